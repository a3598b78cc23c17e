// The gate: one holder, who is admitted before whom, deadlines, closing.
#include "ops/gate.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <functional>
#include <string>
#include <thread>
#include <vector>

namespace orv::server {
namespace {

using namespace std::chrono_literals;

constexpr Clock::time_point kNever = Clock::time_point::max();

class Recorder final : public GateWaiter {
 public:
  explicit Recorder(std::function<void(Verdict)> on_verdict = {})
      : on_verdict_(std::move(on_verdict)) {}
  void gate_decided(Verdict verdict) noexcept override {
    verdicts.push_back(verdict);
    if (on_verdict_) on_verdict_(verdict);
  }
  std::vector<Verdict> verdicts;

 private:
  std::function<void(Verdict)> on_verdict_;
};

std::shared_ptr<Recorder> waiter(std::function<void(Verdict)> on_verdict = {}) {
  return std::make_shared<Recorder>(std::move(on_verdict));
}

TEST(Gate, AdmitsTheFirstAtOnceAndQueuesTheSecond) {
  Gate gate;
  const auto first = waiter();
  const auto second = waiter();
  EXPECT_EQ(gate.enter(first, kNever), Gate::Entry::inside);
  EXPECT_EQ(gate.enter(second, kNever), Gate::Entry::queued);
  EXPECT_TRUE(first->verdicts.empty());
  EXPECT_TRUE(second->verdicts.empty());
  gate.leave();
  EXPECT_EQ(second->verdicts, std::vector{Verdict::admitted});
  gate.leave();
  EXPECT_EQ(gate.enter(first, kNever), Gate::Entry::inside);
}

TEST(Gate, AdmitsWaitersOfOneKindInTheOrderTheyCame) {
  Gate gate;
  std::vector<int> order;
  EXPECT_EQ(gate.enter(waiter(), kNever), Gate::Entry::inside);
  for (int i = 0; i < 5; ++i) {
    EXPECT_EQ(gate.enter(waiter([&order, i](Verdict) { order.push_back(i); }), kNever),
              Gate::Entry::queued);
  }
  for (int i = 0; i < 5; ++i) gate.leave();
  EXPECT_EQ(order, (std::vector{0, 1, 2, 3, 4}));
}

TEST(Gate, IsHandedOverSoThatNobodyWhoComesLaterOvertakes) {
  Gate gate;
  const auto waiting = waiter();
  const auto later = waiter();
  gate.enter(waiter(), kNever);
  gate.enter(waiting, kNever);
  gate.leave();
  ASSERT_EQ(waiting->verdicts, std::vector{Verdict::admitted});
  EXPECT_EQ(gate.enter(later, kNever), Gate::Entry::queued);
}

TEST(Gate, PrefersWaitersOfTheThreadThatLeavesButLetsNobodyWaitForLong) {
  Gate gate;
  EXPECT_EQ(gate.enter(waiter(), kNever), Gate::Entry::inside);
  const auto elsewhere = waiter();
  std::thread([&] { gate.enter(elsewhere, kNever); }).join();
  int own_admitted = 0;
  constexpr int kOwn = 100;
  for (int i = 0; i < kOwn; ++i)
    EXPECT_EQ(gate.enter(waiter([&](Verdict) { ++own_admitted; }), kNever), Gate::Entry::queued);
  gate.leave();
  EXPECT_EQ(own_admitted, 1);
  EXPECT_TRUE(elsewhere->verdicts.empty());
  while (elsewhere->verdicts.empty()) gate.leave();
  EXPECT_LT(own_admitted, 20);
  while (gate.waiting() > 0) gate.leave();
  EXPECT_EQ(own_admitted, kOwn);
}

TEST(Gate, ElsewhereAsksTheWaiterEvenWhenItIsOpen) {
  Gate gate;
  const auto elsewhere = waiter();
  EXPECT_EQ(gate.enter_elsewhere(elsewhere, kNever), Gate::Entry::queued);
  EXPECT_EQ(elsewhere->verdicts, std::vector{Verdict::admitted});
  EXPECT_EQ(gate.enter(waiter(), kNever), Gate::Entry::queued);
}

TEST(Gate, TellsThoseWhoseDeadlinePassedAndNobodyElse) {
  Gate gate;
  const Clock::time_point start{};
  const auto short_wait = waiter();
  const auto long_wait = waiter();
  gate.enter(waiter(), kNever);
  gate.enter(short_wait, start + 10s);
  gate.enter(long_wait, start + 20s);
  gate.expire(start + 9s);
  EXPECT_TRUE(short_wait->verdicts.empty());
  gate.expire(start + 10s);
  EXPECT_EQ(short_wait->verdicts, std::vector{Verdict::late});
  EXPECT_TRUE(long_wait->verdicts.empty());
  gate.leave();
  EXPECT_EQ(short_wait->verdicts.size(), 1U);
  EXPECT_EQ(long_wait->verdicts, std::vector{Verdict::admitted});
}

TEST(Gate, WithdrawnWaitersHearNothing) {
  Gate gate;
  const auto first = waiter();
  const auto second = waiter();
  gate.enter(waiter(), kNever);
  gate.enter(first, kNever);
  gate.enter(second, kNever);
  EXPECT_TRUE(gate.withdraw(*first));
  EXPECT_FALSE(gate.withdraw(*first));
  gate.leave();
  EXPECT_TRUE(first->verdicts.empty());
  EXPECT_EQ(second->verdicts, std::vector{Verdict::admitted});
  EXPECT_FALSE(gate.withdraw(*second));
}

TEST(Gate, ClosedGateRefusesWaitersAndNewcomers) {
  Gate gate;
  const auto waiting = waiter();
  gate.enter(waiter(), kNever);
  gate.enter(waiting, kNever);
  gate.close();
  EXPECT_EQ(waiting->verdicts, std::vector{Verdict::closed});
  EXPECT_EQ(gate.enter(waiter(), kNever), Gate::Entry::closed);
  const auto elsewhere = waiter();
  EXPECT_EQ(gate.enter_elsewhere(elsewhere, kNever), Gate::Entry::closed);
  EXPECT_TRUE(elsewhere->verdicts.empty());
}

TEST(Gate, ClosingWaitsForTheHolder) {
  Gate gate;
  gate.enter(waiter(), kNever);
  EXPECT_FALSE(gate.close_and_wait_until_empty(1ms));
  std::thread holder([&gate] { gate.leave(); });
  EXPECT_TRUE(gate.close_and_wait_until_empty(10s));
  holder.join();
}

TEST(Gate, LetsOneAtATimeThroughFromManyThreads) {
  Gate gate;
  constexpr int kThreads = 4;
  constexpr int kRounds = 2000;
  int unguarded = 0;  // torn without the gate
  std::atomic<int> left{kThreads * kRounds};
  const auto work = [&] {
    ++unguarded;
    gate.leave();
    --left;
  };
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t)
    threads.emplace_back([&] {
      for (int i = 0; i < kRounds; ++i)
        if (gate.enter(waiter([&](Verdict) { work(); }), kNever) == Gate::Entry::inside) work();
    });
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(left.load(), 0);
  EXPECT_EQ(unguarded, kThreads * kRounds);
}

// ---- brief and lasting waiters

Clock::time_point scripted_now;  // of the gates below

class SharedGate : public testing::Test {
 protected:
  SharedGate() {
    scripted_now = Clock::time_point{} + 1h;
    gate.enter(waiter(), kNever);
  }
  void search(const std::string& name, GateUser* user = nullptr) {
    gate.enter(noting(name), kNever, user);
  }
  void change(const std::string& name, GateUser* user = nullptr) {
    gate.enter_elsewhere(noting(name), kNever, user);
  }
  // Who is admitted one after the other, until nobody waits.
  std::vector<std::string> order() {
    while (gate.waiting() > 0) gate.leave();
    return admitted;
  }

  Gate gate{[] { return scripted_now; }};
  std::vector<std::string> admitted;

 private:
  std::shared_ptr<Recorder> noting(const std::string& name) {
    return waiter([this, name](Verdict) { admitted.push_back(name); });
  }
};

TEST_F(SharedGate, SearchGoesBeforeChangesThatWait) {
  for (const char* name : {"first change", "second change", "third change"}) change(name);
  search("search");
  EXPECT_EQ(order(),
            (std::vector<std::string>{"search", "first change", "second change", "third change"}));
}

TEST_F(SharedGate, SearchesThatNeverEndLetAChangeInAfterABoundedNumber) {
  change("change");
  for (int i = 0; i < 10 * Gate::kMostOvertaking; ++i) {
    search("search");
    gate.leave();
    if (admitted.back() == "change") break;
  }
  EXPECT_EQ(admitted.back(), "change");
  EXPECT_EQ(admitted.size(), Gate::kMostOvertaking + 1U);
}

TEST_F(SharedGate, SearchesThatTakeLongLetAChangeInAfterABoundedTime) {
  change("change");
  const Clock::time_point first = scripted_now;
  while (admitted.empty() || admitted.back() != "change") {
    search("search");
    gate.leave();
    scripted_now += 1ms;
    ASSERT_LE(admitted.size(), 100U);
  }
  EXPECT_LE(scripted_now - first, Gate::kOvertakingTime + 2ms);
  EXPECT_GE(admitted.size(), 2U);
}

TEST_F(SharedGate, TimeBeforeTheFirstSearchDoesNotCountAgainstIt) {
  change("change");
  scripted_now += 10s;  // the holder takes its time
  search("search");
  EXPECT_EQ(order(), (std::vector<std::string>{"search", "change"}));
}

TEST_F(SharedGate, EachChangeInTurnIsOvertakenByABoundedNumber) {
  constexpr int kChanges = 5;
  for (int i = 0; i < kChanges; ++i) change("change");
  int searches_in_between = 0;
  int changes = 0;
  while (changes < kChanges) {
    search("search");
    gate.leave();
    if (admitted.back() == "change") {
      ++changes;
      EXPECT_GT(searches_in_between, 0) << "searches go first again before the next one";
      searches_in_between = 0;
    } else {
      ++searches_in_between;
    }
    ASSERT_LE(searches_in_between, Gate::kMostOvertaking);
  }
}

TEST_F(SharedGate, ChangesThatNeverEndLetEachSearchInAtOnce) {
  for (int i = 0; i < 50; ++i) {
    change("change");
    search("search");
    change("change");
    gate.leave();
    EXPECT_EQ(admitted.back(), "search") << i;
    gate.leave();
    EXPECT_EQ(admitted.back(), "change") << i;
  }
}

TEST_F(SharedGate, SearchThatCameBeforeAChangeIsNotHeldBackByIt) {
  for (int i = 0; i < 2 * Gate::kMostOvertaking; ++i) search("early");
  change("change");
  search("late");
  const std::vector<std::string> all = order();
  const auto place = std::find(all.begin(), all.end(), "change") - all.begin();
  EXPECT_EQ(std::count(all.begin(), all.begin() + place, "early"), 2 * Gate::kMostOvertaking);
}

TEST_F(SharedGate, WhatOneConnectionSendsIsDoneInItsOrder) {
  GateUser one;
  GateUser other;
  change("change of another", &other);
  change("own change", &one);
  search("own search", &one);
  change("second own change", &one);
  search("second own search", &one);
  GateUser reader;
  search("search of a third", &reader);
  EXPECT_EQ(order(),
            (std::vector<std::string>{"search of a third", "change of another", "own change",
                                      "own search", "second own change", "second own search"}));
  // Nothing of it waits any more: the next search is free to go first again.
  change("change", &other);
  search("search", &one);
  admitted.clear();
  EXPECT_EQ(order(), (std::vector<std::string>{"search", "change"}));
}

TEST_F(SharedGate, ChangeThatWasGivenUpHoldsNoSearchOfItsConnectionBack) {
  GateUser user;
  const auto given_up = waiter();
  const auto late = waiter();
  change("change of another");
  gate.enter_elsewhere(given_up, kNever, &user);
  gate.enter_elsewhere(late, scripted_now, &user);
  EXPECT_TRUE(gate.withdraw(*given_up));
  gate.expire(scripted_now);
  EXPECT_EQ(late->verdicts, std::vector{Verdict::late});
  search("search", &user);
  EXPECT_EQ(order(), (std::vector<std::string>{"search", "change of another"}));
}

TEST_F(SharedGate, ClosingTellsBothKinds) {
  change("change");
  search("search");
  gate.close();
  EXPECT_EQ(admitted.size(), 2U);
  EXPECT_EQ(gate.waiting(), 0U);
}

}  // namespace
}  // namespace orv::server
