// Modify: the way of the operation, who may change what, the copy that is written, the rules in
// their order.
#include <algorithm>
#include <cctype>
#include <cstring>
#include <functional>

#include "backend_test.h"
#include "config_modify.h"

namespace orv {
namespace {

constexpr unsigned kPrimary = 0x0C;
constexpr unsigned kMember = 0x14;
constexpr unsigned kServerSupplier = 0x01;
constexpr unsigned kSuffixSupplier = 0x02;

constexpr const char* kEntry = "CN=X,CN=CONFIGURATION";
constexpr const char* kTop = "CN=CONFIGURATION";
constexpr const char* kGroup = "CN=ADMINGROUP,CN=CONFIGURATION";
constexpr const char* kOne = "CN=ONE,CN=ADMINGROUP,CN=CONFIGURATION";
constexpr const char* kDefaultLog = "CN=DEFAULT,CN=LOG MANAGEMENT,CN=CONFIGURATION";
constexpr const char* kAudit = "CN=AUDIT,CN=LOG MANAGEMENT,CN=CONFIGURATION";
constexpr const char* kAdminAudit = "CN=ADMIN AUDIT,CN=LOG MANAGEMENT,CN=CONFIGURATION";
constexpr const char* kMaster = "CN=MASTER SERVER,CN=CONFIGURATION";
constexpr const char* kReplication = "CN=REPLICATION,CN=CONFIGURATION";
constexpr const char* kBackends = "CN=ORV DIRECTORY,CN=SCHEMAS,CN=CONFIGURATION";
constexpr const char* kPassThrough = "CN=P,CN=PASSTHROUGH AUTHENTICATION,CN=CONFIGURATION";
constexpr const char* kPolicy = "CN=PWDPOLICY ADMIN,CN=CONFIGURATION";
constexpr const char* kDirectory =
    "CN=DIRECTORY,CN=RDBM BACKENDS,CN=ORV DIRECTORY,CN=SCHEMAS,CN=CONFIGURATION";
constexpr const char* kSuffix = "orv-slapdSuffix";
constexpr const char* kRole = "orv-slapdAdminRole";

using Modifications = std::vector<scripted::ScriptedModification>;
const Modifications kAnything = {{kReplace, "description", {{"text"}}}};

class Modify : public BackendTest {
 protected:
  Modify() {
    platform.name(&pb, "pb");
    as(kPrimary, "CN=ROOT");
    target(kEntry);
  }
  ~Modify() override { g_safe_mode = 0; }

  void target(const std::string& dn, const std::vector<std::string>& classes = {"top"},
              std::vector<scripted::ScriptedAttribute> attributes = {}) {
    attributes.insert(attributes.begin(), {"objectClass", classes});
    platform.file[dn] = {{{dn, attributes}}};
    target_dn_ = dn;
    pb.put(parameter::target_dn, static_cast<const void*>(target_dn_.c_str()));
  }

  int modify(const Modifications& list = kAnything) {
    last_list_ = list;
    pb.put(parameter::modifications, scripted::make_modifications(list));
    return traced(0x01030100, [&] { return config_back_modify(&pb); });
  }

  [[nodiscard]] bool list_is_gone() const {
    return pb.values.at(parameter::modifications).pointer == nullptr;
  }

  // Answered once, with the list released and everything at rest.
  void expect_answered(int code, const std::string& text = "") {
    BackendTest::expect_answered(code, text);
    EXPECT_TRUE(list_is_gone());
    EXPECT_FALSE(locked());
    EXPECT_EQ(connection.config_session, nullptr);
    EXPECT_EQ(platform.count("pthread_mutex_lock"), platform.count("pthread_mutex_unlock"));
    EXPECT_EQ(platform.count("cfg_unbind"), 1);
  }

  // What was handed to the library: "code type=values|..."; "" for nothing.
  std::string written() {
    const auto calls = platform.calls({"cfg_modify_s"});
    if (calls.empty()) return "";
    const std::string text = calls[0].substr(0, calls[0].size() - 2);
    return text.substr(text.find("\", \"") + 4);
  }

  // Lines of the handler itself, in order.
  [[nodiscard]] std::vector<DebugLine> lines_of_the_handler() const {
    std::vector<DebugLine> lines;
    for (const DebugLine& line : platform.debug_lines()) {
      if (line.text.starts_with("Error - config_back_modify")) lines.push_back(line);
    }
    return lines;
  }

  // Exit records of the functions of this kind of operation, as "name code", in order.
  std::vector<std::string> steps() {
    static const std::map<std::string, std::string> kNames = {
        {"0400", "addmodifyop"}, {"0600", "schema"}, {"0700", "member"},   {"0800", "root"},
        {"0900", "kerberos"},    {"0a00", "digest"}, {"0b00", "supplier"}, {"0c00", "proxy name"},
        {"1100", "audit log"},   {"1200", "policy"}, {"1300", "password"}, {"1400", "encryption"}};
    std::vector<std::string> texts;
    for (const std::string& record : platform.records()) {
      if (!record.starts_with("exit 0103")) continue;
      const auto found = kNames.find(record.substr(9, 4));
      if (found != kNames.end()) texts.push_back(found->second + record.substr(13));
    }
    return texts;
  }

  // The copy of the list stays on every way but that of success: its array, its records with their
  // types and arrays of values, and the values; and nothing else does.
  void expect_copy_left() {
    std::map<std::pair<int, std::string>, bool> records;
    std::size_t values = 0;
    for (const scripted::ScriptedModification& m : last_list_) {
      std::string type = m.type;
      for (char& c : type) c = static_cast<char>(std::tolower(c));
      const std::size_t count = m.values ? m.values->size() : 0;
      values += count;
      records[{m.code & 0x7F, type}] |= count != 0;
    }
    std::size_t memory = 1;
    for (const auto& [record, has_values] : records) memory += has_values ? 3U : 2U;
    expect_left(memory, values);
  }
  void expect_left(std::size_t memory, std::size_t texts) {
    std::vector<std::string> expected(memory, "memory");
    expected.insert(expected.end(), texts, "text");
    EXPECT_EQ(platform.count("ldap_mods_free"), 0);
    EXPECT_THAT(platform.leaks(), testing::UnorderedElementsAreArray(expected));
    platform.release_leaks();
  }

 private:
  std::string target_dn_;
  Modifications last_list_;
};

// ---- The way of the operation

TEST_F(Modify, ReadsItsParametersInOrder) {
  EXPECT_EQ(modify(), 0);
  EXPECT_THAT(platform.calls({"slapi_pblock_get"}),
              ElementsAre("slapi_pblock_get(130)", "slapi_pblock_get(131)", "slapi_pblock_get(132)",
                          "slapi_pblock_get(50)", "slapi_pblock_get(90)"));
}

TEST_F(Modify, GoesThroughItsStepsInOrder) {
  platform.admin_policy = true;
  trcEvents = kTraceExit;
  target(kPolicy);
  EXPECT_EQ(modify({{kReplace, "pwdMinLength", {{"9"}}}}), 0);
  EXPECT_THAT(steps(), ElementsAre("schema 0", "addmodifyop 0", "root 0", "supplier 0",
                                   "kerberos 0", "audit log 0", "digest 0", "policy 0",
                                   "password 0", "proxy name 0", "encryption 0"));
  EXPECT_THAT(
      platform.calls({"pthread_mutex_lock", "cfg_bind_s", "xlate_utf8_to_localcp", "cfg_modify_s",
                      "ldap_mods_free", "cfg_unbind", "pthread_mutex_unlock", "send_ldap_result",
                      "free_ldmll", "slapi_pblock_set"}),
      ElementsAre("pthread_mutex_lock(configMutex)", "cfg_bind_s(session, null, null, 128)",
                  "xlate_utf8_to_localcp(\"9\")",
                  "xlate_utf8_to_localcp(\"CN=PWDPOLICY ADMIN,CN=CONFIGURATION\")",
                  "cfg_modify_s(session, \"CN=PWDPOLICY ADMIN,CN=CONFIGURATION\", \"2 "
                  "pwdMinLength=9\")",
                  "ldap_mods_free(\"list\", 1)", "cfg_unbind(session)",
                  "pthread_mutex_unlock(configMutex)",
                  "send_ldap_result(connection, operation, 0, null, \"\")",
                  "free_ldmll(modifications)", "slapi_pblock_set(90, null)"));
  expect_answered(0);
}

TEST_F(Modify, ParameterThatCannotBeReadGives1WithoutASession) {
  for (const int nth : {1, 2, 3, 4, 5}) {
    platform.forget();
    platform.fail("slapi_pblock_get", nth, -1);
    ldapmod* const mods = scripted::make_modifications(kAnything);
    pb.put(parameter::modifications, mods);
    EXPECT_EQ(traced(0x01030100, [&] { return config_back_modify(&pb); }), 1);
    EXPECT_EQ(platform.count("slapi_pblock_get"), nth);
    EXPECT_EQ(platform.count("slapi_pblock_set"), 0);
    EXPECT_EQ(platform.count("pthread_mutex_lock"), 0);
    EXPECT_EQ(platform.count("cfg_unbind"), 0);
    EXPECT_EQ(platform.count("send_ldap_result"), nth > 3 ? 1 : 0) << nth;
    EXPECT_EQ(platform.count("free_ldmll"), 0);  // never obtained
    EXPECT_FALSE(list_is_gone());
    free_ldmll(mods);
  }
}

TEST_F(Modify, UnreadableParameterIsAnsweredWith1AndAnEmptyText) {
  pb.values.erase(parameter::target_dn);
  EXPECT_EQ(traced(0x01030100, [&] { return config_back_modify(&pb); }), 1);
  BackendTest::expect_answered(1);
}

TEST_F(Modify, FailedBindGives1AnsweredAndKeepsHandleAndLock) {
  platform.fail("cfg_bind_s", 1, 7);
  EXPECT_EQ(modify(), 1);
  EXPECT_THAT(platform.calls({"send_ldap_result", "free_ldmll", "cfg_unbind"}),
              ElementsAre("send_ldap_result(connection, operation, 1, null, \"\")",
                          "free_ldmll(modifications)"));
  EXPECT_TRUE(list_is_gone());
  EXPECT_TRUE(locked());
  ASSERT_NE(connection.config_session, nullptr);
  close_session();
}

TEST_F(Modify, ExceptionOfTheLibraryGives1AnsweredWithNothingHeld) {
  platform.at("cfg_init", 1, [] { throw 42; });
  EXPECT_EQ(modify(), 1);
  BackendTest::expect_answered(1);
  EXPECT_FALSE(locked());
  EXPECT_EQ(connection.config_session, nullptr);
  EXPECT_EQ(platform.count("pthread_mutex_unlock"), 1);
  EXPECT_EQ(platform.count("cfg_unbind"), 0);
  EXPECT_TRUE(list_is_gone());
}

TEST_F(Modify, NoHandleGives90AnsweredAndKeepsTheLock) {
  platform.fail("cfg_init", 1, 0);
  EXPECT_EQ(modify(), 90);
  BackendTest::expect_answered(90);
  EXPECT_TRUE(list_is_gone());
  EXPECT_TRUE(locked());
}

TEST_F(Modify, LockThatCannotBeTakenGives80Answered) {
  platform.fail("pthread_mutex_lock", 1, 22);
  EXPECT_EQ(modify(), 80);
  BackendTest::expect_answered(80);
  EXPECT_EQ(platform.count("pthread_mutex_unlock"), 0);
  EXPECT_EQ(platform.count("cfg_unbind"), 0);
  EXPECT_EQ(platform.count("cfg_search_s"), 0);
  EXPECT_TRUE(list_is_gone());
}

TEST_F(Modify, SessionThatAnEarlierOperationLeftIsUsedAndUnbound) {
  open_session();
  EXPECT_EQ(modify(), 0);
  EXPECT_EQ(platform.count("cfg_init"), 0);
  expect_answered(0);
}

TEST_F(Modify, AnswersOfClosingAndSendingAreNotLookedAt) {
  platform.fail("cfg_unbind", 1, 7);
  platform.fail("pthread_mutex_unlock", 1, 1);
  platform.fail("send_ldap_result", 1, 80);
  EXPECT_EQ(modify(), 0);
  EXPECT_EQ(connection.config_session, nullptr);
  EXPECT_TRUE(list_is_gone());
  platform.set_held(&state.configMutex, false);
}

TEST_F(Modify, ParameterIsClearedAfterTheListWasReleasedAndAfterTheAnswer) {
  platform.fail("cfg_modify_s", 1, 53);
  EXPECT_EQ(modify(), 53);
  EXPECT_THAT(platform.calls(
                  {"pthread_mutex_unlock", "send_ldap_result", "free_ldmll", "slapi_pblock_set"}),
              ElementsAre("pthread_mutex_unlock(configMutex)",
                          "send_ldap_result(connection, operation, 53, null, \"\")",
                          "free_ldmll(modifications)", "slapi_pblock_set(90, null)"));
  expect_copy_left();
}

TEST_F(Modify, TellsNobodyElseOfASuccess) {
  debug_off();
  EXPECT_EQ(modify(), 0);
  const std::set<std::string> known = {"slapi_pblock_get",
                                       "slapi_pblock_set",
                                       "pthread_mutex_lock",
                                       "pthread_mutex_unlock",
                                       "cfg_init",
                                       "cfg_set_option",
                                       "cfg_bind_s",
                                       "cfg_search_s",
                                       "cfg_count_entries",
                                       "cfg_first_entry",
                                       "CFGMessage2Entry",
                                       "attr_delete",
                                       "attr_merge",
                                       "ldcf_api_schema_check",
                                       "checkReferral",
                                       "value_find",
                                       "value_find_short_list",
                                       "kel_strcasecmp",
                                       "entry_free",
                                       "cfg_msgfree",
                                       "safe_realloc",
                                       "slapi_ch_strdup",
                                       "realpath",
                                       "cfg_perror",
                                       "pwdIsAdminPolicyOn",
                                       "xlate_utf8_to_localcp",
                                       "cfg_modify_s",
                                       "ldap_mods_free",
                                       "cfg_unbind",
                                       "send_ldap_result",
                                       "free_ldmll",
                                       "kel_strlcpy"};
  for (const std::string& call : platform.calls()) {
    EXPECT_TRUE(known.contains(call.substr(0, call.find('(')))) << call;
  }
}

// ---- The schema

TEST_F(Modify, RefusalOfTheSchemaIsAnsweredBeforeAnythingIsCopied) {
  platform.fail("ldcf_api_schema_check", 1, 65);
  EXPECT_EQ(modify(), 65);
  expect_answered(65);
  EXPECT_EQ(written(), "");
}

TEST_F(Modify, MissingEntryIsAnsweredWith32) {
  platform.file.clear();
  EXPECT_EQ(modify(), 32);
  expect_answered(32);
  EXPECT_THAT(lines_of_the_handler(), IsEmpty());
}

class LastRole : public Modify {
 protected:
  LastRole() { target(kOne, {"top"}, {{kRole, {"SchemaAdmin"}}}); }
  const Modifications roles_ = {{kReplace, kRole, {{"AuditAdmin"}}}};
};

TEST_F(LastRole, ObjectClassViolationIsForgivenOnceWhereTheFirstModificationIsOfRoles) {
  platform.fail("ldcf_api_schema_check", 1, 65);
  EXPECT_EQ(modify(roles_), 0);
  expect_answered(0);
  EXPECT_EQ(platform.count("ldcf_api_schema_check"), 2);
}

TEST_F(LastRole, SecondCheckForgivesNothing) {
  platform.fail("ldcf_api_schema_check", 0, 65);
  EXPECT_EQ(modify(roles_), 65);
  expect_answered(65);
  expect_copy_left();
}

TEST_F(LastRole, OnlyObjectClassViolationsAreForgiven) {
  for (const int code : {1, 17, 19, 21, 64, 66, 69, 80}) {
    platform.forget();
    platform.fail("ldcf_api_schema_check", 1, code);
    EXPECT_EQ(modify(roles_), code);
    expect_answered(code);
  }
}

TEST_F(LastRole, NothingIsForgivenElsewhereOrToALaterModification) {
  platform.fail("ldcf_api_schema_check", 0, 65);
  EXPECT_EQ(modify({{kAdd, "description", {{"x"}}}, {kReplace, kRole, {{"AuditAdmin"}}}}), 65);
  for (const char* dn : {kEntry, "CN=ONE,CN=AdminGroup,CN=CONFIGURATION"}) {
    target(dn);
    EXPECT_EQ(modify(roles_), 65) << dn;
  }
}

TEST_F(LastRole, IsForgivenInTheGroupsContainerAndWhereverItsNameIsPartOfTheDn) {
  for (const char* dn :
       {"CN=ADMINGROUP,CN=CONFIGURATION", "CN=A,CN=ONE,CN=ADMINGROUP,CN=CONFIGURATION",
        "CN=ONE,CN=ADMINGROUP,CN=CONFIGURATION,O=X"}) {
    platform.forget();
    target(dn, {"top"}, {{kRole, {"SchemaAdmin"}}});
    platform.fail("ldcf_api_schema_check", 1, 65);
    EXPECT_EQ(modify(roles_), 0) << dn;
    EXPECT_EQ(platform.count("ldcf_api_schema_check"), 2) << dn;
  }
}

TEST_F(LastRole, IsForgivenToEveryCallerButRefusedByAuthorityWhereThatRefuses) {
  as(0x04);  // whom no authority rule concerns
  platform.fail("ldcf_api_schema_check", 1, 65);
  EXPECT_EQ(modify(roles_), 0);
  EXPECT_EQ(platform.count("ldcf_api_schema_check"), 2);
  for (const unsigned flags : {kMember, 0x24U, kServerSupplier}) {
    platform.forget();
    as(flags);
    platform.fail("ldcf_api_schema_check", 1, 65);
    EXPECT_EQ(modify(roles_), 50) << flags;
    expect_answered(50);
    EXPECT_EQ(platform.count("ldcf_api_schema_check"), 1) << flags;
    if (flags == kMember) expect_copy_left();
  }
}

TEST_F(LastRole, ForgivenessSkipsNoWalkOverASuppliersSuffixes) {
  as(kServerSupplier);
  platform.fail("ldcf_api_schema_check", 1, 65);
  EXPECT_EQ(modify({roles_[0], {kAdd, kSuffix, {{"O=A"}}}}), 50);
  EXPECT_THAT(platform.calls({"checkMasterSrvDn"}),
              ElementsAre("checkMasterSrvDn(null, \"\")", "checkMasterSrvDn(\"O=A\", \"\")"));
}

TEST_F(LastRole, RefusalOfTheRolesEndsBeforeTheSecondCheck) {
  trcEvents = kTraceExit;
  EXPECT_EQ(modify({{kAdd, kRole, {{"Wizard"}}}}), 80);
  EXPECT_THAT(steps(), ElementsAre("schema 0", "addmodifyop 0", "root 80"));
  expect_answered(80);
  expect_copy_left();
}

TEST_F(LastRole, SecondCheckComesBetweenTheRolesAndTheRules) {
  trcEvents = kTraceExit;
  EXPECT_EQ(modify(roles_), 0);
  EXPECT_THAT(steps(), ElementsAre("schema 0", "addmodifyop 0", "root 0", "schema 0",
                                   "addmodifyop 0", "supplier 0", "kerberos 0", "audit log 0",
                                   "digest 0", "proxy name 0", "encryption 0"));
  EXPECT_EQ(written(), "2 orv-slapdAdminRole=AuditAdmin");
}

TEST_F(LastRole, CodesOfTheSecondCheckAreAnsweredUnchangedWithItsText) {
  for (const int code : {1, 21, 65}) {
    platform.forget();
    platform.fail("ldcf_api_schema_check", 2, code);
    EXPECT_EQ(modify(roles_), code);
    expect_answered(code);
    EXPECT_EQ(written(), "");
    expect_copy_left();
  }
  platform.forget();
  target(kOne, {"orv-slapdTop"}, {{kRole, {"SchemaAdmin"}}, {"orv-slapdIpAddress", {"192.0.2.1"}}});
  platform.addresses = {"192.0.2.1"};
  platform.at("isValidIPAddressOnSystem", 2, [&] { platform.addresses.clear(); });
  EXPECT_EQ(modify(roles_), 19);
  expect_answered(19, "IP address 192.0.2.1 is not defined for this system.");
  expect_left(5, 1);  // the copy, and that of the address
}

TEST_F(LastRole, SecondCopyIsMadeLikeTheFirstAndOnlyItIsWritten) {
  target(kOne, {"top"}, {{kRole, {"SchemaAdmin"}}, {"description", {"x"}}});
  EXPECT_EQ(modify({{kReplace, kRole, {{"AuditAdmin", "SchemaAdmin"}}},
                    {kDelete, "description", std::nullopt},
                    {kReplace, "seeAlso", {{}}},
                    {kReplace, "sn", {{"K\xC3\xA4se"}}}}),
            0);
  EXPECT_EQ(written(), "2 orv-slapdAdminRole=AuditAdmin,SchemaAdmin|1 description|2 sn=K\xE4se");
  EXPECT_EQ(platform.count("ldap_mods_free"), 2);
}

TEST_F(LastRole, ListOfNothingToWriteIsCopiedTwice) {
  EXPECT_EQ(modify({{kReplace, kRole, {{}}}}), 0);
  EXPECT_EQ(written(), "<null>");
  EXPECT_EQ(platform.count("ldcf_api_schema_check"), 2);
}

TEST_F(LastRole, WithoutAListThereIsNoFirstModification) {
  pb.put(parameter::modifications, static_cast<const void*>(nullptr));
  EXPECT_EQ(traced(0x01030100, [&] { return config_back_modify(&pb); }), 80);
  platform.forget();
  platform.fail("ldcf_api_schema_check", 1, 65);
  EXPECT_EQ(traced(0x01030100, [&] { return config_back_modify(&pb); }), 65);
}

TEST_F(LastRole, ForgivenessAndSecondCheckKnowTheTypeInAnyLetterCase) {
  platform.fail("ldcf_api_schema_check", 1, 65);
  EXPECT_EQ(modify({{kReplace, "ORV-SLAPDADMINROLE", {{"AuditAdmin"}}}}), 0);
  EXPECT_EQ(platform.count("ldcf_api_schema_check"), 2);
}

TEST_F(LastRole, OtherModificationsAreCheckedOnce) {
  EXPECT_EQ(modify({{kReplace, "description", {{"x"}}}, {kReplace, kRole, {{"AuditAdmin"}}}}), 0);
  EXPECT_EQ(platform.count("ldcf_api_schema_check"), 1);
  target(kEntry);
  EXPECT_EQ(modify(roles_), 0);
  EXPECT_EQ(platform.count("ldcf_api_schema_check"), 2);
}

TEST_F(LastRole, ListIsCopiedAgainAfterItWasRewritten) {
  EXPECT_EQ(modify({{kDelete, kRole, {{"SchemaAdmin"}}}}), 0);
  EXPECT_EQ(written(), "2 orv-slapdAdminRole=NoAdmin");
  EXPECT_EQ(platform.count("ldap_mods_free"), 2);  // the first copy, and the one that was written
}

TEST_F(LastRole, FirstCopyGoesBeforeTheSecondIsMade) {
  EXPECT_EQ(modify(roles_), 0);
  EXPECT_THAT(platform.calls({"ldcf_api_schema_check", "xlate_utf8_to_localcp", "ldap_mods_free",
                              "cfg_modify_s"}),
              ElementsAre(testing::StartsWith("ldcf_api_schema_check("),
                          "xlate_utf8_to_localcp(\"AuditAdmin\")",
                          testing::StartsWith("ldcf_api_schema_check("),
                          "ldap_mods_free(\"list\", 1)", "xlate_utf8_to_localcp(\"AuditAdmin\")",
                          "xlate_utf8_to_localcp(\"CN=ONE,CN=ADMINGROUP,CN=CONFIGURATION\")",
                          "cfg_modify_s(session, \"CN=ONE,CN=ADMINGROUP,CN=CONFIGURATION\", \"2 "
                          "orv-slapdAdminRole=AuditAdmin\")",
                          "ldap_mods_free(\"list\", 1)"));
}

TEST_F(LastRole, FailedSecondCopyIsAnswered) {
  platform.fail("xlate_utf8_to_localcp", 2, 21);
  EXPECT_EQ(modify(roles_), 21);
  expect_answered(21);
  EXPECT_EQ(platform.count("ldap_mods_free"), 1);
  platform.release_leaks();
}

// ---- Who is kept out

TEST_F(Modify, CallerWithoutAccessIsAnsweredWith50WhateverTheSchemaSays) {
  as(0x24);
  EXPECT_EQ(modify(), 50);
  expect_answered(50);
  EXPECT_THAT(lines_of_the_handler(), IsEmpty());
  platform.forget();
  platform.fail("ldcf_api_schema_check", 1, 65);
  EXPECT_EQ(modify(), 50);
  expect_answered(50);
  EXPECT_THAT(lines_of_the_handler(), IsEmpty());
  EXPECT_EQ(platform.count("ldcf_api_schema_check"), 1);
}

TEST_F(Modify, OnlyExactly36IsKeptOut) {
  trcEvents = kTraceExit;
  operation.roles = 0x20;
  for (const unsigned flags : {0x2CU, 0x34U, 0x64U, 0x124U, 0x04U, 0x20U}) {
    platform.forget();
    as(flags);
    EXPECT_EQ(modify(), 0) << flags;
  }
  target(kDirectory);
  platform.supplied = {{"", 1}};
  for (const unsigned flags : {0x25U, 0x26U, 0x27U}) {
    platform.forget();
    as(flags);
    EXPECT_EQ(modify({{kAdd, kSuffix, {{"O=A"}}}}), 0) << flags;
  }
  as(0x24);
  EXPECT_EQ(modify(), 50);
}

TEST_F(Modify, CallerWithoutAccessIsNoSupplierAndNothingIsCopied) {
  trcEvents = kTraceExit;
  as(0x24);
  EXPECT_EQ(modify(), 50);
  EXPECT_THAT(steps(), ElementsAre("schema 0"));
  EXPECT_EQ(platform.count("checkMasterSrvDn"), 0);
}

TEST_F(Modify, RefusalOfThePrimaryAdministratorsRuleEndsBeforeTheOthers) {
  trcEvents = kTraceExit;
  target(kTop);
  EXPECT_EQ(modify({{kReplace, "orv-slapdKrbAdminDN", {{"cn=x"}}}}), 80);
  EXPECT_THAT(steps(), ElementsAre("schema 0", "addmodifyop 0", "root 80"));
  expect_answered(80);
  expect_copy_left();
}

TEST_F(Modify, OthersThanAdministratorsMeetOnlyTheRules) {
  trcEvents = kTraceExit;
  for (const unsigned flags : {0U, 0x04U, 0x08U, 0x10U, 0x20U, 0x2CU & ~0x08U & ~0x04U}) {
    platform.forget();
    as(flags);
    EXPECT_EQ(modify(), 0) << flags;
    EXPECT_THAT(steps(), ElementsAre("schema 0", "addmodifyop 0", "supplier 0", "kerberos 0",
                                     "audit log 0", "digest 0", "proxy name 0", "encryption 0"));
  }
}

TEST_F(Modify, PrimaryAdministratorIsNotAskedForRolesAlsoWhenItIsAMember) {
  trcEvents = kTraceExit;
  for (const unsigned flags : {kPrimary, 0x1CU}) {
    platform.forget();
    as(flags);
    EXPECT_EQ(modify(), 0);
    EXPECT_THAT(steps(), Contains("root 0"));
    EXPECT_THAT(steps(), Not(Contains("member 0")));
  }
}

// ---- Suppliers

class ModifyBySupplier : public Modify {
 protected:
  ModifyBySupplier() {
    target(kDirectory);
    as(kSuffixSupplier, "CN=S");
    platform.supplied = {{"O=A", 5}, {"O=B", 6}};
  }
  const Modifications add_a_ = {{kAdd, kSuffix, {{"O=A"}}}};
};

TEST_F(ModifyBySupplier, AddsItsOwnSuffixes) {
  EXPECT_EQ(modify({{kAdd, kSuffix, {{"O=A", "O=B"}}}}), 0);
  expect_answered(0);
  EXPECT_THAT(platform.calls({"checkMasterSrvDn"}),
              ElementsAre("checkMasterSrvDn(null, \"CN=S\")", "checkMasterSrvDn(\"O=A\", \"CN=S\")",
                          "checkMasterSrvDn(\"O=B\", \"CN=S\")"));
  EXPECT_EQ(operation.master_server_result, 6);  // the last answer
  EXPECT_EQ(written(), "0 orv-slapdSuffix=O=A,O=B");
}

TEST_F(ModifyBySupplier, ForeignSuffixEndsTheWalkWith50) {
  EXPECT_EQ(modify({{kAdd, kSuffix, {{"O=A", "O=X", "O=B"}}}, {kAdd, kSuffix, {{"O=B"}}}}), 50);
  expect_answered(50);
  EXPECT_EQ(platform.count("checkMasterSrvDn"), 3);
  EXPECT_EQ(operation.master_server_result, 0);
}

TEST_F(ModifyBySupplier, OfTheServerNeedsNoSuffixOfItsOwn) {
  platform.supplied = {{"", 1}};
  for (const unsigned flags : {kServerSupplier, kSuffixSupplier, 0x03U}) {
    platform.forget();
    as(flags, "CN=S");
    EXPECT_EQ(modify({{kAdd, kSuffix, {{"O=X"}}}}), 0) << flags;
    EXPECT_EQ(platform.count("checkMasterSrvDn"), 1);
    EXPECT_EQ(operation.master_server_result, 1);
  }
}

TEST_F(ModifyBySupplier, OtherAttributesAndCodesAreRefused) {
  target(kDirectory, {"top"}, {{"description", {"O=A"}}, {kSuffix, {"O=A"}}});
  for (const int server : {0, 1}) {
    platform.supplied[""] = server;
    for (const Modifications& list : {Modifications{{kReplace, kSuffix, {{"O=A"}}}},
                                      Modifications{{kDelete, kSuffix, {{"O=A"}}}},
                                      Modifications{{kReplace, "description", {{"O=A"}}}}}) {
      platform.forget();
      EXPECT_EQ(modify(list), 50);
      expect_answered(50);
    }
  }
}

TEST_F(ModifyBySupplier, OtherAttributeBehindASuffixIsRefused) {
  for (const int server : {0, 1}) {
    platform.supplied[""] = server;
    platform.forget();
    EXPECT_EQ(modify({{kAdd, kSuffix, {{"O=A"}}}, {kAdd, "description", {{"x"}}}}), 50);
    expect_answered(50);
  }
}

TEST_F(ModifyBySupplier, AttributeAndEntryAreKnownInAnyLetterCase) {
  target("cn=directory,cn=rdbm backends,cn=orv directory,cn=schemas,cn=configuration");
  EXPECT_EQ(modify({{kAdd, "ORV-slapdsuffix", {{"O=A"}}}}), 0);
}

TEST_F(ModifyBySupplier, OtherEntriesAreRefused) {
  for (const char* dn : {kEntry, kTop, kBackends}) {
    platform.forget();
    target(dn);
    EXPECT_EQ(modify(add_a_), 50) << dn;
    expect_answered(50);
    EXPECT_THAT(lines_of_the_handler(), IsEmpty()) << dn;
  }
}

TEST_F(ModifyBySupplier, RefusalOfTheSchemaSkipsTheWalkButNotTheFirstQuestion) {
  platform.fail("ldcf_api_schema_check", 1, 65);
  EXPECT_EQ(modify({{kAdd, "description", {{"x"}}}}), 65);
  expect_answered(65);
  EXPECT_EQ(platform.count("checkMasterSrvDn"), 1);
  platform.forget();
  platform.supplied[""] = 1;
  platform.fail("ldcf_api_schema_check", 1, 21);
  EXPECT_EQ(modify(add_a_), 21);
}

TEST_F(ModifyBySupplier, RefusalOfTheSchemaSkipsTheWalkOverSuffixesOfItsOwn) {
  platform.fail("ldcf_api_schema_check", 1, 65);
  EXPECT_EQ(modify(add_a_), 65);
  expect_answered(65);
  EXPECT_THAT(platform.calls({"checkMasterSrvDn"}),
              ElementsAre("checkMasterSrvDn(null, \"CN=S\")"));
  EXPECT_EQ(operation.master_server_result, 0);
}

TEST_F(ModifyBySupplier, RefusalOfTheSchemaNotesTheFirstAnswerNevertheless) {
  platform.supplied[""] = 4;
  platform.fail("ldcf_api_schema_check", 1, 65);
  EXPECT_EQ(modify(add_a_), 65);
  EXPECT_EQ(operation.master_server_result, 4);
}

TEST_F(ModifyBySupplier, WalkGoesOnBehindAnotherAttribute) {
  EXPECT_EQ(modify({{kAdd, "description", {{"x"}}}, {kAdd, kSuffix, {{"O=A"}}}}), 50);
  expect_answered(50);
  EXPECT_THAT(
      platform.calls({"checkMasterSrvDn"}),
      ElementsAre("checkMasterSrvDn(null, \"CN=S\")", "checkMasterSrvDn(\"O=A\", \"CN=S\")"));
  EXPECT_EQ(operation.master_server_result, 5);
}

TEST_F(ModifyBySupplier, WalkEndsAtTheFirstRefusal) {
  EXPECT_EQ(modify({{kAdd, kSuffix, {{"O=X"}}}, {kAdd, kSuffix, {{"O=A"}}}}), 50);
  EXPECT_EQ(platform.count("checkMasterSrvDn"), 2);
  EXPECT_EQ(operation.master_server_result, 0);
}

TEST_F(ModifyBySupplier, WalkAsksForEveryModification) {
  EXPECT_EQ(modify({{kAdd, kSuffix, {{"O=A"}}}, {kAdd, kSuffix, {{"O=X"}}}}), 50);
  expect_answered(50);
  EXPECT_EQ(platform.count("checkMasterSrvDn"), 3);
  platform.forget();
  EXPECT_EQ(modify({{kAdd, kSuffix, {{"O=A"}}}, {kAdd, kSuffix, {{"O=B"}}}}), 0);
  EXPECT_EQ(platform.count("checkMasterSrvDn"), 3);
  EXPECT_EQ(written(), "0 orv-slapdSuffix=O=A,O=B");
}

TEST_F(ModifyBySupplier, WalkLooksAtNoCodesAndNeedsNoValues) {
  // The codes are looked at after the walk; each answer of the walk is noted all the same.
  target(kDirectory, {"top"}, {{kSuffix, {"O=A"}}});
  EXPECT_EQ(modify({{kReplace, kSuffix, {{"O=A"}}}}), 50);
  EXPECT_EQ(operation.master_server_result, 5);
  platform.forget();
  EXPECT_EQ(modify({{kAdd, kSuffix, std::nullopt}}), 0);
  EXPECT_EQ(platform.count("checkMasterSrvDn"), 1);
  EXPECT_EQ(operation.master_server_result, 0);
}

TEST_F(ModifyBySupplier, EveryModificationMustAddToTheSuffixes) {
  target(kDirectory, {"top"}, {{kSuffix, {"O=B"}}});
  for (const int server : {0, 1}) {
    platform.supplied[""] = server;
    for (const int code : {kDelete, kReplace}) {
      platform.forget();
      EXPECT_EQ(modify({{kAdd, kSuffix, {{"O=A"}}}, {code, kSuffix, {{"O=B"}}}}), 50);
      expect_answered(50);
    }
    platform.forget();
    EXPECT_EQ(modify({{kAdd, kSuffix, {{"O=A"}}}}), 0);
  }
}

TEST_F(ModifyBySupplier, EntryIsKnownByItsWholeDn) {
  for (const std::string& dn :
       {std::string("CN=X,") + kDirectory, kDirectory + std::string(",O=X")}) {
    platform.forget();
    target(dn);
    EXPECT_EQ(modify(add_a_), 50) << dn;
  }
}

TEST_F(ModifyBySupplier, WhoIsAlsoAnAdministratorMeetsThoseRulesToo) {
  trcEvents = kTraceExit;
  as(0x0D, "CN=S");
  EXPECT_EQ(modify({{kReplace, "description", {{"x"}}}}), 50);
  platform.forget();
  platform.supplied[""] = 1;
  EXPECT_EQ(modify(add_a_), 0);
  EXPECT_THAT(steps(), Contains("root 0"));
  platform.forget();
  as(0x15, "CN=S");
  EXPECT_EQ(modify(add_a_), 50);  // a member without roles
  expect_copy_left();
  platform.forget();
  operation.roles = 0x20;
  EXPECT_EQ(modify(add_a_), 0);
  EXPECT_THAT(steps(), Contains("member 0"));
}

TEST_F(ModifyBySupplier, MeetsTheRulesButNoRoles) {
  trcEvents = kTraceExit;
  EXPECT_EQ(modify(add_a_), 0);
  EXPECT_THAT(steps(), ElementsAre("schema 0", "addmodifyop 0", "supplier 0", "kerberos 0",
                                   "audit log 0", "digest 0", "proxy name 0", "encryption 0"));
}

// ---- The copy

TEST_F(Modify, CopyHasEveryValueInTheLocalCodePageUnderItsCodeWithoutTheFlag) {
  target(kEntry, {"top"}, {{"seeAlso", {"a", "b"}}});
  EXPECT_EQ(modify({{kReplace, "description", {{"K\xC3\xA4se", "b"}}},
                    {kDelete, "seeAlso", std::nullopt},
                    {kAdd, "sn", {{"c"}}}}),
            0);
  EXPECT_EQ(written(), "2 description=K\xE4se,b|1 seeAlso|0 sn=c");
}

TEST_F(Modify, ModificationWithoutValuesNeedsNoFlagOfCountedOnes) {
  target(kEntry, {"top"}, {{"seeAlso", {"a", "b"}}});
  EXPECT_EQ(modify({{kModDelete, "seeAlso", std::nullopt}}), 0);
  EXPECT_EQ(written(), "1 seeAlso");
}

TEST_F(Modify, EmptyArrayIsLeftOutOfWhatIsWrittenAndStillChecked) {
  trcEvents = kTraceExit;
  EXPECT_EQ(modify({{kReplace, "seeAlso", {{}}}, {kReplace, "description", {{"x"}}}}), 0);
  EXPECT_EQ(written(), "2 description=x");
  platform.forget();
  EXPECT_EQ(modify({{kReplace, "seeAlso", {{}}}}), 0);
  EXPECT_EQ(written(), "<null>");
  EXPECT_EQ(platform.count("ldap_mods_free"), 0);
  EXPECT_THAT(platform.calls({"attr_delete"}), ElementsAre("attr_delete(\"seeAlso\", null)"));
  EXPECT_THAT(steps(), ElementsAre("schema 0", "root 0", "supplier 0", "kerberos 0", "audit log 0",
                                   "digest 0", "proxy name 0", "encryption 0"));
}

TEST_F(Modify, ValueThatCannotBeTranslatedEndsTheCopyWithItsCode) {
  platform.fail("xlate_utf8_to_localcp", 1, 21);
  EXPECT_EQ(modify({{kReplace, "description", {{"a", "b"}}}, {kReplace, "cn", {{"c"}}}}), 21);
  expect_answered(21);
  EXPECT_EQ(platform.count("xlate_utf8_to_localcp"), 1);
  expect_left(4, 0);  // array, record, type and the empty array of values
}

// ---- Members of the administrative group

class ModifyByMember : public Modify {
 protected:
  ModifyByMember() { as(kMember, "CN=ONE"); }

  // Which of all sets of role bits let a member change an entry.
  void expect_roles(const std::function<bool(unsigned)>& allowed,
                    const Modifications& list = kAnything) {
    for (unsigned roles = 0; roles < 0x80; ++roles) {
      platform.forget();
      operation.roles = roles;
      connection.roles = roles;
      const int expected = allowed(roles) ? 0 : 50;
      EXPECT_EQ(modify(list), expected) << roles;
      if (expected == 50) platform.release_leaks();
    }
  }
};

TEST_F(ModifyByMember, OrdinaryEntryNeedsTheServerConfigurationRole) {
  expect_roles([](unsigned roles) { return (roles & 0x20) != 0; });
}

TEST_F(ModifyByMember, AuditLogsNeedTheAuditRole) {
  for (const char* dn :
       {kAudit, kAdminAudit, "cn=admin audit,cn=log management,cn=configuration"}) {
    target(dn);
    expect_roles([](unsigned roles) { return (roles & 0x02) != 0; });
  }
}

TEST_F(ModifyByMember, DefaultLogNeedsTheAuditOrTheServerConfigurationRole) {
  target(kDefaultLog);
  expect_roles([](unsigned roles) { return (roles & 0x22) != 0; });
}

TEST_F(ModifyByMember, ReplicationNeedsAReplicationOrTheServerConfigurationRole) {
  for (const char* dn : {kReplication, "cn=replication,cn=configuration"}) {
    target(dn);
    expect_roles([](unsigned roles) { return (roles & 0x2C) != 0; });
  }
}

TEST_F(ModifyByMember, BackendsNeedTheSchemaOrTheServerConfigurationRole) {
  target(kBackends);
  expect_roles([](unsigned roles) { return (roles & 0x30) != 0; });
}

TEST_F(ModifyByMember, NamedEntriesAreKnownInAnyLetterCase) {
  // Each asks for other bits than an ordinary entry would.
  target("cn=default,cn=log management,cn=configuration");
  expect_roles([](unsigned roles) { return (roles & 0x22) != 0; });
  target("cn=audit,cn=log management,cn=configuration");
  expect_roles([](unsigned roles) { return (roles & 0x02) != 0; });
  target("cn=orv directory,cn=schemas,cn=configuration");
  expect_roles([](unsigned roles) { return (roles & 0x30) != 0; });
  target("cn=master server,cn=configuration");
  expect_roles([](unsigned roles) { return (roles & 0x34) == 0x34; });
}

TEST_F(ModifyByMember, NamedEntriesAreKnownByTheirWholeDns) {
  for (const char* dn : {kDefaultLog, kAdminAudit, kReplication, kBackends, kMaster}) {
    target(std::string("CN=Y,") + dn);
    expect_roles([](unsigned roles) { return (roles & 0x20) != 0; });
    target(dn + std::string(",O=Y"));
    expect_roles([](unsigned roles) { return (roles & 0x20) != 0; });
  }
}

TEST_F(ModifyByMember, TopEntryAndItsOtherEntriesAreOrdinary) {
  for (const char* dn : {kTop, kDirectory, "CN=KERBEROS,CN=CONFIGURATION"}) {
    target(dn);
    expect_roles([](unsigned roles) { return (roles & 0x20) != 0; });
  }
}

TEST_F(ModifyByMember, GroupIsFoundAnywhereInTheDn) {
  target("CN=ONE,CN=AdminGroup,CN=CONFIGURATION,O=X");
  expect_roles([](unsigned) { return true; });
}

TEST_F(ModifyByMember, PassThroughIsFoundAnywhereInTheDn) {
  for (const char* dn :
       {"CN=PASSTHROUGH AUTHENTICATION,CN=CONFIGURATION,cn=admingroup,cn=configuration",
        "CN=P,CN=PASSTHROUGH AUTHENTICATION,CN=CONFIGURATION,cn=admingroup,"
        "cn=configuration"}) {
    target(dn);
    expect_roles([](unsigned roles) { return (roles & 0x20) != 0; });
  }
}

TEST_F(ModifyByMember, PassThroughNeedsTheServerConfigurationRoleInAnyLetterCase) {
  for (const char* dn : {kPassThrough, "cn=p,cn=passthrough authentication,cn=configuration"}) {
    target(dn);
    expect_roles([](unsigned roles) { return (roles & 0x20) != 0; });
  }
}

TEST_F(ModifyByMember, PassThroughInsideOfTheGroupIsKnownByItsBytes) {
  target("CN=PASSTHROUGH AUTHENTICATION,CN=CONFIGURATION,cn=admingroup,cn=configuration");
  expect_roles([](unsigned roles) { return (roles & 0x20) != 0; });
  target("CN=Passthrough Authentication,CN=CONFIGURATION,cn=admingroup,cn=configuration");
  expect_roles([](unsigned) { return true; });
}

TEST_F(ModifyByMember, SupplierBelowPassThroughHasToPassBothRules) {
  target(kPassThrough, {"orv-slapdSupplier"});
  expect_roles([](unsigned roles) { return (roles & 0x34) == 0x34; });
}

TEST_F(ModifyByMember, MasterServerNeedsThreeRolesTogether) {
  target(kMaster);
  expect_roles([](unsigned roles) { return (roles & 0x34) == 0x34; });
}

TEST_F(ModifyByMember, SupplierNeedsThreeRolesTogetherUnderAnyDnAndInAnyLetterCase) {
  for (const char* name : {"orv-slapdSupplier", "ORV-SLAPDSUPPLIER"}) {
    target(kEntry, {"top", name, "x"});
    expect_roles([](unsigned roles) { return (roles & 0x34) == 0x34; });
  }
  target(kEntry, {"orv-slapdSupplierX"});
  expect_roles([](unsigned roles) { return (roles & 0x20) != 0; });
}

TEST_F(ModifyByMember, SupplierInsideOfTheGroupNeedsThreeRolesAlsoForItsOwnPassword) {
  target(kOne, {"orv-slapdSupplier"}, {{"orv-slapdAdminDN", {"cn=one"}}});
  expect_roles([](unsigned roles) { return (roles & 0x34) == 0x34; },
               {{kReplace, "orv-slapdAdminPW", {{"new"}}}});
}

TEST_F(ModifyByMember, SupplierUnderAProtectedDnHasToPassBothRules) {
  target(kAudit, {"orv-slapdSupplier"});
  expect_roles([](unsigned roles) { return (roles & 0x36) == 0x36; });
}

TEST_F(ModifyByMember, EntriesBelowANamedOneAreOrdinary) {
  target("CN=Y,CN=AUDIT,CN=LOG MANAGEMENT,CN=CONFIGURATION");
  expect_roles([](unsigned roles) { return (roles & 0x20) != 0; });
}

TEST_F(ModifyByMember, RolesAreThoseOfTheOperation) {
  connection.roles = 0x3E;
  operation.roles = 0;
  EXPECT_EQ(modify(), 50);
  expect_copy_left();
  platform.forget();
  connection.roles = 0;
  operation.roles = 0x20;
  EXPECT_EQ(modify(), 0);
}

TEST_F(ModifyByMember, WithoutRolesIsRefusedBeforeTheEntryIsRead) {
  EXPECT_EQ(modify(), 50);
  expect_answered(50);
  EXPECT_EQ(platform.count("cfg_search_s"), 1);  // that of the schema check
  for (const DebugLine& line : platform.debug_lines()) {
    EXPECT_NE(line.category, error("").category) << line.text;
  }
  expect_copy_left();
}

TEST_F(ModifyByMember, OtherBitsAreNoRoles) {
  operation.roles = 0x41;
  platform.file[std::string(kEntry) + "?(objectclass=*)"] = {};
  EXPECT_EQ(modify(), 50);  // and not 32: the entry is not read
  EXPECT_EQ(platform.count("cfg_search_s"), 1);
  expect_copy_left();
}

TEST_F(ModifyByMember, EntryIsReadBeforeTheRolesAreHeldAgainstIt) {
  operation.roles = 0x02;  // not enough for this entry
  platform.file[std::string(kEntry) + "?(objectclass=*)"] = {};
  EXPECT_EQ(modify(), 32);
  expect_copy_left();
}

TEST_F(ModifyByMember, RolesThatAreMissingEndBeforeTheGroupsOwnRule) {
  trcEvents = kTraceExit;
  target(kAudit);
  operation.roles = 0x20;
  EXPECT_EQ(modify(), 50);
  EXPECT_THAT(steps(), ElementsAre("schema 0", "addmodifyop 0"));
  expect_copy_left();
  platform.forget();
  operation.roles = 0x02;
  connection.roles = 0x20;  // which only the group's own rule asks
  EXPECT_EQ(modify(), 50);
  EXPECT_THAT(steps(), ElementsAre("schema 0", "addmodifyop 0", "member 50"));
  expect_copy_left();
}

TEST_F(ModifyByMember, MissingEntryIsAnsweredTheSameWayWithoutTheTrace) {
  debug_off();
  operation.roles = 0x20;
  platform.file[std::string(kEntry) + "?(objectclass=*)"] = {};
  EXPECT_EQ(modify(), 32);
  expect_answered(32);
  expect_copy_left();
}

TEST_F(ModifyByMember, ObjectClassesAreReleasedAlsoAfterARefusal) {
  operation.roles = 0x02;
  EXPECT_EQ(modify(), 50);
  EXPECT_EQ(platform.count("cfg_value_free"), 1);
  EXPECT_THAT(
      platform.calls({"cfg_get_values", "cfg_value_free"}),
      ElementsAre("cfg_get_values(session, record 1, \"OBJECTCLASS\")", "cfg_value_free()"));
  EXPECT_THAT(lines_of_the_handler(), IsEmpty());
  expect_copy_left();
}

TEST_F(ModifyByMember, SupplierMayStandAnywhereAmongTheClasses) {
  for (const std::vector<std::string>& classes :
       {std::vector<std::string>{"orv-slapdSupplier", "top"}, {"top", "orv-slapdSupplier"}}) {
    target(kEntry, classes);
    expect_roles([](unsigned roles) { return (roles & 0x34) == 0x34; });
  }
}

TEST_F(ModifyByMember, WithoutRolesMayChangeItsOwnPassword) {
  target(kOne, {"top"}, {{"orv-slapdAdminDN", {"cn=one"}}});
  EXPECT_EQ(modify({{kReplace, "orv-slapdAdminPW", {{"new"}}}}), 0);
  expect_answered(0);
  EXPECT_EQ(written(), "2 orv-slapdAdminPW=new");
}

TEST_F(ModifyByMember, LastWordIsThatOfTheGroupsOwnRule) {
  trcEvents = kTraceExit;
  target(kOne, {"top"}, {{"orv-slapdAdminDN", {"cn=two"}}});
  EXPECT_EQ(modify({{kReplace, "orv-slapdAdminPW", {{"new"}}}}), 50);
  EXPECT_THAT(steps(), ElementsAre("schema 0", "addmodifyop 0", "member 50"));
  expect_answered(50);
  expect_copy_left();
}

TEST_F(ModifyByMember, GroupIsFoundInAnyLetterCaseWhereRolesAreAsked) {
  target("cn=one,cn=admingroup,cn=configuration");
  expect_roles([](unsigned) { return true; });
}

TEST_F(ModifyByMember, ObjectClassesAreReadAndReleased) {
  operation.roles = 0x20;
  EXPECT_EQ(modify(), 0);
  EXPECT_THAT(platform.calls({"cfg_search_s"}),
              Contains("cfg_search_s(session, \"CN=X,CN=CONFIGURATION\", 0, \"(objectclass=*)\", "
                       "[OBJECTCLASS], 0)"));
  EXPECT_THAT(platform.calls({"cfg_get_values", "cfg_msgfree", "cfg_value_free"}),
              ElementsAre("cfg_msgfree(chain)",  // of the schema check
                          "cfg_get_values(session, record 1, \"OBJECTCLASS\")",
                          "cfg_msgfree(chain)", "cfg_value_free()"));
}

TEST_F(ModifyByMember, EntryIsReadUnderTheDnOfTheClient) {
  operation.roles = 0x20;
  target("CN=K\xC3\xA4SE,CN=CONFIGURATION");
  EXPECT_EQ(modify(), 0);
  EXPECT_THAT(platform.calls({"cfg_search_s"}),
              Contains("cfg_search_s(session, \"CN=K\xC3\xA4SE,CN=CONFIGURATION\", 0, "
                       "\"(objectclass=*)\", [OBJECTCLASS], 0)"));
  EXPECT_THAT(platform.calls({"cfg_modify_s"}),
              ElementsAre("cfg_modify_s(session, \"CN=K\xE4SE,CN=CONFIGURATION\", \"2 "
                          "description=text\")"));
}

TEST_F(ModifyByMember, ObjectClassesGoAfterTheirChainAndBeforeTheGroupsOwnRuleReads) {
  target(kOne, {"top"}, {{"orv-slapdAdminDN", {"cn=one"}}});
  EXPECT_EQ(modify({{kReplace, "orv-slapdAdminPW", {{"new"}}}}), 0);
  const auto calls =
      platform.calls({"cfg_get_values", "cfg_msgfree", "cfg_value_free", "cfg_search_s"});
  const auto read =
      std::find(calls.begin(), calls.end(), "cfg_get_values(session, record 1, \"OBJECTCLASS\")");
  ASSERT_GT(calls.end() - read, 3);
  EXPECT_THAT(std::vector<std::string>(read + 1, read + 4),
              ElementsAre("cfg_msgfree(chain)", "cfg_value_free()",
                          "cfg_search_s(session, \"CN=ONE,CN=ADMINGROUP,CN=CONFIGURATION\", 0, "
                          "\"objectclass=*\", null, 0)"));
}

TEST_F(ModifyByMember, EntryThatGoesMeanwhileGives32AndItsLine) {
  operation.roles = 0x20;
  platform.file[std::string(kEntry) + "?(objectclass=*)"] = {};
  EXPECT_EQ(modify(), 32);
  expect_answered(32);
  EXPECT_THAT(lines_of_the_handler(),
              ElementsAre(error("Error - config_back_modify: entry CN=X,CN=CONFIGURATION does not "
                                "exist!\n")));
  expect_copy_left();
}

TEST_F(ModifyByMember, CodeOfTheReaderIsAnswered) {
  operation.roles = 0x20;
  // With a result all the same, which is released.
  platform.file[std::string(kEntry) + "?(objectclass=*)"] = {{{kEntry, {{"cn", {"x"}}}}}, 7};
  EXPECT_EQ(modify(), 80);
  expect_answered(80);
  expect_copy_left();
}

TEST_F(ModifyByMember, ObjectClassesThatCannotBeReadGiveTheErrorNumberOr16) {
  operation.roles = 0x20;
  platform.file[std::string(kEntry) + "?(objectclass=*)"] = {{{kEntry, {{"cn", {"x"}}}}}};
  EXPECT_EQ(modify(), 16);
  expect_answered(16);
  expect_copy_left();
  target(kEntry);
  platform.file.erase(std::string(kEntry) + "?(objectclass=*)");
  for (const int number : {0, 90}) {  // no array at all: 16 whatever the number
    platform.forget();
    platform.fail("cfg_get_values", 1, number);
    EXPECT_EQ(modify(), 16);
    expect_copy_left();
  }
  platform.forget();
  platform.fail("cfg_get_errno", 2, 53);  // with an array; the first is asked by the schema check
  EXPECT_EQ(modify(), 53);
  expect_answered(53);
  expect_copy_left();
}

// ---- The rules in their order

struct Refusal {
  const char* name;
  const char* dn;
  Modifications list;
  std::function<void(Platform&)> script;
  int code;
  std::vector<std::string> steps;
  const char* text = "";
};

void PrintTo(const Refusal& refusal, std::ostream* out) {
  *out << refusal.name;
}

class ModifyRefused : public Modify, public testing::WithParamInterface<Refusal> {};

TEST_P(ModifyRefused, IsAnsweredWithTheCodeAndNoLaterRuleIsAsked) {
  const Refusal& refusal = GetParam();
  trcEvents = kTraceExit;
  as(0x04);  // whom no authority rule concerns
  platform.admin_policy = true;
  target(refusal.dn);
  refusal.script(platform);
  EXPECT_EQ(modify(refusal.list), refusal.code);
  EXPECT_EQ(steps(), refusal.steps);
  EXPECT_THAT(platform.calls({"xlate_utf8_to_localcp"}),
              Not(Contains("xlate_utf8_to_localcp(\"" + std::string(refusal.dn) + "\")")));
  EXPECT_EQ(written(), "");
  expect_answered(refusal.code, refusal.text);
  expect_copy_left();
}

const auto kNoScript = [](Platform&) {};

INSTANTIATE_TEST_SUITE_P(
    Rules, ModifyRefused,
    testing::Values(Refusal{"Supplier",
                            kEntry,
                            {{kReplace, "orv-slapdMasterDN", std::nullopt}},
                            kNoScript,
                            80,
                            {"schema 0", "addmodifyop 0", "supplier 80"}},
                    Refusal{"Kerberos",
                            "CN=KERBEROS,CN=CONFIGURATION",
                            {{kReplace, "orv-slapdKrbAdminDN", std::nullopt}},
                            kNoScript,
                            50,
                            {"schema 0", "addmodifyop 0", "supplier 0", "kerberos 50"}},
                    Refusal{
                        "AuditLog",
                        kEntry,
                        {{kReplace, "orv-slapdLog", {{"/var/ldap/V6.0/audit.log"}}}},
                        kNoScript,
                        53,
                        {"schema 0", "addmodifyop 0", "supplier 0", "kerberos 0", "audit log 53"}},
                    Refusal{"Digest",
                            "CN=DIGEST,CN=CONFIGURATION",
                            {{kReplace, "orv-slapdDigestAdminUser", {{"root"}}}},
                            kNoScript,
                            50,
                            {"schema 0", "addmodifyop 0", "supplier 0", "kerberos 0", "audit log 0",
                             "digest 50"}},
                    Refusal{"Policy",
                            "cn=pwdpolicy admin,cn=configuration",
                            {{kReplace, "pwdMinLength", {{"9"}}}},
                            [](Platform& p) { p.fail("validate_new_settings", 1, 19); },
                            19,
                            {"schema 0", "addmodifyop 0", "supplier 0", "kerberos 0", "audit log 0",
                             "digest 0", "policy 19"}},
                    Refusal{"Password",
                            kEntry,
                            {{kReplace, "orv-slapdMasterPW", {{"new"}}}},
                            kNoScript,
                            16,
                            {"schema 0", "addmodifyop 0", "supplier 0", "kerberos 0", "audit log 0",
                             "digest 0", "password 16"}},
                    Refusal{"ProxyName",
                            kEntry,
                            {{kReplace, "orv-slapdProxySplitName", {{"a b"}}}},
                            kNoScript,
                            21,
                            {"schema 0", "addmodifyop 0", "supplier 0", "kerberos 0", "audit log 0",
                             "digest 0", "password 0", "proxy name 21"}},
                    Refusal{"ProxyNameThatIsTaken",
                            kEntry,
                            {{kReplace, "orv-slapdProxySplitName", {{"taken"}}}},
                            [](Platform& p) {
                              p.file
                                  ["CN=PROXYDB,CN=PROXY BACKENDS,CN=ORV DIRECTORY,CN=SCHEMAS,"
                                   "CN=CONFIGURATION"] = {
                                  {{"cn=split", {{"orv-slapdProxySplitName", {"taken"}}}}}};
                            },
                            68,
                            {"schema 0", "addmodifyop 0", "supplier 0", "kerberos 0", "audit log 0",
                             "digest 0", "password 0", "proxy name 68"}},
                    Refusal{"Encryption",
                            kTop,
                            {{kReplace, "orv-slapdPwEncryption", {{"rot13"}}}},
                            kNoScript,
                            21,
                            {"schema 0", "addmodifyop 0", "supplier 0", "kerberos 0", "audit log 0",
                             "digest 0", "password 0", "proxy name 0", "encryption 21"},
                            "orv-slapdPwEncryption value is not one of the supported values."},
                    Refusal{"EncryptionThatIsNotAllowed",
                            kTop,
                            {{kReplace, "orv-slapdPwEncryption", {{"known"}}}},
                            [](Platform& p) { p.fail("convertPWEncryptionMethod", 1, 1); },
                            53,
                            {"schema 0", "addmodifyop 0", "supplier 0", "kerberos 0", "audit log 0",
                             "digest 0", "password 0", "proxy name 0", "encryption 53"},
                            "requested orv-slapdPwEncryption value is not allowed by current "
                            "configuration."}),
    [](const auto& instance) { return std::string(instance.param.name); });

TEST_F(Modify, RulesGetTheServersListAndNotTheCopy) {
  // The third rule and the last one see the client's bytes, the file its own.
  target(kTop);
  EXPECT_EQ(modify({{kReplace, "orv-slapdLog", {{"/K\xC3\xA4se"}}},
                    {kReplace, "orv-slapdPwEncryption", {{"K\xC3\xA4se"}}}}),
            21);
  EXPECT_THAT(platform.calls({"realpath"}), Contains("realpath(\"/K\xC3\xA4se\")"));
  EXPECT_THAT(platform.calls({"convertPWEncryptionMethod"}),
              ElementsAre("convertPWEncryptionMethod(\"K\xC3\xA4se\", 16)"));
  expect_copy_left();
}

TEST_F(Modify, AuditLogMayBeGivenTheFileThatItHas) {
  platform.file[std::string(kAudit) + "?(objectclass=orv-auditConfig)"] = {
      {{kAudit, {{"orv-slapdLog", {"/log/audit"}}}}}};
  target(kAudit);
  EXPECT_EQ(modify({{kReplace, "orv-slapdLog", {{"/log/audit"}}}}), 0);
  EXPECT_EQ(written(), "2 orv-slapdLog=/log/audit");
  platform.forget();
  target(kDefaultLog);
  EXPECT_EQ(modify({{kReplace, "orv-slapdLog", {{"/log/audit"}}}}), 53);
  expect_copy_left();
}

TEST_F(Modify, RulesAskTheOperationAndTheConnectionEachForItsOwn) {
  // The connection's flags count for the master server, the operation's for the Kerberos entry.
  as(0x04);
  connection.authority = kMember;
  target(kMaster);
  EXPECT_EQ(modify(), 50);
  expect_copy_left();
  target("CN=KERBEROS,CN=CONFIGURATION");
  connection.authority = kPrimary;
  EXPECT_EQ(modify({{kDelete, "orv-slapdKrbAdminDN", std::nullopt}}), 16);
  target("CN=KERBEROS,CN=CONFIGURATION", {"top"}, {{"orv-slapdKrbAdminDN", {"orv-kn=a"}}});
  EXPECT_EQ(modify({{kDelete, "orv-slapdKrbAdminDN", std::nullopt}}), 50);
  platform.release_leaks();
  as(kPrimary);
  connection.authority = 0x24;
  EXPECT_EQ(modify({{kDelete, "orv-slapdKrbAdminDN", std::nullopt}}), 0);
}

TEST_F(Modify, PasswordsAreVerifiedForTheOperationOnlyWhileThePolicyIsOn) {
  target(kTop, {"top"}, {{"orv-slapdAdminPW", {"old"}}, {"orv-slapdAdminDN", {"cn=root"}}});
  const Modifications list = {{kReplace, "orv-slapdAdminPW", {{"new"}}}};
  EXPECT_EQ(modify(list), 0);
  EXPECT_EQ(platform.count("verify_admin_password"), 0);
  platform.admin_policy = true;
  EXPECT_EQ(modify(list), 0);
  EXPECT_THAT(platform.calls({"verify_admin_password"}),
              ElementsAre("verify_admin_password(\"new\", \"old\", operation)"));
}

TEST_F(Modify, WhatAPolicyDoesToItsCopyOfAPasswordIsNotWritten) {
  platform.admin_policy = true;
  platform.password_is_overwritten = true;
  target(kTop, {"top"}, {{"orv-slapdAdminPW", {"old"}}, {"orv-slapdAdminDN", {"cn=root"}}});
  EXPECT_EQ(modify({{kReplace, "orv-slapdAdminPW", {{"new"}}}}), 0);
  EXPECT_EQ(written(), "2 orv-slapdAdminPW=new");
}

TEST_F(Modify, AnswerAndTextOfTheDirectoryBackendAreSentAndNothingIsWritten) {
  Backend localhost;
  PluginFunction functions[] = {[](Backend*, int, char** text) {
                                  *text = strdup("not now");
                                  return 53;
                                },
                                nullptr};
  platform.localhost_backend = &localhost;
  platform.plugin_functions = functions;
  target(kTop);
  EXPECT_EQ(modify({{kReplace, "orv-slapdPwEncryption", {{"known"}}}}), 53);
  expect_answered(53, "not now");
  EXPECT_EQ(written(), "");
  expect_copy_left();
}

TEST_F(Modify, MethodIsHandedOnAfterAllOtherRulesAndBeforeTheWrite) {
  target(kTop);
  EXPECT_EQ(modify({{kReplace, "orv-slapdPwEncryption", {{"known"}}},
                    {kReplace, "orv-slapdProxySplitName", {{"a"}}}}),
            0);
  EXPECT_THAT(
      platform.calls(
          {"realpath", "is_string_alphanum", "convertPWEncryptionMethod", "cfg_modify_s"}),
      ElementsAre("realpath(\"/var/ldap/V6.0/audit.log\")", "is_string_alphanum(\"a\")",
                  "convertPWEncryptionMethod(\"known\", 16)", testing::StartsWith("cfg_mod")));
}

TEST_F(Modify, PolicyIsAskedForTwiceBeforeTheDnIsLookedAt) {
  EXPECT_EQ(modify(), 0);
  EXPECT_EQ(platform.count("pwdIsAdminPolicyOn"), 2);
  platform.forget();
  target(kPolicy);
  platform.fail("validate_new_settings", 1, 19);
  EXPECT_EQ(modify({{kReplace, "pwdMinLength", {{"9"}}}}), 0);  // while it is off
  EXPECT_EQ(platform.count("pwdIsAdminPolicyOn"), 2);
  EXPECT_EQ(platform.count("validate_new_settings"), 0);
}

TEST_F(Modify, PolicyThatIsPutOnBetweenTheTwoQuestionsConcernsThePassword) {
  trcEvents = kTraceExit;
  target(kPolicy);
  platform.at("pwdIsAdminPolicyOn", 2, [&] { platform.admin_policy = true; });
  EXPECT_EQ(modify(), 0);
  EXPECT_THAT(steps(), Contains("password 0"));
  EXPECT_THAT(steps(), Not(Contains("policy 0")));
}

TEST_F(Modify, OtherEntriesThanThePolicysAreNotTakenForIt) {
  platform.admin_policy = true;
  for (const std::string& dn :
       {std::string(kEntry), std::string("CN=X,") + kPolicy, kPolicy + std::string(",O=X")}) {
    platform.forget();
    target(dn);
    EXPECT_EQ(modify(), 0);
    EXPECT_EQ(platform.count("validate_new_settings"), 0) << dn;
  }
}

TEST_F(Modify, TextOfTheAddressCheckIsSentAlsoAlongWith50) {
  for (const unsigned flags : {kPrimary, 0x24U}) {
    platform.forget();
    as(flags);
    target(kTop, {"orv-slapdTop"}, {{"orv-slapdIpAddress", {"192.0.2.1"}}});
    platform.fail("isValidIPAddressOnSystem", 1, 0);
    const int rc = flags == kPrimary ? 19 : 50;
    EXPECT_EQ(modify(), rc);
    expect_answered(rc, "IP address 192.0.2.1 is not defined for this system.");
    EXPECT_THAT(platform.leaks(), ElementsAre("memory"));  // the copy of the address
    platform.release_leaks();
  }
}

TEST_F(Modify, TextIsReleasedAfterTheAnswer) {
  target(kTop);
  platform.name_allocation_in("slapi_ch_strdup", 2, "text");
  EXPECT_EQ(modify({{kReplace, "orv-slapdPwEncryption", {{"rot13"}}}}), 21);
  EXPECT_THAT(platform.calls({"send_ldap_result", "free", "free_ldmll"}),
              ElementsAre("send_ldap_result(connection, operation, 21, null, "
                          "\"orv-slapdPwEncryption value is not one of the supported values.\")",
                          "free(text)", "free_ldmll(modifications)"));
  expect_copy_left();
}

// ---- The write

TEST_F(Modify, TheFileIsAskedForTheDnInItsOwnCodePage) {
  target("CN=K\xC3\xA4SE,CN=CONFIGURATION");
  EXPECT_EQ(modify(), 0);
  EXPECT_THAT(platform.calls({"cfg_modify_s"}),
              ElementsAre("cfg_modify_s(session, \"CN=K\xE4SE,CN=CONFIGURATION\", \"2 "
                          "description=text\")"));
}

TEST_F(Modify, DnThatCannotBeTranslatedEndsWithItsCode) {
  platform.fail("xlate_utf8_to_localcp", 2, 21);
  EXPECT_EQ(modify(), 21);
  expect_answered(21);
  EXPECT_EQ(written(), "");
  expect_copy_left();
}

TEST_F(Modify, DnThatCameWithAFailureIsNotWrittenTo) {
  platform.failed_text_is_left = true;
  platform.fail("xlate_utf8_to_localcp", 2, 21);
  EXPECT_EQ(modify(), 21);
  expect_answered(21);
  EXPECT_EQ(written(), "");
  expect_copy_left();
}

TEST_F(Modify, DnThatWasNotMadeIsASuccessWithoutAWrite) {
  platform.fail("xlate_utf8_to_localcp", 2, 0);
  EXPECT_EQ(modify(), 0);
  expect_answered(0);
  EXPECT_EQ(written(), "");
  EXPECT_EQ(platform.count("ldap_mods_free"), 1);
}

TEST_F(Modify, LibrarysNineBecomes32) {
  platform.fail("cfg_modify_s", 1, 9);
  EXPECT_EQ(modify(), 32);
  expect_answered(32);
  EXPECT_THAT(lines_of_the_handler(), IsEmpty());
  expect_copy_left();
}

TEST_F(Modify, NineOfAnyStepUnderTheSessionBecomes32) {
  platform.fail("ldcf_api_schema_check", 1, 9);
  EXPECT_EQ(modify(), 32);
  expect_answered(32);
}

TEST_F(Modify, OtherCodesOfTheLibraryAreAnsweredUnchangedAndLeaveTheCopy) {
  for (const int code : {1, 16, 20, 51, 53, 65, 80, 90}) {
    platform.forget();
    platform.fail("cfg_modify_s", 1, code);
    EXPECT_EQ(modify(), code);
    expect_answered(code);
    expect_copy_left();
  }
}

TEST_F(Modify, TranslatedDnGoesAfterTheListAndBeforeTheSession) {
  platform.name_allocation_in("xlate_utf8_to_localcp", 2, "converted DN");
  EXPECT_EQ(modify(), 0);
  EXPECT_THAT(
      platform.calls({"ldap_mods_free", "free", "cfg_unbind"}),
      ElementsAre("ldap_mods_free(\"list\", 1)", "free(converted DN)", "cfg_unbind(session)"));
}

TEST_F(Modify, WithoutAListIsRefusedByTheRules) {
  pb.put(parameter::modifications, static_cast<const void*>(nullptr));
  EXPECT_EQ(traced(0x01030100, [&] { return config_back_modify(&pb); }), 80);
  EXPECT_EQ(platform.count("free_ldmll"), 0);
  EXPECT_EQ(platform.count("send_ldap_result"), 1);
}

TEST_F(Modify, TracesTheBlockOnEntryAndTheResultOnExit) {
  trcEvents = kTraceEntry;
  platform.fail("slapi_pblock_get", 4, -1);
  platform.run([&] { return config_back_modify(&pb); });
  char expected[64];
  std::snprintf(expected, sizeof expected, "entry 01030100 pb=0x%p", static_cast<void*>(&pb));
  EXPECT_THAT(platform.records(), ElementsAre(expected, "exit 01030100 1"));
}

// ---- Without memory

// A modify that comes to the function that its name tells.
struct Path {
  const char* name;
  unsigned flags;
  const char* dn;
  std::vector<scripted::ScriptedAttribute> attributes;
  Modifications list;
  int code;
  int fewest;                      // allocations that it makes at least
  std::string written = {};        // after a success
  std::vector<int> refusals = {};  // what it may answer besides 0, 1, 32, 80, 90 and its own code
};

void PrintTo(const Path& path, std::ostream* out) {
  *out << path.name;
}

class ModifyWithoutMemory : public Modify, public testing::WithParamInterface<Path> {
 protected:
  ModifyWithoutMemory() {
    platform.admin_policy = true;
    platform.supplied = {{"O=A", 1}};
    platform.localhost_backend = &localhost_;
    for (const char* dn :
         {kTop, kGroup, "CN=KERBEROS,CN=CONFIGURATION", "CN=DIGEST,CN=CONFIGURATION",
          "CN=PROXYDB,CN=PROXY BACKENDS,CN=ORV DIRECTORY,CN=SCHEMAS,CN=CONFIGURATION",
          "CN=PASSTHROUGH AUTHENTICATION,CN=CONFIGURATION"}) {
      platform.file[dn] = {{{dn,
                             {{"orv-slapdAdminDN", {"cn=root"}},
                              {"orv-slapdMasterDN", {"cn=m"}},
                              {"orv-slapdKrbAdminDN", {"orv-kn=root"}},
                              {"orv-slapdDigestAdminUser", {"root"}},
                              {"orv-slapdProxySplitName", {"taken"}},
                              {"orv-slapdPtaSubtree", {"o=b"}}}}}};
    }
    platform.file[kAudit] = {{{kAudit, {{"orv-slapdLog", {"/log/audit"}}}}}};
    platform.real_paths = {{"/log/audit", "/log/audit"}, {"/log/other", "/log/other"}};
  }

  // The session that a failed opening leaves, with its lock, goes back.
  bool session_was_kept() {
    if (!locked()) return false;
    EXPECT_NE(connection.config_session, nullptr);
    EXPECT_EQ(platform.count("cfg_unbind"), 0);
    EXPECT_EQ(platform.count("cfg_search_s"), 0);
    close_session();
    platform.set_held(&state.configMutex, false);
    return true;
  }

  void expect_in_order(const Path& path, int rc) {
    EXPECT_EQ(platform.count("send_ldap_result"), 1);
    EXPECT_TRUE(list_is_gone());
    EXPECT_EQ(platform.count("free_ldmll"), 1);
    if (session_was_kept()) {
      EXPECT_EQ(rc, 1);
    } else {
      EXPECT_EQ(connection.config_session, nullptr);
      EXPECT_EQ(platform.count("cfg_unbind"), 1);
    }
    const bool allowed = rc == 0 || rc == 1 || rc == 32 || rc == 80 || rc == 90 ||
                         rc == path.code ||
                         std::count(path.refusals.begin(), path.refusals.end(), rc) != 0;
    EXPECT_TRUE(allowed) << rc;
    if (rc == 0) {
      EXPECT_EQ(written(), path.written);
      EXPECT_THAT(platform.leaks(), IsEmpty());
    } else if (platform.count("cfg_modify_s") != 0) {
      EXPECT_EQ(written(), path.written);  // the library itself had no memory
      EXPECT_EQ(rc, 90);
    }
    // After a refusal the copy may be left, and that of an address.
    for (const std::string& word : platform.leaks()) {
      EXPECT_TRUE(word == "memory" || word == "text") << word;
    }
    EXPECT_THAT(platform.violations(), IsEmpty());
    platform.release_leaks();
  }

 private:
  Backend localhost_;
};

TEST_P(ModifyWithoutMemory, IsAnsweredOnceAndComesToRestWhicheverAllocationFails) {
  const Path& path = GetParam();
  as(path.flags, "CN=ONE");
  operation.roles = 0x20;
  connection.authority = path.flags;
  connection.roles = 0x20;
  target(path.dn, {"top", "orv-slapdTop", "orv-slapdPta"}, path.attributes);
  for (const bool from_then_on : {false, true}) {
    int nth = 0;
    int rc = 0;
    do {
      platform.forget();
      ++nth;
      SCOPED_TRACE((from_then_on ? "from allocation " : "allocation ") + std::to_string(nth));
      from_then_on ? platform.fail_allocations_from(nth) : platform.fail_allocation(nth);
      rc = modify(path.list);
      if (platform.allocations() >= nth) {
        expect_in_order(path, rc);
      } else {
        EXPECT_EQ(rc, path.code);
        EXPECT_EQ(written(), rc == 0 ? path.written : "");
        if (rc == 0) {
          EXPECT_THAT(platform.leaks(), IsEmpty());
        }
        platform.release_leaks();
        break;
      }
    } while (nth < 300 && !HasFailure());
    EXPECT_GT(nth, path.fewest);
    EXPECT_LT(nth, 300);
  }
}

INSTANTIATE_TEST_SUITE_P(
    Paths, ModifyWithoutMemory,
    testing::Values(Path{"BindDnOfASupplier",
                         0x04,
                         kEntry,
                         {},
                         {{kReplace, "orv-slapdMasterDN", {{"cn=new"}}}},
                         0,
                         20,
                         "2 orv-slapdMasterDN=cn=new"},
                    Path{"KerberosEntry",
                         kPrimary,
                         "CN=KERBEROS,CN=CONFIGURATION",
                         {},
                         {{kReplace, "orv-slapdKrbAdminDN", {{"orv-kn=new"}}}},
                         0,
                         20,
                         "2 orv-slapdKrbAdminDN=orv-kn=new"},
                    Path{"DigestEntry",
                         kPrimary,
                         "CN=DIGEST,CN=CONFIGURATION",
                         {},
                         {{kReplace, "orv-slapdDigestAdminUser", {{"new"}}}},
                         0,
                         20,
                         "2 orv-slapdDigestAdminUser=new"},
                    Path{"OtherLog",
                         0x04,
                         kDefaultLog,
                         {},
                         {{kReplace, "orv-slapdLog", {{"/log/other"}}}},
                         0,
                         15,
                         "2 orv-slapdLog=/log/other"},
                    Path{"AuditLogsFile",
                         0x04,
                         kDefaultLog,
                         {},
                         {{kReplace, "orv-slapdLog", {{"/log/audit"}}}},
                         53,
                         15,
                         "2 orv-slapdLog=/log/audit"},
                    Path{"PolicyEntry",
                         0x04,
                         kPolicy,
                         {},
                         {{kReplace, "pwdMinLength", {{"9"}}}},
                         0,
                         15,
                         "2 pwdMinLength=9"},
                    Path{"PasswordOfTheAdministrator",
                         kPrimary,
                         kTop,
                         {{"orv-slapdAdminPW", {"{sealed}old"}}, {"orv-slapdAdminDN", {"cn=root"}}},
                         {{kReplace, "orv-slapdAdminPW", {{"new"}}}},
                         0,
                         20,
                         "2 orv-slapdAdminPW=new"},
                    Path{"PasswordOfASupplier",
                         0x04,
                         kEntry,
                         {{"orv-slapdMasterPW", {"old"}}, {"orv-slapdMasterDN", {"cn=s"}}},
                         {{kReplace, "orv-slapdMasterPW", {{"new"}}}},
                         0,
                         20,
                         "2 orv-slapdMasterPW=new"},
                    Path{"SplitName",
                         0x04,
                         kEntry,
                         {},
                         {{kReplace, "orv-slapdProxySplitName", {{"new"}}}},
                         0,
                         20,
                         "2 orv-slapdProxySplitName=new"},
                    Path{"SplitNameThatIsTaken",
                         0x04,
                         kEntry,
                         {},
                         {{kReplace, "orv-slapdProxySplitName", {{"taken"}}}},
                         68,
                         20},
                    Path{"UnknownMethod",
                         0x04,
                         kTop,
                         {},
                         {{kReplace, "orv-slapdPwEncryption", {{"rot13"}}}},
                         21,
                         15},
                    Path{"KnownMethod",
                         0x04,
                         kTop,
                         {},
                         {{kReplace, "orv-slapdPwEncryption", {{"known"}}}},
                         0,
                         15,
                         "2 orv-slapdPwEncryption=known"},
                    Path{"IdentitiesOfAMember",
                         kPrimary,
                         kOne,
                         {{kRole, {"SchemaAdmin"}}},
                         {{kReplace, kRole, {{"AuditAdmin"}}},
                          {kReplace, "orv-slapdAdminDN", {{"cn=new"}}},
                          {kReplace, "orv-slapdKrbAdminDN", {{"orv-kn=new"}}},
                          {kReplace, "orv-slapdDigestAdminUser", {{"new"}}}},
                         0,
                         60,
                         "2 orv-slapdAdminRole=AuditAdmin|2 orv-slapdAdminDN=cn=new|2 "
                         "orv-slapdKrbAdminDN=orv-kn=new|2 orv-slapdDigestAdminUser=new",
                         {16}},
                    Path{"LastRole",
                         kPrimary,
                         kOne,
                         {{kRole, {"SchemaAdmin", "AuditAdmin"}}},
                         {{kDelete, kRole, {{"SchemaAdmin", "AuditAdmin"}}}},
                         0,
                         30,
                         "2 orv-slapdAdminRole=NoAdmin",
                         {16}},
                    Path{"OwnPassword",
                         kMember,
                         kOne,
                         {{"orv-slapdAdminPW", {"old"}}, {"orv-slapdAdminDN", {"cn=one"}}},
                         {{kReplace, "orv-slapdAdminPW", {{"new"}}}},
                         0,
                         30,
                         "2 orv-slapdAdminPW=new",
                         {16}},
                    Path{"OrdinaryEntryByAMember",
                         kMember,
                         kEntry,
                         {},
                         kAnything,
                         0,
                         15,
                         "2 description=text",
                         {16}},
                    Path{"SuffixByASupplier",
                         kSuffixSupplier,
                         kDirectory,
                         {},
                         {{kAdd, kSuffix, {{"O=A"}}}},
                         0,
                         10,
                         "0 orv-slapdSuffix=O=A"},
                    Path{"PassThroughEntry",
                         0x04,
                         kPassThrough,
                         {{"orv-slapdPtaURL", {"ldap://a"}}, {"orv-slapdPtaSubtree", {"o=x"}}},
                         {{kReplace, "orv-slapdPtaSubtree", {{"o=d"}}}},
                         0,
                         15,
                         "2 orv-slapdPtaSubtree=o=d",
                         {21}},
                    Path{"AddressThatTheHostLacks",
                         0x04,
                         kTop,
                         {},
                         {{kReplace, "orv-slapdIpAddress", {{"192.0.2.1"}}}},
                         19,
                         5},
                    Path{"SeveralValues",
                         0x04,
                         kEntry,
                         {},
                         {{kReplace, "description", {{"a", "b", "c"}}}, {kReplace, "cn", {{"d"}}}},
                         0,
                         20,
                         "2 description=a,b,c|2 cn=d"}),
    [](const auto& instance) { return std::string(instance.param.name); });

TEST_F(Modify, ExitRecordsCarryTheCodeOfEveryEnd) {
  trcEvents = kTraceExit;
  modify();
  EXPECT_EQ(last_record(), "exit 01030100 0");
  as(0x24);
  modify();
  EXPECT_EQ(last_record(), "exit 01030100 50");
  platform.forget();
  platform.fail("pthread_mutex_lock", 1, 22);
  modify();
  EXPECT_EQ(last_record(), "exit 01030100 80");
}

}  // namespace
}  // namespace orv
