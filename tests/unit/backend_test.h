// What the backend's tests share: a platform, a started instance, a client and an operation.
#pragma once

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstdint>
#include <cstdio>
#include <memory>
#include <string>
#include <vector>

#include "cfg/ldapmod.h"
#include "config_private.h"
#include "handlers.h"
#include "platform/platform.h"
#include "slapi/globals.h"
#include "slapi/trace.h"

namespace orv {

using scripted::Answer;
using scripted::DebugLine;
using scripted::Platform;
using scripted::ScriptedEntry;
using testing::Contains;
using testing::ElementsAre;
using testing::IsEmpty;
using testing::Not;

// Modifications as handlers get them, with counted values.
inline constexpr int kAdd = kModAdd | kModBvalues;
inline constexpr int kDelete = kModDelete | kModBvalues;
inline constexpr int kReplace = kModReplace | kModBvalues;

class BackendTest : public testing::Test {
 protected:
  BackendTest() {
    scripted::connect(connection);
    platform.name(&connection, "connection");
    platform.name(&operation, "operation");
    platform.name(&backend, "backend");
    platform.name(&state.configMutex, "configMutex");
    platform.name(&control, "control");
    backend.private_data = &state;
    pb.put(parameter::backend, &backend);
    pb.put(parameter::connection, &connection);
    pb.put(parameter::operation, &operation);
    connection.aux = &aux;
    debug_on();
  }

  ~BackendTest() override {
    g_srvType = 0;
    default_autolock = 1;
    al_configfile_counter = 0;
    configfile_read = 1;
    trcEvents = 0;
  }

  // Every test ends with this check: whoever leaves something has looked at it and called
  // `platform.release_leaks()`.
  void TearDown() override {
    EXPECT_THAT(platform.leaks(), IsEmpty());
    EXPECT_THAT(platform.violations(), IsEmpty());
  }

  static void debug_on() { trcEvents = kTraceDebug; }
  static void debug_off() { trcEvents = 0; }

  void as(unsigned authority, const char* bound_dn = "") {
    operation.authority = authority;
    operation.bound_dn = bound_dn;
  }

  // Runs a function that returns a code, and looks at its exit record: that identifier, that code.
  template <typename Function>
  int traced(std::uint32_t function, Function call) {
    const std::uint32_t before = trcEvents;
    trcEvents = before | (kTraceExit & ~kTraceEntry);
    const int rc = platform.run(call);
    trcEvents = before;
    const std::vector<std::string> records = platform.records();
    char expected[32];
    std::snprintf(expected, sizeof expected, "exit %08x %d", function, rc);
    EXPECT_EQ(records.empty() ? "" : records.back(), expected);
    return rc;
  }

  // A session that an earlier call has opened.
  _CFG* open_session() {
    connection.config_session = cfg_init(nullptr, 0);
    platform.forget();
    return connection.config_session;
  }
  void close_session() {
    cfg_unbind(connection.config_session);
    connection.config_session = nullptr;
  }

  [[nodiscard]] bool locked() const { return platform.held(&state.configMutex); }

  // The client was told exactly this.
  void expect_answered(int code, const std::string& text = "") const {
    EXPECT_THAT(platform.calls({"send_ldap_result"}),
                ElementsAre("send_ldap_result(connection, operation, " + std::to_string(code) +
                            ", null, \"" + text + "\")"));
  }

  // The newest entry or exit record.
  [[nodiscard]] std::string last_record() const { return platform.records().back(); }

  Platform platform;
  ConfigBackendPrivate state{
      "/etc/orv/config.ldif", "/etc/orv/config.ldif.save", "/etc/orv/key.stash", {}};
  Backend backend;
  Connection connection;
  ConnectionAux aux;
  Operation operation;
  LDAPControl control{};
  pblock pb;
};

// Blocks that a test has looked at as a caller would, released as a caller would.
struct Freed {
  explicit Freed(char* text) : text(text) {}
  ~Freed() { std::free(text); }
  Freed(const Freed&) = delete;
  Freed& operator=(const Freed&) = delete;
  char* text;
};

inline DebugLine error(const std::string& text) {
  return {0xC8110000U, text};
}
inline DebugLine detail(const std::string& text) {
  return {0xC80D0000U, text};
}
inline DebugLine info(const std::string& text) {
  return {0xC8010000U, text};
}
inline DebugLine closing(const std::string& text) {
  return {0xC8030000U, text};
}

}  // namespace orv
