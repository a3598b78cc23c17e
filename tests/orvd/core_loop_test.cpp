// What an event loop does for its connections when it has been busy, or when one of them is not
// read from.
#include <gtest/gtest.h>

#include <sys/socket.h>

#include <atomic>
#include <deque>
#include <thread>

#include "core_server_fixture.h"

namespace orv::server {
namespace {

using namespace std::chrono_literals;
using test::Event;
using test::kTop;
using test::WireClient;

class LoopTest : public test::LoopbackServer {
 protected:
  LoopTest() { loops = 1; }
  ~LoopTest() override {
    go_on.happen();
    stop();
  }
  static int refused(pblock* parameters) { return test::finish_change(parameters, 53); }
  // The next call of a handler stays inside the backend until `go_on`.
  int stay(pblock* parameters) {
    entered.happen();
    go_on.wait();
    left = true;
    return refused(parameters);
  }
  Event entered;
  Event go_on;
  std::atomic<bool> left{false};
};

TEST_F(LoopTest, ClientThatResetsIsNoticedThoughItIsNotReadFrom) {
  settings.max_pending_operations = 1;
  settings.operation_wait = 60;
  backend.on_change = [this](pblock* parameters) { return stay(parameters); };
  start();
  WireClient holder(port());
  bind_as_root(holder);
  holder.send(test::delete_entry(2, kTop));
  ASSERT_TRUE(entered.wait());
  WireClient client(port());
  bind_as_root(client);
  client.send(test::search(2, kTop));
  ASSERT_TRUE(wait_for_waiters(1));
  const linger at_once{1, 0};
  ASSERT_EQ(setsockopt(client.descriptor(), SOL_SOCKET, SO_LINGER, &at_once, sizeof at_once), 0);
  client.close();
  EXPECT_TRUE(wait_for_waiters(0));
  EXPECT_FALSE(left);  // not because its turn came
}

TEST_F(LoopTest, RequestsThatCameInTimeAreServedThoughTheLoopWasBusyForLonger) {
  constexpr int kClients = 150;  // more than a loop takes on between two looks at the deadlines
  settings.idle_timeout = 2;
  backend.on_search = [this](pblock* parameters) { return stay(parameters); };
  start();
  WireClient holder(port());
  bind_as_root(holder);
  std::deque<WireClient> clients;
  for (int i = 0; i < kClients; ++i) {
    clients.emplace_back(port());
    ASSERT_EQ(code_of(clients.back(), test::search(1, "")), 0);
  }
  holder.send(test::search(2, kTop, 0));
  ASSERT_TRUE(entered.wait());
  for (WireClient& client : clients) client.send(test::search(2, ""));
  const Clock::time_point late = Clock::now() + 2500ms;  // the time that must have passed
  std::this_thread::sleep_until(late);
  go_on.happen();
  int answered = 0;
  for (WireClient& client : clients) {
    const auto replies = client.receive_result();
    if (!replies.empty() && replies.back().id == 2) ++answered;
  }
  EXPECT_EQ(answered, kClients);
}

}  // namespace
}  // namespace orv::server
