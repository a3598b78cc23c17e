// The listening sockets: who connects is counted, and handed to the event loop with the fewest.
//
// Threads: everything on the thread that runs the context it was given.
#pragma once

#include <asio/basic_socket_acceptor.hpp>
#include <asio/generic/stream_protocol.hpp>
#include <asio/io_context.hpp>
#include <asio/steady_timer.hpp>
#include <memory>
#include <string>
#include <vector>

#include "descriptor.h"
#include "net/client.h"
#include "net/limits.h"
#include "net/listening_socket.h"
#include "net/local_socket.h"
#include "net/loop.h"
#include "net/standing.h"
#include "ops/services.h"

namespace orv::server {

class Listeners {
 public:
  // `counter` is for connections over TCP, `local_counter` for those over Unix sockets.
  Listeners(asio::io_context& context, Services& services, ConnectionCounter& counter,
            ConnectionCounter& local_counter, std::vector<std::unique_ptr<Loop>>& loops);

  // Opens a socket on each address (literal IPv4 or IPv6; none: every address of the host), for
  // connections that begin in clear or with TLS. With port 0 the first one's port, which the kernel
  // chose, serves for all. False with the cause.
  bool open(const std::vector<std::string>& addresses, std::uint16_t port, bool secure,
            std::string& error);
  // Opens a Unix socket, for its owner and root.
  bool open_local(const std::string& path, std::string& error);
  // Accepts from a socket that is open already. One of the file system stays there at the end: it
  // is whoever's opened it. False with the cause.
  bool adopt(ListeningSocket socket, std::string& error);
  // Whether there is one of that kind.
  bool has(ListenerKind kind) const noexcept;

  // Begins to accept. `settings` is asked for the limits in force.
  void start(std::shared_ptr<const Settings> settings);
  void renew(std::shared_ptr<const Settings> settings) { settings_ = std::move(settings); }

  // Begins again where a failure has ended it. Throws std::bad_alloc.
  void go_on();

  void close() noexcept;

  // "ldap://ADDRESS:PORT" of the first listener for connections in clear; of the first one of all
  // where there is none.
  std::string url() const;
  // Those of all listeners.
  std::vector<std::string> urls() const;
  // Of the first listener of that kind; 0 when there is none.
  std::uint16_t port(bool secure = false) const;

 private:
  using Acceptor = asio::basic_socket_acceptor<asio::generic::stream_protocol>;
  using Socket = asio::generic::stream_protocol::socket;
  using Kind = ListenerKind;
  struct Listener {
    Listener(asio::io_context& context, Kind listens_for)
        : kind(listens_for), acceptor(context), pause(context) {}
    const Kind kind;
    Acceptor acceptor;
    asio::steady_timer pause;
    Standing waiting;  // for a client, or for the end of the pause
  };

  void accept(Listener& listener);
  void accepted(const Listener& listener, Socket socket);
  void cannot_accept(Listener& listener, const asio::error_code& error);
  bool has_reserve() noexcept;
  void pause(Listener& listener);
  void turn_away(Listener& listener) noexcept;
  std::string admit(Arrival& arrival, const std::string& counted);
  std::string url(const Listener& listener) const;
  Loop& next_loop() noexcept;

  asio::io_context& context_;
  Services& services_;
  ConnectionCounter& counter_;
  ConnectionCounter& local_counter_;
  std::vector<std::unique_ptr<Loop>>& loops_;
  std::vector<std::unique_ptr<Listener>> listeners_;
  LocalSocket local_;
  // Given up for the moment in which a client is told that there is no other descriptor left.
  Descriptor reserve_;
  std::shared_ptr<const Settings> settings_;
  std::size_t last_loop_ = 0;
  std::uint64_t next_number_ = 1;
};

}  // namespace orv::server
