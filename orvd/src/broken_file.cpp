#include "broken_file.h"

#include <utility>

#include "settings.h"

namespace orv::server {

BrokenFileReporter::BrokenFileReporter(std::string config_file, std::string key_stash_file,
                                       Logs& logs)
    : config_file_(std::move(config_file)),
      key_stash_file_(std::move(key_stash_file)),
      logs_(logs),
      thread_([this] { run(); }) {}

BrokenFileReporter::~BrokenFileReporter() {
  {
    const std::lock_guard lock(mutex_);
    ending_ = true;
  }
  changed_.notify_all();
  thread_.join();
}

void BrokenFileReporter::note_failure() noexcept {
  {
    const std::lock_guard lock(mutex_);
    if (std::exchange(noted_, true)) return;
  }
  changed_.notify_one();
}

void BrokenFileReporter::run() {
  std::unique_lock lock(mutex_);
  for (;;) {
    changed_.wait(lock, [this] { return noted_ || ending_; });
    if (ending_) return;
    noted_ = false;
    lock.unlock();
    examine();
    lock.lock();
  }
}

// The state is taken first: a change during the reading shows as a difference later. A file that
// can be read by now has nothing to tell, and is looked at again after the next failure.
void BrokenFileReporter::examine() {
  try {
    const ConfigurationState now(config_file_, key_stash_file_);
    if (now == reported_) return;
    std::string cause;
    if (can_open(config_file_, key_stash_file_, cause)) return;
    reported_ = now;
    logs_.error("operations fail until the configuration can be read again: " + cause);
  } catch (...) {
    // Without memory there is nothing to tell it with.
  }
}

}  // namespace orv::server
