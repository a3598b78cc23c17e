// The listening sockets: who connects is counted, and handed to the event loop with the fewest.
//
// Threads: everything on the thread that runs the context it was given.
#pragma once

#include <asio/io_context.hpp>
#include <asio/ip/tcp.hpp>
#include <asio/steady_timer.hpp>
#include <memory>
#include <string>
#include <vector>

#include "net/limits.h"
#include "net/loop.h"
#include "ops/services.h"

namespace orv::server {

class Listeners {
 public:
  Listeners(asio::io_context& context, Services& services, ConnectionCounter& counter,
            std::vector<std::unique_ptr<Loop>>& loops);

  // Opens a socket on each address (literal IPv4 or IPv6; none: every address of the host). With
  // port 0 the first one's port, which the kernel chose, serves for all. False with the cause.
  bool open(const std::vector<std::string>& addresses, std::uint16_t port, std::string& error);

  // Begins to accept. `settings` is asked for the limits in force.
  void start(std::shared_ptr<const Settings> settings);
  void renew(std::shared_ptr<const Settings> settings) { settings_ = std::move(settings); }

  void close() noexcept;

  // "ldap://ADDRESS:PORT" of the first listener.
  std::string url() const;
  std::uint16_t port() const;

 private:
  struct Listener {
    explicit Listener(asio::io_context& context) : acceptor(context), pause(context) {}
    asio::ip::tcp::acceptor acceptor;
    asio::steady_timer pause;
  };

  bool open_one(const std::string& address, std::uint16_t port, bool required, std::string& error);
  void accept(Listener& listener);
  void accepted(asio::ip::tcp::socket socket);
  Loop& next_loop() noexcept;

  asio::io_context& context_;
  Services& services_;
  ConnectionCounter& counter_;
  std::vector<std::unique_ptr<Loop>>& loops_;
  std::vector<std::unique_ptr<Listener>> listeners_;
  std::shared_ptr<const Settings> settings_;
  std::size_t last_loop_ = 0;
  std::uint64_t next_number_ = 1;
};

}  // namespace orv::server
