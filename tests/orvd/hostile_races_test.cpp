// Clients that leave, abandon and bind while their operations run, on several loops at once. For
// the thread sanitizer as much as for what is counted at the end.
#include <gtest/gtest.h>

#include <sys/socket.h>

#include <random>
#include <string>
#include <thread>
#include <vector>

#include "core_server_fixture.h"
#include "ops/persistent_search.h"

namespace orv::server::test {
namespace {

constexpr int kThreads = 4;
constexpr int kConnections = 40;  // of each thread

enum class End { unbind, reset, close, half_closed, stay };

class Races : public LoopbackServer {
 protected:
  Races() {
    loops = 3;
    controls = {kManageDsaIt, kPersistentSearchOid, kEntryChangeOid};
    settings.max_pending_operations = 8;
    backend.on_search = [](pblock* parameters) {
      const EntryPtr found = make_test_entry("CN=X,CN=CONFIGURATION", 2000);
      int sent = 0;
      for (int code = 0; sent < 20 && code == 0; ++sent) code = send_test_entry(parameters, *found);
      return finish_search(parameters, 0, sent);
    };
    backend.on_change = [](pblock* parameters) { return finish_change(parameters, 0); };
  }
  ~Races() override { stop(); }

  static std::string persistent_search(int id) {
    const std::string wishes = tlv(0x30, integer(15) + tlv(0x01, "\xFF") + tlv(0x01, "\xFF"));
    const std::string control =
        tlv(0x30, tlv(0x04, kPersistentSearchOid) + tlv(0x01, "\xFF") + tlv(0x04, wishes));
    std::string plain = search(id, kTop, 2);
    // The operation alone, behind the header and the id: all lengths are short.
    return message(id, plain.substr(5), control);
  }

  static std::string some_request(std::mt19937& chance, int id) {
    switch (chance() % 12) {
      case 0:
      case 1:
      case 2:
        return search(id, kTop, 2);
      case 3:
        return add_entry(id, "cn=x,cn=configuration", "cn", "x");
      case 4:
        return modify(id, kTop, "description", "x");
      case 5:
        return delete_entry(id, "cn=x,cn=configuration");
      case 6:
      case 7:
        return abandon(id, static_cast<int>(2 + chance() % 20));
      case 8:
        return bind(id, kRoot, chance() % 4 == 0 ? "wrong" : kSecret);
      case 9:
        return persistent_search(id);
      case 10:
        return extended(id, "1.3.6.1.4.1.1466.20037");
      default:
        return search(id, "", 0);
    }
  }

  void end(WireClient& client, End how) {
    const linger at_once{1, 0};
    switch (how) {
      case End::unbind:
        client.send(unbind(1000));
        break;
      case End::reset:
        ::setsockopt(client.descriptor(), SOL_SOCKET, SO_LINGER, &at_once, sizeof at_once);
        break;
      case End::half_closed:
        ::shutdown(client.descriptor(), SHUT_WR);
        while (client.receive()) {
        }
        break;
      case End::close:
      case End::stay:
        break;
    }
  }

  void play(unsigned seed) {
    std::mt19937 chance(seed);
    for (int i = 0; i < kConnections; ++i) {
      WireClient client(port_);
      client.send(bind(1, kRoot, kSecret));
      const std::optional<Reply> bound = client.receive();
      if (!bound || bound->code != 0) return;  // the server is stopping
      ++connected;                             // from now on it is a connection, however it ends
      std::string all;
      const int count = 1 + static_cast<int>(chance() % 16);
      for (int id = 2; id < 2 + count; ++id) all += some_request(chance, id);
      const auto how = static_cast<End>(chance() % 5);
      if (how == End::unbind) all += unbind(1000);
      // In one piece or in two, so that the end meets operations on all their ways.
      const std::size_t cut = chance() % all.size();
      client.send(all.substr(0, cut));
      if (chance() % 2 == 0) std::this_thread::yield();
      client.send(all.substr(cut));
      if (how == End::stay) client.receive();
      end(client, how);
    }
  }

  // Asked for once: the listeners may be closing while clients still come.
  void begin() {
    start();
    port_ = port();
  }

  std::uint16_t port_ = 0;
  std::atomic<int> connected{0};
};

TEST_F(Races, OfUnbindAbandonAndBindLeaveNothingBehind) {
  begin();
  std::vector<std::thread> threads;
  for (unsigned seed = 1; seed <= kThreads; ++seed)
    threads.emplace_back([this, seed] { play(seed); });
  for (std::thread& thread : threads) thread.join();

  WireClient after(port());
  bind_as_root(after);
  EXPECT_EQ(code_of(after, search(2, kTop)), 0);
  const auto deadline = Clock::now() + std::chrono::seconds(60);
  while (backend.calls(parameter::unbind_function) < connected && Clock::now() < deadline)
    std::this_thread::yield();
  EXPECT_EQ(backend.calls(parameter::unbind_function), connected.load())
      << "the unbind handler is called once for each connection, and for none that is open";
  EXPECT_EQ(server->backend().gate().waiting(), 0U);
  EXPECT_EQ(backend.most_inside(), 1);
}

// The server stops in the middle of it.
TEST_F(Races, OfClientsWithTheStopOfTheServerEndInOrder) {
  begin();
  std::atomic<bool> over{false};
  std::vector<std::thread> threads;
  for (unsigned seed = 1; seed <= kThreads; ++seed) {
    threads.emplace_back([this, seed, &over] {
      for (unsigned round = 0; !over; ++round) {
        try {
          play(seed + 100 * round);
        } catch (const std::runtime_error&) {
          return;  // nobody listens any more
        }
      }
    });
  }
  while (connected < 2 * kThreads) std::this_thread::yield();
  stop();
  over = true;
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(status, 0);
  EXPECT_EQ(backend.closed(), 1);
}

}  // namespace
}  // namespace orv::server::test
