// What a modification must leave of the administrators' identities, and who may make it.
#include "backend_test.h"
#include "config_modify.h"

namespace orv {
namespace {

using Attributes = std::vector<scripted::ScriptedAttribute>;
using Script = std::vector<scripted::ScriptedModification>;
using Values = std::optional<std::vector<std::string>>;

constexpr const char* kConfiguration = "CN=CONFIGURATION";
constexpr const char* kGroup = "CN=ADMINGROUP,CN=CONFIGURATION";
constexpr const char* kMember = "CN=ME,CN=ADMINGROUP,CN=CONFIGURATION";
constexpr const char* kKerberos = "CN=KERBEROS,CN=CONFIGURATION";
constexpr const char* kDigest = "CN=DIGEST,CN=CONFIGURATION";
constexpr const char* kMasterServer = "CN=MASTER SERVER,CN=CONFIGURATION";
constexpr const char* kAuditLog = "CN=AUDIT,CN=LOG MANAGEMENT,CN=CONFIGURATION";
constexpr const char* kPolicy = "CN=PWDPOLICY ADMIN,CN=CONFIGURATION";
constexpr const char* kOther = "CN=DEFAULT,CN=LOG MANAGEMENT,CN=CONFIGURATION";
constexpr const char* kProxies =
    "CN=PROXYDB,CN=PROXY BACKENDS,CN=ORV DIRECTORY,CN=SCHEMAS,CN=CONFIGURATION";
constexpr const char* kReplication = "CN=CONFIGURATION?objectclass=orv-slapdReplication";
constexpr const char* kSuppliers = "CN=CONFIGURATION?objectclass=orv-slapdSupplier";

class ModifyRule : public BackendTest {
 protected:
  ModifyRule() {
    session = open_session();
    file(kConfiguration, {{"orv-slapdAdminDN", {"cn=root"}}, {"orv-slapdAdminPW", {"secret"}}});
    file(kGroup, {{"orv-slapdAdminDN", {"cn=one"}},
                  {"orv-slapdKrbAdminDN", {"orv-kn=one@R"}},
                  {"orv-slapdDigestAdminUser", {"one"}}});
    file(kSuppliers, {{"orv-slapdMasterDN", {"cn=supplier"}}});
    file(kKerberos, {{"orv-slapdKrbAdminDN", {"orv-kn=root@R"}}});
    file(kDigest, {{"orv-slapdDigestAdminUser", {"root"}}});
    file(kProxies, {{"orv-slapdProxySplitName", {"split1"}}});
    as(0x0C);
  }
  void TearDown() override {
    free_ldmll(modifications);
    EXPECT_THAT(platform.leaks(), ElementsAre("session"));
    EXPECT_EQ(platform.count("pthread_mutex_lock") + platform.count("cfg_modify_s"), 0);
    close_session();
    BackendTest::TearDown();
  }

  void file(const char* base, Attributes attributes, int code = 0) {
    platform.file[base] = {{{base, std::move(attributes)}}, code};
  }
  ldapmod* make(const Script& script) {
    free_ldmll(modifications);
    return modifications = scripted::make_modifications(script);
  }
  [[nodiscard]] std::string list() const { return scripted::text_of(modifications); }
  [[nodiscard]] std::vector<DebugLine> errors() const {
    std::vector<DebugLine> lines;
    for (const DebugLine& line : platform.debug_lines()) {
      if (line.category == 0xC8110000U) lines.push_back(line);
    }
    return lines;
  }
  [[nodiscard]] std::vector<std::string> searches() const {
    return platform.calls({"cfg_search_s"});
  }

  // Of the rules only the primary administrator's may rewrite the list.
  template <typename Function>
  int untouched(std::uint32_t function, Function rule) {
    const std::string before = list();
    const int rc = traced(function, rule);
    EXPECT_EQ(list(), before);
    return rc;
  }

  int member(const char* dn, const Script& script, const char* bound_dn = "CN=ME") {
    make(script);
    return untouched(0x01030700, [&] {
      return checkIfAdminGroupCanModify(&connection, dn, bound_dn, modifications);
    });
  }
  int root(const char* dn, const Script& script) {
    make(script);
    return traced(0x01030800, [&] { return checkRootAdminModify(session, dn, modifications); });
  }
  int kerberos(const char* dn, const Script& script) {
    make(script);
    return untouched(0x01030900,
                     [&] { return checkKerberosModify(&operation, session, dn, modifications); });
  }
  int digest(const char* dn, const Script& script) {
    make(script);
    return untouched(0x01030a00,
                     [&] { return checkDigestModify(&operation, session, dn, modifications); });
  }
  int supplier(const char* dn, const Script& script) {
    make(script);
    return untouched(0x01030b00, [&] {
      return checkReplSupplierModify(&connection, session, dn, modifications);
    });
  }
  int proxy(const Script& script) {
    make(script);
    return untouched(0x01030c00,
                     [&] { return checkProxyNameModify(session, kOther, modifications); });
  }

  _CFG* session;
  ldapmod* modifications = nullptr;
};

// ======== Modifications by type

using ModificationsByType = ModifyRule;

TEST_F(ModificationsByType, FirstOfTheTypeIsFoundInAnyLetterCase) {
  make({{kDelete, "cn", std::nullopt}, {kAdd, "SN", {{"a"}}}, {kDelete, "sn", {{"b"}}}});
  platform.run([&] {
    EXPECT_EQ(getModAttribute("sn", modifications), modifications->mod_next);
    EXPECT_EQ(getModAttribute("CN", modifications), modifications);
    EXPECT_EQ(getModAttribute("s", modifications), nullptr);
    EXPECT_EQ(doesModAttributeExists("sN", modifications), 1);
    EXPECT_EQ(doesModAttributeExists("snx", modifications), 0);
    return 0;
  });
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
}

TEST_F(ModificationsByType, NullArgumentFindsNothingAndIsTold) {
  make({{kAdd, "cn", {{"a"}}}});
  platform.run([&] {
    EXPECT_EQ(getModAttribute(nullptr, modifications), nullptr);
    EXPECT_EQ(getModAttribute("cn", nullptr), nullptr);
    EXPECT_EQ(doesModAttributeExists(nullptr, modifications), 0);
    EXPECT_EQ(doesModAttributeExists("cn", nullptr), 0);
    return 0;
  });
  EXPECT_THAT(platform.debug_lines(), testing::ElementsAreArray(std::vector<DebugLine>(
                                          4, error("Invalid NULL pointer passed through.\n"))));
}

TEST_F(ModificationsByType, LeaveExitRecords) {
  trcEvents = kTraceExit & ~kTraceEntry;
  make({{kAdd, "cn", {{"a"}}}});
  platform.run([&] {
    doesModAttributeExists("cn", modifications);
    doesModAttributeExists("sn", modifications);
    getModAttribute("cn", modifications);
    return 0;
  });
  EXPECT_THAT(platform.records(),
              ElementsAre("exit 01030d00 1", "exit 01030d00 0", "exit 01030e00 0"));
}

// ======== Null arguments

struct TracedCall {
  std::uint32_t function;
  std::function<int()> call;
};

TEST_F(ModifyRule, NullArgumentGives80WithItsText) {
  ldapmod* const m = make({{kAdd, "cn", {{"a"}}}});
  const TracedCall calls[] = {
      {0x01030700, [&] { return checkIfAdminGroupCanModify(nullptr, kOther, "", m); }},
      {0x01030700, [&] { return checkIfAdminGroupCanModify(&connection, nullptr, "", m); }},
      {0x01030700, [&] { return checkIfAdminGroupCanModify(&connection, kOther, nullptr, m); }},
      {0x01030700, [&] { return checkIfAdminGroupCanModify(&connection, kOther, "", nullptr); }},
      {0x01030800, [&] { return checkRootAdminModify(nullptr, kOther, m); }},
      {0x01030800, [&] { return checkRootAdminModify(session, nullptr, m); }},
      {0x01030800, [&] { return checkRootAdminModify(session, kOther, nullptr); }},
      {0x01030900, [&] { return checkKerberosModify(nullptr, session, kOther, m); }},
      {0x01030900, [&] { return checkKerberosModify(&operation, nullptr, kOther, m); }},
      {0x01030900, [&] { return checkKerberosModify(&operation, session, nullptr, m); }},
      {0x01030900, [&] { return checkKerberosModify(&operation, session, kOther, nullptr); }},
      {0x01030a00, [&] { return checkDigestModify(nullptr, session, kOther, m); }},
      {0x01030a00, [&] { return checkDigestModify(&operation, nullptr, kOther, m); }},
      {0x01030a00, [&] { return checkDigestModify(&operation, session, nullptr, m); }},
      {0x01030a00, [&] { return checkDigestModify(&operation, session, kOther, nullptr); }},
      {0x01030b00, [&] { return checkReplSupplierModify(nullptr, session, kOther, m); }},
      {0x01030b00, [&] { return checkReplSupplierModify(&connection, nullptr, kOther, m); }},
      {0x01030b00, [&] { return checkReplSupplierModify(&connection, session, nullptr, m); }},
      {0x01030b00, [&] { return checkReplSupplierModify(&connection, session, kOther, nullptr); }},
  };
  for (const auto& [function, call] : calls) {
    platform.forget();
    EXPECT_EQ(traced(function, call), 80);
    EXPECT_THAT(platform.debug_lines(),
                ElementsAre(error("Invalid NULL pointer passed through.\n")));
    EXPECT_THAT(platform.calls(), IsEmpty());
    debug_off();
    EXPECT_EQ(traced(function, call), 80);
    debug_on();
  }
}

TEST_F(ModifyRule, NullArgumentOfTheSplitNameHasATextOfItsOwn) {
  ldapmod* const m = make({{kAdd, "orv-slapdProxySplitName", {{"a"}}}});
  const TracedCall calls[] = {
      {0x01030c00, [&] { return checkProxyNameModify(nullptr, kOther, m); }},
      {0x01030c00, [&] { return checkProxyNameModify(session, nullptr, m); }},
      {0x01030c00, [&] { return checkProxyNameModify(session, kOther, nullptr); }},
  };
  for (const auto& [function, call] : calls) {
    platform.forget();
    EXPECT_EQ(traced(function, call), 80);
    EXPECT_THAT(platform.debug_lines(),
                ElementsAre(error("checkProxynameModify::Invalid NULL pointer passed through.\n")));
    EXPECT_THAT(platform.calls(), IsEmpty());
    debug_off();
    EXPECT_EQ(traced(function, call), 80);
    debug_on();
  }
}

// ======== Without memory

TEST_F(ModifyRule, EachFailingAllocationRefusesAnIdentityAndLeaksNothing) {
  file(kMember, {{"orv-slapdAdminDN", {"cn=me"}}, {"orv-slapdAdminRole", {"AuditAdmin"}}});
  const std::function<int()> rules[] = {
      [&] {
        return member(kMember, {{kReplace, "orv-slapdAdminPW", {{"x"}}}});
      },
      [&] {
        return root(kMember, {{kReplace, "orv-slapdAdminDN", {{"cn=new"}}}});
      },
      [&] {
        return supplier(kOther, {{kReplace, "orv-slapdMasterDN", {{"cn=new"}}}});
      },
      [&] {
        return proxy({{kReplace, "orv-slapdProxySplitName", {{"split2"}}}});
      },
  };
  for (const auto& rule : rules) {
    for (int nth = 1;; ++nth) {
      SCOPED_TRACE(nth);
      ASSERT_LT(nth, 200);
      platform.forget();
      platform.fail_allocation(nth);
      const int rc = rule();
      if (platform.allocations() < nth) {
        EXPECT_GT(nth, 4);
        EXPECT_EQ(rc, 0);
        break;
      }
      EXPECT_NE(rc, 0);
      platform.forget();
      platform.fail_allocations_from(nth);
      EXPECT_NE(rule(), 0);
      free_ldmll(modifications);
      modifications = nullptr;
      EXPECT_THAT(platform.leaks(), ElementsAre("session"));
    }
  }
}

// ======== Members of the group

using MemberModify = ModifyRule;

TEST_F(MemberModify, ContainerOfTheGroupIsNotForMembers) {
  EXPECT_EQ(member(kGroup, {{kReplace, "orv-slapdAdminPW", {{"x"}}}}), 50);
  EXPECT_THAT(searches(), IsEmpty());
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
}

TEST_F(MemberModify, AuditLogAsksForTheAuditBitOfTheConnection) {
  operation.roles = 0x3E;
  for (const unsigned roles : {0U, 0x3CU}) {
    connection.roles = roles;
    EXPECT_EQ(member(kAuditLog, {{kReplace, "orv-slapdLog", {{"/x"}}}}), 50);
  }
  operation.roles = 0;
  connection.roles = 0x02;
  EXPECT_EQ(member(kAuditLog, {{kReplace, "orv-slapdLog", {{"/x"}}}}), 0);
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
}

TEST_F(MemberModify, TopEntryIsOpenButForThreeAttributes) {
  for (const char* type :
       {"orv-slapdAdminDN", "orv-slapdAdminPW", "orv-slapdAdminGroupEnabled", "ORV-SLAPDADMINPW"}) {
    for (const int code : {kAdd, kDelete, kReplace}) {
      EXPECT_EQ(member(kConfiguration, {{kReplace, "cn", {{"x"}}}, {code, type, {{"x"}}}}), 50);
    }
  }
  EXPECT_EQ(member(kConfiguration, {{kReplace, "orv-slapdIpAddress", {{"::1"}}}}), 0);
  EXPECT_THAT(searches(), IsEmpty());
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
}

TEST_F(MemberModify, TopEntrysAttributesAreLookedForInTheirOrder) {
  EXPECT_EQ(member(kConfiguration, {{kReplace, "cn", {{"x"}}}}), 0);
  EXPECT_THAT(platform.calls({"kel_strcasecmp"}),
              ElementsAre("kel_strcasecmp(\"cn\", \"orv-slapdAdminDN\")",
                          "kel_strcasecmp(\"cn\", \"orv-slapdAdminPW\")",
                          "kel_strcasecmp(\"cn\", \"orv-slapdAdminGroupEnabled\")"));
}

TEST_F(MemberModify, OwnPasswordMayBeChangedWithAnyCode) {
  file(kMember, {{"orv-slapdAdminDN", {"cn = me"}}});
  for (const int code : {kAdd, kDelete, kReplace}) {
    EXPECT_EQ(member(kMember, {{code, "ORV-slapdAdminPW", {{"x"}}}}), 0);
  }
  EXPECT_THAT(searches(),
              Contains("cfg_search_s(session, \"CN=ME,CN=ADMINGROUP,CN=CONFIGURATION\", 0, "
                       "\"objectclass=*\", null, 0)"));
}

TEST_F(MemberModify, PasswordOfAnotherMemberMayNotBeChanged) {
  file(kMember, {{"orv-slapdAdminDN", {"cn=me"}}});
  for (const char* caller : {"CN=YOU", "cn=me", "CN=M", "CN=ME,O=X", ""}) {
    EXPECT_EQ(member(kMember, {{kReplace, "orv-slapdAdminPW", {{"x"}}}}, caller), 50) << caller;
  }
  EXPECT_THAT(errors(), IsEmpty());
}

TEST_F(MemberModify, OwnEntryTakesExactlyOneModificationOfThePassword) {
  file(kMember, {{"orv-slapdAdminDN", {"cn=me"}}});
  EXPECT_EQ(member(kMember,
                   {{kDelete, "orv-slapdAdminPW", {{"x"}}}, {kAdd, "orv-slapdAdminPW", {{"y"}}}}),
            50);
  EXPECT_EQ(member(kMember, {{kReplace, "orv-slapdAdminRole", {{"AuditAdmin"}}}}), 50);
  EXPECT_EQ(member(kMember, {{kReplace, "orv-slapdAdminPWX", {{"x"}}}}), 50);
  EXPECT_THAT(searches(), IsEmpty());
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
}

TEST_F(MemberModify, MemberWhoseBindDnCannotBeToldGives80) {
  EXPECT_EQ(member(kMember, {{kReplace, "orv-slapdAdminPW", {{"x"}}}}), 80);
  file(kMember, {{"cn", {"me"}}});
  EXPECT_EQ(member(kMember, {{kReplace, "orv-slapdAdminPW", {{"x"}}}}), 80);
}

TEST_F(MemberModify, PasswordPolicyIsNotForMembersAndTheRestIs) {
  EXPECT_EQ(member(kPolicy, {{kReplace, "pwdMinLength", {{"1"}}}}), 50);
  EXPECT_EQ(member(kOther, {{kReplace, "orv-slapdAdminPW", {{"x"}}}}), 0);
  EXPECT_EQ(member("CN=X,CN=PWDPOLICY ADMIN,CN=CONFIGURATION", {{kReplace, "cn", {{"x"}}}}), 0);
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
}

TEST_F(MemberModify, NamesAreComparedByteForByteAndWhole) {
  const Script password = {{kReplace, "orv-slapdAdminPW", {{"x"}}}};
  for (const char* dn : {"cn=admingroup,cn=configuration", "cn=configuration", "CN=CONFIGURATIO",
                         "CN=A,CN=AUDIT,CN=LOG MANAGEMENT,CN=CONFIGURATION",
                         "cn=pwdpolicy admin,cn=configuration"}) {
    EXPECT_EQ(member(dn, password), 0) << dn;
  }
  // The group's may stand anywhere in the name.
  for (const char* dn :
       {"CN=ME,CN=ADMINGROUP,CN=CONFIGURATION,O=X", "XCN=ADMINGROUP,CN=CONFIGURATION"}) {
    EXPECT_EQ(member(dn, {{kReplace, "cn", {{"x"}}}}), 50) << dn;
  }
}

TEST_F(MemberModify, LeavesExitRecords) {
  trcEvents = kTraceExit & ~kTraceEntry;
  member(kPolicy, {{kAdd, "cn", {{"x"}}}});
  member(kOther, {{kAdd, "cn", {{"x"}}}});
  EXPECT_THAT(platform.records(), ElementsAre("exit 01030700 50", "exit 01030700 0"));
}

// ======== The primary administrator

using RootModify = ModifyRule;

TEST_F(RootModify, OtherEntriesAreNoConcern) {
  for (const char* dn : {kOther, kKerberos, "cn=configuration", "cn=x,cn=admingroup"}) {
    EXPECT_EQ(root(dn, {{kReplace, "orv-slapdAdminDN", {{"cn=root"}}},
                        {kReplace, "orv-slapdAdminRole", {{"x"}}},
                        {kReplace, "orv-slapdKrbAdminDN", {{"x"}}}}),
              0);
  }
  EXPECT_THAT(searches(), IsEmpty());
}

TEST_F(RootModify, GroupsNameMayStandAnywhereInThatOfTheEntry) {
  for (const char* dn :
       {"CN=ME,CN=ADMINGROUP,CN=CONFIGURATION,O=X", "XCN=ADMINGROUP,CN=CONFIGURATION"}) {
    EXPECT_EQ(root(dn, {{kReplace, "orv-slapdKrbAdminDN", {{"x"}}}}), 80) << dn;
  }
}

TEST_F(RootModify, BindDnIsHeldAgainstAdministratorsAndThenSuppliers) {
  for (const char* dn : {kConfiguration, kMember}) {
    for (const int code : {kAdd, kReplace}) {
      platform.forget();
      EXPECT_EQ(root(dn, {{code, "ORV-SLAPDADMINDN", {{"cn=one"}}}}), 68);
      EXPECT_EQ(root(dn, {{code, "orv-slapdAdminDN", {{"cn=supplier", "cn=one"}}}}), 68);
      EXPECT_EQ(errors().back(),
                error("Error: Tried to add a DN that already belongs to a replication supplier. "));
      platform.forget();
      EXPECT_EQ(root(dn, {{code, "orv-slapdAdminDN", {{"cn=new", "cn=one"}}}}), 0);
      EXPECT_EQ(searches().size(), 4U);
    }
  }
}

TEST_F(RootModify, DeletedBindDnsAndThoseWithoutValuesAreNotLookedAt) {
  for (const Script& script : {Script{{kDelete, "orv-slapdAdminDN", {{"cn=one"}}}},
                               Script{{kReplace, "orv-slapdAdminDN", std::nullopt}},
                               Script{{kReplace, "orv-slapdAdminDN", Values(Values::value_type{})}},
                               Script{{kReplace, "cn", {{"cn=one"}}}}}) {
    EXPECT_EQ(root(kConfiguration, script), 0);
  }
  EXPECT_THAT(searches(), IsEmpty());
}

TEST_F(RootModify, FirstSettingWithValuesCountsAlsoBehindADelete) {
  EXPECT_EQ(root(kMember, {{kDelete, "orv-slapdAdminDN", {{"cn=me"}}},
                           {kReplace, "orv-slapdAdminDN", std::nullopt},
                           {kAdd, "orv-slapdAdminDN", {{"cn=one"}}},
                           {kAdd, "orv-slapdAdminDN", {{"cn=new"}}}}),
            68);
}

TEST_F(RootModify, RefusedBindDnSkipsRolesAndTheOtherIdentities) {
  EXPECT_EQ(root(kMember, {{kReplace, "orv-slapdAdminDN", {{"cn=one"}}},
                           {kReplace, "orv-slapdAdminRole", {{"x"}}},
                           {kReplace, "orv-slapdKrbAdminDN", {{"x"}}}}),
            68);
  EXPECT_THAT(errors(), testing::Each(Not(error("Error: Invalid attribute value x\n"))));
}

TEST_F(RootModify, KerberosIdentityNeedsItsFormAndMustBeFree) {
  for (const char* bad : {"cn=a@R", "orv-kn", "xorv-kn=a", ""}) {
    platform.forget();
    EXPECT_EQ(root(kMember, {{kAdd, "orv-slapdKrbAdminDN", {{bad}}}}), 80);
    EXPECT_THAT(platform.debug_lines(),
                ElementsAre(error("Bad value for Kerberos Admin Group Member DN\n")));
    EXPECT_THAT(searches(), IsEmpty());
  }
  EXPECT_EQ(root(kMember, {{kReplace, "orv-slapdKrbAdminDN", {{"ORV-KN=ONE@r", "cn=x"}}}}), 68);
  EXPECT_EQ(root(kMember, {{kReplace, "orv-slapdKrbAdminDN", {{"Orv-KerberosName=root@r"}}}}), 68);
  EXPECT_EQ(root(kMember, {{kReplace, "orv-slapdKrbAdminDN", {{"orv-kn=new@R", "cn=x"}}}}), 0);
  platform.forget();
  EXPECT_EQ(root(kMember, {{kReplace, "orv-slapdKrbAdminDN", std::nullopt},
                           {kDelete, "orv-slapdKrbAdminDN", {{"cn=x"}}}}),
            0);
  EXPECT_THAT(searches(), IsEmpty());
}

TEST_F(RootModify, DigestUserMustBeFreeByteForByte) {
  for (const char* taken : {"one", "root"}) {
    EXPECT_EQ(root(kMember, {{kAdd, "orv-slapdDigestAdminUser", {{taken}}}}), 68);
  }
  EXPECT_EQ(root(kMember, {{kAdd, "orv-slapdDigestAdminUser", {{"ONE", "one"}}}}), 0);
  EXPECT_EQ(root(kMember, {{kReplace, "orv-slapdDigestAdminUser", std::nullopt},
                           {kDelete, "orv-slapdDigestAdminUser", {{"one"}}}}),
            0);
}

TEST_F(RootModify, PrefixOfAKerberosIdentityEndsWithItsEqualsSign) {
  for (const char* bad : {"orv-kerberosNames=a", "orv-knx=a", "orv-kerberosName", "orv-k=a"}) {
    EXPECT_EQ(root(kMember, {{kAdd, "orv-slapdKrbAdminDN", {{bad}}}}), 80) << bad;
    EXPECT_EQ(kerberos(kKerberos, {{kAdd, "orv-slapdKrbAdminDN", {{bad}}}}), 80) << bad;
  }
  EXPECT_THAT(searches(), IsEmpty());
}

TEST_F(RootModify, AdministratorsBindDnEndsTheChecksBeforeSuppliers) {
  EXPECT_EQ(root(kMember, {{kAdd, "orv-slapdAdminDN", {{"cn=one"}}}}), 68);
  for (const std::string& search : searches()) {
    EXPECT_THAT(search, Not(testing::HasSubstr("objectclass=orv-slapd")));
  }
}

TEST_F(RootModify, AcceptedIdentityIsFollowedByTheOthers) {
  EXPECT_EQ(root(kMember, {{kReplace, "orv-slapdAdminDN", {{"cn=new"}}},
                           {kReplace, "orv-slapdKrbAdminDN", {{"orv-kn=new@R"}}},
                           {kReplace, "orv-slapdDigestAdminUser", {{"one"}}}}),
            68);
  EXPECT_EQ(root(kMember, {{kReplace, "orv-slapdAdminDN", {{"cn=new"}}},
                           {kReplace, "orv-slapdKrbAdminDN", {{"orv-kn=new@R"}}},
                           {kReplace, "orv-slapdDigestAdminUser", {{"new"}}}}),
            0);
}

TEST_F(RootModify, OtherAnswersAboutAnIdentityAreTheResult) {
  platform.file[kGroup].code = 4;
  for (const char* type : {"orv-slapdAdminDN", "orv-slapdDigestAdminUser"}) {
    EXPECT_EQ(root(kMember, {{kReplace, type, {{"cn=new"}}}}), 4) << type;
  }
  EXPECT_EQ(root(kMember, {{kReplace, "orv-slapdKrbAdminDN", {{"orv-kn=new@R"}}}}), 4);
}

TEST_F(RootModify, KerberosComesBeforeDigestWhateverTheirOrder) {
  EXPECT_EQ(root(kMember, {{kAdd, "orv-slapdDigestAdminUser", {{"one"}}},
                           {kAdd, "orv-slapdKrbAdminDN", {{"x"}}}}),
            80);
}

// ======== Roles

class RolesModify : public ModifyRule {
 protected:
  RolesModify() { member_has({"AuditAdmin", "SchemaAdmin", "DirDataAdmin"}); }
  void member_has(const std::vector<std::string>& roles) {
    file(kMember, {{"cn", {"me"}}, {"orv-slapdAdminRole", roles}});
  }
  static constexpr const char* kType = "orv-slapdAdminRole";
};

TEST_F(RolesModify, RolesAreReadWithTheWholeSubtreeAndParentheses) {
  EXPECT_EQ(root(kMember, {{kAdd, "orv-slapdadminrole", {{"passwordadmin"}}}}), 0);
  EXPECT_THAT(platform.calls({"cfg_search_s", "cfg_first_entry", "cfg_get_values", "cfg_msgfree"}),
              ElementsAre("cfg_search_s(session, \"CN=ME,CN=ADMINGROUP,CN=CONFIGURATION\", 2, "
                          "\"(objectclass=*)\", [orv-slapdAdminRole], 0)",
                          "cfg_first_entry(session, chain)",
                          "cfg_get_values(session, record 1, \"orv-slapdAdminRole\")",
                          "cfg_msgfree(chain)"));
  EXPECT_EQ(list(), "0x80 orv-slapdadminrole=passwordadmin");
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
}

TEST_F(RolesModify, WhatWasMadeToReadTheRolesGoesInItsOrder) {
  platform.name_allocation(1, "names");
  platform.name_allocation(2, "name");
  EXPECT_EQ(root(kMember, {{kReplace, kType, {{"PasswordAdmin"}}}}), 0);
  EXPECT_THAT(platform.calls({"cfg_msgfree", "free", "cfg_value_free"}),
              ElementsAre("cfg_msgfree(chain)", "free(name)", "free(names)", "cfg_value_free()"));
}

TEST_F(RolesModify, FirstEntryThatIsFoundIsTheOneWhoseRolesCount) {
  platform.file[kGroup] = {{{kGroup, {{"cn", {"group"}}}}, {kMember, {{kType, {"AuditAdmin"}}}}},
                           0};
  EXPECT_EQ(root(kGroup, {{kDelete, kType, {{"AuditAdmin"}}}}), 16);
  EXPECT_EQ(root(kConfiguration, {{kAdd, kType, {{"AuditAdmin"}}}}), 16);
}

TEST_F(RolesModify, MissingEntryGives32WithItsLine) {
  platform.file.erase(kMember);
  EXPECT_EQ(root(kMember, {{kAdd, kType, {{"AuditAdmin"}}}}), 32);
  const auto line = error(
      "Error - checkRootAdminModify: entry CN=ME,CN=ADMINGROUP,CN=CONFIGURATION does not exist!\n");
  EXPECT_THAT(platform.debug_lines(), ElementsAre(line));
  platform.forget();
  platform.file[kMember] = {};
  EXPECT_EQ(root(kMember, {{kAdd, kType, {{"AuditAdmin"}}}}), 32);
  EXPECT_THAT(platform.debug_lines(), ElementsAre(line));
}

TEST_F(RolesModify, OtherFailuresOfTheSearchGive80WithTheirLine) {
  platform.file[kMember].code = 9;
  EXPECT_EQ(root(kMember, {{kAdd, kType, {{"AuditAdmin"}}}}), 80);
  EXPECT_THAT(platform.debug_lines(),
              ElementsAre(error("Error - checkRootAdminModify: cfg_search_s failed with rc =9 for "
                                "CN=ME,CN=ADMINGROUP,CN=CONFIGURATION.\n")));
}

TEST_F(RolesModify, EntryWithoutRolesGives16) {
  file(kMember, {{"cn", {"me"}}});
  EXPECT_EQ(root(kMember, {{kAdd, kType, {{"AuditAdmin"}}}}), 16);
  member_has({});
  EXPECT_EQ(root(kMember, {{kAdd, kType, {{"AuditAdmin"}}}}), 16);
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
}

TEST_F(RolesModify, RolesAreReadBeforeTheNewOnesAreHeldAgainstTheVocabulary) {
  const Script unknown = {{kAdd, kType, {{"Wizard"}}}};
  platform.file.erase(kMember);
  EXPECT_EQ(root(kMember, unknown), 32);
  file(kMember, {{"cn", {"me"}}});
  EXPECT_EQ(root(kMember, unknown), 16);
  platform.forget();
  platform.file[kMember].code = 9;
  EXPECT_EQ(root(kMember, unknown), 80);
  EXPECT_THAT(platform.debug_lines(),
              ElementsAre(error("Error - checkRootAdminModify: cfg_search_s failed with rc =9 for "
                                "CN=ME,CN=ADMINGROUP,CN=CONFIGURATION.\n")));
  platform.forget();
  platform.fail_allocation(1);
  EXPECT_EQ(root(kMember, unknown), 90);
}

TEST_F(RolesModify, NoMemoryForTheNameGives90WithItsLine) {
  for (const int nth : {1, 2}) {
    platform.forget();
    platform.fail_allocation(nth);
    EXPECT_EQ(root(kMember, {{kAdd, kType, {{"AuditAdmin"}}}}), 90);
    EXPECT_THAT(platform.debug_lines(),
                ElementsAre(error("Error - checkRootAdminModify: rc = 90\n")));
    EXPECT_THAT(searches(), IsEmpty());
  }
}

TEST_F(RolesModify, UnknownRoleGives80WithItsLineWhateverTheCode) {
  for (const int code : {kAdd, kDelete, kReplace}) {
    platform.forget();
    EXPECT_EQ(root(kMember, {{code, kType, {{"AUDITADMIN", "Wizard", "Other"}}}}), 80);
    EXPECT_THAT(platform.debug_lines(),
                ElementsAre(error("Error: Invalid attribute value Wizard\n")));
  }
}

TEST_F(RolesModify, VocabularyIsAskedInItsOrder) {
  EXPECT_EQ(root(kMember, {{kReplace, kType, {{"x"}}}}), 80);
  std::vector<std::string> asked = platform.calls({"kel_strcasecmp"});
  asked.erase(std::remove_if(
                  asked.begin(), asked.end(),
                  [](const std::string& call) { return call.find("(\"x\"") == std::string::npos; }),
              asked.end());
  EXPECT_THAT(asked, ElementsAre("kel_strcasecmp(\"x\", \"AuditAdmin\")",
                                 "kel_strcasecmp(\"x\", \"DirDataAdmin\")",
                                 "kel_strcasecmp(\"x\", \"NoAdmin\")",
                                 "kel_strcasecmp(\"x\", \"ReplicationAdmin\")",
                                 "kel_strcasecmp(\"x\", \"SchemaAdmin\")",
                                 "kel_strcasecmp(\"x\", \"ServerConfigGroupMember\")",
                                 "kel_strcasecmp(\"x\", \"ServerStartStopAdmin\")",
                                 "kel_strcasecmp(\"x\", \"PasswordAdmin\")"));
}

TEST_F(RolesModify, ValuesOfLaterModificationsAreCheckedByPositionOnTheFirst) {
  // What is not looked at...
  EXPECT_EQ(root(kMember, {{kAdd, kType, {{"PasswordAdmin", "NoAdmin"}}},
                           {kReplace, kType, {{"Wizard", "Witch"}}}}),
            0);
  // ...and what is, in its place: the first is too short, so the value itself.
  EXPECT_EQ(
      root(kMember, {{kAdd, kType, {{"PasswordAdmin"}}}, {kReplace, kType, {{"Wizard", "Witch"}}}}),
      80);
  EXPECT_EQ(errors().back(), error("Error: Invalid attribute value Witch\n"));
  EXPECT_EQ(root(kMember, {{kDelete, kType, std::nullopt}, {kAdd, kType, {{"Witch"}}}}), 80);
}

TEST_F(RolesModify, ModificationsOfOtherTypesBetweenThemHideNothing) {
  EXPECT_EQ(root(kMember, {{kAdd, kType, {{"PasswordAdmin"}}},
                           {kAdd, "cn", {{"x"}}},
                           {kAdd, kType, {{"AuditAdmin", "Wizard"}}}}),
            80);
  EXPECT_THAT(errors(), ElementsAre(error("Error: Invalid attribute value Wizard\n")));
}

TEST_F(RolesModify, LastDeletedValueMustBeThere) {
  EXPECT_EQ(root(kMember, {{kDelete, kType, {{"AuditAdmin", "PasswordAdmin"}}}}), 16);
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
  EXPECT_EQ(root(kMember, {{kDelete, kType, {{"PasswordAdmin", "auditADMIN"}}}}), 0);
  // Added and replaced ones need not be there.
  EXPECT_EQ(root(kMember, {{kReplace, kType, {{"PasswordAdmin"}}}}), 0);
}

TEST_F(RolesModify, RoleThatIsMissingEndsTheWalkOverTheModifications) {
  EXPECT_EQ(root(kMember, {{kDelete, kType, {{"PasswordAdmin"}}},
                           {kAdd, kType, {{"AuditAdmin", "Wizard"}}}}),
            16);
}

TEST_F(RolesModify, DeletingAllRolesByValueStoresNoAdmin) {
  EXPECT_EQ(root(kMember, {{kDelete, kType, {{"SchemaAdmin", "AuditAdmin", "DirDataAdmin"}}}}), 0);
  EXPECT_EQ(list(), "0x82 orv-slapdAdminRole=NoAdmin");
  EXPECT_EQ(modifications->mod_vals.modv_bvals[0]->bv_len, 7U);
  EXPECT_EQ(modifications->mod_vals.modv_bvals[1], nullptr);
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
}

TEST_F(RolesModify, RoleThatIsMissingLeavesTheListAsItWasAlsoWhereTheNumbersAreEqual) {
  EXPECT_EQ(root(kMember, {{kDelete, kType, {{"SchemaAdmin", "AuditAdmin", "PasswordAdmin"}}}}),
            16);
  EXPECT_EQ(list(), "0x81 orv-slapdAdminRole=SchemaAdmin,AuditAdmin,PasswordAdmin");
}

TEST_F(RolesModify, NumbersOfValuesDecideNotWhichTheyAre) {
  EXPECT_EQ(root(kMember, {{kDelete, kType, {{"NoAdmin", "NoAdmin", "AuditAdmin"}}}}), 0);
  EXPECT_EQ(list(), "0x82 orv-slapdAdminRole=NoAdmin");
}

TEST_F(RolesModify, MoreDeletedValuesThanRolesAreNotAll) {
  EXPECT_EQ(
      root(kMember, {{kDelete, kType, {{"NoAdmin", "SchemaAdmin", "NoAdmin", "AuditAdmin"}}}}), 0);
  EXPECT_EQ(list(), "0x81 orv-slapdAdminRole=NoAdmin,SchemaAdmin,NoAdmin,AuditAdmin");
}

TEST_F(RolesModify, AddedRolesCountAgainstTheDeletedOnes) {
  const Script kept = {{kAdd, kType, {{"PasswordAdmin"}}},
                       {kDelete, kType, {{"SchemaAdmin", "DirDataAdmin", "AuditAdmin"}}}};
  EXPECT_EQ(root(kMember, kept), 0);
  EXPECT_EQ(list(),
            "0x80 orv-slapdAdminRole=PasswordAdmin|"
            "0x81 orv-slapdAdminRole=SchemaAdmin,DirDataAdmin,AuditAdmin");
  member_has({"AuditAdmin"});
  EXPECT_EQ(root(kMember, {{kAdd, kType, {{"PasswordAdmin"}}},
                           {kDelete, kType, {{"PasswordAdmin", "AuditAdmin"}}}}),
            0);
  EXPECT_EQ(list(), "0x80 orv-slapdAdminRole=PasswordAdmin|0x82 orv-slapdAdminRole=NoAdmin");
}

TEST_F(RolesModify, ReplacedRolesAndDeletesWithoutValuesAreNotCounted) {
  for (const Script& script :
       {Script{{kReplace, kType, {{"AuditAdmin", "SchemaAdmin", "DirDataAdmin"}}}},
        Script{{kReplace, kType, {{"AuditAdmin", "SchemaAdmin", "DirDataAdmin"}}},
               {kDelete, "cn", {{"me"}}}},
        Script{{kDelete, kType, std::nullopt}}, Script{{kReplace, kType, std::nullopt}},
        Script{{kDelete, kType, {{"AuditAdmin", "SchemaAdmin"}}}}}) {
    EXPECT_EQ(root(kMember, script), 0);
    const std::string after = list();
    make(script);
    EXPECT_EQ(after, list());
  }
}

TEST_F(RolesModify, FirstDeleteOfTheWholeListIsRewritten) {
  member_has({"AuditAdmin"});
  EXPECT_EQ(root(kMember, {{kAdd, "cn", {{"x"}}},
                           {kDelete, "orv-slapdDigestAdminUser", std::nullopt},
                           {kDelete, kType, {{"AuditAdmin"}}}}),
            0);
  EXPECT_EQ(list(),
            "0x80 cn=x|0x82 orv-slapdDigestAdminUser=NoAdmin|"
            "0x81 orv-slapdAdminRole=AuditAdmin");
  // Which is then looked at like any other.
  EXPECT_EQ(platform.count("cfg_search_s"), 3);
}

TEST_F(RolesModify, NoMemoryForNoAdminGives90AndLeavesTheListAsItWas) {
  member_has({"AuditAdmin"});
  const Script script = {{kDelete, kType, {{"AuditAdmin"}}}};
  EXPECT_EQ(root(kMember, script), 0);
  const int needed = platform.allocations();
  int refused = 0;
  for (int nth = 1; nth <= needed; ++nth) {
    SCOPED_TRACE(nth);
    platform.forget();
    platform.fail_allocation(nth);
    const int rc = root(kMember, script);
    EXPECT_NE(rc, 0);
    EXPECT_EQ(list(), "0x81 orv-slapdAdminRole=AuditAdmin");
    if (rc == 90) ++refused;
    EXPECT_EQ(platform.debug_lines().empty(), nth > 3);  // the name and the search are told
  }
  EXPECT_EQ(refused, 5);  // two for the name, three for the value
}

TEST_F(RolesModify, RolesComeAfterTheBindDnAndBeforeKerberos) {
  EXPECT_EQ(root(kMember, {{kAdd, "orv-slapdKrbAdminDN", {{"x"}}}, {kAdd, kType, {{"Wizard"}}}}),
            80);
  EXPECT_EQ(errors().back(), error("Error: Invalid attribute value Wizard\n"));
  EXPECT_EQ(root(kMember,
                 {{kAdd, kType, {{"AuditAdmin"}}}, {kAdd, "orv-slapdDigestAdminUser", {{"one"}}}}),
            68);
}

TEST_F(RolesModify, RolesAreCheckedBehindAnAcceptedBindDn) {
  EXPECT_EQ(
      root(kMember, {{kReplace, "orv-slapdAdminDN", {{"cn=new"}}}, {kAdd, kType, {{"Wizard"}}}}),
      80);
  EXPECT_EQ(errors().back(), error("Error: Invalid attribute value Wizard\n"));
}

TEST_F(RolesModify, CodesDoNotDependOnTheDebugBit) {
  debug_off();
  EXPECT_EQ(root(kMember, {{kAdd, kType, {{"Wizard"}}}}), 80);
  EXPECT_EQ(root(kMember, {{kAdd, "orv-slapdKrbAdminDN", {{"x"}}}}), 80);
  platform.fail_allocation(platform.allocations() + 1);
  EXPECT_EQ(root(kMember, {{kAdd, kType, {{"AuditAdmin"}}}}), 90);
  platform.file[kMember].code = 9;
  EXPECT_EQ(root(kMember, {{kAdd, kType, {{"AuditAdmin"}}}}), 80);
  platform.file[kMember] = {};
  EXPECT_EQ(root(kMember, {{kAdd, kType, {{"AuditAdmin"}}}}), 32);
  platform.file.erase(kMember);
  EXPECT_EQ(root(kMember, {{kAdd, kType, {{"AuditAdmin"}}}}), 32);
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
}

TEST_F(RolesModify, LeavesExitRecords) {
  trcEvents = kTraceExit & ~kTraceEntry;
  root(kOther, {{kAdd, kType, {{"x"}}}});
  EXPECT_THAT(platform.records(), ElementsAre("exit 01030800 0"));
  platform.forget();
  root(kMember, {{kAdd, kType, {{"x"}}}});
  EXPECT_EQ(platform.records().back(), "exit 01030800 80");
}

// ======== Kerberos and Digest-MD5 of the primary administrator

using RootIdentityModify = ModifyRule;

TEST_F(RootIdentityModify, OtherEntriesAndAttributesAreNoConcern) {
  as(0x14);
  for (const char* dn : {kOther, "cn=kerberos,cn=configuration", "cn=digest,cn=configuration",
                         "CN=X,CN=KERBEROS,CN=CONFIGURATION", "CN=X,CN=DIGEST,CN=CONFIGURATION"}) {
    EXPECT_EQ(kerberos(dn, {{kAdd, "orv-slapdKrbAdminDN", {{"x"}}}}), 0);
    EXPECT_EQ(digest(dn, {{kAdd, "orv-slapdDigestAdminUser", {{"root"}}}}), 0);
  }
  EXPECT_EQ(kerberos(kKerberos, {{kAdd, "cn", {{"x"}}}}), 0);
  EXPECT_EQ(digest(kDigest, {{kAdd, "cn", {{"x"}}}}), 0);
  EXPECT_THAT(searches(), IsEmpty());
}

TEST_F(RootIdentityModify, OnlyThePrimaryAdministratorByTheOperationsFlags) {
  for (const unsigned flags : {0x14U, 0x04U, 0x08U, 0x01U, 0U}) {
    as(flags);
    connection.authority = 0x0C;
    for (const int code : {kAdd, kDelete, kReplace}) {
      EXPECT_EQ(kerberos(kKerberos, {{code, "ORV-slapdKrbAdminDN", {{"orv-kn=new@R"}}}}), 50);
      EXPECT_EQ(digest(kDigest, {{code, "ORV-slapdDigestAdminUser", {{"new"}}}}), 50);
    }
  }
  EXPECT_THAT(searches(), IsEmpty());
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
}

TEST_F(RootIdentityModify, AuthorityComesBeforeTheValue) {
  as(0x14);
  EXPECT_EQ(kerberos(kKerberos, {{kReplace, "orv-slapdKrbAdminDN", {{"x"}}}}), 50);
  EXPECT_EQ(digest(kDigest, {{kReplace, "orv-slapdDigestAdminUser", std::nullopt}}), 50);
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
}

TEST_F(RootIdentityModify, OtherAnswersAboutAnIdentityAreTheResult) {
  platform.file[kGroup].code = 4;
  EXPECT_EQ(kerberos(kKerberos, {{kReplace, "orv-slapdKrbAdminDN", {{"orv-kn=new@R"}}}}), 4);
  EXPECT_EQ(digest(kDigest, {{kReplace, "orv-slapdDigestAdminUser", {{"new"}}}}), 4);
}

TEST_F(RootIdentityModify, BadFormIsRefusedWithoutTheDebugBitToo) {
  debug_off();
  EXPECT_EQ(kerberos(kKerberos, {{kReplace, "orv-slapdKrbAdminDN", {{"x"}}}}), 80);
}

TEST_F(RootIdentityModify, KerberosIdentityNeedsItsFormAndMustBeFree) {
  for (const Values& bad : {Values({"cn=a"}), Values(), Values(Values::value_type{})}) {
    platform.forget();
    EXPECT_EQ(kerberos(kKerberos, {{kReplace, "orv-slapdKrbAdminDN", bad}}), 80);
    EXPECT_THAT(platform.debug_lines(),
                ElementsAre(error("Bad value for Kerberos Root Administrator DN\n")));
  }
  for (const int code : {kAdd, kReplace}) {
    EXPECT_EQ(kerberos(kKerberos, {{code, "orv-slapdKrbAdminDN", {{"ORV-KN=one@R", "cn=x"}}}}), 68);
    EXPECT_EQ(kerberos(kKerberos, {{code, "orv-slapdKrbAdminDN", {{"orv-kerberosname=two@R"}}}}),
              0);
  }
}

TEST_F(RootIdentityModify, DigestUserMustBeFreeAndThere) {
  for (const int code : {kAdd, kReplace}) {
    EXPECT_EQ(digest(kDigest, {{code, "orv-slapdDigestAdminUser", {{"one", "x"}}}}), 68);
    EXPECT_EQ(digest(kDigest, {{code, "orv-slapdDigestAdminUser", {{"two", "one"}}}}), 0);
  }
  EXPECT_EQ(digest(kDigest, {{kReplace, "orv-slapdDigestAdminUser", std::nullopt}}), 80);
}

TEST_F(RootIdentityModify, DeletesAreNotLookedAtAndHideWhatFollows) {
  EXPECT_EQ(kerberos(kKerberos, {{kDelete, "orv-slapdKrbAdminDN", {{"x"}}},
                                 {kAdd, "orv-slapdKrbAdminDN", {{"x"}}}}),
            0);
  EXPECT_EQ(digest(kDigest, {{kDelete, "orv-slapdDigestAdminUser", std::nullopt},
                             {kAdd, "orv-slapdDigestAdminUser", {{"one"}}}}),
            0);
  EXPECT_THAT(searches(), IsEmpty());
}

TEST_F(RootIdentityModify, LeaveExitRecords) {
  trcEvents = kTraceExit & ~kTraceEntry;
  as(0x14);
  kerberos(kKerberos, {{kDelete, "orv-slapdKrbAdminDN", std::nullopt}});
  digest(kDigest, {{kDelete, "orv-slapdDigestAdminUser", std::nullopt}});
  EXPECT_THAT(platform.records(), Contains("exit 01030900 50"));
  EXPECT_EQ(platform.records().back(), "exit 01030a00 50");
}

// ======== Suppliers

using SupplierModify = ModifyRule;

TEST_F(SupplierModify, MembersNeedAReplicationBitOfTheConnectionForTheMasterServer) {
  as(0x0C);
  connection.authority = 0x14;
  const Script script = {{kReplace, "cn", {{"x"}}}};
  operation.roles = 0x3E;
  for (const unsigned roles : {0U, 0x32U}) {
    connection.roles = roles;
    EXPECT_EQ(supplier(kMasterServer, script), 50);
    EXPECT_EQ(supplier(kOther, script), 0);
    for (const char* dn :
         {"cn=master server,cn=configuration", "CN=X,CN=MASTER SERVER,CN=CONFIGURATION",
          "CN=MASTER SERVER,CN=CONFIGURATION,O=X"}) {
      EXPECT_EQ(supplier(dn, script), 0);
    }
  }
  for (const unsigned flags : {0x15U, 0x1CU, 0x34U}) {  // also those
    connection.authority = flags;
    EXPECT_EQ(supplier(kMasterServer, script), 50) << flags;
  }
  connection.authority = 0x14;
  for (const unsigned roles : {0x04U, 0x08U}) {
    connection.roles = roles;
    EXPECT_EQ(supplier(kMasterServer, script), 0);
  }
  connection.roles = 0;
  for (const unsigned flags : {0x0CU, 0x10U, 0x04U, 0x24U}) {
    connection.authority = flags;
    EXPECT_EQ(supplier(kMasterServer, script), 0);
  }
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
}

TEST_F(SupplierModify, BindDnOfEveryEntryMustBeNoAdministrators) {
  for (const char* dn : {kOther, kMasterServer}) {
    for (const int code : {kAdd, kReplace}) {
      EXPECT_EQ(supplier(dn, {{code, "ORV-slapdMasterDN", {{"cn=one", "cn=x"}}}}), 68);
      EXPECT_EQ(supplier(dn, {{code, "orv-slapdMasterDN", {{"cn=root"}}}}), 68);
      EXPECT_EQ(supplier(dn, {{code, "orv-slapdMasterDN", {{"cn=supplier", "cn=one"}}}}), 0);
    }
  }
}

TEST_F(SupplierModify, OtherAnswersAboutTheBindDnAreTheResult) {
  const Script script = {{kReplace, "orv-slapdMasterDN", {{"cn=new"}}}};
  platform.file[kGroup].code = 4;
  EXPECT_EQ(supplier(kOther, script), 4);
  file(kConfiguration, {{"cn", {"configuration"}}});  // the administrator's cannot be told
  EXPECT_EQ(supplier(kOther, script), 80);
}

TEST_F(SupplierModify, RefusalOfTheMasterServerComesBeforeTheValue) {
  connection.authority = 0x14;
  EXPECT_EQ(supplier(kMasterServer, {{kReplace, "orv-slapdMasterDN", std::nullopt}}), 50);
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
}

TEST_F(SupplierModify, MissingValueIsRefusedWithoutTheDebugBitToo) {
  debug_off();
  EXPECT_EQ(supplier(kOther, {{kReplace, "orv-slapdMasterDN", std::nullopt}}), 80);
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
}

TEST_F(SupplierModify, MissingValueGives80WithItsLine) {
  for (const Values& none : {Values(), Values(Values::value_type{})}) {
    platform.forget();
    EXPECT_EQ(supplier(kOther, {{kReplace, "orv-slapdMasterDN", none}}), 80);
    EXPECT_THAT(platform.debug_lines(), ElementsAre(error("Missing value for dn.\n")));
    EXPECT_THAT(searches(), IsEmpty());
  }
}

TEST_F(SupplierModify, DeletesAreNotLookedAtAndHideNothing) {
  EXPECT_EQ(supplier(kOther, {{kDelete, "orv-slapdMasterDN", {{"cn=one"}}}}), 0);
  EXPECT_THAT(searches(), IsEmpty());
  EXPECT_EQ(supplier(kOther, {{kDelete, "orv-slapdMasterDN", std::nullopt},
                              {kAdd, "orv-slapdMasterDN", {{"cn=one"}}}}),
            68);
}

TEST_F(SupplierModify, LeavesExitRecords) {
  trcEvents = kTraceExit & ~kTraceEntry;
  supplier(kOther, {{kReplace, "orv-slapdMasterDN", std::nullopt}});
  supplier(kOther, {{kReplace, "cn", {{"x"}}}});
  EXPECT_THAT(platform.records(), ElementsAre("exit 01030b00 80", "exit 01030b00 0"));
}

// ======== Proxy split names

using SplitNameModify = ModifyRule;

TEST_F(SplitNameModify, OtherAttributesAndDeletesAreNoConcern) {
  EXPECT_EQ(proxy({{kReplace, "cn", {{"-"}}}}), 0);
  EXPECT_EQ(proxy({{kDelete, "orv-slapdProxySplitName", {{"-"}}},
                   {kAdd, "orv-slapdProxySplitName", {{"-"}}}}),
            0);
  EXPECT_EQ(platform.count("is_string_alphanum"), 0);
}

TEST_F(SplitNameModify, NameMustBeAlphanumericBeforeItIsLookedFor) {
  for (const Values& bad :
       {Values({"a-b"}), Values({""}), Values(), Values(Values::value_type{})}) {
    for (const int code : {kAdd, kReplace}) {
      EXPECT_EQ(proxy({{code, "ORV-slapdProxySplitName", bad}}), 21);
    }
  }
  EXPECT_THAT(searches(), IsEmpty());
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
}

TEST_F(SplitNameModify, TakenNameGives68AndIsLogged) {
  EXPECT_EQ(proxy({{kReplace, "orv-slapdProxySplitName", {{"split1", "-"}}}}), 68);
  EXPECT_THAT(platform.calls({"PrintMessage"}), ElementsAre("PrintMessage(0, 8, 145)"));
}

TEST_F(SplitNameModify, TakenNameIsLoggedWithoutTheDebugBitToo) {
  debug_off();
  EXPECT_EQ(proxy({{kAdd, "orv-slapdProxySplitName", {{"split1"}}}}), 68);
  EXPECT_THAT(platform.calls({"PrintMessage"}), ElementsAre("PrintMessage(0, 8, 145)"));
}

TEST_F(SplitNameModify, OtherAnswersAreNotLogged) {
  EXPECT_EQ(proxy({{kReplace, "orv-slapdProxySplitName", {{"split2", "split1"}}}}), 0);
  platform.file[kProxies].code = 80;
  EXPECT_EQ(proxy({{kAdd, "orv-slapdProxySplitName", {{"split2"}}}}), 80);
  EXPECT_EQ(platform.count("PrintMessage"), 0);
}

TEST_F(SplitNameModify, LeavesExitRecords) {
  trcEvents = kTraceExit & ~kTraceEntry;
  proxy({{kReplace, "orv-slapdProxySplitName", {{"-"}}}});
  EXPECT_EQ(platform.records().back(), "exit 01030c00 21");
}

}  // namespace
}  // namespace orv
