// Handles, options, error numbers and diagnostics.
#include "cfg/diagnostics.h"
#include "cfg_fixture.h"

namespace orv::cfg_test {
namespace {

class SessionTest : public CfgTest {};

constexpr const char* kSmall = "dn: cn=top\ncn: top\n";

TEST_F(SessionTest, TextOptionsAreCopiedAndReadBack) {
  const CfgSession session(cfg_init(nullptr, 0));
  const char* value = nullptr;
  EXPECT_EQ(cfg_get_option(session.get(), kCfgOptConfigFile, &value), 0);
  EXPECT_STREQ(value, "");
  for (const int option : {kCfgOptConfigFile, kCfgOptSaveFile, kCfgOptKeyStashFile}) {
    std::string text = "/path/" + std::to_string(option);
    EXPECT_EQ(cfg_set_option(session.get(), option, text.c_str()), 0);
    const std::string expected = text;
    text.assign(text.size(), 'x');
    EXPECT_EQ(cfg_get_option(session.get(), option, &value), 0);
    EXPECT_EQ(value, expected);
  }
  EXPECT_EQ(cfg_set_option(session.get(), kCfgOptSaveFile, static_cast<const char*>(nullptr)), 0);
  EXPECT_EQ(cfg_get_option(session.get(), kCfgOptSaveFile, &value), 0);
  EXPECT_STREQ(value, "");
}

TEST_F(SessionTest, UnknownOptionsAndWrongTypesAreRefused) {
  const CfgSession session(cfg_init(nullptr, 0));
  const char* value = nullptr;
  EXPECT_EQ(cfg_set_option(session.get(), 4711, "x"), 1);
  EXPECT_EQ(cfg_get_errno(session.get()), 1);
  EXPECT_EQ(cfg_set_option(session.get(), kCfgOptDiagnostics, "x"), 1);
  EXPECT_EQ(cfg_set_option(session.get(), kCfgOptConfigFile, 1), 1);
  EXPECT_EQ(cfg_set_option(session.get(), kCfgOptDiagnostics, 1), 0);
  EXPECT_EQ(cfg_get_errno(session.get()), 0);
  EXPECT_EQ(cfg_get_option(session.get(), kCfgOptDiagnostics, &value), 1);
  EXPECT_STREQ(value, "");
  EXPECT_EQ(cfg_get_option(session.get(), kCfgOptConfigFile, nullptr), 1);
}

TEST_F(SessionTest, EverythingAcceptsNull) {
  _CFGMessage* chain = reinterpret_cast<_CFGMessage*>(&chain);
  _CFGBer* cursor = reinterpret_cast<_CFGBer*>(&cursor);
  const char* value = nullptr;
  EXPECT_EQ(cfg_set_option(nullptr, kCfgOptConfigFile, "x"), 1);
  EXPECT_EQ(cfg_set_option(nullptr, kCfgOptDiagnostics, 1), 1);
  EXPECT_EQ(cfg_get_option(nullptr, kCfgOptConfigFile, &value), 1);
  EXPECT_EQ(cfg_bind_s(nullptr, nullptr, nullptr, 128), 1);
  EXPECT_EQ(cfg_unbind(nullptr), 0);
  EXPECT_STREQ(cfg_dump_exception(nullptr), "");
  EXPECT_EQ(cfg_search_s(nullptr, "", 0, nullptr, nullptr, 0, &chain), 1);
  EXPECT_EQ(chain, nullptr);
  EXPECT_EQ(cfg_count_entries(nullptr, nullptr), 0);
  EXPECT_EQ(cfg_first_entry(nullptr, nullptr), nullptr);
  EXPECT_EQ(cfg_next_entry(nullptr, nullptr), nullptr);
  EXPECT_EQ(cfg_get_dn(nullptr, nullptr), nullptr);
  EXPECT_EQ(cfg_first_attribute(nullptr, nullptr, &cursor), nullptr);
  EXPECT_EQ(cursor, nullptr);
  EXPECT_EQ(cfg_first_attribute(nullptr, nullptr, nullptr), nullptr);
  EXPECT_EQ(cfg_next_attribute(nullptr, nullptr, nullptr), nullptr);
  EXPECT_EQ(cfg_get_values(nullptr, nullptr, nullptr), nullptr);
  cfg_value_free(nullptr);
  cfg_memfree(nullptr);
  cfg_ber_free(nullptr);
  EXPECT_EQ(cfg_msgfree(nullptr), 0);
  cfg_msg_unlink(nullptr, nullptr);
  EXPECT_EQ(cfg_get_errno(nullptr), 1);
  cfg::set_diagnostics_sink([](const char*) noexcept {});
  cfg_perror(nullptr, nullptr);
  cfg::set_diagnostics_sink(nullptr);
}

TEST_F(SessionTest, AnUnboundHandleAnswersOne) {
  const CfgSession session(cfg_init(nullptr, 0));
  EXPECT_EQ(search_code(session, "cn=top", 0, nullptr), 1);
  EXPECT_EQ(cfg_count_entries(session.get(), nullptr), 0);
  EXPECT_EQ(cfg_get_dn(session.get(), nullptr), nullptr);
  EXPECT_EQ(cfg_get_errno(session.get()), 1);
}

TEST_F(SessionTest, AFailedHandleServesOptionsDumpAndASecondBind) {
  write_file(path_, "broken\n");
  const CfgSession session = unbound();
  EXPECT_EQ(cfg_bind_s(session.get(), nullptr, nullptr, 128), 1);
  EXPECT_EQ(cfg_set_option(session.get(), kCfgOptDiagnostics, 1), 0);
  EXPECT_EQ(cfg_set_option(session.get(), kCfgOptDiagnosticsFile, 1), 0);
  const char* value = nullptr;
  EXPECT_EQ(cfg_get_option(session.get(), kCfgOptConfigFile, &value), 0);
  EXPECT_EQ(value, path_);
  EXPECT_NE(std::string(cfg_dump_exception(session.get())).find("line 1"), std::string::npos);
  EXPECT_EQ(search_code(session, "cn=top", 0, nullptr), 1);
  write_file(path_, kSmall);
  EXPECT_EQ(cfg_bind_s(session.get(), nullptr, nullptr, 128), 0);
  EXPECT_STREQ(cfg_dump_exception(session.get()), "");
  EXPECT_EQ(search_code(session, "cn=top", 0, nullptr), 0);
}

TEST_F(SessionTest, DiagnosticsSwitchesLeaveOutPositionAndDetails) {
  write_file(path_, "broken\n");
  const CfgSession session = unbound();
  EXPECT_STREQ(cfg_dump_exception(session.get()), "");
  EXPECT_EQ(cfg_bind_s(session.get(), nullptr, nullptr, 128), 1);
  cfg_set_option(session.get(), kCfgOptDiagnosticsFile, 0);
  const std::string without_position = cfg_dump_exception(session.get());
  EXPECT_EQ(without_position.find(path_), std::string::npos);
  EXPECT_EQ(without_position.find("line 1"), std::string::npos);
  EXPECT_NE(without_position, "");
  cfg_set_option(session.get(), kCfgOptDiagnostics, 0);
  EXPECT_STREQ(cfg_dump_exception(session.get()), "the configuration could not be opened");
}

TEST_F(SessionTest, ABoundSessionRefusesASecondBindAndNewPathsAndStaysGood) {
  const CfgSession session = open(kSmall);
  EXPECT_EQ(cfg_bind_s(session.get(), nullptr, nullptr, 128), 1);
  EXPECT_EQ(cfg_set_option(session.get(), kCfgOptConfigFile, "/other"), 1);
  EXPECT_EQ(search(session, "cn=top", 0, nullptr).size(), 1U);
}

std::string reported;

TEST_F(SessionTest, PerrorWritesTextAndReasonToTheSink) {
  cfg::set_diagnostics_sink([](const char* line) noexcept { reported = line; });
  const CfgSession session = open(kSmall);
  search_code(session, "cn=none", 0, nullptr);
  cfg_perror(session.get(), "cfg_search_s");
  EXPECT_EQ(reported, "cfg_search_s: no such entry");
  EXPECT_EQ(cfg_get_errno(session.get()), 32);
  cfg_perror(session.get(), nullptr);
  EXPECT_EQ(reported, "no such entry");
  cfg_perror(session.get(), std::string(2000, 'x').c_str());
  EXPECT_LT(reported.size(), 512U);
  cfg::set_diagnostics_sink(nullptr);
}

TEST_F(SessionTest, PerrorHasWordsForTheCodesOfTheLibrary) {
  cfg::set_diagnostics_sink([](const char* line) noexcept { reported = line; });
  const CfgSession session = open("dn: cn=top\ncn: top\n\ndn: cn=a,cn=top\ncn: a\n");
  const auto said = [&](int rc, int code) {
    EXPECT_EQ(rc, code);
    cfg_perror(session.get(), nullptr);
    return reported;
  };
  char type[] = "cn";
  char value[] = "a";
  char empty[] = "";
  char* values[] = {value, nullptr};
  const auto change = [&](int operation, const char* dn, bool adds = false) {
    ldapmod mod{operation, type, {values}, nullptr};
    ldapmod* mods[] = {&mod, nullptr};
    return adds ? cfg_add_s(session.get(), dn, mods) : cfg_modify_s(session.get(), dn, mods);
  };
  _CFGMessage* chain = nullptr;
  EXPECT_EQ(said(cfg_set_option(session.get(), 4711, 1), 1), "operations error");
  EXPECT_EQ(said(cfg_search_s(session.get(), "cn=top", 0, "(", nullptr, 0, &chain), 2),
            "the request cannot be read");
  EXPECT_EQ(said(change(kModAdd, "cn=none"), 9), "no such entry, or no parent for it");
  EXPECT_EQ(said(change(kModDelete, "cn=top"), 16), "no such attribute");
  EXPECT_EQ(said(change(kModAdd, "cn=a,cn=top"), 20), "the value exists already");
  EXPECT_EQ(said(cfg_delete_s(session.get(), "cn=top"), 66), "the entry has children");
  EXPECT_EQ(said(change(kModAdd, "cn=a,cn=top", true), 68), "the entry exists already");
  EXPECT_EQ(said(change(kModAdd, "no dn"), 34), "not a DN");
  EXPECT_EQ(said(change(kModReplace, "cn=a,cn=top"), 0), "success");
  type[0] = '-';
  EXPECT_EQ(said(change(kModAdd, "cn=a,cn=top"), 17), "failed");
  write_file(path_, "dn: cn=top\ncn: edited\n");
  type[0] = 'c';
  values[0] = empty;
  EXPECT_EQ(said(change(kModAdd, "cn=a,cn=top"), 51), "busy");
  cfg::set_diagnostics_sink(nullptr);
}

}  // namespace
}  // namespace orv::cfg_test
