// The modification list for the file, and the entry as it would be.
#include "backend_test.h"
#include "config_modify.h"
#include "slapi/owners.h"

namespace orv {
namespace {

using Attributes = std::vector<scripted::ScriptedAttribute>;
using Script = std::vector<scripted::ScriptedModification>;

// ======== The list for the file

class ListForTheFile : public BackendTest {
 protected:
  void TearDown() override {
    ldap_mods_free(list, 1);
    BackendTest::TearDown();
  }

  int add(int operation, const char* type, const char* value) {
    return traced(0x01030400, [&] { return addmodifyop(&list, operation, type, value); });
  }
  // "code type=value,value" for each record; "=" only where there is an array.
  [[nodiscard]] std::vector<std::string> records() const {
    std::vector<std::string> texts;
    for (ldapmod** mod = list; mod != nullptr && *mod != nullptr; ++mod) {
      std::string text = std::to_string((*mod)->mod_op) + " " +
                         ((*mod)->mod_type == nullptr ? "<null>" : (*mod)->mod_type);
      char** const values = (*mod)->mod_vals.modv_strvals;
      if (values != nullptr) text += "=";
      for (char** value = values; value != nullptr && *value != nullptr; ++value) {
        text += (value == values ? "" : ",") + std::string(*value);
      }
      texts.push_back(text);
    }
    return texts;
  }

  ldapmod** list = nullptr;
};

TEST_F(ListForTheFile, CollectsValuesOfOneTypeAndCodeInAnyLetterCase) {
  EXPECT_EQ(add(0, "cn", "a"), 0);
  EXPECT_EQ(add(0, "CN", "b"), 0);
  EXPECT_EQ(add(0, "Cn", "c"), 0);
  EXPECT_THAT(records(), ElementsAre("0 cn=a,b,c"));
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
}

TEST_F(ListForTheFile, KeepsCodesApartExactly) {
  add(0, "cn", "a");
  add(1, "cn", "b");
  add(2, "cn", "c");
  add(0x80, "cn", "d");
  add(1, "cn", "e");
  EXPECT_THAT(records(), ElementsAre("0 cn=a", "1 cn=b,e", "2 cn=c", "128 cn=d"));
  list[3]->mod_op = 0;  // its values are texts, whatever the code says: they are released so
}

TEST_F(ListForTheFile, KeepsRecordsInTheOrderOfTheirFirstCalls) {
  add(0, "cn", "a");
  add(0, "sn", "b");
  add(0, "cn", "c");
  add(0, "snx", "d");
  EXPECT_THAT(records(), ElementsAre("0 cn=a,c", "0 sn=b", "0 snx=d"));
}

TEST_F(ListForTheFile, CallWithoutAValueMakesTheRecordAndNoArray) {
  EXPECT_EQ(add(2, "cn", nullptr), 0);
  EXPECT_EQ(add(2, "cn", nullptr), 0);
  EXPECT_THAT(records(), ElementsAre("2 cn"));
  add(2, "cn", "a");
  EXPECT_EQ(add(2, "cn", nullptr), 0);
  EXPECT_THAT(records(), ElementsAre("2 cn=a"));
}

TEST_F(ListForTheFile, EmptyValueIsOne) {
  add(0, "cn", "");
  add(0, "cn", "a");
  EXPECT_THAT(records(), ElementsAre("0 cn=,a"));
}

TEST_F(ListForTheFile, OwnsItsTypesAndLinksNothing) {
  char type[] = "cn";
  add(0, type, "a");
  type[0] = 'x';
  EXPECT_STREQ(list[0]->mod_type, "cn");
  EXPECT_EQ(list[0]->mod_next, nullptr);
}

TEST_F(ListForTheFile, ValuesAreInTheLocalCodePageAndTypesAsTheyCame) {
  add(0, "\xC3\xA4", "b\xC3\xA4r");
  EXPECT_THAT(records(), ElementsAre("0 \xC3\xA4=b\xE4r"));
  EXPECT_THAT(platform.calls({"xlate_utf8_to_localcp"}),
              ElementsAre("xlate_utf8_to_localcp(\"b\xC3\xA4r\")"));
}

TEST_F(ListForTheFile, GrowsByExactlyOneSlot) {
  constexpr std::size_t kOneSlot = 2 * sizeof(void*);  // and the terminator
  for (const char* type : {"a", "b", "c"}) add(0, type, nullptr);
  EXPECT_THAT(platform.sizes,
              ElementsAre(kOneSlot, sizeof(ldapmod), sizeof(ldapmod), sizeof(ldapmod)));
  EXPECT_THAT(platform.calls({"safe_realloc"}),
              ElementsAre("safe_realloc(24)", "safe_realloc(32)"));
  platform.forget();
  for (const char* value : {"1", "2", "3"}) add(0, "a", value);
  EXPECT_THAT(platform.sizes, ElementsAre(kOneSlot));
  EXPECT_THAT(platform.calls({"safe_realloc"}),
              ElementsAre("safe_realloc(24)", "safe_realloc(32)"));
  EXPECT_EQ(list[3], nullptr);
  EXPECT_EQ(list[0]->mod_vals.modv_strvals[3], nullptr);
}

TEST_F(ListForTheFile, CodeOfTheConversionComesBackAndTheRecordStays) {
  add(0, "cn", "a");
  platform.forget();
  platform.fail("xlate_utf8_to_localcp", 1, 21);
  EXPECT_EQ(add(0, "cn", "b"), 21);
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
  EXPECT_THAT(records(), ElementsAre("0 cn=a"));
  platform.forget();
  platform.fail("xlate_utf8_to_localcp", 1, 80);
  EXPECT_EQ(add(1, "cn", "b"), 80);
  EXPECT_THAT(records(), ElementsAre("0 cn=a", "1 cn="));
}

TEST_F(ListForTheFile, ConversionThatTouchesNoResultLeavesTheValuesTerminated) {
  platform.results_left_alone = true;
  platform.fail("xlate_utf8_to_localcp", 1, 21);
  EXPECT_EQ(add(0, "cn", "a"), 21);
  EXPECT_THAT(records(), ElementsAre("0 cn="));
  EXPECT_EQ(add(0, "cn", "a"), 0);
  platform.forget();
  platform.fail("xlate_utf8_to_localcp", 1, 21);
  EXPECT_EQ(add(0, "cn", "b"), 21);
  EXPECT_THAT(records(), ElementsAre("0 cn=a"));
}

// What is in the list after the n-th allocation failed, and what was told.
TEST_F(ListForTheFile, EachAllocationOfANewRecordFailsWithItsText) {
  const struct {
    std::vector<DebugLine> told;
    std::vector<std::string> left;  // the code too, which is set before the type is copied
  } cases[] = {
      {{error("addmodifyop: safe_realloc returns NULL \n")}, {}},
      {{error("addmodifyop: calloc returns NULL \n")}, {}},
      {{error("addmodifyop: strdup returns NULL \n")}, {"2 <null>"}},
      {{error("addmodifyop: safe_realloc returns NULL \n")}, {"2 cn"}},
      {{}, {"2 cn="}},  // the conversion
  };
  int nth = 0;
  for (const auto& expected : cases) {
    SCOPED_TRACE(++nth);
    platform.forget();
    platform.fail_allocation(nth);
    EXPECT_EQ(add(2, "cn", "a"), 90);
    EXPECT_EQ(platform.debug_lines(), expected.told);
    EXPECT_EQ(records(), expected.left);
    EXPECT_EQ(list == nullptr, nth == 1);  // what was stored stays
    ldap_mods_free(list, 1);
    list = nullptr;
  }
  platform.forget();
  platform.fail_allocation(nth + 1);
  EXPECT_EQ(add(2, "cn", "a"), 0);
}

TEST_F(ListForTheFile, ArraysThatCannotGrowStayAsTheyWere) {
  add(0, "cn", "a");
  for (const char* type : {"cn", "sn"}) {
    platform.forget();
    platform.fail("safe_realloc", 1, 90);
    EXPECT_EQ(add(0, type, "b"), 90);
    EXPECT_THAT(platform.debug_lines(),
                ElementsAre(error("addmodifyop: safe_realloc returns NULL \n")));
    EXPECT_THAT(records(), ElementsAre("0 cn=a"));
  }
}

TEST_F(ListForTheFile, RecordThatCannotBeMadeLeavesTheListTerminated) {
  add(0, "cn", nullptr);
  platform.forget();
  platform.fail_allocation(2);
  EXPECT_EQ(add(0, "sn", nullptr), 90);
  EXPECT_THAT(platform.debug_lines(), ElementsAre(error("addmodifyop: calloc returns NULL \n")));
  EXPECT_THAT(records(), ElementsAre("0 cn"));
}

TEST_F(ListForTheFile, RecordWithoutATypeIsPassedOver) {
  platform.fail_allocation(3);
  EXPECT_EQ(add(0, "cn", "a"), 90);
  EXPECT_EQ(add(0, "cn", "a"), 0);
  EXPECT_THAT(records(), ElementsAre("0 <null>", "0 cn=a"));
}

TEST_F(ListForTheFile, TextsNeedTheDebugBit) {
  debug_off();
  platform.fail_allocation(1);
  EXPECT_EQ(add(0, "cn", "a"), 90);
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
}

TEST_F(ListForTheFile, LeavesExitRecords) {
  trcEvents = kTraceExit & ~kTraceEntry;
  add(0, "cn", nullptr);
  platform.fail("xlate_utf8_to_localcp", 1, 21);
  add(0, "cn", "a");
  EXPECT_THAT(platform.records(),
              ElementsAre("exit 01030400 0", "exit 01050200 21", "exit 01030400 21"));
}

// ======== The entry as it would be

class ChangedEntry : public BackendTest {
 protected:
  ChangedEntry() { e.reset(scripted::make_entry({"cn=x", {{"cn", {"a", "b"}}}})); }
  void TearDown() override {
    e.reset();
    free_ldmll(modifications);
    BackendTest::TearDown();
  }

  int apply(const Script& script) {
    free_ldmll(modifications);
    modifications = scripted::make_modifications(script);
    return traced(0x01030500, [&] { return mod_entry(e.get(), &modifications); });
  }
  [[nodiscard]] std::string text() const { return scripted::text_of(*e); }

  EntryPtr e;
  ldapmod* modifications = nullptr;
};

TEST_F(ChangedEntry, TakesEachModificationInItsOrder) {
  EXPECT_EQ(apply({{kAdd, "cn", {{"c"}}},
                   {kDelete, "cn", {{"a"}}},
                   {kReplace, "sn", {{"d", "e"}}},
                   {kAdd, "sn", {{"f"}}}}),
            0);
  EXPECT_EQ(text(), "cn=x|cn=b,c|sn=d,e,f");
  EXPECT_THAT(platform.calls({"attr_merge", "attr_delete", "delete_values_from_entry"}),
              ElementsAre("attr_merge(\"cn\", \"c\", 1, 1, null)",
                          "delete_values_from_entry(\"cn\", \"a\")", "attr_delete(\"sn\", null)",
                          "attr_merge(\"sn\", \"d,e\", 1, 1, null)",
                          "attr_merge(\"sn\", \"f\", 1, 1, null)"));
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
}

TEST_F(ChangedEntry, EmptyListChangesNothing) {
  EXPECT_EQ(apply({}), 0);
  EXPECT_EQ(text(), "cn=x|cn=a,b");
}

TEST_F(ChangedEntry, ModificationsInEitherFormOfTheirCodeAreTheSame) {
  EXPECT_EQ(apply({{kModDelete, "cn", std::nullopt}}), 0);
  EXPECT_EQ(text(), "cn=x");
  EXPECT_EQ(apply({{kModReplace, "sn", std::nullopt}}), 0);
  EXPECT_EQ(apply({{kModAdd, "sn", std::nullopt}}), 0);
  EXPECT_THAT(platform.calls({"attr_merge", "attr_delete", "delete_values_from_entry"}),
              ElementsAre("delete_values_from_entry(\"cn\", \"\")", "attr_delete(\"sn\", null)"));
}

TEST_F(ChangedEntry, ReplaceWithoutValuesRemovesTheAttribute) {
  using Values = std::optional<std::vector<std::string>>;
  for (const Values& none : {Values{}, Values{std::vector<std::string>{}}}) {
    platform.forget();
    e.reset(scripted::make_entry({"cn=x", {{"cn", {"a"}}, {"sn", {"b"}}}}));
    EXPECT_EQ(apply({{kReplace, "sn", none}}), 0);
    EXPECT_EQ(text(), "cn=x|cn=a");
    EXPECT_EQ(platform.count("attr_merge"), 0);
  }
}

TEST_F(ChangedEntry, ReplaceOfAnAttributeThatIsMissingSucceeds) {
  EXPECT_EQ(apply({{kReplace, "sn", {{"c"}}}}), 0);
  EXPECT_EQ(text(), "cn=x|cn=a,b|sn=c");
  EXPECT_EQ(apply({{kReplace, "ou", std::nullopt}}), 0);
}

TEST_F(ChangedEntry, ReplaceThatCannotRemoveAddsNothing) {
  for (const auto& [given, code] : {std::pair{-1, 1}, {-2, -2}, {80, 80}, {2, 2}}) {
    platform.forget();
    platform.fail("attr_delete", 1, given);
    EXPECT_EQ(apply({{kReplace, "cn", {{"c"}}}}), code);
    EXPECT_EQ(platform.count("attr_merge"), 0);
  }
}

TEST_F(ChangedEntry, AddWithoutValuesIsPassedOver) {
  EXPECT_EQ(apply({{kAdd, "cn", std::nullopt}, {kAdd, "cn", std::vector<std::string>{}}}), 0);
  EXPECT_EQ(platform.count("attr_merge"), 0);
}

TEST_F(ChangedEntry, CodeOfTheMergeComesBackAndMinusOneIsOne) {
  for (const auto& [given, code] : {std::pair{-1, 1}, {-2, -2}, {20, 20}, {90, 90}}) {
    platform.forget();
    platform.fail("attr_merge", 1, given);
    EXPECT_EQ(apply({{kAdd, "cn", {{"c"}}}}), code);
    platform.forget();
    platform.fail("attr_merge", 1, given);
    EXPECT_EQ(apply({{kReplace, "sn", {{"c"}}}}), code);
  }
}

TEST_F(ChangedEntry, CodeOfADeleteComesBackUnchanged) {
  for (const int code : {-1, 16, 90}) {
    platform.forget();
    platform.fail("delete_values_from_entry", 1, code);
    EXPECT_EQ(apply({{kDelete, "cn", {{"a"}}}}), code);
  }
  platform.forget();
  EXPECT_EQ(apply({{kDelete, "sn", std::nullopt}}), 16);
}

TEST_F(ChangedEntry, LaterDeleteOrReplaceOverwritesAFailure) {
  EXPECT_EQ(apply({{kDelete, "cn", {{"z"}}}, {kDelete, "cn", {{"a"}}}}), 0);
  EXPECT_EQ(apply({{kDelete, "cn", {{"z"}}}, {kReplace, "cn", {{"c"}}}}), 0);
  EXPECT_EQ(text(), "cn=x|cn=c");
  EXPECT_EQ(apply({{3, "cn", std::nullopt}, {kReplace, "cn", {{"d"}}}}), 0);
}

TEST_F(ChangedEntry, FailureKeepsLaterAddsOutAndIsKept) {
  EXPECT_EQ(apply({{kDelete, "cn", {{"z"}}}, {kAdd, "cn", {{"c"}}}, {kAdd, "sn", {{"d"}}}}), 16);
  EXPECT_EQ(platform.count("attr_merge"), 0);
  EXPECT_EQ(text(), "cn=x|cn=a,b");
}

TEST_F(ChangedEntry, AddAfterAReplaceThatHealedIsMerged) {
  EXPECT_EQ(
      apply({{kDelete, "sn", std::nullopt}, {kReplace, "cn", {{"c"}}}, {kAdd, "cn", {{"d"}}}}), 0);
  EXPECT_EQ(text(), "cn=x|cn=c,d");
}

TEST_F(ChangedEntry, UnknownCodeGives80AndTheOthersGoOn) {
  for (const int code : {3, 4, 3 | kModBvalues, -1}) {
    platform.forget();
    EXPECT_EQ(apply({{code, "cn", std::nullopt}}), 80);
    EXPECT_THAT(platform.calls({"attr_merge", "attr_delete", "delete_values_from_entry"}),
                IsEmpty());
  }
  EXPECT_EQ(apply({{kDelete, "cn", {{"z"}}}, {3, "cn", std::nullopt}}), 80);
  EXPECT_EQ(apply({{kAdd, "cn", {{"c"}}}, {3, "cn", std::nullopt}}), 80);
  EXPECT_EQ(text(), "cn=x|cn=a,b,c");
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
}

TEST_F(ChangedEntry, LeavesAnExitRecord) {
  trcEvents = kTraceExit & ~kTraceEntry;
  apply({{3, "cn", std::nullopt}});
  EXPECT_THAT(platform.records(), ElementsAre("exit 01030500 80"));
}

// ======== The check of the entry as it would be

class ChangeCheck : public BackendTest {
 protected:
  ChangeCheck() {
    open_session();
    platform.addresses = {"::1"};
    set({{"objectClass", {"top", "orv-slapdTop"}}, {"orv-slapdIpAddress", {"::1"}}});
  }
  void TearDown() override {
    free_ldmll(modifications);
    EXPECT_THAT(platform.leaks(), ElementsAre("session"));
    EXPECT_EQ(platform.count("pthread_mutex_lock") + platform.count("cfg_modify_s"), 0);
    close_session();
    BackendTest::TearDown();
  }

  static constexpr const char* kEntry = "CN=CONFIGURATION";
  static constexpr const char* kPassthrough = "CN=A,CN=PASSTHROUGH AUTHENTICATION,CN=CONFIGURATION";

  void set(Attributes attributes, int code = 0, const char* dn = kEntry) {
    platform.file[dn] = {{{dn, std::move(attributes)}}, code};
  }
  int check(const Script& script, const char* dn = kEntry) {
    free_ldmll(modifications);
    modifications = scripted::make_modifications(script);
    text = not_text;
    return traced(0x01030600,
                  [&] { return mod_schema_check(&connection, dn, &modifications, &text); });
  }
  // The checks that were made, in their order.
  [[nodiscard]] std::vector<std::string> checks() const {
    std::vector<std::string> names;
    for (const std::string& call :
         platform.calls({"attr_merge", "attr_delete", "ldcf_api_schema_check", "checkReferral",
                         "value_find_short_list", "value_find", "ldap_url_parse"})) {
      names.push_back(call.substr(0, call.find('(')));
    }
    return names;
  }

  ldapmod* modifications = nullptr;
  char not_text[16] = "not a result";
  char* text = nullptr;
};

TEST_F(ChangeCheck, ReadsTheEntryChangesACopyAndChecksIt) {
  EXPECT_EQ(check({{kAdd, "cn", {{"x"}}}}), 0);
  EXPECT_EQ(text, nullptr);
  const std::set<std::string> functions = {"cfg_search_s",
                                           "cfg_count_entries",
                                           "cfg_first_entry",
                                           "CFGMessage2Entry",
                                           "attr_merge",
                                           "checkReferral",
                                           "value_find_short_list",
                                           "value_find",
                                           "ldcf_api_schema_check",
                                           "entry_free",
                                           "cfg_msgfree",
                                           "cfg_perror"};
  EXPECT_THAT(
      platform.calls(functions),
      ElementsAre("cfg_search_s(session, \"CN=CONFIGURATION\", 0, \"objectclass=*\", null, 0)",
                  "cfg_count_entries(session, chain)", "cfg_first_entry(session, chain)",
                  "CFGMessage2Entry(session, record 1)", "attr_merge(\"cn\", \"x\", 1, 1, null)",
                  "ldcf_api_schema_check(?, 0, 0)", "checkReferral(?)",
                  "value_find_short_list(\"orv-replicationContext\", 22)",
                  "value_find(\"objectClass\", \"orv-slapdTop\", 0, 1)", "entry_free(\"entry\")",
                  "cfg_msgfree(chain)"));
}

TEST_F(ChangeCheck, MissingEntryGives32WhateverTheSearchSaid) {
  EXPECT_EQ(check({}, "CN=MISSING"), 32);
  EXPECT_EQ(text, nullptr);
  for (const int code : {0, 1, 80}) {
    platform.forget();
    platform.file[kEntry] = {{}, code};
    EXPECT_EQ(check({}), 32);
    EXPECT_EQ(platform.count("cfg_first_entry"), 0);
    EXPECT_EQ(platform.count("cfg_msgfree"), code == 0 ? 1 : 0);
    EXPECT_THAT(platform.debug_lines(), IsEmpty());
  }
}

TEST_F(ChangeCheck, ResultThatCannotBeCountedHoldsNoEntry) {
  platform.fail("cfg_count_entries", 1, -1);
  EXPECT_EQ(check({}), 32);
  EXPECT_EQ(platform.count("cfg_msgfree"), 1);
}

TEST_F(ChangeCheck, EntryThatCannotBeTakenGives80AndIsReported) {
  for (const std::uint32_t debug : {kTraceDebug, 0U}) {
    trcEvents = debug;
    for (const int number : {5, -1}) {
      platform.forget();
      platform.fail("cfg_first_entry", 1, number);
      EXPECT_EQ(check({}), 80);
      EXPECT_THAT(platform.calls({"cfg_perror", "CFGMessage2Entry", "cfg_msgfree"}),
                  ElementsAre("cfg_perror(session, \"cfg_first_entry\")", "cfg_msgfree(chain)"));
      EXPECT_THAT(platform.debug_lines(), IsEmpty());
    }
  }
}

TEST_F(ChangeCheck, ErrorNumberOfTheSessionCountsAlsoBesideAnEntry) {
  platform.fail("cfg_get_errno", 1, 5);
  EXPECT_EQ(check({}), 80);
  EXPECT_THAT(platform.calls({"cfg_perror", "CFGMessage2Entry", "cfg_msgfree"}),
              ElementsAre("cfg_perror(session, \"cfg_first_entry\")", "cfg_msgfree(chain)"));
}

TEST_F(ChangeCheck, EntryThatCannotBeConvertedGives90) {
  for (const int code : {0, 4}) {
    platform.forget();
    platform.file[kEntry].code = code;
    platform.fail("CFGMessage2Entry", 1, 0);
    EXPECT_EQ(check({{kAdd, "cn", {{"x"}}}}), 90);
    EXPECT_THAT(checks(), IsEmpty());
    EXPECT_EQ(platform.count("cfg_msgfree"), 1);
  }
}

TEST_F(ChangeCheck, CodeOfTheSearchStandsAlsoWhenAnEntryCameWithIt) {
  platform.file[kEntry].code = 4;
  EXPECT_EQ(check({{kAdd, "cn", {{"x"}}}}), 4);
  EXPECT_THAT(checks(), IsEmpty());
  EXPECT_EQ(platform.count("entry_free"), 1);
}

TEST_F(ChangeCheck, FirstRefusalEndsTheChecks) {
  const Script script = {{kAdd, "cn", {{"x"}}}};
  platform.fail("attr_merge", 1, 20);
  EXPECT_EQ(check(script), 20);
  EXPECT_THAT(checks(), ElementsAre("attr_merge"));

  platform.forget();
  platform.fail("ldcf_api_schema_check", 1, 65);
  EXPECT_EQ(check(script), 65);
  EXPECT_THAT(checks(), ElementsAre("attr_merge", "ldcf_api_schema_check"));

  platform.forget();
  platform.fail("checkReferral", 1, 53);
  EXPECT_EQ(check(script), 53);
  EXPECT_THAT(checks(), ElementsAre("attr_merge", "ldcf_api_schema_check", "checkReferral"));

  platform.forget();
  EXPECT_EQ(check({{kAdd, "objectClass", {{"orv-replicationContext"}}}}), 92);
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
  EXPECT_THAT(checks(), ElementsAre("attr_merge", "ldcf_api_schema_check", "checkReferral",
                                    "value_find_short_list"));
  EXPECT_EQ(text, nullptr);
}

TEST_F(ChangeCheck, AddressThatTheHostLacksGives19AndItsText) {
  EXPECT_EQ(check({{kAdd, "orv-slapdIpAddress", {{"10.0.0.1"}}}}), 19);
  EXPECT_STREQ(text, "IP address 10.0.0.1 is not defined for this system.");
  std::free(text);
  EXPECT_THAT(platform.leaks(), Contains("memory"));  // the copy that gen_checkIPaddrs_err keeps
  platform.release_leaks();
  connection.config_session = nullptr;
  modifications = nullptr;
  open_session();
}

TEST_F(ChangeCheck, AddressWhoseTextCannotBeMadeGives19WithoutOne) {
  platform.fail("kel_asprintf", 1, -1);
  EXPECT_EQ(check({{kAdd, "orv-slapdIpAddress", {{"10.0.0.1"}}}}), 19);
  EXPECT_EQ(text, nullptr);
}

TEST_F(ChangeCheck, AddressesOfOtherEntriesAreNotLookedAt) {
  set({{"objectClass", {"top"}}, {"orv-slapdIpAddress", {"10.0.0.1"}}});
  EXPECT_EQ(check({{kAdd, "orv-slapdIpAddress", {{"10.0.0.2"}}}}), 0);
  EXPECT_EQ(platform.count("isValidIPAddressOnSystem"), 0);
}

TEST_F(ChangeCheck, ClassesAreLookedAtAsTheyWouldBe) {
  platform.addresses = {};
  EXPECT_EQ(check({{kReplace, "objectClass", {{"top"}}}}), 0);
  set({{"objectClass", {"top"}}, {"orv-slapdIpAddress", {"::1"}}});
  platform.fail("kel_asprintf", 1, -1);
  EXPECT_EQ(check({{kReplace, "objectClass", {{"orv-slapdTop"}}}}), 19);
  EXPECT_EQ(check({{kReplace, "objectClass", {{"top", "orv-replicationContext"}}}}), 92);
}

TEST_F(ChangeCheck, AddressesAreLookedAtAsTheyWouldBe) {
  platform.addresses = {"127.0.0.1"};  // the host has lost the one in the file
  EXPECT_EQ(check({{kReplace, "orv-slapdIpAddress", {{"127.0.0.1"}}}}), 0);
  EXPECT_EQ(check({{kDelete, "orv-slapdIpAddress", std::nullopt}}), 0);
  EXPECT_EQ(check({{kAdd, "orv-slapdIpAddress", {{"127.0.0.1"}}}}), 19);
  EXPECT_STREQ(text, "IP address ::1 is not defined for this system.");
  std::free(text);
  platform.release_leaks();
  modifications = nullptr;
  open_session();
}

TEST_F(ChangeCheck, PassThroughSettingsComeLastAndUnderTheDnOfTheTarget) {
  set({{"objectClass", {"top"}}, {"orv-slapdPtaURL", {"ldap://a"}}}, 0, kPassthrough);
  platform.fail("ldap_url_parse", 0, 3);
  EXPECT_EQ(check({{kReplace, "orv-slapdPtaURL", {{"bad"}}}}, kPassthrough), 21);
  EXPECT_THAT(checks(),
              ElementsAre("attr_delete", "attr_merge", "ldcf_api_schema_check", "checkReferral",
                          "value_find_short_list", "value_find", "ldap_url_parse"));
  EXPECT_THAT(platform.calls({"ldap_url_parse"}), ElementsAre("ldap_url_parse(\"bad\")"));

  platform.forget();
  set({{"objectClass", {"top"}}, {"orv-slapdPtaURL", {"bad"}}});
  platform.fail("ldap_url_parse", 0, 3);
  EXPECT_EQ(check({}), 0);  // no pass-through entry
}

TEST_F(ChangeCheck, AddressesAreLookedAtBeforePassThroughSettings) {
  platform.addresses = {};
  set({{"objectClass", {"orv-slapdTop"}}, {"orv-slapdIpAddress", {"10.0.0.1"}}}, 0, kPassthrough);
  platform.fail("ldap_url_parse", 0, 3);
  platform.fail("kel_asprintf", 1, -1);
  EXPECT_EQ(check({{kReplace, "orv-slapdPtaURL", {{"bad"}}}}, kPassthrough), 19);
  EXPECT_EQ(platform.count("isValidIPAddressOnSystem"), 1);
  EXPECT_EQ(platform.count("ldap_url_parse"), 0);
}

TEST_F(ChangeCheck, PassThroughSubtreesAreLookedForOnTheSessionOfTheConnection) {
  set({{"objectClass", {"top"}}, {"orv-slapdPtaSubtree", {"o=a"}}}, 0, kPassthrough);
  platform.fail("cfg_search_s", 2, 53);
  EXPECT_EQ(check({}, kPassthrough), 53);
  EXPECT_THAT(
      platform.calls({"cfg_search_s"}),
      ElementsAre("cfg_search_s(session, \"" + std::string(kPassthrough) +
                      "\", 0, \"objectclass=*\", null, 0)",
                  "cfg_search_s(session, \"CN=PASSTHROUGH AUTHENTICATION,CN=CONFIGURATION\", 1, "
                  "\"objectclass=orv-slapdPta\", null, 0)"));
}

TEST_F(ChangeCheck, LeavesExitRecords) {
  trcEvents = kTraceExit & ~kTraceEntry;
  check({}, "CN=MISSING");
  EXPECT_THAT(platform.records(), ElementsAre("exit 01030600 32"));
  platform.forget();
  platform.fail("ldcf_api_schema_check", 1, 65);
  check({});
  EXPECT_THAT(platform.records(), ElementsAre("exit 01030500 0", "exit 01030600 65"));
}

TEST_F(ChangeCheck, EachFailingAllocationIsAnsweredAndLeaksNothing) {
  int nth = 1;
  for (;; ++nth) {
    SCOPED_TRACE(nth);
    ASSERT_LT(nth, 100);
    for (const bool once : {false, true}) {
      platform.forget();
      once ? platform.fail_allocation(nth) : platform.fail_allocations_from(nth);
      const int rc = check({{kReplace, "cn", {{"x"}}}, {kAdd, "sn", {{"y"}}}});
      if (platform.allocations() < nth) break;
      EXPECT_TRUE(rc == 90 || rc == 32) << rc;
      EXPECT_EQ(text, nullptr);
      free_ldmll(modifications);
      modifications = nullptr;
      EXPECT_THAT(platform.leaks(), ElementsAre("session"));
    }
    if (platform.allocations() < nth) break;
  }
  EXPECT_GE(nth, 4);
}

}  // namespace
}  // namespace orv
