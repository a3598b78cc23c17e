#include "server.h"

#include <algorithm>
#include <asio/executor_work_guard.hpp>
#include <asio/post.hpp>
#include <csignal>
#include <cstdlib>
#include <new>
#include <thread>
#include <utility>

#include "audit/log.h"
#include "cfg/entry_limits.h"
#include "slapi/globals.h"
#include "standard_error.h"
#include "stop_watchdog.h"

namespace orv::server {
namespace {

constexpr std::size_t kChangeThreads = 1;  // the gate lets no more than one in
constexpr std::size_t kVerifierThreads = 2;
constexpr std::size_t kOwnThreads = 1;
// How often waiting operations are checked for their deadline.
constexpr std::chrono::milliseconds kGateInterval{100};
// How often the files are looked at that nobody says have changed.
constexpr std::chrono::milliseconds kFileInterval{1000};
// How long the control thread rests when there is no memory to go on.
constexpr std::chrono::milliseconds kPause{20};
// How long a stopping server waits for the operation in hand, and for clients to leave.
constexpr std::chrono::seconds kPatience{30};
constexpr std::chrono::seconds kFarewell{3};
// What all the rest of a stop may take before the process is ended.
constexpr std::chrono::seconds kWindUp{30};
// The same for handlers that may wait for the lock of a backend that has failed.
constexpr std::chrono::seconds kLockPatience{1};

// For a process with a thread that nobody can wait for.
[[noreturn]] void end_at_once(Logs& logs) noexcept {
  logs.finish();
  drain_standard_error(StandardError::kPatience);
  std::_Exit(1);
}

// Asio gives a signal back to the system, for which it is the end of the process, with the last set
// that holds it. This one stands until the process ends, so that being told to stop once more never
// cuts the stop short.
void hold_stop_signals() {
  static auto& nobody_runs = *new asio::io_context;
  [[maybe_unused]] static const auto& held = *new asio::signal_set(nobody_runs, SIGTERM, SIGINT);
}

// What bounds a message bounds what becomes of an entry by many.
void bound_entries(const Settings& settings) noexcept {
  cfg::set_entry_limits({static_cast<std::size_t>(settings.max_attributes),
                         static_cast<std::size_t>(settings.max_values)});
}

}  // namespace

Server::Server(ServerParts parts)
    : parts_(std::move(parts)),
      signals_(control_),
      gate_timer_(control_),
      file_timer_(control_),
      loop_timer_(control_),
      backend_(parts_.backend,
               [this](std::string_view why) {
                 parts_.logs.error("the backend threw: " + std::string(why) +
                                   "; nothing is admitted any more");
                 stop();
               }),
      services_{parts_.schema,
                backend_,
                parts_.authenticator,
                parts_.publications,
                parts_.logs,
                parts_.supported_controls,
                changes_,
                verifiers_,
                {}},
      settings_(std::make_shared<const Settings>(parts_.settings)),
      changes_(kChangeThreads),
      verifiers_(kVerifierThreads),
      own_work_(kOwnThreads),
      listeners_(control_, services_, counter_, local_counter_, loops_) {
  services_.note_failure = parts_.note_failure;
  services_.audit = parts_.audit;
  services_.guards = parts_.guards;
  services_.take_over = parts_.take_over;
  services_.changes_made = parts_.changes_made;
  services_.renew_settings = [this] { renew_settings(); };
  services_.read_settings = parts_.read_settings;
  services_.read_policy = parts_.read_policy;
  services_.mechanisms = parts_.mechanisms;
  services_.local_verifiers = &own_work_;
  services_.tls = &tls_;
  bound_entries(*settings_);
  if (parts_.wall_time) services_.wall_time = parts_.wall_time;
  for (unsigned i = 0; i < std::max(1U, parts_.loops); ++i)
    loops_.push_back(std::make_unique<Loop>(parts_.logs, settings_));
}

Server::~Server() {
  stop_workers();
  for (const auto& loop : loops_) loop->stop();
  services_.binds.clear();  // a loop may have added some until it stopped
}

void Server::stop_workers() {
  for (asio::thread_pool* const pool : {&changes_, &verifiers_, &own_work_}) {
    pool->stop();
    pool->join();
  }
  services_.binds.clear();
  if (parts_.audit) parts_.audit->settle();
}

bool Server::take(std::vector<ListeningSocket> sockets, std::string& error) {
  for (ListeningSocket& socket : sockets) {
    (socket.kind == ListenerKind::local ? local_taken_ : ports_taken_) = true;
    if (!listeners_.adopt(std::move(socket), error)) return false;
  }
  return true;
}

bool Server::listen(const std::vector<std::string>& addresses, std::uint16_t port,
                    std::string& error, const MoreListeners& more) {
  if (!load_certificate(settings_->tls, error)) return false;
  if (listeners_.has(ListenerKind::secure) && !tls_.current()) {
    error = "there is a socket for TLS, but orv-slapdTlsCertificateFile names no certificate";
    return false;
  }
  if (!ports_taken_ && !listeners_.open(addresses, port, false, error)) return false;
  const bool secure = !ports_taken_ && more.secure_port && tls_.current();
  if (secure && !listeners_.open(addresses, *more.secure_port, true, error)) return false;
  // Another server of the same instance may be there, or the path be too long: no reason to serve
  // nobody.
  std::string failure;
  if (!more.local_socket.empty() && !local_taken_ &&
      !listeners_.open_local(more.local_socket, failure))
    parts_.logs.error(failure);
  return true;
}

// Without one in the settings, TLS is not offered to new connections any more.
bool Server::load_certificate(const TlsSettings& settings, std::string& error) {
  std::shared_ptr<const TlsContext> context;
  if (!settings.certificate_file.empty()) {
    context = TlsContext::load(settings, error);
    if (!context) return false;
    const std::shared_ptr<const TlsContext> before = tls_.current();
    if (!before || before->description() != context->description())
      parts_.logs.info("certificate for TLS: " + context->description());
  }
  tls_.put(std::move(context));
  return true;
}

// The files may hold something else than before under the same names.
void Server::renew_certificate(Settings& wanted) {
  std::string error;
  // Whoever connected to a port for TLS must find it.
  if (wanted.tls.certificate_file.empty() && secure_port() != 0)
    error = "orv-slapdTlsCertificateFile is gone, which the port for TLS needs";
  else if (load_certificate(wanted.tls, error))
    return;
  else
    error += "; mend this before the next start, which it would prevent";
  parts_.logs.error("TLS stays as it was: " + error);
  wanted.tls = settings_->tls;
}

void Server::handle_signals() {
  for (const int number : {SIGTERM, SIGINT, SIGHUP}) signals_.add(number);
  hold_stop_signals();
  takes_signals_ = true;
  await_signal();
}

void Server::await_signal() {
  signals_.async_wait(signal_watch_.keep([this](const asio::error_code& error, int number) {
    if (error) return;
    if (number != SIGHUP) return stop();
    await_signal();
    if (parts_.manager) parts_.manager->reloading();
    renew_settings();  // whatever becomes of it, the manager hears of its end
    tell_ready();
  }));
}

// The administrator of a port at which nobody answers should not have to guess.
void Server::tell_what_is_missing() {
  const std::lock_guard lock(reloading_);
  if (settings_->secure_port > 0 && !tls_.current())
    parts_.logs.warning(
        "nobody listens at orv-slapdSecurePort, because TLS needs a certificate: name one in "
        "orv-slapdTlsCertificateFile and start again, or set the port to 0");
}

int Server::serve() {
  tell_what_is_missing();
  const auto work = asio::make_work_guard(control_);
  watch_gate();
  watch_files();
  for (const auto& loop : loops_) loop->start();
  {
    const std::lock_guard lock(reloading_);
    listeners_.start(settings_);
  }
  tell_ready();
  turning_.store(loops_.size());
  watch_loops();
  control();
  wind_up();
  return backend_.failed() ? 1 : 0;
}

// What fails on the control thread (a connection that could not be taken in, a reload) fails alone.
void Server::control() {
  for (;;) try {
      control_.run();
      return;
    } catch (const std::exception& error) {
      // Apart: what is missing may be the memory to put them together.
      parts_.logs.error("not done:");
      parts_.logs.error(error.what());
      while (!control_.stopped() && !go_on()) std::this_thread::sleep_for(kPause);
    }
}

// A failure ends what it happens in, also what is to be waited for again and again.
bool Server::go_on() noexcept {
  try {
    if (takes_signals_ && !signal_watch_.under_way()) await_signal();
    if (!gate_watch_.under_way()) watch_gate();
    if (!file_watch_.under_way()) watch_files();
    if (!loop_watch_.under_way()) watch_loops();
    listeners_.go_on();
    return true;
  } catch (...) {
    return false;  // there will be memory again
  }
}

void Server::stop() {
  control_.stop();
}

void Server::watch_gate() {
  gate_timer_.expires_after(kGateInterval);
  gate_timer_.async_wait(gate_watch_.keep([this](const asio::error_code& error) {
    if (error) return;
    watch_gate();
    const Clock::time_point now = Clock::now();
    backend_.gate().expire(now);
    services_.cut_offs.tick(now);
    remind_of_expiry();
  }));
}

void Server::remind_of_expiry() {
  using Due = ExpiryReminder::Due;
  const std::shared_ptr<const TlsContext> tls = tls_.current();
  if (!tls) return;
  const std::time_t now = services_.wall_time();
  const Due own = certificate_end_.due(tls->end_point(), tls->good_until(), now);
  if (own == Due::has_ended)
    parts_.logs.warning("the certificate for TLS has expired: " + tls->description());
  if (own == Due::ends_soon)
    parts_.logs.warning("the certificate for TLS expires within 30 days: " + tls->description());
  if (revocations_end_.due(tls->trust(), tls->revocations_good_until(), now) == Due::has_ended)
    parts_.logs.warning(
        "a list in orv-slapdTlsCrlFile is too old: nobody with a certificate of its authority is "
        "let in");
}

// Reading may take long: workers do it, one at a time.
void Server::watch_files() {
  if (!parts_.look_after) return;
  file_timer_.expires_after(kFileInterval);
  file_timer_.async_wait(file_watch_.keep([this](const asio::error_code& error) {
    if (error) return;
    watch_files();
    if (looking_.exchange(true)) return;
    try {
      asio::post(own_work_, [this] {
        parts_.look_after();
        looking_.store(false);
      });
    } catch (...) {
      looking_.store(false);
      throw;
    }
  }));
}

// Tells the manager that the server lives, for as long as every loop turns.
void Server::watch_loops() {
  if (!parts_.manager || parts_.manager->watchdog_interval().count() <= 0) return;
  loop_timer_.expires_after(parts_.manager->watchdog_interval());
  loop_timer_.async_wait(loop_watch_.keep([this](const asio::error_code& error) {
    if (error) return;
    watch_loops();
    if (turning_.load() < loops_.size()) return;
    parts_.manager->alive();
    turning_.store(0);
    for (const auto& loop : loops_) try {
        loop->post([this] { ++turning_; });
      } catch (const std::bad_alloc&) {
        ++turning_;  // it could not be asked, and may well turn
      }
  }));
}

void Server::tell_ready() noexcept try {
  if (!parts_.manager) return;
  std::string status = "Serving";
  for (const std::string& url : urls()) status += " " + url;
  parts_.manager->ready(status);
} catch (...) {
  parts_.manager->ready("");
}

void Server::wind_up() {
  const StopWatchdog watchdog(kPatience + kWindUp);
  if (parts_.manager) parts_.manager->stopping();
  parts_.logs.info("stopping");
  listeners_.close();
  // What was cancelled is told so.
  control_.restart();
  control_.poll();
  services_.stopping.store(true, std::memory_order_relaxed);
  const bool closed = backend_.close(kPatience);
  if (!closed && !backend_.failed()) {
    parts_.logs.error("an operation does not end; its thread cannot be waited for");
    end_at_once(parts_.logs);
  }
  if (backend_.failed() && !backend_.calls_ended(kLockPatience)) {
    parts_.logs.error("the backend holds a thread; it cannot be waited for");
    end_at_once(parts_.logs);
  }
  // The answer to the operation in hand goes to its loop before the farewell does.
  changes_.join();
  if (parts_.audit) parts_.audit->settle();
  for (const auto& loop : loops_) loop->disconnect_all();
  const Clock::time_point end = Clock::now() + kFarewell;
  while (!backend_.failed() && connections() > 0 && Clock::now() < end)
    std::this_thread::sleep_for(std::chrono::milliseconds(5));
  stop_workers();
  for (const auto& loop : loops_) loop->stop();
  parts_.logs.info("stopped");
}

void Server::reload() {
  const std::lock_guard lock(reloading_);
  Settings wanted;
  if (!parts_.reload || !parts_.reload(wanted)) return;
  for (const std::string_view name : restart_needed(*settings_, wanted))
    parts_.logs.warning(std::string(name) + " takes effect at the next start");
  // What listens is not changed; the settings say what runs.
  wanted.port = settings_->port;
  wanted.addresses = settings_->addresses;
  wanted.secure_port = settings_->secure_port;
  wanted.local_socket = settings_->local_socket;
  renew_certificate(wanted);
  settings_ = std::make_shared<const Settings>(std::move(wanted));
  bound_entries(*settings_);
  for (const auto& loop : loops_) loop->renew(settings_);
  asio::post(control_, [this, settings = settings_] { listeners_.renew(settings); });
}

// After a change over LDAP, which stays whatever becomes of this, and at a signal.
void Server::renew_settings() noexcept {
  try {
    reload();
  } catch (const std::exception& error) {
    parts_.logs.error("settings not taken over:");
    parts_.logs.error(error.what());
  }
}

}  // namespace orv::server
