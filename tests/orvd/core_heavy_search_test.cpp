// Searches that take long, and answers that nobody reads: who else is served meanwhile.
#include <gtest/gtest.h>

#include "core_searched_file.h"
#include "core_server_fixture.h"
#include "ops/output_meter.h"
#include "ops/search_cost.h"

namespace orv::server {
namespace {

using namespace std::chrono_literals;
using test::Event;
using test::kTop;
using test::Reply;
using test::WireClient;

// ---- which searches are long

TEST(SearchCost, FirstSearchCountsAsLong) {
  const SearchCost cost;
  EXPECT_TRUE(cost.may_be_long(15));
}

TEST(SearchCost, DependsOnTheSizeOfTheTreeAndTheLengthOfTheFilter) {
  SearchCost cost;
  cost.learn(50, true);
  EXPECT_FALSE(cost.may_be_long(15));
  EXPECT_FALSE(cost.may_be_long(1000));
  EXPECT_TRUE(cost.may_be_long(20000));
  cost.learn(20000, true);
  EXPECT_TRUE(cost.may_be_long(15));
}

TEST(SearchCost, SearchOfAPartShowsOnlyThatThereIsNoLess) {
  SearchCost cost;
  cost.learn(20000, true);
  cost.learn(3, false);
  EXPECT_TRUE(cost.may_be_long(15));
  cost.learn(50, true);
  EXPECT_FALSE(cost.may_be_long(15));
  cost.learn(20000, false);
  EXPECT_TRUE(cost.may_be_long(15));
}

TEST(SearchCost, HugeNumbersDoNotOverflow) {
  SearchCost cost;
  cost.learn(SIZE_MAX, true);
  EXPECT_TRUE(cost.may_be_long(SIZE_MAX));
}

// ---- the loop of a long search

class HeavySearch : public test::LoopbackServer {
 protected:
  // Searches below the base stay inside the backend until `go_on`.
  void block_searches() {
    backend.on_search = [this](pblock* parameters) {
      int scope = 0;
      slapi_pblock_get(parameters, parameter::search_scope, &scope);
      if (scope != 0) {
        entered.happen();
        EXPECT_TRUE(go_on.wait());
      }
      return test::finish_search(parameters, 0, 0);
    };
  }
  ~HeavySearch() override {
    go_on.happen();
    stop();
  }
  Event entered;
  Event go_on;
};

TEST_F(HeavySearch, LeavesTheOtherClientsOfItsLoopServed) {
  block_searches();
  start();
  WireClient heavy(port());
  bind_as_root(heavy);
  heavy.send(test::search(2, kTop, 2));
  ASSERT_TRUE(entered.wait());
  WireClient other(port());
  EXPECT_EQ(code_of(other, test::search(1, "")), 0);
  go_on.happen();
  EXPECT_EQ(heavy.receive_result().back().code, 0);
}

TEST_F(HeavySearch, LeavesWaitersOfItsLoopToBeToldBusyInTime) {
  settings.operation_wait = 1;
  block_searches();
  start();
  WireClient heavy(port());
  bind_as_root(heavy);
  heavy.send(test::search(2, kTop, 1));
  ASSERT_TRUE(entered.wait());
  WireClient waiter(port());
  bind_as_root(waiter);
  EXPECT_EQ(code_of(waiter, test::search(2, kTop)), 51);
  go_on.happen();
  EXPECT_EQ(heavy.receive_result().back().code, 0);
}

TEST_F(HeavySearch, IsAbandonedByItsClientWhileItRuns) {
  block_searches();
  start();
  WireClient client(port());
  bind_as_root(client);
  client.send(test::search(2, kTop, 2));
  ASSERT_TRUE(entered.wait());
  client.send(test::abandon(3, 2) + test::search(4, ""));
  EXPECT_EQ(client.receive_result().back().id, 4);
  go_on.happen();
  EXPECT_EQ(code_of(client, test::search(5, "")), 0);
}

// Searches in a file with a few entries.
class FileSearch : public test::LoopbackServer {
 protected:
  FileSearch() {
    backend.on_search = [this](pblock* parameters) {
      if (before_search) before_search();
      const int code = file.search();
      threads.push_back(std::this_thread::get_id());
      return test::finish_search(parameters, code, 0);
    };
  }
  ~FileSearch() override { stop(); }

  test::SearchedFile file{3};
  std::function<void()> before_search;
  std::vector<std::thread::id> threads;  // of each search
};

TEST_F(FileSearch, SmallTreeIsSearchedOnTheLoopOnceItIsKnownToBeSmall) {
  start();
  WireClient client(port());
  bind_as_root(client);
  EXPECT_EQ(code_of(client, test::search(2, kTop, 0)), 0);
  EXPECT_EQ(code_of(client, test::search(3, kTop, 2)), 0);
  EXPECT_EQ(code_of(client, test::search(4, kTop, 2)), 0);
  EXPECT_EQ(code_of(client, test::search(5, kTop, 1)), 0);
  ASSERT_EQ(threads.size(), 4U);
  EXPECT_NE(threads[1], threads[0]);
  EXPECT_EQ(threads[2], threads[0]);
  EXPECT_EQ(threads[3], threads[0]);
}

TEST_F(FileSearch, TimeLimitIsLookedAtForEveryEntry) {
  const auto begun = Clock::now();
  before_search = [&] {
    while (Clock::now() < begun + 1500ms) std::this_thread::yield();
  };
  start();
  WireClient client(port());
  bind_as_root(client);
  EXPECT_EQ(code_of(client, test::search(2, kTop, 2, 0, 1)), 3);
}

TEST_F(FileSearch, CutOffByTheStopOfTheServerIsAnsweredUnavailable) {
  Event entered;
  backend.on_search = [&](pblock* parameters) {
    entered.happen();
    return test::finish_search(parameters, file.search_until_interrupted(), 0);
  };
  start();
  WireClient client(port());
  bind_as_root(client);
  client.send(test::search(2, kTop, 2));
  ASSERT_TRUE(entered.wait());
  stop();
  const std::vector<Reply> replies = client.receive_result();
  ASSERT_FALSE(replies.empty());
  EXPECT_EQ(replies.back().id, 2);
  EXPECT_EQ(replies.back().code, 52);
}

// ---- answers that nobody reads

TEST(OutputMeter, CountsWhatIsUnreadAndGivesItBack) {
  OutputMeter meter(1000);
  {
    OutputShare a(meter);
    OutputShare b(meter);
    a.answered(300);
    b.answered(600);
    EXPECT_EQ(meter.room(), 100U);
    a.queued(300);
    a.unwritten(300);
    a.settled(300);
    EXPECT_EQ(meter.room(), 100U);
    a.unwritten(50);
    EXPECT_EQ(meter.room(), 350U);
    b.answered(900);
    EXPECT_EQ(meter.room(), 0U);
  }
  EXPECT_EQ(meter.room(), 1000U);
}

TEST(OutputMeter, DoesNotCountWhatTheBackendDidNotAnswer) {
  OutputMeter meter(1000);
  OutputShare share(meter);
  share.unwritten(700);
  EXPECT_EQ(meter.room(), 1000U);
  share.answered(100);
  share.queued(100);
  share.unwritten(800);
  share.settled(100);
  EXPECT_EQ(meter.room(), 900U);
  share.unwritten(0);
  EXPECT_EQ(meter.room(), 1000U);
}

TEST(OutputMeter, ShareIsFullAboveTheMark) {
  OutputMeter meter;
  OutputShare share(meter);
  share.answered(OutputShare::kMark - 1);
  EXPECT_FALSE(share.full());
  share.answered(1);
  EXPECT_TRUE(share.full());
}

class UnreadAnswers : public test::LoopbackServer {
 protected:
  static constexpr int kRequests = 50;

  // The first search waits for `go_on`; each answer has two megabytes.
  void answer_much() {
    backend.on_search = [this](pblock* parameters) {
      if (++searches == 1) go_on.wait();
      if (test::target_of(parameters) != "CN=CONFIGURATION")
        return test::finish_search(parameters, 0, 0);
      const EntryPtr entry = test::make_test_entry("CN=CONFIGURATION", 1 << 20);
      test::send_test_entry(parameters, *entry);
      test::send_test_entry(parameters, *entry);
      return test::finish_search(parameters, 0, 2);
    };
  }
  ~UnreadAnswers() override {
    go_on.happen();
    stop();
  }
  std::atomic<int> searches{0};
  Event go_on;
};

TEST_F(UnreadAnswers, KeepTheConnectionsOtherOperationsFromBeingStarted) {
  answer_much();
  start();
  WireClient client(port());
  bind_as_root(client);
  std::string all;
  for (int i = 0; i < kRequests; ++i) all += test::search(2 + i, kTop, 2);
  client.send(all);
  ASSERT_TRUE(wait_for_waiters(kRequests - 1));
  WireClient other(port());
  bind_as_root(other);
  other.send(test::search(2, "cn=other,cn=configuration", 2));
  ASSERT_TRUE(wait_for_waiters(kRequests));
  go_on.happen();
  EXPECT_EQ(other.receive_result().back().code, 0);
  // What the system's own buffers take is another matter.
  EXPECT_LT(searches.load(), 15);
  int answered = 0;
  for (int i = 0; i < kRequests; ++i) {
    const std::vector<Reply> replies = client.receive_result();
    if (replies.size() == 3 && replies.back().code == 0) ++answered;
  }
  EXPECT_EQ(answered, kRequests);
}

TEST_F(UnreadAnswers, LeaveTheChangesBehindThemInTheirOrder) {
  constexpr int kChanges = 12;
  settings.max_pending_operations = 4;
  std::string made;
  std::string expected;
  backend.on_search = [this](pblock* parameters) {
    go_on.wait();
    const EntryPtr entry = test::make_test_entry("CN=CONFIGURATION", 1 << 20);
    int code = 0;
    for (int i = 0; i < 14 && code == 0; ++i) code = test::send_test_entry(parameters, *entry);
    return test::finish_search(parameters, code, 14);
  };
  backend.on_change = [&](pblock* parameters) {
    made += test::target_of(parameters) + " ";
    return test::finish_change(parameters, 0);
  };
  start();
  WireClient client(port());
  bind_as_root(client);
  std::string all = test::search(2, kTop, 2);
  for (int i = 0; i < kChanges; ++i) {
    const std::string name = "CN=" + std::to_string(i) + ",CN=CONFIGURATION";
    all += test::delete_entry(3 + i, name);
    expected += name + " ";
  }
  client.send(all);
  ASSERT_TRUE(wait_for_waiters(3));
  go_on.happen();
  ASSERT_TRUE(wait_for_waiters(0));
  EXPECT_EQ(client.receive_result().back().code, 0);
  for (int i = 0; i < kChanges; ++i) {
    const std::vector<Reply> replies = client.receive_result();
    ASSERT_EQ(replies.size(), 1U);
    EXPECT_EQ(replies[0].id, 3 + i);
    EXPECT_EQ(replies[0].code, 0);
  }
  stop();
  EXPECT_EQ(made, expected);
}

TEST_F(UnreadAnswers, OfAClientThatLeavesAreForgottenWithItsOtherOperations) {
  Event unbound;
  backend.on_unbind = [&](pblock*) {
    unbound.happen();
    return 0;
  };
  answer_much();
  start();
  WireClient other(port());
  {
    WireClient client(port());
    bind_as_root(client);
    std::string all;
    for (int i = 0; i < kRequests; ++i) all += test::search(2 + i, kTop, 2);
    client.send(all);
    ASSERT_TRUE(wait_for_waiters(kRequests - 1));
    go_on.happen();
    bind_as_root(other);
    EXPECT_EQ(code_of(other, test::search(2, "cn=other,cn=configuration", 2)), 0);
  }
  EXPECT_TRUE(unbound.wait());
  EXPECT_EQ(code_of(other, test::search(3, "cn=other,cn=configuration", 2)), 0);
  stop();
}

}  // namespace
}  // namespace orv::server
