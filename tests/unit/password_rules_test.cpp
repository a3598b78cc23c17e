// Passwords of administrators: changes of the policy, new passwords, how passwords are stored.
#include <algorithm>

#include "backend_test.h"
#include "config_modify.h"
#include "slapi/services.h"
#include "slapi/strings.h"

namespace orv {
namespace {

constexpr const char* kTop = "CN=CONFIGURATION";
constexpr const char* kGroupMember = "CN=ONE,CN=ADMINGROUP,CN=CONFIGURATION";
constexpr const char* kSupplierEntry = "CN=S,CN=REPLICATION,CN=CONFIGURATION";
constexpr const char* kAdminPassword = "orv-slapdAdminPW";
constexpr const char* kMasterPassword = "orv-slapdMasterPW";
constexpr const char* kEncryption = "orv-slapdPwEncryption";

using Modifications = std::vector<scripted::ScriptedModification>;

const DebugLine kNullLine = error("Invalid NULL pointer passed through.\n");

// ---- A change of the policy

class PolicyChange : public BackendTest {
 protected:
  PolicyChange() { platform.policy = {1, 1, 2, 3, 4, 5, 6, 7, 8, 9, {10, 11}}; }

  int change(const Modifications& list) {
    ldapmod* const mods = scripted::make_modifications(list);
    const int rc = traced(0x01031200, [&] { return checkAdminPolicyEntryModify(mods); });
    free_ldmll(mods);
    return rc;
  }
  // What the server was asked about, member by member.
  std::vector<int> validated() {
    const _Admin_pwdPolicy& p = platform.validated;
    return {p.enabled,
            p.pwdLockout,
            p.pwdLockoutDuration,
            p.pwdMaxFailure,
            p.pwdFailureCountInterval,
            p.pwdMinLength,
            p.passwordMinAlphaChars,
            p.passwordMinOtherChars,
            p.passwordMaxRepeatedChars,
            p.passwordMinDiffChars,
            p.reserved[0],
            p.reserved[1]};
  }
};

TEST_F(PolicyChange, ServerIsAskedAboutTheCurrentPolicyWithTheChangesInIt) {
  EXPECT_EQ(change({{kReplace, "pwdMinLength", {{"12"}}}}), 0);
  EXPECT_THAT(validated(), ElementsAre(1, 1, 2, 3, 4, 12, 6, 7, 8, 9, 10, 11));
  EXPECT_THAT(platform.calls({"getGlobalAdminPWDPolicyLocal", "validate_new_settings"}),
              ElementsAre("getGlobalAdminPWDPolicyLocal()", "validate_new_settings(1)"));
  EXPECT_EQ(platform.policy.pwdMinLength, 5);  // the policy itself stays
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
}

TEST_F(PolicyChange, EachSettingHasItsMemberInAnyLetterCase) {
  const char* const numbers[] = {"PWDLOCKOUTDURATION",       "pwdmaxfailure",
                                 "PwdFailureCountInterval",  "pwdMinLength",
                                 "passwordMinAlphaChars",    "passwordMinOtherChars",
                                 "passwordMaxRepeatedChars", "passwordMinDiffChars"};
  for (std::size_t i = 0; i < std::size(numbers); ++i) {
    std::vector<int> expected = {1, 1, 2, 3, 4, 5, 6, 7, 8, 9, 10, 11};
    expected[i + 2] = 77;
    EXPECT_EQ(change({{kReplace, numbers[i], {{"77"}}}}), 0);
    EXPECT_EQ(validated(), expected) << numbers[i];
  }
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
}

TEST_F(PolicyChange, LockoutIsOnForTrueInAnyLetterCaseAndOffForAnythingElse) {
  for (const char* value : {"TRUE", "true", "True"}) {
    platform.policy.pwdLockout = 0;
    EXPECT_EQ(change({{kReplace, "pwdlockout", {{value}}}}), 0);
    EXPECT_EQ(validated()[1], 1) << value;
  }
  for (const char* value : {"FALSE", "", "TRUEX", "1"}) {
    platform.policy.pwdLockout = 1;
    EXPECT_EQ(change({{kReplace, "pwdLockout", {{value}}}}), 0);
    EXPECT_EQ(validated()[1], 0) << value;
  }
}

TEST_F(PolicyChange, OperationCodeIsNotLookedAt) {
  for (const int code : {kAdd, kDelete, kReplace, 0, 1, 2, 3}) {
    EXPECT_EQ(change({{code, "pwdMinLength", {{"12"}}}}), 0);
    EXPECT_EQ(validated()[5], 12) << code;
  }
}

TEST_F(PolicyChange, MissingValueLeavesTheMemberAsItIs) {
  for (const int code : {kReplace, kDelete, 0, 1}) {
    EXPECT_EQ(change({{code, "pwdMinLength", std::nullopt},
                      {code, "pwdLockout", std::nullopt},
                      {code, "pwdMaxFailure", {{}}}}),
              0);
    EXPECT_THAT(validated(), ElementsAre(1, 1, 2, 3, 4, 5, 6, 7, 8, 9, 10, 11));
  }
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
}

TEST_F(PolicyChange, OnlyTheFirstValueIsUsedAndALaterModificationWins) {
  EXPECT_EQ(change({{kReplace, "pwdMinLength", {{"12", "13"}}}}), 0);
  EXPECT_EQ(validated()[5], 12);
  EXPECT_EQ(change({{kReplace, "pwdMinLength", {{"12"}}}, {kAdd, "pwdMinLength", {{"14"}}}}), 0);
  EXPECT_EQ(validated()[5], 14);
}

TEST_F(PolicyChange, NumbersAreReadAsFarAsTheyGo) {
  const std::pair<const char*, int> cases[] = {
      {"12abc", 12}, {"", 0},     {"abc", 0},  {"-3", -3},
      {" 7", 7},     {"012", 12}, {"0x10", 0}, {"2147483647", 2147483647}};
  for (const auto& [text, number] : cases) {
    change({{kReplace, "pwdMinLength", {{text}}}});
    EXPECT_EQ(validated()[5], number) << text;
  }
}

TEST_F(PolicyChange, NumberThatIsTooLargeWraps) {
  change({{kReplace, "pwdMinLength", {{"4294967297"}}}});
  EXPECT_EQ(validated()[5], 1);
  change({{kReplace, "pwdMinLength", {{"2147483648"}}}});
  EXPECT_EQ(validated()[5], -2147483647 - 1);
}

TEST_F(PolicyChange, OtherAttributesAreToldAndIgnored) {
  EXPECT_EQ(change({{kReplace, "cn", {{"x"}}},
                    {kReplace, "pwdMinLength", {{"12"}}},
                    {kReplace, "pwdMinLengthX", {{"13"}}}}),
            0);
  EXPECT_EQ(validated()[5], 12);
  const DebugLine line = error("checkAdminPolicyEntryModify:invalid mod_type!\n");
  EXPECT_THAT(platform.debug_lines(), ElementsAre(line, line));
}

TEST_F(PolicyChange, RefusalOfTheServerIsToldAndReturned) {
  platform.fail("validate_new_settings", 1, 19);
  EXPECT_EQ(change({{kReplace, "pwdMinLength", {{"12"}}}}), 19);
  EXPECT_THAT(
      platform.debug_lines(),
      ElementsAre(error("checkAdminPolicyEntryModify:validate_new_setting failed, rc=19!\n")));
}

TEST_F(PolicyChange, WithoutModificationsTheCurrentPolicyIsValidated) {
  EXPECT_EQ(change({}), 0);
  EXPECT_EQ(platform.count("validate_new_settings"), 1);
}

TEST_F(PolicyChange, SettingsAreKnownByTheirWholeNames) {
  for (const char* type : {"pwdLockoutDurations", "pwdMaxFailur", "pwdLock", "xpwdMinLength", ""}) {
    EXPECT_EQ(change({{kReplace, type, {{"77"}}}}), 0);
    EXPECT_THAT(validated(), ElementsAre(1, 1, 2, 3, 4, 5, 6, 7, 8, 9, 10, 11)) << type;
  }
  EXPECT_EQ(platform.debug_lines().size(), 5U);
}

TEST_F(PolicyChange, EveryModificationCountsAlsoBehindOneThatIsIgnored) {
  EXPECT_EQ(change({{kAdd, "pwdLockout", {{"false"}}},
                    {kDelete, "cn", std::nullopt},
                    {kAdd, "pwdLockoutDuration", {{"20"}}},
                    {kReplace, "pwdMaxFailure", {{"30"}}},
                    {kDelete, "passwordMinDiffChars", {{"90"}}}}),
            0);
  EXPECT_THAT(validated(), ElementsAre(1, 0, 20, 30, 4, 5, 6, 7, 8, 90, 10, 11));
  EXPECT_EQ(platform.count("validate_new_settings"), 1);
}

TEST_F(PolicyChange, AnswerOfTheServerIsReturnedWhateverItIsAlsoWithoutTheTrace) {
  debug_off();
  for (const int code : {-1, 1, 19, 80}) {
    platform.forget();
    platform.fail("validate_new_settings", 1, code);
    EXPECT_EQ(change({{kReplace, "pwdMinLength", {{"12"}}}, {kReplace, "cn", {{"x"}}}}), code);
    EXPECT_EQ(validated()[5], 12);
  }
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
}

TEST_F(PolicyChange, TakesNoMemory) {
  EXPECT_EQ(change({{kReplace, "pwdMinLength", {{"12"}}}, {kReplace, "pwdLockout", {{"x"}}}}), 0);
  EXPECT_EQ(platform.allocations(), 0);
}

TEST_F(PolicyChange, LeavesAnExitRecord) {
  trcEvents = kTraceExit;
  platform.fail("validate_new_settings", 1, 19);
  change({});
  EXPECT_THAT(platform.records(), ElementsAre("entry 01031200 ", "exit 01031200 19"));
}

// ---- A new password

class NewPassword : public BackendTest {
 protected:
  NewPassword() {
    open_session();
    entry(kTop, {{kAdminPassword, {"old"}}, {"orv-slapdAdminDN", {"cn=root"}}});
    entry(kGroupMember, {{kAdminPassword, {"old"}}, {"orv-slapdAdminDN", {"cn=one"}}});
    platform.administrator_record = &record;
  }
  void TearDown() override {
    close_session();
    BackendTest::TearDown();
  }

  void entry(const std::string& dn, const std::vector<scripted::ScriptedAttribute>& attributes) {
    platform.file[dn] = {{{dn, attributes}}};
  }
  // A supplier's entry: found with the second filter, or already with the first.
  void supplier(const std::vector<scripted::ScriptedAttribute>& attributes,
                const std::string& filter = "objectclass=orv-slapdSupplier") {
    const std::string dn = kSupplierEntry;
    platform.file[dn + "?objectclass=orv-slapdReplication"] = {};
    platform.file[dn + "?objectclass=orv-slapdSupplier"] = {};
    platform.file[dn + "?" + filter] = {{{dn, attributes}}};
  }

  int check(const char* dn, const Modifications& list) {
    ldapmod* const mods = scripted::make_modifications(list);
    const int rc = traced(0x01031300, [&] {
      return checkAdminPolicyModify(&operation, connection.config_session, dn, mods);
    });
    free_ldmll(mods);
    return rc;
  }
  int replace(const char* dn, const char* type = kAdminPassword) {
    return check(dn, {{kReplace, type, {{"new"}}}});
  }
  void expect_untouched() {
    EXPECT_EQ(platform.count("cfg_search_s"), 0);
    EXPECT_EQ(platform.count("verify_admin_password"), 0);
    EXPECT_EQ(record.changed, 0);
  }

  AdminPasswordRecord record{0};
};

TEST_F(NewPassword, IsVerifiedAgainstTheStoredOneAndTheRecordIsMarked) {
  EXPECT_EQ(replace(kTop), 0);
  EXPECT_THAT(platform.calls({"cfg_search_s", "cfg_count_entries", "cfg_get_values",
                              "unformat_password", "verify_admin_password",
                              "pwdIsAdminPasswordLockoutOn", "findAdminPWDPAttrib", "cfg_msgfree"}),
              ElementsAre("cfg_search_s(session, \"CN=CONFIGURATION\", 0, \"orv-slapdAdminPW\", "
                          "[orv-slapdAdminPW orv-slapdAdminDN], 0)",
                          "cfg_count_entries(session, chain)",
                          "cfg_get_values(session, record 1, \"orv-slapdAdminPW\")",
                          "unformat_password(\"old\", null, 0)",
                          "cfg_get_values(session, record 1, \"orv-slapdAdminDN\")",
                          "verify_admin_password(\"new\", \"old\", operation)",
                          "pwdIsAdminPasswordLockoutOn()", "findAdminPWDPAttrib(\"cn=root\")",
                          "cfg_msgfree(chain)"));
  EXPECT_EQ(record.changed, 1);
  EXPECT_THAT(platform.debug_lines(),
              ElementsAre(detail("unformat_password returns 0 for clear text password\n")));
}

TEST_F(NewPassword, OfAMemberIsReadFromItsOwnEntry) {
  EXPECT_EQ(replace(kGroupMember), 0);
  EXPECT_THAT(platform.calls({"cfg_search_s", "findAdminPWDPAttrib"}),
              ElementsAre("cfg_search_s(session, \"CN=ONE,CN=ADMINGROUP,CN=CONFIGURATION\", 0, "
                          "\"orv-slapdAdminPW\", [orv-slapdAdminPW orv-slapdAdminDN], 0)",
                          "findAdminPWDPAttrib(\"cn=one\")"));
}

TEST_F(NewPassword, SealedOldPasswordIsOpenedWithTheKeyOfTheSession) {
  entry(kTop, {{kAdminPassword, {"{sealed}clear"}}, {"orv-slapdAdminDN", {"cn=root"}}});
  const int key = 0;
  platform.name(&key, "key");
  connection.config_session->key = &key;
  EXPECT_EQ(replace(kTop), 0);
  EXPECT_THAT(platform.calls({"unformat_password", "verify_admin_password"}),
              ElementsAre("unformat_password(\"{sealed}clear\", key, 0)",
                          "verify_admin_password(\"new\", \"clear\", operation)"));
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
}

TEST_F(NewPassword, OldPasswordThatIsNotOpenedIsTakenAsItIsStored) {
  for (const int answer : {0, -1, 2}) {
    platform.forget();
    platform.fail("unformat_password", 1, answer);
    EXPECT_EQ(replace(kTop), 0);
    EXPECT_THAT(platform.calls({"verify_admin_password"}),
                ElementsAre("verify_admin_password(\"new\", \"old\", operation)"));
    EXPECT_EQ(platform.debug_lines().back().text,
              "unformat_password returns 0 for clear text password\n");
  }
}

TEST_F(NewPassword, NullArgumentsGive1ButTheOperationMayBeNull) {
  ldapmod* const mods = scripted::make_modifications({{kReplace, kAdminPassword, {{"new"}}}});
  _CFG* const session = connection.config_session;
  const auto check_with = [&](Operation* o, _CFG* s, const char* dn, ldapmod* m) {
    platform.forget();
    return traced(0x01031300, [&] { return checkAdminPolicyModify(o, s, dn, m); });
  };
  EXPECT_EQ(check_with(&operation, nullptr, kTop, mods), 1);
  EXPECT_THAT(platform.debug_lines(), ElementsAre(kNullLine));
  EXPECT_EQ(check_with(&operation, session, nullptr, mods), 1);
  EXPECT_THAT(platform.debug_lines(), ElementsAre(kNullLine));
  EXPECT_EQ(check_with(&operation, session, kTop, nullptr), 1);
  EXPECT_THAT(platform.debug_lines(), ElementsAre(kNullLine));
  EXPECT_EQ(check_with(nullptr, session, kTop, mods), 0);
  EXPECT_THAT(platform.calls({"verify_admin_password"}),
              ElementsAre("verify_admin_password(\"new\", \"old\", null)"));
  free_ldmll(mods);
}

TEST_F(NewPassword, ListWithoutAPasswordIsNotLookedAt) {
  EXPECT_EQ(check(kTop, {{kReplace, "cn", {{"x"}}}, {kReplace, "orv-slapdAdminDN", {{"y"}}}}), 0);
  expect_untouched();
}

TEST_F(NewPassword, DeleteIsNeverExamined) {
  for (const int code : {kDelete, static_cast<int>(kModDelete), 3, 0x83}) {
    EXPECT_EQ(check(kTop, {{code, kAdminPassword, {{"old"}}}}), 0) << code;
    EXPECT_EQ(check(kSupplierEntry, {{code, kMasterPassword, {{"old"}}}}), 0) << code;
  }
  expect_untouched();
}

TEST_F(NewPassword, OnlyTheFirstModificationOfTheTypeCounts) {
  EXPECT_EQ(check(kTop, {{kDelete, kAdminPassword, {{"old"}}}, {kAdd, kAdminPassword, {{"n"}}}}),
            0);
  expect_untouched();
}

TEST_F(NewPassword, AdministratorsHidesTheSuppliersInOneList) {
  EXPECT_EQ(check(kTop, {{kReplace, kMasterPassword, {{"masters"}}},
                         {kReplace, kAdminPassword, {{"admins"}}}}),
            0);
  EXPECT_THAT(platform.calls({"verify_admin_password"}),
              ElementsAre("verify_admin_password(\"admins\", \"old\", operation)"));
  platform.forget();
  record.changed = 0;
  EXPECT_EQ(check(kTop, {{kReplace, kMasterPassword, {{"masters"}}},
                         {kDelete, kAdminPassword, std::nullopt}}),
            0);
  expect_untouched();
}

TEST_F(NewPassword, TypesAreKnownInAnyLetterCase) {
  EXPECT_EQ(replace(kTop, "ORV-SLAPDADMINPW"), 0);
  EXPECT_EQ(platform.count("verify_admin_password"), 1);
}

TEST_F(NewPassword, OfASupplierIsLookedForUnderTwoClasses) {
  supplier({{kMasterPassword, {"old"}}, {"orv-slapdMasterDN", {"cn=s"}}});
  EXPECT_EQ(replace(kSupplierEntry, kMasterPassword), 0);
  EXPECT_THAT(
      platform.calls(
          {"cfg_search_s", "cfg_msgfree", "verify_admin_password", "findAdminPWDPAttrib"}),
      ElementsAre("cfg_search_s(session, \"CN=S,CN=REPLICATION,CN=CONFIGURATION\", 0, "
                  "\"objectclass=orv-slapdReplication\", [orv-slapdMasterPW orv-slapdMasterDN], 0)",
                  "cfg_msgfree(chain)",
                  "cfg_search_s(session, \"CN=S,CN=REPLICATION,CN=CONFIGURATION\", 0, "
                  "\"objectclass=orv-slapdSupplier\", [orv-slapdMasterPW orv-slapdMasterDN], 0)",
                  "verify_admin_password(\"new\", \"old\", operation)",
                  "findAdminPWDPAttrib(\"cn=s\")", "cfg_msgfree(chain)"));
}

TEST_F(NewPassword, OfTheReplicationEntryIsFoundAtOnce) {
  supplier({{kMasterPassword, {"old"}}, {"orv-slapdMasterDN", {"cn=s"}}},
           "objectclass=orv-slapdReplication");
  EXPECT_EQ(replace(kSupplierEntry, kMasterPassword), 0);
  EXPECT_EQ(platform.count("cfg_search_s"), 1);
}

TEST_F(NewPassword, IdentityIsToldByTheDnAndNotByTheAttribute) {
  // A master's password at the administrator's entry: the administrator's is the old one.
  EXPECT_EQ(replace(kTop, kMasterPassword), 0);
  EXPECT_THAT(platform.calls({"verify_admin_password"}),
              ElementsAre("verify_admin_password(\"new\", \"old\", operation)"));
  // And the other way round.
  supplier({{kMasterPassword, {"masters"}}, {"orv-slapdMasterDN", {"cn=s"}}});
  platform.forget();
  EXPECT_EQ(replace(kSupplierEntry, kAdminPassword), 0);
  EXPECT_THAT(platform.calls({"verify_admin_password"}),
              ElementsAre("verify_admin_password(\"new\", \"masters\", operation)"));
}

TEST_F(NewPassword, AdministratorsUnderAnotherSpellingIsLookedForAmongTheSuppliers) {
  for (const char* dn :
       {"cn=configuration", "CN=CONFIGURATION,O=X", "CN=ONE,cn=admingroup,CN=CONFIGURATION"}) {
    platform.forget();
    platform.file[dn] = {};
    EXPECT_EQ(replace(dn), 32) << dn;
    EXPECT_EQ(platform.count("cfg_search_s"), 2) << dn;
  }
  platform.forget();
  platform.file["CN=ONE,CN=ADMINGROUP,CN=CONFIGURATION,O=X"] = {};
  EXPECT_EQ(replace("CN=ONE,CN=ADMINGROUP,CN=CONFIGURATION,O=X"), 32);
  EXPECT_EQ(platform.count("cfg_search_s"), 1);  // contains the group
}

TEST_F(NewPassword, WithoutAnEntryGives32) {
  platform.file[kTop] = {};  // there, but without a password
  EXPECT_EQ(replace(kTop), 32);
  platform.file.erase(kTop);
  EXPECT_EQ(replace(kTop), 32);
  platform.file[kSupplierEntry] = {};
  EXPECT_EQ(replace(kSupplierEntry, kMasterPassword), 32);
  EXPECT_EQ(platform.count("verify_admin_password"), 0);
}

TEST_F(NewPassword, ResultThatCannotBeCountedHoldsNoEntry) {
  platform.fail("cfg_count_entries", 1, -1);
  EXPECT_EQ(replace(kTop), 32);
  EXPECT_EQ(platform.count("cfg_get_values"), 0);
  supplier({{kMasterPassword, {"old"}}, {"orv-slapdMasterDN", {"cn=s"}}});
  platform.forget();
  platform.fail("cfg_count_entries", 0, -1);
  EXPECT_EQ(replace(kSupplierEntry, kMasterPassword), 32);
  EXPECT_EQ(platform.count("cfg_search_s"), 2);
  EXPECT_EQ(platform.count("cfg_get_values"), 0);
}

TEST_F(NewPassword, SearchThatFailsGivesItsCode) {
  platform.file[kTop].code = 3;  // with its entry
  EXPECT_EQ(replace(kTop), 3);
  for (const int nth : {1, 2}) {
    supplier({{kMasterPassword, {"old"}}});
    platform.forget();
    platform.fail("cfg_search_s", nth, 11);
    EXPECT_EQ(replace(kSupplierEntry, kMasterPassword), 11);
    EXPECT_EQ(platform.count("cfg_search_s"), nth);
  }
  EXPECT_EQ(platform.count("cfg_get_values"), 0);
}

TEST_F(NewPassword, MissingOldPasswordIsForgivenToAnAddOnly) {
  supplier({{"orv-slapdMasterDN", {"cn=s"}}});
  EXPECT_EQ(replace(kSupplierEntry, kMasterPassword), 16);
  EXPECT_THAT(platform.debug_lines(), ElementsAre(error("Error - no password value\n")));
  EXPECT_EQ(platform.count("verify_admin_password"), 0);
  for (const int code : {kAdd, static_cast<int>(kModAdd)}) {
    platform.forget();
    record.changed = 0;
    EXPECT_EQ(check(kSupplierEntry, {{code, kMasterPassword, {{"new"}}}}), 0);
    EXPECT_THAT(platform.debug_lines(), ElementsAre(error("Error - no password value\n")));
    EXPECT_THAT(platform.calls({"verify_admin_password", "unformat_password"}),
                ElementsAre("verify_admin_password(\"new\", null, operation)"));
    EXPECT_EQ(record.changed, 1);
  }
}

TEST_F(NewPassword, OtherErrorsOfTheOldPasswordAreReturnedAlsoToAnAdd) {
  for (const int code : {kAdd, kReplace}) {
    platform.forget();
    platform.fail("cfg_get_values", 1, 80);
    EXPECT_EQ(check(kTop, {{code, kAdminPassword, {{"new"}}}}), 80);
    EXPECT_THAT(platform.debug_lines(), ElementsAre(error("Error - no password value\n")));
  }
}

TEST_F(NewPassword, OldPasswordWithoutAValueIsNone) {
  entry(kTop, {{kAdminPassword, {}}, {"orv-slapdAdminDN", {"cn=root"}}});
  EXPECT_EQ(replace(kTop), 0);
  EXPECT_THAT(platform.calls({"verify_admin_password", "unformat_password"}),
              ElementsAre("verify_admin_password(\"new\", null, operation)"));
  platform.forget();
  platform.fail("cfg_get_values", 1, 0);
  EXPECT_EQ(replace(kTop), 0);
}

TEST_F(NewPassword, MissingDnIsReturnedAlsoToAnAdd) {
  entry(kTop, {{kAdminPassword, {"old"}}});
  EXPECT_EQ(check(kTop, {{kAdd, kAdminPassword, {{"new"}}}}), 16);
  EXPECT_EQ(platform.debug_lines().back(), error("Error - no dn value\n"));
  EXPECT_EQ(platform.count("verify_admin_password"), 0);
}

TEST_F(NewPassword, DnWithoutAValueIsNone) {
  entry(kTop, {{kAdminPassword, {"old"}}, {"orv-slapdAdminDN", {}}});
  EXPECT_EQ(replace(kTop), 0);
  EXPECT_THAT(platform.calls({"findAdminPWDPAttrib"}), ElementsAre("findAdminPWDPAttrib(null)"));
  platform.forget();
  platform.fail("cfg_get_values", 2, 0);
  EXPECT_EQ(replace(kTop), 0);
}

TEST_F(NewPassword, CopiesThatCannotBeMadeGive90) {
  for (const int nth : {1, 2}) {  // of the DN, of the password
    platform.forget();
    platform.fail("slapi_ch_strdup", nth, 0);
    EXPECT_EQ(replace(kTop), 90);
    EXPECT_EQ(platform.count("verify_admin_password"), 0);
  }
}

TEST_F(NewPassword, ReplaceByNothingGives90) {
  EXPECT_EQ(check(kTop, {{kReplace, kAdminPassword, std::nullopt}}), 90);
  EXPECT_EQ(check(kTop, {{kReplace, kAdminPassword, {{}}}}), 90);
}

TEST_F(NewPassword, EmptyOneIsVerifiedLikeAnyOther) {
  platform.fail("verify_admin_password", 1, 19);
  EXPECT_EQ(check(kTop, {{kReplace, kAdminPassword, {{""}}}}), 19);
  EXPECT_THAT(platform.calls({"verify_admin_password"}),
              ElementsAre("verify_admin_password(\"\", \"old\", operation)"));
  EXPECT_EQ(record.changed, 0);
}

TEST_F(NewPassword, OnlyTheFirstValueIsUsedInEitherForm) {
  EXPECT_EQ(check(kTop, {{kReplace, kAdminPassword, {{"first", "second"}}}}), 0);
  EXPECT_EQ(check(kTop, {{kModReplace, kAdminPassword, {{"text", "second"}}}}), 0);
  EXPECT_THAT(platform.calls({"verify_admin_password"}),
              ElementsAre("verify_admin_password(\"first\", \"old\", operation)",
                          "verify_admin_password(\"text\", \"old\", operation)"));
}

TEST_F(NewPassword, RefusalOfThePolicyIsReturnedAndNothingIsMarked) {
  platform.fail("verify_admin_password", 1, 19);
  EXPECT_EQ(replace(kTop), 19);
  EXPECT_EQ(platform.count("pwdIsAdminPasswordLockoutOn"), 0);
  EXPECT_EQ(platform.count("findAdminPWDPAttrib"), 0);
  EXPECT_EQ(record.changed, 0);
}

TEST_F(NewPassword, LockoutIsAskedForWithoutUseAndARecordMayBeMissing) {
  for (const int answer : {0, 1}) {
    platform.forget();
    record.changed = answer + 4;
    platform.fail("pwdIsAdminPasswordLockoutOn", 1, answer);
    EXPECT_EQ(replace(kTop), 0);
    EXPECT_EQ(record.changed, 1) << answer;
  }
  platform.administrator_record = nullptr;
  EXPECT_EQ(replace(kTop), 0);
}

TEST_F(NewPassword, AtTheTopEntryInLowerCaseIsASuppliersWhereThatIsOne) {
  platform.file["cn=configuration"] = {};
  platform.file["cn=configuration?objectclass=orv-slapdSupplier"] = {
      {{"cn=configuration", {{kMasterPassword, {"masters"}}, {"orv-slapdMasterDN", {"cn=s"}}}}}};
  EXPECT_EQ(replace("cn=configuration"), 0);
  EXPECT_THAT(platform.calls({"verify_admin_password", "findAdminPWDPAttrib"}),
              ElementsAre("verify_admin_password(\"new\", \"masters\", operation)",
                          "findAdminPWDPAttrib(\"cn=s\")"));
}

TEST_F(NewPassword, OfTheGroupsContainerIsAnAdministrators) {
  entry("CN=ADMINGROUP,CN=CONFIGURATION",
        {{kAdminPassword, {"groups"}}, {"orv-slapdAdminDN", {"cn=g"}}});
  EXPECT_EQ(replace("CN=ADMINGROUP,CN=CONFIGURATION"), 0);
  EXPECT_THAT(platform.calls({"verify_admin_password"}),
              ElementsAre("verify_admin_password(\"new\", \"groups\", operation)"));
}

TEST_F(NewPassword, FirstValuesCountOfWhatIsStored) {
  entry(kTop, {{kAdminPassword, {"first", "second"}}, {"orv-slapdAdminDN", {"cn=a", "cn=b"}}});
  EXPECT_EQ(replace(kTop), 0);
  EXPECT_THAT(platform.calls({"unformat_password", "verify_admin_password", "findAdminPWDPAttrib"}),
              ElementsAre("unformat_password(\"first\", null, 0)",
                          "verify_admin_password(\"new\", \"first\", operation)",
                          "findAdminPWDPAttrib(\"cn=a\")"));
}

TEST_F(NewPassword, FirstEntryCountsOfWhatIsFound) {
  platform.file[kTop] = {
      {{kTop, {{kAdminPassword, {"one"}}, {"orv-slapdAdminDN", {"cn=1"}}}},
       {kGroupMember, {{kAdminPassword, {"two"}}, {"orv-slapdAdminDN", {"cn=2"}}}}}};
  EXPECT_EQ(replace(kTop), 0);
  EXPECT_THAT(platform.calls({"findAdminPWDPAttrib"}),
              ElementsAre("findAdminPWDPAttrib(\"cn=1\")"));
}

TEST_F(NewPassword, AnswerOfThePolicyIsReturnedWhateverItIs) {
  for (const int code : {-1, 1, 16, 19, 90}) {
    platform.forget();
    platform.fail("verify_admin_password", 1, code);
    EXPECT_EQ(check(kTop, {{kAdd, kAdminPassword, {{"new"}}}}), code);
    EXPECT_EQ(record.changed, 0);
  }
}

TEST_F(NewPassword, ErrorsOfTheDnAreReturnedWithTheirLineAndReleaseEverything) {
  for (const int number : {1, 16, 80}) {
    platform.forget();
    platform.fail("cfg_get_values", 2, number);
    EXPECT_EQ(check(kTop, {{kAdd, kAdminPassword, {{"new"}}}}), number);
    EXPECT_EQ(platform.debug_lines().back(), error("Error - no dn value\n"));
    EXPECT_EQ(platform.count("verify_admin_password"), 0);
    EXPECT_THAT(platform.leaks(), ElementsAre("session"));
  }
}

TEST_F(NewPassword, ErrorNumberCountsAlsoWhereThereAreValues) {
  for (const int nth : {1, 2}) {  // of the password, of the DN
    platform.forget();
    platform.fail("cfg_get_errno", nth, 7);
    EXPECT_EQ(check(kTop, {{kAdd, kAdminPassword, {{"new"}}}}), 7);
    EXPECT_EQ(platform.count("verify_admin_password"), 0);
  }
  platform.forget();
  platform.fail("cfg_get_errno", 1, 16);  // forgiven, and the values are not looked at
  EXPECT_EQ(check(kTop, {{kAdd, kAdminPassword, {{"new"}}}}), 0);
  EXPECT_THAT(platform.calls({"unformat_password", "verify_admin_password"}),
              ElementsAre("verify_admin_password(\"new\", null, operation)"));
}

TEST_F(NewPassword, IsDecidedTheSameWayWithoutTheTrace) {
  debug_off();
  EXPECT_EQ(replace(kTop), 0);
  EXPECT_EQ(record.changed, 1);
  EXPECT_EQ(platform.count("pwdIsAdminPasswordLockoutOn"), 1);
  EXPECT_EQ(check(kTop, {}), 1);
  supplier({{"orv-slapdMasterDN", {"cn=s"}}});
  EXPECT_EQ(replace(kSupplierEntry, kMasterPassword), 16);
  EXPECT_EQ(check(kSupplierEntry, {{kAdd, kMasterPassword, {{"new"}}}}), 0);
  supplier({{kMasterPassword, {"old"}}});
  EXPECT_EQ(replace(kSupplierEntry, kMasterPassword), 16);
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
}

TEST_F(NewPassword, EachFailingAllocationIsAnsweredAndLeaksNothing) {
  supplier({{kMasterPassword, {"{sealed}old"}}, {"orv-slapdMasterDN", {"cn=s"}}});
  for (const bool from_then_on : {false, true}) {
    int nth = 0;
    int rc = 0;
    do {
      platform.forget();
      record.changed = 0;
      ++nth;
      from_then_on ? platform.fail_allocations_from(nth) : platform.fail_allocation(nth);
      rc = replace(kSupplierEntry, kMasterPassword);
      EXPECT_TRUE(rc == 90 || rc == 0) << nth;
      EXPECT_EQ(record.changed, rc == 0 ? 1 : 0);
      EXPECT_EQ(platform.count("verify_admin_password"), rc == 0 ? 1 : 0);
      EXPECT_THAT(platform.leaks(), ElementsAre("session")) << nth;
    } while (platform.allocations() >= nth && nth < 50);
    EXPECT_EQ(rc, 0);
    EXPECT_EQ(nth, 8);  // two searches, values, clear text, values, DN, password; then none
  }
}

// What was read for a check is released at its end.
class NewPasswordRelease : public NewPassword {
 protected:
  NewPasswordRelease() {
    entry(kTop, {{kAdminPassword, {"{sealed}old"}}, {"orv-slapdAdminDN", {"cn=root"}}});
    platform.name_allocation(3, "clear text");  // after the result and the values of the password
    platform.name_allocation(5, "copy of the DN");
    platform.name_allocation(6, "copy of the password");
  }
  // Every release, and what is asked of the server.
  [[nodiscard]] std::vector<std::string> releases() const {
    return platform.calls(
        {"verify_admin_password", "findAdminPWDPAttrib", "cfg_value_free", "free", "cfg_msgfree"});
  }
};

TEST_F(NewPasswordRelease, ComesLastAndTakesValuesCopiesClearTextAndResult) {
  EXPECT_EQ(replace(kTop), 0);
  EXPECT_THAT(releases(),
              ElementsAre("verify_admin_password(\"new\", \"old\", operation)",
                          "findAdminPWDPAttrib(\"cn=root\")", "cfg_value_free()",
                          "cfg_value_free()", "free(copy of the DN)", "free(copy of the password)",
                          "free(clear text)", "cfg_msgfree(chain)"));
}

TEST_F(NewPasswordRelease, OfThePasswordsValuesComesBeforeThatOfTheDns) {
  std::vector<std::vector<std::string>> left;
  platform.at("cfg_value_free", 0, [&] { left.push_back(platform.leaks()); });
  entry(kTop, {{kAdminPassword, {"{sealed}old", "x", "y"}}, {"orv-slapdAdminDN", {"cn=root"}}});
  EXPECT_EQ(replace(kTop), 0);
  ASSERT_EQ(left.size(), 2U);
  const auto values = [](const std::vector<std::string>& kinds) {
    return std::count(kinds.begin(), kinds.end(), "cfg_value");
  };
  EXPECT_EQ(values(left[0]), 4);
  EXPECT_EQ(values(left[1]), 1);
}

TEST_F(NewPasswordRelease, ComesInTheSameOrderAfterARefusal) {
  platform.fail("verify_admin_password", 1, 19);
  EXPECT_EQ(replace(kTop), 19);
  EXPECT_THAT(releases(),
              ElementsAre("verify_admin_password(\"new\", \"old\", operation)", "cfg_value_free()",
                          "cfg_value_free()", "free(copy of the DN)", "free(copy of the password)",
                          "free(clear text)", "cfg_msgfree(chain)"));
}

TEST_F(NewPasswordRelease, ComesInTheSameOrderWhereTheDnCannotBeRead) {
  platform.fail("cfg_get_errno", 2, 80);  // with its values
  EXPECT_EQ(replace(kTop), 80);
  EXPECT_THAT(releases(), ElementsAre("cfg_value_free()", "cfg_value_free()", "free(clear text)",
                                      "cfg_msgfree(chain)"));
}

TEST_F(NewPassword, LeavesAnExitRecord) {
  trcEvents = kTraceExit;
  platform.fail("verify_admin_password", 1, 19);
  replace(kTop);
  EXPECT_EQ(platform.records().front(), "entry 01031300 ");
  EXPECT_EQ(last_record(), "exit 01031300 19");
}

// ---- How passwords are stored

struct Staged {
  Backend* backend;
  int method;
};
std::vector<Staged> g_staged;
int g_answer = 0;

int stage(Backend* backend, int method, char** text) {
  g_staged.push_back({backend, method});
  if (g_answer != 0) *text = slapi_ch_strdup("the backend's reason");
  return g_answer;
}
int never(Backend*, int, char**) {
  ADD_FAILURE() << "only the first function is called";
  return 0;
}

class PasswordMethod : public BackendTest {
 protected:
  PasswordMethod() {
    open_session();
    g_staged.clear();
    g_answer = 0;
    platform.name(&localhost, "localhost");
    platform.localhost_backend = &localhost;
    platform.plugin_functions = functions;
  }
  ~PasswordMethod() override { g_safe_mode = 0; }
  void TearDown() override {
    close_session();
    BackendTest::TearDown();
  }

  // The code, and the text as "code text" where there is one.
  std::string check(const Modifications& list, const char* dn = kTop) {
    ldapmod* const mods = scripted::make_modifications(list);
    char* text = nullptr;
    const int rc = traced(0x01031400, [&] {
      return checkPwEncryptionModify(&operation, connection.config_session, dn, mods, &text);
    });
    free_ldmll(mods);
    const Freed owner(text);
    return std::to_string(rc) + (text == nullptr ? "" : " " + std::string(text));
  }
  std::string replace(const char* method) { return check({{kReplace, kEncryption, {{method}}}}); }
  void expect_not_converted() { EXPECT_EQ(platform.count("convertPWEncryptionMethod"), 0); }

  Backend localhost;
  PluginFunction functions[3] = {stage, never, nullptr};
};

TEST_F(PasswordMethod, IsConvertedFrom16AndHandedToTheDirectoryBackend) {
  EXPECT_EQ(replace("known"), "0");
  EXPECT_THAT(
      platform.calls({"convertPWEncryptionMethod", "select_backend_opt", "getAllPluginFuncs"}),
      ElementsAre("convertPWEncryptionMethod(\"known\", 16)",
                  "select_backend_opt(\"CN=LOCALHOST\")", "getAllPluginFuncs(localhost, -159)"));
  ASSERT_EQ(g_staged.size(), 1U);
  EXPECT_EQ(g_staged[0].backend, &localhost);
  EXPECT_EQ(g_staged[0].method, 3);
}

TEST_F(PasswordMethod, AnswerAndTextOfTheDirectoryBackendAreHandedOn) {
  g_answer = 53;
  EXPECT_EQ(replace("known"), "53 the backend's reason");
}

TEST_F(PasswordMethod, ThatIsNotAllowedGives53AndItsText) {
  platform.fail("convertPWEncryptionMethod", 1, 1);
  EXPECT_EQ(replace("known"),
            "53 requested orv-slapdPwEncryption value is not allowed by current configuration.");
  EXPECT_THAT(g_staged, IsEmpty());
  EXPECT_EQ(platform.count("select_backend_opt"), 0);
}

TEST_F(PasswordMethod, ThatIsNotAllowedIsToldByAnyAnswerBut0) {
  for (const int answer : {-1, 2, 16, 90}) {
    for (const char* method : {"known", "rot13"}) {  // whatever came of the conversion
      platform.forget();
      platform.fail("convertPWEncryptionMethod", 1, answer);
      EXPECT_EQ(
          replace(method),
          "53 requested orv-slapdPwEncryption value is not allowed by current configuration.");
    }
  }
  EXPECT_THAT(g_staged, IsEmpty());
}

TEST_F(PasswordMethod, ThatIsUnknownGives21AndItsText) {
  EXPECT_EQ(replace("rot13"), "21 orv-slapdPwEncryption value is not one of the supported values.");
  EXPECT_THAT(g_staged, IsEmpty());
}

TEST_F(PasswordMethod, WithoutAValueIsUnknown) {
  for (const auto& values : {Modifications{{kReplace, kEncryption, std::nullopt}},
                             Modifications{{kReplace, kEncryption, {{}}}}}) {
    EXPECT_EQ(check(values), "21 orv-slapdPwEncryption value is not one of the supported values.");
  }
  EXPECT_THAT(platform.calls({"convertPWEncryptionMethod"}),
              Contains("convertPWEncryptionMethod(null, 16)"));
}

TEST_F(PasswordMethod, TextThatCannotBeMadeLeavesTheCodeAlone) {
  platform.fail("slapi_ch_strdup", 0, 0);
  EXPECT_EQ(replace("rot13"), "21");
  platform.fail("convertPWEncryptionMethod", 2, 1);
  EXPECT_EQ(replace("known"), "53");
}

TEST_F(PasswordMethod, TextIsLeftAloneWithoutARefusal) {
  char before[] = "before";
  const auto expect_left_alone = [&](int code, const char* dn) {
    ldapmod* const mods = scripted::make_modifications({{code, kEncryption, {{"known"}}}});
    char* text = before;
    EXPECT_EQ(traced(0x01031400,
                     [&] {
                       return checkPwEncryptionModify(&operation, connection.config_session, dn,
                                                      mods, &text);
                     }),
              0);
    EXPECT_EQ(text, before);
    free_ldmll(mods);
  };
  expect_left_alone(kReplace, "CN=X,CN=CONFIGURATION");
  expect_left_alone(kDelete, kTop);
  expect_left_alone(kReplace, kTop);  // the directory backend has nothing to say
  platform.localhost_backend = nullptr;
  expect_left_alone(kReplace, kTop);
  g_safe_mode = 1;
  expect_left_alone(kReplace, kTop);
  EXPECT_EQ(g_staged.size(), 1U);
}

TEST_F(PasswordMethod, NullArgumentsGive80) {
  ldapmod* const mods = scripted::make_modifications({{kReplace, kEncryption, {{"known"}}}});
  _CFG* const session = connection.config_session;
  char* text = nullptr;
  const auto check_with = [&](Operation* o, _CFG* s, const char* dn, ldapmod* m, char** t) {
    platform.forget();
    const int rc = traced(0x01031400, [&] { return checkPwEncryptionModify(o, s, dn, m, t); });
    EXPECT_THAT(platform.debug_lines(), ElementsAre(kNullLine));
    return rc;
  };
  EXPECT_EQ(check_with(nullptr, session, kTop, mods, &text), 80);
  EXPECT_EQ(check_with(&operation, nullptr, kTop, mods, &text), 80);
  EXPECT_EQ(check_with(&operation, session, nullptr, mods, &text), 80);
  EXPECT_EQ(check_with(&operation, session, kTop, nullptr, &text), 80);
  EXPECT_EQ(check_with(&operation, session, kTop, mods, nullptr), 80);
  g_safe_mode = 1;  // asked only then
  EXPECT_EQ(check_with(nullptr, session, kTop, mods, &text), 80);
  EXPECT_EQ(text, nullptr);
  free_ldmll(mods);
}

TEST_F(PasswordMethod, EverythingPassesInSafeMode) {
  for (const int mode : {1, 2, -1}) {
    g_safe_mode = mode;
    EXPECT_EQ(replace("rot13"), "0");
    EXPECT_EQ(replace("known"), "0");
  }
  expect_not_converted();
}

TEST_F(PasswordMethod, IsLookedAtInTheTopEntryOnlyByteForByte) {
  for (const char* dn : {"cn=configuration", "CN=X,CN=CONFIGURATION", "CN=CONFIGURATION,O=X"}) {
    EXPECT_EQ(check({{kReplace, kEncryption, {{"rot13"}}}}, dn), "0") << dn;
  }
  expect_not_converted();
}

TEST_F(PasswordMethod, IsTheFirstModificationOfItsTypeIfThatAddsOrReplaces) {
  EXPECT_EQ(check({{kReplace, "cn", {{"rot13"}}}}), "0");
  for (const int code : {kDelete, static_cast<int>(kModDelete), 3}) {
    EXPECT_EQ(check({{code, kEncryption, {{"rot13"}}}, {kAdd, kEncryption, {{"rot13"}}}}), "0");
  }
  expect_not_converted();
  for (const int code :
       {kAdd, kReplace, static_cast<int>(kModAdd), static_cast<int>(kModReplace)}) {
    EXPECT_EQ(check({{code, "ORV-slapdpwencryption", {{"known", "rot13"}}}}), "0") << code;
  }
  EXPECT_EQ(g_staged.size(), 4U);
}

TEST_F(PasswordMethod, IsTheFirstValueAlsoWhereAnotherIsKnown) {
  EXPECT_THAT(check({{kAdd, kEncryption, {{"rot13", "known"}}}}), testing::StartsWith("21"));
}

TEST_F(PasswordMethod, IsNotHandedOnWhenSafeModeBeginsMeanwhile) {
  platform.at("convertPWEncryptionMethod", 1, [] { g_safe_mode = 1; });
  EXPECT_EQ(replace("known"), "0");
  EXPECT_EQ(platform.count("select_backend_opt"), 0);
  g_safe_mode = 0;
  platform.at("convertPWEncryptionMethod", 2, [] { g_safe_mode = 1; });
  EXPECT_EQ(replace("rot13"), "21 orv-slapdPwEncryption value is not one of the supported values.");
}

TEST_F(PasswordMethod, PassesWhereNobodyTakesIt) {
  for (const int answer : {-1, 80}) {
    platform.forget();
    platform.fail("getAllPluginFuncs", 1, answer);  // which hands a list out all the same
    EXPECT_EQ(replace("known"), "0") << answer;
    EXPECT_THAT(g_staged, IsEmpty()) << answer;
  }
  platform.plugin_functions = nullptr;
  EXPECT_EQ(replace("known"), "0");
  functions[0] = nullptr;
  platform.plugin_functions = functions;
  EXPECT_EQ(replace("known"), "0");
  platform.localhost_backend = nullptr;
  platform.forget();
  EXPECT_EQ(replace("known"), "0");
  EXPECT_EQ(platform.count("getAllPluginFuncs"), 0);
  EXPECT_THAT(g_staged, IsEmpty());
}

TEST_F(PasswordMethod, AnswersOfTheDirectoryBackendAreReturnedWhateverTheyAre) {
  for (const int code : {-1, 1, 21, 90}) {
    g_answer = code;
    EXPECT_EQ(replace("known"), std::to_string(code) + " the backend's reason");
  }
}

TEST_F(PasswordMethod, IsDecidedTheSameWayWithoutTheTrace) {
  debug_off();
  EXPECT_EQ(replace("rot13"), "21 orv-slapdPwEncryption value is not one of the supported values.");
  EXPECT_EQ(replace("known"), "0");
  EXPECT_EQ(g_staged.size(), 1U);
  EXPECT_EQ(check({}), "80");
  platform.forget();
  platform.fail("convertPWEncryptionMethod", 1, 1);
  EXPECT_EQ(replace("known"),
            "53 requested orv-slapdPwEncryption value is not allowed by current configuration.");
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
}

TEST_F(PasswordMethod, RefusalsAndAcceptedMethodsLeaveNoLineInTheTrace) {
  replace("known");
  replace("rot13");
  platform.fail("convertPWEncryptionMethod", 3, 1);
  replace("known");
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
}

TEST_F(PasswordMethod, OnlyTheTextOfARefusalNeedsMemory) {
  EXPECT_EQ(replace("known"), "0");
  EXPECT_EQ(platform.allocations(), 0);
  platform.fail_allocations_from(1);
  EXPECT_EQ(replace("rot13"), "21");
  EXPECT_EQ(platform.allocations(), 1);
}

TEST_F(PasswordMethod, LeavesAnExitRecord) {
  trcEvents = kTraceExit;
  replace("rot13");
  EXPECT_EQ(platform.records().front(), "entry 01031400 ");
  EXPECT_EQ(last_record(), "exit 01031400 21");
}

}  // namespace
}  // namespace orv
