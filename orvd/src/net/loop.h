// An event loop: one thread, the connections that are pinned to it, and work that others post.
//
// A loop waits for its descriptors itself instead of through Asio's context: level-triggered, so
// that reading on needs no call to the system, and between two messages of a brisk client it looks
// for the next one a little longer before it sleeps.
//
// Threads: everything here belongs to the loop's thread, except where a function says otherwise.
#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <thread>
#include <unordered_set>
#include <vector>

#include "logs.h"
#include "net/descriptor.h"
#include "ops/gate.h"
#include "settings.h"

namespace orv::server {

class Client;

class Loop {
 public:
  // Throws std::system_error when the system has no descriptors left.
  Loop(Logs& logs, std::shared_ptr<const Settings> settings);
  ~Loop();
  Loop(const Loop&) = delete;
  Loop& operator=(const Loop&) = delete;

  // Starts the thread; ends it after what it is doing. Called from outside.
  void start();
  void stop() noexcept;  // waits for the thread

  // Runs `work` on the loop's thread, later. Any thread. Throws std::bad_alloc.
  void post(std::function<void()> work);

  // Takes new settings over. Any thread.
  void renew(std::shared_ptr<const Settings> settings);
  const Settings& settings() const noexcept { return *settings_; }

  AccessLane& access() noexcept { return access_; }

  // The time at which the loop last woke. Where a deadline starts, look at the clock instead: what
  // the loop is doing may have taken long.
  Clock::time_point now() const noexcept { return now_; }

  // Keeps a client.
  void add(std::shared_ptr<Client> client);
  void remove(const std::shared_ptr<Client>& client);

  // Number of clients that are here or on their way, which each client keeps. Any thread.
  std::size_t load() const noexcept { return load_.load(std::memory_order_relaxed); }
  void change_load(int by) noexcept {
    load_.fetch_add(static_cast<std::size_t>(by), std::memory_order_relaxed);
  }

  // Calls the client's `ready` whenever one of these epoll events holds, errors always included.
  // False when the system refuses.
  bool watch(Client& client, int descriptor, std::uint32_t events) noexcept;
  bool change(Client& client, int descriptor, std::uint32_t events) noexcept;
  void unwatch(int descriptor) noexcept;

  // Ends every connection with a notice of disconnection. Any thread.
  void disconnect_all();

 private:
  void run();
  bool turn();
  int wait_time();
  bool fall_asleep() noexcept;
  bool run_posted();
  void run_one(const std::function<void()>& work);
  void sweep_if_due();
  void wake() noexcept;

  Descriptor epoll_;
  Descriptor wake_up_;
  Logs& logs_;
  std::shared_ptr<const Settings> settings_;
  AccessLane access_;
  std::atomic<std::size_t> load_{0};  // before whatever holds clients
  std::unordered_set<std::shared_ptr<Client>> clients_;

  Clock::time_point now_ = Clock::now();
  Clock::time_point next_sweep_ = now_;
  Clock::time_point last_work_{};

  std::mutex mutex_;
  std::vector<std::function<void()>> posted_;  // under the mutex
  std::vector<std::function<void()>> running_;
  std::atomic<bool> work_posted_{false};  // written under the mutex
  std::atomic<bool> asleep_{false};       // set under the mutex
  std::atomic<bool> stopping_{false};
  std::thread thread_;
};

}  // namespace orv::server
