#include "net/loop.h"

#include <asio/post.hpp>
#include <exception>
#include <string>
#include <utility>
#include <vector>

#include "cfg/result_codes.h"
#include "net/client.h"

namespace orv::server {
namespace {

// How often deadlines of connections are looked at; their settings are in seconds.
constexpr std::chrono::milliseconds kSweepInterval{200};
constexpr std::chrono::microseconds kLookLonger{40};

}  // namespace

Loop::Loop(Logs& logs, std::shared_ptr<const Settings> settings)
    : work_(context_.get_executor()),
      timer_(context_),
      logs_(logs),
      settings_(std::move(settings)),
      access_(logs) {}

Loop::~Loop() {
  stop();
}

void Loop::start() {
  schedule_sweep();
  thread_ = std::thread([this] { run(); });
}

// After some work the next request is often only microseconds away: looking for it a little longer
// saves the system the wake-up, which costs as much as a small search. Others that want the
// processor get it in between.
void Loop::run() {
  Clock::time_point last_work{};
  while (!context_.stopped()) {
    try {
      if (context_.poll() > 0) {
        last_work = Clock::now();
      } else if (Clock::now() - last_work < kLookLonger) {
        std::this_thread::yield();
      } else {
        context_.run_one();
        last_work = Clock::now();
      }
    } catch (const std::exception& error) {
      logs_.error(std::string("event loop: ") + error.what());
    }
  }
}

void Loop::stop() noexcept {
  if (!thread_.joinable()) return;
  context_.stop();
  thread_.join();
  access_.flush();
}

void Loop::renew(std::shared_ptr<const Settings> settings) {
  asio::post(context_,
             [this, settings = std::move(settings)]() mutable { settings_ = std::move(settings); });
}

void Loop::add(std::shared_ptr<Client> client) {
  clients_.insert(std::move(client));
}

void Loop::remove(const std::shared_ptr<Client>& client) {
  clients_.erase(client);
}

void Loop::disconnect_all() {
  asio::post(context_, [this] {
    const std::vector<std::shared_ptr<Client>> all(clients_.begin(), clients_.end());
    for (const auto& client : all) client->disconnect(result::unavailable, "server is stopping");
  });
}

void Loop::schedule_sweep() {
  timer_.expires_after(kSweepInterval);
  timer_.async_wait([this](const asio::error_code& error) {
    if (error) return;
    sweep();
    schedule_sweep();
  });
}

void Loop::sweep() {
  const Clock::time_point now = Clock::now();
  const std::vector<std::shared_ptr<Client>> all(clients_.begin(), clients_.end());
  for (const auto& client : all) client->sweep(now);
  access_.flush();
}

}  // namespace orv::server
