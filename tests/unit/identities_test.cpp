// The administrators' identities, as they are read from the file.
#include "backend_test.h"
#include "config_add.h"

namespace orv {
namespace {

constexpr const char* kConfiguration = "CN=CONFIGURATION";
constexpr const char* kKerberos = "CN=KERBEROS,CN=CONFIGURATION";
constexpr const char* kDigest = "CN=DIGEST,CN=CONFIGURATION";
constexpr const char* kMember = "CN=ONE,CN=ADMINGROUP,CN=CONFIGURATION";

class Identities : public BackendTest {
 protected:
  Identities() { session = open_session(); }
  void TearDown() override {
    close_session();
    BackendTest::TearDown();
  }

  void file(const char* dn, std::vector<scripted::ScriptedAttribute> attributes) {
    platform.file[dn] = {{{dn, std::move(attributes)}}};
  }

  // Runs a look-up; "null" when it finds nothing.
  template <typename Function>
  std::string looked_up(Function function) {
    const Freed found(platform.run(function));
    return found.text == nullptr ? "null" : found.text;
  }
  std::string admin_dn() {
    return looked_up([&] { return getAdminDN(session); });
  }
  std::string kerberos_id() {
    return looked_up([&] { return getAdminKerberosID(session); });
  }
  std::string digest_user() {
    return looked_up([&] { return getAdminDigestUserName(session); });
  }
  std::string member_dn() {
    return looked_up([&] { return getAdminGroupMemberDn(&connection, kMember); });
  }

  void expect_released_and_free_of_locks() {
    EXPECT_THAT(platform.leaks(), ElementsAre("session"));
    EXPECT_EQ(platform.count("pthread_mutex_lock"), 0);
  }

  // `code` is what the library says of the first entry: an error, or that there is none.
  void expect_report_of_a_member_not_taken(int code) {
    platform.forget();
    file(kMember, {{"orv-slapdAdminDN", {"CN=M"}}});
    platform.fail("cfg_first_entry", 1, code);
    EXPECT_EQ(member_dn(), "null");
    EXPECT_THAT(platform.calls({"cfg_perror"}),
                ElementsAre("cfg_perror(session, \"cfg_first_entry\")"));
  }

  [[nodiscard]] DebugLine last_line() const { return platform.debug_lines().back(); }

  _CFG* session;
};

// ---- What is read, and its form

TEST_F(Identities, AdminDnIsReadFromConfigurationAndNormalised) {
  file(kConfiguration, {{"orv-slapdAdminDN", {"cn = root , o=orv"}}});
  EXPECT_EQ(admin_dn(), "CN=ROOT,O=ORV");
  EXPECT_THAT(platform.calls({"cfg_search_s", "replace_DN"}),
              ElementsAre("cfg_search_s(session, \"CN=CONFIGURATION\", 0, \"objectclass=*\", null, "
                          "0)",
                          "replace_DN(\"cn = root , o=orv\", 1)"));
  expect_released_and_free_of_locks();
}

TEST_F(Identities, AdminDnIsConvertedFromTheLocalCodePage) {
  file(kConfiguration, {{"orv-slapdAdminDN", {"CN=K\xE4SE"}}});
  EXPECT_EQ(admin_dn(), "CN=K\xC3\xA4SE");
}

TEST_F(Identities, KerberosIdentityIsReadFromKerberosInTheLightForm) {
  file(kKerberos, {{"orv-slapdKrbAdminDN", {"orv-kn = admin@REALM"}}});
  EXPECT_EQ(kerberos_id(), "orv-kn=admin@REALM");
  EXPECT_THAT(
      platform.calls({"cfg_search_s", "dn_normalize_light_esc", "free_ldap_escDN", "replace_DN"}),
      ElementsAre("cfg_search_s(session, \"CN=KERBEROS,CN=CONFIGURATION\", 0, "
                  "\"objectclass=*\", null, 0)",
                  "dn_normalize_light_esc(\"orv-kn = admin@REALM\")",
                  "free_ldap_escDN(escaped DN)"));
  expect_released_and_free_of_locks();
}

TEST_F(Identities, KerberosIdentityIsCopiedBetweenTheReleasesOfItsRawAndLightForms) {
  file(kKerberos, {{"orv-slapdKrbAdminDN", {"orv-kn = admin@REALM"}}});
  platform.name_allocation_in("xlate_localcp_to_utf8", 1, "raw");
  EXPECT_EQ(kerberos_id(), "orv-kn=admin@REALM");
  EXPECT_THAT(platform.calls({"dn_normalize_light_esc", "free", "free_ldap_escDN"}),
              ElementsAre("dn_normalize_light_esc(\"orv-kn = admin@REALM\")", "free(raw)",
                          "free_ldap_escDN(escaped DN)"));
}

TEST_F(Identities, DigestUserIsReadFromDigestAsStored) {
  file(kDigest, {{"orv-slapdDigestAdminUser", {" Admin "}}});
  EXPECT_EQ(digest_user(), " Admin ");
  EXPECT_THAT(platform.calls({"cfg_search_s", "dn_normalize_light_esc", "replace_DN"}),
              ElementsAre("cfg_search_s(session, \"CN=DIGEST,CN=CONFIGURATION\", 0, "
                          "\"objectclass=*\", null, 0)"));
  expect_released_and_free_of_locks();
}

TEST_F(Identities, MemberDnIsReadFromTheMembersEntryAndNormalised) {
  file(kMember, {{"orv-slapdAdminDN", {"cn=one, o=orv"}}});
  EXPECT_EQ(member_dn(), "CN=ONE,O=ORV");
  EXPECT_THAT(platform.calls({"cfg_search_s", "cfg_count_entries", "cfg_first_entry"}),
              ElementsAre("cfg_search_s(session, \"CN=ONE,CN=ADMINGROUP,CN=CONFIGURATION\", 0, "
                          "\"objectclass=*\", null, 0)",
                          "cfg_count_entries(session, chain)", "cfg_first_entry(session, chain)"));
  expect_released_and_free_of_locks();
}

TEST_F(Identities, AttributeNamesMatchInAnyLetterCase) {
  file(kConfiguration, {{"ORV-SLAPDADMINDN", {"CN=A"}}});
  file(kKerberos, {{"orv-slapdkrbadmindn", {"CN=B"}}});
  file(kDigest, {{"Orv-SlapdDigestAdminUser", {"C"}}});
  file(kMember, {{"orv-slapdADMINdn", {"CN=D"}}});
  EXPECT_EQ(admin_dn() + kerberos_id() + digest_user() + member_dn(), "CN=ACN=BCCN=D");
}

TEST_F(Identities, AttributeNamesMatchAsAWhole) {
  file(kConfiguration, {{"orv-slapdAdminDNX", {"CN=X", "CN=Z"}},
                        {"orv-slapdAdminD", {"CN=Y"}},
                        {"orv-slapdAdminPWX", {"shown"}},
                        {"orv-slapdAdminP", {"this too"}}});
  file(kKerberos, {{"orv-slapdKrbAdminDNX", {"CN=X"}}, {"orv-slapdKrbAdminD", {"CN=Y"}}});
  file(kDigest, {{"orv-slapdDigestAdminUserX", {"x"}}, {"orv-slapdDigestAdminUse", {"y"}}});
  file(kMember, {{"orv-slapdAdminDNX", {"CN=X"}}, {"orv-slapdAdminD", {"CN=Y"}}});
  EXPECT_EQ(admin_dn(), "null");
  EXPECT_EQ(last_line(), error("Retrieving orv-slapdAdminDN FAILED rc = 0\n"));
  EXPECT_THAT(platform.debug_lines(), Not(Contains(error("Error: more then one admin DN "))));
  EXPECT_THAT(platform.debug_lines(), Contains(detail("orv-slapdAdminPWX: shown\n")));
  EXPECT_THAT(platform.debug_lines(), Contains(detail("orv-slapdAdminP: this too\n")));
  EXPECT_EQ(kerberos_id(), "null");
  EXPECT_EQ(last_line(), error("Retrieving orv-slapdKrbAdminDN FAILED rc = 0\n"));
  EXPECT_EQ(digest_user(), "null");
  EXPECT_EQ(last_line(), error("Retrieving orv-slapdDigestAdminUser FAILED rc = 0\n"));
  EXPECT_EQ(member_dn(), "null");
}

TEST_F(Identities, WalkReadsAndReleasesInOrder) {
  file(kConfiguration, {{"cn", {"x"}}, {"orv-slapdAdminDN", {"CN=A"}}, {"sn", {"y"}}});
  EXPECT_EQ(admin_dn(), "CN=A");
  EXPECT_THAT(platform.calls({"cfg_first_entry", "cfg_get_dn", "cfg_first_attribute",
                              "cfg_next_attribute", "cfg_get_values", "cfg_memfree", "cfg_ber_free",
                              "cfg_msgfree", "cfg_value_free"}),
              ElementsAre("cfg_first_entry(session, chain)", "cfg_get_dn(session, record 1)",
                          "cfg_first_attribute(session, record 1)",
                          "cfg_get_values(session, record 1, \"cn\")", "cfg_memfree(\"cn\")",
                          "cfg_next_attribute(session, record 1, cursor)",
                          "cfg_get_values(session, record 1, \"orv-slapdAdminDN\")",
                          "cfg_memfree(\"orv-slapdAdminDN\")",
                          "cfg_next_attribute(session, record 1, cursor)",
                          "cfg_get_values(session, record 1, \"sn\")", "cfg_memfree(\"sn\")",
                          "cfg_next_attribute(session, record 1, cursor)", "cfg_ber_free(cursor)",
                          "cfg_msgfree(chain)", "cfg_memfree(\"CN=CONFIGURATION\")"));
}

// Allocations before the values: search, DN, attribute name.
TEST_F(Identities, ValuesAreReleasedAfterTheWalkHasAdvanced) {
  file(kConfiguration, {{"orv-slapdAdminDN", {"CN=A"}}});
  platform.name_allocation(4, "values");
  EXPECT_EQ(admin_dn(), "CN=A");
  EXPECT_THAT(platform.calls({"cfg_get_values", "cfg_memfree", "cfg_next_attribute", "free"}),
              ElementsAre("cfg_get_values(session, record 1, \"orv-slapdAdminDN\")",
                          "cfg_memfree(\"orv-slapdAdminDN\")",
                          "cfg_next_attribute(session, record 1, cursor)", "free(one of values)",
                          "free(values)", "cfg_memfree(\"CN=CONFIGURATION\")"));
}

// The values that were being visited go after the line of the step that failed.
TEST_F(Identities, IdentityThatIsDiscardedIsReleasedAfterItsLine) {
  file(kConfiguration, {{"orv-slapdAdminDN", {"CN=A"}}, {"cn", {"x"}}});
  platform.name_allocation(4, "values");
  platform.name_allocation_in("replace_DN", 1, "made");
  platform.fail("cfg_next_attribute", 1, 80);
  EXPECT_EQ(admin_dn(), "null");
  const std::vector<std::string> story =
      platform.story({"cfg_ber_free", "cfg_msgfree", "cfg_memfree", "free"});
  ASSERT_GT(story.size(), 8U);
  EXPECT_THAT(
      std::vector<std::string>(story.end() - 8, story.end()),
      ElementsAre("debug: cfg_first_attribute error ! \n", "free(one of values)", "free(values)",
                  "cfg_ber_free(cursor)", "cfg_msgfree(chain)", "cfg_memfree(\"CN=CONFIGURATION\")",
                  "debug: Retrieving orv-slapdAdminDN FAILED rc = 1\n", "free(made)"));
}

// ---- Several values, no value

TEST_F(Identities, SecondAdminDnFailsTheLookup) {
  file(kConfiguration, {{"orv-slapdAdminDN", {"CN=A", "CN=B"}}});
  EXPECT_EQ(admin_dn(), "null");
  EXPECT_THAT(platform.debug_lines(),
              ElementsAre(detail("Retrieving values for attribute orv-slapdAdminDN ! \n"),
                          detail("orv-slapdAdminDN: CN=A\n"), detail("orv-slapdAdminDN: CN=B\n"),
                          error("Error: more then one admin DN "),
                          error("Retrieving orv-slapdAdminDN FAILED rc = 1\n")));
  EXPECT_EQ(platform.count("xlate_localcp_to_utf8"), 0);
}

TEST_F(Identities, OthersTakeTheFirstOfSeveralValues) {
  file(kKerberos, {{"orv-slapdKrbAdminDN", {"CN=A", "CN=B"}}});
  file(kDigest, {{"orv-slapdDigestAdminUser", {"a", "b"}}});
  file(kMember, {{"orv-slapdAdminDN", {"CN=C", "CN=D"}}});
  EXPECT_EQ(kerberos_id(), "CN=A");
  EXPECT_EQ(digest_user(), "a");
  EXPECT_EQ(member_dn(), "CN=C");
  EXPECT_THAT(platform.debug_lines(), Not(Contains(error("Error: more then one admin DN "))));
}

TEST_F(Identities, AbsentAttributeGivesNullWithCodeZero) {
  for (const char* dn : {kConfiguration, kKerberos, kDigest, kMember}) file(dn, {{"cn", {"x"}}});
  EXPECT_EQ(admin_dn(), "null");
  EXPECT_EQ(last_line(), error("Retrieving orv-slapdAdminDN FAILED rc = 0\n"));
  EXPECT_EQ(kerberos_id(), "null");
  EXPECT_EQ(last_line(), error("Retrieving orv-slapdKrbAdminDN FAILED rc = 0\n"));
  EXPECT_EQ(digest_user(), "null");
  EXPECT_EQ(last_line(), error("Retrieving orv-slapdDigestAdminUser FAILED rc = 0\n"));
  platform.forget();
  EXPECT_EQ(member_dn(), "null");
  EXPECT_THAT(platform.debug_lines(),
              ElementsAre(detail("Retrieving values for attribute cn ! \n"), detail("cn: x\n")));
}

TEST_F(Identities, AttributeWithoutValuesGivesNull) {
  for (const char* dn : {kConfiguration, kMember}) file(dn, {{"orv-slapdAdminDN", {}}});
  EXPECT_EQ(admin_dn(), "null");
  EXPECT_EQ(last_line(), error("Retrieving orv-slapdAdminDN FAILED rc = 0\n"));
  EXPECT_EQ(member_dn(), "null");
}

TEST_F(Identities, ValuesThatAreNullWithoutAnErrorGiveNull) {
  file(kConfiguration, {{"orv-slapdAdminDN", {"CN=A"}}});
  platform.fail("cfg_get_values", 1, 0);
  EXPECT_EQ(admin_dn(), "null");
  EXPECT_EQ(last_line(), error("Retrieving orv-slapdAdminDN FAILED rc = 0\n"));
}

TEST_F(Identities, EntryFoundWithoutARecordGivesNull) {
  platform.file[kConfiguration] = {};
  EXPECT_EQ(admin_dn(), "null");
  EXPECT_EQ(platform.count("cfg_get_dn"), 0);
  EXPECT_THAT(platform.calls({"cfg_first_attribute", "cfg_next_attribute"}),
              ElementsAre("cfg_first_attribute(session, null)"));
  EXPECT_THAT(platform.debug_lines(),
              ElementsAre(error("cfg_first_attribute error ! \n"),
                          error("Retrieving orv-slapdAdminDN FAILED rc = 1\n")));
}

TEST_F(Identities, ValueWithoutAConversionGivesNullWithCodeZero) {
  file(kConfiguration, {{"orv-slapdAdminDN", {"CN=A"}}});
  file(kKerberos, {{"orv-slapdKrbAdminDN", {"CN=A"}}});
  file(kDigest, {{"orv-slapdDigestAdminUser", {"a"}}});
  file(kMember, {{"orv-slapdAdminDN", {"CN=A"}}});
  platform.fail("xlate_localcp_to_utf8", 0, 0);
  EXPECT_EQ(admin_dn(), "null");
  EXPECT_EQ(last_line(), error("Retrieving orv-slapdAdminDN FAILED rc = 0\n"));
  EXPECT_EQ(kerberos_id(), "null");
  EXPECT_EQ(last_line(), error("Retrieving orv-slapdKrbAdminDN FAILED rc = 0\n"));
  EXPECT_EQ(digest_user(), "null");
  EXPECT_EQ(last_line(), error("Retrieving orv-slapdDigestAdminUser FAILED rc = 0\n"));
  EXPECT_EQ(member_dn(), "null");
  EXPECT_EQ(last_line(), detail("orv-slapdAdminDN: CN=A\n"));
  EXPECT_EQ(platform.count("replace_DN"), 0);
  EXPECT_EQ(platform.count("dn_normalize_light_esc"), 0);
}

// ---- Failures

TEST_F(Identities, FailedSearchGivesNullAndItsCode) {
  EXPECT_EQ(digest_user(), "null");
  EXPECT_THAT(platform.debug_lines(),
              ElementsAre(error("Retrieving orv-slapdDigestAdminUser FAILED rc = 32\n")));
  platform.fail("cfg_search_s", 2, 3);
  EXPECT_EQ(admin_dn(), "null");
  EXPECT_EQ(last_line(), error("Retrieving orv-slapdAdminDN FAILED rc = 3\n"));
  platform.fail("cfg_search_s", 3, 80);
  EXPECT_EQ(kerberos_id(), "null");
  EXPECT_EQ(last_line(), error("Retrieving orv-slapdKrbAdminDN FAILED rc = 80\n"));

  platform.forget();
  platform.fail("cfg_search_s", 1, -1);
  EXPECT_EQ(admin_dn(), "null");
  EXPECT_THAT(platform.debug_lines(),
              ElementsAre(error("Retrieving orv-slapdAdminDN FAILED rc = -1\n")));
}

TEST_F(Identities, EntryWhoseDnCannotBeReadGives90) {
  file(kConfiguration, {{"orv-slapdAdminDN", {"CN=A"}}});
  platform.fail("cfg_get_dn", 1, 0);
  EXPECT_EQ(admin_dn(), "null");
  EXPECT_THAT(platform.debug_lines(),
              ElementsAre(error("Retrieving orv-slapdAdminDN FAILED rc = 90\n")));
}

TEST_F(Identities, ErrorAtTheFirstAttributeGives1) {
  file(kConfiguration, {{"orv-slapdAdminDN", {"CN=A"}}});
  platform.fail("cfg_first_attribute", 1, 80);
  EXPECT_EQ(admin_dn(), "null");
  EXPECT_THAT(platform.debug_lines(),
              ElementsAre(error("cfg_first_attribute error ! \n"),
                          error("Retrieving orv-slapdAdminDN FAILED rc = 1\n")));
}

TEST_F(Identities, ErrorAtTheNextAttributeGives1UnderTheSameText) {
  file(kDigest, {{"orv-slapdDigestAdminUser", {"a"}}, {"cn", {"x"}}});
  platform.fail("cfg_next_attribute", 1, 80);
  EXPECT_EQ(digest_user(), "null");
  EXPECT_THAT(
      platform.debug_lines(),
      ElementsAre(detail("Retrieving values for attribute orv-slapdDigestAdminUser ! \n"),
                  detail("orv-slapdDigestAdminUser: a\n"), error("cfg_first_attribute error ! \n"),
                  error("Retrieving orv-slapdDigestAdminUser FAILED rc = 1\n")));
}

TEST_F(Identities, ErrorAtTheValuesGives1AndEndsTheWalk) {
  file(kKerberos, {{"cn", {"x"}}, {"orv-slapdKrbAdminDN", {"CN=A"}}});
  platform.fail("cfg_get_values", 1, 80);
  EXPECT_EQ(kerberos_id(), "null");
  EXPECT_THAT(platform.debug_lines(),
              ElementsAre(detail("Retrieving values for attribute cn ! \n"),
                          error("Problems retrieving values for cn ! \n"),
                          error("Retrieving orv-slapdKrbAdminDN FAILED rc = 1\n")));
  EXPECT_EQ(platform.count("cfg_get_values"), 1);
  EXPECT_EQ(platform.count("cfg_next_attribute"), 1);
}

// Error numbers asked for: after the first attribute, its values, the next attribute.
TEST_F(Identities, ErrorNumberCountsThoughSomethingCame) {
  file(kConfiguration, {{"orv-slapdAdminDN", {"CN=A"}}, {"cn", {"x"}}});
  const DebugLine asked = detail("Retrieving values for attribute orv-slapdAdminDN ! \n");
  const DebugLine failed = error("Retrieving orv-slapdAdminDN FAILED rc = 1\n");

  platform.fail("cfg_get_errno", 1, 80);
  EXPECT_EQ(admin_dn(), "null");
  EXPECT_THAT(platform.debug_lines(), ElementsAre(error("cfg_first_attribute error ! \n"), failed));

  platform.forget();
  platform.fail("cfg_get_errno", 2, 80);
  EXPECT_EQ(admin_dn(), "null");
  EXPECT_THAT(
      platform.debug_lines(),
      ElementsAre(asked, error("Problems retrieving values for orv-slapdAdminDN ! \n"), failed));

  platform.forget();
  platform.fail("cfg_get_errno", 3, 80);
  EXPECT_EQ(admin_dn(), "null");
  EXPECT_THAT(platform.debug_lines(), ElementsAre(asked, detail("orv-slapdAdminDN: CN=A\n"),
                                                  error("cfg_first_attribute error ! \n"), failed));
  expect_released_and_free_of_locks();
}

TEST_F(Identities, WalkAdvancesOnceAfterAFailureAndEnds) {
  file(kConfiguration, {{"orv-slapdAdminDN", {"CN=A", "CN=B"}}, {"cn", {"x"}}});
  EXPECT_EQ(admin_dn(), "null");
  EXPECT_EQ(platform.count("cfg_next_attribute"), 1);
  EXPECT_EQ(platform.count("cfg_get_values"), 1);
  expect_released_and_free_of_locks();
}

TEST_F(Identities, ErrorOfTheAdvanceAfterAFailureIsTheCode) {
  file(kDigest, {{"orv-slapdDigestAdminUser", {"a"}}, {"cn", {"x"}}});
  platform.fail("xlate_localcp_to_utf8", 1, 21);
  platform.fail("cfg_next_attribute", 1, 80);
  EXPECT_EQ(digest_user(), "null");
  EXPECT_EQ(platform.count("cfg_next_attribute"), 1);
  EXPECT_THAT(
      platform.debug_lines(),
      ElementsAre(detail("Retrieving values for attribute orv-slapdDigestAdminUser ! \n"),
                  detail("orv-slapdDigestAdminUser: a\n"), error("cfg_first_attribute error ! \n"),
                  error("Retrieving orv-slapdDigestAdminUser FAILED rc = 1\n")));
}

TEST_F(Identities, FailedConversionGivesNull) {
  file(kConfiguration, {{"orv-slapdAdminDN", {"CN=A"}}});
  platform.fail("xlate_localcp_to_utf8", 1, 21);
  EXPECT_EQ(admin_dn(), "null");
  EXPECT_EQ(last_line(), error("Retrieving orv-slapdAdminDN FAILED rc = 21\n"));
  EXPECT_EQ(platform.count("replace_DN"), 0);
}

TEST_F(Identities, TextOfAFailedConversionIsNotUsed) {
  file(kConfiguration, {{"orv-slapdAdminDN", {"CN=A"}}});
  file(kKerberos, {{"orv-slapdKrbAdminDN", {"CN=A"}}});
  file(kDigest, {{"orv-slapdDigestAdminUser", {"a"}}});
  file(kMember, {{"orv-slapdAdminDN", {"CN=A"}}});
  platform.failed_text_is_left = true;
  platform.fail("xlate_localcp_to_utf8", 0, 21);
  EXPECT_EQ(admin_dn(), "null");
  EXPECT_EQ(last_line(), error("Retrieving orv-slapdAdminDN FAILED rc = 21\n"));
  EXPECT_EQ(kerberos_id(), "null");
  EXPECT_EQ(last_line(), error("Retrieving orv-slapdKrbAdminDN FAILED rc = 21\n"));
  EXPECT_EQ(digest_user(), "null");
  EXPECT_EQ(last_line(), error("Retrieving orv-slapdDigestAdminUser FAILED rc = 21\n"));
  EXPECT_EQ(member_dn(), "null");
  EXPECT_EQ(platform.count("replace_DN"), 0);
  EXPECT_EQ(platform.count("dn_normalize_light_esc"), 0);
  expect_released_and_free_of_locks();
}

TEST_F(Identities, FailedNormalisationGivesNullAndItsCode) {
  file(kConfiguration, {{"orv-slapdAdminDN", {"CN=A"}}});
  platform.fail("replace_DN", 1, 34);
  EXPECT_EQ(admin_dn(), "null");
  EXPECT_EQ(last_line(), error("Retrieving orv-slapdAdminDN FAILED rc = 34\n"));
}

TEST_F(Identities, KerberosRecordThatCannotBeMadeGives90) {
  file(kKerberos, {{"orv-slapdKrbAdminDN", {"CN=A"}}});
  platform.fail("dn_normalize_light_esc", 1, 0);
  EXPECT_EQ(kerberos_id(), "null");
  EXPECT_EQ(last_line(), error("Retrieving orv-slapdKrbAdminDN FAILED rc = 90\n"));
}

TEST_F(Identities, ErrorInTheKerberosRecordIsTheCode) {
  file(kKerberos, {{"orv-slapdKrbAdminDN", {"CN=A"}}});
  platform.fail("dn_normalize_light_esc", 1, 34);
  EXPECT_EQ(kerberos_id(), "null");
  EXPECT_EQ(last_line(), error("Retrieving orv-slapdKrbAdminDN FAILED rc = 34\n"));
  EXPECT_EQ(platform.count("free_ldap_escDN"), 1);
}

TEST_F(Identities, KerberosCopyThatCannotBeMadeGives90) {
  file(kKerberos, {{"orv-slapdKrbAdminDN", {"CN=A"}}});
  // After search, DN, name, values, conversion and record.
  platform.fail_allocation(7);
  EXPECT_EQ(kerberos_id(), "null");
  EXPECT_EQ(last_line(), error("Retrieving orv-slapdKrbAdminDN FAILED rc = 90\n"));
}

TEST_F(Identities, FailedConversionOfKerberosAndDigestGivesNull) {
  file(kKerberos, {{"orv-slapdKrbAdminDN", {"CN=A"}}});
  file(kDigest, {{"orv-slapdDigestAdminUser", {"a"}}});
  platform.fail("xlate_localcp_to_utf8", 0, 21);
  EXPECT_EQ(kerberos_id(), "null");
  EXPECT_EQ(last_line(), error("Retrieving orv-slapdKrbAdminDN FAILED rc = 21\n"));
  EXPECT_EQ(digest_user(), "null");
  EXPECT_EQ(last_line(), error("Retrieving orv-slapdDigestAdminUser FAILED rc = 21\n"));
}

// ---- What is traced

TEST_F(Identities, PasswordsStayOutOfTheTraceOfTheAdminDnOnly) {
  for (const char* dn : {kConfiguration, kKerberos, kDigest, kMember}) {
    file(dn, {{"ORV-slapdAdminPW", {"secret"}}});
  }
  const DebugLine asked = detail("Retrieving values for attribute ORV-slapdAdminPW ! \n");
  const DebugLine value = detail("ORV-slapdAdminPW: secret\n");
  admin_dn();
  EXPECT_THAT(platform.debug_lines(), Contains(asked));
  EXPECT_THAT(platform.debug_lines(), Not(Contains(value)));
  platform.forget();
  kerberos_id();
  EXPECT_THAT(platform.debug_lines(), Contains(value));
  platform.forget();
  digest_user();
  EXPECT_THAT(platform.debug_lines(), Contains(value));
  platform.forget();
  member_dn();
  EXPECT_THAT(platform.debug_lines(), Contains(value));
}

TEST_F(Identities, EveryValueOfEveryAttributeIsTraced) {
  file(kMember, {{"cn", {"a", "b"}}, {"orv-slapdAdminDN", {"CN=M"}}, {"sn", {"c"}}});
  EXPECT_EQ(member_dn(), "CN=M");
  EXPECT_THAT(platform.debug_lines(),
              ElementsAre(detail("Retrieving values for attribute cn ! \n"), detail("cn: a\n"),
                          detail("cn: b\n"),
                          detail("Retrieving values for attribute orv-slapdAdminDN ! \n"),
                          detail("orv-slapdAdminDN: CN=M\n"),
                          detail("Retrieving values for attribute sn ! \n"), detail("sn: c\n")));
}

TEST_F(Identities, NothingIsTracedWhenNotDebugging) {
  debug_off();
  file(kConfiguration, {{"cn", {"x"}}});
  EXPECT_EQ(admin_dn(), "null");
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
}

TEST_F(Identities, ExitRecordsCarryTheStatus) {
  trcEvents = 0x00020000;
  file(kConfiguration, {{"cn", {"x"}}});
  admin_dn();
  kerberos_id();
  digest_user();
  member_dn();
  EXPECT_THAT(platform.records(), ElementsAre("exit 01020200 0", "exit 01020300 32",
                                              "exit 01020400 32", "exit 01020500 32"));
}

// ---- Members

TEST_F(Identities, MembersCursorIsReleasedBeforeItsChain) {
  file(kMember, {{"orv-slapdAdminDN", {"CN=M"}}});
  EXPECT_EQ(member_dn(), "CN=M");
  EXPECT_THAT(platform.calls({"cfg_ber_free", "cfg_msgfree"}),
              ElementsAre("cfg_ber_free(cursor)", "cfg_msgfree(chain)"));
}

TEST_F(Identities, ExitRecordsOfAMemberCarryTheCodesOfLaterFailures) {
  trcEvents = 0x00020000;
  file(kMember, {{"orv-slapdAdminDN", {"CN=M"}}});
  for (const char* function : {"cfg_first_entry", "cfg_get_values", "cfg_first_attribute"}) {
    platform.forget();
    platform.fail(function, 1, 7);
    EXPECT_EQ(member_dn(), "null");
    EXPECT_EQ(last_record(), "exit 01020500 1") << function;
  }
}

TEST_F(Identities, MemberSearchMustFindExactlyOneEntry) {
  EXPECT_EQ(member_dn(), "null");
  platform.file[kMember] = {};
  EXPECT_EQ(member_dn(), "null");
  const ScriptedEntry one{kMember, {{"orv-slapdAdminDN", {"CN=M"}}}};
  platform.file[kMember] = {{one, one}};
  EXPECT_EQ(member_dn(), "null");
  EXPECT_EQ(platform.count("cfg_first_entry"), 0);
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
  expect_released_and_free_of_locks();
}

TEST_F(Identities, MemberSearchThatFailsWithEntriesStillGivesNull) {
  platform.file[kMember] = {{{kMember, {{"orv-slapdAdminDN", {"CN=M"}}}}}, 3};
  EXPECT_EQ(member_dn(), "null");
  expect_released_and_free_of_locks();
}

TEST_F(Identities, MemberWhoseEntryCannotBeTakenIsReported) {
  for (const int code : {1, 0}) {
    expect_report_of_a_member_not_taken(code);
    expect_released_and_free_of_locks();
  }
}

TEST_F(Identities, MemberWhoseEntryCannotBeTakenIsReportedWithoutTheTraceToo) {
  debug_off();
  for (const int code : {1, 0}) {
    expect_report_of_a_member_not_taken(code);
    EXPECT_THAT(platform.debug_lines(), IsEmpty());
  }
}

TEST_F(Identities, MembersEntryThatComesWithAnErrorIsReportedAndNotUsed) {
  file(kMember, {{"orv-slapdAdminDN", {"CN=M"}}});
  platform.fail("cfg_get_errno", 1, 1);
  EXPECT_EQ(member_dn(), "null");
  EXPECT_THAT(platform.calls({"cfg_perror"}),
              ElementsAre("cfg_perror(session, \"cfg_first_entry\")"));
  expect_released_and_free_of_locks();
}

TEST_F(Identities, MemberFoundIsDiscardedByALaterError) {
  file(kMember, {{"orv-slapdAdminDN", {"CN=M"}}, {"cn", {"x"}}});
  platform.fail("cfg_get_values", 2, 1);
  EXPECT_EQ(member_dn(), "null");
  EXPECT_EQ(last_line(), error("Problems retrieving values for cn ! \n"));
  platform.forget();
  platform.fail("cfg_next_attribute", 1, 1);
  EXPECT_EQ(member_dn(), "null");
  EXPECT_EQ(last_line(), error("cfg_first_attribute error ! \n"));
  expect_released_and_free_of_locks();
}

TEST_F(Identities, MemberThatIsDiscardedIsReleasedBeforeItsChain) {
  file(kMember, {{"orv-slapdAdminDN", {"CN=M"}}, {"cn", {"x"}}});
  platform.name_allocation_in("replace_DN", 1, "made");
  platform.fail("cfg_get_values", 2, 1);
  EXPECT_EQ(member_dn(), "null");
  EXPECT_THAT(platform.calls({"free", "cfg_msgfree"}),
              ElementsAre("free(made)", "cfg_msgfree(chain)"));
}

TEST_F(Identities, MemberDnThatCannotBeMadeGivesNullAfterTheWholeWalk) {
  file(kMember, {{"orv-slapdAdminDN", {"CN=M"}}, {"cn", {"x"}}});
  platform.fail("replace_DN", 1, 34);
  EXPECT_EQ(member_dn(), "null");
  EXPECT_EQ(last_line(), detail("cn: x\n"));
  platform.forget();
  platform.fail("xlate_localcp_to_utf8", 1, 21);
  EXPECT_EQ(member_dn(), "null");
  EXPECT_EQ(last_line(), detail("cn: x\n"));
}

TEST_F(Identities, ErrorAtTheMembersFirstAttributeGivesNull) {
  file(kMember, {{"orv-slapdAdminDN", {"CN=M"}}});
  platform.fail("cfg_first_attribute", 1, 1);
  EXPECT_EQ(member_dn(), "null");
  EXPECT_THAT(platform.debug_lines(), ElementsAre(error("cfg_first_attribute error ! \n")));
}

}  // namespace
}  // namespace orv
