// The server as a whole: what it is made of, and its life from start to stop.
//
//   Server server(parts)  ->  listen()  ->  serve()   (until stop() or a signal)
//
// Threads: one for the control of the server (whoever calls serve), one for each event loop, a few
// workers. Functions are for the control thread, except stop().
#pragma once

#include <asio/io_context.hpp>
#include <asio/signal_set.hpp>
#include <asio/steady_timer.hpp>
#include <atomic>
#include <ctime>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "net/expiry.h"
#include "net/limits.h"
#include "net/listener.h"
#include "net/loop.h"
#include "net/standing.h"
#include "net/tls.h"
#include "ops/services.h"
#include "process/service_manager.h"
#include "settings.h"

namespace orv::server {

// What a server is given from outside; all of it outlives the server.
struct ServerParts {
  const Schema& schema;
  Backend& backend;  // started, with its handlers
  Authenticator& authenticator;
  Publications publications;
  Logs& logs;
  std::vector<std::string> supported_controls;
  Settings settings;
  unsigned loops = 1;
  // Reads everything anew after SIGHUP; false keeps the settings. May be empty.
  std::function<bool(Settings&)> reload;
  // Told when an operation failed because the backend could not open its session. May be empty.
  std::function<void()> note_failure{};
  AuditLog* audit = nullptr;  // null: changes are not recorded
  // Takes over identities and password policy after a change (Services::take_over). Inside the
  // gate; must not throw. May be empty.
  std::function<bool(const Consequences&, bool made)> take_over{};
  bool guards = true;  // the server's own, in front of the backend
  // Looks after what time may have changed, about once a second and on a worker. Must not throw.
  // May be empty.
  std::function<void()> look_after{};
  unsigned long (*changes_made)() = nullptr;       // Services::changes_made
  const SaslMechanisms* mechanisms = nullptr;      // null: none
  const ServiceManager* manager = nullptr;         // who is told how the server is; null: nobody
  std::function<bool(Settings&)> read_settings{};  // Services::read_settings
  std::function<bool(AdminPolicySettings&)> read_policy{};  // Services::read_policy
  std::function<std::time_t()> wall_time{};  // Services::wall_time; empty: the system's clock
};

// Where a server listens, besides its addresses for connections in clear.
struct MoreListeners {
  std::optional<std::uint16_t> secure_port;  // on the same addresses; 0: the kernel chooses
  std::string local_socket;                  // "": none
};

class Server {
 public:
  explicit Server(ServerParts parts);
  ~Server();
  Server(const Server&) = delete;
  Server& operator=(const Server&) = delete;

  // Takes over sockets that listen already, before listen(). False with the cause.
  bool take(std::vector<ListeningSocket> sockets, std::string& error);

  // Reads the server's certificate, if the settings name one, and opens the listeners, except
  // where some were taken over: no more for TCP, or none for the local socket. False with the
  // cause.
  bool listen(const std::vector<std::string>& addresses, std::uint16_t port, std::string& error,
              const MoreListeners& more = {});
  std::string url() const { return listeners_.url(); }
  std::vector<std::string> urls() const { return listeners_.urls(); }
  std::uint16_t port() const { return listeners_.port(); }
  std::uint16_t secure_port() const { return listeners_.port(true); }

  // Takes SIGTERM and SIGINT as stop, SIGHUP as reload.
  void handle_signals();

  // Accepts and serves until somebody stops the server, and winds up: no new connections, the
  // operation in hand is finished, clients are told, the backend is closed. Returns the exit status
  // of the process: 0, or 1 when the backend failed. When the operation in hand does not end, the
  // process does.
  int serve();

  // Ends serve(). Any thread.
  void stop();

  // Reads the settings again and takes them over. When it returns they are in force for what is
  // posted to the loops from then on. Any thread but those of the loops; one at a time, others
  // wait.
  void reload();

  BackendHost& backend() noexcept { return backend_; }
  std::int64_t connections() const { return counter_.count() + local_counter_.count(); }

 private:
  void renew_settings() noexcept;
  bool load_certificate(const TlsSettings& settings, std::string& error);
  void renew_certificate(Settings& wanted);
  void tell_what_is_missing();
  void remind_of_expiry();
  void control();
  bool go_on() noexcept;
  void watch_gate();
  void watch_files();
  void watch_loops();
  void tell_ready() noexcept;
  void wind_up();
  void stop_workers();
  void await_signal();

  ServerParts parts_;
  asio::io_context control_{1};
  asio::signal_set signals_;
  asio::steady_timer gate_timer_;
  asio::steady_timer file_timer_;
  asio::steady_timer loop_timer_;
  Standing signal_watch_;
  Standing gate_watch_;
  Standing file_watch_;
  Standing loop_watch_;
  bool takes_signals_ = false;
  std::atomic<bool> looking_{false};     // a worker is at it, or will be
  std::atomic<std::size_t> turning_{0};  // loops that have answered since they were asked
  BackendHost backend_;
  TlsHolder tls_;
  // Used by the control thread.
  ExpiryReminder certificate_end_{30 * ExpiryReminder::kDay};
  ExpiryReminder revocations_end_{0};
  Services services_;
  ConnectionCounter counter_;        // over TCP
  ConnectionCounter local_counter_;  // over the Unix socket
  std::mutex reloading_;
  std::shared_ptr<const Settings> settings_;  // guarded by `reloading_` once the server serves
  std::vector<std::unique_ptr<Loop>> loops_;
  // After the loops: work that was never done goes with the pools and holds connections.
  asio::thread_pool changes_;
  asio::thread_pool verifiers_;
  asio::thread_pool own_work_;  // that waits for no stranger's: the files, and local clients
  Listeners listeners_;
  bool ports_taken_ = false;
  bool local_taken_ = false;
};

}  // namespace orv::server
