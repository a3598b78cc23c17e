#include "slapi/control.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <cstdlib>
#include <string>
#include <thread>
#include <vector>

#include "slapi/connection.h"
#include "slapi/globals.h"

namespace orv {
namespace {

TEST(InsertControl, StartsAndGrowsANullTerminatedArrayOfTheControlsThemselves) {
  LDAPControl first{};
  LDAPControl second{};
  LDAPControl** list = nullptr;
  ASSERT_EQ(ldap_insert_control(&first, &list), 0);
  ASSERT_EQ(ldap_insert_control(&second, &list), 0);
  EXPECT_EQ(list[0], &first);
  EXPECT_EQ(list[1], &second);
  EXPECT_EQ(list[2], nullptr);
  std::free(list);
}

TEST(InsertControl, RefusesNullArguments) {
  LDAPControl control{};
  LDAPControl** list = nullptr;
  EXPECT_EQ(ldap_insert_control(nullptr, &list), 80);
  EXPECT_EQ(ldap_insert_control(&control, nullptr), 80);
  EXPECT_EQ(list, nullptr);
}

TEST(SupportedControls, AreListedOnceInOrderOfRegistration) {
  EXPECT_EQ(slapi_register_supported_control("1.2.840.1", -1), 0);
  EXPECT_EQ(slapi_register_supported_control("1.2.840.2", 4), 0);
  EXPECT_EQ(slapi_register_supported_control("1.2.840.1", -1), 0);
  EXPECT_EQ(slapi_register_supported_control(nullptr, -1), 80);
  std::vector<std::string> ours;
  for (const std::string& oid : slapi_supported_controls())
    if (oid.starts_with("1.2.840.")) ours.push_back(oid);
  EXPECT_THAT(ours, testing::ElementsAre("1.2.840.1", "1.2.840.2"));
}

TEST(SupportedControls, AreRegisteredAndReadByManyThreads) {
  constexpr int kThreads = 8;
  constexpr int kEach = 200;
  std::vector<std::thread> threads;
  std::atomic<int> failures{0};
  for (int t = 0; t < kThreads; ++t)
    threads.emplace_back([t, &failures] {
      for (int i = 0; i < kEach; ++i) {
        const std::string oid = "1.3." + std::to_string(t % 2) + "." + std::to_string(i);
        if (slapi_register_supported_control(oid.c_str(), -1) != 0) ++failures;
        const auto all = slapi_supported_controls();
        if (std::find(all.begin(), all.end(), oid) == all.end()) ++failures;
      }
    });
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(failures, 0);
  const auto all = slapi_supported_controls();
  EXPECT_EQ(std::count_if(all.begin(), all.end(),
                          [](const std::string& oid) { return oid.starts_with("1.3."); }),
            2 * kEach);
}

int g_sent_code = -1;
std::string g_sent_text;

int record_result(Connection*, Operation*, int code, const char* matched, const char* text) {
  g_sent_code = code;
  g_sent_text = std::string(matched == nullptr ? "-" : matched) + "/" + text;
  return 17;
}

TEST(SendResult, GoesThroughTheConnectionAndReturnsItsAnswer) {
  Connection connection;
  Operation operation;
  connection.send_result = record_result;
  EXPECT_EQ(send_ldap_result(&connection, &operation, 50, nullptr, "no"), 17);
  EXPECT_EQ(g_sent_code, 50);
  EXPECT_EQ(g_sent_text, "-/no");
}

TEST(SendResult, OnNoConnectionIs80AndSendsNothing) {
  g_sent_code = -1;
  Operation operation;
  Connection mute;
  EXPECT_EQ(send_ldap_result(nullptr, &operation, 0, nullptr, ""), 80);
  EXPECT_EQ(send_ldap_result(&mute, &operation, 0, nullptr, ""), 80);
  EXPECT_EQ(g_sent_code, -1);
}

TEST(SharedRecords, BeginWithoutConfigurationAccess) {
  EXPECT_EQ(Operation{}.authority, 0x24U);
  EXPECT_EQ(Operation{}.roles, 0U);
  const Connection connection;
  EXPECT_EQ(connection.authority, 0x24U);
  EXPECT_EQ(connection.state, 1);
  EXPECT_EQ(connection.config_session, nullptr);
}

TEST(SharedGlobals, BeginWithTheTimedLockPolicyUnread) {
  EXPECT_EQ(default_autolock, 1);
  EXPECT_EQ(al_configfile_counter, 0);
  EXPECT_EQ(configfile_read, 1);
  EXPECT_EQ(g_srvType, 0);
  EXPECT_EQ(g_safe_mode, 0);
}

}  // namespace
}  // namespace orv
