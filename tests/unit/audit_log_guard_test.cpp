// The audit log's file is nobody else's: paths, the file's name in the settings, the guard.
#include <algorithm>
#include <cerrno>

#include "backend_test.h"
#include "config_modify.h"

namespace orv {
namespace {

constexpr const char* kAudit = "CN=AUDIT,CN=LOG MANAGEMENT,CN=CONFIGURATION";
constexpr const char* kOtherLog = "CN=DEFAULT,CN=LOG MANAGEMENT,CN=CONFIGURATION";
constexpr const char* kDefaultFile = "/var/ldap/V6.0/audit.log";

class AuditLogTest : public BackendTest {
 protected:
  AuditLogTest() { open_session(); }
  void TearDown() override {
    close_session();
    BackendTest::TearDown();
  }

  // What the audit log's entry says.
  void audit_entry(const std::vector<scripted::ScriptedAttribute>& attributes) {
    platform.file[kAudit] = {{{kAudit, attributes}}};
  }

  // A line whose place in the source is any.
  void expect_allocation_line(const DebugLine& line, const std::string& function) {
    EXPECT_EQ(line.category, 0xC8110000U);
    EXPECT_THAT(line.text, testing::MatchesRegex("Error - " + function +
                                                 ": allocation failed in file "
                                                 "back-config/config_modify.cpp near line "
                                                 "[0-9]+\n"));
  }
};

// ---- resolve_path

class ResolvedPath : public AuditLogTest {
 protected:
  // What becomes of a path; "NULL" for nothing.
  std::string resolved(const char* path) {
    const Freed result(platform.run([&] { return resolve_path(path); }));
    return result.text == nullptr ? "NULL" : result.text;
  }
};

TEST_F(ResolvedPath, IsWhatTheSystemMakesOfIt) {
  platform.real_paths["/logs/../log/audit"] = "/log/audit";
  EXPECT_EQ(resolved("/logs/../log/audit"), "/log/audit");
  EXPECT_THAT(platform.calls({"realpath"}), ElementsAre("realpath(\"/logs/../log/audit\")"));
  EXPECT_THAT(platform.debug_lines(),
              ElementsAre(detail("resolve_path: input file=[/logs/../log/audit] resolved "
                                 "file=[/log/audit]\n")));
}

TEST_F(ResolvedPath, OfAFileThatDoesNotExistYetIsItsNameAsGiven) {
  EXPECT_EQ(resolved("/x/../y"), "/x/../y");
  EXPECT_THAT(platform.debug_lines(),
              ElementsAre(detail("resolve_path: file name=[/x/../y] errno=2\n"),
                          detail("resolve_path: input file=[/x/../y] resolved file=[/x/../y]\n")));
}

TEST_F(ResolvedPath, IsNoneForEveryOtherReason) {
  for (const int reason : {EACCES, ELOOP, ENOTDIR, ENAMETOOLONG, EIO}) {
    platform.forget();
    platform.path_errors["/x"] = reason;
    EXPECT_EQ(resolved("/x"), "NULL");
    EXPECT_THAT(
        platform.debug_lines(),
        ElementsAre(error("Error - resolve_path: realpath failed for file name=[/x] errno=" +
                          std::to_string(reason) + "\n"),
                    detail("resolve_path: input file=[/x] resolved file=[NULL]\n")));
  }
}

TEST_F(ResolvedPath, IsNoneForNone) {
  EXPECT_EQ(resolved(nullptr), "NULL");
  EXPECT_EQ(platform.count("realpath"), 0);
  EXPECT_THAT(platform.debug_lines(),
              ElementsAre(error("Error - resolve_path: input filespec is NULL\n"),
                          detail("resolve_path: input file=[NULL] resolved file=[NULL]\n")));
}

TEST_F(ResolvedPath, WithoutMemoryIsNone) {
  platform.fail_allocation(1);
  EXPECT_EQ(resolved("/x"), "NULL");
  EXPECT_EQ(platform.count("realpath"), 0);
  ASSERT_EQ(platform.debug_lines().size(), 2U);
  expect_allocation_line(platform.debug_lines()[0], "resolve_path");
  EXPECT_EQ(platform.debug_lines()[1],
            detail("resolve_path: input file=[/x] resolved file=[NULL]\n"));
}

TEST_F(ResolvedPath, OfAMissingFileEndsWithItsBuffer) {
  const std::string path = "/" + std::string(5000, 'x');
  EXPECT_EQ(resolved(path.c_str()), path.substr(0, 4095));
}

TEST_F(ResolvedPath, BeginsWithABufferOfZerosForTheSystem) {
  platform.real_paths["/x"] = "/y";
  const Freed result(platform.run([&] { return resolve_path("/x"); }));
  ASSERT_NE(result.text, nullptr);
  EXPECT_THAT(platform.sizes, ElementsAre(4096U));
  EXPECT_EQ(std::count(result.text, result.text + 4096, '\0'), 4096 - 2);
}

TEST_F(ResolvedPath, ReleasesItsBufferBeforeItSaysThatThereIsNone) {
  platform.path_errors["/x"] = EACCES;
  platform.name_allocation(1, "buffer");
  EXPECT_EQ(resolved("/x"), "NULL");
  EXPECT_THAT(platform.story({"free"}),
              ElementsAre(testing::HasSubstr("realpath failed"), "free(buffer)",
                          testing::HasSubstr("resolved file=[NULL]")));
}

TEST_F(ResolvedPath, IsTheSameWithoutTheTrace) {
  debug_off();
  platform.real_paths["/x"] = "/y";
  platform.path_errors["/z"] = EACCES;
  EXPECT_EQ(resolved("/x"), "/y");
  EXPECT_EQ(resolved("/missing"), "/missing");
  EXPECT_EQ(resolved("/z"), "NULL");
  EXPECT_EQ(resolved(nullptr), "NULL");
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
}

TEST_F(ResolvedPath, LeavesAnExitRecord) {
  trcEvents = kTraceExit;
  resolved("/x");
  EXPECT_THAT(platform.records(), ElementsAre("entry 01030f00 ", "exit 01030f00 0"));
}

// ---- get_audit_log_filename

class AuditLogFile : public AuditLogTest {
 protected:
  const DebugLine search_line = detail(
      "get_audit_log_filename: base search dn=[CN=AUDIT,CN=LOG MANAGEMENT,CN=CONFIGURATION] "
      "filter=[(objectclass=orv-auditConfig)] for attribute=[orv-slapdLog]\n");

  // The name that the settings give; "NULL" for none. Its exit record carries `rc`.
  std::string file_name(int rc = 0) {
    const std::uint32_t before = trcEvents;
    trcEvents = before | (kTraceExit & ~kTraceEntry);
    const Freed result(
        platform.run([&] { return get_audit_log_filename(connection.config_session); }));
    trcEvents = before;
    EXPECT_EQ(last_record(), "exit 01031000 " + std::to_string(rc));
    return result.text == nullptr ? "NULL" : result.text;
  }

  static DebugLine not_read(int rc) {
    return error("Error - get_audit_log_filename: unable to retrieve attributes rc=" +
                 std::to_string(rc) + "\n");
  }
};

TEST_F(AuditLogFile, IsTheFirstValueOfTheEntrysOnlyAttribute) {
  audit_entry({{"orv-slapdLog", {"/log/audit", "/log/second"}}});
  EXPECT_EQ(file_name(), "/log/audit");
  EXPECT_THAT(
      platform.calls({"cfg_search_s", "cfg_first_entry", "cfg_first_attribute", "cfg_get_values",
                      "slapi_ch_strdup", "cfg_memfree", "cfg_ber_free", "cfg_msgfree",
                      "cfg_value_free", "cfg_next_attribute", "cfg_perror"}),
      ElementsAre("cfg_search_s(session, \"CN=AUDIT,CN=LOG MANAGEMENT,CN=CONFIGURATION\", 0, "
                  "\"(objectclass=orv-auditConfig)\", [orv-slapdLog], 0)",
                  "cfg_first_entry(session, chain)", "cfg_first_attribute(session, record 1)",
                  "cfg_get_values(session, record 1, \"orv-slapdLog\")",
                  "slapi_ch_strdup(\"/log/audit\")", "cfg_memfree(\"orv-slapdLog\")",
                  "cfg_ber_free(cursor)", "cfg_msgfree(chain)"));
  EXPECT_THAT(platform.debug_lines(), ElementsAre(search_line));
}

TEST_F(AuditLogFile, IsKnownByTheAttributesNameInAnyLetterCase) {
  audit_entry({{"ORV-slapdlog", {"/log/audit"}}});
  EXPECT_EQ(file_name(), "/log/audit");
}

TEST_F(AuditLogFile, IsNoneWithoutASession) {
  const Freed result(platform.run([&] { return get_audit_log_filename(nullptr); }));
  EXPECT_EQ(result.text, nullptr);
  EXPECT_EQ(platform.count("cfg_search_s"), 0);
  EXPECT_THAT(
      platform.debug_lines(),
      ElementsAre(error("Error - get_audit_log_filename: invalid configuration session handel\n")));
}

TEST_F(AuditLogFile, OfAMissingEntryIsNoneAndTold) {
  EXPECT_EQ(file_name(32), "NULL");
  EXPECT_THAT(platform.story({"cfg_perror", "cfg_msgfree"}),
              ElementsAre("debug: " + search_line.text,
                          "debug: Error - get_audit_log_filename: missing entry for "
                          "DN=CN=AUDIT,CN=LOG MANAGEMENT,CN=CONFIGURATION\n",
                          "cfg_perror(session, null)", "debug: " + not_read(32).text));
  EXPECT_EQ(platform.debug_lines()[1].category, 0xC8110000U);
  EXPECT_EQ(platform.debug_lines()[2], not_read(32));
}

TEST_F(AuditLogFile, OfASearchThatFailedIsNoneAlsoWhenItFoundSomething) {
  platform.file[kAudit] = {{{kAudit, {{"orv-slapdLog", {"/log/audit"}}}}}, 3};
  EXPECT_EQ(file_name(3), "NULL");
  EXPECT_EQ(platform.debug_lines().back(), not_read(3));
  EXPECT_EQ(platform.count("cfg_first_entry"), 0);
}

TEST_F(AuditLogFile, OfAnEntryOfAnotherClassIsNoneWithoutAnError) {
  platform.file[kAudit] = {};
  EXPECT_EQ(file_name(), "NULL");
  EXPECT_THAT(platform.debug_lines(), ElementsAre(search_line));
  EXPECT_EQ(platform.count("cfg_perror"), 0);
  EXPECT_EQ(platform.count("cfg_first_attribute"), 0);
}

TEST_F(AuditLogFile, OfNoEntryIsNoneWithoutAnErrorWhateverTheErrorNumber) {
  audit_entry({{"orv-slapdLog", {"/log/audit"}}});
  platform.fail("cfg_first_entry", 1, 7);
  EXPECT_EQ(file_name(), "NULL");
  EXPECT_THAT(platform.debug_lines(), ElementsAre(search_line));
  EXPECT_EQ(platform.count("cfg_perror"), 0);
  EXPECT_EQ(platform.count("cfg_first_attribute"), 0);
}

TEST_F(AuditLogFile, OfAnAttributeThatCannotBeReachedIsNoneAndTold) {
  audit_entry({{"orv-slapdLog", {"/log/audit"}}});
  platform.fail("cfg_get_errno", 1, 7);  // the name is there nevertheless, and released
  EXPECT_EQ(file_name(7), "NULL");
  EXPECT_THAT(
      platform.debug_lines(),
      ElementsAre(search_line,
                  error("Error - get_audit_log_filename: failed to retrieve attribute, rc=7\n"),
                  not_read(7)));
  EXPECT_EQ(platform.count("cfg_get_values"), 0);
}

TEST_F(AuditLogFile, OfValuesThatCannotBeReadIsNoneAndToldAfterEverythingIsReleased) {
  audit_entry({{"orv-slapdLog", {"/log/audit"}}});
  platform.fail("cfg_get_errno", 2, 8);
  EXPECT_EQ(file_name(8), "NULL");
  EXPECT_THAT(platform.debug_lines(),
              ElementsAre(search_line,
                          error("Error - get_audit_log_filename: failed to retrieve values for "
                                "orv-slapdLog, rc=8\n"),
                          not_read(8)));
  EXPECT_THAT(platform.calls({"cfg_memfree", "cfg_ber_free", "cfg_msgfree", "cfg_perror"}),
              ElementsAre("cfg_memfree(\"orv-slapdLog\")", "cfg_ber_free(cursor)",
                          "cfg_msgfree(chain)", "cfg_perror(session, null)"));
}

TEST_F(AuditLogFile, OfWhatTheLibraryDoesNotGiveIsNoneAndTold) {
  audit_entry({{"orv-slapdLog", {"/log/audit"}}});
  platform.fail("cfg_first_attribute", 1, 7);
  EXPECT_EQ(file_name(7), "NULL");
  EXPECT_THAT(
      platform.debug_lines(),
      ElementsAre(search_line,
                  error("Error - get_audit_log_filename: failed to retrieve attribute, rc=7\n"),
                  not_read(7)));
  EXPECT_EQ(platform.count("cfg_get_values"), 0);
  EXPECT_EQ(platform.count("cfg_perror"), 1);
  platform.forget();
  platform.fail("cfg_get_values", 1, 8);
  EXPECT_EQ(file_name(8), "NULL");
  EXPECT_THAT(platform.debug_lines(),
              ElementsAre(search_line,
                          error("Error - get_audit_log_filename: failed to retrieve values for "
                                "orv-slapdLog, rc=8\n"),
                          not_read(8)));
  EXPECT_EQ(platform.count("cfg_perror"), 1);
}

TEST_F(AuditLogFile, IsLookedForInTheFirstAttributeOnly) {
  audit_entry({{"cn", {"audit"}}, {"orv-slapdLog", {"/log/audit"}}});
  EXPECT_EQ(file_name(), "NULL");
  EXPECT_THAT(platform.debug_lines(), ElementsAre(search_line));
  EXPECT_EQ(platform.count("cfg_next_attribute"), 0);
}

TEST_F(AuditLogFile, OfNoAttributeNoArrayAndNoValueIsNoneWithoutAnError) {
  audit_entry({});
  EXPECT_EQ(file_name(), "NULL");
  audit_entry({{"orv-slapdLog", {}}});
  EXPECT_EQ(file_name(), "NULL");
  audit_entry({{"orv-slapdLog", {"/log/audit"}}});
  platform.fail("cfg_get_values", 2, 0);
  EXPECT_EQ(file_name(), "NULL");
  EXPECT_EQ(platform.count("cfg_perror"), 0);
}

TEST_F(AuditLogFile, ThatCannotBeCopiedIsNoneAndTold) {
  audit_entry({{"orv-slapdLog", {"/log/audit"}}});
  platform.fail("slapi_ch_strdup", 1, 0);
  EXPECT_EQ(file_name(90), "NULL");
  ASSERT_EQ(platform.debug_lines().size(), 3U);
  expect_allocation_line(platform.debug_lines()[1], "get_audit_log_filename");
  EXPECT_EQ(platform.debug_lines()[2], not_read(90));
  EXPECT_EQ(platform.count("cfg_perror"), 1);
}

TEST_F(AuditLogFile, GivesUpWhatItReadInTheReverseOrderOfItsReading) {
  audit_entry({{"orv-slapdLog", {"/log/audit", "/log/second"}}});
  const auto left_at = [&](const char* function, const std::vector<std::string>& words) {
    platform.at(function, 1, [&, words] {
      std::vector<std::string> left = platform.leaks();
      left.erase(std::remove(left.begin(), left.end(), "session"), left.end());
      EXPECT_THAT(left, testing::UnorderedElementsAreArray(words));
    });
  };
  left_at("cfg_memfree", {"text", "cfg_text", "cursor", "chain", "record"});  // no values
  left_at("cfg_ber_free", {"text", "cursor", "chain", "record"});
  left_at("cfg_msgfree", {"text", "chain", "record"});
  EXPECT_EQ(file_name(), "/log/audit");
  EXPECT_EQ(platform.count("cfg_msgfree"), 1);
}

TEST_F(AuditLogFile, IsReadAndReportedTheSameWayWithoutTheTrace) {
  debug_off();
  EXPECT_EQ(file_name(32), "NULL");
  audit_entry({{"orv-slapdLog", {"/log/audit"}}});
  EXPECT_EQ(file_name(), "/log/audit");
  EXPECT_EQ(platform.count("cfg_perror"), 1);
  for (const int nth : {1, 2}) {
    platform.forget();
    platform.fail("cfg_get_errno", nth, 7);
    EXPECT_EQ(file_name(7), "NULL");
    EXPECT_EQ(platform.count("cfg_perror"), 1);
  }
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
}

TEST_F(AuditLogFile, LeavesAnExitRecord) {
  trcEvents = kTraceExit;
  file_name(32);
  EXPECT_EQ(platform.records().front(), "entry 01031000 ");
}

// ---- checkAuditLog

class AuditLogGuard : public AuditLogTest {
 protected:
  AuditLogGuard() {
    audit_entry({{"orv-slapdLog", {"/log/audit"}}});
    exists("/log/audit");
  }

  void exists(const std::string& path) { platform.real_paths[path] = path; }

  int check(const char* dn, const std::vector<scripted::ScriptedModification>& list) {
    ldapmod* const mods = scripted::make_modifications(list);
    const int rc =
        traced(0x01031100, [&] { return checkAuditLog(connection.config_session, dn, mods); });
    free_ldmll(mods);
    return rc;
  }
  int log_to(const std::string& path, int code = kReplace) {
    return check(kOtherLog, {{code, "orv-slapdLog", {{path}}}});
  }
};

TEST_F(AuditLogGuard, RefusesTheFileOfTheAuditLogWith53AndSaysSo) {
  EXPECT_EQ(log_to("/log/audit"), 53);
  EXPECT_THAT(
      platform.debug_lines(),
      Contains(error("Error - checkAuditLog: audit log filename /log/audit cannot be used as a "
                     "value for orv-slapdLog\n")));
  EXPECT_THAT(platform.debug_lines(),
              Contains(detail("checkAuditLog: audit log filename=[/log/audit] value=[/log/audit] "
                              "for attr=orv-slapdLog\n")));
}

TEST_F(AuditLogGuard, LetsEveryOtherFilePass) {
  exists("/log/other");
  EXPECT_EQ(log_to("/log/other"), 0);
  EXPECT_EQ(platform.debug_lines().back(),
            detail("checkAuditLog: audit log filename=[/log/audit] value=[/log/other] for "
                   "attr=orv-slapdLog\n"));
}

TEST_F(AuditLogGuard, SeesThroughLinksAndRelativePartsOnBothSides) {
  platform.real_paths["/link"] = "/log/audit";
  EXPECT_EQ(log_to("/link"), 53);
  audit_entry({{"orv-slapdLog", {"/link"}}});
  EXPECT_EQ(log_to("/log/audit"), 53);
  EXPECT_EQ(log_to("/link"), 53);
}

TEST_F(AuditLogGuard, SeesThroughTwoDotsInTheNameOfAFileThatExists) {
  platform.real_paths["/log/old/../audit"] = "/log/audit";
  EXPECT_EQ(log_to("/log/old/../audit"), 53);
}

TEST_F(AuditLogGuard, SaysTheResolvedNameAndTheTypeAsItWasSpelled) {
  platform.real_paths["/link"] = "/log/Audit";
  platform.real_paths["/second/link"] = "/log/audit";
  audit_entry({{"orv-slapdLog", {"/link"}}});
  EXPECT_EQ(check(kOtherLog, {{kReplace, "ORV-slapdLog", {{"/second/link"}}}}), 53);
  const auto lines = platform.debug_lines();
  ASSERT_GT(lines.size(), 2U);
  EXPECT_THAT(std::vector<DebugLine>(lines.end() - 2, lines.end()),
              ElementsAre(detail("checkAuditLog: audit log filename=[/log/Audit] "
                                 "value=[/log/audit] for attr=ORV-slapdLog\n"),
                          error("Error - checkAuditLog: audit log filename /log/Audit cannot be "
                                "used as a value for ORV-slapdLog\n")));
}

TEST_F(AuditLogGuard, ComparesFilesThatDoNotExistByTheirLiteralNames) {
  platform.real_paths.clear();
  EXPECT_EQ(log_to("/log/audit"), 53);
  EXPECT_EQ(log_to("/log/../log/audit"), 0);
}

TEST_F(AuditLogGuard, TakesNamesThatDifferInLetterCaseForOneFile) {
  exists("/LOG/Audit");
  EXPECT_EQ(log_to("/LOG/Audit"), 53);
}

TEST_F(AuditLogGuard, LetsAPathThatIsNoFilePass) {
  platform.path_errors["/log/audit/."] = ENOTDIR;
  EXPECT_EQ(log_to("/log/audit/."), 0);
}

TEST_F(AuditLogGuard, ProtectsTheDefaultFileWhereTheSettingsNameNone) {
  platform.file.erase(kAudit);
  EXPECT_EQ(log_to(kDefaultFile), 53);
  EXPECT_EQ(platform.calls({"realpath"}).front(), "realpath(\"/var/ldap/V6.0/audit.log\")");
  EXPECT_EQ(log_to("/log/audit"), 0);
  audit_entry({{"orv-slapdLog", {}}});
  EXPECT_EQ(log_to(kDefaultFile), 53);
}

TEST_F(AuditLogGuard, ProtectsTheDefaultFileWhereTheSettingsCannotBeRead) {
  const std::pair<const char*, int> failures[] = {
      {"cfg_search_s", 1},   {"cfg_first_entry", 1}, {"cfg_first_attribute", 1},
      {"cfg_get_errno", 1},  {"cfg_get_errno", 2},   {"cfg_get_values", 1},
      {"slapi_ch_strdup", 1}};
  for (const auto& [function, nth] : failures) {
    for (const auto& [path, expected] : {std::pair{kDefaultFile, 53}, std::pair{"/log/audit", 0}}) {
      platform.forget();
      platform.fail(function, nth, 7);
      EXPECT_EQ(log_to(path), expected) << function << nth << path;
    }
  }
}

TEST_F(AuditLogGuard, LooksAtAddsAndReplacesOnly) {
  for (const int code :
       {kAdd, kReplace, static_cast<int>(kModAdd), static_cast<int>(kModReplace)}) {
    EXPECT_EQ(log_to("/log/audit", code), 53) << code;
  }
  for (const int code : {kDelete, static_cast<int>(kModDelete), 3, 0x83}) {
    platform.forget();
    EXPECT_EQ(log_to("/log/audit", code), 0) << code;
    EXPECT_EQ(platform.count("realpath"), 1) << code;  // of the audit log itself
  }
}

TEST_F(AuditLogGuard, LooksAtTheLogAttributeInAnyLetterCaseAndAtNoOther) {
  EXPECT_EQ(check(kOtherLog, {{kAdd, "ORV-SLAPDLOG", {{"/log/audit"}}}}), 53);
  EXPECT_EQ(check(kOtherLog, {{kAdd, "orv-slapdLogs", {{"/log/audit"}}}}), 0);
}

TEST_F(AuditLogGuard, PassesOverAModificationWithoutAType) {
  ldapmod nameless{};
  nameless.mod_op = kModAdd;
  EXPECT_EQ(traced(0x01031100,
                   [&] { return checkAuditLog(connection.config_session, kOtherLog, &nameless); }),
            0);
}

TEST_F(AuditLogGuard, LooksAtTheFirstValueOnly) {
  EXPECT_EQ(check(kOtherLog, {{kAdd, "orv-slapdLog", {{"/log/other", "/log/audit"}}}}), 0);
  EXPECT_EQ(check(kOtherLog, {{kAdd, "orv-slapdLog", {{"/log/audit", "/log/other"}}}}), 53);
}

TEST_F(AuditLogGuard, HasNothingToCompareWhereThereIsNoValue) {
  for (const int code : {kReplace, static_cast<int>(kModReplace)}) {
    platform.forget();
    EXPECT_EQ(check(kOtherLog, {{code, "orv-slapdLog", std::nullopt}}), 0);
    EXPECT_EQ(check(kOtherLog, {{code, "orv-slapdLog", {{}}}}), 0);
    EXPECT_EQ(platform.count("realpath"), 2);
    EXPECT_THAT(platform.debug_lines(),
                Not(Contains(error("Error - resolve_path: input filespec is NULL\n"))));
  }
}

TEST_F(AuditLogGuard, WalksToTheEndAlsoAfterARefusal) {
  exists("/log/other");
  EXPECT_EQ(check(kOtherLog, {{kAdd, "orv-slapdLog", {{"/log/audit"}}},
                              {kAdd, "cn", {{"x"}}},
                              {kAdd, "orv-slapdLog", {{"/log/other"}}}}),
            53);
  EXPECT_THAT(platform.calls({"realpath"}),
              ElementsAre("realpath(\"/log/audit\")", "realpath(\"/log/audit\")",
                          "realpath(\"/log/other\")"));
}

TEST_F(AuditLogGuard, LetsTheAuditLogChangeItsOwnFileWithoutALook) {
  EXPECT_EQ(check(kAudit, {{kReplace, "orv-slapdLog", {{"/log/audit"}}}}), 0);
  EXPECT_EQ(check(kAudit, {}), 0);  // asked before the list
  EXPECT_EQ(platform.count("cfg_search_s"), 0);
  EXPECT_EQ(platform.debug_lines().front(),
            detail("checkAuditLog: No check made for changes to entry "
                   "DN=CN=AUDIT,CN=LOG MANAGEMENT,CN=CONFIGURATION\n"));
}

TEST_F(AuditLogGuard, ExaminesTheAuditLogUnderAnyOtherSpelling) {
  EXPECT_EQ(check("CN=Audit,CN=LOG MANAGEMENT,CN=CONFIGURATION",
                  {{kReplace, "orv-slapdLog", {{"/log/audit"}}}}),
            53);
}

TEST_F(AuditLogGuard, ExaminesWhateverOnlyContainsTheAuditLogsName) {
  for (const std::string& dn : {std::string("CN=X,") + kAudit, kAudit + std::string(",O=X")}) {
    EXPECT_EQ(check(dn.c_str(), {{kReplace, "orv-slapdLog", {{"/log/audit"}}}}), 53) << dn;
  }
}

TEST_F(AuditLogGuard, MissingArgumentsGive80WithALineOfTheirOwn) {
  EXPECT_EQ(check(nullptr, {{kAdd, "cn", {{"x"}}}}), 80);
  EXPECT_THAT(platform.debug_lines(), ElementsAre(error("Error - checkAuditLog: invalid dn\n")));
  platform.forget();
  EXPECT_EQ(check(kOtherLog, {}), 80);
  EXPECT_THAT(platform.debug_lines(), ElementsAre(error("Error - checkAuditLog: invalid mods\n")));
  EXPECT_EQ(platform.count("cfg_search_s"), 0);
}

TEST_F(AuditLogGuard, WithoutASessionProtectsTheDefaultFile) {
  ldapmod* const mods = scripted::make_modifications({{kAdd, "orv-slapdLog", {{kDefaultFile}}}});
  EXPECT_EQ(traced(0x01031100, [&] { return checkAuditLog(nullptr, kOtherLog, mods); }), 53);
  free_ldmll(mods);
}

TEST_F(AuditLogGuard, AuditLogThatDoesNotResolveGives80) {
  platform.path_errors["/log/audit"] = EACCES;
  EXPECT_EQ(log_to("/log/other"), 80);
  EXPECT_EQ(platform.debug_lines().back(),
            error("Error - checkAuditLog: invalid audit log filename\n"));
}

TEST_F(AuditLogGuard, DefaultThatCannotBeCopiedGives90) {
  platform.file.erase(kAudit);
  platform.fail("slapi_ch_strdup", 1, 0);
  EXPECT_EQ(log_to("/log/other"), 90);
  expect_allocation_line(platform.debug_lines().back(), "checkAuditLog");
  EXPECT_EQ(platform.count("realpath"), 0);
}

TEST_F(AuditLogGuard, ReleasesTheNameOfTheFileBeforeItLooksAtTheValues) {
  platform.name_allocation_in("slapi_ch_strdup", 1, "file name");
  log_to("/log/other");
  EXPECT_THAT(
      platform.calls({"free", "realpath"}),
      ElementsAre("realpath(\"/log/audit\")", "free(file name)", "realpath(\"/log/other\")"));
}

TEST_F(AuditLogGuard, ReleasesTheNameOfTheFileBeforeItSaysThatItDoesNotResolve) {
  platform.path_errors["/log/audit"] = EACCES;
  platform.name_allocation_in("slapi_ch_strdup", 1, "file name");
  EXPECT_EQ(log_to("/log/other"), 80);
  const auto story = platform.story({"free"});
  ASSERT_GT(story.size(), 2U);
  EXPECT_EQ(story[story.size() - 2], "free(file name)");
  EXPECT_EQ(story.back(), "debug: Error - checkAuditLog: invalid audit log filename\n");
}

TEST_F(AuditLogGuard, ReleasesEachResolvedValueBeforeTheNextOne) {
  exists("/log/other");
  std::size_t left = 0;
  const auto note = [&] { left = platform.leaks().size(); };
  const auto same = [&] { EXPECT_EQ(platform.leaks().size(), left); };
  platform.at("realpath", 2, note);
  platform.at("realpath", 3, same);
  platform.at("realpath", 4, same);
  EXPECT_EQ(check(kOtherLog, {{kAdd, "orv-slapdLog", {{"/log/audit"}}},
                              {kAdd, "orv-slapdLog", {{"/log/other"}}},
                              {kAdd, "orv-slapdLog", {{"/log/audit"}}}}),
            53);
  EXPECT_EQ(platform.count("realpath"), 4);
}

TEST_F(AuditLogGuard, DecidesTheSameWithoutTheTrace) {
  debug_off();
  exists("/log/other");
  EXPECT_EQ(log_to("/log/audit"), 53);
  EXPECT_EQ(log_to("/log/other"), 0);
  EXPECT_EQ(check(kAudit, {{kReplace, "orv-slapdLog", {{"/log/audit"}}}}), 0);
  EXPECT_EQ(check(nullptr, {{kAdd, "cn", {{"x"}}}}), 80);
  EXPECT_EQ(check(kOtherLog, {}), 80);
  platform.path_errors["/log/audit"] = EACCES;
  EXPECT_EQ(log_to("/log/other"), 80);
  platform.file.erase(kAudit);
  platform.forget();
  platform.fail("slapi_ch_strdup", 1, 0);
  EXPECT_EQ(log_to("/log/other"), 90);
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
}

TEST_F(AuditLogGuard, EachFailingAllocationIsAnsweredAndLeaksNothing) {
  // Search, name, values, copy of the name, its buffer, the value's; then none. Where the settings
  // cannot be read the default counts, which needs a copy; a value without a buffer is let pass.
  const std::vector<int> once = {0, 0, 0, 0, 80, 0, 53};
  const std::vector<int> from_then_on = {90, 90, 90, 90, 80, 0, 53};
  for (const std::vector<int>& codes : {once, from_then_on}) {
    std::vector<int> answered;
    for (int nth = 1; nth <= 7; ++nth) {
      platform.forget();
      codes == once ? platform.fail_allocation(nth) : platform.fail_allocations_from(nth);
      answered.push_back(log_to("/log/audit"));
      EXPECT_EQ(platform.allocations() >= nth, nth < 7) << nth;
      EXPECT_THAT(platform.leaks(), ElementsAre("session")) << nth;
    }
    EXPECT_EQ(answered, codes);
  }
}

TEST_F(AuditLogGuard, LeavesAnExitRecord) {
  trcEvents = kTraceExit;
  log_to("/log/audit");
  EXPECT_EQ(platform.records().front(), "entry 01031100 ");
  EXPECT_EQ(last_record(), "exit 01031100 53");
}

}  // namespace
}  // namespace orv
