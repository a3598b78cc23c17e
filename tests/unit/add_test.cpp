// Add: authority, the checks of the file, the translation of the entry, and the way of the
// operation.
#include "added_entry.h"
#include "config_add.h"
#include "function_ids.h"

namespace orv {
namespace {

constexpr const char* kEntry = "cn=x, cn=Configuration";
class AddTest : public AddedEntryTest {
 protected:
  AddTest() { as(kPrimary); }

  void make(const std::string& dn, const Attributes& attributes) {
    AddedEntryTest::make(dn, attributes);
    pb.put(parameter::add_entry, e.get());
  }

  void exists(const std::string& dn) { platform.file[dn] = {{{dn, {}}}}; }
};

// ---- Who may add

class AddAuthority : public AddTest {
 protected:
  int authority() {
    return traced(function_id::check_add_authority,
                  [&] { return check_add_authority(nullptr, &operation, e.get()); });
  }

  // Which of all sets of role bits let a member add an entry.
  template <typename Allowed>
  void expect_roles(const char* dn, const std::vector<std::string>& classes, Allowed allowed) {
    SCOPED_TRACE(dn);
    make(dn, {{"objectClass", classes}});
    orv::expect_roles(
        operation, [&] { return authority(); }, allowed);
  }
};

TEST_F(AddAuthority, SuppliersAndStrangersAreRefusedBeforeTheEntryIsLookedAt) {
  make(kEntry, {});
  for (const unsigned flags : {0x01U, 0x02U, 0x03U, 0x0DU, 0x0EU, 0x15U, 0x16U, 0x24U}) {
    as(flags);
    operation.roles = 0x3E;
    EXPECT_EQ(authority(), 50) << flags;
  }
  EXPECT_THAT(platform.calls(), IsEmpty());
}

TEST_F(AddAuthority, OnlyExactlyThirtySixMarksAStranger) {
  make(kEntry, {});
  for (const unsigned flags : {0x2CU, 0x04U, 0x20U, 0U, 0x10U, kPrimary}) {
    as(flags);
    EXPECT_EQ(authority(), 0) << flags;
  }
}

TEST_F(AddAuthority, OthersThanMembersNeedNoRole) {
  make(kMaster, {{"objectClass", {"orv-slapdSupplier"}}});
  for (const unsigned flags : {kPrimary, 0x04U, 0x10U, 0U}) {
    as(flags);
    EXPECT_EQ(authority(), 0) << flags;
  }
}

TEST_F(AddAuthority, MembersNeedARoleWhateverElseTheyAre) {
  make(kEntry, {});
  for (const unsigned flags : {0x14U, 0x1CU, 0x34U, 0x3CU}) {
    as(flags);
    operation.roles = 0x1E;
    EXPECT_EQ(authority(), 50) << flags;
    operation.roles = 0x20;
    EXPECT_EQ(authority(), 0) << flags;
  }
}

TEST_F(AddAuthority, SupplierIsLookedForUpToTheFirstMatch) {
  make(kEntry, {{"objectClass", {"top", "ORV-slapdsupplier", "x"}}});
  EXPECT_EQ(authority(), 0);
  EXPECT_THAT(platform.calls(),
              ElementsAre("attr_find(\"OBJECTCLASS\", 0, 0)",
                          "kel_strcasecmp(\"top\", \"orv-slapdSupplier\")",
                          "kel_strcasecmp(\"ORV-slapdsupplier\", \"orv-slapdSupplier\")"));
}

TEST_F(AddAuthority, OrdinaryEntryNeedsTheServerConfigurationRole) {
  expect_roles(kEntry, {"top"}, [](unsigned roles) { return (roles & 0x20) != 0; });
}

TEST_F(AddAuthority, EntryWithoutObjectClassesIsOrdinary) {
  make(kEntry, {});
  as(kGroupMember);
  operation.roles = 0x20;
  EXPECT_EQ(authority(), 0);
  operation.roles = 0x1E;
  EXPECT_EQ(authority(), 50);
}

TEST_F(AddAuthority, EntryWhoseObjectClassesHaveNoValuesIsOrdinary) {
  for (const bool null_list : {false, true}) {
    platform.empty_lists_are_null = null_list;
    expect_roles(kEntry, {}, [](unsigned roles) { return (roles & 0x20) != 0; });
  }
}

TEST_F(AddAuthority, AuditLogsNeedTheAuditRole) {
  for (const char* dn : {kAudit, kAdminAudit}) {
    expect_roles(dn, {"top"}, [](unsigned roles) { return (roles & 0x02) != 0; });
  }
}

TEST_F(AddAuthority, DefaultLogNeedsTheAuditOrTheServerConfigurationRole) {
  expect_roles(kDefaultLog, {"top"}, [](unsigned roles) { return (roles & 0x22) != 0; });
}

TEST_F(AddAuthority, ReplicationNeedsAReplicationOrTheServerConfigurationRole) {
  expect_roles(kReplication, {"top"}, [](unsigned roles) { return (roles & 0x2C) != 0; });
}

TEST_F(AddAuthority, MasterServerNeedsThreeRolesTogether) {
  expect_roles(kMaster, {"top"}, [](unsigned roles) { return (roles & 0x34) == 0x34; });
}

TEST_F(AddAuthority, SupplierNeedsThreeRolesTogetherUnderAnyDnAndInAnyLetterCase) {
  for (const char* name : {"orv-slapdSupplier", "ORV-SLAPDSUPPLIER"}) {
    expect_roles(kEntry, {"top", name}, [](unsigned roles) { return (roles & 0x34) == 0x34; });
  }
}

TEST_F(AddAuthority, SupplierUnderAProtectedDnHasToPassBothRules) {
  expect_roles(kAudit, {"orv-slapdSupplier"},
               [](unsigned roles) { return (roles & 0x36) == 0x36; });
  expect_roles(kReplication, {"orv-slapdSupplier"},
               [](unsigned roles) { return (roles & 0x34) == 0x34; });
}

TEST_F(AddAuthority, OtherSpellingsOfAProtectedDnAreTheSameEntry) {
  make("cn = Audit, cn=Log Management , cn=Configuration", {});
  as(kGroupMember);
  operation.roles = 0x20;
  EXPECT_EQ(authority(), 50);
  operation.roles = 0x02;
  EXPECT_EQ(authority(), 0);
}

TEST_F(AddAuthority, NormalisedDnIsComparedWithoutRegardToLetterCase) {
  platform.keeps_letter_case = true;
  make(kAudit, {});
  for (char* c = e->normalized_dn; *c != '\0'; ++c) *c = static_cast<char>(std::tolower(*c));
  as(kGroupMember);
  operation.roles = 0x20;
  EXPECT_EQ(authority(), 50);
  operation.roles = 0x02;
  EXPECT_EQ(authority(), 0);
}

TEST_F(AddAuthority, DnThatOnlyBeginsWithAProtectedOneIsOrdinary) {
  for (const char* dn : {"CN=AUDIT,CN=LOG MANAGEMENT,CN=CONFIGURATION,O=X",
                         "CN=MASTER SERVER,CN=CONFIGURATION,O=X"}) {
    expect_roles(dn, {"top"}, [](unsigned roles) { return (roles & 0x20) != 0; });
  }
}

TEST_F(AddAuthority, LeavesAnExitRecord) {
  make(kEntry, {});
  trcEvents = kTraceExit;
  as(0x24);
  authority();
  EXPECT_THAT(platform.records(), ElementsAre("entry 01021600 ", "exit 01021600 50"));
}

// ---- What the file says

class FileChecks : public AddTest {
 protected:
  FileChecks() { open_session(); }
  void TearDown() override {
    close_session();
    AddTest::TearDown();
  }
  int existence(const char* dn = "CN=X") {
    return traced(function_id::check_if_exists, [&] { return checkIfExists(dn, &connection); });
  }
  int parent_of(const char* dn = "CN=X,CN=P") {
    return traced(function_id::check_for_parent,
                  [&] { return checkForParent(dn, &connection, &backend); });
  }
  int replication_context() {
    return traced(function_id::check_for_rep, [&] { return checkForRep(e.get()); });
  }
};

TEST_F(FileChecks, EntryThatExistsGives68) {
  exists("CN=X");
  EXPECT_EQ(existence(), 68);
  EXPECT_THAT(platform.calls({"cfg_search_s", "cfg_count_entries", "cfg_msgfree"}),
              ElementsAre("cfg_search_s(session, \"CN=X\", 0, \"objectclass=*\", null, 0)",
                          "cfg_count_entries(session, chain)", "cfg_msgfree(chain)"));
}

TEST_F(FileChecks, EntryThatIsNotThereGives0) {
  EXPECT_EQ(existence(), 0);
  platform.file["CN=X"] = {};
  EXPECT_EQ(existence(), 0);
  EXPECT_EQ(platform.count("cfg_msgfree"), 1);
  platform.file["CN=X"] = {{{"CN=X", {}}}};
  platform.fail("cfg_count_entries", 2, -1);
  EXPECT_EQ(existence(), 0);
}

TEST_F(FileChecks, OtherCodesOfTheSearchForTheEntryComeBack) {
  for (const int code : {1, 9, 34, 80, 90}) {
    platform.file["CN=X"] = {{{"CN=X", {}}}, code};
    EXPECT_EQ(existence(), code);
  }
  platform.file["CN=X"] = {{{"CN=X", {}}}, 32};
  EXPECT_EQ(existence(), 0);
  EXPECT_EQ(platform.count("cfg_msgfree"), 6);
  EXPECT_EQ(platform.count("cfg_count_entries"), 0);
}

TEST_F(FileChecks, ParentThatExistsGives0AndItsDnGoesRightAfterTheSearch) {
  exists("CN=P");
  platform.name_allocation(1, "parent");
  EXPECT_EQ(parent_of(), 0);
  EXPECT_THAT(
      platform.calls(
          {"dn_parent_norm", "cfg_search_s", "free", "cfg_count_entries", "cfg_msgfree"}),
      ElementsAre("dn_parent_norm(backend, \"CN=X,CN=P\")",
                  "cfg_search_s(session, \"CN=P\", 0, \"objectclass=*\", null, 0)", "free(parent)",
                  "cfg_count_entries(session, chain)", "cfg_msgfree(chain)"));
}

TEST_F(FileChecks, EntryWithoutAParentPassesWithoutASearch) {
  EXPECT_EQ(parent_of("CN=X"), 0);
  EXPECT_EQ(platform.count("cfg_search_s"), 0);
}

TEST_F(FileChecks, MissingParentGives32) {
  EXPECT_EQ(parent_of(), 32);
  EXPECT_THAT(platform.calls({"cfg_msgfree"}), ElementsAre("cfg_msgfree(null)"));
  platform.file["CN=P"] = {};
  EXPECT_EQ(parent_of(), 32);
  platform.file["CN=P"] = {{{"CN=P", {}}}};
  platform.fail("cfg_count_entries", 2, -1);
  EXPECT_EQ(parent_of(), 32);
}

TEST_F(FileChecks, OtherCodesOfTheSearchForTheParentComeBack) {
  for (const int code : {1, 9, 34, 80, 90}) {
    platform.file["CN=P"] = {{{"CN=P", {}}}, code};
    EXPECT_EQ(parent_of(), code);
  }
  EXPECT_EQ(platform.count("cfg_msgfree"), 5);
}

TEST_F(FileChecks, ReplicationContextGives92) {
  make(kEntry, {{"objectClass", {"top", "orv-replicationContext"}}});
  EXPECT_EQ(replication_context(), 92);
  EXPECT_THAT(platform.calls(),
              ElementsAre("value_find_short_list(\"orv-replicationContext\", 22)"));
  make(kEntry, {{"objectClass", {"top", "orv-replicationContextX"}}});
  EXPECT_EQ(replication_context(), 0);
  make(kEntry, {});
  EXPECT_EQ(replication_context(), 0);
}

TEST_F(FileChecks, OnlyTheAnswer0MeansAReplicationContext) {
  make(kEntry, {});
  for (const int answer : {1, -1, 80}) {
    platform.forget();
    platform.fail("value_find_short_list", 1, answer);
    EXPECT_EQ(replication_context(), 0);
  }
}

TEST_F(FileChecks, LeaveExitRecords) {
  trcEvents = kTraceExit;
  make(kEntry, {{"objectClass", {"orv-replicationContext"}}});
  exists("CN=X");
  existence();
  parent_of();
  replication_context();
  EXPECT_THAT(platform.records(),
              ElementsAre("entry 01021700 ", "exit 01021700 68", "entry 01021800 ",
                          "exit 01021800 32", "entry 01021900 ", "exit 01021900 92"));
}

// ---- The entry in the file's code page

class Translation : public AddTest {
 protected:
  int translate() {
    return traced(function_id::xlate_attrs, [&] { return xlate_attrs(e->attributes, &list); });
  }
  void clean() {
    EXPECT_EQ(platform.run([&] { return cleanup_attrs(&list); }), 0);
    EXPECT_EQ(list, nullptr);
    e.reset();
    EXPECT_THAT(platform.leaks(), IsEmpty());
  }
  [[nodiscard]] std::string text() const {
    entry shown{};
    shown.attributes = list;
    return scripted::text_of(shown);
  }

  attr* list = nullptr;
};

TEST_F(Translation, MirrorsTheListWithValuesInTheLocalCodePage) {
  make(kEntry, {{"cn", {"a", "k\xC3\xA4se"}}, {"sn", {}}, {"l", {""}}});
  EXPECT_EQ(translate(), 0);
  EXPECT_THAT(platform.calls(),
              ElementsAre("xlate_utf8_to_localcp(\"a\")", "xlate_utf8_to_localcp(\"k\xC3\xA4se\")",
                          "xlate_utf8_to_localcp(\"\")"));
  ASSERT_NE(list, nullptr);
  EXPECT_EQ(list->type, e->attributes->type);  // shared
  EXPECT_EQ(list->values[0]->bv_len, 2U);      // with the NUL
  EXPECT_STREQ(list->values[1]->bv_val, "k\xE4se");
  EXPECT_EQ(list->values[2], nullptr);
  EXPECT_EQ(list->count, 2);
  EXPECT_EQ(list->next->type, e->attributes->next->type);
  EXPECT_EQ(list->next->values[0], nullptr);
  EXPECT_EQ(list->next->next->values[0]->bv_len, 1U);
  EXPECT_EQ(list->next->next->next, nullptr);
  clean();
}

TEST_F(Translation, NullValueArrayCountsAsNone) {
  platform.empty_lists_are_null = true;
  make(kEntry, {{"cn", {}}});
  EXPECT_EQ(translate(), 0);
  ASSERT_NE(list, nullptr);
  EXPECT_EQ(list->values[0], nullptr);
  clean();
}

TEST_F(Translation, ValuesAreReadUpToTheirNul) {
  make(kEntry, {{"cn", {"abc"}}});
  e->attributes->values[0]->bv_val[1] = '\0';
  EXPECT_EQ(translate(), 0);
  EXPECT_EQ(list->values[0]->bv_len, 2U);
  clean();
}

TEST_F(Translation, NoAttributesGiveNoList) {
  make(kEntry, {});
  list = reinterpret_cast<attr*>(1);
  EXPECT_EQ(translate(), 0);
  EXPECT_EQ(list, nullptr);
  clean();
}

TEST_F(Translation, OnlyTheCodeOfTheLastValueSurvives) {
  make(kEntry, {{"cn", {"a", "b"}}, {"sn", {"c"}}});
  platform.fail("xlate_utf8_to_localcp", 1, 21);
  platform.fail("xlate_utf8_to_localcp", 2, 90);
  EXPECT_EQ(translate(), 0);
  EXPECT_EQ(platform.count("xlate_utf8_to_localcp"), 3);
  EXPECT_EQ(list->values[0]->bv_val, nullptr);
  EXPECT_EQ(list->values[1]->bv_val, nullptr);
  EXPECT_STREQ(list->next->values[0]->bv_val, "c");
  clean();
}

TEST_F(Translation, LastValueThatFailsGivesItsCodeWithTheWholeList) {
  make(kEntry, {{"cn", {"a"}}, {"sn", {"c"}}});
  platform.fail("xlate_utf8_to_localcp", 2, 21);
  EXPECT_EQ(translate(), 21);
  EXPECT_EQ(text(), "<null>|cn=a" + std::string(1, '\0') + "|sn=<null 0>");
  clean();
}

TEST_F(Translation, ConversionThatTouchesNoResultLeavesNullAndLengthZero) {
  make(kEntry, {{"cn", {"a", "b"}}});
  platform.results_left_alone = true;
  platform.fail("xlate_utf8_to_localcp", 1, 21);
  EXPECT_EQ(translate(), 0);
  EXPECT_EQ(list->values[0]->bv_val, nullptr);
  EXPECT_EQ(list->values[0]->bv_len, 0U);
  EXPECT_STREQ(list->values[1]->bv_val, "b");
  clean();
}

TEST_F(Translation, AttributeWithoutValuesKeepsTheCodeOfTheValueBefore) {
  make(kEntry, {{"cn", {"a"}}, {"sn", {}}});
  platform.fail("xlate_utf8_to_localcp", 1, 21);
  EXPECT_EQ(translate(), 21);
  clean();
}

TEST_F(Translation, LastValueWithoutMemoryGives90WithoutAList) {
  make(kEntry, {{"cn", {"a"}}, {"sn", {"c"}}});
  platform.fail("xlate_utf8_to_localcp", 2, 90);
  EXPECT_EQ(translate(), 90);
  EXPECT_EQ(list, nullptr);
  clean();
}

TEST_F(Translation, NoMemoryForAValueArrayOrAValueGives90WithoutAList) {
  // record, array, value, text; record, array, value, text
  for (const int nth : {2, 3, 6, 7}) {
    make(kEntry, {{"cn", {"a"}}, {"sn", {"c"}}});
    platform.fail_allocation(nth);
    EXPECT_EQ(translate(), 90) << nth;
    EXPECT_EQ(list, nullptr);
    EXPECT_EQ(platform.allocations(), nth);
    clean();
  }
}

TEST_F(Translation, NoMemoryForAnAttributeEndsTheListBeforeIt) {
  make(kEntry, {{"cn", {"a"}}, {"sn", {"c"}}, {"l", {"d"}}});
  platform.fail_allocation(5);
  EXPECT_EQ(translate(), 0);
  EXPECT_EQ(platform.allocations(), 5);
  ASSERT_NE(list, nullptr);
  EXPECT_EQ(list->next, nullptr);
  clean();
}

TEST_F(Translation, ListThatEndsEarlyKeepsTheCodeOfItsLastValue) {
  make(kEntry, {{"cn", {"a"}}, {"sn", {"c"}}});
  platform.fail("xlate_utf8_to_localcp", 1, 21);
  platform.fail_allocation(4);  // the second attribute
  EXPECT_EQ(translate(), 21);
  ASSERT_NE(list, nullptr);
  EXPECT_EQ(list->next, nullptr);
  clean();
}

TEST_F(Translation, CleaningTakesNullAndAnEmptyList) {
  EXPECT_EQ(platform.run([&] { return cleanup_attrs(nullptr); }), 0);
  clean();
}

TEST_F(Translation, LeavesExitRecords) {
  trcEvents = kTraceExit;
  make(kEntry, {{"cn", {"a"}}});
  platform.fail("xlate_utf8_to_localcp", 1, 90);
  translate();
  EXPECT_EQ(last_record(), "exit 01021a00 90");
  EXPECT_THAT(platform.records(), Contains("exit 01021b00 0"));
}

// ---- The handler

class Add : public AddTest {
 protected:
  Add() {
    exists(kConfiguration);
    make(kEntry, {{"objectClass", {"top"}}, {"cn", {"x"}}});
  }

  int add() {
    return traced(function_id::config_back_add, [&] { return config_back_add(&pb); });
  }

  // The backend's own functions that were entered, and the platform's that are named, in order.
  std::vector<std::string> path(const std::set<std::string>& functions) {
    static const std::map<std::uint32_t, std::string> kNames = {
        {function_id::process_roles_if_admin_group_entry, "roles"},
        {function_id::check_add_authority, "authority"},
        {function_id::init_cfg_ld, "session"},
        {function_id::check_if_exists, "existence"},
        {function_id::check_for_parent, "parent"},
        {function_id::check_for_rep, "replication context"},
        {function_id::check_if_admin_group_entry, "group"},
        {function_id::check_if_repl_supplier_entry, "supplier"},
        {function_id::check_if_kerberos_entry, "Kerberos"},
        {function_id::check_if_digest_entry, "Digest"},
        {function_id::check_if_proxy_split_container, "proxy split"},
        {function_id::check_if_passthru_subtree_entry, "pass-through"},
        {function_id::check_admin_policy_entry, "password"},
        {function_id::xlate_attrs, "translation"},
        {function_id::cleanup_attrs, "cleaning"},
        {function_id::config_end, "end"}};
    std::vector<std::string> steps;
    for (const scripted::Event& event : platform.events()) {
      if (event.kind == scripted::Event::Kind::entry) {
        const auto found = kNames.find(event.number);
        if (found != kNames.end()) steps.push_back(found->second);
      } else if (event.kind == scripted::Event::Kind::call && functions.contains(event.function)) {
        steps.push_back(event.function);
      }
    }
    return steps;
  }

  void expect_at_rest() {
    EXPECT_FALSE(locked());
    EXPECT_EQ(connection.config_session, nullptr);
    EXPECT_EQ(platform.count("pthread_mutex_lock"), 1);
    EXPECT_EQ(platform.count("pthread_mutex_unlock"), 1);
    EXPECT_EQ(platform.count("cfg_unbind"), 1);
  }
  void expect_no_lock_touched() {
    EXPECT_EQ(platform.count("pthread_mutex_lock"), 0);
    EXPECT_EQ(platform.count("pthread_mutex_unlock"), 0);
    EXPECT_EQ(platform.count("cfg_unbind"), 0);
    EXPECT_EQ(connection.config_session, nullptr);
  }
};

TEST_F(Add, GoesThroughItsStepsInOrder) {
  trcEvents = kTraceEntry;
  platform.admin_policy = true;
  EXPECT_EQ(add(), 0);
  EXPECT_THAT(
      path({"slapi_pblock_get", "ldcf_api_schema_check", "checkReferral", "pwdIsAdminPolicyOn",
            "EntryToLDAPMod", "cfg_add_s", "free_ldmll", "cfg_unbind", "send_ldap_result"}),
      ElementsAre("slapi_pblock_get", "slapi_pblock_get", "slapi_pblock_get", "slapi_pblock_get",
                  "roles", "ldcf_api_schema_check", "authority", "session", "existence", "parent",
                  "checkReferral", "replication context", "group", "supplier", "Kerberos", "Digest",
                  "proxy split", "pass-through", "pwdIsAdminPolicyOn", "password", "translation",
                  "EntryToLDAPMod", "cfg_add_s", "free_ldmll", "cleaning", "cfg_unbind", "end",
                  "send_ldap_result"));
  expect_answered(0);
  expect_at_rest();
}

TEST_F(Add, ReadsItsParametersInOrder) {
  add();
  EXPECT_THAT(platform.calls({"slapi_pblock_get"}),
              ElementsAre("slapi_pblock_get(130)", "slapi_pblock_get(131)", "slapi_pblock_get(132)",
                          "slapi_pblock_get(60)"));
}

TEST_F(Add, WritesTheTranslatedEntryUnderTheClientsDn) {
  make("cn=K\xC3\xA4se , cn=Configuration",
       {{"objectClass", {"top", "x"}}, {"cn", {"K\xC3\xA4se"}}});
  EXPECT_EQ(add(), 0);
  EXPECT_THAT(platform.calls({"ldcf_api_schema_check", "checkReferral", "cfg_add_s"}),
              ElementsAre("ldcf_api_schema_check(entry, 0, 0)", "checkReferral(entry)",
                          "cfg_add_s(session, \"cn=K\xE4se , cn=Configuration\", "
                          "\"0 objectClass=top,x|0 cn=K\xE4se\")"));
}

TEST_F(Add, ReleasesListThenRecordsThenSessionThenDnBeforeItAnswers) {
  platform.name_allocation_in("xlate_utf8_to_localcp", 3, "local DN");
  platform.name_allocation_in("xlate_utf8_to_localcp", 1, "first value");
  EXPECT_EQ(add(), 0);
  EXPECT_THAT(
      platform.calls({"cfg_add_s", "free_ldmll", "free", "cfg_unbind", "pthread_mutex_unlock",
                      "send_ldap_result"}),
      ElementsAre("cfg_add_s(session, \"cn=x, cn=Configuration\", "
                  "\"0 objectClass=top|0 cn=x\")",
                  "free_ldmll(first modification)", "free(modifications)", "free(first value)",
                  "cfg_unbind(session)", "pthread_mutex_unlock(configMutex)", "free(local DN)",
                  "send_ldap_result(connection, operation, 0, null, \"\")"));
}

TEST_F(Add, ParameterThatCannotBeReadGives1WithoutALock) {
  for (const int nth : {1, 2, 3, 4}) {
    platform.forget();
    platform.fail("slapi_pblock_get", nth, -1);
    EXPECT_EQ(add(), 1);
    EXPECT_EQ(platform.count("slapi_pblock_get"), nth);
    EXPECT_EQ(platform.count("ldcf_api_schema_check"), 0);
    expect_no_lock_touched();
    if (nth == 4) {
      expect_answered(1);
    } else {
      EXPECT_EQ(platform.count("send_ldap_result"), 0) << nth;
    }
  }
}

// ---- Steps 3 to 7

class AddMember : public Add {
 protected:
  AddMember() {
    exists("CN=ADMINGROUP,CN=CONFIGURATION");
    platform.file[kConfiguration] = {{{kConfiguration, {{"orv-slapdAdminDN", {"cn=root"}}}}}};
  }
  void member(const Attributes& more) {
    Attributes attributes = {
        {"objectClass", {"top", "orv-slapdConfigEntry", "orv-slapdAdminGroupMember"}},
        {"orv-slapdAdminDN", {"cn=new"}}};
    attributes.insert(attributes.end(), more.begin(), more.end());
    make("cn=m,cn=AdminGroup,cn=Configuration", attributes);
  }
};

TEST_F(AddMember, UnknownRoleGives80WithItsTextBeforeAnythingElseIsAsked) {
  member({{"orv-slapdAdminRole", {"SchemaAdmin", "King"}}});
  trcEvents = kTraceEntry;
  EXPECT_EQ(add(), 80);
  expect_answered(80, "Invalid administrative role value");
  EXPECT_THAT(path({"ldcf_api_schema_check"}), ElementsAre("roles", "ldcf_api_schema_check"));
  expect_no_lock_touched();
}

TEST_F(AddMember, UnknownRoleIsAnsweredAlsoWhenTheSchemaRefuses) {
  member({{"orv-slapdAdminRole", {"King"}}});
  platform.fail("ldcf_api_schema_check", 1, 65);
  EXPECT_EQ(add(), 80);
  expect_answered(80, "Invalid administrative role value");
}

TEST_F(AddMember, OtherCodesOfTheRolesAreAnsweredUnchangedWithoutText) {
  member({});
  platform.fail("attr_merge", 1, 90);
  EXPECT_EQ(add(), 90);
  expect_answered(90);
  EXPECT_EQ(platform.count("ldcf_api_schema_check"), 1);
  expect_no_lock_touched();
  platform.forget();
  as(kGroupMember);
  EXPECT_EQ(add(), 50);
  expect_answered(50);
}

TEST_F(AddMember, DefaultRolesAreInTheEntryBeforeTheSchemaLooksAtItAndAreWritten) {
  member({});
  EXPECT_EQ(add(), 0);
  EXPECT_THAT(platform.calls({"attr_merge", "ldcf_api_schema_check"}),
              ElementsAre("attr_merge(\"orv-slapdAdminRole\", "
                          "\"DirDataAdmin,PasswordAdmin,SchemaAdmin,ServerConfigGroupMember,"
                          "ServerStartStopAdmin\", 1, 1, null)",
                          "ldcf_api_schema_check(entry, 0, 0)"));
  EXPECT_THAT(platform.calls({"cfg_add_s"})[0],
              testing::HasSubstr("|0 orv-slapdAdminRole=DirDataAdmin,PasswordAdmin,SchemaAdmin,"
                                 "ServerConfigGroupMember,ServerStartStopAdmin"));
}

TEST_F(AddMember, NoAdminIsWrittenAlone) {
  member({{"orv-slapdAdminRole", {"SchemaAdmin", "noadmin", "AuditAdmin"}}});
  EXPECT_EQ(add(), 0);
  EXPECT_THAT(platform.calls({"cfg_add_s"})[0],
              testing::EndsWith("|0 orv-slapdAdminRole=NoAdmin\")"));
}

TEST_F(AddMember, PasswordIsVerifiedWhileThePolicyIsOn) {
  member({{"orv-slapdAdminPW", {"weak"}}});
  platform.admin_policy = true;
  platform.fail("verify_admin_password", 1, 19);
  EXPECT_EQ(add(), 19);
  expect_answered(19);
  EXPECT_THAT(platform.calls({"verify_admin_password"}),
              ElementsAre("verify_admin_password(\"weak\", null, operation)"));
  EXPECT_EQ(platform.count("cfg_add_s"), 0);
}

TEST_F(Add, RefusedCallerIsAnsweredWith50WithoutALock) {
  as(0x24);
  exists("CN=X,CN=CONFIGURATION");
  EXPECT_EQ(add(), 50);
  expect_answered(50);
  expect_no_lock_touched();
}

TEST_F(Add, SchemaRefusalSkipsAuthorityAndIsToldAfterExistenceAndParent) {
  as(0x24);
  const auto refused_by_schema = [&] {
    platform.forget();
    platform.fail("ldcf_api_schema_check", 1, 21);
    return add();
  };
  trcEvents = kTraceEntry;
  EXPECT_EQ(refused_by_schema(), 21);
  EXPECT_THAT(path({"checkReferral"}),
              ElementsAre("roles", "session", "existence", "parent", "end"));
  expect_answered(21);
  expect_at_rest();
  exists("CN=X,CN=CONFIGURATION");
  EXPECT_EQ(refused_by_schema(), 68);
  platform.file.clear();
  EXPECT_EQ(refused_by_schema(), 32);
}

TEST_F(Add, FailedBindGives1AnsweredAndKeepsHandleAndLock) {
  platform.fail("cfg_bind_s", 1, 7);
  EXPECT_EQ(add(), 1);
  expect_answered(1);
  EXPECT_EQ(platform.count("cfg_unbind"), 0);
  EXPECT_EQ(platform.count("pthread_mutex_unlock"), 0);
  EXPECT_EQ(platform.count("cfg_search_s"), 0);
  EXPECT_TRUE(locked());
  ASSERT_NE(connection.config_session, nullptr);
  close_session();
}

TEST_F(Add, NoHandleGives90AnsweredAndKeepsTheLock) {
  platform.fail("cfg_init", 1, 0);
  EXPECT_EQ(add(), 90);
  expect_answered(90);
  EXPECT_TRUE(locked());
}

TEST_F(Add, ExceptionOfTheLibraryGives1AnsweredAndLeavesNothing) {
  platform.at("cfg_init", 1, [] { throw 42; });
  EXPECT_EQ(add(), 1);
  expect_answered(1);
  EXPECT_FALSE(locked());
  EXPECT_EQ(platform.count("pthread_mutex_unlock"), 1);
  EXPECT_EQ(platform.count("cfg_unbind"), 0);
  EXPECT_EQ(connection.config_session, nullptr);
}

TEST_F(Add, LockThatCannotBeTakenGives80Answered) {
  platform.fail("pthread_mutex_lock", 1, 22);
  EXPECT_EQ(add(), 80);
  expect_answered(80);
  EXPECT_EQ(platform.count("pthread_mutex_unlock"), 0);
}

// ---- Steps 8 to 18: the first refusal is the answer and ends them

struct Refusal {
  std::string name;
  int code;
  std::string last;  // the rule that refuses
  std::string dn = kEntry;
  Attributes attributes = {};
  std::vector<std::string> in_file = {};
  std::string failing = {};        // a function of the platform that gives the code
  std::string administrator = {};  // the primary administrator's bind DN
};

class AddRefused : public Add, public testing::WithParamInterface<Refusal> {};

TEST_P(AddRefused, IsAnsweredWithTheCodeAndNoLaterRuleIsAsked) {
  static const std::vector<std::string> kOrder = {
      "existence", "parent",   "schema", "checkReferral", "replication context", "group",
      "supplier",  "Kerberos", "Digest", "proxy split",   "pass-through",        "password"};
  const Refusal& refusal = GetParam();
  make(refusal.dn, refusal.attributes);
  for (const std::string& dn : refusal.in_file) exists(dn);
  if (!refusal.administrator.empty()) {
    platform.file[kConfiguration] = {
        {{kConfiguration, {{"orv-slapdAdminDN", {refusal.administrator}}}}}};
  }
  platform.admin_policy = true;
  if (!refusal.failing.empty()) platform.fail(refusal.failing, 1, refusal.code);
  trcEvents = kTraceEntry;
  EXPECT_EQ(add(), refusal.code);

  std::vector<std::string> expected = {"roles"};
  if (refusal.last != "schema") expected.push_back("authority");
  expected.push_back("session");
  for (const std::string& rule : kOrder) {
    if (rule != "schema") expected.push_back(rule);
    if (rule == refusal.last) break;
  }
  expected.push_back("end");
  EXPECT_EQ(path({"checkReferral", "cfg_add_s"}), expected);
  expect_answered(refusal.code);
  expect_at_rest();
}

INSTANTIATE_TEST_SUITE_P(
    Rules, AddRefused,
    testing::Values(
        Refusal{"Existence", 68, "existence", kEntry, {}, {"CN=X,CN=CONFIGURATION"}},
        Refusal{"Parent", 32, "parent", "cn=x,cn=y,cn=configuration"},
        Refusal{"SearchForTheEntry", 80, "existence", kEntry, {}, {}, "cfg_search_s"},
        Refusal{"Schema", 65, "schema", kEntry, {}, {}, "ldcf_api_schema_check"},
        Refusal{"Referral", 53, "checkReferral", kEntry, {}, {}, "checkReferral"},
        Refusal{"ReplicationContext",
                92,
                "replication context",
                kEntry,
                {{"objectClass", {"orv-replicationContext"}}}},
        Refusal{"Group",
                65,
                "group",
                "cn=m,cn=admingroup,cn=configuration",
                {{"orv-slapdAdminRole", {"NoAdmin"}}},
                {"CN=ADMINGROUP,CN=CONFIGURATION"}},
        Refusal{"MemberWhoseBindDnIsTaken",
                68,
                "group",
                "cn=m,cn=admingroup,cn=configuration",
                {{"objectClass", {"top", "orv-slapdConfigEntry", "orv-slapdAdminGroupMember"}},
                 {"orv-slapdAdminRole", {"NoAdmin"}},
                 {"orv-slapdAdminDN", {"CN = Root"}}},
                {"CN=ADMINGROUP,CN=CONFIGURATION"},
                {},
                "cn=root"},
        Refusal{"Supplier",
                80,
                "supplier",
                kEntry,
                {{"objectClass", {"top"}}, {"orv-slapdMasterDN", {"cn=m"}}}},
        Refusal{"Kerberos", 65, "Kerberos", "cn=kerberos,cn=configuration"},
        Refusal{"Digest", 65, "Digest", "cn=digest,cn=configuration"},
        Refusal{"ProxySplit", 21, "proxy split", kEntry, {{"orv-slapdProxySplitName", {"a b"}}}},
        Refusal{"PassThrough",
                53,
                "pass-through",
                "cn=a,cn=b,cn=passthrough authentication,cn=configuration",
                {},
                {"CN=B,CN=PASSTHROUGH AUTHENTICATION,CN=CONFIGURATION"}},
        Refusal{"Password",
                19,
                "password",
                kEntry,
                {{"objectClass", {"top"}}, {"orv-slapdMasterPW", {"weak"}}},
                {},
                "verify_admin_password"}),
    [](const testing::TestParamInfo<Refusal>& refusal) { return refusal.param.name; });

TEST_F(Add, MemberWhoseDnIsTakenIsAnsweredWith68AndAnEmptyText) {
  make("cn=m,cn=admingroup,cn=configuration",
       {{"objectClass", {"top", "orv-slapdConfigEntry", "orv-slapdAdminGroupMember"}},
        {"orv-slapdAdminDN", {"cn=root"}}});
  exists(kGroup);
  platform.file[kConfiguration] = {{{kConfiguration, {{"orv-slapdAdminDN", {"CN=ROOT"}}}}}};
  EXPECT_EQ(add(), 68);
  expect_answered(68);
  expect_at_rest();
}

TEST_F(Add, PasswordIsNotLookedAtWhileThePolicyIsOff) {
  make(kEntry, {{"objectClass", {"top"}}, {"orv-slapdMasterPW", {"weak"}}});
  platform.fail("verify_admin_password", 1, 19);
  EXPECT_EQ(add(), 0);
  EXPECT_EQ(platform.count("pwdIsAdminPolicyOn"), 1);
  EXPECT_EQ(platform.count("verify_admin_password"), 0);
}

TEST_F(Add, MemberWithoutSchemaRoleMayNotAddTheMasterServer) {
  make("cn=Master Server,cn=Configuration", {{"objectClass", {"top"}}});
  as(kGroupMember);
  operation.roles = 0x24;
  EXPECT_EQ(add(), 50);
  operation.roles = 0x34;
  EXPECT_EQ(add(), 0);
}

// ---- Steps 19 to 22

TEST_F(Add, EntryWithoutAttributesIsASuccessWithoutAWrite) {
  make(kEntry, {});
  EXPECT_EQ(add(), 0);
  EXPECT_EQ(platform.count("xlate_utf8_to_localcp"), 0);
  EXPECT_EQ(platform.count("EntryToLDAPMod"), 0);
  EXPECT_EQ(platform.count("cfg_add_s"), 0);
  expect_answered(0);
  expect_at_rest();
}

TEST_F(Add, DnThatWasNotMadeIsASuccessWithoutAWrite) {
  platform.fail("xlate_utf8_to_localcp", 3, 0);
  EXPECT_EQ(add(), 0);
  EXPECT_EQ(platform.count("EntryToLDAPMod"), 0);
  expect_answered(0);
  expect_at_rest();
}

TEST_F(Add, ListThatWasNotMadeIsASuccessWithoutAWrite) {
  platform.fail("EntryToLDAPMod", 1, 0);
  EXPECT_EQ(add(), 0);
  EXPECT_EQ(platform.count("cfg_add_s"), 0);
  EXPECT_EQ(platform.count("free_ldmll"), 0);
  expect_answered(0);
  expect_at_rest();
}

TEST_F(Add, LastValueThatCannotBeTranslatedEndsWithItsCode) {
  platform.fail("xlate_utf8_to_localcp", 2, 21);
  EXPECT_EQ(add(), 21);
  EXPECT_EQ(platform.count("xlate_utf8_to_localcp"), 2);  // not the DN
  EXPECT_EQ(platform.count("cfg_add_s"), 0);
  expect_answered(21);
  expect_at_rest();
}

TEST_F(Add, EarlierValueThatCannotBeTranslatedIsPassedOnAsItIs) {
  platform.fail("xlate_utf8_to_localcp", 1, 21);
  EXPECT_EQ(add(), 0);
  EXPECT_THAT(platform.calls({"cfg_add_s"}),
              ElementsAre("cfg_add_s(session, \"cn=x, cn=Configuration\", "
                          "\"0 objectClass=<null>|0 cn=x\")"));
}

TEST_F(Add, EarlierValueThatWasTranslatedInPartIsPassedOnAsItIs) {
  platform.failed_text_is_left = true;
  platform.fail("xlate_utf8_to_localcp", 1, 21);
  EXPECT_EQ(add(), 0);
  EXPECT_THAT(platform.calls({"cfg_add_s"}),
              ElementsAre(testing::Not(testing::HasSubstr("<null>"))));
}

TEST_F(Add, DnThatCannotBeTranslatedEndsWithItsCode) {
  platform.failed_text_is_left = true;  // what it left is not used
  platform.fail("xlate_utf8_to_localcp", 3, 21);
  EXPECT_EQ(add(), 21);
  EXPECT_EQ(platform.count("EntryToLDAPMod"), 0);
  expect_answered(21);
  expect_at_rest();
}

TEST_F(Add, NoMemoryForTheTranslationEndsWith90) {
  platform.fail("xlate_utf8_to_localcp", 2, 90);
  EXPECT_EQ(add(), 90);
  expect_answered(90);
  expect_at_rest();
}

TEST_F(Add, LibrarysNineBecomes32) {
  platform.fail("cfg_add_s", 1, 9);
  EXPECT_EQ(add(), 32);
  EXPECT_EQ(platform.count("free_ldmll"), 1);
  expect_answered(32);
  expect_at_rest();
}

TEST_F(Add, OtherCodesOfTheLibraryAreAnsweredUnchanged) {
  for (const int code : {1, 16, 21, 51, 53, 68, 80, 90}) {
    platform.forget();
    platform.fail("cfg_add_s", 1, code);
    EXPECT_EQ(add(), code);
    EXPECT_EQ(platform.count("cfg_perror"), 0);
    expect_answered(code);
    expect_at_rest();
  }
}

TEST_F(Add, NineOfAnotherStepStaysNine) {
  platform.fail("cfg_search_s", 1, 9);
  EXPECT_EQ(add(), 9);
  platform.forget();
  platform.fail("xlate_utf8_to_localcp", 3, 9);
  EXPECT_EQ(add(), 9);
}

TEST_F(Add, TracesTheBlockOnEntryAndTheResultOnExit) {
  trcEvents = kTraceEntry;
  platform.fail("slapi_pblock_get", 4, -1);
  add();
  char expected[64];
  std::snprintf(expected, sizeof expected, "entry 01020100 pb=0x%p", static_cast<void*>(&pb));
  EXPECT_THAT(platform.records(), ElementsAre(expected, "exit 01020100 1"));
}

TEST_F(Add, ExitRecordsCarryTheCodeOfEveryEnd) {
  trcEvents = kTraceExit;
  const auto last = [&] {
    add();
    return last_record();
  };
  EXPECT_EQ(last(), "exit 01020100 0");
  as(0x24);
  EXPECT_EQ(last(), "exit 01020100 50");
  as(kPrimary);
  platform.fail("pthread_mutex_lock", 2, 22);
  EXPECT_EQ(last(), "exit 01020100 80");
  exists("CN=X,CN=CONFIGURATION");
  EXPECT_EQ(last(), "exit 01020100 68");
}

}  // namespace
}  // namespace orv
