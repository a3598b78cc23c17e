// Delete: authority, the protected entries, the notice to persistent searches, and the way of the
// operation.
#include "config_delete.h"

#include "added_entry.h"
#include "config_session.h"
#include "function_ids.h"
#include "slapi/psearch.h"

namespace orv {
namespace {

constexpr const char* kEntry = "CN=X,CN=CONFIGURATION";
constexpr const char* kOwnBackend =
    "CN=CONFIGDB,CN=CONFIG BACKENDS,CN=ORV DIRECTORY,CN=SCHEMAS,CN=CONFIGURATION";

class DeleteTest : public BackendTest {
 protected:
  DeleteTest() {
    platform.name(&pb, "pb");
    operation.parameters = &pb;
    as(kPrimary);
  }

  // An entry of the file, with these object classes.
  void entry_of_file(const std::string& dn, const std::vector<std::string>& classes = {"top"}) {
    platform.file[dn] = {{{dn, {{"objectClass", classes}}}}};
  }
};

// ---- check_delete_authority

class DeleteAuthority : public DeleteTest {
 protected:
  DeleteAuthority() { open_session(); }
  void TearDown() override {
    close_session();
    BackendTest::TearDown();
  }

  int authority_over(const char* dn) {
    return traced(function_id::check_delete_authority,
                  [&] { return check_delete_authority(&connection, &operation, nullptr, dn); });
  }

  // Which of all sets of role bits let a member delete an entry.
  template <typename Allowed>
  void expect_roles(const char* dn, Allowed allowed) {
    SCOPED_TRACE(dn);
    orv::expect_roles(
        operation, [&] { return authority_over(dn); }, allowed);
  }
};

TEST_F(DeleteAuthority, SuppliersAndStrangersAreRefusedBeforeTheFileIsRead) {
  for (const unsigned flags : {0x01U, 0x02U, 0x03U, 0x0DU, 0x0EU, 0x15U, 0x16U, 0x24U}) {
    as(flags);
    operation.roles = 0x3E;
    EXPECT_EQ(authority_over(kEntry), 50) << flags;
  }
  EXPECT_EQ(platform.count("cfg_search_s"), 0);
}

TEST_F(DeleteAuthority, OnlyExactlyThirtySixMarksAStranger) {
  entry_of_file(kEntry);
  for (const unsigned flags : {0x04U, 0x20U, 0x2CU, 0U, 0x10U, kPrimary}) {
    as(flags);
    EXPECT_EQ(authority_over(kEntry), 0) << flags;
  }
  as(0x34);  // a member, whatever else
  EXPECT_EQ(authority_over(kEntry), 50);
}

TEST_F(DeleteAuthority, ReadsTheObjectClassesAndReleasesChainThenValues) {
  entry_of_file(kEntry);
  EXPECT_EQ(authority_over(kEntry), 0);
  EXPECT_THAT(platform.calls({"cfg_search_s", "cfg_first_entry", "cfg_get_values", "cfg_msgfree",
                              "charray_free"}),
              ElementsAre("cfg_search_s(session, \"CN=X,CN=CONFIGURATION\", 0, "
                          "\"(objectclass=*)\", [OBJECTCLASS], 0)",
                          "cfg_first_entry(session, chain)",
                          "cfg_get_values(session, record 1, \"OBJECTCLASS\")",
                          "cfg_msgfree(chain)", "charray_free(\"array\")"));
}

TEST_F(DeleteAuthority, MissingEntryIsToldToEveryCallerBeforeItsRoles) {
  for (const unsigned flags : {kPrimary, kGroupMember, 0U}) {
    as(flags);
    EXPECT_EQ(authority_over(kEntry), 32) << flags;
  }
}

TEST_F(DeleteAuthority, CodeOfTheReaderIsReturned) {
  platform.fail("cfg_search_s", 1, 1);
  EXPECT_EQ(authority_over(kEntry), 80);
  platform.fail("slapi_ch_strdup", 2, 0);
  EXPECT_EQ(authority_over(kEntry), 90);
}

TEST_F(DeleteAuthority, ResultThatCameWithAFailureIsReleased) {
  entry_of_file(kEntry);
  for (const auto& [code, answer] : {std::pair{32, 32}, {3, 80}}) {
    platform.forget();
    platform.file[kEntry].code = code;
    EXPECT_EQ(authority_over(kEntry), answer);
    EXPECT_THAT(platform.calls({"cfg_first_entry", "cfg_get_values", "cfg_msgfree"}),
                ElementsAre("cfg_msgfree(chain)"));
  }
}

TEST_F(DeleteAuthority, FoundWithoutARecordGives32AndItsLine) {
  platform.file[kEntry] = {};
  EXPECT_EQ(authority_over(kEntry), 32);
  EXPECT_THAT(platform.debug_lines(),
              ElementsAre(error("Error - check_delete_authority: entry CN=X,CN=CONFIGURATION does "
                                "not exist!\n")));
  EXPECT_EQ(platform.count("cfg_get_values"), 0);
  EXPECT_EQ(platform.count("cfg_msgfree"), 1);
}

TEST_F(DeleteAuthority, FoundWithoutARecordGives32WithoutTheTraceToo) {
  debug_off();
  platform.file[kEntry] = {};
  EXPECT_EQ(authority_over(kEntry), 32);
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
  EXPECT_EQ(platform.count("cfg_get_values"), 0);
  EXPECT_EQ(platform.count("cfg_msgfree"), 1);
}

TEST_F(DeleteAuthority, EntryWithoutObjectClassesGives16) {
  platform.file[kEntry] = {{{kEntry, {{"cn", {"x"}}}}}};
  EXPECT_EQ(authority_over(kEntry), 16);
  EXPECT_EQ(platform.count("cfg_msgfree"), 1);
}

TEST_F(DeleteAuthority, NoValuesGive16WhateverTheErrorNumber) {
  entry_of_file(kEntry);
  platform.fail("cfg_get_values", 1, 0);
  platform.fail("cfg_get_values", 2, 90);
  EXPECT_EQ(authority_over(kEntry), 16);
  EXPECT_EQ(authority_over(kEntry), 16);
}

TEST_F(DeleteAuthority, ErrorNumberWithValuesIsReturnedAndTheValuesReleased) {
  entry_of_file(kEntry);
  platform.fail("cfg_get_errno", 1, 53);
  EXPECT_EQ(authority_over(kEntry), 53);
  EXPECT_EQ(platform.count("charray_free"), 1);
}

TEST_F(DeleteAuthority, OthersThanMembersNeedNoRole) {
  entry_of_file(kMaster, {"orv-slapdSupplier"});
  for (const unsigned flags : {kPrimary, 0x04U, 0x10U, 0U}) {
    as(flags);
    EXPECT_EQ(authority_over(kMaster), 0) << flags;
  }
}

TEST_F(DeleteAuthority, MembersNeedARoleWhateverElseTheyAre) {
  entry_of_file(kEntry);
  for (const unsigned flags : {0x14U, 0x1CU, 0x34U, 0x3CU}) {
    as(flags);
    operation.roles = 0x1E;
    EXPECT_EQ(authority_over(kEntry), 50) << flags;
    operation.roles = 0x20;
    EXPECT_EQ(authority_over(kEntry), 0) << flags;
  }
}

TEST_F(DeleteAuthority, OrdinaryEntryNeedsTheServerConfigurationRole) {
  entry_of_file(kEntry);
  expect_roles(kEntry, [](unsigned roles) { return (roles & 0x20) != 0; });
}

TEST_F(DeleteAuthority, AuditLogsNeedTheAuditRole) {
  for (const char* dn : {kAudit, kAdminAudit}) {
    entry_of_file(dn);
    expect_roles(dn, [](unsigned roles) { return (roles & 0x02) != 0; });
  }
}

TEST_F(DeleteAuthority, DefaultLogNeedsTheAuditOrTheServerConfigurationRole) {
  entry_of_file(kDefaultLog);
  expect_roles(kDefaultLog, [](unsigned roles) { return (roles & 0x22) != 0; });
}

TEST_F(DeleteAuthority, ReplicationNeedsAReplicationOrTheServerConfigurationRole) {
  entry_of_file(kReplication);
  expect_roles(kReplication, [](unsigned roles) { return (roles & 0x2C) != 0; });
}

TEST_F(DeleteAuthority, MasterServerNeedsThreeRolesTogether) {
  entry_of_file(kMaster);
  expect_roles(kMaster, [](unsigned roles) { return (roles & 0x34) == 0x34; });
}

TEST_F(DeleteAuthority, SupplierNeedsThreeRolesTogetherUnderAnyDnAndInAnyLetterCase) {
  for (const char* name : {"orv-slapdSupplier", "ORV-SLAPDSUPPLIER", "orv-slapdsupplier"}) {
    entry_of_file(kEntry, {"top", "orv-slapdConfigEntry", name});
    expect_roles(kEntry, [](unsigned roles) { return (roles & 0x34) == 0x34; });
    entry_of_file(kEntry, {name, "top"});
    expect_roles(kEntry, [](unsigned roles) { return (roles & 0x34) == 0x34; });
  }
  entry_of_file(kEntry, {"orv-slapdSupplierX"});
  expect_roles(kEntry, [](unsigned roles) { return (roles & 0x20) != 0; });
}

TEST_F(DeleteAuthority, SupplierUnderAProtectedDnHasToPassBothRules) {
  entry_of_file(kAudit, {"orv-slapdSupplier"});
  expect_roles(kAudit, [](unsigned roles) { return (roles & 0x36) == 0x36; });
}

TEST_F(DeleteAuthority, NamedEntriesAreRecognisedInAnyLetterCase) {
  const char* dn = "cn=Audit,cn=Log Management,cn=Configuration";
  entry_of_file(dn);
  expect_roles(dn, [](unsigned roles) { return (roles & 0x02) != 0; });
  EXPECT_THAT(platform.calls({"kel_strcasecmp"}), Not(IsEmpty()));
}

TEST_F(DeleteAuthority, EntriesBelowANamedOneAreOrdinary) {
  const char* dn = "CN=Y,CN=AUDIT,CN=LOG MANAGEMENT,CN=CONFIGURATION";
  entry_of_file(dn);
  expect_roles(dn, [](unsigned roles) { return (roles & 0x20) != 0; });
}

TEST_F(DeleteAuthority, DnThatOnlyBeginsWithANamedOneIsOrdinary) {
  for (const char* dn : {"CN=AUDIT,CN=LOG MANAGEMENT,CN=CONFIGURATION,O=X",
                         "CN=MASTER SERVER,CN=CONFIGURATION,O=X"}) {
    entry_of_file(dn);
    expect_roles(dn, [](unsigned roles) { return (roles & 0x20) != 0; });
  }
}

TEST_F(DeleteAuthority, MemberWithServerConfigurationOnlyMayDeleteReplicationButNotTheMaster) {
  entry_of_file(kReplication);
  entry_of_file(kMaster);
  as(kGroupMember);
  operation.roles = 0x20;
  EXPECT_EQ(authority_over(kReplication), 0);
  EXPECT_EQ(authority_over(kMaster), 50);
}

TEST_F(DeleteAuthority, LeavesAnExitRecord) {
  trcEvents = kTraceExit;
  as(0x24);
  authority_over(kEntry);
  EXPECT_THAT(platform.records(), ElementsAre("entry 01010900 ", "exit 01010900 50"));
}

// ---- The monitor of persistent searches

class Monitor : public DeleteTest {
 protected:
  Monitor() { platform.name(&monitor, "monitor"); }
  int ask() {
    return traced(function_id::get_num_current_psearches,
                  [&] { return monitor.get_num_current_psearches(); });
  }
  PSearchMonitor monitor;
};

TEST_F(Monitor, CountsUnderItsMutex) {
  EXPECT_EQ(ask(), 0);
  monitor.begin(9);
  monitor.begin(9);
  platform.forget();
  EXPECT_EQ(ask(), 2);
  EXPECT_THAT(platform.calls(),
              ElementsAre("pthread_mutex_lock(monitor)", "pthread_mutex_unlock(monitor)"));
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
}

TEST_F(Monitor, CountIsThatBetweenLockingAndUnlocking) {
  platform.at("pthread_mutex_lock", 1, [&] { monitor.begin(9); });
  platform.at("pthread_mutex_unlock", 1, [&] { monitor.begin(9); });
  EXPECT_EQ(ask(), 1);
  EXPECT_EQ(ask(), 2);
}

TEST_F(Monitor, WithoutItsMutexIsSilentWithALine) {
  monitor.begin(9);
  platform.fail("pthread_mutex_lock", 1, 22);
  EXPECT_EQ(ask(), 0);
  EXPECT_THAT(platform.debug_lines(),
              ElementsAre(error("Failed to acquire lock on monitor mutex, rc=22.\n")));
  EXPECT_EQ(platform.count("pthread_mutex_unlock"), 0);
}

TEST_F(Monitor, WithoutItsMutexIsSilentWithoutTheTraceToo) {
  debug_off();
  monitor.begin(9);
  platform.fail("pthread_mutex_lock", 1, 22);
  EXPECT_EQ(ask(), 0);
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
  EXPECT_EQ(platform.count("pthread_mutex_unlock"), 0);
}

TEST_F(Monitor, ThatCannotUnlockSaysSoAndStillCounts) {
  monitor.begin(9);
  platform.fail("pthread_mutex_unlock", 1, 1);
  EXPECT_EQ(ask(), 1);
  EXPECT_THAT(platform.debug_lines(),
              ElementsAre(error("Failed to release lock on monitor mutex, rc=1.\n")));
}

TEST_F(Monitor, LeavesAnExitRecord) {
  monitor.begin(9);
  trcEvents = kTraceExit;
  ask();
  EXPECT_THAT(platform.records(), ElementsAre("entry 01010a00 ", "exit 01010a00 1"));
}

// ---- The handler

class Delete : public DeleteTest {
 protected:
  Delete() {
    platform.name(&monitor, "monitor");
    target(kEntry);
    platform.forget();
  }

  void target(const char* dn, const std::vector<std::string>& classes = {"top"}) {
    entry_of_file(dn, classes);
    pb.put(parameter::target_dn, static_cast<const void*>(dn));
  }

  int remove() {
    return traced(function_id::config_back_delete, [&] { return config_back_delete(&pb); });
  }

  // Persistent searches run.
  void somebody_listens() {
    monitor.begin(9);
    platform.global_parameters.put(parameter::persistent_search_switch, 1);
    platform.global_parameters.put(parameter::persistent_search_monitor, &monitor);
  }

  entry* kept() {
    const auto found = pb.values.find(parameter::entry_before_delete);
    return found == pb.values.end() ? nullptr
                                    : static_cast<entry*>(const_cast<void*>(found->second.pointer));
  }

  void expect_at_rest() {
    EXPECT_FALSE(locked());
    EXPECT_EQ(connection.config_session, nullptr);
    EXPECT_EQ(platform.count("pthread_mutex_lock"), platform.count("pthread_mutex_unlock"));
    EXPECT_EQ(platform.count("cfg_unbind"), 1);
    EXPECT_THAT(platform.calls({"entry_free"}), ElementsAre("entry_free(null)"));
  }

  PSearchMonitor monitor;
};

TEST_F(Delete, GoesThroughItsStepsInOrder) {
  EXPECT_EQ(remove(), 0);
  EXPECT_THAT(
      platform.calls({"slapi_pblock_get", "pthread_mutex_lock", "cfg_bind_s", "cfg_search_s",
                      "xlate_utf8_to_localcp", "getGlobalPBlock", "cfg_delete_s", "entry_free",
                      "cfg_unbind", "pthread_mutex_unlock", "send_ldap_result"}),
      ElementsAre("slapi_pblock_get(130)", "slapi_pblock_get(131)", "slapi_pblock_get(132)",
                  "slapi_pblock_get(50)", "pthread_mutex_lock(configMutex)",
                  "cfg_bind_s(session, null, null, 128)",
                  "cfg_search_s(session, \"CN=X,CN=CONFIGURATION\", 0, \"(objectclass=*)\", "
                  "[OBJECTCLASS], 0)",
                  "xlate_utf8_to_localcp(\"CN=X,CN=CONFIGURATION\")", "getGlobalPBlock()",
                  "slapi_pblock_get(-141)", "slapi_pblock_get(-146)",
                  "cfg_delete_s(session, \"CN=X,CN=CONFIGURATION\")", "entry_free(null)",
                  "cfg_unbind(session)", "pthread_mutex_unlock(configMutex)",
                  "send_ldap_result(connection, operation, 0, null, \"\")"));
  expect_at_rest();
}

TEST_F(Delete, ReleasesTheConvertedDnBeforeTheSessionEnds) {
  platform.name_allocation_in("xlate_utf8_to_localcp", 1, "converted DN");
  EXPECT_EQ(remove(), 0);
  EXPECT_THAT(platform.calls({"cfg_delete_s", "free", "entry_free"}),
              ElementsAre("cfg_delete_s(session, \"CN=X,CN=CONFIGURATION\")", "free(converted DN)",
                          "entry_free(null)"));
}

TEST_F(Delete, ParameterThatCannotBeReadGives1WithoutASession) {
  for (const int nth : {1, 2, 3, 4}) {
    platform.forget();
    platform.fail("slapi_pblock_get", nth, -1);
    EXPECT_EQ(remove(), 1);
    EXPECT_EQ(platform.count("slapi_pblock_get"), nth);
    EXPECT_EQ(platform.count("pthread_mutex_lock"), 0);
    EXPECT_EQ(platform.count("pthread_mutex_unlock"), 0);
    EXPECT_EQ(platform.count("cfg_unbind"), 0);
    if (nth == 4) {
      expect_answered(1);
    } else {
      EXPECT_EQ(platform.count("send_ldap_result"), 0) << nth;
    }
  }
}

TEST_F(Delete, FailedBindGives1UnansweredAndKeepsHandleAndLock) {
  platform.fail("cfg_bind_s", 1, 7);
  EXPECT_EQ(remove(), 1);
  EXPECT_EQ(platform.count("send_ldap_result"), 0);
  EXPECT_EQ(platform.count("cfg_unbind"), 0);
  EXPECT_EQ(platform.count("pthread_mutex_unlock"), 0);
  EXPECT_EQ(platform.count("cfg_search_s"), 0);
  EXPECT_EQ(platform.count("entry_free"), 0);
  EXPECT_TRUE(locked());
  ASSERT_NE(connection.config_session, nullptr);
  close_session();
}

TEST_F(Delete, NoHandleGives90UnansweredAndKeepsTheLock) {
  platform.fail("cfg_init", 1, 0);
  EXPECT_EQ(remove(), 90);
  EXPECT_EQ(platform.count("send_ldap_result"), 0);
  EXPECT_TRUE(locked());
}

TEST_F(Delete, ExceptionOfTheLibraryGives1UnansweredAndLeavesNothing) {
  platform.at("cfg_init", 1, [] { throw 42; });
  EXPECT_EQ(remove(), 1);
  EXPECT_EQ(platform.count("send_ldap_result"), 0);
  EXPECT_FALSE(locked());
  EXPECT_EQ(platform.count("pthread_mutex_unlock"), 1);
  EXPECT_EQ(platform.count("cfg_unbind"), 0);
  EXPECT_EQ(connection.config_session, nullptr);
}

TEST_F(Delete, LockThatCannotBeTakenGives80Unanswered) {
  platform.fail("pthread_mutex_lock", 1, 22);
  EXPECT_EQ(remove(), 80);
  EXPECT_EQ(platform.count("send_ldap_result"), 0);
  EXPECT_EQ(platform.count("pthread_mutex_unlock"), 0);
}

TEST_F(Delete, RefusedCallerIsAnsweredWith50AndNothingIsDeleted) {
  as(0x24);
  EXPECT_EQ(remove(), 50);
  expect_answered(50);
  expect_at_rest();
  EXPECT_EQ(platform.count("xlate_utf8_to_localcp"), 0);
  EXPECT_EQ(platform.count("cfg_delete_s"), 0);
}

TEST_F(Delete, MissingEntryIsAnsweredWith32ByTheAuthorityCheck) {
  platform.file.clear();
  EXPECT_EQ(remove(), 32);
  expect_answered(32);
  expect_at_rest();
  EXPECT_EQ(platform.count("cfg_delete_s"), 0);
}

TEST_F(Delete, EntryIsReadBeforeItIsAskedWhetherItIsForThePrimaryAdministrator) {
  as(kGroupMember);
  operation.roles = 0x3E;
  for (const char* dn : {kGroup, kMember, kKerberos, kDigest}) {
    SCOPED_TRACE(dn);
    target(dn);
    platform.file.clear();
    platform.forget();
    EXPECT_EQ(remove(), 32);
    expect_answered(32);
    platform.file[dn] = {{{dn, {}}}};
    platform.forget();
    EXPECT_EQ(remove(), 16);
    expect_answered(16);
  }
}

TEST_F(Delete, EntryWithoutObjectClassesIsAnsweredWith16) {
  platform.file[kEntry] = {{{kEntry, {}}}};
  EXPECT_EQ(remove(), 16);
  expect_answered(16);
  expect_at_rest();
}

TEST_F(Delete, OwnBackendIsAnsweredWith53InAnyLetterCase) {
  for (const char* dn :
       {kOwnBackend, "cn=ConfigDB,cn=Config Backends,cn=ORV Directory,cn=Schemas,cn=Configuration",
        "CN=configdb,CN=CONFIG backends,cn=orv directory,CN=SCHEMAS,cn=configuration"}) {
    platform.forget();
    target(dn);
    EXPECT_EQ(remove(), 53) << dn;
    expect_answered(53);
    expect_at_rest();
    EXPECT_EQ(platform.count("xlate_utf8_to_localcp"), 0);
  }
}

TEST_F(Delete, AuthorityOverTheOwnBackendComesBeforeItsRule) {
  target(kOwnBackend);
  as(kGroupMember);
  EXPECT_EQ(remove(), 50);
  platform.file.clear();
  EXPECT_EQ(remove(), 32);
}

TEST_F(Delete, EntriesBesideTheOwnBackendMayGo) {
  for (const std::string& dn :
       {std::string("CN=X,") + kOwnBackend, std::string(kOwnBackend) + ",O=X"}) {
    target(dn.c_str());
    EXPECT_EQ(remove(), 0) << dn;
  }
}

TEST_F(Delete, AdministratorsAreForThePrimaryAdministratorOnly) {
  for (const char* dn : {"CN=ADMINGROUP,CN=CONFIGURATION", "CN=A,CN=ADMINGROUP,CN=CONFIGURATION",
                         "CN=ADMINGROUP,CN=CONFIGURATION,O=X", "CN=KERBEROS,CN=CONFIGURATION",
                         "CN=DIGEST,CN=CONFIGURATION"}) {
    target(dn);
    for (const unsigned flags : {kGroupMember, 0x04U, 0x08U, 0x10U, 0U}) {
      platform.forget();
      as(flags);
      operation.roles = 0x3E;
      EXPECT_EQ(remove(), 50) << dn << flags;
      expect_answered(50);
      expect_at_rest();
      EXPECT_EQ(platform.count("cfg_delete_s"), 0);
    }
    for (const unsigned flags : {kPrimary, 0x1CU}) {
      as(flags);
      operation.roles = 0x3E;
      EXPECT_EQ(remove(), 0) << dn << flags;
    }
  }
}

TEST_F(Delete, KerberosAndDigestAreRecognisedAsWholeDnsAndByteForByte) {
  as(kGroupMember);
  operation.roles = 0x20;
  for (const char* dn : {"cn=kerberos,cn=configuration", "CN=KERBEROS,CN=CONFIGURATION,O=X",
                         "CN=X,CN=KERBEROS,CN=CONFIGURATION", "cn=digest,cn=configuration",
                         "CN=DIGEST,CN=CONFIGURATION,O=X", "CN=X,CN=DIGEST,CN=CONFIGURATION",
                         "CN=A,cn=admingroup,CN=CONFIGURATION"}) {
    target(dn);
    EXPECT_EQ(remove(), 0) << dn;
  }
}

TEST_F(Delete, DnThatCannotBeConvertedEndsWithThatCodeAndSkipsTheRest) {
  somebody_listens();
  platform.failed_text_is_left = true;  // what it left is not used
  platform.fail("xlate_utf8_to_localcp", 1, 21);
  EXPECT_EQ(remove(), 21);
  expect_answered(21);
  expect_at_rest();
  EXPECT_EQ(platform.count("getGlobalPBlock"), 0);
  EXPECT_EQ(platform.count("cfg_delete_s"), 0);
}

TEST_F(Delete, LibrarysNineBecomes32) {
  platform.fail("cfg_delete_s", 1, 9);
  EXPECT_EQ(remove(), 32);
  expect_answered(32);
  expect_at_rest();
}

TEST_F(Delete, NineOfTheConversionBecomes32ButNotThatOfTheRules) {
  platform.fail("xlate_utf8_to_localcp", 1, 9);
  EXPECT_EQ(remove(), 32);
  expect_answered(32);
  platform.forget();
  platform.fail("cfg_get_errno", 1, 9);  // at the object classes
  EXPECT_EQ(remove(), 9);
  expect_answered(9);
}

TEST_F(Delete, OtherCodesOfTheLibraryAreAnsweredUnchanged) {
  for (const int code : {1, 16, 51, 53, 66, 80, 90}) {
    platform.forget();
    platform.fail("cfg_delete_s", 1, code);
    EXPECT_EQ(remove(), code);
    expect_answered(code);
    expect_at_rest();
  }
}

TEST_F(Delete, TheFileIsAskedForTheDnInItsOwnCodePage) {
  target("CN=K\xC3\xA4SE,CN=CONFIGURATION");
  EXPECT_EQ(remove(), 0);
  EXPECT_THAT(platform.calls({"cfg_search_s", "cfg_delete_s"}),
              ElementsAre("cfg_search_s(session, \"CN=K\xC3\xA4SE,CN=CONFIGURATION\", 0, "
                          "\"(objectclass=*)\", [OBJECTCLASS], 0)",
                          "cfg_delete_s(session, \"CN=K\xE4SE,CN=CONFIGURATION\")"));
}

// ---- Persistent searches

TEST_F(Delete, EntryIsReadAndKeptBeforeItGoesWhileSomebodyListens) {
  somebody_listens();
  EXPECT_EQ(remove(), 0);
  EXPECT_THAT(platform.calls({"pthread_mutex_lock", "pthread_mutex_unlock", "CFGMessage2Entry",
                              "slapi_pblock_set", "cfg_delete_s", "entry_free"}),
              ElementsAre("pthread_mutex_lock(configMutex)", "pthread_mutex_lock(monitor)",
                          "pthread_mutex_unlock(monitor)", "CFGMessage2Entry(session, record 1)",
                          "slapi_pblock_set(pb, -157, ?)",
                          "cfg_delete_s(session, \"CN=X,CN=CONFIGURATION\")", "entry_free(null)",
                          "pthread_mutex_unlock(configMutex)"));
  ASSERT_NE(kept(), nullptr);
  EXPECT_STREQ(kept()->requested_dn, kEntry);
  entry_free(kept());
}

TEST_F(Delete, EntryIsKeptHoweverManyListen) {
  somebody_listens();
  monitor.begin(9);
  EXPECT_EQ(remove(), 0);
  ASSERT_NE(kept(), nullptr);
  entry_free(kept());
}

TEST_F(Delete, EntryIsKeptInTheOperationsOwnBlock) {
  pblock own;
  platform.name(&own, "own");
  operation.parameters = &own;
  somebody_listens();
  EXPECT_EQ(remove(), 0);
  EXPECT_EQ(kept(), nullptr);
  EXPECT_THAT(platform.calls({"slapi_pblock_set"}), ElementsAre("slapi_pblock_set(own, -157, ?)"));
  entry_free(static_cast<entry*>(
      const_cast<void*>(own.values.at(parameter::entry_before_delete).pointer)));
}

TEST_F(Delete, EntryIsFetchedUnderTheConvertedDn) {
  target("CN=K\xC3\xA4SE,CN=CONFIGURATION");
  entry_of_file("CN=K\xE4SE,CN=CONFIGURATION");
  somebody_listens();
  EXPECT_EQ(remove(), 0);
  ASSERT_NE(kept(), nullptr);
  EXPECT_STREQ(kept()->requested_dn, "CN=K\xE4SE,CN=CONFIGURATION");
  entry_free(kept());
}

TEST_F(Delete, EntryIsKeptAlsoWhenTheDeleteThenFails) {
  somebody_listens();
  platform.fail("cfg_delete_s", 1, 66);
  EXPECT_EQ(remove(), 66);
  ASSERT_NE(kept(), nullptr);
  entry_free(kept());
}

TEST_F(Delete, NothingIsReadWhileNobodyListens) {
  somebody_listens();
  for (const int off : {0, 2, -1}) {
    platform.global_parameters.put(parameter::persistent_search_switch, off);
    EXPECT_EQ(remove(), 0) << off;
  }
  EXPECT_THAT(platform.calls({"pthread_mutex_lock"}), Not(Contains("pthread_mutex_lock(monitor)")));
  platform.global_parameters.put(parameter::persistent_search_switch, 1);
  platform.global_parameters.put(parameter::persistent_search_monitor,
                                 static_cast<const void*>(nullptr));
  EXPECT_EQ(remove(), 0);
  PSearchMonitor idle;
  platform.global_parameters.put(parameter::persistent_search_monitor, &idle);
  EXPECT_EQ(remove(), 0);
  EXPECT_EQ(kept(), nullptr);
  EXPECT_EQ(platform.count("CFGMessage2Entry"), 0);
}

TEST_F(Delete, EntryThatCannotBeFetchedOnlyLosesTheNotice) {
  somebody_listens();
  platform.fail("CFGMessage2Entry", 1, 0);
  EXPECT_EQ(remove(), 0);
  EXPECT_EQ(kept(), nullptr);
  EXPECT_EQ(platform.count("slapi_pblock_set"), 0);
  EXPECT_EQ(platform.count("cfg_delete_s"), 1);
}

TEST_F(Delete, EntryThatTheBlockDoesNotTakeIsReleased) {
  somebody_listens();
  platform.fail("slapi_pblock_set", 1, -1);
  EXPECT_EQ(remove(), 0);
  EXPECT_THAT(platform.calls({"entry_free"}),
              ElementsAre("entry_free(\"entry\")", "entry_free(null)"));
  EXPECT_EQ(platform.count("cfg_delete_s"), 1);
}

TEST_F(Delete, RefusedDeleteIsNotToldToAnybody) {
  somebody_listens();
  as(0x24);
  EXPECT_EQ(remove(), 50);
  EXPECT_EQ(kept(), nullptr);
}

TEST_F(Delete, TracesTheBlockOnEntryAndTheResultOnExit) {
  trcEvents = kTraceEntry;
  platform.fail("slapi_pblock_get", 4, -1);
  remove();
  char expected[64];
  std::snprintf(expected, sizeof expected, "entry 01010800 pb=0x%p", static_cast<void*>(&pb));
  EXPECT_THAT(platform.records(), ElementsAre(expected, "exit 01010800 1"));
  platform.forget();
  as(0x24);
  remove();
  EXPECT_EQ(last_record(), "exit 01010800 50");
}

TEST_F(Delete, ExitRecordsCarryTheCodesOfAnsweredAndUnansweredDeletes) {
  trcEvents = kTraceExit;
  remove();
  EXPECT_EQ(last_record(), "exit 01010800 0");
  platform.fail("pthread_mutex_lock", 2, 22);
  remove();
  EXPECT_EQ(last_record(), "exit 01010800 80");
}

}  // namespace
}  // namespace orv
