// Which entries fit the schema, and with which code and message others are refused.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <cstring>
#include <sstream>

#include "cfg/attribute_table.h"
#include "cfg/owners.h"
#include "config/default_config.h"
#include "configuration_file.h"
#include "entries.h"
#include "messages.h"
#include "slapi/codepage.h"
#include "slapi/schema.h"

namespace orv {
namespace {

using test::Attributes;
using test::make_entry;
using test::set_values;
using testing::ElementsAre;
using testing::IsEmpty;

constexpr const char* kMemberDn = "cn=alice,CN=ADMINGROUP,CN=CONFIGURATION";

EntryPtr member() {
  return make_entry(kMemberDn,
                    {{"objectClass", {"top", "orv-slapdConfigEntry", "orv-slapdAdminGroupMember"}},
                     {"cn", {"alice"}},
                     {"orv-slapdAdminDN", {"cn=alice"}},
                     {"orv-slapdAdminPW", {"secret"}},
                     {"orv-slapdAdminRole", {"AuditAdmin", "SchemaAdmin"}}});
}

EntryPtr container() {
  return make_entry("cn=box,CN=CONFIGURATION",
                    {{"objectClass", {"top", "container"}}, {"cn", {"box"}}});
}

class SchemaCheck : public testing::Test {
 protected:
  void TearDown() override {
    set_local_code_page("UTF-8");
    initIconvHandle();
  }
  static int check(const EntryPtr& e) { return ldcf_api_schema_check(e.get(), 0, 0); }
  test::MessageRecorder messages_;
};

TEST_F(SchemaCheck, AcceptsAMemberAndSaysNothing) {
  EXPECT_EQ(check(member()), 0);
  EXPECT_THAT(messages_.take(), IsEmpty());
}

TEST_F(SchemaCheck, AnswersANullEntryWith80) {
  EXPECT_EQ(ldcf_api_schema_check(nullptr, 0, 0), 80);
}

TEST_F(SchemaCheck, RefusesAnEntryWithoutObjectClass) {
  const EntryPtr e = member();
  set_values(*e, "objectClass", {});
  EXPECT_EQ(check(e), 65);
  EXPECT_THAT(messages_.take(),
              ElementsAre("9/1 The entry 'cn=alice,CN=ADMINGROUP,CN=CONFIGURATION' does not fit "
                          "the schema: it has no object class."));
}

TEST_F(SchemaCheck, TakesAnObjectClassWithoutValuesForNone) {
  test::Values none{};
  const EntryPtr e = make_entry("cn=x", {});
  ASSERT_EQ(attr_merge(e.get(), "objectClass", none.list(), 1, 1, nullptr), 0);
  EXPECT_EQ(check(e), 65);
  EXPECT_THAT(messages_.take(), ElementsAre(testing::HasSubstr("9/1")));
}

TEST_F(SchemaCheck, RefusesAnUnknownObjectClass) {
  const EntryPtr e = container();
  set_values(*e, "objectClass", {"top", "container", "spaceship"});
  EXPECT_EQ(check(e), 65);
  EXPECT_THAT(messages_.take(), ElementsAre("9/2 The entry 'cn=box,CN=CONFIGURATION' does not fit "
                                            "the schema: there is no object class 'spaceship'."));
}

TEST_F(SchemaCheck, RefusesAnUnknownTypeWith17) {
  const EntryPtr e = container();
  set_values(*e, "shoeSize", {"43"});
  EXPECT_EQ(check(e), 17);
  EXPECT_THAT(messages_.take(), ElementsAre("9/3 The entry 'cn=box,CN=CONFIGURATION' does not fit "
                                            "the schema: there is no attribute type 'shoeSize'."));
}

TEST_F(SchemaCheck, RefusesAnAttributeOptionWith17) {
  const EntryPtr e = container();
  set_values(*e, "description;lang-en", {"a box"});
  EXPECT_EQ(check(e), 17);
}

TEST_F(SchemaCheck, RefusesASecondValueOfASingleValuedTypeWith19) {
  const EntryPtr e = member();
  set_values(*e, "orv-slapdAdminDN", {"cn=alice", "cn=bob"});
  EXPECT_EQ(check(e), 19);
  EXPECT_THAT(messages_.take(),
              ElementsAre("9/4 The entry 'cn=alice,CN=ADMINGROUP,CN=CONFIGURATION' does not fit "
                          "the schema: 'orv-slapdAdminDN' has more than one value."));
}

TEST_F(SchemaCheck, RefusesAValueThatIsNotOfTheSyntaxWith21) {
  const EntryPtr e = member();
  set_values(*e, "orv-slapdAdminDN", {"alice"});
  EXPECT_EQ(check(e), 21);
  EXPECT_THAT(messages_.take(),
              ElementsAre("9/5 The entry 'cn=alice,CN=ADMINGROUP,CN=CONFIGURATION' does not fit "
                          "the schema: a value of 'orv-slapdAdminDN' is not a DN."));
}

TEST_F(SchemaCheck, NeverWritesAPasswordIntoAMessage) {
  const EntryPtr e = member();
  set_values(*e, "orv-slapdAdminPW", {std::string("hid\0den", 7)});
  EXPECT_EQ(check(e), 21);
  EXPECT_THAT(messages_.take(), ElementsAre(testing::Not(testing::HasSubstr("hid"))));
}

TEST_F(SchemaCheck, RefusesAValueThatIsTooLongWith19) {
  const EntryPtr e = make_entry("CN=CONFIGURATION",
                                {{"objectClass", {"top", "orv-slapdConfigEntry", "orv-slapdTop"}},
                                 {"cn", {"Configuration"}},
                                 {"orv-slapdAdminDN", {"cn=root"}},
                                 {"orv-slapdIpAddress", {"127.0.0.1", std::string(65, '1')}}});
  EXPECT_EQ(check(e), 19);
  set_values(*e, "orv-slapdIpAddress", {"127.0.0.1", std::string(64, '1')});
  EXPECT_EQ(check(e), 0);
}

TEST_F(SchemaCheck, RefusesAnAttributeWithoutValuesWith21) {
  const EntryPtr e = container();
  test::Values none{};
  ASSERT_EQ(attr_merge(e.get(), "description", none.list(), 1, 1, nullptr), 0);
  EXPECT_EQ(check(e), 21);
}

TEST_F(SchemaCheck, RefusesAnAttributeThatTheClassesDoNotAllow) {
  const EntryPtr e = container();
  set_values(*e, "orv-slapdPort", {"389"});
  EXPECT_EQ(check(e), 65);
  EXPECT_THAT(messages_.take(), ElementsAre("9/6 The entry 'cn=box,CN=CONFIGURATION' does not fit "
                                            "the schema: its object classes do not allow "
                                            "'orv-slapdPort'."));
}

TEST_F(SchemaCheck, AllowsWhatASuperiorClassAllowsAlthoughItIsNotNamed) {
  const EntryPtr e = member();
  set_values(*e, "objectClass", {"orv-slapdAdminGroupMember"});
  set_values(*e, "description", {"from orv-slapdConfigEntry"});
  EXPECT_EQ(check(e), 0);
}

TEST_F(SchemaCheck, DemandsWhatASuperiorClassDemandsAlthoughItIsNotNamed) {
  const EntryPtr e = member();
  set_values(*e, "objectClass", {"orv-slapdAdminGroupMember"});
  set_values(*e, "cn", {});
  EXPECT_EQ(check(e), 65);
  EXPECT_THAT(messages_.take(),
              ElementsAre("9/9 The entry 'cn=alice,CN=ADMINGROUP,CN=CONFIGURATION' does not fit "
                          "the schema: its object classes demand 'cn'."));
}

TEST_F(SchemaCheck, AllowsOperationalAttributesInEveryEntry) {
  const EntryPtr e = container();
  set_values(*e, "createTimestamp", {"20260101000000Z"});
  EXPECT_EQ(check(e), 0);
}

TEST_F(SchemaCheck, DemandsAStructuralClass) {
  for (const std::vector<std::string>& classes :
       {std::vector<std::string>{"top"}, {"top", "orv-replicationContext"}}) {
    const EntryPtr e = make_entry(nullptr, {{"objectClass", classes}});
    EXPECT_EQ(check(e), 65);
    EXPECT_THAT(messages_.take(), ElementsAre("9/7 The entry '' does not fit the schema: it has no "
                                              "structural object class."));
  }
}

TEST_F(SchemaCheck, RefusesTwoStructuralClasses) {
  const EntryPtr e =
      make_entry("cn=x,CN=CONFIGURATION",
                 {{"objectClass",
                   {"top", "orv-slapdConfigEntry", "orv-slapdReplication", "orv-slapdSupplier"}},
                  {"cn", {"x"}},
                  {"orv-slapdMasterDN", {"cn=x"}}});
  EXPECT_EQ(check(e), 65);
  EXPECT_THAT(messages_.take(),
              ElementsAre("9/8 The entry 'cn=x,CN=CONFIGURATION' does not fit the schema: "
                          "'orv-slapdReplication' and 'orv-slapdSupplier' are structural object "
                          "classes of which neither derives from the other."));
}

TEST_F(SchemaCheck, AllowsAnAuxiliaryClassBesideTheStructuralOne) {
  const EntryPtr e = container();
  set_values(*e, "objectClass", {"top", "container", "orv-replicationContext"});
  EXPECT_EQ(check(e), 0) << "the rule against it has a code of its own";
}

TEST_F(SchemaCheck, KnowsTheClassOfReferrals) {
  const EntryPtr e = make_entry(
      nullptr, {{"objectClass", {"top", "referral"}}, {"ref", {"ldap://example.com/o=x"}}});
  EXPECT_EQ(check(e), 0);
}

TEST_F(SchemaCheck, DemandsWhatTheRulesLookAt) {
  const struct {
    const char* object_class;
    const char* type;
  } cases[] = {
      {"orv-slapdTop", "orv-slapdAdminDN"},
      {"orv-slapdAdminGroupMember", "orv-slapdAdminRole"},
      {"orv-slapdAdminGroupMember", "orv-slapdAdminDN"},
      {"orv-slapdKerberos", "orv-slapdKrbAdminDN"},
      {"orv-slapdReplication", "orv-slapdMasterDN"},
      {"orv-slapdSupplier", "orv-slapdMasterDN"},
      {"orv-slapdPta", "orv-slapdPtaSubtree"},
      {"orv-slapdPta", "orv-slapdPtaURL"},
      {"orv-slapdProxySplit", "orv-slapdProxySplitName"},
  };
  const Attributes values{
      {"orv-slapdAdminDN", {"cn=a"}},          {"orv-slapdAdminRole", {"NoAdmin"}},
      {"orv-slapdKrbAdminDN", {"orv-kn=a@B"}}, {"orv-slapdMasterDN", {"cn=a"}},
      {"orv-slapdPtaURL", {"ldap://h"}},       {"orv-slapdPtaSubtree", {"o=a"}},
      {"orv-slapdProxySplitName", {"a"}}};
  for (const auto& c : cases) {
    const ObjectClass* const object_class = builtin_schema().object_class(c.object_class);
    ASSERT_NE(object_class, nullptr);
    const EntryPtr e =
        make_entry(nullptr, {{"objectClass", {"top", c.object_class}}, {"cn", {"x"}}});
    for (const auto& [type, texts] : values)
      if (std::find(object_class->must.begin(), object_class->must.end(), type) !=
          object_class->must.end())
        set_values(*e, type.c_str(), texts);
    EXPECT_EQ(check(e), 0) << c.object_class;
    set_values(*e, c.type, {});
    EXPECT_EQ(check(e), 65) << c.object_class << " " << c.type;
  }
}

TEST_F(SchemaCheck, ReportsUnknownClassesBeforeUnknownTypesAndThoseBeforeMissingOnes) {
  const EntryPtr e = make_entry(nullptr, {{"objectClass", {"container", "spaceship"}},
                                          {"shoeSize", {"43"}},
                                          {"orv-slapdPort", {"many"}}});
  EXPECT_EQ(check(e), 65);
  set_values(*e, "objectClass", {"container"});
  EXPECT_EQ(check(e), 17);
  set_values(*e, "shoeSize", {});
  EXPECT_EQ(check(e), 21);
  set_values(*e, "orv-slapdPort", {"389"});
  EXPECT_EQ(check(e), 65);
  messages_.take();
  set_values(*e, "orv-slapdPort", {});
  EXPECT_EQ(check(e), 65);
  EXPECT_THAT(messages_.take(), ElementsAre(testing::HasSubstr("demand 'cn'")));
}

// ---- Names -----------------------------------------------------------------------------------

TEST_F(SchemaCheck, RefusesANameThatTheEntryLacksWith64) {
  const EntryPtr e = member();
  set_values(*e, "cn", {"bob"});
  EXPECT_EQ(check(e), 64);
  EXPECT_THAT(messages_.take(),
              ElementsAre("9/11 The entry 'cn=alice,CN=ADMINGROUP,CN=CONFIGURATION' does not fit "
                          "the schema: its name has a value of 'cn' that the entry lacks."));
}

TEST_F(SchemaCheck, FindsTheNameInEverySpelling) {
  for (const char* dn :
       {"CN=ALICE,CN=ADMINGROUP,CN=CONFIGURATION", "2.5.4.3=\\61lice,CN=CONFIGURATION",
        "commonName = alice , CN=CONFIGURATION", "cn=#0405616c696365,CN=CONFIGURATION"}) {
    const EntryPtr e = member();
    std::free(e->dn);
    e->dn = strdup(dn);
    EXPECT_EQ(check(e), 0) << dn;
  }
}

TEST_F(SchemaCheck, LooksAtEveryPartOfTheName) {
  const EntryPtr e = container();
  std::free(e->dn);
  e->dn = strdup("cn=box+description=blue,CN=CONFIGURATION");
  EXPECT_EQ(check(e), 64);
  set_values(*e, "description", {"red", "Blue"});
  EXPECT_EQ(check(e), 0);
}

TEST_F(SchemaCheck, RefusesAPasswordInANameWith64) {
  for (const char* dn : {"orv-slapdAdminPW=secret,CN=ADMINGROUP,CN=CONFIGURATION",
                         "cn=alice+2.25.83817390626969804497818767862655265745.1.2=secret,o=x"}) {
    const EntryPtr e = member();
    std::free(e->dn);
    e->dn = strdup(dn);
    EXPECT_EQ(check(e), 64) << dn;
    EXPECT_THAT(messages_.take(), ElementsAre(testing::HasSubstr("'orv-slapdAdminPW' is a "
                                                                 "password")));
  }
}

TEST_F(SchemaCheck, DoesNotTellAPasswordThatStandsInAName) {
  ASSERT_EQ(cfg::register_attribute_types(builtin_schema().attribute_table()), 0);
  for (const auto& [dn, shown] :
       {std::pair{"orv-slapdAdminPW=hidden,CN=CONFIGURATION",
                  "'orv-slapdAdminPW=********,cn=CONFIGURATION'"},
        {"cn=box,cn=a+2.25.83817390626969804497818767862655265745.1.2=hidden,CN=CONFIGURATION",
         "'cn=box,cn=a+orv-slapdAdminPW=********,cn=CONFIGURATION'"},
        {"orv-slapdAdminPW=hidden,,", "'not a DN'"}}) {
    const EntryPtr e = container();
    std::free(e->dn);
    e->dn = strdup(dn);
    set_values(*e, "objectClass", {"nonsense"});
    EXPECT_EQ(check(e), 65) << dn;
    EXPECT_THAT(messages_.take(), ElementsAre(testing::HasSubstr(shown)));
  }
}

TEST_F(SchemaCheck, HasNothingToSayAboutTheEmptyName) {
  const EntryPtr e = container();
  e->dn[0] = '\0';
  EXPECT_EQ(check(e), 0);
}

TEST_F(SchemaCheck, RefusesADnThatIsNoneWith34) {
  const EntryPtr e = container();
  std::free(e->dn);
  e->dn = strdup("box");
  EXPECT_EQ(check(e), 34);
}

// ---- Entries of a file in another code page --------------------------------------------------

TEST_F(SchemaCheck, ReadsEntriesOfTheFileInItsCodePage) {
  set_local_code_page("ISO-8859-1");
  ASSERT_EQ(initIconvHandle(), 0);
  const EntryPtr e = make_entry(
      "cn=caf\xE9,CN=CONFIGURATION",
      {{"objectClass", {"top", "container"}}, {"cn", {"CAF\xC9"}}, {"description", {"\xE9"}}});
  EXPECT_EQ(check(e), 21) << "not UTF-8";
  e->local_code_page = true;
  EXPECT_EQ(check(e), 0);
  set_values(*e, "description", {std::string(1, '\0')});
  e->local_code_page = false;
  EXPECT_EQ(check(e), 21);
}

TEST_F(SchemaCheck, LeavesTextThatTheCodePageLacksAsItIs) {
  set_local_code_page("EUC-JP");
  ASSERT_EQ(initIconvHandle(), 0);
  const EntryPtr e = container();
  set_values(*e, "description", {"\xFF\xFF"});
  EXPECT_EQ(check(e), 21);
  e->local_code_page = true;
  EXPECT_EQ(check(e), 0);
}

// ---- Many ------------------------------------------------------------------------------------

TEST_F(SchemaCheck, TakesTenThousandValuesOfAMegabyte) {
  const EntryPtr e = container();
  std::vector<std::string> many;
  for (int i = 0; i < 10000; ++i) many.push_back("value " + std::to_string(i));
  many.emplace_back(1 << 20, 'x');
  set_values(*e, "description", many);
  EXPECT_EQ(check(e), 0);
}

// ---- The default configuration ---------------------------------------------------------------

std::string default_configuration() {
  std::string text = kDefaultConfigText;
  for (const auto& [word, value] : {std::pair{"@DIR@", "/srv/orv"}, {"@ADMINPW@", "secret"}})
    for (std::size_t at = text.find(word); at != std::string::npos; at = text.find(word))
      text.replace(at, std::strlen(word), value);
  return text;
}

// Takes the comment sign off the examples that a reader is to take over.
std::string with_examples(std::string text) {
  std::string all;
  std::istringstream lines(text);
  bool in_example = false;
  for (std::string line; std::getline(lines, line); all += line + "\n") {
    if (line.starts_with("# dn: ")) in_example = true;
    if (!line.starts_with("# ")) in_example = false;
    if (in_example) line.erase(0, 2);
  }
  return all;
}

TEST_F(SchemaCheck, AcceptsTheDefaultConfigurationWithItsExamples) {
  const std::string text = default_configuration();
  for (const std::string& ldif : {text, with_examples(text)}) {
    test::ConfigurationFile file(ldif);
    _CFGMessage* chain = nullptr;
    ASSERT_EQ(cfg_search_s(file.session(), "CN=CONFIGURATION", kScopeSubtree, nullptr, nullptr, 0,
                           &chain),
              0);
    const CfgResult result(chain);
    EXPECT_GT(cfg_count_entries(file.session(), chain), ldif == text ? 15 : 19);
    for (_CFGMessage* record = cfg_first_entry(file.session(), chain); record != nullptr;
         record = cfg_next_entry(file.session(), record)) {
      const EntryPtr e(CFGMessage2Entry(file.session(), record));
      ASSERT_NE(e, nullptr);
      EXPECT_EQ(check(e), 0) << e->dn << testing::PrintToString(messages_.take());
    }
  }
}

// ---- Referrals -------------------------------------------------------------------------------

TEST(Referral, IsRefusedWith53UnderAnyNameOfItsClass) {
  for (const char* name : {"referral", "REFERRAL", "2.16.840.1.113730.3.2.6"})
    EXPECT_EQ(checkReferral(make_entry(nullptr, {{"objectClass", {"top", name}}}).get()), 53)
        << name;
}

TEST(Referral, OtherEntriesAreNone) {
  EXPECT_EQ(checkReferral(member().get()), 0);
  EXPECT_EQ(checkReferral(make_entry(nullptr, {{"objectClass", {"referrals"}}}).get()), 0);
  EXPECT_EQ(checkReferral(make_entry(nullptr, {{"cn", {"referral"}}}).get()), 0);
  EXPECT_EQ(checkReferral(make_entry(nullptr, {}).get()), 0);
  EXPECT_EQ(checkReferral(nullptr), 0);
}

}  // namespace
}  // namespace orv
