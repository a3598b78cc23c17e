// From the configuration file to server entries: code page, readers, converters.
#include "config_xlate.h"

#include "backend_test.h"

namespace orv {
namespace {

constexpr const char* kLocal = "K\xE4se";
constexpr const char* kUtf8 = "K\xC3\xA4se";

class Reading : public BackendTest {
 protected:
  Reading() { session = open_session(); }
  void TearDown() override {
    close_session();
    BackendTest::TearDown();
  }

  _CFG* session;
};

// ---- Code page

TEST_F(Reading, LocalTextBecomesUtf8WithItsLengthAndNul) {
  char* text = nullptr;
  std::size_t length = 0;
  EXPECT_EQ(platform.run([&] { return cfg_xlate_localcp_to_utf8(kLocal, &text, &length); }), 0);
  const Freed owner(text);
  EXPECT_STREQ(text, kUtf8);
  EXPECT_EQ(length, 6U);
}

TEST_F(Reading, Utf8TextBecomesLocalWithItsLengthAndNul) {
  char* text = nullptr;
  std::size_t length = 0;
  EXPECT_EQ(platform.run([&] { return cfg_xlate_utf8_to_localcp(kUtf8, &text, &length); }), 0);
  const Freed owner(text);
  EXPECT_STREQ(text, kLocal);
  EXPECT_EQ(length, 5U);
}

TEST_F(Reading, ConverterCodesComeBackUnchangedAndTraced) {
  trcEvents = kTraceExit;
  platform.fail("xlate_localcp_to_utf8", 1, 21);
  platform.fail("xlate_utf8_to_localcp", 1, 90);
  char* text = nullptr;
  std::size_t length = 0;
  EXPECT_EQ(platform.run([&] { return cfg_xlate_localcp_to_utf8("a", &text, &length); }), 21);
  EXPECT_EQ(platform.run([&] { return cfg_xlate_utf8_to_localcp("a", &text, &length); }), 90);
  EXPECT_THAT(platform.records(), ElementsAre("entry 01050100 ", "exit 01050100 21",
                                              "entry 01050200 ", "exit 01050200 90"));
}

// ---- cfg_read_cfg_entry

class ReadOneAttribute : public Reading {
 protected:
  int read(const char* dn = "CN=X") {
    return traced(0x01050300, [&] { return cfg_read_cfg_entry(session, dn, "cn", 2, &chain); });
  }
  _CFGMessage* chain = nullptr;
};

TEST_F(ReadOneAttribute, AsksForTheOneAttributeWithTheParenthesisedFilter) {
  platform.file["CN=X"] = {{{"CN=X", {}}}};
  EXPECT_EQ(read(), 0);
  EXPECT_THAT(platform.calls({"cfg_search_s"}),
              ElementsAre("cfg_search_s(session, \"CN=X\", 2, \"(objectclass=*)\", [cn], 0)"));
  ASSERT_NE(chain, nullptr);
  EXPECT_EQ(platform.count("cfg_msgfree"), 0);
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
  cfg_msgfree(chain);
}

TEST_F(ReadOneAttribute, CopiesTheNameWithTheServersRoutine) {
  EXPECT_EQ(read(), 32);
  EXPECT_THAT(platform.calls({"slapi_ch_strdup"}), ElementsAre("slapi_ch_strdup(\"cn\")"));
}

TEST_F(ReadOneAttribute, MissingEntryStays32) {
  EXPECT_EQ(read("CN=MISSING"), 32);
  EXPECT_THAT(platform.debug_lines(),
              ElementsAre(error("Error - cfg_read_cfg_entry: entry CN=MISSING does not exist!\n")));
}

TEST_F(ReadOneAttribute, OtherFailuresBecome80) {
  for (const int code : {-1, 1, 3, 9, 31, 33, 34, 90}) {
    platform.forget();
    platform.fail("cfg_search_s", 1, code);
    EXPECT_EQ(read(), 80);
    EXPECT_THAT(platform.debug_lines(),
                ElementsAre(error("Error - cfg_read_cfg_entry: cfg_search_s failed with rc =" +
                                  std::to_string(code) + " for CN=X.\n")));
  }
}

TEST_F(ReadOneAttribute, NoMemoryForListOrNameGives90WithoutASearch) {
  for (const int nth : {1, 2}) {
    platform.forget();
    platform.fail_allocation(nth);
    EXPECT_EQ(read(), 90);
    EXPECT_THAT(platform.debug_lines(),
                ElementsAre(error("Error - cfg_read_cfg_entry: rc = 90\n")));
    EXPECT_EQ(platform.count("cfg_search_s"), 0);
    EXPECT_THAT(platform.leaks(), ElementsAre("session"));
  }
}

TEST_F(ReadOneAttribute, ReleasesListAndNameOnEveryReturn) {
  read("CN=MISSING");
  platform.fail("cfg_search_s", 2, 1);
  read();
  EXPECT_THAT(platform.leaks(), ElementsAre("session"));
}

TEST_F(ReadOneAttribute, LeavesAnExitRecord) {
  trcEvents = kTraceExit;
  platform.fail("cfg_search_s", 1, 1);
  read();
  EXPECT_THAT(platform.records(), ElementsAre("entry 01050300 ", "exit 01050300 80"));
}

// ---- CFGMessage2EntryTrans

class ConvertRecord : public Reading {
 protected:
  void of(ScriptedEntry entry) {
    platform.file["CN=X"] = {{std::move(entry)}};
    cfg_search_s(session, "CN=X", 0, "f", nullptr, 0, &chain);
    record = cfg_first_entry(session, chain);
    platform.forget();
  }
  void TearDown() override {
    entry_free(made);
    cfg_msgfree(chain);
    Reading::TearDown();
  }
  std::string convert() {
    traced(0x01050400, [&] {
      made = CFGMessage2EntryTrans(session, record);
      return made == nullptr ? 90 : 0;
    });
    return made == nullptr ? "null" : scripted::text_of(*made);
  }

  entry* made = nullptr;
  _CFGMessage* chain = nullptr;
  _CFGMessage* record = nullptr;
};

TEST_F(ConvertRecord, ConvertsDnAndValuesToUtf8) {
  of({std::string("CN=") + kLocal, {{"cn", {kLocal, "x"}}, {"sn", {"y"}}}});
  EXPECT_EQ(convert(), std::string("CN=") + kUtf8 + "|cn=" + kUtf8 + ",x|sn=y");
}

TEST_F(ConvertRecord, MergesEachAttributeOnceWithItsFlags) {
  of({"CN=X", {{"cn", {"a", "b", "c"}}, {"sn", {"d"}}}});
  convert();
  EXPECT_THAT(platform.calls({"attr_merge"}),
              ElementsAre("attr_merge(\"cn\", \"a,b,c\", 1, 1, null)",
                          "attr_merge(\"sn\", \"d\", 1, 1, null)"));
}

TEST_F(ConvertRecord, CountedLengthExcludesTheNul) {
  of({"CN=X", {{"cn", {"four"}}}});
  convert();
  EXPECT_EQ(made->attributes->values[0]->bv_len, 4U);
}

TEST_F(ConvertRecord, EmptyValueKeepsLengthZero) {
  of({"CN=X", {{"cn", {""}}}});
  convert();
  EXPECT_EQ(made->attributes->values[0]->bv_len, 0U);
}

TEST_F(ConvertRecord, ValueWithoutConversionKeepsLengthZero) {
  of({"CN=X", {{"cn", {"bad"}}}});
  platform.fail("xlate_localcp_to_utf8", 2, 21);
  EXPECT_EQ(convert(), "CN=X|cn=");
  EXPECT_EQ(platform.calls({"attr_merge"}).front(), "attr_merge(\"cn\", \"<null 0>\", 1, 1, null)");
  EXPECT_EQ(made->attributes->values[0]->bv_len, 0U);
}

TEST_F(ConvertRecord, ConversionThatTouchesNoResultLeavesAnEmptyValue) {
  of({"CN=X", {{"cn", {"a", "bad"}}}});
  platform.results_left_alone = true;
  platform.fail("xlate_localcp_to_utf8", 3, 21);
  EXPECT_EQ(convert(), "CN=X|cn=a,");
  EXPECT_EQ(platform.calls({"attr_merge"}).front(),
            "attr_merge(\"cn\", \"a,<null 0>\", 1, 1, null)");
}

TEST_F(ConvertRecord, ArraysHaveRoomForTheirLastNull) {
  of({"CN=X", {{"cn", {"a", "b"}}}});
  convert();
  EXPECT_THAT(platform.sizes, ElementsAre(sizeof(entry), 3 * sizeof(berval*), 3 * sizeof(berval)));
}

TEST_F(ConvertRecord, WalksAndReleasesInOrder) {
  of({"CN=X", {{"cn", {"a"}}, {"sn", {"b"}}}});
  convert();
  EXPECT_THAT(
      platform.calls({"cfg_get_dn", "cfg_first_attribute", "cfg_next_attribute", "cfg_get_values",
                      "cfg_value_free", "cfg_memfree", "cfg_ber_free", "attr_merge"}),
      ElementsAre(
          "cfg_get_dn(session, record 1)", "cfg_memfree(\"CN=X\")",
          "cfg_first_attribute(session, record 1)", "cfg_get_values(session, record 1, \"cn\")",
          "attr_merge(\"cn\", \"a\", 1, 1, null)", "cfg_value_free()", "cfg_memfree(\"cn\")",
          "cfg_next_attribute(session, record 1, cursor)",
          "cfg_get_values(session, record 1, \"sn\")", "attr_merge(\"sn\", \"b\", 1, 1, null)",
          "cfg_value_free()", "cfg_memfree(\"sn\")",
          "cfg_next_attribute(session, record 1, cursor)", "cfg_ber_free(cursor)"));
}

// Allocations before the arrays: entry, DN, converted DN, attribute name, values.
TEST_F(ConvertRecord, ReleasesPointersThenValuesThenTheirArray) {
  of({"CN=X", {{"cn", {"a", "b"}}}});
  platform.name_allocation(6, "pointers");
  platform.name_allocation(7, "counted");
  platform.name_allocation(8, "first value");
  platform.name_allocation(9, "second value");
  convert();
  EXPECT_THAT(
      platform.calls({"attr_merge", "free", "cfg_value_free"}),
      ElementsAre("attr_merge(\"cn\", \"a,b\", 1, 1, null)", "free(pointers)", "free(first value)",
                  "free(second value)", "free(counted)", "cfg_value_free()"));
}

TEST_F(ConvertRecord, DnThatCannotBeReadIsLeftOut) {
  of({"CN=X", {{"cn", {"a"}}}});
  platform.fail("cfg_get_dn", 1, 90);
  EXPECT_EQ(convert(), "<null>|cn=a");
  EXPECT_THAT(platform.calls({"cfg_perror"}), ElementsAre("cfg_perror(session, \"cfg_get_dn\")"));
}

TEST_F(ConvertRecord, DnThatComesWithAnErrorIsLeftOutAndReleased) {
  of({"CN=X", {{"cn", {"a"}}}});
  platform.fail("cfg_get_errno", 1, 1);
  EXPECT_EQ(convert(), "<null>|cn=a");
  EXPECT_THAT(platform.calls({"cfg_perror"}), ElementsAre("cfg_perror(session, \"cfg_get_dn\")"));
  EXPECT_THAT(platform.calls({"cfg_memfree"}),
              ElementsAre("cfg_memfree(\"CN=X\")", "cfg_memfree(\"cn\")"));
}

TEST_F(ConvertRecord, NoDnWithoutAnErrorIsSilent) {
  of({"CN=X", {{"cn", {"a"}}}});
  platform.fail("cfg_get_dn", 1, 0);
  EXPECT_EQ(convert(), "<null>|cn=a");
  EXPECT_EQ(platform.count("cfg_perror"), 0);
}

TEST_F(ConvertRecord, DnThatCannotBeConvertedIsLeftOut) {
  of({"CN=X", {{"cn", {"a"}}}});
  platform.fail("xlate_localcp_to_utf8", 1, 21);
  EXPECT_EQ(convert(), "<null>|cn=a");
}

TEST_F(ConvertRecord, ErrorAtTheFirstAttributeGivesTheEntryWithItsDnOnly) {
  of({"CN=X", {{"cn", {"a"}}}});
  platform.fail("cfg_first_attribute", 1, 1);
  EXPECT_EQ(convert(), "CN=X");
  EXPECT_THAT(platform.calls({"cfg_perror"}),
              ElementsAre("cfg_perror(session, \"cfg_first_attribute\")"));
  EXPECT_EQ(platform.count("cfg_get_values"), 0);
}

TEST_F(ConvertRecord, ErrorNumberAfterTheFirstAttributeReleasesTheCursor) {
  of({"CN=X", {{"cn", {"a"}}}});
  platform.fail("cfg_get_errno", 2, 1);
  EXPECT_EQ(convert(), "CN=X");
  EXPECT_THAT(platform.calls({"cfg_perror", "cfg_ber_free", "cfg_get_values"}),
              ElementsAre("cfg_perror(session, \"cfg_first_attribute\")", "cfg_ber_free(cursor)"));
}

TEST_F(ConvertRecord, ErrorAtValuesSkipsThatAttributeOnly) {
  of({"CN=X", {{"cn", {"a"}}, {"sn", {"b"}}}});
  platform.fail("cfg_get_values", 1, 1);
  EXPECT_EQ(convert(), "CN=X|sn=b");
  EXPECT_THAT(platform.calls({"cfg_perror"}),
              ElementsAre("cfg_perror(session, \"cfg_get_values\")"));
  EXPECT_THAT(platform.calls({"cfg_memfree"}), Contains("cfg_memfree(\"cn\")"));
}

// Error numbers asked for: after the DN, the first attribute, its values, the next attribute.
TEST_F(ConvertRecord, ValuesThatComeWithAnErrorAreSkippedAndReleased) {
  of({"CN=X", {{"cn", {"a"}}, {"sn", {"b"}}}});
  platform.fail("cfg_get_errno", 3, 1);
  EXPECT_EQ(convert(), "CN=X|sn=b");
  EXPECT_THAT(platform.calls({"cfg_perror"}),
              ElementsAre("cfg_perror(session, \"cfg_get_values\")"));
  EXPECT_EQ(platform.count("cfg_value_free"), 2);
}

TEST_F(ConvertRecord, NextAttributeThatComesWithAnErrorIsReportedAndTaken) {
  of({"CN=X", {{"cn", {"a"}}, {"sn", {"b"}}}});
  platform.fail("cfg_get_errno", 4, 1);
  EXPECT_EQ(convert(), "CN=X|cn=a|sn=b");
  EXPECT_THAT(platform.calls({"cfg_perror"}),
              ElementsAre("cfg_perror(session, \"cfg_next_attribute\")"));
}

TEST_F(ConvertRecord, NoValuesWithoutAnErrorIsSilent) {
  of({"CN=X", {{"cn", {"a"}}, {"sn", {"b"}}}});
  platform.fail("cfg_get_values", 1, 0);
  EXPECT_EQ(convert(), "CN=X|sn=b");
  EXPECT_EQ(platform.count("cfg_perror"), 0);
}

TEST_F(ConvertRecord, ErrorAtTheNextAttributeEndsTheWalk) {
  of({"CN=X", {{"cn", {"a"}}, {"sn", {"b"}}}});
  platform.fail("cfg_next_attribute", 1, 1);
  EXPECT_EQ(convert(), "CN=X|cn=a");
  EXPECT_THAT(platform.calls({"cfg_perror"}),
              ElementsAre("cfg_perror(session, \"cfg_next_attribute\")"));
  EXPECT_EQ(platform.count("cfg_ber_free"), 1);
}

// Error numbers asked for: after the DN, the first attribute, its values, the next attribute.
TEST_F(ConvertRecord, FailedCallsAreReportedAlsoWithoutTheDebugBit) {
  debug_off();
  of({"CN=X", {{"cn", {"a"}}}});
  int nth = 0;
  for (const char* call :
       {"cfg_get_dn", "cfg_first_attribute", "cfg_get_values", "cfg_next_attribute"}) {
    platform.forget();
    platform.fail("cfg_get_errno", ++nth, 1);
    convert();
    EXPECT_THAT(platform.calls({"cfg_perror"}),
                ElementsAre("cfg_perror(session, \"" + std::string(call) + "\")"));
    entry_free(made);
    made = nullptr;
  }
}

TEST_F(ConvertRecord, TypesWithoutValuesBecomeAttributesWithoutValues) {
  of({"CN=X", {{"cn", {"a"}}}});
  platform.types_only_values = true;
  EXPECT_EQ(convert(), "CN=X|cn=");
  EXPECT_EQ(made->attributes->count, 0);
  EXPECT_EQ(platform.count("cfg_perror"), 0);
}

TEST_F(ConvertRecord, ResultOfTheMergeIsNotLookedAt) {
  of({"CN=X", {{"cn", {"a"}}, {"sn", {"b"}}}});
  platform.fail("attr_merge", 1, 90);
  EXPECT_EQ(convert(), "CN=X|sn=b");
}

TEST_F(ConvertRecord, NoMemoryForTheEntryGivesNullAndTouchesNothing) {
  of({"CN=X", {{"cn", {"a"}}}});
  platform.fail_allocation(1);
  EXPECT_EQ(convert(), "null");
  EXPECT_THAT(platform.calls(), IsEmpty());
}

// Allocations before the arrays: entry, DN, converted DN, attribute name, values.
class NoMemoryForValueArrays : public ConvertRecord, public testing::WithParamInterface<int> {};

TEST_P(NoMemoryForValueArrays, ReleasesRecordArraysAndEntryButNotCursorAndValues) {
  of({"CN=X", {{"cn", {"a", "b"}}}});
  // The one of the two arrays that there is.
  platform.name_allocation(6, "array");
  platform.name_allocation(7, "array");
  platform.fail_allocation(GetParam());
  EXPECT_EQ(convert(), "null");
  EXPECT_THAT(
      platform.calls({"cfg_msg_unlink", "free", "cfg_value_free", "cfg_ber_free", "cfg_memfree",
                      "entry_free"}),
      ElementsAre("cfg_memfree(\"CN=X\")", "cfg_msg_unlink(session, record 1)", "free(record 1)",
                  "free(array)", "cfg_memfree(\"cn\")", "entry_free(\"entry\")"));
  EXPECT_THAT(platform.leaks(),
              ElementsAre("cfg_value", "cfg_value", "cfg_values", "chain", "cursor", "session"));
  cfg_msgfree(chain);
  chain = nullptr;
  EXPECT_THAT(platform.violations(), IsEmpty());
  close_session();
  platform.release_leaks();
  open_session();
}

INSTANTIATE_TEST_SUITE_P(FirstAndSecondArray, NoMemoryForValueArrays, testing::Values(6, 7));

TEST_F(ConvertRecord, ChainStaysGoodWithoutTheReleasedRecord) {
  platform.file["CN=X"] = {{{"CN=A", {}}, {"CN=B", {{"cn", {"b"}}}}, {"CN=C", {}}}};
  cfg_search_s(session, "CN=X", 1, "f", nullptr, 0, &chain);
  record = cfg_next_entry(session, cfg_first_entry(session, chain));
  platform.forget();
  platform.fail_allocation(6);
  EXPECT_EQ(convert(), "null");
  EXPECT_EQ(cfg_count_entries(session, chain), 2);
  EXPECT_EQ(platform.show(cfg_next_entry(session, cfg_first_entry(session, chain))), "record 3");
  cfg_msgfree(chain);
  chain = nullptr;
  close_session();
  EXPECT_THAT(platform.violations(), IsEmpty());
  platform.release_leaks();
  open_session();
}

TEST_F(ConvertRecord, LeavesAnExitRecord) {
  trcEvents = kTraceExit;
  platform.fail_allocation(1);
  convert();
  EXPECT_THAT(platform.records(), ElementsAre("entry 01050400 ", "exit 01050400 90"));
}

// ---- retrieve_entry

class RetrieveEntry : public Reading {
 protected:
  int retrieve(const char* dn = "CN=X") {
    found = reinterpret_cast<entry*>(this);
    const int rc = traced(0x01050500, [&] { return retrieve_entry(session, dn, &found); });
    EXPECT_EQ(found == nullptr, rc != 0);
    return rc;
  }
  entry* found = nullptr;
};

TEST_F(RetrieveEntry, ConvertsWithTheServersConverterAndNotesTheRequestedDn) {
  platform.file["CN=X"] = {{{"cn=x", {}}}};
  EXPECT_EQ(retrieve(), 0);
  EXPECT_THAT(platform.calls({"cfg_search_s", "cfg_count_entries", "cfg_first_entry",
                              "CFGMessage2Entry", "cfg_msgfree", "slapi_ch_strdup"}),
              ElementsAre("cfg_search_s(session, \"CN=X\", 0, \"objectclass=*\", null, 0)",
                          "cfg_count_entries(session, chain)", "cfg_first_entry(session, chain)",
                          "CFGMessage2Entry(session, record 1)", "cfg_msgfree(chain)",
                          "slapi_ch_strdup(\"CN=X\")"));
  ASSERT_NE(found, nullptr);
  EXPECT_STREQ(found->requested_dn, "CN=X");
  EXPECT_STREQ(found->dn, "as the file spells it");
  EXPECT_EQ(platform.count("xlate_localcp_to_utf8"), 0);
  entry_free(found);
}

TEST_F(RetrieveEntry, MissingEntryGives32WhateverTheSearchSaid) {
  EXPECT_EQ(retrieve("CN=MISSING"), 32);
  for (const int code : {0, 1, 80}) {
    platform.file["CN=X"] = {{}, code};
    EXPECT_EQ(retrieve(), 32);
  }
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
}

TEST_F(RetrieveEntry, NegativeCountGives32) {
  platform.file["CN=X"] = {{{"CN=X", {}}}};
  platform.fail("cfg_count_entries", 1, -1);
  EXPECT_EQ(retrieve(), 32);
}

TEST_F(RetrieveEntry, CodeOfTheSearchIsNotLookedAtWhenThereIsAnEntry) {
  platform.file["CN=X"] = {{{"CN=X", {}}}, 4};
  EXPECT_EQ(retrieve(), 0);
  entry_free(found);
}

TEST_F(RetrieveEntry, ErrorNumberAtTheFirstRecordComesBackUnchanged) {
  platform.file["CN=X"] = {{{"CN=X", {}}}};
  for (const int number : {53, -1}) {
    platform.forget();
    platform.fail("cfg_first_entry", 1, number);
    EXPECT_EQ(retrieve(), number);
    EXPECT_THAT(platform.calls({"cfg_perror", "cfg_msgfree"}),
                ElementsAre("cfg_perror(session, \"retrieve_entry: cfg_first_entry\")",
                            "cfg_msgfree(chain)"));
    EXPECT_THAT(platform.debug_lines(), IsEmpty());
  }
}

TEST_F(RetrieveEntry, ErrorNumberAtTheFirstRecordIsReportedAlsoWithoutTheDebugBit) {
  debug_off();
  platform.file["CN=X"] = {{{"CN=X", {}}}};
  platform.fail("cfg_first_entry", 1, 53);
  EXPECT_EQ(retrieve(), 53);
  EXPECT_THAT(platform.calls({"cfg_perror"}),
              ElementsAre("cfg_perror(session, \"retrieve_entry: cfg_first_entry\")"));
}

TEST_F(RetrieveEntry, RecordThatComesWithAnErrorNumberIsNotConverted) {
  platform.file["CN=X"] = {{{"CN=X", {}}}};
  platform.fail("cfg_get_errno", 1, 53);
  EXPECT_EQ(retrieve(), 53);
  EXPECT_EQ(platform.count("CFGMessage2Entry"), 0);
}

TEST_F(RetrieveEntry, NoFirstRecordGives1) {
  platform.file["CN=X"] = {{{"CN=X", {}}}};
  platform.fail("cfg_first_entry", 1, 0);
  EXPECT_EQ(retrieve(), 1);
  EXPECT_THAT(platform.debug_lines(), ElementsAre(error("retrieve_entry: no c_entry\n")));
  EXPECT_THAT(platform.story({"cfg_msgfree"}),
              ElementsAre("debug: retrieve_entry: no c_entry\n", "cfg_msgfree(chain)"));
}

TEST_F(RetrieveEntry, FailedConversionGives1) {
  platform.file["CN=X"] = {{{"CN=X", {}}}};
  platform.fail("CFGMessage2Entry", 1, 0);
  EXPECT_EQ(retrieve(), 1);
}

TEST_F(RetrieveEntry, RequestedDnThatCannotBeCopiedGives90) {
  platform.file["CN=X"] = {{{"CN=X", {}}}};
  platform.fail("slapi_ch_strdup", 1, 0);
  EXPECT_EQ(retrieve(), 90);
  EXPECT_EQ(platform.count("entry_free"), 1);
}

TEST_F(RetrieveEntry, LeavesAnExitRecord) {
  trcEvents = kTraceExit;
  retrieve("CN=MISSING");
  EXPECT_THAT(platform.records(), ElementsAre("entry 01050500 ", "exit 01050500 32"));
}

// ---- cfg_value_find

TEST_F(Reading, ValueFindAsksTheServerWithTheAttributesSyntax) {
  char type[] = "cn";
  char bytes[] = "present";
  berval value{7, bytes};
  berval* values[] = {&value, nullptr};
  attr a{type, values, 1, 17, nullptr};
  EXPECT_EQ(platform.run([&] { return cfg_value_find(&a, "present"); }), 0);
  EXPECT_EQ(platform.run([&] { return cfg_value_find(&a, "absent"); }), 1);
  platform.fail("value_find", 3, -4);
  EXPECT_EQ(platform.run([&] { return cfg_value_find(&a, "present"); }), -4);
  EXPECT_THAT(platform.calls(), ElementsAre("value_find(\"cn\", \"present\", 17, 1)",
                                            "value_find(\"cn\", \"absent\", 17, 1)",
                                            "value_find(\"cn\", \"present\", 17, 1)"));
}

TEST_F(Reading, ValueFindLeavesAnExitRecord) {
  trcEvents = kTraceExit;
  char type[] = "cn";
  attr a{type, nullptr, 0, 17, nullptr};
  platform.fail("value_find", 1, 1);
  platform.run([&] { return cfg_value_find(&a, "absent"); });
  EXPECT_THAT(platform.records(), ElementsAre("entry 01050600 ", "exit 01050600 1"));
}

}  // namespace
}  // namespace orv
