// Whether an identity is already taken.
#include "added_entry.h"
#include "config_add.h"
#include "function_ids.h"

namespace orv {
namespace {

using Check = int (*)(_CFG* session, const char* candidate);

std::uint32_t identifier_of(Check check) {
  return check == doesAdminGroupMemberDNExist      ? function_id::does_admin_group_member_dn_exist
         : check == doesReplicationSupplierDNExist ? function_id::does_replication_supplier_dn_exist
         : check == doesKerberosIDExist            ? function_id::does_kerberos_id_exist
         : check == doesDigestUserNameExist        ? function_id::does_digest_user_name_exist
                                                   : function_id::does_proxy_split_name_exist;
}

class Uniqueness : public BackendTest {
 protected:
  Uniqueness() {
    session = open_session();
    administrator({{"orv-slapdAdminDN", {"cn=root"}}});
  }
  void TearDown() override {
    EXPECT_THAT(platform.leaks(), ElementsAre("session"));
    EXPECT_EQ(platform.count("pthread_mutex_lock"), 0);
    close_session();
    BackendTest::TearDown();
  }

  void administrator(Attributes attributes) {
    platform.file[kConfiguration] = {{{kConfiguration, std::move(attributes)}}};
  }
  // What a search at `base` (and with a filter, when it is named) finds: an entry for each list.
  void found(const char* base, const std::vector<Attributes>& entries, int code = 0) {
    Answer answer{{}, code};
    for (const Attributes& attributes : entries) answer.entries.push_back({base, attributes});
    platform.file[base] = answer;
  }

  int run(Check check, const char* candidate) {
    return traced(identifier_of(check), [&] { return check(session, candidate); });
  }
  int member_dn(const char* candidate) { return run(doesAdminGroupMemberDNExist, candidate); }
  int supplier_dn(const char* candidate) { return run(doesReplicationSupplierDNExist, candidate); }
  int kerberos_id(const char* candidate) { return run(doesKerberosIDExist, candidate); }
  int digest_user(const char* candidate) { return run(doesDigestUserNameExist, candidate); }
  int split_name(const char* candidate) { return run(doesProxySplitNameExist, candidate); }

  [[nodiscard]] std::vector<std::string> searches() const {
    return platform.calls({"cfg_search_s"});
  }
  // The lines that the check itself has written: those of the look-ups it begins with are known by
  // their categories and beginnings.
  [[nodiscard]] std::vector<DebugLine> errors() const {
    std::vector<DebugLine> lines;
    for (const DebugLine& line : platform.debug_lines()) {
      if (line.category == 0xC8110000U) lines.push_back(line);
    }
    return lines;
  }
  [[nodiscard]] DebugLine last_line() const { return platform.debug_lines().back(); }

  _CFG* session;
};

constexpr const char* kSecondValue = "Error: more then one admin DN ";

// ---- Null candidates

TEST_F(Uniqueness, NullCandidateGives80AndItsTextBeforeAnythingIsRead) {
  for (const Check check : {doesAdminGroupMemberDNExist, doesReplicationSupplierDNExist,
                            doesKerberosIDExist, doesDigestUserNameExist}) {
    platform.forget();
    EXPECT_EQ(run(check, nullptr), 80);
    EXPECT_THAT(platform.debug_lines(),
                ElementsAre(error("Invalid NULL pointer passed through.\n")));
    EXPECT_THAT(platform.calls(), IsEmpty());
  }
}

TEST_F(Uniqueness, NullSplitNameHasATextOfItsOwn) {
  EXPECT_EQ(split_name(nullptr), 80);
  EXPECT_THAT(
      platform.debug_lines(),
      ElementsAre(error("doesProxySplitNameExist::Invalid NULL pointer passed through.\n")));
  EXPECT_THAT(platform.calls(), IsEmpty());
}

// ---- Bind DNs of administrators

TEST_F(Uniqueness, AdministratorsDnIsTakenInAnySpelling) {
  for (const char* candidate : {"CN=ROOT", "cn=root", "Cn = Root"}) {
    platform.forget();
    EXPECT_EQ(member_dn(candidate), 68) << candidate;
    EXPECT_EQ(last_line(), error("Error: Bind DN attribute specified on add or modify operation "
                                 "matches the admin bind DN. "));
    EXPECT_THAT(searches(), ElementsAre("cfg_search_s(session, \"CN=CONFIGURATION\", 0, "
                                        "\"objectclass=*\", null, 0)"));
  }
}

TEST_F(Uniqueness, NormalFormsAreComparedByteForByte) {
  platform.keeps_letter_case = true;
  found(kGroup, {{{"orv-slapdAdminDN", {"cn=one"}}}});
  EXPECT_EQ(member_dn("CN=ROOT"), 0);
  EXPECT_EQ(member_dn("CN=ONE"), 0);
  found(kReplicationSearch, {{{"orv-slapdMasterDN", {"cn=one"}}}});
  found(kSupplierSearch, {{{"orv-slapdMasterDN", {"cn=one"}}}});
  EXPECT_EQ(supplier_dn("CN=ONE"), 0);
  EXPECT_EQ(supplier_dn("cn=one"), 68);
}

TEST_F(Uniqueness, DnsOfWhichOneBeginsWithTheOtherAreDifferent) {
  found(kGroup, {{{"orv-slapdAdminDN", {"cn=one,o=orv"}}}});
  EXPECT_EQ(member_dn("cn=root,o=orv"), 0);
  EXPECT_EQ(member_dn("cn=roo"), 0);
  EXPECT_EQ(member_dn("cn=one"), 0);
  EXPECT_EQ(member_dn("cn=one,o=orv,c=x"), 0);
}

TEST_F(Uniqueness, AdministratorsDnThatCannotBeReadGives80) {
  for (const Attributes& attributes :
       {Attributes{}, Attributes{{"orv-slapdAdminDN", {"cn=a", "cn=b"}}}}) {
    platform.forget();
    administrator(attributes);
    found(kGroup, {{{"orv-slapdAdminDN", {"cn=one"}}}});
    EXPECT_EQ(member_dn("cn=one"), 80);
    EXPECT_EQ(searches().size(), 1U);
    EXPECT_EQ(platform.count("slapi_ch_strdup"), 0);
  }
  platform.file.clear();
  EXPECT_EQ(member_dn("cn=one"), 80);
}

TEST_F(Uniqueness, MembersDnIsTakenInAnySpelling) {
  found(kGroup, {{{"cn", {"admingroup"}}}, {{"orv-slapdAdminDN", {"cn = One,o=orv"}}}});
  EXPECT_EQ(member_dn("CN=one, O=Orv"), 68);
  EXPECT_EQ(last_line(), error("Error: Bind DN attribute specified on add or modify operation "
                               "matches an admin group member bind DN. "));
  EXPECT_THAT(
      searches(),
      ElementsAre("cfg_search_s(session, \"CN=CONFIGURATION\", 0, \"objectclass=*\", null, 0)",
                  "cfg_search_s(session, \"CN=ADMINGROUP,CN=CONFIGURATION\", 2, \"objectclass=*\", "
                  "null, 0)"));
}

TEST_F(Uniqueness, FreeDnGivesZeroAfterEveryMember) {
  found(kGroup,
        {{{"cn", {"x"}}}, {{"orv-slapdAdminDN", {"cn=one"}}}, {{"orv-slapdAdminDN", {"cn=two"}}}});
  EXPECT_EQ(member_dn("cn=three"), 0);
  EXPECT_THAT(platform.calls({"cfg_count_entries", "cfg_next_entry"}),
              ElementsAre("cfg_count_entries(session, chain)", "cfg_next_entry(session, record 1)",
                          "cfg_next_entry(session, record 2)"));
  EXPECT_EQ(platform.count("cfg_first_entry"), 2);
  EXPECT_THAT(errors(), IsEmpty());
}

TEST_F(Uniqueness, OnlyTheCountedEntriesAreCompared) {
  found(kGroup, {{{"orv-slapdAdminDN", {"cn=one"}}}, {{"orv-slapdAdminDN", {"cn=two"}}}});
  platform.fail("cfg_count_entries", 1, 1);
  EXPECT_EQ(member_dn("cn=two"), 0);
  EXPECT_EQ(platform.count("cfg_next_entry"), 0);
  for (const int count : {0, -1}) {
    platform.forget();
    platform.fail("cfg_count_entries", 1, count);
    EXPECT_EQ(member_dn("cn=one"), 0) << count;
  }
}

TEST_F(Uniqueness, FirstCollisionEndsTheSearch) {
  found(kGroup, {{{"orv-slapdAdminDN", {"cn=one"}}},
                 {{"orv-slapdAdminDN", {"cn=two"}}},
                 {{"orv-slapdAdminDN", {"cn=two"}}}});
  EXPECT_EQ(member_dn("cn=two"), 68);
  EXPECT_EQ(platform.count("cfg_next_entry"), 1);
  EXPECT_EQ(errors().size(), 1U);
}

TEST_F(Uniqueness, EntriesAreComparedAfterAllTheirAttributes) {
  found(kGroup, {{{"orv-slapdAdminDN", {"cn=one"}}, {"cn", {"x", "y"}}}});
  EXPECT_EQ(member_dn("cn=one"), 68);
  EXPECT_THAT(
      platform.story({"cfg_get_dn", "cfg_get_values"}),
      ElementsAre("cfg_get_dn(session, record 1)",
                  "debug: Retrieving values for attribute orv-slapdAdminDN ! \n",
                  "cfg_get_values(session, record 1, \"orv-slapdAdminDN\")",
                  "debug: orv-slapdAdminDN: cn=root\n", "cfg_get_dn(session, record 1)",
                  "cfg_get_values(session, record 1, \"orv-slapdAdminDN\")",
                  "debug: orv-slapdAdminDN: cn=one\n", "cfg_get_values(session, record 1, \"cn\")",
                  "debug: cn: x\n", "debug: cn: y\n",
                  "debug: Error: Bind DN attribute specified on add or modify operation "
                  "matches an admin group member bind DN. "));
}

TEST_F(Uniqueness, ValuesAreTracedAsDetailAndPasswordsToo) {
  found(kProxies, {{{"orv-slapdAdminPW", {"secret"}}}});
  EXPECT_EQ(split_name("x"), 0);
  EXPECT_THAT(platform.debug_lines(), ElementsAre(detail("orv-slapdAdminPW: secret\n")));
}

TEST_F(Uniqueness, ValuesAreTracedUnderTheirNamesByAllButTheSuppliersCheck) {
  found(kGroup, {{{"orv-slapdAdminDN", {"cn=one"}},
                  {"orv-slapdKrbAdminDN", {"orv-kn=one"}},
                  {"orv-slapdDigestAdminUser", {"one"}}}});
  for (const Check check :
       {doesAdminGroupMemberDNExist, doesKerberosIDExist, doesDigestUserNameExist}) {
    platform.forget();
    EXPECT_EQ(run(check, "x"), 0);
    EXPECT_THAT(platform.debug_lines(), Contains(detail("orv-slapdAdminDN: cn=one\n")));
    EXPECT_THAT(platform.debug_lines(), Contains(detail("orv-slapdKrbAdminDN: orv-kn=one\n")));
    EXPECT_THAT(platform.debug_lines(), Contains(detail("orv-slapdDigestAdminUser: one\n")));
  }
}

TEST_F(Uniqueness, StepsAndReleasesComeInTheirOrder) {
  found(kGroup, {{{"orv-slapdAdminDN", {"cn=one"}}}});
  EXPECT_EQ(member_dn("cn=two"), 0);
  const std::vector<std::string> calls = platform.calls();
  const auto copied = std::find(calls.begin(), calls.end(), "slapi_ch_strdup(\"cn=two\")");
  ASSERT_NE(copied, calls.end());
  EXPECT_THAT(std::vector<std::string>(copied, calls.end()),
              ElementsAre("slapi_ch_strdup(\"cn=two\")", "replace_DN(\"cn=two\", 1)",
                          "cfg_search_s(session, \"CN=ADMINGROUP,CN=CONFIGURATION\", 2, "
                          "\"objectclass=*\", null, 0)",
                          "cfg_count_entries(session, chain)", "cfg_first_entry(session, chain)",
                          "cfg_get_dn(session, record 1)", "cfg_first_attribute(session, record 1)",
                          "cfg_get_values(session, record 1, \"orv-slapdAdminDN\")",
                          "xlate_localcp_to_utf8(\"cn=one\")", "replace_DN(\"cn=one\", 1)",
                          "cfg_memfree(\"orv-slapdAdminDN\")",
                          "cfg_next_attribute(session, record 1, cursor)", "cfg_ber_free(cursor)",
                          "cfg_memfree(\"CN=ADMINGROUP,CN=CONFIGURATION\")", "cfg_msgfree(chain)"));
}

TEST_F(Uniqueness, DnsAreReleasedWithWhatTheyWereComparedIn) {
  found(kGroup, {{{"orv-slapdAdminDN", {"cn=one"}}}});
  int made = 0;
  const char* const names[] = {"administrator's DN", "copy", "member's DN"};
  platform.at("replace_DN", 0,
              [&] { platform.name_allocation(platform.allocations() + 1, names[made++]); });
  EXPECT_EQ(member_dn("cn=two"), 0);
  const std::vector<std::string> calls =
      platform.calls({"free", "cfg_ber_free", "cfg_memfree", "cfg_msgfree"});
  ASSERT_GT(calls.size(), 6U);
  EXPECT_THAT(std::vector<std::string>(calls.end() - 6, calls.end()),
              ElementsAre("free(member's DN)", "cfg_ber_free(cursor)",
                          "cfg_memfree(\"CN=ADMINGROUP,CN=CONFIGURATION\")", "cfg_msgfree(chain)",
                          "free(copy)", "free(administrator's DN)"));
}

TEST_F(Uniqueness, AdministratorsNamesAreReleasedAfterTheMembersOfTheGroup) {
  found(kGroup, {{{"cn", {"x"}}}});
  found(kKerberos, {{{"orv-slapdKrbAdminDN", {"orv-kn=admin"}}}});
  found(kDigest, {{{"orv-slapdDigestAdminUser", {"admin"}}}});
  const auto releases = [&](Check check) {
    EXPECT_EQ(run(check, "x"), 0);
    return platform.calls({"cfg_msgfree", "free"});
  };
  // The light form is made first, and then the copy of it that is compared.
  platform.at("dn_normalize_light_esc", 1,
              [&] { platform.name_allocation(platform.allocations() + 2, "administrator's"); });
  EXPECT_THAT(releases(doesKerberosIDExist),
              ElementsAre("cfg_msgfree(chain)", "cfg_msgfree(chain)", "free(administrator's)"));
  platform.forget();
  platform.name_allocation_in("xlate_localcp_to_utf8", 1, "administrator's");
  EXPECT_THAT(releases(doesDigestUserNameExist),
              ElementsAre("cfg_msgfree(chain)", "cfg_msgfree(chain)", "free(administrator's)"));
}

TEST_F(Uniqueness, CopyOfASuppliersDnIsReleasedAfterBothSearches) {
  found(kReplicationSearch, {{}});
  found(kSupplierSearch, {{}});
  platform.name_allocation_in("replace_DN", 1, "copy");
  EXPECT_EQ(supplier_dn("cn=one"), 0);
  EXPECT_THAT(platform.calls({"cfg_msgfree", "free"}),
              ElementsAre("cfg_msgfree(chain)", "cfg_msgfree(chain)", "free(copy)"));
}

TEST_F(Uniqueness, StoredValuesAreConvertedFromTheLocalCodePage) {
  found(kGroup, {{{"orv-slapdAdminDN", {"CN=K\xE4SE"}},
                  {"orv-slapdKrbAdminDN", {"orv-kn=K\xE4se"}},
                  {"orv-slapdDigestAdminUser", {"K\xE4se"}}}});
  found(kReplicationSearch, {{{"orv-slapdMasterDN", {"CN=K\xE4SE"}}}});
  found(kProxies, {{{"orv-slapdProxySplitName", {"K\xE4se"}}}});
  EXPECT_EQ(member_dn("CN=K\xC3\xA4SE"), 68);
  EXPECT_EQ(supplier_dn("CN=K\xC3\xA4SE"), 68);
  EXPECT_EQ(kerberos_id("orv-kn=K\xC3\xA4se"), 68);
  EXPECT_EQ(digest_user("K\xC3\xA4se"), 68);
  EXPECT_EQ(split_name("K\xC3\xA4se"), 68);
}

TEST_F(Uniqueness, AttributeNamesMatchInAnyLetterCase) {
  found(kGroup, {{{"ORV-SLAPDADMINDN", {"cn=one"}},
                  {"orv-slapdkrbadmindn", {"orv-kn=one"}},
                  {"Orv-SlapdDigestAdminUser", {"one"}}}});
  found(kReplicationSearch, {{{"orv-slapdMASTERDN", {"cn=one"}}}});
  found(kSupplierSearch, {{{"orv-slapdMASTERDN", {"cn=two"}}}});
  found(kProxies, {{{"ORV-slapdProxySplitName", {"one"}}}});
  EXPECT_EQ(member_dn("cn=one"), 68);
  EXPECT_EQ(kerberos_id("orv-kn=one"), 68);
  EXPECT_EQ(digest_user("one"), 68);
  EXPECT_EQ(supplier_dn("cn=one"), 68);
  EXPECT_EQ(supplier_dn("cn=two"), 68);
  EXPECT_EQ(split_name("one"), 68);
}

TEST_F(Uniqueness, OtherAttributesAreNotCompared) {
  const Attributes other = {{"cn", {"cn=one"}}, {"orv-slapdMasterDn2", {"cn=one"}}};
  found(kGroup, {other});
  found(kReplicationSearch, {other});
  found(kSupplierSearch, {other});
  found(kProxies, {other});
  EXPECT_EQ(member_dn("cn=one"), 0);
  EXPECT_EQ(supplier_dn("cn=one"), 0);
  EXPECT_EQ(kerberos_id("cn=one"), 0);
  EXPECT_EQ(digest_user("cn=one"), 0);
  EXPECT_EQ(split_name("cn=one"), 0);
}

// ---- Several values, none

TEST_F(Uniqueness, OnlyTheFirstOfSeveralValuesIsComparedAndTheSecondTraced) {
  found(kGroup, {{{"orv-slapdAdminDN", {"cn=one", "cn=two"}}}});
  EXPECT_EQ(member_dn("cn=two"), 0);
  EXPECT_THAT(errors(), ElementsAre(error(kSecondValue)));
  platform.forget();
  EXPECT_EQ(member_dn("cn=one"), 68);
  EXPECT_THAT(errors(), ElementsAre(error(kSecondValue),
                                    error("Error: Bind DN attribute specified on add or modify "
                                          "operation matches an admin group member bind DN. ")));
}

TEST_F(Uniqueness, SecondValuesOfTheOthersAreTreatedAlike) {
  found(kGroup, {{{"orv-slapdKrbAdminDN", {"orv-kn=one", "orv-kn=two"}},
                  {"orv-slapdDigestAdminUser", {"one", "two"}}}});
  found(kReplicationSearch, {{{"orv-slapdMasterDN", {"cn=one", "cn=two"}}}});
  found(kSupplierSearch, {{{"orv-slapdMasterDN", {"cn=one", "cn=two"}}}});
  found(kProxies, {{{"orv-slapdProxySplitName", {"one", "two"}}}});
  const std::vector<std::pair<Check, const char*>> cases = {
      {doesReplicationSupplierDNExist, "cn=two"},
      {doesKerberosIDExist, "orv-kn=two"},
      {doesDigestUserNameExist, "two"},
      {doesProxySplitNameExist, "two"}};
  for (const auto& [check, second] : cases) {
    platform.forget();
    EXPECT_EQ(run(check, second), 0) << second;
    EXPECT_THAT(errors(), Contains(error(kSecondValue)));
  }
}

TEST_F(Uniqueness, AttributeWithoutValuesOrWithoutAConversionHoldsNothing) {
  found(kGroup, {{{"orv-slapdAdminDN", {}}}, {{"orv-slapdAdminDN", {"cn=one"}}}});
  platform.fail("xlate_localcp_to_utf8", 2, 0);
  EXPECT_EQ(member_dn("cn=one"), 0);
}

TEST_F(Uniqueness, ValuesThatAreNullWithoutAnErrorHoldNothing) {
  found(kProxies, {{{"orv-slapdProxySplitName", {"one"}}}});
  platform.fail("cfg_get_values", 1, 0);
  EXPECT_EQ(split_name("one"), 0);
}

// ---- Suppliers

TEST_F(Uniqueness, SupplierDnsAreLookedForInTwoSearchesWithoutTheAdministrator) {
  found(kReplicationSearch, {});
  found(kSupplierSearch, {});
  EXPECT_EQ(supplier_dn("cn=root"), 0);
  EXPECT_THAT(searches(), ElementsAre("cfg_search_s(session, \"CN=CONFIGURATION\", 2, "
                                      "\"objectclass=orv-slapdReplication\", null, 0)",
                                      "cfg_search_s(session, \"CN=CONFIGURATION\", 2, "
                                      "\"objectclass=orv-slapdSupplier\", null, 0)"));
  EXPECT_THAT(platform.calls({"cfg_first_entry"}), IsEmpty());
}

TEST_F(Uniqueness, ReplicationEntrysDnIsTakenAndSuppliersAreNotSearched) {
  found(kReplicationSearch, {{{"orv-slapdMasterDN", {"cn=one"}}}});
  found(kSupplierSearch, {{{"orv-slapdMasterDN", {"cn=one"}}}});
  EXPECT_EQ(supplier_dn("CN = one"), 68);
  EXPECT_THAT(platform.debug_lines(),
              ElementsAre(detail(" Attribute orv-slapdMasterDN: has value cn=one \n"),
                          error("Error: Bind DN attribute specified on add or modify operation "
                                "matches a replication supplier bind DN. ")));
  EXPECT_EQ(searches().size(), 1U);
}

TEST_F(Uniqueness, SecondReplicationEntryIsNeverExamined) {
  found(kReplicationSearch,
        {{{"orv-slapdMasterDN", {"cn=one"}}}, {{"orv-slapdMasterDN", {"cn=two"}}}});
  EXPECT_EQ(supplier_dn("cn=two"), 0);
  EXPECT_EQ(platform.count("cfg_next_entry"), 0);
}

TEST_F(Uniqueness, EverySuppliersDnIsTakenWithATextOfItsOwn) {
  found(kReplicationSearch, {});
  found(kSupplierSearch,
        {{{"orv-slapdMasterDN", {"cn=one"}}}, {{"orv-slapdMasterDN", {"cn=two"}}}});
  EXPECT_EQ(supplier_dn("cn=two"), 68);
  EXPECT_THAT(
      platform.debug_lines(),
      ElementsAre(
          detail(" Attribute orv-slapdMasterDN: has value cn=one \n"),
          detail(" Attribute orv-slapdMasterDN: has value cn=two \n"),
          error("Error: Tried to add a DN that already belongs to a replication supplier. ")));
}

TEST_F(Uniqueness, SuppliersAreSearchedAfterAMissingReplicationEntryButNotAfterAFailure) {
  found(kReplicationSearch, {}, 32);
  found(kSupplierSearch, {{{"orv-slapdMasterDN", {"cn=one"}}}});
  EXPECT_EQ(supplier_dn("cn=one"), 68);
  platform.forget();
  found(kReplicationSearch, {}, 80);
  EXPECT_EQ(supplier_dn("cn=one"), 80);
  EXPECT_EQ(searches().size(), 1U);
  platform.forget();
  found(kReplicationSearch, {{{"orv-slapdMasterDN", {"cn=two"}}}});
  platform.fail("cfg_get_values", 1, 1);
  EXPECT_EQ(supplier_dn("cn=one"), 1);
  EXPECT_EQ(searches().size(), 1U);
}

TEST_F(Uniqueness, FirstSearchsResultIsReleasedBeforeTheSecondSearch) {
  found(kReplicationSearch, {{}});
  found(kSupplierSearch, {});
  EXPECT_EQ(supplier_dn("cn=one"), 0);
  EXPECT_THAT(platform.calls({"cfg_search_s", "cfg_msgfree"}),
              ElementsAre(testing::HasSubstr("Replication"), "cfg_msgfree(chain)",
                          testing::HasSubstr("Supplier"), "cfg_msgfree(chain)"));
}

// ---- Kerberos identities

TEST_F(Uniqueness, AdministratorsKerberosIdentityIsTakenByWhatFollowsTheFirstEqualsSign) {
  found(kKerberos, {{{"orv-slapdKrbAdminDN", {"orv-kn = admin=x@REALM"}}}});
  for (const char* candidate : {"orv-kn=admin=x@REALM", "orv-kerberosName=ADMIN=X@realm",
                                "=admin=x@realm", "admin=admin=X@realm"}) {
    platform.forget();
    EXPECT_EQ(kerberos_id(candidate), 68) << candidate;
    EXPECT_EQ(last_line(), error("Error: Kerberos ID specified on add or modify operation matches "
                                 "the admin Kerberos ID."));
    EXPECT_EQ(searches().size(), 1U);
  }
  for (const char* candidate : {"orv-kn=x@REALM", "admin=x@REALM", "orv-kn=admin=x@REALM2"}) {
    EXPECT_EQ(kerberos_id(candidate), 0) << candidate;
  }
}

TEST_F(Uniqueness, WholeIdentityIsComparedWhereThereIsNoEqualsSign) {
  found(kKerberos, {{{"orv-slapdKrbAdminDN", {"admin@REALM"}}}});
  EXPECT_EQ(kerberos_id("Admin@realm"), 68);
  EXPECT_EQ(kerberos_id("orv-kn=admin@realm"), 68);
  EXPECT_EQ(kerberos_id("other@realm"), 0);
}

TEST_F(Uniqueness, CandidateKerberosIdentityIsNotNormalised) {
  found(kKerberos, {{{"orv-slapdKrbAdminDN", {"orv-kn=admin"}}}});
  EXPECT_EQ(kerberos_id("orv-kn= admin"), 0);
  EXPECT_THAT(platform.calls({"dn_normalize_light_esc", "slapi_ch_strdup", "replace_DN"}),
              ElementsAre("dn_normalize_light_esc(\"orv-kn=admin\")"));
}

TEST_F(Uniqueness, MembersKerberosIdentityIsTakenInItsLightForm) {
  found(kGroup, {{{"cn", {"x"}}}, {{"orv-slapdKrbAdminDN", {"orv-kn = one@REALM"}}}});
  EXPECT_EQ(kerberos_id("orv-kerberosName=One@realm"), 68);
  EXPECT_EQ(last_line(), error("Error: Kerberos ID specified on add or modify operation matches a "
                               "admin group member Kerberos ID."));
  EXPECT_THAT(searches(),
              ElementsAre("cfg_search_s(session, \"CN=KERBEROS,CN=CONFIGURATION\", 0, "
                          "\"objectclass=*\", null, 0)",
                          "cfg_search_s(session, \"CN=ADMINGROUP,CN=CONFIGURATION\", 2, "
                          "\"objectclass=*\", null, 0)"));
  EXPECT_EQ(platform.count("replace_DN"), 0);
}

TEST_F(Uniqueness, FailuresOfAMembersLightFormAreTheCode) {
  found(kGroup, {{{"orv-slapdKrbAdminDN", {"orv-kn=one"}}}});
  platform.fail("dn_normalize_light_esc", 1, 34);
  EXPECT_EQ(kerberos_id("orv-kn=one"), 34);
  EXPECT_EQ(platform.count("free_ldap_escDN"), 1);
  platform.forget();
  platform.fail("dn_normalize_light_esc", 1, 0);
  EXPECT_EQ(kerberos_id("orv-kn=one"), 90);
}

// ---- Digest-MD5 user names

TEST_F(Uniqueness, AdministratorsDigestUserIsTakenByteForByte) {
  found(kDigest, {{{"orv-slapdDigestAdminUser", {"Admin"}}}});
  EXPECT_EQ(digest_user("Admin"), 68);
  EXPECT_EQ(last_line(), error("Error: Digest-MD5 User Name specified on add or modify operation "
                               "matches the admin Digest-MD5 User Name."));
  EXPECT_EQ(searches().size(), 1U);
  for (const char* candidate : {"admin", "Admin ", " Admin", "Admi", "x=Admin"}) {
    EXPECT_EQ(digest_user(candidate), 0) << candidate;
  }
}

TEST_F(Uniqueness, MembersDigestUserIsTakenByteForByte) {
  found(kGroup, {{{"cn", {"x"}}}, {{"orv-slapdDigestAdminUser", {"One"}}}});
  EXPECT_EQ(digest_user("One"), 68);
  EXPECT_EQ(last_line(), error("Error: Digest-MD5 User Name specified on add or modify operation "
                               "matches an admin group member Digest-MD5 User Name."));
  EXPECT_EQ(digest_user("one"), 0);
  EXPECT_THAT(searches().front(), testing::HasSubstr("\"CN=DIGEST,CN=CONFIGURATION\", 0,"));
  EXPECT_EQ(searches()[1],
            "cfg_search_s(session, \"CN=ADMINGROUP,CN=CONFIGURATION\", 2, \"objectclass=*\", null, "
            "0)");
  EXPECT_EQ(platform.count("replace_DN") + platform.count("dn_normalize_light_esc"), 0);
}

TEST_F(Uniqueness, MissingAdministratorsIdentitySkipsOnlyTheComparisonWithIt) {
  found(kGroup, {{{"orv-slapdKrbAdminDN", {"orv-kn=one"}}, {"orv-slapdDigestAdminUser", {"one"}}}});
  EXPECT_EQ(kerberos_id("orv-kn=one"), 68);
  EXPECT_EQ(digest_user("one"), 68);
  EXPECT_EQ(kerberos_id("orv-kn=two"), 0);
  EXPECT_EQ(digest_user("two"), 0);
}

// ---- Names of proxy splits

TEST_F(Uniqueness, SplitNameIsTakenByteForByte) {
  found(kProxies, {{{"orv-slapdProxySplitName", {"One"}}}, {{"orv-slapdProxySplitName", {"Two"}}}});
  EXPECT_EQ(split_name("Two"), 68);
  EXPECT_THAT(
      platform.debug_lines(),
      ElementsAre(detail("orv-slapdProxySplitName: One\n"),
                  detail("orv-slapdProxySplitName: Two\n"),
                  error("Error: orv-slapdProxySplitName Name specified on add or modify operation "
                        "matches an existing split Name.")));
  EXPECT_THAT(searches(),
              ElementsAre("cfg_search_s(session, \"CN=PROXYDB,CN=PROXY BACKENDS,CN=ORV "
                          "DIRECTORY,CN=SCHEMAS,CN=CONFIGURATION\", 2, \"objectclass=*\", null, "
                          "0)"));
  EXPECT_EQ(split_name("two"), 0);
  EXPECT_EQ(split_name("Tw"), 0);
}

TEST_F(Uniqueness, NamesAreNotNormalised) {
  found(kGroup, {{{"orv-slapdDigestAdminUser", {"a = b"}}}});
  found(kProxies, {{{"orv-slapdProxySplitName", {"a = b"}}}});
  EXPECT_EQ(digest_user("a = b"), 68);
  EXPECT_EQ(digest_user("a=b"), 0);
  EXPECT_EQ(split_name("a = b"), 68);
  EXPECT_EQ(split_name("a=b"), 0);
  EXPECT_THAT(platform.calls({"replace_DN", "dn_normalize_light_esc"}), IsEmpty());
}

// ---- Failures that all of them share

struct Case {
  Check check;
  const char* base;       // where its holders are
  const char* attribute;  // and under which attribute
};
constexpr Case kCases[] = {
    {doesAdminGroupMemberDNExist, kGroup, "orv-slapdAdminDN"},
    {doesReplicationSupplierDNExist, kReplicationSearch, "orv-slapdMasterDN"},
    {doesReplicationSupplierDNExist, kSupplierSearch, "orv-slapdMasterDN"},
    {doesKerberosIDExist, kGroup, "orv-slapdKrbAdminDN"},
    {doesDigestUserNameExist, kGroup, "orv-slapdDigestAdminUser"},
    {doesProxySplitNameExist, kProxies, "orv-slapdProxySplitName"},
};

class EachUniqueness : public Uniqueness, public testing::WithParamInterface<Case> {
 protected:
  // Every look-up and search before the holders' makes calls of its own: they are counted first.
  // Two holders, whose DNs cannot be mistaken for the candidate.
  EachUniqueness() {
    administrator({{"orv-slapdAdminDN", {"cn=root"}}});
    found(kKerberos, {{{"orv-slapdKrbAdminDN", {"orv-kn=root"}}}});
    found(kDigest, {{{"orv-slapdDigestAdminUser", {"root"}}}});
    found(kReplicationSearch, {});
    found(kSupplierSearch, {});
    found(GetParam().base, {});
    run("x");
    for (const char* function : {"cfg_search_s", "cfg_get_dn", "cfg_first_attribute",
                                 "cfg_next_attribute", "cfg_get_values", "xlate_localcp_to_utf8"}) {
      before[function] = platform.count(function);
    }
    // The suppliers are searched after the replication entry.
    if (std::string(GetParam().base) == kReplicationSearch)
      before["cfg_search_s"] = 0;
    else
      --before["cfg_search_s"];
    platform.forget();
    found(GetParam().base,
          {{{GetParam().attribute, {"one"}}, {"cn", {"x"}}}, {{GetParam().attribute, {"two"}}}});
  }
  int run(const char* candidate) { return Uniqueness::run(GetParam().check, candidate); }
  void fail(const char* function, int nth, int code) {
    platform.fail(function, before[function] + nth, code);
  }

  std::map<std::string, int> before;
};

TEST_P(EachUniqueness, MissingContainerMeansFree) {
  platform.file.erase(GetParam().base);
  if (GetParam().check == doesReplicationSupplierDNExist) platform.file.clear();
  EXPECT_EQ(run("one"), 0);
}

TEST_P(EachUniqueness, MissingContainerMeansFreeWhateverComesWithTheCode) {
  platform.file[GetParam().base].code = 32;
  EXPECT_EQ(run("one"), 0);
}

TEST_P(EachUniqueness, OtherFailureOfTheSearchIsTheCode) {
  platform.file[GetParam().base].code = 3;
  EXPECT_EQ(run("one"), 3);
  EXPECT_EQ(platform.count("cfg_get_dn"), before["cfg_get_dn"]);
  EXPECT_THAT(errors(), IsEmpty());
}

TEST_P(EachUniqueness, EntryWhoseDnCannotBeReadGives90) {
  fail("cfg_get_dn", 1, 0);
  EXPECT_EQ(run("two"), 90);
  EXPECT_EQ(platform.count("cfg_first_attribute"), before["cfg_first_attribute"]);
  EXPECT_THAT(errors(), IsEmpty());
}

// Where one entry is examined there is no second.
TEST_P(EachUniqueness, SecondEntryThatCannotBeTakenOrReadGives90) {
  const int code = std::string(GetParam().base) == kReplicationSearch ? 0 : 90;
  fail("cfg_get_dn", 2, 0);
  EXPECT_EQ(run("two"), code);
  platform.forget();
  platform.fail("cfg_next_entry", 1, 1);
  EXPECT_EQ(run("two"), code);
}

TEST_P(EachUniqueness, EntryThatCannotBeTakenGives90) {
  platform.fail("cfg_first_entry", 0, 1);
  if (GetParam().check != doesAdminGroupMemberDNExist) {
    EXPECT_EQ(run("two"), 90);
  } else {
    EXPECT_EQ(run("two"), 80);  // the administrator's entry is the first
  }
}

TEST_P(EachUniqueness, ErrorAtTheFirstAttributeGives1) {
  fail("cfg_first_attribute", 1, 80);
  EXPECT_EQ(run("two"), 1);
  EXPECT_EQ(last_line(), error("cfg_first_attribute error ! \n"));
}

TEST_P(EachUniqueness, ErrorAtTheNextAttributeGives1EvenAfterTheFind) {
  fail("cfg_next_attribute", 1, 80);
  EXPECT_EQ(run("one"), 1);
  EXPECT_EQ(last_line(), error("cfg_first_attribute error ! \n"));
}

TEST_P(EachUniqueness, ErrorAtTheValuesGives1AndEndsTheSearch) {
  fail("cfg_get_values", 2, 80);
  EXPECT_EQ(run("two"), 1);
  EXPECT_EQ(last_line(), error("Problems retrieving values for cn ! \n"));
  EXPECT_EQ(platform.count("cfg_get_values"), before["cfg_get_values"] + 2);
}

TEST_P(EachUniqueness, FailedConversionIsTheCode) {
  fail("xlate_localcp_to_utf8", 1, 21);
  EXPECT_EQ(run("two"), 21);
}

TEST_P(EachUniqueness, ErrorsOfReadingGive1WithoutTheTraceToo) {
  debug_off();
  for (const char* function : {"cfg_first_attribute", "cfg_next_attribute", "cfg_get_values"}) {
    platform.forget();
    fail(function, 1, 80);
    EXPECT_EQ(run("two"), 1) << function;
    EXPECT_THAT(platform.debug_lines(), IsEmpty());
  }
}

TEST_P(EachUniqueness, NothingIsTracedWhenNotDebugging) {
  debug_off();
  EXPECT_EQ(run("three"), 0);
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
}

std::string name_of(const testing::TestParamInfo<Case>& info) {
  static constexpr const char* kNames[] = {"AdminDn",    "ReplicationDn", "SupplierDn",
                                           "KerberosId", "DigestUser",    "SplitName"};
  return kNames[info.index];
}

INSTANTIATE_TEST_SUITE_P(Rules, EachUniqueness, testing::ValuesIn(kCases), name_of);

TEST_F(Uniqueness, CandidateThatCannotBeNormalisedEndsTheCheckWithThatCode) {
  platform.fail("replace_DN", 2, 34);  // after the administrator's
  EXPECT_EQ(member_dn("cn=one"), 34);
  EXPECT_EQ(searches().size(), 1U);
  platform.forget();
  platform.fail("replace_DN", 1, 34);
  EXPECT_EQ(supplier_dn("cn=one"), 34);
  EXPECT_THAT(searches(), IsEmpty());
}

TEST_F(Uniqueness, CandidatesNormalisationKeepsACodeOf32) {
  platform.fail("replace_DN", 2, 32);
  EXPECT_EQ(member_dn("cn=one"), 32);
  platform.forget();
  platform.fail("replace_DN", 1, 32);
  EXPECT_EQ(supplier_dn("cn=one"), 32);
}

TEST_F(Uniqueness, NormalisationOfAStoredDnThatGives32CountsAsAMissingEntry) {
  found(kGroup, {{{"orv-slapdAdminDN", {"cn=one"}}}});
  platform.fail("replace_DN", 3, 32);  // after the administrator's and the candidate's
  EXPECT_EQ(member_dn("cn=one"), 0);
  EXPECT_EQ(platform.count("replace_DN"), 3);
  platform.forget();
  found(kReplicationSearch, {{{"orv-slapdMasterDN", {"cn=one"}}}});
  found(kSupplierSearch, {{{"orv-slapdMasterDN", {"cn=two"}}}});
  platform.fail("replace_DN", 2, 32);
  EXPECT_EQ(supplier_dn("cn=two"), 68);
  EXPECT_EQ(searches().size(), 2U);
}

TEST_F(Uniqueness, CandidateThatCannotBeCopiedGives90) {
  platform.fail("slapi_ch_strdup", 1, 90);
  EXPECT_EQ(member_dn("cn=one"), 90);
  platform.forget();
  platform.fail("slapi_ch_strdup", 1, 90);
  EXPECT_EQ(supplier_dn("cn=one"), 90);
  EXPECT_EQ(platform.count("replace_DN"), 0);
}

TEST_F(Uniqueness, StoredDnThatCannotBeNormalisedIsTheCode) {
  found(kGroup, {{{"orv-slapdAdminDN", {"cn=one"}}}});
  platform.fail("replace_DN", 3, 34);
  EXPECT_EQ(member_dn("cn=two"), 34);
  platform.forget();
  found(kReplicationSearch, {{{"orv-slapdMasterDN", {"cn=one"}}}});
  platform.fail("replace_DN", 2, 34);
  EXPECT_EQ(supplier_dn("cn=two"), 34);
}

TEST_F(Uniqueness, ExitRecordsCarryTheCode) {
  found(kReplicationSearch, {});
  found(kSupplierSearch, {});
  found(kProxies, {{{"orv-slapdProxySplitName", {"one"}}}});
  trcEvents = 0x00020000;
  member_dn("cn=root");
  supplier_dn("cn=x");
  kerberos_id(nullptr);
  digest_user("x");
  split_name("one");
  std::vector<std::string> own;
  for (const std::string& record : platform.records()) {
    if (record.starts_with("exit 0102")) own.push_back(record);
  }
  EXPECT_THAT(
      own, ElementsAre("exit 01020200 0", "exit 01020600 68", "exit 01020700 0", "exit 01020800 80",
                       "exit 01020400 32", "exit 01020900 0", "exit 01020a00 68"));
}

}  // namespace
}  // namespace orv
