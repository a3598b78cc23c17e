// A server over loopback with a scripted backend, for tests of one subject each.
#pragma once

#include <gtest/gtest.h>

#include <atomic>
#include <csignal>
#include <ctime>
#include <functional>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "cfg/attribute_table.h"
#include "core_fake_backend.h"
#include "core_wire.h"
#include "publish/root_dse.h"
#include "publish/subschema.h"
#include "server.h"

namespace orv::server::test {

inline constexpr const char* kRoot = "cn=root";
inline constexpr const char* kMember = "cn=member";
inline constexpr const char* kSecret = "secret";
inline constexpr const char* kTop = "cn=configuration";
inline constexpr const char* kManageDsaIt = "2.16.840.1.113730.3.4.2";
inline constexpr int kNotice = 0x78;  // the tag of a notice of disconnection

// Knows the primary administrator and one member, both with kSecret.
class ScriptedAuthenticator final : public Authenticator {
 public:
  std::shared_ptr<const Identity> authenticate(std::string_view name,
                                               std::string_view password) override {
    ++asked;
    if (meanwhile) meanwhile(name);
    if (password != kSecret) return nullptr;
    if (name == kRoot) return std::make_shared<Identity>(Identity{"CN=ROOT", 0x0C, 0, ""});
    if (name == kMember) return std::make_shared<Identity>(Identity{"CN=MEMBER", 0x14, 0x20, ""});
    return nullptr;
  }
  std::uint64_t generation() const noexcept override { return generation_; }
  bool still_valid(const Identity&) const noexcept override { return valid; }

  // The identities were read anew; `good` tells whether those who are bound are still the same.
  void change(bool good) {
    valid = good;
    ++generation_;
  }
  std::atomic<bool> valid{true};
  std::atomic<int> asked{0};
  std::function<void(std::string_view)> meanwhile;  // is done while a password is verified

 private:
  std::atomic<std::uint64_t> generation_{1};
};

class LoopbackServer : public testing::Test {
 protected:
  static void SetUpTestSuite() {
    std::signal(SIGPIPE, SIG_IGN);
    ASSERT_EQ(cfg::register_attribute_types(builtin_schema().attribute_table()), 0);
  }

  LoopbackServer() {
    settings.error_log_level = "off";
    settings.idle_timeout = 0;
  }
  ~LoopbackServer() override { stop(); }

  void start() {
    logs.open(settings);
    ServerParts parts{builtin_schema(),
                      backend.record(),
                      authenticator,
                      {[](const Offer&) {
                         return make_root_dse({{kTop}, {}, {}, {}, "v", "1"});
                       },
                       [] { return make_subschema(builtin_schema(), 0); }},
                      logs,
                      controls,
                      settings,
                      loops,
                      reload,
                      {},
                      audit,
                      take_over,
                      true,
                      look_after,
                      changes_made};
    parts.mechanisms = &mechanisms;
    parts.manager = manager;
    parts.wall_time = wall_time;
    parts.read_policy = read_policy;
    server.emplace(std::move(parts));
    std::string error;
    ASSERT_TRUE(server->listen(addresses, 0, error, more)) << error;
    if (reload) server->handle_signals();
    control = std::thread([this] { status = server->serve(); });
  }
  void stop() {
    if (!control.joinable()) return;
    server->stop();
    control.join();
    logs.finish();
  }
  std::uint16_t port() const { return server->port(); }

  void bind_as_root(WireClient& client) { bind_as(client, kRoot); }
  void bind_as(WireClient& client, const char* name) {
    client.send(bind(1, name, kSecret));
    const std::optional<Reply> reply = client.receive();
    ASSERT_TRUE(reply);
    ASSERT_EQ(reply->code, 0);
  }
  static int code_of(WireClient& client, std::string_view request) {
    client.send(request);
    const std::vector<Reply> replies = client.receive_result();
    return replies.empty() ? -1 : replies.back().code;
  }
  bool wait_for_waiters(std::size_t count) {
    const auto end = Clock::now() + std::chrono::seconds(10);
    while (server->backend().gate().waiting() != count && Clock::now() < end)
      std::this_thread::yield();
    return server->backend().gate().waiting() == count;
  }

  // What handlers refer to outlives the server.
  Event unbound;
  std::atomic<int> state_at_unbind{-1};
  FakeBackend backend;
  ScriptedAuthenticator authenticator;
  Settings settings;
  std::vector<std::string> controls{kManageDsaIt};  // that the server supports
  Logs logs;
  std::function<bool(Settings&)> reload;
  AuditLog* audit = nullptr;
  std::function<bool(const Consequences&, bool made)> take_over;
  std::function<void()> look_after;
  unsigned long (*changes_made)() = nullptr;
  std::vector<std::string> addresses{"127.0.0.1"};
  MoreListeners more;
  SaslMechanisms mechanisms;
  const ServiceManager* manager = nullptr;
  std::function<std::time_t()> wall_time;
  std::function<bool(AdminPolicySettings&)> read_policy;
  unsigned loops = 1;
  std::optional<Server> server;
  std::thread control;
  int status = -1;
};

// One client's change is inside the backend until `go_on`.
class BlockedServer : public LoopbackServer {
 protected:
  ~BlockedServer() override {
    go_on.happen();
    stop();
  }

  void block() {
    backend.on_change = [this](pblock* parameters) {
      entered.happen();
      go_on.wait();
      send_ldap_result(connection_of(parameters), operation_of(parameters), 53, nullptr, "");
      return 53;
    };
    start();
    holder.emplace(port());
    bind_as_root(*holder);
    holder->send(delete_entry(2, kTop));
    ASSERT_TRUE(entered.wait());
  }

  Event entered;
  Event go_on;
  std::optional<WireClient> holder;
};

}  // namespace orv::server::test
