// A session by itself, without a socket, a loop or a server around it.
#pragma once

#include <gtest/gtest.h>

#include <asio/thread_pool.hpp>
#include <atomic>
#include <deque>
#include <functional>
#include <memory>
#include <mutex>
#include <new>
#include <string>
#include <string_view>
#include <thread>

#include "core_server_fixture.h"
#include "ops/session.h"

namespace orv::server::test {

// A session without a socket; what it posts is run by the test, and posting can be made to fail.
class BareSession final : public Session {
 public:
  BareSession(Services& services, AccessLane& lane, const Settings& settings)
      : Session(services, lane, 1), settings_(settings) {
    TransportFacts facts;
    facts.loopback = true;
    set_transport(facts);
  }

  using Session::client_left;
  using Session::handle;
  using Session::idle;
  using Session::output_is;
  using Session::set_transport;
  using Session::tick;

  // Runs what was posted until `done`, for ten seconds at most.
  bool run_until(const std::function<bool()>& done) {
    const auto end = Clock::now() + std::chrono::seconds(10);
    while (!done() && Clock::now() < end) {
      std::unique_lock lock(mutex_);
      if (posted_.empty()) {
        lock.unlock();
        try {
          tick();
        } catch (const std::bad_alloc&) {
          // As in an event loop: the next one tries again.
        }
        std::this_thread::yield();
        continue;
      }
      const auto work = std::move(posted_.front());
      posted_.pop_front();
      lock.unlock();
      work();
    }
    return done();
  }
  // Runs what was posted for afterwards: it holds the session.
  void run_posted() {
    for (;;) {
      std::unique_lock lock(mutex_);
      if (posted_.empty()) return;
      const auto work = std::move(posted_.front());
      posted_.pop_front();
      lock.unlock();
      work();
    }
  }
  // How much was posted and waits for that.
  std::size_t posts() {
    const std::lock_guard lock(mutex_);
    return posted_.size();
  }
  void fail_to_post(int times) { failing_ = times; }
  int failed_posts() const { return failed_; }

  bool lost_interest(PendingOperation&) noexcept override { return false; }
  std::string sent;
  bool ended = false;
  int resumed = 0;  // how often what it had not handled yet was asked for

 protected:
  const Settings& settings() const noexcept override { return settings_; }
  void post(std::function<void()> work) override {
    const std::lock_guard lock(mutex_);
    if (failing_ > 0) {
      --failing_;
      ++failed_;
      throw std::bad_alloc();
    }
    posted_.push_back(std::move(work));
  }
  void transmit(std::string& bytes) override {
    sent += bytes;
    bytes.clear();
    output_is(sent.size());
  }
  void lend_storage(std::string&) noexcept override {}
  void flush() override {}
  void disconnect(int, std::string_view) override { ended = true; }
  void drop() override { ended = true; }
  void resume() override { ++resumed; }
  void settled() override {}

 private:
  const Settings& settings_;
  std::mutex mutex_;
  std::deque<std::function<void()>> posted_;
  std::atomic<int> failing_{0};
  std::atomic<int> failed_{0};
};

class BareSessionTest : public testing::Test {
 protected:
  static void SetUpTestSuite() {
    ASSERT_EQ(cfg::register_attribute_types(builtin_schema().attribute_table()), 0);
  }
  explicit BareSessionTest(std::size_t ceiling = OutputMeter::kDefaultCeiling)
      : services{builtin_schema(),    host, authenticator, {}, logs, {}, changes, verifiers, {}, {},
                 OutputMeter(ceiling)} {
    settings.error_log_level = "off";
    logs.open(settings);
    session = std::make_shared<BareSession>(services, lane, settings);
  }
  ~BareSessionTest() override {
    changes.join();
    verifiers.join();
  }
  void bind_as_root() {
    session->handle(bind(1, kRoot, kSecret));
    ASSERT_TRUE(session->run_until([this] { return session->idle(); }));
    session->sent.clear();
    session->output_is(0);
  }
  static Reply result_in(std::string_view bytes) {
    // SEQUENCE, message id, operation: all short here.
    Reply reply;
    reply.id = bytes.at(4);
    reply.tag = static_cast<unsigned char>(bytes.at(5));
    reply.code = bytes.at(9);
    return reply;
  }

  FakeBackend backend;
  BackendHost host{backend.record(), [](std::string_view) {}};
  ScriptedAuthenticator authenticator;
  Settings settings;
  Logs logs;
  AccessLane lane{logs};
  asio::thread_pool changes{1};
  asio::thread_pool verifiers{1};
  Services services;
  std::shared_ptr<BareSession> session;
};

}  // namespace orv::server::test
