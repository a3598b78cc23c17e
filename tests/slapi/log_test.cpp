#include "slapi/log.h"
#include "../temporary_directory.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstdlib>
#include <string>
#include <thread>
#include <vector>

#include "cfg/attribute_table.h"
#include "slapi/schema.h"
#include "slapi/trace.h"

namespace orv {
namespace {

thread_local std::vector<std::string> g_messages;

void record_message(int severity, int set, int number, const char* text) noexcept {
  g_messages.push_back(std::to_string(severity) + "/" + std::to_string(set) + "/" +
                       std::to_string(number) + " " + text);
}

class Messages : public testing::Test {
 protected:
  void SetUp() override {
    g_messages.clear();
    set_message_sink(record_message);
  }
  void TearDown() override {
    open_message_catalogue("/nonexistent/orvd.cat");
    set_message_sink(nullptr);
  }
};

void print_all() {
  PrintMessage(0, 8, 145);
  PrintMessage(0, 8, 146);
  PrintMessage(0, 8, 167, "O=A", "O=B");
  PrintMessage(0, 8, 174, "CN=P", "CN=SCHEMA");
  PrintMessage(0, 8, 179, "http://x");
  for (int number = 1; number <= 11; ++number) PrintMessage(0, 9, number, "CN=E", "A", "B");
  for (int number = 1; number <= 10; ++number) PrintMessage(0, 10, number, "CN=A", "7");
}

const std::vector<std::string> kBuiltInTexts{
    "0/8/145 The proxy split name in this change is already in use. The change was refused.",
    "0/8/146 The proxy split name in this entry is already in use. The entry was not added.",
    "0/8/167 The pass-through subtrees 'O=A' and 'O=B' overlap. Each subtree may be passed to one "
    "server only.",
    "0/8/174 The pass-through entry 'CN=P' covers the reserved suffix 'CN=SCHEMA', which is never "
    "passed through.",
    "0/8/179 The value 'http://x' of orv-slapdPtaURL is not an LDAP URL.",
    "0/9/1 The entry 'CN=E' does not fit the schema: it has no object class.",
    "0/9/2 The entry 'CN=E' does not fit the schema: there is no object class 'A'.",
    "0/9/3 The entry 'CN=E' does not fit the schema: there is no attribute type 'A'.",
    "0/9/4 The entry 'CN=E' does not fit the schema: 'A' has more than one value.",
    "0/9/5 The entry 'CN=E' does not fit the schema: a value of 'A' B.",
    "0/9/6 The entry 'CN=E' does not fit the schema: its object classes do not allow 'A'.",
    "0/9/7 The entry 'CN=E' does not fit the schema: it has no structural object class.",
    "0/9/8 The entry 'CN=E' does not fit the schema: 'A' and 'B' are structural object classes of "
    "which neither derives from the other.",
    "0/9/9 The entry 'CN=E' does not fit the schema: its object classes demand 'A'.",
    "0/9/10 The entry 'CN=E' does not fit the schema: 'A' is a password and cannot be part of a "
    "name.",
    "0/9/11 The entry 'CN=E' does not fit the schema: its name has a value of 'A' that the entry "
    "lacks.",
    "0/10/1 A new password from 'CN=A' was refused: it is empty.",
    "0/10/2 A new password from 'CN=A' was refused: it has fewer than 7 characters.",
    "0/10/3 A new password from 'CN=A' was refused: it has fewer than 7 letters.",
    "0/10/4 A new password from 'CN=A' was refused: fewer than 7 of its characters are no "
    "letters.",
    "0/10/5 A new password from 'CN=A' was refused: one character occurs more than 7 times.",
    "0/10/6 A new password from 'CN=A' was refused: fewer than 7 different characters are new.",
    "0/10/7 A new password from 'CN=A' was refused: it is the old one.",
    "0/10/8 The password policy in the configuration file is not put in force: CN=A. The one "
    "before stays.",
    "0/10/9 The password method in the configuration file is not put in force: CN=A. The one "
    "before stays.",
    "0/10/10 'CN=A' is locked out after 7 failed binds."};

TEST_F(Messages, HaveBuiltInTextsWithoutACatalogue) {
  EXPECT_FALSE(open_message_catalogue("/nonexistent/orvd.cat"));
  print_all();
  EXPECT_EQ(g_messages, kBuiltInTexts);
}

TEST_F(Messages, OfTheInstalledCatalogueAreTheBuiltInOnes) {
  ASSERT_TRUE(open_message_catalogue(ORV_CATALOGUE));
  print_all();
  EXPECT_EQ(g_messages, kBuiltInTexts);
}

TEST_F(Messages, AreTakenFromTheCatalogueWithArgumentsInItsOrder) {
  ASSERT_TRUE(open_message_catalogue(ORV_TEST_DATA "/translated.cat"));
  print_all();
  g_messages.resize(5);
  EXPECT_THAT(g_messages,
              testing::ElementsAre("0/8/145 Der Name ist vergeben (100%).", kBuiltInTexts[1],
                                   "0/8/167 O=B liegt unter oder auf O=A.", kBuiltInTexts[3],
                                   "0/8/179 Keine LDAP-URL: http://x"));
}

TEST_F(Messages, OfACatalogueWithOtherConversionsAreNotUsed) {
  ASSERT_TRUE(open_message_catalogue(ORV_TEST_DATA "/damaged.cat"));
  print_all();
  EXPECT_EQ(g_messages, kBuiltInTexts);
}

TEST_F(Messages, AreFoundThroughTheEnvironment) {
  setenv("NLSPATH", ORV_TEST_DATA "/translated.cat", 1);
  EXPECT_TRUE(open_message_catalogue(nullptr));
  unsetenv("NLSPATH");
  PrintMessage(0, 8, 145);
  EXPECT_THAT(g_messages, testing::ElementsAre("0/8/145 Der Name ist vergeben (100%)."));
}

TEST_F(Messages, AreOneLineWhateverTheirArgumentsHold) {
  PrintMessage(0, 8, 179, "a\nforged\r\x7F %s\t");
  PrintMessage(0, 8, 179, nullptr);
  EXPECT_THAT(
      g_messages,
      testing::ElementsAre(
          "0/8/179 The value 'a\\0Aforged\\0D\\7F %s\\09' of orv-slapdPtaURL is not an LDAP URL.",
          "0/8/179 The value '(null)' of orv-slapdPtaURL is not an LDAP URL."));
}

TEST_F(Messages, ShowNoPasswordThatStandsInAnArgument) {
  ASSERT_EQ(cfg::register_attribute_types(builtin_schema().attribute_table()), 0);
  PrintMessage(0, 8, 179, "ldap://h/orv-slapdAdminPW=hidden\n, o=x??sub");
  PrintMessage(0, 8, 179, "ldap://h/orv-slapdAdminPW%3dhidden");
  PrintMessage(0, 8, 167, "ORV-SLAPDMASTERPW=HIDDEN", "OU=B,ORV-SLAPDMASTERPW=HIDDEN");
  EXPECT_THAT(
      g_messages,
      testing::ElementsAre(
          "0/8/179 The value 'ldap://h/orv-slapdAdminPW=********, o=x??sub' of orv-slapdPtaURL is "
          "not an LDAP URL.",
          "0/8/179 The value 'ldap://h/orv-slapdAdminPW%3d********' of orv-slapdPtaURL is not an "
          "LDAP URL.",
          "0/8/167 The pass-through subtrees 'ORV-SLAPDMASTERPW=********' and "
          "'OU=B,ORV-SLAPDMASTERPW=********' overlap. Each subtree may be passed to one server "
          "only."));
}

TEST_F(Messages, ThatAreTooLongAreCutAndSaySo) {
  const std::string url(100000, 'x');
  PrintMessage(0, 8, 179, url.c_str());
  ASSERT_EQ(g_messages.size(), 1U);
  EXPECT_LT(g_messages[0].size(), 10000U);
  EXPECT_THAT(g_messages[0], testing::EndsWith("x..."));
}

TEST_F(Messages, WithoutATextAreStillReported) {
  PrintMessage(3, 8, 999);
  EXPECT_THAT(g_messages, testing::ElementsAre("3/8/999 A message without a text."));
}

TEST_F(Messages, GoToStandardErrorUntilThereIsASink) {
  set_message_sink(nullptr);
  testing::internal::CaptureStderr();
  PrintMessage(0, 8, 145);
  EXPECT_EQ(testing::internal::GetCapturedStderr(),
            "8-145 The proxy split name in this change is already in use. The change was "
            "refused.\n");
}

TEST_F(Messages, AreWrittenByManyThreads) {
  ASSERT_TRUE(open_message_catalogue(ORV_TEST_DATA "/translated.cat"));
  std::vector<std::thread> threads;
  std::vector<std::size_t> good(8);
  for (std::size_t t = 0; t < good.size(); ++t)
    threads.emplace_back([&good, t] {
      const std::string dn = "O=" + std::to_string(t);
      for (int i = 0; i < 500; ++i) PrintMessage(0, 8, 167, dn.c_str(), "O=Z");
      for (const std::string& message : g_messages)
        good[t] += message == "0/8/167 O=Z liegt unter oder auf " + dn + ".";
    });
  for (std::thread& thread : threads) thread.join();
  EXPECT_THAT(good, testing::Each(500U));
}

TEST(DebugOutput, HasItsSwitchAndItsCategory) {
  EXPECT_FALSE(read_ldap_debug());
  set_ldap_debug(true);
  EXPECT_TRUE(read_ldap_debug());
  set_ldap_debug(false);
  const test::TemporaryDirectory directory;
  ASSERT_EQ(set_trace_file(directory.file("debug").c_str()), 0);
  PrintDebug(0xC8010000, "%d failed to trylock1 %s, waiting 0.1s\n", 5, "m");
  PrintDebug(0xC8010000, "no newline");
  ASSERT_EQ(set_trace_file(nullptr), 0);
  EXPECT_THAT(directory.read("debug"),
              testing::MatchesRegex("[^ ]+Z [0-9]+ debug C8010000 5 failed to trylock1 m, waiting "
                                    "0\\.1s\n[^ ]+Z [0-9]+ debug C8010000 no newline\n"));
}

}  // namespace
}  // namespace orv
