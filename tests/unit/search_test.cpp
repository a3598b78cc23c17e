// Search: authority, the path of an operation, and who sees which credentials.
#include "config_search.h"

#include <cerrno>
#include <thread>

#include "backend_test.h"
#include "config_session.h"

namespace orv {
namespace {

constexpr unsigned kPrimary = 0x0C;
constexpr unsigned kMember = 0x14;
constexpr const char* kMe = "CN=ME,O=ORV";
constexpr const char* kDirectory =
    "CN=DIRECTORY,CN=RDBM BACKENDS,CN=ORV DIRECTORY,CN=SCHEMAS,CN=CONFIGURATION";
constexpr const char* kGroup = "cn=AdminGroup, cn=Configuration";
constexpr const char* kMemberEntry = "cn=one, cn=AdminGroup, cn=Configuration";
constexpr const char* kMemberEntryNormal = "CN=ONE,CN=ADMINGROUP,CN=CONFIGURATION";

// ---- Who may search

class SearchAuthority : public BackendTest {
 protected:
  int authority_of(unsigned flags) {
    as(flags);
    return traced(0x01040200, [&] { return has_search_authority(&connection, &operation); });
  }
};

TEST_F(SearchAuthority, SuppliersAreRefusedWith50) {
  for (const unsigned flags : {0x01U, 0x02U, 0x03U, 0x0DU, 0x0EU, 0x15U, 0x25U}) {
    EXPECT_EQ(authority_of(flags), 50) << flags;
  }
}

TEST_F(SearchAuthority, ExactlyThirtySixIsRefusedWith50) {
  EXPECT_EQ(authority_of(0x24), 50);
  for (const unsigned flags : {0x04U, 0x20U, 0x2CU, 0x34U, 0U}) {
    EXPECT_EQ(authority_of(flags), 0) << flags;
  }
}

TEST_F(SearchAuthority, AdministratorsMaySearch) {
  EXPECT_EQ(authority_of(kPrimary), 0);
  EXPECT_EQ(authority_of(kMember), 0);
}

TEST_F(SearchAuthority, ServerOfKindThreeAsksForTheMarkerBeforeTheFlags) {
  g_srvType = 3;
  for (const int marker : {0, 2, -1}) {
    operation.server_kind_marker = marker;
    EXPECT_EQ(authority_of(0x01), 32);
    EXPECT_EQ(authority_of(0x24), 32);
    EXPECT_EQ(authority_of(kPrimary), 32);
  }
}

TEST_F(SearchAuthority, MarkedCallerOnServerOfKindThreeIsJudgedByItsFlags) {
  g_srvType = 3;
  operation.server_kind_marker = 1;
  EXPECT_EQ(authority_of(0x01), 50);
  EXPECT_EQ(authority_of(kPrimary), 0);
}

TEST_F(SearchAuthority, MarkerDoesNotMatterOnOtherServers) {
  for (const int kind : {0, 1, 2, 4, -1}) {
    g_srvType = kind;
    EXPECT_EQ(authority_of(kPrimary), 0);
  }
}

// ---- Sending a result

class Sending : public BackendTest {
 protected:
  Sending() {
    session = open_session();
    as(kMember, kMe);
  }
  void TearDown() override {
    close_session();
    BackendTest::TearDown();
  }

  void found(std::vector<ScriptedEntry> entries) {
    platform.file["CN=FOUND"] = {std::move(entries)};
  }

  int send(int full_view = 1) {
    cfg_search_s(session, "CN=FOUND", 2, "f", nullptr, 0, &chain);
    // Only what the code under test does is of interest from here on.
    return traced(0x01040300, [&] {
      return sendCFGSearchResults(session, chain, &connection, &operation, &backend, attributes,
                                  types_only, full_view, response_control);
    });
  }

  // The last call that was made to the client.
  [[nodiscard]] std::string final_result() const {
    const auto results = platform.calls({"send_search_result"});
    return results.size() == 1 ? results.front() : "not exactly one";
  }

  _CFG* session = nullptr;
  _CFGMessage* chain = nullptr;
  char** attributes = nullptr;
  int types_only = 0;
  LDAPControl* response_control = nullptr;
};

ScriptedEntry configuration() {
  return {"cn=Configuration",
          {{"cn", {"Configuration"}},
           {"orv-slapdAdminDN", {"cn=root"}},
           {"orv-slapdAdminPW", {"secret"}},
           {"orv-slapdAdminGroupEnabled", {"TRUE"}}}};
}

ScriptedEntry member(const char* bind_dn, const char* dn = kMemberEntry) {
  return {dn, {{"cn", {"one"}}, {"orv-slapdAdminDN", {bind_dn}}, {"orv-slapdAdminPW", {"pw"}}}};
}

ScriptedEntry password_only(const char* dn = kMemberEntry) {
  return {dn, {{"orv-slapdAdminPW", {"pw"}}}};
}

TEST_F(Sending, HandsEachEntryToTheSenderWithItsArguments) {
  found({{"cn=a,cn=configuration", {{"cn", {"a"}}}}});
  char name[] = "cn";
  char* list[] = {name, nullptr};
  attributes = list;
  types_only = 1;
  EXPECT_EQ(send(), 0);
  EXPECT_THAT(platform.calls({"send_search_entry", "send_search_result"}),
              ElementsAre("send_search_entry(backend, connection, operation, "
                          "\"cn=a,cn=configuration\", [cn], 1, null, null, null, null)",
                          "send_search_result(connection, operation, 0, null, null, 1)"));
}

TEST_F(Sending, NoEntriesIsASuccessWithAFinalResult) {
  found({});
  EXPECT_EQ(send(), 0);
  EXPECT_EQ(final_result(), "send_search_result(connection, operation, 0, null, null, 0)");
  EXPECT_EQ(platform.count("cfg_msgfree"), 1);
}

TEST_F(Sending, ReleasesTheChainBeforeTheFinalResult) {
  found({{"cn=a", {}}});
  EXPECT_EQ(send(), 0);
  EXPECT_THAT(platform.calls({"cfg_msgfree", "send_search_result"}),
              ElementsAre("cfg_msgfree(chain)",
                          "send_search_result(connection, operation, 0, null, null, 1)"));
}

TEST_F(Sending, ReleasesEachEntryBeforeTheNextIsTaken) {
  found({{"cn=a", {}}, {"cn=b", {}}});
  EXPECT_EQ(send(), 0);
  EXPECT_THAT(platform.calls({"entry_free", "cfg_next_entry"}),
              ElementsAre("entry_free(\"entry\")", "cfg_next_entry(session, record 1)",
                          "entry_free(\"entry\")", "cfg_next_entry(session, record 2)"));
}

TEST_F(Sending, ReleasesWhatItComparedWhenTheEntryIsSentAndBeforeTheEntry) {
  found({{"cn=a,cn=admingroup,cn=configuration",
          {{"orv-slapdAdminDN", {"cn=me"}}, {"orv-slapdAdminPW", {"p"}}}}});
  platform.name_allocation_in("replace_DN", 1, "dn");
  platform.name_allocation_in("replace_DN", 2, "member");
  EXPECT_EQ(send(), 0);
  const auto calls = platform.calls({"send_search_entry", "free", "entry_free", "cfg_next_entry"});
  ASSERT_EQ(calls.size(), 5U);
  EXPECT_THAT(calls.front(), testing::StartsWith("send_search_entry("));
  EXPECT_THAT(std::vector<std::string>(calls.begin() + 1, calls.end()),
              ElementsAre("free(dn)", "free(member)", "entry_free(\"entry\")",
                          "cfg_next_entry(session, record 1)"));
}

TEST_F(Sending, ErrorAtTheFirstEntryStillSendsAFinalSuccessAndKeepsTheChain) {
  found({{"cn=a", {}}});
  platform.fail("cfg_first_entry", 1, 1);
  EXPECT_EQ(send(), 0);
  EXPECT_THAT(platform.calls({"cfg_perror", "cfg_msgfree", "send_search_entry"}),
              ElementsAre("cfg_perror(session, \"cfg_first_entry\")"));
  EXPECT_EQ(final_result(), "send_search_result(connection, operation, 0, null, null, 0)");
  EXPECT_THAT(platform.leaks(), ElementsAre("chain", "record", "session"));
  cfg_msgfree(chain);
}

TEST_F(Sending, FirstEntryThatComesWithAnErrorIsNotSent) {
  found({{"cn=a", {}}});
  platform.fail("cfg_get_errno", 1, 1);
  EXPECT_EQ(send(), 0);
  EXPECT_THAT(platform.calls({"cfg_perror", "cfg_msgfree", "send_search_entry"}),
              ElementsAre("cfg_perror(session, \"cfg_first_entry\")"));
  EXPECT_EQ(final_result(), "send_search_result(connection, operation, 0, null, null, 0)");
  cfg_msgfree(chain);
}

// Error numbers asked for: after the first entry, its DN, its first attribute, the next entry.
TEST_F(Sending, NextEntryThatComesWithAnErrorIsReportedAndSent) {
  found({{"cn=a", {}}, {"cn=b", {}}});
  platform.fail("cfg_get_errno", 4, 1);
  EXPECT_EQ(send(), 0);
  EXPECT_THAT(platform.calls({"cfg_perror"}),
              ElementsAre("cfg_perror(session, \"cfg_next_entry\")"));
  EXPECT_THAT(platform.sent, ElementsAre("cn=a", "cn=b"));
}

TEST_F(Sending, ErrorAtTheNextEntryIsReportedAndEndsTheEntries) {
  found({{"cn=a", {}}, {"cn=b", {}}});
  platform.fail("cfg_next_entry", 1, 1);
  EXPECT_EQ(send(), 0);
  EXPECT_THAT(platform.calls({"cfg_perror"}),
              ElementsAre("cfg_perror(session, \"cfg_next_entry\")"));
  EXPECT_EQ(final_result(), "send_search_result(connection, operation, 0, null, null, 1)");
}

TEST_F(Sending, ErrorsOfTheWalkAreReportedWithoutTheTraceToo) {
  debug_off();
  found({{"cn=a", {}}, {"cn=b", {}}});
  for (const char* function : {"cfg_first_entry", "cfg_next_entry"}) {
    SCOPED_TRACE(function);
    platform.forget();
    platform.fail(function, 1, 1);
    EXPECT_EQ(send(), 0);
    EXPECT_THAT(platform.calls({"cfg_perror"}),
                ElementsAre("cfg_perror(session, \"" + std::string(function) + "\")"));
    EXPECT_THAT(platform.debug_lines(), IsEmpty());
    if (function == std::string("cfg_first_entry")) cfg_msgfree(chain);  // kept there
  }
}

TEST_F(Sending, SenderThatRefusesEndsTheSearchAndItsEntryCounts) {
  found({{"cn=a", {}}, {"cn=b", {}}, {"cn=c", {}}});
  platform.fail("send_search_entry", 2, 4);
  EXPECT_EQ(send(), 4);
  EXPECT_THAT(platform.sent, ElementsAre("cn=a"));
  EXPECT_EQ(platform.count("send_search_entry"), 2);
  EXPECT_EQ(final_result(), "send_search_result(connection, operation, 4, null, null, 2)");
}

TEST_F(Sending, ResultOfTheFinalResultIsNotLookedAt) {
  found({});
  platform.fail("send_search_result", 1, 80);
  EXPECT_EQ(send(), 0);
}

TEST_F(Sending, EntryThatCannotBeConvertedEndsWith90AndItsRecordIsNotUsedAgain) {
  found({{"cn=a", {}}, {"cn=b", {}}});
  platform.at("send_search_entry", 1,
              [&] { platform.fail_allocation(platform.allocations() + 1); });
  EXPECT_EQ(send(), 90);
  EXPECT_EQ(platform.count("cfg_next_entry"), 1);
  EXPECT_EQ(final_result(), "send_search_result(connection, operation, 90, null, null, 1)");
}

TEST_F(Sending, EntryWithoutDnEndsWith90) {
  found({{"cn=a", {}}});
  platform.fail("cfg_get_dn", 1, 90);
  EXPECT_EQ(send(), 90);
  EXPECT_EQ(platform.count("send_search_entry"), 0);
  EXPECT_EQ(final_result(), "send_search_result(connection, operation, 90, null, null, 0)");
}

TEST_F(Sending, DnThatCannotBeCopiedEndsWith90AfterTheEntriesSentSoFar) {
  found({{"cn=a", {}}, {"cn=b", {}}});
  platform.fail("slapi_ch_strdup", 2, 0);
  EXPECT_EQ(send(), 90);
  EXPECT_EQ(platform.count("cfg_next_entry"), 1);
  EXPECT_EQ(final_result(), "send_search_result(connection, operation, 90, null, null, 1)");
}

TEST_F(Sending, DnThatCannotBeNormalisedEndsWithThatCode) {
  found({{"cn=a", {}}});
  platform.fail("replace_DN", 1, 34);
  EXPECT_EQ(send(), 34);
  EXPECT_EQ(platform.count("send_search_entry"), 0);
  EXPECT_EQ(final_result(), "send_search_result(connection, operation, 34, null, null, 0)");
}

TEST_F(Sending, DnIsNormalisedEvenForThePrimaryAdministrator) {
  as(kPrimary);
  found({{"cn=a", {}}});
  platform.fail("replace_DN", 1, 34);
  EXPECT_EQ(send(), 34);
  EXPECT_EQ(platform.calls({"replace_DN"}), std::vector<std::string>{"replace_DN(\"cn=a\", 1)"});
  EXPECT_EQ(final_result(), "send_search_result(connection, operation, 34, null, null, 0)");
}

// ---- Response control

TEST_F(Sending, ResponseControlIsAttachedWhenTheConnectionAsks) {
  found({{"cn=a", {}}, {"cn=b", {}}});
  response_control = &control;
  for (const unsigned char flag : std::initializer_list<unsigned char>{1, 2, 255}) {
    platform.forget();
    aux.attach_response_control = flag;
    EXPECT_EQ(send(), 0);
    EXPECT_EQ(platform.count("ldap_insert_control"), 1);
    EXPECT_EQ(platform.sent.size(), 2U);
    for (const std::string& call : platform.calls({"send_search_entry"})) {
      EXPECT_THAT(call, testing::EndsWith("null, null, null, control)"));
    }
  }
}

TEST_F(Sending, ControlArrayIsReleasedAfterTheFinalResult) {
  found({});
  aux.attach_response_control = 1;
  response_control = &control;
  EXPECT_EQ(send(), 0);
  EXPECT_THAT(
      platform.calls({"send_search_result", "free"}),
      ElementsAre("send_search_result(connection, operation, 0, null, null, 0)", "free(controls)"));
}

TEST_F(Sending, ResponseControlNeedsTheFlagTheRecordAndTheControl) {
  found({{"cn=a", {}}});
  response_control = &control;
  send();
  aux.attach_response_control = 1;
  response_control = nullptr;
  send();
  connection.aux = nullptr;
  response_control = &control;
  send();
  EXPECT_EQ(platform.count("ldap_insert_control"), 0);
  EXPECT_EQ(platform.sent.size(), 3U);
}

// ---- Who sees what

TEST_F(Sending, PrimaryAdministratorSeesTheCredentialsOfConfiguration) {
  as(kPrimary);
  found({configuration()});
  EXPECT_EQ(send(), 0);
  EXPECT_THAT(platform.sent,
              ElementsAre("cn=Configuration|cn=Configuration|orv-slapdAdminDN=cn=root|"
                          "orv-slapdAdminPW=secret|orv-slapdAdminGroupEnabled=TRUE"));
}

TEST_F(Sending, OthersSeeConfigurationWithoutTheCredentials) {
  found({configuration()});
  EXPECT_EQ(send(), 0);
  EXPECT_THAT(platform.sent, ElementsAre("cn=Configuration|cn=Configuration"));
  EXPECT_THAT(platform.calls({"attr_delete"}),
              ElementsAre("attr_delete(\"orv-slapdAdminDN\", null)",
                          "attr_delete(\"orv-slapdAdminPW\", null)",
                          "attr_delete(\"orv-slapdAdminGroupEnabled\", null)"));
}

TEST_F(Sending, OnlyBothFlagsMakeAPrimaryAdministrator) {
  for (const unsigned flags : {0x04U, 0x08U, 0x14U, 0x18U}) {
    platform.forget();
    as(flags);
    found({configuration()});
    EXPECT_EQ(send(), 0);
    EXPECT_THAT(platform.sent, ElementsAre("cn=Configuration|cn=Configuration")) << flags;
  }
}

TEST_F(Sending, PrimaryAdministratorMayHaveFurtherFlags) {
  as(0x1C);
  found({password_only()});
  EXPECT_EQ(send(), 0);
  EXPECT_EQ(platform.sent.size(), 1U);
}

TEST_F(Sending, OnlyCredentialsThatAreThereAreRemoved) {
  found({{"cn=Configuration", {{"cn", {"x"}}, {"orv-slapdAdminPW", {"p"}}}}});
  EXPECT_EQ(send(), 0);
  EXPECT_THAT(platform.calls({"attr_delete"}),
              ElementsAre("attr_delete(\"orv-slapdAdminPW\", null)"));
}

TEST_F(Sending, ConfigurationLeftWithoutAttributesIsStillSent) {
  found({{"cn=Configuration", {{"orv-slapdAdminPW", {"p"}}}}});
  EXPECT_EQ(send(), 0);
  EXPECT_THAT(platform.sent, ElementsAre("cn=Configuration"));
}

TEST_F(Sending, CredentialThatCannotBeRemovedEndsWith16AndIsNotSent) {
  for (const int nth : {1, 2, 3}) {
    platform.forget();
    platform.fail("attr_delete", nth, -1);
    found({configuration(), {"cn=later", {}}});
    EXPECT_EQ(send(), 16);
    EXPECT_THAT(platform.sent, IsEmpty());
    EXPECT_EQ(platform.count("attr_delete"), nth);
    EXPECT_EQ(platform.count("cfg_next_entry"), 0);
    EXPECT_EQ(final_result(), "send_search_result(connection, operation, 16, null, null, 0)");
  }
}

TEST_F(Sending, EntriesBelowConfigurationKeepTheirAttributes) {
  found({{"cn=x,cn=Configuration", {{"orv-slapdAdminDN", {"d"}}, {"orv-slapdAdminPW", {"p"}}}}});
  EXPECT_EQ(send(), 0);
  EXPECT_THAT(platform.sent,
              ElementsAre("cn=x,cn=Configuration|orv-slapdAdminDN=d|orv-slapdAdminPW=p"));
}

TEST_F(Sending, LongerDnThatBeginsWithConfigurationKeepsItsAttributes) {
  found({{"cn=Configuration,o=y", {{"orv-slapdAdminDN", {"d"}}, {"orv-slapdAdminPW", {"p"}}}}});
  EXPECT_EQ(send(), 0);
  EXPECT_THAT(platform.sent,
              ElementsAre("cn=Configuration,o=y|orv-slapdAdminDN=d|orv-slapdAdminPW=p"));
}

// The normal form is in upper case: a text in lower case is not the normal form of these entries,
// and not taken for them.
TEST_F(Sending, ConfigurationIsRecognisedByteForByte) {
  platform.keeps_letter_case = true;
  found({{"cn=configuration", {{"orv-slapdAdminDN", {"d"}}, {"orv-slapdAdminPW", {"p"}}}}});
  EXPECT_EQ(send(), 0);
  EXPECT_THAT(platform.sent, ElementsAre("cn=configuration|orv-slapdAdminDN=d|orv-slapdAdminPW=p"));
}

TEST_F(Sending, GroupContainerIsRecognisedByteForByte) {
  platform.keeps_letter_case = true;
  found({{"cn=admingroup,cn=configuration", {{"orv-slapdAdminPW", {"p"}}}}});
  EXPECT_EQ(send(), 0);
  EXPECT_THAT(platform.sent, ElementsAre("cn=admingroup,cn=configuration|orv-slapdAdminPW=p"));
  EXPECT_EQ(platform.count("attr_find"), 0);
}

TEST_F(Sending, EntryInsideTheGroupIsRecognisedByteForByte) {
  platform.keeps_letter_case = true;
  found({member("cn=you,o=orv", "cn=one,cn=admingroup,cn=configuration")});
  EXPECT_EQ(send(), 0);
  EXPECT_THAT(platform.sent.front(), testing::HasSubstr("orv-slapdAdminPW=pw"));
  EXPECT_EQ(platform.count("attr_find"), 0);
}

TEST_F(Sending, GroupContainerIsSentUnchangedToEverybody) {
  found({{kGroup, {{"orv-slapdAdminDN", {"d"}}, {"orv-slapdAdminPW", {"p"}}}}});
  EXPECT_EQ(send(), 0);
  EXPECT_THAT(platform.sent,
              ElementsAre(std::string(kGroup) + "|orv-slapdAdminDN=d|orv-slapdAdminPW=p"));
  EXPECT_EQ(platform.count("attr_find"), 0);
}

TEST_F(Sending, MemberSeesItsOwnPassword) {
  found({member("cn=me, o=orv")});
  EXPECT_EQ(send(), 0);
  EXPECT_THAT(platform.sent,
              ElementsAre(std::string(kMemberEntry) + "|cn=one|orv-slapdAdminDN=cn=me, o=orv|"
                                                      "orv-slapdAdminPW=pw"));
  EXPECT_EQ(platform.calls({"replace_DN"}).back(), "replace_DN(\"cn=me, o=orv\", 1)");
}

TEST_F(Sending, MemberDoesNotSeeAnotherMembersPassword) {
  found({member("cn=you,o=orv")});
  EXPECT_EQ(send(), 0);
  EXPECT_THAT(platform.sent,
              ElementsAre(std::string(kMemberEntry) + "|cn=one|orv-slapdAdminDN=cn=you,o=orv"));
}

TEST_F(Sending, BoundDnIsComparedByteForByte) {
  as(kMember, "cn=me,o=orv");
  found({member("cn=me,o=orv")});
  EXPECT_EQ(send(), 0);
  EXPECT_THAT(platform.sent.front(), Not(testing::HasSubstr("orv-slapdAdminPW")));
}

TEST_F(Sending, BoundDnIsComparedWhole) {
  for (const char* dn : {"cn=me,o=orvx", "cn=me,o=or", "cn=xcn=me,o=orv", "cn=x,cn=me,o=orv"}) {
    platform.forget();
    platform.file[kMemberEntryNormal] = {{member(dn)}};
    found({member(dn), password_only()});
    EXPECT_EQ(send(), 0);
    EXPECT_THAT(platform.sent, ElementsAre(Not(testing::HasSubstr("orv-slapdAdminPW")))) << dn;
  }
}

TEST_F(Sending, PrimaryAdministratorSeesEveryMembersPassword) {
  as(kPrimary, "CN=ROOT");
  found({member("cn=you,o=orv"), password_only()});
  EXPECT_EQ(send(), 0);
  EXPECT_THAT(platform.sent.front(), testing::HasSubstr("orv-slapdAdminPW=pw"));
  EXPECT_EQ(platform.sent.size(), 2U);
}

TEST_F(Sending, OnlyTheFirstDnOfAMemberCounts) {
  found({{kMemberEntry,
          {{"orv-slapdAdminDN", {"cn=you,o=orv", "cn=me,o=orv"}}, {"orv-slapdAdminPW", {"p"}}}}});
  EXPECT_EQ(send(), 0);
  EXPECT_THAT(platform.sent.front(), Not(testing::HasSubstr("orv-slapdAdminPW")));
}

TEST_F(Sending, EntriesBelowAMemberAreTreatedAsMembers) {
  found({member("cn=you", "cn=deep,cn=one,cn=AdminGroup,cn=Configuration")});
  EXPECT_EQ(send(), 0);
  EXPECT_THAT(platform.sent.front(), Not(testing::HasSubstr("orv-slapdAdminPW")));
}

TEST_F(Sending, EntriesThatHaveTheGroupAnywhereInTheirDnAreTreatedAsMembers) {
  found({member("cn=you", "cn=x,cn=AdminGroup,cn=Configuration,o=y"),
         member("cn=you", "cn=AdminGroup,cn=Configuration,o=y")});
  EXPECT_EQ(send(), 0);
  ASSERT_EQ(platform.sent.size(), 2U);
  for (const std::string& sent : platform.sent) {
    EXPECT_THAT(sent, Not(testing::HasSubstr("orv-slapdAdminPW")));
  }
}

TEST_F(Sending, AnotherMembersEntryWithoutAPasswordLosesNothing) {
  found({{kMemberEntry, {{"orv-slapdAdminDN", {"cn=you"}}}}});
  EXPECT_EQ(send(), 0);
  EXPECT_THAT(platform.sent, ElementsAre(std::string(kMemberEntry) + "|orv-slapdAdminDN=cn=you"));
  EXPECT_EQ(platform.count("attr_delete"), 0);
}

TEST_F(Sending, GroupEntryWithoutDnAndPasswordIsSentWithoutALookup) {
  found({{kMemberEntry, {{"cn", {"one"}}}}});
  EXPECT_EQ(send(), 0);
  EXPECT_EQ(platform.sent.size(), 1U);
  EXPECT_EQ(platform.count("cfg_search_s"), 1);
}

TEST_F(Sending, GroupEntryThatHadNoAttributesIsSent) {
  found({{kMemberEntry, {}}});
  EXPECT_EQ(send(), 0);
  EXPECT_EQ(platform.sent.size(), 1U);
}

TEST_F(Sending, PasswordAloneIsNotSentToAnother) {
  platform.file[kMemberEntryNormal] = {{member("cn=you,o=orv")}};
  found({password_only(), {"cn=later", {}}});
  EXPECT_EQ(send(), 0);
  EXPECT_THAT(platform.sent, ElementsAre("cn=later"));
  EXPECT_EQ(final_result(), "send_search_result(connection, operation, 0, null, null, 1)");
}

TEST_F(Sending, PasswordAloneIsSentToItsMember) {
  platform.file[kMemberEntryNormal] = {{member("cn=me,o=orv")}};
  found({password_only()});
  EXPECT_EQ(send(), 0);
  EXPECT_THAT(platform.sent, ElementsAre(std::string(kMemberEntry) + "|orv-slapdAdminPW=pw"));
  EXPECT_THAT(platform.calls({"cfg_search_s"}).back(),
              testing::StartsWith("cfg_search_s(session, "
                                  "\"CN=ONE,CN=ADMINGROUP,CN=CONFIGURATION\", 0"));
}

TEST_F(Sending, BoundDnIsComparedByteForByteWithTheMemberOfTheFile) {
  as(kMember, "cn=me,o=orv");
  platform.file[kMemberEntryNormal] = {{member("cn=me,o=orv")}};
  found({password_only()});
  EXPECT_EQ(send(), 0);
  EXPECT_THAT(platform.sent, IsEmpty());
}

TEST_F(Sending, PasswordWithOtherAttributesLosesOnlyThePassword) {
  platform.file[kMemberEntryNormal] = {{member("cn=you,o=orv")}};
  found({{kMemberEntry, {{"cn", {"one"}}, {"orv-slapdAdminPW", {"p"}}}}});
  EXPECT_EQ(send(), 0);
  EXPECT_THAT(platform.sent, ElementsAre(std::string(kMemberEntry) + "|cn=one"));
}

TEST_F(Sending, PasswordWhoseMemberCannotBeToldEndsWith80) {
  found({password_only(), {"cn=later", {}}});
  EXPECT_EQ(send(), 80);
  EXPECT_THAT(platform.sent, IsEmpty());
  EXPECT_EQ(platform.count("cfg_next_entry"), 0);
  EXPECT_EQ(final_result(), "send_search_result(connection, operation, 80, null, null, 0)");
}

TEST_F(Sending, PasswordOfAnotherThatCannotBeRemovedEndsWith16) {
  platform.fail("attr_delete", 1, 1);
  found({member("cn=you")});
  EXPECT_EQ(send(), 16);
  EXPECT_THAT(platform.sent, IsEmpty());
  EXPECT_EQ(final_result(), "send_search_result(connection, operation, 16, null, null, 0)");
}

TEST_F(Sending, MembersDnThatCannotBeCopiedEndsWith90) {
  platform.fail("slapi_ch_strdup", 2, 0);
  found({member("cn=me,o=orv")});
  EXPECT_EQ(send(), 90);
  EXPECT_THAT(platform.sent, IsEmpty());
  EXPECT_EQ(final_result(), "send_search_result(connection, operation, 90, null, null, 0)");
}

TEST_F(Sending, MembersDnThatCannotBeNormalisedEndsWithThatCode) {
  platform.fail("replace_DN", 2, 34);
  found({member("cn=me,o=orv")});
  EXPECT_EQ(send(), 34);
  EXPECT_THAT(platform.sent, IsEmpty());
  EXPECT_EQ(final_result(), "send_search_result(connection, operation, 34, null, null, 0)");
}

TEST_F(Sending, TypesOnlyMemberEntryHasNoDnToCompareAndLosesItsPassword) {
  platform.types_only_values = true;
  for (const bool null_lists : {false, true}) {
    platform.forget();
    platform.empty_lists_are_null = null_lists;
    found({member("cn=me,o=orv")});
    EXPECT_EQ(send(), 0);
    EXPECT_THAT(platform.sent, ElementsAre(std::string(kMemberEntry) + "|cn=|orv-slapdAdminDN="));
  }
}

// ---- The restricted view

TEST_F(Sending, RestrictedViewShowsOnlyTheDirectoryBackend) {
  found({configuration(),
         {"cn=Directory, cn=RDBM Backends, cn=orv Directory, cn=Schemas, cn=Configuration",
          {{"cn", {"Directory"}}}},
         member("cn=me,o=orv")});
  EXPECT_EQ(send(0), 0);
  EXPECT_THAT(platform.sent,
              ElementsAre("cn=Directory, cn=RDBM Backends, cn=orv Directory, cn=Schemas, "
                          "cn=Configuration|cn=Directory"));
  EXPECT_EQ(final_result(), "send_search_result(connection, operation, 0, null, null, 1)");
  EXPECT_EQ(platform.count("replace_DN"), 0);
}

TEST_F(Sending, RestrictedViewComparesTheEntrysOwnDnWithTheServersComparison) {
  found({{"cn=x", {}}});
  EXPECT_EQ(send(0), 0);
  EXPECT_THAT(platform.calls({"slapi_dn_compare_v3"}),
              ElementsAre(std::string("slapi_dn_compare_v3(\"cn=x\", \"") + kDirectory + "\")"));
}

TEST_F(Sending, RestrictedViewTakesOnlyZeroForTheSameDn) {
  found({{kDirectory, {}}});
  for (const int code : {-1, 1}) {
    platform.forget();
    platform.fail("slapi_dn_compare_v3", 1, code);
    EXPECT_EQ(send(0), 0);
    EXPECT_THAT(platform.sent, IsEmpty());
  }
}

TEST_F(Sending, EveryFlagButOneMeansTheRestrictedView) {
  found({{"cn=x", {}}});
  EXPECT_EQ(send(2), 0);
  EXPECT_EQ(send(-1), 0);
  EXPECT_THAT(platform.sent, IsEmpty());
}

TEST_F(Sending, BufferIsReadUnderItsMutexInTheRestrictedViewOnly) {
  found({{"cn=x", {}}});
  EXPECT_EQ(send(1), 0);
  EXPECT_EQ(platform.count("pthread_mutex_lock"), 0);
  EXPECT_EQ(send(0), 0);
  EXPECT_EQ(platform.count("pthread_mutex_lock"), 1);
  EXPECT_EQ(platform.count("pthread_mutex_trylock"), 0);
  EXPECT_EQ(platform.mutexes_alive(), 0);
}

TEST_F(Sending, RestrictedViewWithoutMemoryForTheBufferEndsWith90) {
  found({{kDirectory, {}}});
  platform.fail_allocation(2);  // the first is the search that this test makes itself
  EXPECT_EQ(send(0), 90);
  EXPECT_THAT(platform.sent, IsEmpty());
  EXPECT_EQ(final_result(), "send_search_result(connection, operation, 90, null, null, 0)");
}

TEST_F(Sending, LeavesAnExitRecord) {
  trcEvents = 0x00020000;
  found({});
  platform.fail("cfg_first_entry", 1, 1);
  send();
  EXPECT_EQ(platform.records().back(), "exit 01040300 0");
  cfg_msgfree(chain);
}

// ---- The handler

class Search : public BackendTest {
 protected:
  Search() {
    as(kMember, kMe);
    pb.put(parameter::target_dn, static_cast<const void*>("CN=K\xC3\xA4SE"));
    pb.put(parameter::search_filter, static_cast<const void*>(&pb));
    pb.put(parameter::search_filter_text, static_cast<const void*>("(cn=k\xC3\xA4se)"));
    pb.put(parameter::search_scope, 2);
    pb.put(parameter::search_types_only, 1);
    pb.put(parameter::search_attributes, static_cast<const void*>(attributes));
    platform.file["CN=K\xE4SE"] = {{{"cn=a", {{"cn", {"a"}}}}}};
  }

  int search() {
    return traced(0x01040100, [&] { return config_back_search(&pb); });
  }

  // What every search past its silent end leaves behind.
  void expect_rest() {
    EXPECT_EQ(connection.config_session, nullptr);
    EXPECT_FALSE(locked());
    const auto calls = platform.calls({"send_ldap_result", "send_search_result", "cfg_unbind",
                                       "pthread_mutex_unlock", "pthread_mutex_destroy"});
    ASSERT_GE(calls.size(), 3U);
    EXPECT_EQ(calls[calls.size() - 1], "pthread_mutex_unlock(configMutex)");
    EXPECT_THAT(calls[calls.size() - 2], testing::StartsWith("cfg_unbind("));
  }

  // The session failed: the file was not asked, and neither were its converters.
  void expect_no_file_search() {
    EXPECT_EQ(platform.count("xlate_utf8_to_localcp"), 0);
    EXPECT_EQ(platform.count("cfg_search_s"), 0);
    EXPECT_EQ(platform.count("send_search_result"), 0);
  }

  [[nodiscard]] std::vector<std::string> plain_results() const {
    return platform.calls({"send_ldap_result"});
  }

  char cn[3] = "cn";
  char* attributes[2] = {cn, nullptr};
};

TEST_F(Search, ReadsItsArgumentsInOrder) {
  EXPECT_EQ(search(), 0);
  EXPECT_THAT(platform.calls({"slapi_pblock_get"}),
              ElementsAre("slapi_pblock_get(130)", "slapi_pblock_get(131)", "slapi_pblock_get(132)",
                          "slapi_pblock_get(50)", "slapi_pblock_get(114)", "slapi_pblock_get(115)",
                          "slapi_pblock_get(116)", "slapi_pblock_get(110)", "slapi_pblock_get(117)",
                          "slapi_pblock_get(-145)"));
}

TEST_F(Search, RunsTheSameSearchOnTheFileInItsCodePage) {
  EXPECT_EQ(search(), 0);
  EXPECT_THAT(platform.calls({"cfg_search_s", "xlate_utf8_to_localcp"}),
              ElementsAre("xlate_utf8_to_localcp(\"CN=K\xC3\xA4SE\")",
                          "xlate_utf8_to_localcp(\"(cn=k\xC3\xA4se)\")",
                          "cfg_search_s(session, \"CN=K\xE4SE\", 2, \"(cn=k\xE4se)\", [cn], 1)"));
  expect_rest();
}

TEST_F(Search, ReleasesTheConvertedTextsAfterTheLock) {
  platform.name_allocation_in("xlate_utf8_to_localcp", 1, "base");
  platform.name_allocation_in("xlate_utf8_to_localcp", 2, "filter");
  EXPECT_EQ(search(), 0);
  const auto calls = platform.calls({"cfg_unbind", "pthread_mutex_unlock", "free"});
  ASSERT_GE(calls.size(), 4U);
  EXPECT_THAT(std::vector<std::string>(std::prev(calls.end(), 4), calls.end()),
              ElementsAre("cfg_unbind(session)", "pthread_mutex_unlock(configMutex)", "free(base)",
                          "free(filter)"));
}

TEST_F(Search, AsksForEverythingAtTheBaseWhenTheClientDoes) {
  pb.put(parameter::search_scope, 0);
  pb.put(parameter::search_types_only, 0);
  pb.put(parameter::search_attributes, static_cast<const void*>(nullptr));
  EXPECT_EQ(search(), 0);
  EXPECT_THAT(platform.calls({"cfg_search_s", "send_search_entry"}),
              ElementsAre("cfg_search_s(session, \"CN=K\xE4SE\", 0, \"(cn=k\xE4se)\", null, 0)",
                          "send_search_entry(backend, connection, operation, \"cn=a\", null, 0, "
                          "null, null, null, null)"));
  expect_rest();
}

TEST_F(Search, SendsEntriesWithTheRequestedAttributesInTheFullView) {
  EXPECT_EQ(search(), 0);
  EXPECT_THAT(platform.calls({"send_search_entry", "send_search_result"}),
              ElementsAre("send_search_entry(backend, connection, operation, \"cn=a\", [cn], 1, "
                          "null, null, null, null)",
                          "send_search_result(connection, operation, 0, null, null, 1)"));
  EXPECT_THAT(plain_results(), IsEmpty());
}

TEST_F(Search, HandsTheResponseControlOn) {
  aux.attach_response_control = 1;
  pb.put(parameter::search_response_control, static_cast<const void*>(&control));
  EXPECT_EQ(search(), 0);
  EXPECT_THAT(platform.calls({"send_search_entry"}).front(), testing::EndsWith("control)"));
}

TEST_F(Search, HoldsTheLockFromOpeningToTheEnd) {
  bool at_search = false;
  bool at_send = false;
  platform.at("cfg_search_s", 1, [&] { at_search = locked(); });
  platform.at("send_search_result", 1, [&] { at_send = locked(); });
  EXPECT_EQ(search(), 0);
  EXPECT_TRUE(at_search);
  EXPECT_TRUE(at_send);
  EXPECT_FALSE(locked());
}

TEST_F(Search, StepsComeInTheirOrder) {
  EXPECT_EQ(search(), 0);
  EXPECT_THAT(
      platform.calls({"pthread_mutex_lock", "pthread_mutex_unlock", "cfg_bind_s",
                      "xlate_utf8_to_localcp", "cfg_search_s", "send_search_result", "cfg_unbind"}),
      ElementsAre("pthread_mutex_lock(configMutex)", "cfg_bind_s(session, null, null, 128)",
                  "xlate_utf8_to_localcp(\"CN=K\xC3\xA4SE\")",
                  "xlate_utf8_to_localcp(\"(cn=k\xC3\xA4se)\")",
                  testing::StartsWith("cfg_search_s("), testing::StartsWith("send_search_result("),
                  "cfg_unbind(session)", "pthread_mutex_unlock(configMutex)"));
}

TEST_F(Search, SlotIsEmptyWhenTheLockIsReleased) {
  bool empty = false;
  const auto look = [&] { empty = connection.config_session == nullptr; };
  platform.at("pthread_mutex_unlock", 1, look);
  EXPECT_EQ(search(), 0);
  EXPECT_TRUE(empty);

  platform.forget();
  platform.at("pthread_mutex_unlock", 1, look);
  platform.fail("cfg_bind_s", 1, 1);
  empty = false;
  EXPECT_EQ(search(), 1);
  EXPECT_TRUE(empty);

  open_session();
  platform.at("pthread_mutex_unlock", 1, look);
  as(0x24);
  empty = false;
  EXPECT_EQ(search(), 50);
  EXPECT_TRUE(empty);
}

TEST_F(Search, ResultOfTheEntriesIsTheResultOfTheSearch) {
  platform.fail("send_search_entry", 1, 3);
  EXPECT_EQ(search(), 3);
  expect_rest();
}

// A real mutex that knows its owner. The second thread would hang if the first had kept the lock,
// and the lock could not be released by a thread that does not hold it.
TEST_F(Search, ThreadsWithConnectionsOfTheirOwnFollowEachOtherOnARealMutex) {
  platform.real_mutexes = true;
  pthread_mutexattr_t attributes_of_mutex;
  pthread_mutexattr_init(&attributes_of_mutex);
  pthread_mutexattr_settype(&attributes_of_mutex, PTHREAD_MUTEX_ERRORCHECK);
  pthread_mutex_init(&state.configMutex, &attributes_of_mutex);
  pthread_mutexattr_destroy(&attributes_of_mutex);

  int held_by_another = 0;
  platform.at("cfg_search_s", 0, [&] {
    std::thread([&] {
      held_by_another += pthread_mutex_trylock(&state.configMutex) == EBUSY;
    }).join();
  });
  Connection connections[2];
  for (Connection& own : connections) {
    scripted::connect(own);
    pb.put(parameter::connection, &own);
    int rc = -1;
    std::thread([&] { rc = search(); }).join();
    EXPECT_EQ(rc, 0);
    EXPECT_EQ(own.config_session, nullptr);
  }
  EXPECT_EQ(held_by_another, 2);
  EXPECT_EQ(platform.sent.size(), 2U);
  EXPECT_THAT(platform.debug_lines(), Not(Contains(info("Could not unlock config mutex\n"))));
  EXPECT_EQ(pthread_mutex_trylock(&state.configMutex), 0);
  pthread_mutex_unlock(&state.configMutex);
  pthread_mutex_destroy(&state.configMutex);
}

// ---- Clients who are gone

TEST_F(Search, ClientWhoIsGoneHearsNothingAndNoLockIsTouched) {
  connection.state = 0;
  for (const unsigned char flag : std::initializer_list<unsigned char>{1, 2, 255}) {
    platform.forget();
    aux.client_gone = flag;
    EXPECT_EQ(search(), 0);
    EXPECT_THAT(platform.calls(), ElementsAre("slapi_pblock_get(130)", "slapi_pblock_get(131)"));
  }
}

TEST_F(Search, EveryStateButZeroIsAnOpenConnection) {
  aux.client_gone = 1;
  for (const std::uint16_t open : std::initializer_list<std::uint16_t>{2, 0x0100, 0xFFFF}) {
    platform.forget();
    connection.state = open;
    EXPECT_EQ(search(), 0);
    EXPECT_EQ(platform.count("send_search_result"), 1) << open;
  }
}

TEST_F(Search, ClientWhoIsGoneIsNoticedBeforeAuthority) {
  connection.state = 0;
  aux.client_gone = 1;
  as(0x24);
  EXPECT_EQ(search(), 0);
}

TEST_F(Search, SilenceNeedsStateAndRecordAndFlagTogether) {
  connection.state = 0;
  EXPECT_EQ(search(), 0);
  EXPECT_EQ(platform.count("send_search_result"), 1);
  connection.state = 1;
  aux.client_gone = 1;
  EXPECT_EQ(search(), 0);
  EXPECT_EQ(platform.count("send_search_result"), 2);
  connection.state = 0;
  connection.aux = nullptr;
  EXPECT_EQ(search(), 0);
  EXPECT_EQ(platform.count("send_search_result"), 3);
}

// ---- Refusals and failures

TEST_F(Search, RefusalSendsTheCodeWithAnEmptyTextAndOpensNoSession) {
  as(0x24);
  EXPECT_EQ(search(), 50);
  EXPECT_THAT(plain_results(),
              ElementsAre("send_ldap_result(connection, operation, 50, null, \"\")"));
  EXPECT_EQ(platform.count("pthread_mutex_lock"), 0);
  EXPECT_EQ(platform.count("cfg_search_s"), 0);
  EXPECT_EQ(platform.count("xlate_utf8_to_localcp"), 0);
  EXPECT_EQ(platform.count("send_search_result"), 0);
}

TEST_F(Search, RefusalReleasesALockThatItNeverTook) {
  as(0x24);
  EXPECT_EQ(search(), 50);
  EXPECT_EQ(platform.count("pthread_mutex_unlock"), 1);
  EXPECT_EQ(platform.unlocks_of_free_mutexes(), 1);
  EXPECT_EQ(platform.calls({"cfg_unbind"}), std::vector<std::string>{"cfg_unbind(null)"});
  expect_rest();
}

TEST_F(Search, RefusedSearchBringsALeftSessionBackToRest) {
  platform.fail("cfg_bind_s", 1, 1);
  platform.run([&] { return init_cfg_ld(&connection, &state); });
  ASSERT_TRUE(locked());
  platform.forget();
  as(0x24);
  EXPECT_EQ(search(), 50);
  EXPECT_EQ(platform.calls({"cfg_unbind"}), std::vector<std::string>{"cfg_unbind(session)"});
  expect_rest();
}

TEST_F(Search, UnmarkedCallerOnServerOfKindThreeGets32) {
  g_srvType = 3;
  EXPECT_EQ(search(), 32);
  EXPECT_THAT(plain_results(),
              ElementsAre("send_ldap_result(connection, operation, 32, null, \"\")"));
  expect_rest();
}

TEST_F(Search, LockFailureIsSentAndStillReleases) {
  platform.fail("pthread_mutex_lock", 1, 22);
  EXPECT_EQ(search(), 80);
  EXPECT_THAT(plain_results(),
              ElementsAre("send_ldap_result(connection, operation, 80, null, \"\")"));
  expect_no_file_search();
  expect_rest();
}

TEST_F(Search, FailedBindIsSentAsOneAndLeavesNothing) {
  platform.fail("cfg_bind_s", 1, 90);
  EXPECT_EQ(search(), 1);
  EXPECT_THAT(plain_results(),
              ElementsAre("send_ldap_result(connection, operation, 1, null, \"\")"));
  EXPECT_EQ(platform.calls({"cfg_unbind"}), std::vector<std::string>{"cfg_unbind(session)"});
  expect_no_file_search();
  expect_rest();
}

TEST_F(Search, NullHandleIsSentAs90AndReleasesTheLock) {
  platform.fail("cfg_init", 1, 0);
  EXPECT_EQ(search(), 90);
  EXPECT_THAT(plain_results(),
              ElementsAre("send_ldap_result(connection, operation, 90, null, \"\")"));
  expect_no_file_search();
  expect_rest();
}

TEST_F(Search, ExceptionOfTheLibraryIsSentAsOne) {
  platform.at("cfg_init", 1, [] { throw 1; });
  EXPECT_EQ(search(), 1);
  EXPECT_THAT(plain_results(),
              ElementsAre("send_ldap_result(connection, operation, 1, null, \"\")"));
  expect_no_file_search();
  expect_rest();
}

TEST_F(Search, BaseThatCannotBeConvertedEndsBeforeTheFilter) {
  platform.fail("xlate_utf8_to_localcp", 1, 21);
  EXPECT_EQ(search(), 21);
  EXPECT_EQ(platform.count("xlate_utf8_to_localcp"), 1);
  EXPECT_EQ(platform.count("cfg_search_s"), 0);
  EXPECT_THAT(plain_results(),
              ElementsAre("send_ldap_result(connection, operation, 21, null, \"\")"));
  expect_rest();
}

TEST_F(Search, FilterThatCannotBeConvertedEndsBeforeTheSearch) {
  platform.fail("xlate_utf8_to_localcp", 2, 21);
  EXPECT_EQ(search(), 21);
  EXPECT_EQ(platform.count("cfg_search_s"), 0);
  EXPECT_THAT(plain_results(),
              ElementsAre("send_ldap_result(connection, operation, 21, null, \"\")"));
  expect_rest();
}

TEST_F(Search, FailedFileSearchIsSentWithItsCode) {
  for (const int code : {3, 18, 32, 34}) {
    platform.forget();
    platform.fail("cfg_search_s", 1, code);
    EXPECT_EQ(search(), code);
    EXPECT_THAT(plain_results(), ElementsAre("send_ldap_result(connection, operation, " +
                                             std::to_string(code) + ", null, \"\")"));
    EXPECT_EQ(platform.count("send_search_result"), 0);
    expect_rest();
  }
}

TEST_F(Search, ResultOfThePlainResultIsNotLookedAt) {
  as(0x24);
  platform.fail("send_ldap_result", 1, 80);
  EXPECT_EQ(search(), 50);
}

TEST_F(Search, ResultsOfUnbindAndUnlockAreNotLookedAt) {
  platform.fail("cfg_unbind", 1, 1);
  platform.fail("pthread_mutex_unlock", 1, 1);
  EXPECT_EQ(search(), 0);
  EXPECT_EQ(platform.debug_lines().back(), info("Could not unlock config mutex\n"));
}

TEST_F(Search, TracesTheBlockOnEntryAndTheResultOnExit) {
  trcEvents = kTraceEntry;
  as(0x24);
  EXPECT_EQ(search(), 50);
  char entry[64];
  std::snprintf(entry, sizeof entry, "entry 01040100 pb=0x%p", static_cast<void*>(&pb));
  const auto records = platform.records();
  EXPECT_EQ(records.front(), entry);
  EXPECT_EQ(records[1], "entry 01040200 ");
  EXPECT_EQ(records[2], "exit 01040200 50");
  EXPECT_EQ(records.back(), "exit 01040100 50");
}

}  // namespace
}  // namespace orv
