// The roles of a member that is added.
#include "added_entry.h"
#include "config_add.h"
#include "function_ids.h"

namespace orv {
namespace {

class Roles : public AddedEntryTest {
 protected:
  using Values = std::vector<std::string>;

  Roles() { as(kPrimary); }

  void adding(const char* normalized_dn, const Attributes& attributes = {}) {
    make(normalized_dn, attributes);
    dn = normalized_dn;
  }
  void adding_with(const Values& roles) { adding(kMember, {{"orv-slapdAdminRole", roles}}); }

  int process() {
    return traced(function_id::process_roles_if_admin_group_entry,
                  [&] { return processRolesIfAdminGroupEntry(dn, e.get(), &operation); });
  }
  // The attribute as it stands after processing; "none" without one.
  [[nodiscard]] std::string roles() const {
    for (const attr* a = e->attributes; a != nullptr; a = a->next) {
      if (std::string(a->type) != "orv-slapdAdminRole") continue;
      std::string text;
      for (int i = 0; i < a->count; ++i) {
        EXPECT_EQ(a->values[i]->bv_len, std::string(a->values[i]->bv_val).size());
        text += (i == 0 ? "" : ",") + std::string(a->values[i]->bv_val);
      }
      EXPECT_EQ(a->values[a->count], nullptr);
      return text;
    }
    return "none";
  }

  const char* dn = nullptr;
};

const std::vector<std::string> kVocabulary = {
    "AuditAdmin",           "DirDataAdmin", "NoAdmin",
    "ReplicationAdmin",     "SchemaAdmin",  "ServerConfigGroupMember",
    "ServerStartStopAdmin", "PasswordAdmin"};
constexpr const char* kDefaults =
    "DirDataAdmin,PasswordAdmin,SchemaAdmin,ServerConfigGroupMember,ServerStartStopAdmin";

// ---- Whom it concerns

TEST_F(Roles, EachNullArgumentGives80AndTheText) {
  adding(kMember);
  for (int i = 0; i < 3; ++i) {
    platform.forget();
    EXPECT_EQ(traced(function_id::process_roles_if_admin_group_entry,
                     [&] {
                       return processRolesIfAdminGroupEntry(i == 0 ? nullptr : dn,
                                                            i == 1 ? nullptr : e.get(),
                                                            i == 2 ? nullptr : &operation);
                     }),
              80);
    EXPECT_THAT(
        platform.debug_lines(),
        ElementsAre(error("Invalid NULL pointer passed to processRolesIfAdminGroupEntry()\n")));
    EXPECT_THAT(platform.calls(), IsEmpty());
  }
}

TEST_F(Roles, EntriesOutsideTheGroupAreLeftAlone) {
  as(0x24);
  for (const char* other : {"CN=X,CN=CONFIGURATION", "CN=ONE,CN=ADMINGROUP,CN=X",
                            "cn=one,cn=admingroup,cn=configuration"}) {
    adding(other, {{"orv-slapdAdminRole", {"Wizard"}}});
    EXPECT_EQ(process(), 0) << other;
    EXPECT_THAT(platform.calls(), IsEmpty());
  }
}

TEST_F(Roles, CodesDoNotDependOnTheDebugBit) {
  debug_off();
  adding_with({"SchemaAdmin", "Wizard"});
  EXPECT_EQ(process(), 21);
  EXPECT_EQ(roles(), "SchemaAdmin,Wizard");
  adding(kMember);
  EXPECT_EQ(process(), 0);
  EXPECT_EQ(roles(), kDefaults);
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
}

TEST_F(Roles, GroupIsForThePrimaryAdministratorAloneTheContainerToo) {
  for (const unsigned flags : {0x00U, 0x04U, 0x08U, 0x14U, 0x24U, 0x01U}) {
    as(flags);
    operation.roles = 0x3E;
    connection.authority = 0x0C;
    for (const char* inside : {kMember, kGroup, "CN=X,CN=ONE,CN=ADMINGROUP,CN=CONFIGURATION",
                               "CN=ADMINGROUP,CN=CONFIGURATION,O=ORV"}) {
      adding(inside, {{"orv-slapdAdminRole", {"Wizard"}}});
      EXPECT_EQ(process(), 50) << flags;
      EXPECT_EQ(platform.count("attr_find"), 0);
      EXPECT_THAT(platform.debug_lines(), IsEmpty());
    }
  }
  as(0x1C);
  adding(kMember);
  EXPECT_EQ(process(), 0);
}

TEST_F(Roles, ContainerIsNotTouched) {
  adding(kGroup);
  EXPECT_EQ(process(), 0);
  EXPECT_EQ(e->attributes, nullptr);
  EXPECT_EQ(platform.count("attr_find"), 0);
  adding(kGroup, {{"orv-slapdAdminRole", {"Wizard"}}});
  EXPECT_EQ(process(), 0);
  EXPECT_EQ(roles(), "Wizard");
}

TEST_F(Roles, ContainerIsRecognisedByTheServersComparison) {
  adding("CN=X,CN=ADMINGROUP,CN=CONFIGURATION");
  platform.fail("kel_strcasecmp", 1, 0);
  EXPECT_EQ(process(), 0);
  EXPECT_EQ(roles(), "none");
  EXPECT_THAT(platform.calls({"kel_strcasecmp"}),
              ElementsAre("kel_strcasecmp(\"CN=X,CN=ADMINGROUP,CN=CONFIGURATION\", "
                          "\"CN=ADMINGROUP,CN=CONFIGURATION\")"));
}

TEST_F(Roles, EverythingElseInTheGroupIsAMember) {
  for (const char* inside :
       {"CN=X,CN=ONE,CN=ADMINGROUP,CN=CONFIGURATION", "CN=ADMINGROUP,CN=CONFIGURATION,O=ORV"}) {
    adding(inside);
    EXPECT_EQ(process(), 0);
    EXPECT_EQ(roles(), kDefaults);
  }
}

// ---- Roles that are given

TEST_F(Roles, EveryRoleOfTheVocabularyIsAcceptedAsItIsWritten) {
  for (const std::string& role : kVocabulary) {
    adding_with({role});
    EXPECT_EQ(process(), 0) << role;
    EXPECT_EQ(roles(), role);
  }
}

TEST_F(Roles, NamesMatchInAnyLetterCaseAndKeepTheirOwn) {
  adding_with({"auditadmin", "SERVERconfigGROUPmember"});
  EXPECT_EQ(process(), 0);
  EXPECT_EQ(roles(), "auditadmin,SERVERconfigGROUPmember");
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
}

TEST_F(Roles, ValueIsHeldAgainstTheVocabularyInItsOrder) {
  adding_with({"passwordadmin"});
  EXPECT_EQ(process(), 0);
  std::vector<std::string> expected = {
      "kel_strcasecmp(\"CN=ONE,CN=ADMINGROUP,CN=CONFIGURATION\", "
      "\"CN=ADMINGROUP,CN=CONFIGURATION\")"};
  for (const std::string& role : kVocabulary) {
    expected.push_back("kel_strcasecmp(\"passwordadmin\", \"" + role + "\")");
  }
  EXPECT_EQ(platform.calls({"kel_strcasecmp"}), expected);
}

TEST_F(Roles, UnknownRoleGives21AndItsLineAndChangesNothing) {
  for (const char* bad : {"Wizard", "", "NoAdmin ", " NoAdmin", "NoAdmi", "AuditAdminX"}) {
    adding_with({"SchemaAdmin", "NoAdmin", bad, "Ghost"});
    EXPECT_EQ(process(), 21) << bad;
    EXPECT_EQ(roles(), std::string("SchemaAdmin,NoAdmin,") + bad + ",Ghost");
    EXPECT_THAT(platform.debug_lines(),
                ElementsAre(error("Error: Invalid administrative role for "
                                  "CN=ONE,CN=ADMINGROUP,CN=CONFIGURATION: orv-slapdAdminRole=" +
                                  std::string(bad) + "\n")));
    EXPECT_THAT(platform.calls({"kel_strlcpy", "attr_merge"}), IsEmpty());
  }
}

TEST_F(Roles, UnknownRoleGives21WithoutTheTraceToo) {
  debug_off();
  adding_with({"SchemaAdmin", "Wizard"});
  EXPECT_EQ(process(), 21);
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
}

TEST_F(Roles, NoAdminLeavesItselfAlone) {
  for (const Values& given :
       {Values{"SchemaAdmin", "NoAdmin", "AuditAdmin"},
        Values{"NoAdmin", "ServerConfigGroupMember"}, Values{"ServerConfigGroupMember", "noadmin"},
        Values{"NOADMIN"}, Values{"NoAdmin", "NoAdmin"}}) {
    adding_with(given);
    EXPECT_EQ(process(), 0);
    EXPECT_EQ(roles(), "NoAdmin");
    EXPECT_THAT(platform.calls({"kel_strlcpy"}), ElementsAre("kel_strlcpy(\"NoAdmin\", 8)"));
    EXPECT_THAT(platform.debug_lines(), IsEmpty());
  }
}

TEST_F(Roles, NoAdminIsWrittenOverTheFirstValueAndTheOthersAreReleasedFromTheLast) {
  adding_with({"SchemaAdmin", "NoAdmin", "AuditAdmin"});
  berval** const values = e->attributes->values;
  berval* const first = values[0];
  char* const text = first->bv_val;
  platform.name(values[2]->bv_val, "text 3");
  platform.name(values[2], "value 3");
  platform.name(values[1]->bv_val, "text 2");
  platform.name(values[1], "value 2");
  EXPECT_EQ(process(), 0);
  EXPECT_EQ(e->attributes->values, values);
  EXPECT_EQ(values[0], first);
  EXPECT_EQ(first->bv_val, text);
  EXPECT_EQ(first->bv_len, 7U);
  EXPECT_EQ(values[1], nullptr);
  EXPECT_EQ(values[2], nullptr);
  EXPECT_EQ(e->attributes->count, 1);
  EXPECT_THAT(platform.calls({"free", "kel_strlcpy"}),
              ElementsAre("free(text 3)", "free(value 3)", "free(text 2)", "free(value 2)",
                          "kel_strlcpy(\"NoAdmin\", 8)"));
}

TEST_F(Roles, RoleAttributeWithoutValuesIsLeftAsItIs) {
  for (const bool null_list : {false, true}) {
    platform.empty_lists_are_null = null_list;
    adding_with({});
    EXPECT_EQ(process(), 0);
    EXPECT_EQ(platform.count("attr_merge"), 0);
    EXPECT_EQ(e->attributes->count, 0);
  }
}

TEST_F(Roles, RoleAttributeIsFoundInAnyLetterCase) {
  adding(kMember, {{"ORV-SLAPDADMINROLE", {"AuditAdmin"}}});
  EXPECT_EQ(process(), 0);
  EXPECT_EQ(platform.count("attr_merge"), 0);
}

// ---- Roles that are not given

TEST_F(Roles, MemberWithoutRolesGetsTheDefaultsInTheirOrder) {
  adding(kMember, {{"cn", {"one"}}});
  EXPECT_EQ(process(), 0);
  EXPECT_EQ(roles(), kDefaults);
  EXPECT_EQ(scripted::text_of(*e),
            std::string(kMember) + "|cn=one|orv-slapdAdminRole=" + kDefaults);
  EXPECT_THAT(
      platform.calls({"attr_find", "slapi_ch_strdup", "attr_merge"}),
      ElementsAre(
          "attr_find(\"orv-slapdAdminRole\", 0, 0)", "slapi_ch_strdup(\"DirDataAdmin\")",
          "slapi_ch_strdup(\"PasswordAdmin\")", "slapi_ch_strdup(\"SchemaAdmin\")",
          "slapi_ch_strdup(\"ServerConfigGroupMember\")",
          "slapi_ch_strdup(\"ServerStartStopAdmin\")",
          std::string("attr_merge(\"orv-slapdAdminRole\", \"") + kDefaults + "\", 1, 1, null)"));
}

TEST_F(Roles, EachDefaultRoleIsTracedAsInformationBeforeAnythingIsAllocated) {
  adding(kMember);
  platform.fail_allocation(1);
  EXPECT_EQ(process(), 90);
  const auto line = [](const char* role) {
    return info(
        "Admin group member CN=ONE,CN=ADMINGROUP,CN=CONFIGURATION is being added with "
        "orv-slapdAdminRole: " +
        std::string(role) + "\n");
  };
  EXPECT_THAT(platform.debug_lines(),
              ElementsAre(line("DirDataAdmin"), line("PasswordAdmin"), line("SchemaAdmin"),
                          line("ServerConfigGroupMember"), line("ServerStartStopAdmin")));
}

TEST_F(Roles, EachFailedAllocationOfTheDefaultsGives90AndNoRoles) {
  int nth = 1;
  for (;; ++nth) {
    adding(kMember);
    platform.fail_allocation(nth);
    const int rc = process();
    if (platform.allocations() < nth) break;
    EXPECT_EQ(rc, 90) << nth;
    EXPECT_EQ(roles(), "none");
    EXPECT_EQ(platform.count("attr_merge"), nth < 12 ? 0 : 1);
    e.reset();
    EXPECT_THAT(platform.leaks(), IsEmpty());
  }
  EXPECT_EQ(nth - 1, 12);  // the array, a value and a text for each role, the merge
}

TEST_F(Roles, OtherCodesOfTheMergeArePassedOnAndTheValuesReleased) {
  for (const int code : {20, -1, 21}) {
    adding(kMember);
    platform.fail("attr_merge", 1, code);
    EXPECT_EQ(process(), code);
    EXPECT_EQ(roles(), "none");
    e.reset();
    EXPECT_THAT(platform.leaks(), IsEmpty());
  }
}

TEST_F(Roles, ExitRecordsCarryTheCode) {
  trcEvents = 0x00020000;
  adding_with({"Wizard"});
  process();
  EXPECT_THAT(platform.records(), ElementsAre("exit 01021100 21"));
  adding(kMember);
  process();
  EXPECT_THAT(platform.records(), ElementsAre("exit 01021100 0"));
  as(0x14);
  adding(kMember);
  process();
  EXPECT_THAT(platform.records(), ElementsAre("exit 01021100 50"));
}

}  // namespace
}  // namespace orv
