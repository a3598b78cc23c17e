// Work that queues: each address has its turn.
#include "ops/fair_queue.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <asio/post.hpp>
#include <memory>
#include <string>
#include <vector>

#include "core_fake_backend.h"
#include "core_server_fixture.h"

namespace orv::server {
namespace {

using namespace std::chrono_literals;
using test::Event;
using test::WireClient;

// Both threads of a pool are busy: one until the rest may go on, the other until that has run,
// which it therefore does one after the other.
class BusyQueue : public testing::Test {
 protected:
  BusyQueue() {
    for (Thread& thread : threads_)
      queue.post("whoever", [&thread] {
        thread.entered.happen();
        thread.go_on.wait();
      });
    for (Thread& thread : threads_) thread.entered.wait();
  }
  void post(const std::string& whose) {
    queue.post(whose, [this, whose] {
      order_.push_back(whose);
      if (order_.size() == expected_) threads_[1].go_on.happen();
    });
  }
  // Whose turns they were, once there have been `expected` of them.
  std::vector<std::string> order(std::size_t expected) {
    expected_ = expected;
    if (expected == 0) threads_[1].go_on.happen();
    threads_[0].go_on.happen();
    pool.join();
    return order_;
  }

  asio::thread_pool pool{FairQueue::kAtOnce};
  FairQueue queue{pool};

 private:
  struct Thread {
    Event entered;
    Event go_on;
  };
  Thread threads_[FairQueue::kAtOnce];
  static_assert(FairQueue::kAtOnce == 2);
  std::size_t expected_ = 0;
  std::vector<std::string> order_;
};

TEST_F(BusyQueue, WorkOfOneDoesNotWaitForAllThatAnotherQueued) {
  for (int i = 0; i < 1000; ++i) post("flood");
  post("administrator");
  const std::vector<std::string> all = order(1001);
  ASSERT_EQ(all.size(), 1001U);
  EXPECT_LE(std::find(all.begin(), all.end(), "administrator") - all.begin(), 2);
}

TEST_F(BusyQueue, EverybodyHasATurnInEachRound) {
  for (const char* const whose : {"a", "b", "c"})
    for (int i = 0; i < 100; ++i) post(whose);
  const std::vector<std::string> all = order(300);
  ASSERT_EQ(all.size(), 300U);
  for (const char* const whose : {"a", "b", "c"})
    EXPECT_NEAR(static_cast<double>(std::count(all.begin(), all.begin() + 150, whose)), 50, 1);
}

TEST_F(BusyQueue, OtherWorkOfThePoolComesInBetween) {
  for (int i = 0; i < 1000; ++i) post("flood");
  std::size_t before = 0;
  asio::post(pool, [&] { post("counted"), before = 1; });
  const std::vector<std::string> all = order(1001);
  EXPECT_EQ(before, 1U);
  EXPECT_LE(std::find(all.begin(), all.end(), "counted") - all.begin(), 20);
}

TEST_F(BusyQueue, WhatWasForgottenIsNotRunAndReleased) {
  const auto held = std::make_shared<int>(0);
  queue.post("whoever", [this, held] { post("run"); });
  pool.stop();
  EXPECT_TRUE(order(0).empty());
  EXPECT_EQ(held.use_count(), 2);
  queue.clear();
  EXPECT_EQ(held.use_count(), 1);
}

// ---- binds

class SlowBinds : public test::LoopbackServer {
 protected:
  SlowBinds() {
    authenticator.meanwhile = [this](std::string_view name) {
      go_on.wait();
      const std::lock_guard lock(mutex);
      names.emplace_back(name);
    };
  }
  ~SlowBinds() override {
    go_on.happen();
    stop();
  }

  Event go_on;
  std::mutex mutex;
  std::vector<std::string> names;  // in the order in which they were verified
};

TEST_F(SlowBinds, OfOneAddressDoNotHoldUpThoseOfAnother) {
  start();
  constexpr int kFlood = 60;
  std::vector<std::unique_ptr<WireClient>> flood;
  for (int i = 0; i < kFlood; ++i) {
    flood.push_back(std::make_unique<WireClient>("127.0.0.1", port(), "127.0.0.2"));
    flood.back()->send(test::bind(1, "cn=nobody", "guess"));
  }
  WireClient client("127.0.0.1", port(), "127.0.0.3");
  EXPECT_EQ(code_of(client, test::search(1, "")), 0);  // all of the flood has been read
  client.send(test::bind(2, test::kRoot, test::kSecret));
  WireClient other("127.0.0.1", port(), "127.0.0.4");
  EXPECT_EQ(code_of(other, test::search(1, "")), 0);
  go_on.happen();
  const std::optional<test::Reply> reply = client.receive();
  ASSERT_TRUE(reply);
  EXPECT_EQ(reply->code, 0);
  for (const auto& one : flood) EXPECT_EQ(one->receive()->code, 49);
  const std::lock_guard lock(mutex);
  ASSERT_EQ(names.size(), kFlood + 1U);
  EXPECT_LE(std::find(names.begin(), names.end(), test::kRoot) - names.begin(), 6);
}

}  // namespace
}  // namespace orv::server
