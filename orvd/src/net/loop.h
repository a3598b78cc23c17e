// An event loop: one thread with an Asio context of its own, the connections that are pinned to it,
// and work that others post. Between two messages of a brisk client it looks for the next one a
// little longer before it sleeps.
//
// Threads: everything here belongs to the loop's thread, except where a function says otherwise.
// Sockets of the context are used on that thread only: the context does without locks for them.
#pragma once

#include <asio/executor_work_guard.hpp>
#include <asio/io_context.hpp>
#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <thread>
#include <unordered_set>
#include <vector>

#include "logs.h"
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

  // For the sockets of the clients.
  asio::io_context& context() noexcept { return context_; }

  // Keeps a client.
  void add(std::shared_ptr<Client> client);
  void remove(const std::shared_ptr<Client>& client);

  // Number of clients that are here or on their way, which each client keeps. Any thread.
  std::size_t load() const noexcept { return load_.load(std::memory_order_relaxed); }
  void change_load(int by) noexcept {
    load_.fetch_add(static_cast<std::size_t>(by), std::memory_order_relaxed);
  }

  // Ends every connection with a notice of disconnection. Any thread.
  void disconnect_all();

 private:
  void run();
  void turn();
  void sleep();
  bool handle_what_is_ready();
  void sweep_if_due(Clock::time_point now);

  Logs& logs_;
  std::shared_ptr<const Settings> settings_;
  AccessLane access_;
  std::atomic<std::size_t> load_{0};
  // After what clients use when they go, before what holds clients: its handlers do, too.
  asio::io_context context_;
  asio::executor_work_guard<asio::io_context::executor_type> lasting_;
  std::unordered_set<std::shared_ptr<Client>> clients_;
  Clock::time_point next_sweep_ = Clock::now();
  std::thread thread_;
};

}  // namespace orv::server
