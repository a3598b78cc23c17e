// What an entry must be to be added: group, suppliers, Kerberos, Digest-MD5, proxy splits,
// passwords.
#include "added_entry.h"
#include "config_add.h"
#include "function_ids.h"

namespace orv {
namespace {

constexpr const char* kElsewhere = "CN=X,CN=CONFIGURATION";

class AddRules : public AddedEntryTest {
 protected:
  AddRules() {
    open_session();
    as(kPrimary);
    found(kConfiguration, {{"orv-slapdAdminDN", {"cn=root"}}});
    found(kReplicationSearch, {{"orv-slapdMasterDN", {"cn=master"}}});
    found(kSupplierSearch, {{"orv-slapdMasterDN", {"cn=supplier"}}});
    found(kGroup, {{"orv-slapdAdminDN", {"cn=taken"}},
                   {"orv-slapdKrbAdminDN", {"orv-kn=taken@REALM"}},
                   {"orv-slapdDigestAdminUser", {"taken"}}});
    found(kProxies, {{"orv-slapdProxySplitName", {"taken"}}});
  }
  void TearDown() override {
    e.reset();
    EXPECT_THAT(platform.leaks(), ElementsAre("session"));
    EXPECT_EQ(platform.count("pthread_mutex_lock"), 0);
    close_session();
    AddedEntryTest::TearDown();
  }

  void found(const std::string& base, Attributes attributes) {
    platform.file[base] = {{{base, std::move(attributes)}}};
  }

  // The entry to add, and the DN under which the rules are told of it.
  void adding(const char* normalized_dn, const Attributes& attributes) {
    make(normalized_dn, attributes);
    dn = normalized_dn;
  }
  // A member with everything that it must have, and `more`.
  void adding_member(const Attributes& more = {}) {
    Attributes all = {{"objectClass", {"top", "orv-slapdConfigEntry", "orv-slapdAdminGroupMember"}},
                      {"orv-slapdAdminDN", {"cn=one"}}};
    all.insert(all.end(), more.begin(), more.end());
    adding(kMember, all);
  }

  // Runs a rule; none changes the entry.
  template <typename Rule>
  int run(std::uint32_t identifier, Rule rule) {
    platform.forget();
    const std::string before = e == nullptr ? "" : scripted::text_of(*e);
    const int rc = traced(identifier, rule);
    EXPECT_EQ(e == nullptr ? "" : scripted::text_of(*e), before);
    return rc;
  }
  int group() {
    return run(function_id::check_if_admin_group_entry,
               [&] { return checkIfAdminGroupEntry(dn, e.get(), &connection, &operation); });
  }
  int supplier() {
    return run(function_id::check_if_repl_supplier_entry,
               [&] { return checkIfReplSupplierEntry(dn, e.get(), &connection); });
  }
  int kerberos() {
    return run(function_id::check_if_kerberos_entry,
               [&] { return checkIfKerberosEntry(dn, e.get(), &connection, &operation); });
  }
  int digest() {
    return run(function_id::check_if_digest_entry,
               [&] { return checkIfDigestEntry(dn, e.get(), &connection, &operation); });
  }
  int proxy() {
    return run(function_id::check_if_proxy_split_container,
               [&] { return checkIfProxySplitContainer(e.get(), &connection); });
  }
  int policy() {
    return run(function_id::check_admin_policy_entry,
               [&] { return checkAdminPolicyEntry(dn, e.get(), &connection, &operation); });
  }
  // With what the platform has been told since the last call.
  int policy_of_the_script() {
    return traced(function_id::check_admin_policy_entry,
                  [&] { return checkAdminPolicyEntry(dn, e.get(), &connection, &operation); });
  }

  [[nodiscard]] int searches() const { return platform.count("cfg_search_s"); }
  [[nodiscard]] std::vector<std::string> asked() const {
    return platform.calls({"value_find", "attr_find"});
  }

  const char* dn = nullptr;
};

DebugLine null_line() {
  return error("Invalid NULL pointer passed through.\n");
}

// ---- Null arguments

TEST_F(AddRules, EachNullArgumentGives80AndTheText) {
  adding(kElsewhere, {});
  Connection* const c = &connection;
  Operation* const o = &operation;
  const auto refused = [&](std::uint32_t identifier, auto rule) {
    EXPECT_EQ(run(identifier, rule), 80) << identifier;
    EXPECT_THAT(platform.debug_lines(), ElementsAre(null_line())) << identifier;
    EXPECT_THAT(platform.calls(), IsEmpty()) << identifier;
  };
  using Rule = int (*)(const char*, entry*, Connection*, Operation*);
  for (const auto& [identifier, rule] :
       {std::pair<std::uint32_t, Rule>{function_id::check_if_admin_group_entry,
                                       checkIfAdminGroupEntry},
        {function_id::check_if_kerberos_entry, checkIfKerberosEntry},
        {function_id::check_if_digest_entry, checkIfDigestEntry},
        {function_id::check_admin_policy_entry, checkAdminPolicyEntry}}) {
    refused(identifier, [&, rule = rule] { return rule(nullptr, e.get(), c, o); });
    refused(identifier, [&, rule = rule] { return rule(dn, nullptr, c, o); });
    refused(identifier, [&, rule = rule] { return rule(dn, e.get(), nullptr, o); });
    refused(identifier, [&, rule = rule] { return rule(dn, e.get(), c, nullptr); });
  }
  constexpr std::uint32_t kSupplier = function_id::check_if_repl_supplier_entry;
  refused(kSupplier, [&] { return checkIfReplSupplierEntry(nullptr, e.get(), c); });
  refused(kSupplier, [&] { return checkIfReplSupplierEntry(dn, nullptr, c); });
  refused(kSupplier, [&] { return checkIfReplSupplierEntry(dn, e.get(), nullptr); });
}

TEST_F(AddRules, NullEntryForTheProxyRuleHasATextOfItsOwn) {
  EXPECT_EQ(run(function_id::check_if_proxy_split_container,
                [&] { return checkIfProxySplitContainer(nullptr, &connection); }),
            80);
  EXPECT_THAT(
      platform.debug_lines(),
      ElementsAre(error("CheckIfProxySplitContainer::Invalid NULL pointer passed through.\n")));
}

TEST_F(AddRules, ProxyRuleTakesNoConnectionWhereItNeedsNone) {
  adding(kElsewhere, {});
  EXPECT_EQ(run(function_id::check_if_proxy_split_container,
                [&] { return checkIfProxySplitContainer(e.get(), nullptr); }),
            0);
}

// ---- The administrative group: whom it concerns

TEST_F(AddRules, GroupRuleLetsOtherEntriesPassUnseen) {
  as(0x24);
  for (const char* other : {kElsewhere, kConfiguration, "CN=LOG MANAGEMENT,CN=CONFIGURATION",
                            "CN=X,CN=AUDIT,CN=LOG MANAGEMENT,CN=CONFIGURATION",
                            "CN=AUDIT,CN=LOG MANAGEMENT,CN=CONFIGURATION,O=ORV"}) {
    adding(other, {});
    EXPECT_EQ(group(), 0) << other;
    EXPECT_THAT(platform.calls(), IsEmpty());
  }
}

TEST_F(AddRules, LowerCaseDnsNeverMatch) {
  as(kGroupMember);
  for (const char* lower :
       {"cn=one,cn=admingroup,cn=configuration", "cn=audit,cn=log management,cn=configuration",
        "cn=admin audit,cn=log management,cn=configuration",
        "cn=default,cn=log management,cn=configuration"}) {
    adding(lower, {});
    EXPECT_EQ(group(), 0) << lower;
  }
  adding("cn=kerberos,cn=configuration", {});
  EXPECT_EQ(kerberos(), 0);
  adding("cn=digest,cn=configuration", {});
  EXPECT_EQ(digest(), 0);
  adding("cn=one,cn=admingroup,cn=configuration",
         {{"cn", {"one"}}, {"orv-slapdAdminPW", {"admin"}}, {"orv-slapdMasterPW", {"master"}}});
  EXPECT_EQ(policy(), 0);
  EXPECT_THAT(platform.calls({"verify_admin_password"}),
              ElementsAre("verify_admin_password(\"master\", null, operation)"));
}

TEST_F(AddRules, LogEntriesAskMembersForTheirRights) {
  struct {
    unsigned roles;
    int audit, admin_audit, default_log;
  } const rows[] = {{0x00, 50, 50, 50}, {0x02, 0, 0, 0},    {0x20, 50, 0, 0},
                    {0x22, 0, 0, 0},    {0x1C, 50, 50, 50}, {0x3C, 50, 0, 0}};
  as(kGroupMember);
  for (const auto& row : rows) {
    operation.roles = row.roles;
    adding(kAudit, {});
    EXPECT_EQ(group(), row.audit) << row.roles;
    adding(kAdminAudit, {});
    EXPECT_EQ(group(), row.admin_audit) << row.roles;
    adding(kDefaultLog, {});
    EXPECT_EQ(group(), row.default_log) << row.roles;
  }
}

TEST_F(AddRules, LogEntriesAskOnlyMembers) {
  for (const unsigned flags : {kPrimary, 0x01U, 0x02U, 0x04U, 0x10U, 0x24U}) {
    as(flags);
    for (const char* log : {kAudit, kAdminAudit, kDefaultLog}) {
      adding(log, {});
      EXPECT_EQ(group(), 0) << flags << log;
    }
  }
}

TEST_F(AddRules, RightsAreThoseOfTheOperation) {
  as(kGroupMember);
  connection.authority = kPrimary;
  connection.roles = 0x3E;
  adding(kAudit, {});
  EXPECT_EQ(group(), 50);
  adding_member();
  EXPECT_EQ(group(), 50);
}

TEST_F(AddRules, GroupIsForThePrimaryAdministratorAlone) {
  for (const unsigned flags : {0x00U, 0x04U, 0x08U, kGroupMember, 0x18U, 0x24U, 0x01U}) {
    as(flags);
    operation.roles = 0x3E;
    for (const char* inside : {kGroup, kMember, "CN=X,CN=ONE,CN=ADMINGROUP,CN=CONFIGURATION",
                               "CN=ADMINGROUP,CN=CONFIGURATION,O=ORV"}) {
      adding(inside, {});
      EXPECT_EQ(group(), 50) << flags << inside;
      EXPECT_THAT(asked(), IsEmpty());
      EXPECT_THAT(platform.debug_lines(), IsEmpty());
    }
  }
}

TEST_F(AddRules, BothFlagsMakeThePrimaryAdministratorWhateverElseIsSet) {
  as(kPrimary | kGroupMember);
  adding_member();
  EXPECT_EQ(group(), 0);
}

// ---- The container

TEST_F(AddRules, ContainerNeedsTopAndThenContainer) {
  adding(kGroup, {{"objectClass", {"top", "container"}}});
  EXPECT_EQ(group(), 0);
  EXPECT_THAT(asked(), ElementsAre("value_find(\"objectClass\", \"top\", 0, 1)",
                                   "value_find(\"objectClass\", \"container\", 0, 1)"));
  EXPECT_EQ(searches(), 0);
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
  adding(kGroup, {{"objectClass", {"top"}}});
  EXPECT_EQ(group(), 65);
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
  adding(kGroup, {{"objectClass", {"container"}}});
  EXPECT_EQ(group(), 65);
  EXPECT_EQ(asked().size(), 1U);
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
  adding(kGroup, {{"cn", {"x"}}});
  EXPECT_EQ(group(), 65);
  EXPECT_THAT(asked(), IsEmpty());
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
}

TEST_F(AddRules, OnlyTheContainersOwnDnIsTheContainer) {
  adding("CN=ADMINGROUP,CN=CONFIGURATION,O=ORV", {{"objectClass", {"top", "container"}}});
  EXPECT_EQ(group(), 65);
}

TEST_F(AddRules, ContainersAttributesAreNotLookedAt) {
  adding(kGroup, {{"objectClass", {"top", "container"}}, {"orv-slapdAdminDN", {"cn=taken"}}});
  EXPECT_EQ(group(), 0);
}

TEST_F(AddRules, ClassesMatchWhereTheServerSaysSo) {
  adding(kGroup, {{"objectClass", {"TOP", "CONTAINER"}}});
  platform.forget();
  platform.fail("value_find", 0, 0);
  EXPECT_EQ(
      platform.run([&] { return checkIfAdminGroupEntry(dn, e.get(), &connection, &operation); }),
      0);
}

TEST_F(AddRules, ClassesAreAbsentWhateverElseTheServerSays) {
  const std::vector<std::string> both = {"orv-slapdReplication", "orv-slapdSupplier"};
  const auto answered = [&](std::uint32_t identifier, auto rule) {
    platform.forget();
    platform.fail("value_find", 0, -1);
    return traced(identifier, rule);
  };
  adding(kGroup, {{"objectClass", {"top", "container"}}});
  EXPECT_EQ(answered(function_id::check_if_admin_group_entry,
                     [&] { return checkIfAdminGroupEntry(dn, e.get(), &connection, &operation); }),
            65);
  adding(kElsewhere, {{"objectClass", both}, {"orv-slapdMasterDN", {"cn=taken"}}});
  EXPECT_EQ(answered(function_id::check_if_repl_supplier_entry,
                     [&] { return checkIfReplSupplierEntry(dn, e.get(), &connection); }),
            68);
  adding(kElsewhere, {{"objectClass", both}, {"orv-slapdMasterPW", {"new"}}});
  EXPECT_EQ(answered(function_id::check_admin_policy_entry,
                     [&] { return checkAdminPolicyEntry(dn, e.get(), &connection, &operation); }),
            0);
  EXPECT_EQ(platform.count("verify_admin_password"), 1);
}

TEST_F(AddRules, ClassesAreThoseOfTheDirectReference) {
  adding(kGroup, {{"objectClass", {"top", "container"}}});
  e->object_classes = nullptr;
  EXPECT_EQ(group(), 65);
}

// ---- Members

TEST_F(AddRules, MemberNeedsItsClassesAndItsDnInOrder) {
  adding_member();
  EXPECT_EQ(group(), 0);
  EXPECT_THAT(asked(),
              ElementsAre("value_find(\"objectClass\", \"top\", 0, 1)",
                          "value_find(\"objectClass\", \"orv-slapdConfigEntry\", 0, 1)",
                          "value_find(\"objectClass\", \"orv-slapdAdminGroupMember\", 0, 1)",
                          "attr_find(\"orv-slapdAdminDN\", 0, 0)",
                          "attr_find(\"orv-slapdKrbAdminDN\", 0, 0)",
                          "attr_find(\"orv-slapdDigestAdminUser\", 0, 0)"));
  const Attributes with_dn = {{"orv-slapdAdminDN", {"cn=one"}}};
  for (const std::vector<std::string>& classes :
       {std::vector<std::string>{"top", "orv-slapdConfigEntry"},
        {"top", "orv-slapdAdminGroupMember"},
        {"orv-slapdConfigEntry", "orv-slapdAdminGroupMember"},
        {"top", "container"}}) {
    adding(kMember, {{"objectClass", classes}, with_dn[0]});
    EXPECT_EQ(group(), 65) << classes[0] << classes[1];
    EXPECT_EQ(searches(), 0);
  }
  adding(kMember, {{"objectClass", {"top", "orv-slapdConfigEntry", "orv-slapdAdminGroupMember"}}});
  EXPECT_EQ(group(), 65);
  EXPECT_EQ(searches(), 0);
}

TEST_F(AddRules, MembersDnMustBeNobodysElse) {
  const auto with_dn = [&](const char* bind_dn) {
    adding_member();
    adding(kMember, {{"objectClass", {"top", "orv-slapdConfigEntry", "orv-slapdAdminGroupMember"}},
                     {"orv-slapdAdminDN", {bind_dn, "cn=taken"}}});
    return group();
  };
  EXPECT_EQ(with_dn("CN = Root"), 68);
  EXPECT_EQ(with_dn("CN = Taken"), 68);
  EXPECT_THAT(platform.calls({"cfg_search_s"}), Not(Contains(testing::HasSubstr("Replication"))));
  EXPECT_EQ(with_dn("CN = Master"), 68);
  EXPECT_EQ(with_dn("CN = Supplier"), 68);
  EXPECT_EQ(with_dn("cn=one"), 0);
}

TEST_F(AddRules, MembersRulesComeInTheirOrder) {
  adding_member({{"orv-slapdDigestAdminUser", {"one"}}, {"orv-slapdKrbAdminDN", {"orv-kn=one"}}});
  EXPECT_EQ(group(), 0);
  std::vector<std::string> bases;
  for (const std::string& call : platform.calls({"cfg_search_s"})) {
    const std::size_t begin = call.find('"') + 1;
    bases.push_back(call.substr(begin, call.find('"', begin) - begin));
  }
  EXPECT_THAT(bases, ElementsAre(kConfiguration, kGroup, kConfiguration, kConfiguration, kKerberos,
                                 kGroup, kDigest, kGroup));
}

TEST_F(AddRules, FailureOfOneOfTheMembersRulesEndsThem) {
  adding_member({{"orv-slapdDigestAdminUser", {"one"}}, {"orv-slapdKrbAdminDN", {"orv-kn=one"}}});
  platform.file[kReplicationSearch].code = 3;
  EXPECT_EQ(group(), 3);
  EXPECT_EQ(platform.calls({"attr_find"}).size(), 1U);
  platform.file.erase(kConfiguration);
  EXPECT_EQ(group(), 80);
  EXPECT_EQ(searches(), 1);
}

TEST_F(AddRules, MembersKerberosIdentityHasOneOfTwoPrefixesInAnyLetterCase) {
  for (const char* value : {"orv-kerberosName=x", "ORV-KERBEROSNAME=x", "orv-kn=x", "ORV-KN=x",
                            "Orv-Kn=", "orv-kn== "}) {
    adding_member({{"orv-slapdKrbAdminDN", {value}}});
    EXPECT_EQ(group(), 0) << value;
  }
  for (const char* value : {"cn=x", "orv-kn", "orv-kerberosName", " orv-kn=x", "orv-kn =x",
                            "orv-kerberosNam=x", "", "x,orv-kn=x"}) {
    adding_member({{"orv-slapdKrbAdminDN", {value}}});
    EXPECT_EQ(group(), 80) << value;
    EXPECT_EQ(platform.debug_lines().back(),
              error("Bad value for Kerberos Admin Group Member DN\n"));
    EXPECT_THAT(platform.calls({"cfg_search_s"}), Not(Contains(testing::HasSubstr("KERBEROS"))));
  }
}

TEST_F(AddRules, MembersKerberosIdentityMustBeFree) {
  adding_member({{"orv-slapdKrbAdminDN", {"orv-kerberosName=TAKEN@realm", "x"}},
                 {"orv-slapdDigestAdminUser", {"one"}}});
  EXPECT_EQ(group(), 68);
  EXPECT_THAT(platform.calls({"attr_find"}), Not(Contains(testing::HasSubstr("Digest"))));
}

TEST_F(AddRules, KerberosIdentitiesAreComparedWithTheirPrefix) {
  found(kGroup, {{"orv-slapdKrbAdminDN", {"orv-kn=a=b"}}});
  adding_member({{"orv-slapdKrbAdminDN", {"orv-kerberosName=a=b"}}});
  EXPECT_EQ(group(), 68);
  adding(kKerberos,
         {{"objectClass", {"orv-slapdKerberos"}}, {"orv-slapdKrbAdminDN", {"orv-kn=a=b"}}});
  EXPECT_EQ(kerberos(), 68);
}

TEST_F(AddRules, BadKerberosIdentityEndsBeforeTheDigestUser) {
  adding_member(
      {{"orv-slapdKrbAdminDN", {"x", "orv-kn=x"}}, {"orv-slapdDigestAdminUser", {"taken"}}});
  EXPECT_EQ(group(), 80);
  EXPECT_THAT(platform.calls({"attr_find"}), Not(Contains(testing::HasSubstr("Digest"))));
}

TEST_F(AddRules, MembersDigestUserMustBeFree) {
  adding_member({{"orv-slapdDigestAdminUser", {"taken", "one"}}});
  EXPECT_EQ(group(), 68);
  adding_member({{"orv-slapdDigestAdminUser", {"one", "taken"}}});
  EXPECT_EQ(group(), 0);
}

TEST_F(AddRules, AttributesWithoutValuesAreNullCandidates) {
  for (const bool null_lists : {false, true}) {
    platform.empty_lists_are_null = null_lists;
    adding(kMember, {{"objectClass", {"top", "orv-slapdConfigEntry", "orv-slapdAdminGroupMember"}},
                     {"orv-slapdAdminDN", {}}});
    EXPECT_EQ(group(), 80);
    EXPECT_THAT(platform.debug_lines(), ElementsAre(null_line()));
    adding_member({{"orv-slapdKrbAdminDN", {}}});
    EXPECT_EQ(group(), 80);
    EXPECT_EQ(platform.debug_lines().back(),
              error("Bad value for Kerberos Admin Group Member DN\n"));
    adding_member({{"orv-slapdDigestAdminUser", {}}});
    EXPECT_EQ(group(), 80);
    EXPECT_EQ(platform.debug_lines().back(), null_line());
    adding(kElsewhere, {{"objectClass", {"top"}}, {"orv-slapdMasterDN", {}}});
    EXPECT_EQ(supplier(), 80);
    adding(kElsewhere, {{"orv-slapdProxySplitName", {}}});
    EXPECT_EQ(proxy(), 21);
    adding(kMember, {{"orv-slapdAdminPW", {}}});
    EXPECT_EQ(policy(), 0);
  }
}

// ---- Suppliers

TEST_F(AddRules, SuppliersDnMustBeNoAdministrators) {
  for (const std::vector<std::string>& classes :
       {std::vector<std::string>{"orv-slapdSupplier"}, {"orv-slapdReplication"}, {"top"}}) {
    for (const unsigned flags : {kPrimary, kGroupMember, 0x24U}) {
      as(flags);
      adding(kElsewhere, {{"objectClass", classes}, {"orv-slapdMasterDN", {"CN = Taken", "x"}}});
      EXPECT_EQ(supplier(), 68) << classes[0];
      adding(kElsewhere, {{"objectClass", classes}, {"orv-slapdMasterDN", {"cn=root"}}});
      EXPECT_EQ(supplier(), 68) << classes[0];
      adding(kElsewhere,
             {{"objectClass", classes}, {"orv-slapdMasterDN", {"cn=master", "cn=taken"}}});
      EXPECT_EQ(supplier(), 0) << classes[0];
    }
  }
}

TEST_F(AddRules, OnlyBothClassesTogetherExemptASupplier) {
  adding(kElsewhere, {{"objectClass", {"orv-slapdSupplier", "orv-slapdReplication"}},
                      {"orv-slapdMasterDN", {"cn=taken"}}});
  EXPECT_EQ(supplier(), 0);
  EXPECT_THAT(asked(), ElementsAre("value_find(\"objectClass\", \"orv-slapdReplication\", 0, 1)",
                                   "value_find(\"objectClass\", \"orv-slapdSupplier\", 0, 1)"));
  EXPECT_EQ(searches(), 0);
}

TEST_F(AddRules, SupplierRuleNeedsClassesAndADn) {
  adding(kElsewhere, {{"orv-slapdMasterDN", {"cn=taken"}}});
  EXPECT_EQ(supplier(), 0);
  EXPECT_THAT(platform.calls(), IsEmpty());
  adding(kElsewhere, {{"objectClass", {"orv-slapdSupplier"}}});
  EXPECT_EQ(supplier(), 0);
  EXPECT_EQ(searches(), 0);
}

TEST_F(AddRules, SupplierRuleDoesNotDependOnTheDn) {
  for (const char* anywhere : {kMember, kKerberos, ""}) {
    adding(anywhere, {{"objectClass", {"top"}}, {"orv-slapdMasterDN", {"cn=taken"}}});
    EXPECT_EQ(supplier(), 68) << anywhere;
  }
}

// ---- Kerberos

TEST_F(AddRules, KerberosRuleIsForItsEntryAlone) {
  as(0x24);
  for (const char* other : {kElsewhere, "CN=X,CN=KERBEROS,CN=CONFIGURATION",
                            "CN=KERBEROS,CN=CONFIGURATION,O=ORV", "CN=KERBEROS"}) {
    adding(other, {});
    EXPECT_EQ(kerberos(), 0) << other;
  }
  adding(kKerberos, {});
  EXPECT_EQ(kerberos(), 50);
}

TEST_F(AddRules, KerberosAndDigestAreForThePrimaryAdministratorAlone) {
  for (const unsigned flags : {0x00U, 0x04U, 0x08U, kGroupMember, 0x24U}) {
    as(flags);
    operation.roles = 0x3E;
    adding(kKerberos, {});
    EXPECT_EQ(kerberos(), 50) << flags;
    EXPECT_THAT(platform.debug_lines(), IsEmpty()) << flags;
    adding(kDigest, {});
    EXPECT_EQ(digest(), 50) << flags;
    EXPECT_THAT(platform.debug_lines(), IsEmpty()) << flags;
    EXPECT_THAT(asked(), IsEmpty());
  }
}

TEST_F(AddRules, KerberosEntryNeedsItsClassAndItsIdentity) {
  for (const Attributes& attributes :
       {Attributes{{"orv-slapdKrbAdminDN", {"orv-kn=x"}}},
        {{"objectClass", {"top"}}, {"orv-slapdKrbAdminDN", {"orv-kn=x"}}},
        {{"objectClass", {"orv-slapdKerberos"}}}}) {
    adding(kKerberos, attributes);
    EXPECT_EQ(kerberos(), 65);
    EXPECT_EQ(searches(), 0);
    EXPECT_THAT(platform.debug_lines(), IsEmpty());
  }
  adding(kKerberos,
         {{"objectClass", {"orv-slapdKerberos"}}, {"orv-slapdKrbAdminDN", {"orv-kn=x"}}});
  EXPECT_EQ(kerberos(), 0);
  EXPECT_THAT(asked(), ElementsAre("value_find(\"objectClass\", \"orv-slapdKerberos\", 0, 1)",
                                   "attr_find(\"orv-slapdKrbAdminDN\", 0, 0)"));
}

TEST_F(AddRules, KerberosIdentityOfTheRootHasAPrefixAndIsFree) {
  const auto with = [&](const char* value) {
    adding(kKerberos,
           {{"objectClass", {"orv-slapdKerberos"}}, {"orv-slapdKrbAdminDN", {value, "orv-kn=x"}}});
    return kerberos();
  };
  EXPECT_EQ(with("ORV-KN=x"), 0);
  EXPECT_EQ(with("ORV-KERBEROSNAME=x"), 0);
  EXPECT_EQ(with("orv-kn=Taken@realm"), 68);
  for (const char* bad : {"cn=taken@realm", "orv-kn", ""}) {
    EXPECT_EQ(with(bad), 80) << bad;
    EXPECT_THAT(platform.debug_lines(),
                ElementsAre(error("Bad value for Kerberos Root Administrator DN\n")));
    EXPECT_EQ(searches(), 0);
  }
}

// ---- Digest-MD5

TEST_F(AddRules, DigestRuleIsForItsEntryAlone) {
  as(0x24);
  for (const char* other : {kElsewhere, "CN=X,CN=DIGEST,CN=CONFIGURATION",
                            "CN=DIGEST,CN=CONFIGURATION,O=ORV", "CN=DIGEST"}) {
    adding(other, {});
    EXPECT_EQ(digest(), 0) << other;
  }
  adding(kDigest, {});
  EXPECT_EQ(digest(), 50);
}

TEST_F(AddRules, DigestEntryNeedsItsClassButNoUser) {
  for (const Attributes& attributes : {Attributes{}, {{"objectClass", {"top"}}}}) {
    adding(kDigest, attributes);
    EXPECT_EQ(digest(), 65);
    EXPECT_THAT(platform.debug_lines(), IsEmpty());
  }
  adding(kDigest, {{"objectClass", {"orv-slapdDigest"}}});
  EXPECT_EQ(digest(), 0);
  EXPECT_EQ(searches(), 0);
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
  adding(kDigest,
         {{"objectClass", {"orv-slapdDigest"}}, {"orv-slapdDigestAdminUser", {"Taken", "taken"}}});
  EXPECT_EQ(digest(), 0);
  adding(kDigest, {{"objectClass", {"orv-slapdDigest"}}, {"orv-slapdDigestAdminUser", {"taken"}}});
  EXPECT_EQ(digest(), 68);
}

// ---- Proxy splits

TEST_F(AddRules, ProxyRuleConcernsEveryEntryWithASplitName) {
  adding(kMember, {});
  EXPECT_EQ(proxy(), 0);
  EXPECT_THAT(platform.calls(), ElementsAre("attr_find(\"orv-slapdProxySplitName\", 0, 0)"));
  adding(kMember, {{"orv-slapdProxySplitName", {"Split1", "x y"}}});
  EXPECT_EQ(proxy(), 0);
  EXPECT_EQ(searches(), 1);
}

TEST_F(AddRules, SplitNameMustBeAlphanumericBeforeAnySearch) {
  for (const char* bad : {"two words", "", "x-y", "x="}) {
    adding(kElsewhere, {{"orv-slapdProxySplitName", {bad, "good"}}});
    EXPECT_EQ(proxy(), 21) << bad;
    EXPECT_EQ(searches(), 0);
    EXPECT_EQ(platform.count("PrintMessage"), 0);
    EXPECT_THAT(platform.debug_lines(), IsEmpty());
  }
}

TEST_F(AddRules, SplitNameThatIsTakenIsAlsoToldInTheServerLog) {
  adding(kElsewhere, {{"orv-slapdProxySplitName", {"taken"}}});
  EXPECT_EQ(proxy(), 68);
  EXPECT_THAT(platform.calls({"is_string_alphanum", "cfg_search_s", "PrintMessage"}),
              ElementsAre("is_string_alphanum(\"taken\")", testing::HasSubstr("CN=PROXYDB"),
                          "PrintMessage(0, 8, 146)"));
  debug_off();  // on which the server log does not depend
  EXPECT_EQ(proxy(), 68);
  EXPECT_EQ(platform.count("PrintMessage"), 1);
}

TEST_F(AddRules, OtherFailuresOfTheSplitNameAreNotLogged) {
  adding(kElsewhere, {{"orv-slapdProxySplitName", {"taken"}}});
  platform.file[kProxies].code = 3;
  EXPECT_EQ(proxy(), 3);
  EXPECT_EQ(platform.count("PrintMessage"), 0);
}

// ---- Passwords

TEST_F(AddRules, PasswordOfEveryEntryInTheGroupIsVerified) {
  for (const char* inside : {kMember, kGroup, "CN=ADMINGROUP,CN=CONFIGURATION,O=ORV"}) {
    adding(inside, {{"objectClass", {"orv-slapdReplication", "orv-slapdSupplier"}},
                    {"orv-slapdMasterPW", {"other"}},
                    {"orv-slapdAdminPW", {"new", "second"}}});
    EXPECT_EQ(policy(), 0);
    EXPECT_THAT(platform.calls(), ElementsAre("attr_find(\"orv-slapdAdminPW\", 0, 0)",
                                              "verify_admin_password(\"new\", null, operation)"));
  }
}

TEST_F(AddRules, PasswordOfASupplierIsVerifiedUnlessItsFirstAttributeHasBothClasses) {
  const Attributes password = {{"orv-slapdMasterPW", {"new"}}};
  const auto verified = [&](Attributes attributes) {
    attributes.push_back(password[0]);
    adding(kElsewhere, attributes);
    EXPECT_EQ(policy(), 0);
    return platform.count("verify_admin_password") == 1;
  };
  EXPECT_TRUE(verified({{"objectClass", {"orv-slapdSupplier"}}}));
  EXPECT_TRUE(verified({{"objectClass", {"orv-slapdReplication"}}}));
  EXPECT_TRUE(verified({{"objectClass", {"top"}}}));
  EXPECT_TRUE(verified({}));
  EXPECT_FALSE(verified({{"objectClass", {"orv-slapdSupplier", "orv-slapdReplication"}}}));
  EXPECT_THAT(asked(), ElementsAre("value_find(\"objectClass\", \"orv-slapdReplication\", 0, 1)",
                                   "value_find(\"objectClass\", \"orv-slapdSupplier\", 0, 1)"));
  // The first attribute counts, not the object classes.
  EXPECT_TRUE(
      verified({{"cn", {"x"}}, {"objectClass", {"orv-slapdSupplier", "orv-slapdReplication"}}}));
  EXPECT_FALSE(verified({{"cn", {"orv-slapdSupplier", "orv-slapdReplication"}}}));
}

TEST_F(AddRules, AdministratorsPasswordOutsideTheGroupIsNotVerified) {
  adding(kElsewhere, {{"objectClass", {"top"}}, {"orv-slapdAdminPW", {"new"}}});
  EXPECT_EQ(policy(), 0);
  EXPECT_EQ(platform.count("verify_admin_password"), 0);
}

TEST_F(AddRules, EntryWithoutAttributesHasNoPassword) {
  adding(kElsewhere, {});
  EXPECT_EQ(policy(), 0);
  EXPECT_THAT(platform.calls(), IsEmpty());
  adding(kMember, {});
  EXPECT_EQ(policy(), 0);
}

TEST_F(AddRules, AbsentAndEmptyPasswordsPass) {
  for (const Attributes& attributes : {Attributes{{"cn", {"x"}}},
                                       {{"orv-slapdAdminPW", {}}},
                                       {{"orv-slapdAdminPW", {"", "new"}}}}) {
    adding(kMember, attributes);
    EXPECT_EQ(policy(), 0);
    EXPECT_EQ(platform.count("verify_admin_password"), 0);
  }
  adding(kMember, {{"orv-slapdAdminPW", {"x"}}});
  std::free(e->attributes->values[0]->bv_val);
  e->attributes->values[0]->bv_val = nullptr;
  e->attributes->values[0]->bv_len = 0;
  EXPECT_EQ(policy(), 0);
  EXPECT_EQ(platform.count("verify_admin_password"), 0);
}

TEST_F(AddRules, CodeOfThePolicyIsReturnedUnchanged) {
  for (const int code : {19, 53, -1}) {
    adding(kMember, {{"orv-slapdAdminPW", {"new"}}});
    platform.forget();
    platform.fail("verify_admin_password", 1, code);
    EXPECT_EQ(policy_of_the_script(), code);
  }
}

TEST_F(AddRules, PolicyMayWriteOverWhatItGets) {
  platform.password_is_overwritten = true;
  adding(kMember, {{"orv-slapdAdminPW", {"new"}}});
  EXPECT_EQ(policy(), 0);
  EXPECT_STREQ(e->attributes->values[0]->bv_val, "new");
}

TEST_F(AddRules, PolicyGetsACopyThatIsReleased) {
  adding(kMember, {{"orv-slapdAdminPW", {"new"}}});
  platform.forget();
  platform.name_allocation(1, "copy");
  platform.at("verify_admin_password", 1, [&] {
    EXPECT_EQ(platform.count("free"), 0);
    EXPECT_EQ(platform.allocations(), 1);
  });
  EXPECT_EQ(policy_of_the_script(), 0);
  EXPECT_EQ(platform.count("free"), 1);
}

TEST_F(AddRules, PasswordThatCannotBeCopiedGives90) {
  adding(kMember, {{"orv-slapdAdminPW", {"new"}}});
  platform.forget();
  platform.fail_allocation(1);
  EXPECT_EQ(policy_of_the_script(), 90);
  EXPECT_EQ(platform.count("verify_admin_password"), 0);
}

// ---- Trace

TEST_F(AddRules, NothingIsTracedWhenNotDebugging) {
  debug_off();
  adding_member({{"orv-slapdKrbAdminDN", {"x"}}});
  EXPECT_EQ(group(), 80);
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
  adding(kKerberos, {{"objectClass", {"orv-slapdKerberos"}}, {"orv-slapdKrbAdminDN", {"x"}}});
  EXPECT_EQ(kerberos(), 80);
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
}

TEST_F(AddRules, ExitRecordsCarryTheCodes) {
  trcEvents = 0x00020000;
  adding(kGroup, {});
  group();
  EXPECT_EQ(last_record(), "exit 01020b00 65");
  adding(kElsewhere, {{"objectClass", {"top"}}, {"orv-slapdMasterDN", {"cn=taken"}}});
  supplier();
  EXPECT_EQ(last_record(), "exit 01020c00 68");
  adding(kKerberos, {});
  kerberos();
  EXPECT_EQ(last_record(), "exit 01020d00 65");
  adding(kDigest, {});
  digest();
  EXPECT_EQ(last_record(), "exit 01020e00 65");
  adding(kElsewhere, {{"orv-slapdProxySplitName", {"-"}}});
  proxy();
  EXPECT_EQ(last_record(), "exit 01020f00 21");
  dn = nullptr;
  policy();
  EXPECT_EQ(last_record(), "exit 01021000 80");
}

}  // namespace
}  // namespace orv
