// A server over loopback with a scripted backend, for tests of one subject each.
#pragma once

#include <gtest/gtest.h>

#include <atomic>
#include <csignal>
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
inline constexpr const char* kSecret = "secret";
inline constexpr const char* kTop = "cn=configuration";

class ScriptedAuthenticator final : public Authenticator {
 public:
  std::shared_ptr<const Identity> authenticate(std::string_view,
                                               std::string_view password) override {
    if (password != kSecret) return nullptr;
    auto identity = std::make_shared<Identity>();
    identity->bound_dn = "CN=ROOT";
    identity->authority = 0x0C;
    return identity;
  }
  std::uint64_t generation() const noexcept override { return generation_; }
  bool still_valid(const Identity&) const noexcept override { return valid; }

  // The identities were read anew; `good` tells whether those who are bound are still the same.
  void change(bool good) {
    valid = good;
    ++generation_;
  }
  std::atomic<bool> valid{true};

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

  void start(unsigned loops = 1) {
    logs.open(settings);
    server.emplace(ServerParts{builtin_schema(),
                               backend.record(),
                               authenticator,
                               {[] {
                                  return make_root_dse({{kTop}, {}, {}, {}, "v", "1"});
                                },
                                [] { return make_subschema(builtin_schema(), 0); }},
                               logs,
                               {},
                               settings,
                               loops,
                               reload});
    std::string error;
    ASSERT_TRUE(server->listen({"127.0.0.1"}, 0, error)) << error;
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

  void bind_as_root(WireClient& client) {
    client.send(bind(1, kRoot, kSecret));
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

  FakeBackend backend;
  ScriptedAuthenticator authenticator;
  Settings settings;
  Logs logs;
  std::function<bool(Settings&)> reload;
  std::optional<Server> server;
  std::thread control;
  int status = -1;
};

}  // namespace orv::server::test
