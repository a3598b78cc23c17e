// An event loop: one thread, and the connections that are pinned to it.
//
// Threads: everything here belongs to the loop's thread, except where a function says otherwise.
#pragma once

#include <asio/io_context.hpp>
#include <asio/steady_timer.hpp>
#include <memory>
#include <thread>
#include <unordered_set>

#include "logs.h"
#include "ops/gate.h"
#include "settings.h"

namespace orv::server {

class Client;

class Loop {
 public:
  Loop(Logs& logs, std::shared_ptr<const Settings> settings);
  ~Loop();
  Loop(const Loop&) = delete;
  Loop& operator=(const Loop&) = delete;

  // Starts the thread; ends it once all connections are gone, or at once. Called from outside.
  void start();
  void stop() noexcept;  // waits for the thread

  asio::io_context& context() noexcept { return context_; }

  // Takes new settings over. Any thread.
  void renew(std::shared_ptr<const Settings> settings);
  const Settings& settings() const noexcept { return *settings_; }

  AccessLane& access() noexcept { return access_; }

  void add(std::shared_ptr<Client> client);
  void remove(const std::shared_ptr<Client>& client);

  // Ends every connection with a notice of disconnection. Any thread.
  void disconnect_all();

  // Number of connections; only meaningful on the loop's thread.
  std::size_t clients() const noexcept { return clients_.size(); }

 private:
  void run();
  void schedule_sweep();
  void sweep();

  asio::io_context context_{1};
  asio::executor_work_guard<asio::io_context::executor_type> work_;
  asio::steady_timer timer_;
  Logs& logs_;
  std::shared_ptr<const Settings> settings_;
  AccessLane access_;
  std::unordered_set<std::shared_ptr<Client>> clients_;
  std::thread thread_;
};

}  // namespace orv::server
