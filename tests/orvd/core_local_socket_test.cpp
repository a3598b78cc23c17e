// The Unix socket: its name in the file system, who may connect, and whom the system says they are.
#include <gtest/gtest.h>

#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/time.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstring>
#include <filesystem>
#include <fstream>

#include "../temporary_directory.h"
#include "auth/sasl_external.h"
#include "core_server_fixture.h"
#include "net/local_socket.h"

namespace orv::server {
namespace {

using namespace std::chrono_literals;

using test::kTop;
using test::Reply;
using test::WireClient;

class LocalClient final : public WireClient {
 public:
  explicit LocalClient(const std::string& path) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::strncpy(address.sun_path, path.c_str(), sizeof address.sun_path - 1);
    socket_ = ::socket(AF_UNIX, SOCK_STREAM, 0);
    connected = ::connect(socket_, reinterpret_cast<sockaddr*>(&address), sizeof address) == 0;
  }
  bool connected = false;
};

struct Folder : orv::test::TemporaryDirectory {
  Folder() : TemporaryDirectory("/tmp") {}  // the path of a socket is short
  std::string socket() const { return file("ldapi"); }
};

class LocalSocketTest : public testing::Test {
 protected:
  std::string refusal(const std::string& path) {
    LocalSocket second;
    std::string error;
    return second.listen(path, error) ? "" : error;
  }
  Folder folder;
  std::string path = folder.socket();
  std::string error;
};

TEST_F(LocalSocketTest, IsForItsOwnerAndGoesWithTheServer) {
  {
    LocalSocket local;
    ASSERT_TRUE(local.listen(path, error)) << error;
    struct stat status {};
    ASSERT_EQ(::stat(path.c_str(), &status), 0);
    EXPECT_TRUE(S_ISSOCK(status.st_mode));
    EXPECT_EQ(status.st_mode & 0777U, 0600U);
  }
  EXPECT_FALSE(std::filesystem::exists(path));
}

TEST_F(LocalSocketTest, IsForItsOwnerWhateverTheUmaskLeaves) {
  const mode_t before = ::umask(0);
  LocalSocket local;
  const Descriptor listening = local.listen(path, error);
  ::umask(before);
  ASSERT_TRUE(listening) << error;
  struct stat status {};
  ASSERT_EQ(::stat(path.c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 0777U, 0600U);
}

TEST_F(LocalSocketTest, ReplacesOneThatAServerLeftBehind) {
  {
    LocalSocket killed;
    ASSERT_TRUE(killed.listen(path, error));
    ASSERT_EQ(::link(path.c_str(), (path + ".kept").c_str()), 0);
  }
  ASSERT_EQ(::rename((path + ".kept").c_str(), path.c_str()), 0);
  EXPECT_EQ(refusal(path), "");
}

TEST_F(LocalSocketTest, DoesNotReplaceOneThatSomebodyListensAt) {
  LocalSocket first;
  const Descriptor listening = first.listen(path, error);
  ASSERT_TRUE(listening) << error;
  EXPECT_NE(refusal(path).find("in use"), std::string::npos);
  EXPECT_TRUE(LocalClient(path).connected);
}

TEST_F(LocalSocketTest, DoesNotReplaceAnythingElse) {
  std::ofstream(path) << "precious";
  EXPECT_NE(refusal(path), "");
  std::string text;
  std::ifstream(path) >> text;
  EXPECT_EQ(text, "precious");
  std::filesystem::remove(path);
  std::filesystem::create_symlink("/nowhere", path);
  EXPECT_NE(refusal(path), "");
  EXPECT_TRUE(std::filesystem::is_symlink(path));
}

TEST_F(LocalSocketTest, RemovesNothingThatTookItsPlace) {
  {
    LocalSocket local;
    ASSERT_TRUE(local.listen(path, error));
    std::filesystem::remove(path);
    std::ofstream(path) << "precious";
  }
  EXPECT_TRUE(std::filesystem::exists(path));
}

TEST_F(LocalSocketTest, SaysWhyThereIsNone) {
  EXPECT_NE(refusal(folder.socket() + std::string(200, 'x')).find("too long"), std::string::npos);
  EXPECT_NE(refusal("/nowhere/at/all").find("No such file"), std::string::npos);
}

// ---- the server behind it

class LocalServer : public test::LoopbackServer, public ExternalIdentities {
 protected:
  LocalServer() {
    more.local_socket = folder.socket();
    mechanisms.push_back(make_external(*this));
  }
  ~LocalServer() override { stop(); }

  std::shared_ptr<const Identity> primary_administrator() override {
    return known ? std::make_shared<Identity>(Identity{"CN=ROOT", 0x0C, 0, ""}) : nullptr;
  }
  std::shared_ptr<const Identity> of_certificate(std::string_view) override { return nullptr; }

  static Reply external(WireClient& client, int id, const std::optional<std::string>& as = "") {
    client.send(test::sasl_bind(id, "EXTERNAL", as));
    return client.receive().value_or(Reply{});
  }

  Folder folder;
  std::atomic<bool> known{true};
};

TEST_F(LocalServer, MakesWhoRunsTheServerItsAdministrator) {
  start();
  LocalClient client(folder.socket());
  ASSERT_TRUE(client.connected);
  EXPECT_EQ(code_of(client, test::delete_entry(1, kTop)), 50);
  EXPECT_EQ(external(client, 2).code, 0);
  EXPECT_EQ(code_of(client, test::delete_entry(3, kTop)), 53);
}

TEST_F(LocalServer, AsksForAnInitialResponseThatWasLeftOut) {
  start();
  LocalClient client(folder.socket());
  EXPECT_EQ(external(client, 1, std::nullopt).code, 14);
  EXPECT_EQ(external(client, 2, "").code, 0);
}

TEST_F(LocalServer, LetsNobodyActAsAnybodyElse) {
  start();
  LocalClient client(folder.socket());
  for (const char* const other : {"dn:cn=member", "u:root", "dn:", "cn=root", "dn:not a dn", "x"})
    EXPECT_EQ(external(client, 1, other).code, 49) << other;
  EXPECT_EQ(code_of(client, test::delete_entry(2, kTop)), 50);
  EXPECT_EQ(external(client, 3, "dn: CN = Root ").code, 0);
}

TEST_F(LocalServer, RefusesWhereThereIsNoAdministrator) {
  known = false;
  start();
  LocalClient client(folder.socket());
  EXPECT_EQ(external(client, 1).code, 49);
}

TEST_F(LocalServer, OffersExternalNowhereElse) {
  start();
  WireClient client(port());
  EXPECT_EQ(external(client, 1).code, 7);
}

TEST_F(LocalServer, IsReachedHoweverManyStrangersAreConnected) {
  settings.max_connections = 2;
  settings.max_unauthenticated_connections = 2;
  start();
  WireClient first(port());
  WireClient second(port());
  EXPECT_EQ(code_of(first, test::search(1, "")), 0);
  EXPECT_EQ(code_of(second, test::search(1, "")), 0);
  LocalClient client(folder.socket());
  EXPECT_EQ(external(client, 1).code, 0);
}

TEST_F(LocalServer, TakesNoPlaceOfThoseFromElsewhere) {
  settings.max_connections = 2;
  settings.max_unauthenticated_connections = 2;
  start();
  std::vector<std::unique_ptr<LocalClient>> locals;
  for (int i = 0; i < 4; ++i) {
    locals.push_back(std::make_unique<LocalClient>(folder.socket()));
    EXPECT_EQ(code_of(*locals.back(), test::search(1, "")), 0);
  }
  EXPECT_EQ(external(*locals.front(), 2).code, 0);
  WireClient first(port());
  WireClient second(port());
  EXPECT_EQ(code_of(first, test::search(1, "")), 0);
  EXPECT_EQ(code_of(second, test::search(1, "")), 0);
  EXPECT_EQ(server->connections(), 6);
  // Those who leave make no place that there is not.
  locals.clear();
  const auto end = Clock::now() + 10s;
  while (server->connections() > 2 && Clock::now() < end) std::this_thread::yield();
  WireClient third(port());
  EXPECT_EQ(code_of(third, test::search(1, "")), 51);
}

TEST_F(LocalServer, IsItselfLimited) {
  settings.max_connections_per_address = 2;
  start();
  LocalClient first(folder.socket());
  LocalClient second(folder.socket());
  EXPECT_EQ(code_of(first, test::search(1, "")), 0);
  EXPECT_EQ(code_of(second, test::search(1, "")), 0);
  LocalClient third(folder.socket());
  EXPECT_EQ(code_of(third, test::search(1, "")), 51);
  WireClient other(port());
  EXPECT_EQ(code_of(other, test::search(1, "")), 0);
}

// Checks of passwords cost time by intention, and strangers may ask for as many as they have
// connections.
TEST_F(LocalServer, BindsWhileStrangersHavePasswordsChecked) {
  test::Event enough;
  authenticator.meanwhile = [&](std::string_view) { enough.wait(); };
  std::atomic<bool> looked_after{false};
  look_after = [&] { looked_after = authenticator.asked >= 2; };
  start();
  std::vector<std::unique_ptr<WireClient>> strangers;
  for (int i = 0; i < 8; ++i) {
    strangers.push_back(std::make_unique<WireClient>(port()));
    strangers.back()->send(test::bind(1, "cn=root", "guess"));
  }
  const auto end = Clock::now() + 10s;
  while (authenticator.asked < 2 && Clock::now() < end) std::this_thread::yield();
  LocalClient client(folder.socket());
  const timeval patience{5, 0};
  ::setsockopt(client.descriptor(), SOL_SOCKET, SO_RCVTIMEO, &patience, sizeof patience);
  EXPECT_EQ(external(client, 1).code, 0);
  while (!looked_after && Clock::now() < end) std::this_thread::yield();
  EXPECT_TRUE(looked_after);
  enough.happen();
  stop();
}

TEST_F(LocalServer, RemovesItsSocketWhenItStops) {
  start();
  stop();
  EXPECT_FALSE(std::filesystem::exists(folder.socket()));
}

TEST_F(LocalServer, ServesOthersWhereTheSocketCannotBe) {
  more.local_socket = "/nowhere/at/all";
  start();
  WireClient client(port());
  EXPECT_EQ(code_of(client, test::search(1, "")), 0);
}

}  // namespace
}  // namespace orv::server
