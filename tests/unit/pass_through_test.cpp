// Pass-through authentication: who may add an entry, where, and when its settings are sound.
#include <cstring>

#include "added_entry.h"
#include "config_add.h"
#include "function_ids.h"

#ifdef ORV_COVERAGE
extern "C" void __gcov_dump();  // <gcov.h> declares it for C alone
#endif

namespace orv {
namespace {

constexpr const char* kEntry = "CN=NEW,CN=PASSTHROUGH AUTHENTICATION,CN=CONFIGURATION";
constexpr const char* kOther = "cn=other, cn=passthrough authentication, cn=configuration";
constexpr const char* kOtherNormal = "CN=OTHER,CN=PASSTHROUGH AUTHENTICATION,CN=CONFIGURATION";
constexpr const char* kSearch =
    "cfg_search_s(session, \"CN=PASSTHROUGH AUTHENTICATION,CN=CONFIGURATION\", 1, "
    "\"objectclass=orv-slapdPta\", null, 0)";

class PassThrough : public AddedEntryTest {
 protected:
  PassThrough() { open_session(); }
  void TearDown() override {
    close_session();
    AddedEntryTest::TearDown();
  }

  void make_with(const std::string& type, const std::vector<std::string>& values) {
    make(kEntry, {{type, values}});
  }
  void make_with_subtrees(const std::vector<std::string>& subtrees) {
    make_with("orv-slapdPtaSubtree", subtrees);
  }

  // The pass-through entries of the file.
  void file(const std::vector<ScriptedEntry>& entries) { platform.file[kContainer] = {entries}; }

  int verify(const char* dn = kEntry) {
    return traced(function_id::verify_passthrough_server_entry,
                  [&] { return verifyPassthroughServerEntry(dn, e.get(), &connection); });
  }
  int check() { return check(e.get(), &connection, &backend, &operation); }
  int check(entry* an_entry, Connection* a_connection, Backend* a_backend,
            Operation* an_operation) {
    return traced(function_id::check_if_passthru_subtree_entry, [&] {
      return checkIfPassthruSubtreeEntry(an_entry, a_connection, a_backend, an_operation);
    });
  }

  void expect_only_the_session_left() {
    EXPECT_THAT(platform.violations(), IsEmpty());
    e.reset();
    EXPECT_THAT(platform.leaks(), ElementsAre("session"));
  }
};

// ---- Who may add, and where

class AddPassThrough : public PassThrough {
 protected:
  AddPassThrough() {
    as(kPrimary);
    make(kEntry, {{"objectClass", {"top", "orv-slapdConfigEntry", "orv-slapdPta"}}});
  }
};

TEST_F(AddPassThrough, NullEntryConnectionOrBackendGives80AndItsLine) {
  const auto refused = [&](entry* an_entry, Connection* a_connection, Backend* a_backend) {
    platform.forget();
    EXPECT_EQ(check(an_entry, a_connection, a_backend, &operation), 80);
    EXPECT_THAT(platform.debug_lines(),
                ElementsAre(error("Invalid NULL pointer passed through.\n")));
  };
  refused(nullptr, &connection, &backend);
  refused(e.get(), nullptr, &backend);
  refused(e.get(), &connection, nullptr);
}

TEST_F(AddPassThrough, OperationIsNotTestedForNull) {
  make("CN=X,CN=CONFIGURATION", {});
  EXPECT_EQ(check(e.get(), &connection, &backend, nullptr), 0);
}

TEST_F(AddPassThrough, OtherEntriesAreNoConcern) {
  as(kGroupMember);
  for (const char* dn : {"CN=X,CN=CONFIGURATION", "CN=PASSTHROUGH AUTHENTICATION,CN=X"}) {
    make(dn, {});
    EXPECT_EQ(check(), 0);
    EXPECT_THAT(platform.calls(), IsEmpty());
  }
  // Byte for byte: only the normal form is recognised.
  make(kEntry, {});
  std::strcpy(e->normalized_dn, "CN=NEW,CN=Passthrough Authentication,CN=CONFIGURATION");
  EXPECT_EQ(check(), 0);
  EXPECT_THAT(platform.calls(), IsEmpty());
}

TEST_F(AddPassThrough, PrimaryAdministratorOrServerConfigurationRoleIsNeeded) {
  const auto given = [&](unsigned flags, unsigned roles) {
    as(flags);
    operation.roles = roles;
    return check();
  };
  EXPECT_EQ(given(kPrimary, 0), 0);
  EXPECT_EQ(given(0x1C, 0), 0);
  EXPECT_EQ(given(kGroupMember, 0x20), 0);
  EXPECT_EQ(given(kGroupMember, 0x3E), 0);
  for (const unsigned roles : {0U, 0x02U, 0x04U, 0x08U, 0x10U, 0x1EU, 0x40U}) {
    EXPECT_EQ(given(kGroupMember, roles), 50) << roles;
  }
  EXPECT_EQ(given(0x04, 0), 50);
  EXPECT_EQ(given(0x08, 0), 50);
  // The role bit counts by itself: who holds it is not asked.
  for (const unsigned flags : {0U, 0x04U, 0x10U}) EXPECT_EQ(given(flags, 0x20), 0) << flags;
}

TEST_F(AddPassThrough, AuthorityComesBeforeThePlace) {
  as(kGroupMember);
  make(kContainer, {});
  EXPECT_EQ(check(), 50);
  EXPECT_EQ(platform.count("dn_parent_norm"), 0);
}

TEST_F(AddPassThrough, OnlyDirectlyBelowTheContainer) {
  for (const char* dn : {"CN=DEEP,CN=NEW,CN=PASSTHROUGH AUTHENTICATION,CN=CONFIGURATION",
                         kContainer, "CN=X,CN=PASSTHROUGH AUTHENTICATION,CN=CONFIGURATION,O=Y"}) {
    make(dn, {{"objectClass", {"top", "container", "orv-slapdConfigEntry", "orv-slapdPta"}}});
    EXPECT_EQ(check(), 53) << dn;
    EXPECT_EQ(platform.count("value_find"), 0);
  }
}

TEST_F(AddPassThrough, ParentIsAskedOfTheBackendAndReleased) {
  EXPECT_EQ(check(), 0);
  EXPECT_THAT(platform.calls({"dn_parent_norm", "kel_strcasecmp"}),
              ElementsAre("dn_parent_norm(backend, \"CN=NEW,CN=PASSTHROUGH "
                          "AUTHENTICATION,CN=CONFIGURATION\")",
                          "kel_strcasecmp(\"CN=PASSTHROUGH AUTHENTICATION,CN=CONFIGURATION\", "
                          "\"CN=PASSTHROUGH AUTHENTICATION,CN=CONFIGURATION\")"));
  expect_only_the_session_left();
}

TEST_F(AddPassThrough, ParentIsThatOfTheNormalisedDn) {
  make("cn = new, cn = passthrough authentication, cn=configuration",
       {{"objectClass", {"top", "orv-slapdConfigEntry", "orv-slapdPta"}}});
  EXPECT_EQ(check(), 0);
  EXPECT_THAT(platform.calls({"dn_parent_norm"}),
              ElementsAre("dn_parent_norm(backend, \"CN=NEW,CN=PASSTHROUGH "
                          "AUTHENTICATION,CN=CONFIGURATION\")"));
}

TEST_F(AddPassThrough, ParentMatchesInAnyLetterCase) {
  make("CN=NEW,CN=PASSTHROUGH AUTHENTICATION,CN=CONFIGURATION",
       {{"objectClass", {"top", "orv-slapdConfigEntry", "orv-slapdPta"}}});
  platform.fail("kel_strcasecmp", 1, 0);
  EXPECT_EQ(check(), 0);
  platform.fail("kel_strcasecmp", 2, -1);
  EXPECT_EQ(check(), 53);
}

TEST_F(AddPassThrough, EntryWithoutAParentPasses) {
  make(kEntry, {});
  platform.fail("dn_parent_norm", 1, 0);
  EXPECT_EQ(check(), 0);
  EXPECT_EQ(platform.count("value_find"), 0);
}

TEST_F(AddPassThrough, ClassesAreNeededInTheirOrder) {
  make(kEntry, {});
  EXPECT_EQ(check(), 65);  // no object classes at all
  make(kEntry, {{"objectClass", {"orv-slapdConfigEntry", "orv-slapdPta"}}});
  EXPECT_EQ(check(), 65);
  make(kEntry, {{"objectClass", {"top", "orv-slapdPta"}}});
  EXPECT_EQ(check(), 65);
  make(kEntry, {{"objectClass", {"top", "orv-slapdConfigEntry"}}});
  EXPECT_EQ(check(), 65);
  EXPECT_THAT(platform.calls({"value_find"}),
              ElementsAre("value_find(\"objectClass\", \"top\", 0, 1)",
                          "value_find(\"objectClass\", \"orv-slapdConfigEntry\", 0, 1)",
                          "value_find(\"objectClass\", \"orv-slapdPta\", 0, 1)"));
}

TEST_F(AddPassThrough, ContainerItselfWouldNeedTheContainerClass) {
  // Only where the container could be its own parent.
  make(kContainer, {{"objectClass", {"top", "container"}}});
  platform.fail("kel_strcasecmp", 1, 0);
  EXPECT_EQ(check(), 0);
  make(kContainer, {{"objectClass", {"top"}}});
  platform.fail("kel_strcasecmp", 1, 0);
  EXPECT_EQ(check(), 65);
}

TEST_F(AddPassThrough, ClassTopIsAskedForBeforeTheContainersOwn) {
  make(kContainer, {{"objectClass", {"container"}}});
  platform.fail("kel_strcasecmp", 1, 0);
  EXPECT_EQ(check(), 65);
}

TEST_F(AddPassThrough, SettingsAreVerifiedLast) {
  make(kEntry, {{"objectClass", {"top", "orv-slapdConfigEntry", "orv-slapdPta"}},
                {"orv-slapdPtaURL", {"nonsense"}}});
  platform.fail("ldap_url_parse", 1, 1);
  EXPECT_EQ(check(), 21);
  make(kEntry,
       {{"objectClass", {"top", "orv-slapdConfigEntry"}}, {"orv-slapdPtaURL", {"nonsense"}}});
  platform.fail("ldap_url_parse", 1, 1);
  EXPECT_EQ(check(), 65);
}

TEST_F(AddPassThrough, ExitRecordsCarryTheCodes) {
  trcEvents = kTraceExit;
  as(kGroupMember);
  check();
  EXPECT_THAT(platform.records(), ElementsAre("entry 01021200 ", "exit 01021200 50"));
}

// ---- The settings

TEST_F(PassThrough, EntriesOutsideTheContainerAreNotVerified) {
  make_with("orv-slapdPtaURL", {"nonsense"});
  platform.fail("ldap_url_parse", 0, 1);
  EXPECT_EQ(verify("CN=X,CN=CONFIGURATION"), 0);
  EXPECT_EQ(verify("cn=new,cn=passthrough authentication,cn=configuration"), 0);
  EXPECT_EQ(platform.count("attr_find"), 0);
  // Its name may stand anywhere in that of the entry.
  for (const std::string& dn :
       {std::string(kEntry), kEntry + std::string(",O=X"), std::string(kContainer)}) {
    EXPECT_EQ(verify(dn.c_str()), 21) << dn;
  }
}

TEST_F(PassThrough, EntryWithoutSettingsPassesWithoutASearch) {
  make(kEntry, {});
  EXPECT_EQ(verify(), 0);
  EXPECT_THAT(platform.calls(), ElementsAre("attr_find(\"orv-slapdPtaURL\", 0, 0)",
                                            "attr_find(\"orv-slapdPtaSubtree\", 0, 0)",
                                            "attr_find(\"orv-slapdPtaAttrMapping\", 0, 0)"));
}

TEST_F(PassThrough, UrlIsParsedAndItsDescriptionFreedAtOnce) {
  make(kEntry, {{"orv-slapdPtaURL", {"ldap://a", "nonsense"}}, {"orv-slapdPtaSubtree", {"o=x"}}});
  file({});
  EXPECT_EQ(verify(), 0);
  EXPECT_THAT(platform.calls(
                  {"ldap_url_parse", "ldap_free_urldesc", "xlate_localcp_to_utf8", "PrintMessage"}),
              ElementsAre("ldap_url_parse(\"ldap://a\")", "ldap_free_urldesc(description)",
                          "xlate_localcp_to_utf8(\"o=x\")"));
}

TEST_F(PassThrough, UrlThatDoesNotParseGives21WithMessage179BeforeAnySubtree) {
  make(kEntry, {{"orv-slapdPtaURL", {"nonsense"}}, {"orv-slapdPtaSubtree", {"CN=SCHEMA"}}});
  for (const int answer : {-1, 1, 3}) {
    platform.forget();
    platform.fail("ldap_url_parse", 1, answer);
    EXPECT_EQ(verify(), 21) << answer;
    EXPECT_THAT(platform.calls({"PrintMessage", "xlate_localcp_to_utf8", "ldap_free_urldesc"}),
                ElementsAre("PrintMessage(0, 8, 179, \"nonsense\")"));
    EXPECT_THAT(platform.debug_lines(), IsEmpty());
  }
}

TEST_F(PassThrough, UrlWithoutAValueIsNotParsed) {
  make_with("orv-slapdPtaURL", {});
  EXPECT_EQ(verify(), 0);
  EXPECT_EQ(platform.count("ldap_url_parse"), 0);
}

TEST_F(PassThrough, SubtreesAreConvertedAndNormalisedInOrder) {
  file({});
  make_with_subtrees({"o = k\xE4se", "o=b"});
  EXPECT_EQ(verify(), 0);
  EXPECT_THAT(
      platform.calls({"xlate_localcp_to_utf8", "replace_DN"}),
      ElementsAre("xlate_localcp_to_utf8(\"o = k\xE4se\")", "replace_DN(\"o = k\xC3\xA4se\", 1)",
                  "xlate_localcp_to_utf8(\"o=b\")", "replace_DN(\"o=b\", 1)"));
  EXPECT_EQ(platform.sizes.front(), 3 * sizeof(char*));  // a null after the two
  expect_only_the_session_left();
}

TEST_F(PassThrough, SubtreeThatCannotBeConvertedOrNormalisedGives1AndStops) {
  make_with_subtrees({"o=a", "o=b", "o=c"});
  platform.fail("xlate_localcp_to_utf8", 2, 21);
  EXPECT_EQ(verify(), 1);
  EXPECT_EQ(platform.count("xlate_localcp_to_utf8"), 2);
  EXPECT_EQ(platform.count("are_nested_dn"), 0);
  EXPECT_EQ(platform.count("cfg_search_s"), 0);
  platform.forget();
  platform.fail("replace_DN", 1, 34);
  EXPECT_EQ(verify(), 1);
  EXPECT_EQ(platform.count("xlate_localcp_to_utf8"), 1);
  platform.forget();
  platform.fail("xlate_localcp_to_utf8", 1, 0);  // success without a text
  EXPECT_EQ(verify(), 1);
  EXPECT_EQ(platform.count("replace_DN"), 0);
  expect_only_the_session_left();
}

TEST_F(PassThrough, SubtreeThatHasNoNormalFormIsReleasedWithTheOthersBeforeTheArray) {
  make_with_subtrees({"o=a", "o=b", "o=c"});
  platform.name_allocation(1, "array");
  platform.name_allocation_in("replace_DN", 1, "first");
  platform.name_allocation_in("xlate_localcp_to_utf8", 2, "second");
  platform.fail("replace_DN", 2, 34);
  EXPECT_EQ(verify(), 1);
  EXPECT_THAT(platform.calls({"free"}), ElementsAre("free(first)", "free(second)", "free(array)"));
}

TEST_F(PassThrough, NoMemoryForTheSubtreesGives90) {
  make_with_subtrees({"o=a"});
  platform.fail_allocation(1);
  EXPECT_EQ(verify(), 90);
  EXPECT_EQ(platform.count("xlate_localcp_to_utf8"), 0);
}

TEST_F(PassThrough, ReservedSuffixesComeFirstAndInTheirOrder) {
  file({});
  make_with_subtrees({"o=a", "o=b"});
  EXPECT_EQ(verify(), 0);
  EXPECT_THAT(
      platform.calls({"are_nested_dn", "cfg_search_s"}),
      ElementsAre(
          "are_nested_dn(\"O=A\", \"CN=CONFIGURATION\")", "are_nested_dn(\"O=A\", \"CN=SCHEMA\")",
          "are_nested_dn(\"O=A\", \"CN=PWDPOLICY,CN=ORVPOLICIES\")",
          "are_nested_dn(\"O=A\", \"CN=CHANGELOG\")", "are_nested_dn(\"O=A\", \"CN=LOCALHOST\")",
          "are_nested_dn(\"O=A\", \"O=B\")", "are_nested_dn(\"O=B\", \"CN=CONFIGURATION\")",
          "are_nested_dn(\"O=B\", \"CN=SCHEMA\")",
          "are_nested_dn(\"O=B\", \"CN=PWDPOLICY,CN=ORVPOLICIES\")",
          "are_nested_dn(\"O=B\", \"CN=CHANGELOG\")", "are_nested_dn(\"O=B\", \"CN=LOCALHOST\")",
          kSearch));
}

TEST_F(PassThrough, SubtreeInOrAboveAReservedSuffixGives19WithMessage174) {
  const std::vector<std::pair<std::string, std::string>> cases = {
      {"cn=schema", "CN=SCHEMA"},
      {"cn=x,cn=configuration", "CN=CONFIGURATION"},
      {"cn=configuration", "CN=CONFIGURATION"},
      {"cn=orvpolicies", "CN=PWDPOLICY,CN=ORVPOLICIES"},
      {"cn=pwdpolicy,cn=orvpolicies", "CN=PWDPOLICY,CN=ORVPOLICIES"},
      {"cn=1,cn=changelog", "CN=CHANGELOG"},
      {"cn=localhost", "CN=LOCALHOST"}};
  for (const auto& [subtree, suffix] : cases) {
    make_with_subtrees({"o=fine", subtree, "o=below,o=fine"});
    EXPECT_EQ(verify(), 19) << subtree;
    EXPECT_EQ(platform.calls({"PrintMessage"}).size(), 1U);
    // The nesting of the first with the third is met before the second is looked at.
    EXPECT_THAT(platform.calls({"PrintMessage"}),
                ElementsAre("PrintMessage(0, 8, 167, \"O=FINE\", \"O=BELOW,O=FINE\")"));
    make_with_subtrees({"o=fine", subtree});
    EXPECT_EQ(verify(), 19) << subtree;
    EXPECT_THAT(platform.calls({"PrintMessage", "cfg_search_s"}),
                ElementsAre("PrintMessage(0, 8, 174, \"CN=NEW,CN=PASSTHROUGH "
                            "AUTHENTICATION,CN=CONFIGURATION\", \"" +
                            suffix + "\")"));
    EXPECT_THAT(platform.debug_lines(), IsEmpty());
  }
  expect_only_the_session_left();
}

TEST_F(PassThrough, ReservedSuffixIsToldBeforeANestedSubtree) {
  make_with_subtrees({"cn=schema", "cn=schema"});
  EXPECT_EQ(verify(), 19);
  EXPECT_THAT(platform.calls({"PrintMessage"}),
              ElementsAre("PrintMessage(0, 8, 174, \"CN=NEW,CN=PASSTHROUGH "
                          "AUTHENTICATION,CN=CONFIGURATION\", \"CN=SCHEMA\")"));
}

TEST_F(PassThrough, FirstReservedSuffixThatOverlapsEndsTheCheck) {
  make_with_subtrees({"o=a", "o=b"});
  platform.fail("are_nested_dn", 0, 1);  // each
  EXPECT_EQ(verify(), 19);
  EXPECT_THAT(platform.calls({"are_nested_dn", "PrintMessage", "cfg_search_s"}),
              ElementsAre("are_nested_dn(\"O=A\", \"CN=CONFIGURATION\")",
                          "PrintMessage(0, 8, 174, \"" + std::string(kEntry) +
                              "\", \"CN=CONFIGURATION\")"));
}

TEST_F(PassThrough, SubtreesNestedWithinTheEntryGive19TracedAndLogged) {
  make_with_subtrees({"o=x", "o=y", "ou=people,o=y"});
  EXPECT_EQ(verify(), 19);
  EXPECT_THAT(platform.story({"PrintMessage", "cfg_search_s"}),
              ElementsAre("debug: doesConflictingPTAsubtreeExists: Nested PTA Subtrees found "
                          "'O=Y', 'OU=PEOPLE,O=Y'\n",
                          "PrintMessage(0, 8, 167, \"O=Y\", \"OU=PEOPLE,O=Y\")"));
  EXPECT_EQ(platform.debug_lines()[0].category, 0xC8110000U);
  expect_only_the_session_left();
}

TEST_F(PassThrough, SubtreesWithoutValuesAreStillComparedWithTheFile) {
  make_with_subtrees({});
  file({{kOther, {{"orv-slapdPtaSubtree", {"o=x"}}}}});
  EXPECT_EQ(verify(), 0);
  EXPECT_EQ(platform.count("cfg_search_s"), 1);
}

// ---- Against the other entries of the file

TEST_F(PassThrough, FailedSearchReturnsItsCodeWithItsLine) {
  make_with_subtrees({"o=x"});
  for (const int code : {32, 1, 80}) {
    platform.forget();
    platform.fail("cfg_search_s", 1, code);
    EXPECT_EQ(verify(), code);
    EXPECT_THAT(platform.debug_lines(),
                ElementsAre(error("doesConflictingPTAsubtreeExists: cfg_search_s rc=" +
                                  std::to_string(code) + "\n")));
    EXPECT_EQ(platform.count("cfg_count_entries"), 0);
  }
}

TEST_F(PassThrough, NoEntryInTheFileIsTracedAfterTheResultIsReleased) {
  make_with_subtrees({"o=x"});
  file({});
  EXPECT_EQ(verify(), 0);
  EXPECT_THAT(platform.story({"cfg_msgfree", "cfg_first_entry"}),
              ElementsAre("cfg_msgfree(chain)",
                          "debug: doesConflictingPTAsubtreeExists: No PTA entry found\n"));
  EXPECT_EQ(platform.debug_lines()[0].category, 0xC80D0000U);
}

TEST_F(PassThrough, ResultThatCannotBeCountedHoldsNoEntry) {
  make_with_subtrees({"o=x"});
  file({{kOther, {{"orv-slapdPtaSubtree", {"o=x"}}}}});
  platform.fail("cfg_count_entries", 1, -1);
  EXPECT_EQ(verify(), 0);
  EXPECT_EQ(platform.count("cfg_first_entry"), 0);
  EXPECT_EQ(platform.count("cfg_msgfree"), 1);
}

TEST_F(PassThrough, SubtreesOfAnotherEntryMayNotOverlap) {
  make_with_subtrees({"o=a", "o=b"});
  for (const char* existing : {"o=b", "ou=x,o=b", "O = B"}) {
    file({{kOther, {{"orv-slapdPtaSubtree", {"o=c", existing}}}}});
    EXPECT_EQ(verify(), 19) << existing;
  }
  EXPECT_EQ(platform.debug_lines()[1],
            error("doesConflictingPTAsubtreeExists: Nested PTA Subtrees found 'O=B', "
                  "'OU=X,O=B'\n"));
  EXPECT_EQ(platform.calls({"PrintMessage"})[1], "PrintMessage(0, 8, 167, \"O=B\", \"OU=X,O=B\")");
  expect_only_the_session_left();
}

TEST_F(PassThrough, SubtreeBelowAnothersOverlapsToo) {
  make_with_subtrees({"o=b"});
  file({{kOther, {{"orv-slapdPtaSubtree", {"o=b"}}}}});
  EXPECT_EQ(verify(), 19);
  make_with_subtrees({"ou=x,o=b"});
  EXPECT_EQ(verify(), 19);
  make_with_subtrees({"o=xb"});
  EXPECT_EQ(verify(), 0);
}

TEST_F(PassThrough, NewSubtreesAreTheOuterLoopAndTheFirstPairEndsIt) {
  make_with_subtrees({"o=a", "o=b"});
  file({{kOther, {{"orv-slapdPtaSubtree", {"o=b", "o=a"}}}}});
  EXPECT_EQ(verify(), 19);
  EXPECT_THAT(platform.calls({"PrintMessage"}),
              ElementsAre("PrintMessage(0, 8, 167, \"O=A\", \"O=A\")"));
}

TEST_F(PassThrough, PairThatFailedIsTheOnlyOneToldAndTheLastOneCompared) {
  make_with_subtrees({"o=a"});
  file({{kOther, {{"orv-slapdPtaSubtree", {"o=a", "ou=x,o=a"}}}}});
  EXPECT_EQ(verify(), 19);
  EXPECT_THAT(platform.story({"PrintMessage"}),
              ElementsAre("debug: doesConflictingPTAsubtreeExists: Nested PTA Subtrees found "
                          "'O=A', 'O=A'\n",
                          "PrintMessage(0, 8, 167, \"O=A\", \"O=A\")"));
  platform.forget();
  make_with_subtrees({"o=y", "ou=a,o=y", "ou=b,o=y"});
  EXPECT_EQ(verify(), 19);
  EXPECT_THAT(platform.story({"PrintMessage"}),
              ElementsAre("debug: doesConflictingPTAsubtreeExists: Nested PTA Subtrees found "
                          "'O=Y', 'OU=A,O=Y'\n",
                          "PrintMessage(0, 8, 167, \"O=Y\", \"OU=A,O=Y\")"));
}

TEST_F(PassThrough, EachNewSubtreeMeetsTheExistingOnesInTheirOrder) {
  make_with_subtrees({"o=a", "o=b"});
  file({{kOther, {{"orv-slapdPtaSubtree", {"o=c", "o=d"}}}}});
  std::size_t own = 0;
  platform.at("cfg_get_values", 1, [&] { own = platform.calls({"are_nested_dn"}).size(); });
  EXPECT_EQ(verify(), 0);
  std::vector<std::string> pairs = platform.calls({"are_nested_dn"});
  pairs.erase(pairs.begin(), pairs.begin() + static_cast<std::ptrdiff_t>(own));
  EXPECT_THAT(pairs,
              ElementsAre("are_nested_dn(\"O=A\", \"O=C\")", "are_nested_dn(\"O=A\", \"O=D\")",
                          "are_nested_dn(\"O=B\", \"O=C\")", "are_nested_dn(\"O=B\", \"O=D\")"));
}

TEST_F(PassThrough, FirstConflictEndsTheWalk) {
  make_with_subtrees({"o=a"});
  file({{"cn=1," + std::string(kContainer), {{"orv-slapdPtaSubtree", {"o=a"}}}},
        {"cn=2," + std::string(kContainer), {{"orv-slapdPtaSubtree", {"o=a"}}}}});
  EXPECT_EQ(verify(), 19);
  EXPECT_EQ(platform.count("cfg_next_entry"), 0);
  EXPECT_EQ(platform.count("PrintMessage"), 1);
}

TEST_F(PassThrough, EveryEntryIsCompared) {
  make_with_subtrees({"o=a"});
  file({{"cn=1," + std::string(kContainer), {{"orv-slapdPtaSubtree", {"o=b"}}}},
        {"cn=2," + std::string(kContainer), {{"orv-slapdPtaSubtree", {"o=a"}}}}});
  EXPECT_EQ(verify(), 19);
  EXPECT_THAT(platform.calls({"cfg_count_entries", "cfg_first_entry", "cfg_next_entry",
                              "cfg_get_dn", "cfg_get_values", "cfg_msgfree"}),
              ElementsAre("cfg_count_entries(session, chain)", "cfg_first_entry(session, chain)",
                          "cfg_get_dn(session, record 1)",
                          "cfg_get_values(session, record 1, \"orv-slapdPtaSubtree\")",
                          "cfg_next_entry(session, record 1)", "cfg_get_dn(session, record 2)",
                          "cfg_get_values(session, record 2, \"orv-slapdPtaSubtree\")",
                          "cfg_msgfree(chain)"));
}

TEST_F(PassThrough, EntryDoesNotConflictWithItself) {
  make_with_subtrees({"o=a"});
  file({{"cn = new, cn=PassThrough Authentication,cn=Configuration",
         {{"orv-slapdPtaSubtree", {"o=a"}}}}});
  EXPECT_EQ(verify(), 0);
  EXPECT_EQ(platform.count("cfg_get_values"), 0);
  EXPECT_THAT(platform.calls({"kel_strcasecmp"}),
              ElementsAre("kel_strcasecmp(\"CN=NEW,CN=PASSTHROUGH AUTHENTICATION,"
                          "CN=CONFIGURATION\", \"CN=NEW,CN=PASSTHROUGH AUTHENTICATION,"
                          "CN=CONFIGURATION\")"));
  platform.forget();
  platform.keeps_letter_case = true;
  EXPECT_EQ(verify(), 0);  // without regard to letter case
  EXPECT_EQ(platform.count("cfg_get_values"), 0);
}

TEST_F(PassThrough, DnAndValuesOfTheFileAreConverted) {
  make_with_subtrees({"o=k\xE4se"});
  file({{"cn=k\xE4se," + std::string(kContainer), {{"orv-slapdPtaSubtree", {"o=K\xE4SE"}}}}});
  EXPECT_EQ(verify(), 19);
  EXPECT_EQ(platform.calls({"PrintMessage"})[0],
            "PrintMessage(0, 8, 167, \"O=K\xC3\xA4SE\", \"O=K\xC3\xA4SE\")");
}

TEST_F(PassThrough, MissingDnOfTheFirstEntryGives90) {
  make_with_subtrees({"o=a"});
  file({{kOther, {{"orv-slapdPtaSubtree", {"o=b"}}}}});
  platform.fail("cfg_get_dn", 1, 90);
  EXPECT_EQ(verify(), 90);
  EXPECT_EQ(platform.count("cfg_msgfree"), 1);
  platform.forget();
  platform.fail("cfg_first_entry", 1, 1);
  EXPECT_EQ(verify(), 90);
}

TEST_F(PassThrough, MissingDnOfALaterEntryEndsTheWalkWithTheResultSoFar) {
  make_with_subtrees({"o=a"});
  file({{"cn=1," + std::string(kContainer), {{"orv-slapdPtaSubtree", {"o=b"}}}},
        {"cn=2," + std::string(kContainer), {{"orv-slapdPtaSubtree", {"o=a"}}}}});
  platform.fail("cfg_get_dn", 2, 90);
  EXPECT_EQ(verify(), 0);
}

TEST_F(PassThrough, DnOfAnotherEntryThatCannotBeConvertedGives1) {
  make_with_subtrees({"o=a"});
  file({{kOther, {{"orv-slapdPtaSubtree", {"o=b"}}}}});
  platform.fail("xlate_localcp_to_utf8", 2, 21);
  EXPECT_EQ(verify(), 1);
  platform.forget();
  platform.fail("replace_DN", 2, 34);
  EXPECT_EQ(verify(), 1);
  EXPECT_EQ(platform.count("cfg_get_values"), 0);
  expect_only_the_session_left();
}

TEST_F(PassThrough, DnThatCannotBeConvertedIsReleasedAfterTheResult) {
  make_with_subtrees({"o=a"});
  file({{kOther, {{"orv-slapdPtaSubtree", {"o=b"}}}}});
  const std::string dn_released = "cfg_memfree(\"" + std::string(kOther) + "\")";
  platform.fail("xlate_localcp_to_utf8", 2, 21);
  EXPECT_EQ(verify(), 1);
  EXPECT_THAT(platform.calls({"free", "cfg_memfree", "cfg_msgfree"}),
              ElementsAre("cfg_msgfree(chain)", dn_released));
  platform.forget();
  platform.name_allocation_in("xlate_localcp_to_utf8", 2, "converted DN");
  platform.fail("replace_DN", 2, 34);
  EXPECT_EQ(verify(), 1);
  EXPECT_THAT(platform.calls({"free", "cfg_memfree", "cfg_msgfree"}),
              ElementsAre("cfg_msgfree(chain)", "free(converted DN)", dn_released));
}

TEST_F(PassThrough, ValuesThenDnThenResultAreReleasedWhereTheWalkEndsAtAnEntry) {
  const auto expect_values_dn_result = [&](int code, const std::string& existing) {
    file({{kOther, {{"orv-slapdPtaSubtree", {"o=b", existing}}}}});
    platform.at("cfg_memfree", 1, [&] {
      EXPECT_THAT(platform.leaks(), Not(Contains("cfg_value")));
      EXPECT_THAT(platform.leaks(), Not(Contains("cfg_values")));
    });
    EXPECT_EQ(verify(), code);
    EXPECT_THAT(platform.calls({"cfg_memfree", "cfg_msgfree"}),
                ElementsAre("cfg_memfree(\"" + std::string(kOther) + "\")", "cfg_msgfree(chain)"));
  };
  make_with_subtrees({"o=a"});
  expect_values_dn_result(19, "o=a");  // a conflict
  platform.forget();
  platform.fail("cfg_get_errno", 1, 53);  // values that came with an error
  expect_values_dn_result(1, "o=c");
  platform.forget();
  platform.fail("replace_DN", 4, 34);  // a value that has no normal form
  expect_values_dn_result(1, "o=c");
  platform.forget();
  expect_values_dn_result(0, "o=c");
}

TEST_F(PassThrough, ValuesThatCannotBeReadGive1WithTheEntrysDn) {
  make_with_subtrees({"o=a"});
  file({{kOther, {{"cn", {"x"}}}}});
  EXPECT_EQ(verify(), 1);
  EXPECT_THAT(platform.debug_lines(),
              ElementsAre(error("Problems retrieving values for orv-slapdPtaSubtree in entry " +
                                std::string(kOtherNormal) + "!\n")));
}

TEST_F(PassThrough, ValuesThatCameWithAnErrorGive1AndAreReleased) {
  make_with_subtrees({"o=a"});
  file({{kOther, {{"orv-slapdPtaSubtree", {"o=b"}}}}});
  platform.fail("cfg_get_errno", 1, 53);
  EXPECT_EQ(verify(), 1);
  EXPECT_THAT(platform.debug_lines(),
              ElementsAre(error("Problems retrieving values for orv-slapdPtaSubtree in entry " +
                                std::string(kOtherNormal) + "!\n")));
  EXPECT_EQ(platform.count("xlate_localcp_to_utf8"), 2);  // the entry's own, and the DN
  expect_only_the_session_left();
}

TEST_F(PassThrough, NoValuesWithoutAnErrorAreNoConflict) {
  make_with_subtrees({"o=a"});
  file({{kOther, {{"orv-slapdPtaSubtree", {"o=a"}}}}});
  platform.fail("cfg_get_values", 1, 0);
  EXPECT_EQ(verify(), 0);
}

TEST_F(PassThrough, ValueOfAnotherEntryThatCannotBeConvertedGives1) {
  make_with_subtrees({"o=a"});
  file({{kOther, {{"orv-slapdPtaSubtree", {"o=b", "o=c", "o=d"}}}}});
  platform.fail("xlate_localcp_to_utf8", 4, 21);  // own, DN, first, second
  EXPECT_EQ(verify(), 1);
  platform.forget();
  platform.fail("replace_DN", 3, 34);
  EXPECT_EQ(verify(), 1);
  expect_only_the_session_left();
}

TEST_F(PassThrough, AllValuesOfAnotherEntryAreConvertedBeforeTheFirstIsCompared) {
  make_with_subtrees({"o=a"});
  file({{kOther, {{"orv-slapdPtaSubtree", {"o=a", "o=c"}}}}});
  platform.fail("replace_DN", 4, 34);  // own, DN, first, second
  EXPECT_EQ(verify(), 1);
  EXPECT_EQ(platform.count("PrintMessage"), 0);
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
  expect_only_the_session_left();
}

TEST_F(PassThrough, DnOfAnotherEntryIsReleasedBeforeTheNextEntryIsTaken) {
  make_with_subtrees({"o=a"});
  file({{kOther, {{"orv-slapdPtaSubtree", {"o=b"}}}}});
  EXPECT_EQ(verify(), 0);
  EXPECT_THAT(
      platform.calls({"cfg_get_dn", "cfg_memfree", "cfg_next_entry"}),
      ElementsAre("cfg_get_dn(session, record 1)", "cfg_memfree(\"" + std::string(kOther) + "\")",
                  "cfg_next_entry(session, record 1)"));
}

TEST_F(PassThrough, ValuesOfAnotherEntryAreReleasedBeforeTheNextEntryIsTaken) {
  make_with_subtrees({"o=a"});
  file({{kOther, {{"orv-slapdPtaSubtree", {"o=b", "o=c"}}}}});
  std::vector<std::string> before;
  platform.at("cfg_get_dn", 1, [&] { before = platform.leaks(); });
  platform.at("cfg_next_entry", 1,
              [&] { EXPECT_THAT(platform.leaks(), testing::UnorderedElementsAreArray(before)); });
  EXPECT_EQ(verify(), 0);
  EXPECT_EQ(platform.count("cfg_next_entry"), 1);
}

TEST_F(PassThrough, ValuesAreReleasedOneByOneAndNotByTheLibrary) {
  make_with_subtrees({"o=a"});
  file({{kOther, {{"orv-slapdPtaSubtree", {"o=b", "o=c"}}}}});
  EXPECT_EQ(verify(), 0);
  EXPECT_EQ(platform.count("cfg_value_free"), 0);
  EXPECT_THAT(platform.calls({"cfg_memfree"}),
              ElementsAre("cfg_memfree(\"" + std::string(kOther) + "\")"));
  expect_only_the_session_left();
}

// ---- The attribute mapping

TEST_F(PassThrough, MappingsFirstValueIsVerifiedLast) {
  file({});
  make(kEntry, {{"orv-slapdPtaAttrMapping", {"a=b", "c=d"}},
                {"orv-slapdPtaURL", {"ldap://a"}},
                {"orv-slapdPtaSubtree", {"o=a"}}});
  platform.fail("verifyAttributeMapping", 1, 21);
  EXPECT_EQ(verify(), 21);
  EXPECT_THAT(platform.calls({"ldap_url_parse", "cfg_search_s", "verifyAttributeMapping"}),
              ElementsAre("ldap_url_parse(\"ldap://a\")", kSearch,
                          "verifyAttributeMapping(\"a=b\", null, null)"));
  EXPECT_EQ(verify(), 0);
}

TEST_F(PassThrough, CodeOfTheMappingIsReturnedWhateverItIs) {
  make_with("orv-slapdPtaAttrMapping", {"a=b"});
  for (const int code : {-1, 1, 53, 80, 90}) {
    platform.forget();
    platform.fail("verifyAttributeMapping", 1, code);
    EXPECT_EQ(verify(), code);
  }
}

TEST_F(PassThrough, SubtreesAreReleasedAfterTheMapping) {
  file({});
  make(kEntry, {{"orv-slapdPtaAttrMapping", {"a=b"}}, {"orv-slapdPtaSubtree", {"o=a"}}});
  platform.name_allocation(1, "subtrees");
  EXPECT_EQ(verify(), 0);
  EXPECT_THAT(platform.calls({"verifyAttributeMapping", "free"}),
              ElementsAre("verifyAttributeMapping(\"a=b\", null, null)", "free(subtrees)"));
}

TEST_F(PassThrough, MappingWithoutAValueIsVerifiedAsNull) {
  for (const bool null_list : {false, true}) {
    platform.empty_lists_are_null = null_list;
    make_with("orv-slapdPtaAttrMapping", {});
    platform.fail("verifyAttributeMapping", 1, 21);
    EXPECT_EQ(verify(), 21);
    EXPECT_THAT(platform.calls({"verifyAttributeMapping"}),
                ElementsAre("verifyAttributeMapping(null, null, null)"));
  }
}

TEST_F(PassThrough, MappingIsNotVerifiedAfterAnEarlierRefusal) {
  make(kEntry, {{"orv-slapdPtaAttrMapping", {"a=b"}}, {"orv-slapdPtaSubtree", {"cn=schema"}}});
  EXPECT_EQ(verify(), 19);
  EXPECT_EQ(platform.count("verifyAttributeMapping"), 0);
}

TEST_F(PassThrough, ServerLogDoesNotDependOnTheTrace) {
  debug_off();
  const auto logged = [&](const std::string& type, const std::vector<std::string>& values) {
    make_with(type, values);
    platform.fail("ldap_url_parse", 1, 3);
    EXPECT_NE(verify(), 0);
    EXPECT_THAT(platform.debug_lines(), IsEmpty());
    return platform.calls({"PrintMessage"});
  };
  file({{kOther, {{"orv-slapdPtaSubtree", {"o=b"}}}}});
  EXPECT_THAT(logged("orv-slapdPtaURL", {"nonsense"}),
              ElementsAre("PrintMessage(0, 8, 179, \"nonsense\")"));
  EXPECT_THAT(
      logged("orv-slapdPtaSubtree", {"cn=schema"}),
      ElementsAre("PrintMessage(0, 8, 174, \"" + std::string(kEntry) + "\", \"CN=SCHEMA\")"));
  EXPECT_THAT(logged("orv-slapdPtaSubtree", {"o=a", "o=a"}),
              ElementsAre("PrintMessage(0, 8, 167, \"O=A\", \"O=A\")"));
  EXPECT_THAT(logged("orv-slapdPtaSubtree", {"o=b"}),
              ElementsAre("PrintMessage(0, 8, 167, \"O=B\", \"O=B\")"));
}

TEST_F(PassThrough, ExitRecordsCarryTheCodes) {
  trcEvents = kTraceExit;
  make_with_subtrees({"o=a"});
  verify();
  EXPECT_THAT(last_record(), "exit 01021300 32");
  EXPECT_THAT(platform.records(), Contains("exit 01021400 32"));
  file({{kOther, {{"orv-slapdPtaSubtree", {"o=a"}}}}});
  verify();
  EXPECT_THAT(platform.records(), Contains("exit 01021400 19"));
}

// ---- The review of all entries, once in a process: each of these runs in a process of its own

class Review : public PassThrough {
 protected:
  const std::string kFirstDnReleased = "cfg_memfree(\"cn=one," + std::string(kContainer) + "\")";
  const std::string kSecondDnReleased = "cfg_memfree(\"cn=two," + std::string(kContainer) + "\")";

  // Runs `test` in a child process, which fails when the test does.
  template <typename Test>
  void in_a_fresh_process(Test test) {
    EXPECT_EXIT(
        {
          test();
          std::fflush(nullptr);
          write_counters();
          std::_Exit(HasFailure() ? 1 : 0);
        },
        testing::ExitedWithCode(0), "");
  }

  // Of a build that measures what is reached: a process that ends like this would not write them.
  static void write_counters() {
#ifdef ORV_COVERAGE
    __gcov_dump();
#endif
  }

  // Two entries of the file, of which the second has a bad URL.
  void two_entries() {
    file({{"cn=one," + std::string(kContainer), {{"orv-slapdPtaURL", {"ldap://a"}}}},
          {"cn=two," + std::string(kContainer), {{"orv-slapdPtaURL", {"nonsense"}}}}});
  }

  // What a review of both releases in the end when `failing` fails for the second of them: the
  // first one's DN, the result, and `last`. The second one's DN is what `maker` allocated.
  void expect_released(const std::string& failing, const std::string& maker,
                       const std::vector<std::string>& last) {
    in_a_fresh_process([&] {
      g_safe_mode = 1;
      two_entries();
      make(kEntry, {});
      platform.name_allocation_in("replace_DN", 1, "first DN");
      platform.name_allocation_in(maker, 2, "second DN");
      platform.fail(failing, 2, 90);
      EXPECT_EQ(verify(), 0);
      std::vector<std::string> expected = {"free(first DN)", kFirstDnReleased,
                                           "cfg_msgfree(chain)"};
      expected.insert(expected.end(), last.begin(), last.end());
      EXPECT_EQ(platform.calls({"free", "cfg_memfree", "cfg_msgfree"}), expected) << failing;
    });
  }
};

TEST_F(Review, HappensInSafeModeOnceAndChangesNoResult) {
  in_a_fresh_process([&] {
    g_safe_mode = 1;
    two_entries();
    make(kEntry, {{"orv-slapdPtaURL", {"ldap://new"}}});
    platform.fail("ldap_url_parse", 2, 3);
    EXPECT_EQ(verify(), 0);
    EXPECT_THAT(platform.calls({"cfg_search_s", "ldap_url_parse", "PrintMessage", "cfg_msgfree",
                                "CFGMessage2Entry", "entry_free"}),
                ElementsAre(kSearch, "CFGMessage2Entry(session, record 1)",
                            "ldap_url_parse(\"ldap://a\")", "entry_free(\"entry\")",
                            "CFGMessage2Entry(session, record 2)", "ldap_url_parse(\"nonsense\")",
                            "PrintMessage(0, 8, 179, \"nonsense\")", "entry_free(\"entry\")",
                            "cfg_msgfree(chain)", "ldap_url_parse(\"ldap://new\")"));
    platform.forget();
    EXPECT_EQ(verify(), 0);
    EXPECT_EQ(platform.count("cfg_search_s"), 0);
    expect_only_the_session_left();
  });
}

TEST_F(Review, HappensOnAServerOfKindOne) {
  in_a_fresh_process([&] {
    g_srvType = 1;
    two_entries();
    make(kEntry, {});
    EXPECT_EQ(verify(), 0);
    EXPECT_EQ(platform.count("CFGMessage2Entry"), 2);
  });
}

TEST_F(Review, DoesNotHappenOnOtherServersAndIsThenStillToCome) {
  in_a_fresh_process([&] {
    two_entries();
    make(kEntry, {});
    for (const int value : {0, 2, 3, -1}) {
      g_safe_mode = value;
      g_srvType = value;
      EXPECT_EQ(verify(), 0);
    }
    EXPECT_EQ(platform.count("cfg_search_s"), 0);
    g_srvType = 1;
    EXPECT_EQ(verify("CN=X,CN=CONFIGURATION"), 0);  // not for an entry elsewhere
    EXPECT_EQ(platform.count("cfg_search_s"), 0);
    EXPECT_EQ(verify(), 0);
    EXPECT_EQ(platform.count("CFGMessage2Entry"), 2);
  });
}

TEST_F(Review, FindsWhatIsNestedWithoutReviewingAgain) {
  in_a_fresh_process([&] {
    g_safe_mode = 1;
    file({{"cn=one," + std::string(kContainer), {{"orv-slapdPtaSubtree", {"o=a"}}}},
          {"cn=two," + std::string(kContainer), {{"orv-slapdPtaSubtree", {"ou=x,o=a"}}}}});
    make(kEntry, {});
    EXPECT_EQ(verify(), 0);
    EXPECT_THAT(platform.calls({"PrintMessage"}),
                ElementsAre("PrintMessage(0, 8, 167, \"O=A\", \"OU=X,O=A\")",
                            "PrintMessage(0, 8, 167, \"OU=X,O=A\", \"O=A\")"));
    EXPECT_EQ(platform.count("cfg_search_s"), 3);  // the review, and one for each entry
    expect_only_the_session_left();
  });
}

TEST_F(Review, FailedSearchOnlyLeavesItsLine) {
  in_a_fresh_process([&] {
    g_safe_mode = 1;
    make(kEntry, {});
    EXPECT_EQ(verify(), 0);
    EXPECT_THAT(platform.debug_lines(),
                ElementsAre(error("checkAllPTAEntries: cfg_search_s rc=32\n")));
    EXPECT_EQ(platform.count("cfg_count_entries"), 0);
    two_entries();
    EXPECT_EQ(verify(), 0);  // this was the one time
    EXPECT_EQ(platform.count("cfg_search_s"), 1);
  });
}

TEST_F(Review, NothingToReviewIsTracedAfterTheResultIsReleased) {
  in_a_fresh_process([&] {
    g_safe_mode = 1;
    file({});
    make(kEntry, {});
    EXPECT_EQ(verify(), 0);
    EXPECT_THAT(
        platform.story({"cfg_msgfree", "cfg_first_entry"}),
        ElementsAre("cfg_msgfree(chain)", "debug: checkAllPTAEntries: No PTA entry found\n"));
    EXPECT_EQ(platform.debug_lines()[0].category, 0xC80D0000U);
  });
}

TEST_F(Review, LeavesItsRecordsWithoutACode) {
  in_a_fresh_process([&] {
    g_safe_mode = 1;
    trcEvents = kTraceExit;
    make(kEntry, {});
    EXPECT_EQ(verify(), 0);
    EXPECT_THAT(platform.records(), ElementsAre("entry 01021300 ", "entry 01021500 ",
                                                "exit 01021500 0", "exit 01021300 0"));
  });
}

TEST_F(Review, HasNothingToReviewInAResultThatCannotBeCounted) {
  in_a_fresh_process([&] {
    g_safe_mode = 1;
    two_entries();
    make(kEntry, {});
    platform.fail("cfg_count_entries", 1, -1);
    EXPECT_EQ(verify(), 0);
    EXPECT_EQ(platform.count("cfg_first_entry"), 0);
    EXPECT_EQ(platform.count("cfg_msgfree"), 1);
  });
}

TEST_F(Review, EndsWhereADnOrAnEntryCannotBeMade) {
  for (const char* failing :
       {"cfg_get_dn", "xlate_localcp_to_utf8", "replace_DN", "CFGMessage2Entry"}) {
    in_a_fresh_process([&] {
      g_safe_mode = 1;
      two_entries();
      make(kEntry, {});
      platform.fail(failing, 1, 90);
      EXPECT_EQ(verify(), 0);
      EXPECT_EQ(platform.count("cfg_next_entry"), 0) << failing;
      EXPECT_EQ(platform.count("ldap_url_parse"), 0) << failing;
      const bool dn_made = failing == std::string("CFGMessage2Entry");
      EXPECT_EQ(platform.count("CFGMessage2Entry"), dn_made ? 1 : 0) << failing;
      EXPECT_EQ(platform.count("cfg_msgfree"), 1) << failing;
      expect_only_the_session_left();
    });
  }
}

TEST_F(Review, EntryIsBuiltWhenItsDnIsNormalised) {
  in_a_fresh_process([&] {
    g_safe_mode = 1;
    file({{kOther, {{"orv-slapdPtaURL", {"ldap://a"}}}}});
    make(kEntry, {});
    EXPECT_EQ(verify(), 0);
    EXPECT_THAT(platform.calls({"cfg_get_dn", "xlate_localcp_to_utf8", "replace_DN",
                                "CFGMessage2Entry", "entry_free"}),
                ElementsAre("cfg_get_dn(session, record 1)",
                            "xlate_localcp_to_utf8(\"" + std::string(kOther) + "\")",
                            "replace_DN(\"" + std::string(kOther) + "\", 1)",
                            "CFGMessage2Entry(session, record 1)", "entry_free(\"entry\")"));
  });
}

TEST_F(Review, FailingAllocationOnlyEndsTheReviewOrAnEntrysPartOfIt) {
  constexpr int kEnough = 45;  // one more than a review of these entries makes, at least
  for (int nth = 1; nth <= kEnough; ++nth) {
    in_a_fresh_process([&] {
      g_safe_mode = 1;
      file({{"cn=one," + std::string(kContainer), {{"orv-slapdPtaSubtree", {"o=a"}}}},
            {"cn=two," + std::string(kContainer), {{"orv-slapdPtaSubtree", {"o=b"}}}}});
      make(kEntry, {});
      platform.fail_allocation(nth);
      EXPECT_EQ(verify(), 0) << nth;
      if (nth == kEnough) {
        EXPECT_LT(platform.allocations(), nth);
      }
      EXPECT_EQ(platform.count("PrintMessage"), 0) << nth;
      expect_only_the_session_left();
    });
  }
}

TEST_F(Review, LastDnIsReleasedAfterTheResult) {
  in_a_fresh_process([&] {
    g_safe_mode = 1;
    two_entries();
    make(kEntry, {});
    platform.name_allocation_in("replace_DN", 0, "DN");
    EXPECT_EQ(verify(), 0);
    EXPECT_THAT(platform.calls({"cfg_get_dn", "cfg_memfree", "cfg_msgfree", "free"}),
                ElementsAre("cfg_get_dn(session, record 1)", "free(DN)", kFirstDnReleased,
                            "cfg_get_dn(session, record 2)", "cfg_msgfree(chain)", "free(DN)",
                            kSecondDnReleased));
  });
}

TEST_F(Review, DnThatEndsTheWalkIsReleasedAfterTheResult) {
  expect_released("xlate_localcp_to_utf8", "xlate_localcp_to_utf8", {kSecondDnReleased});
  expect_released("replace_DN", "xlate_localcp_to_utf8", {"free(second DN)", kSecondDnReleased});
}

TEST_F(Review, DnOfAnEntryThatCannotBeBuiltIsReleasedAfterTheResult) {
  expect_released("CFGMessage2Entry", "replace_DN", {"free(second DN)", kSecondDnReleased});
}

TEST_F(Review, RecordsAreWalkedUnderTheirNormalisedDns) {
  in_a_fresh_process([&] {
    g_safe_mode = 1;
    file({{kOther, {{"orv-slapdPtaSubtree", {"cn=schema"}}}}});
    make(kEntry, {});
    EXPECT_EQ(verify(), 0);
    EXPECT_THAT(platform.calls({"PrintMessage"}),
                ElementsAre("PrintMessage(0, 8, 174, \"" + std::string(kOtherNormal) +
                            "\", \"CN=SCHEMA\")"));
  });
}

}  // namespace
}  // namespace orv
