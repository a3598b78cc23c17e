#include "net/loop.h"

#include <asio/post.hpp>
#include <exception>
#include <utility>

#include "cfg/result_codes.h"
#include "net/client.h"

namespace orv::server {
namespace {

// How often deadlines of connections are looked at; their settings are in seconds.
constexpr std::chrono::milliseconds kSweepInterval{200};
// After some work the next request is often only microseconds away: looking for it a little longer
// saves the system the wake-up, which costs as much as a small search.
constexpr std::chrono::microseconds kLookLonger{40};
// Handlers that run before deadlines are looked at again.
constexpr int kHandlersAtOnce = 64;

}  // namespace

Loop::Loop(Logs& logs, std::shared_ptr<const Settings> settings)
    : logs_(logs),
      settings_(std::move(settings)),
      access_(logs),
      // Posting is open to all threads, sockets are not.
      context_(ASIO_CONCURRENCY_HINT_UNSAFE_IO),
      lasting_(asio::make_work_guard(context_)) {}

Loop::~Loop() {
  stop();
}

void Loop::start() {
  thread_ = std::thread([this] { run(); });
}

void Loop::stop() noexcept {
  if (!thread_.joinable()) return;
  context_.stop();
  thread_.join();
  access_.flush();
}

// ---- turning

void Loop::run() {
  while (!context_.stopped()) {
    try {
      turn();
    } catch (const std::exception& error) {
      // Apart: what is missing may be the memory to put them together.
      logs_.error("event loop:");
      logs_.error(error.what());
    }
  }
}

// Sleeps until there is something to do, and does it until there has been nothing for a while.
void Loop::turn() {
  sleep();
  // Counted from the end of the work: the next request comes after its answer.
  Clock::time_point last_work = Clock::now();
  for (Clock::time_point now = last_work; now - last_work < kLookLonger;) {
    const bool worked = handle_what_is_ready();
    now = Clock::now();
    sweep_if_due(now);
    if (worked)
      last_work = now;
    else
      std::this_thread::yield();  // others that want the processor get it in between
  }
}

void Loop::sleep() {
  if (!clients_.empty()) {
    context_.run_one_until(next_sweep_);
    return;
  }
  access_.flush();  // nobody will sweep before somebody connects
  context_.run_one();
}

// Whether there was something.
bool Loop::handle_what_is_ready() {
  int left = kHandlersAtOnce;
  while (left > 0 && context_.poll_one() != 0) --left;
  return left < kHandlersAtOnce;
}

void Loop::post(std::function<void()> work) {
  asio::post(context_, std::move(work));
}

void Loop::renew(std::shared_ptr<const Settings> settings) {
  post([this, settings = std::move(settings)]() mutable { settings_ = std::move(settings); });
}

// ---- clients

void Loop::add(std::shared_ptr<Client> client) {
  clients_.insert(std::move(client));
}

void Loop::remove(const std::shared_ptr<Client>& client) {
  clients_.erase(client);
}

void Loop::disconnect_all() {
  post([this] {
    const std::vector<std::shared_ptr<Client>> all(clients_.begin(), clients_.end());
    for (const auto& client : all) client->disconnect(result::unavailable, "server is stopping");
  });
}

void Loop::sweep_if_due(Clock::time_point now) {
  if (now < next_sweep_) return;
  next_sweep_ = now + kSweepInterval;
  const std::vector<std::shared_ptr<Client>> all(clients_.begin(), clients_.end());
  for (const auto& client : all) client->sweep(now);
  access_.flush();
}

}  // namespace orv::server
