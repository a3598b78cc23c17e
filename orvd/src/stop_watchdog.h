// Ends the process when a stop does not come to its end.
#pragma once

#include <chrono>
#include <condition_variable>
#include <cstdlib>
#include <mutex>
#include <thread>

namespace orv::server {

// Unless the object is destroyed within `patience`, the process ends with status 1: at once,
// without destructors and without waiting for any log, since whatever hangs may be one of those.
class StopWatchdog {
 public:
  explicit StopWatchdog(std::chrono::milliseconds patience)
      : thread_([this, patience] { watch(patience); }) {}
  ~StopWatchdog() {
    {
      const std::lock_guard lock(mutex_);
      stopped_ = true;
    }
    changed_.notify_all();
    thread_.join();
  }
  StopWatchdog(const StopWatchdog&) = delete;
  StopWatchdog& operator=(const StopWatchdog&) = delete;

 private:
  void watch(std::chrono::milliseconds patience) {
    std::unique_lock lock(mutex_);
    if (!changed_.wait_for(lock, patience, [this] { return stopped_; })) std::_Exit(1);
  }

  std::mutex mutex_;
  std::condition_variable changed_;
  bool stopped_ = false;
  std::thread thread_;
};

}  // namespace orv::server
