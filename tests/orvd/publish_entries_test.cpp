// What the server tells about itself, and which filters find it.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <set>

#include "protocol/encoder.h"
#include "publish/match.h"
#include "publish/root_dse.h"
#include "publish/subschema.h"
#include "server_entries.h"
#include "slapi/control.h"

namespace orv::server {
namespace {

using ::testing::Contains;
using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;

std::vector<std::string> values_of(const EntryPtr& e, const char* type) {
  std::vector<std::string> values;
  const attr* a = attr_find(e.get(), type, 0, 0);
  if (a == nullptr) return values;
  for (berval** value = a->values; *value != nullptr; ++value) {
    values.emplace_back((*value)->bv_val, (*value)->bv_len);
  }
  return values;
}

std::vector<std::string> types_shown(const EntryPtr& e, std::initializer_list<const char*> names) {
  AttributeSelection selection;
  Names list(names);
  EXPECT_TRUE(selection.assign(list.get()));
  std::vector<std::string> types;
  for (const attr* a = e->attributes; a != nullptr; a = a->next) {
    if (selection.wants(a->type)) types.emplace_back(a->type);
  }
  return types;
}

ServerFacts facts() {
  ServerFacts f;
  f.naming_contexts = {"cn=configuration"};
  f.supported_extensions = {"1.3.6.1.4.1.4203.1.11.3"};
  f.supported_features = {"1.3.6.1.4.1.4203.1.5.1"};
  f.restart_settings = {"orv-slapdPort"};
  f.vendor_name = "orv";
  f.vendor_version = "0.1.0";
  return f;
}

// ---- Root DSE

TEST(RootDse, TellsWhatTheServerIs) {
  slapi_register_supported_control("2.16.840.1.113730.3.4.2", -1);
  const EntryPtr e = make_root_dse(facts());
  ASSERT_TRUE(e);
  EXPECT_STREQ(e->dn, "");
  EXPECT_STREQ(e->normalized_dn, "");
  EXPECT_THAT(values_of(e, "objectClass"), ElementsAre("top"));
  EXPECT_THAT(values_of(e, "namingContexts"), ElementsAre("cn=configuration"));
  EXPECT_THAT(values_of(e, "subschemaSubentry"), ElementsAre("cn=subschema"));
  EXPECT_THAT(values_of(e, "supportedControl"), Contains("2.16.840.1.113730.3.4.2"));
  EXPECT_THAT(values_of(e, "supportedExtension"), ElementsAre("1.3.6.1.4.1.4203.1.11.3"));
  EXPECT_THAT(values_of(e, "supportedFeatures"), ElementsAre("1.3.6.1.4.1.4203.1.5.1"));
  EXPECT_THAT(values_of(e, "supportedLDAPVersion"), ElementsAre("3"));
  EXPECT_THAT(values_of(e, "orv-restartSettings"), ElementsAre("orv-slapdPort"));
  EXPECT_THAT(values_of(e, "vendorName"), ElementsAre("orv"));
  EXPECT_THAT(values_of(e, "vendorVersion"), ElementsAre("0.1.0"));
}

TEST(RootDse, WhatTheServerLacksIsAbsentAndNotEmpty) {
  const EntryPtr e = make_root_dse({});
  ASSERT_TRUE(e);
  for (const char* type : {"supportedSASLMechanisms", "supportedExtension", "namingContexts",
                           "supportedFeatures", "vendorName"}) {
    EXPECT_EQ(attr_find(e.get(), type, 0, 0), nullptr) << type;
  }
  ServerFacts with = facts();
  with.sasl_mechanisms = {"EXTERNAL", "SCRAM-SHA-256"};
  EXPECT_THAT(values_of(make_root_dse(with), "supportedSASLMechanisms"),
              ElementsAre("EXTERNAL", "SCRAM-SHA-256"));
}

TEST(RootDse, OnlyTheObjectClassIsAUserAttribute) {
  const EntryPtr e = make_root_dse(facts());
  EXPECT_THAT(types_shown(e, {}), ElementsAre("objectClass"));
  EXPECT_THAT(types_shown(e, {"namingcontexts"}), ElementsAre("namingContexts"));
  const std::size_t operational = types_shown(e, {"+"}).size();
  EXPECT_EQ(types_shown(e, {"*", "+"}).size(), operational + 1);
  EXPECT_GE(operational, 7U);
}

// ---- Subschema

TEST(Subschema, PublishesEveryTypeAndClass) {
  const EntryPtr e = make_subschema(builtin_schema(), 86400);
  ASSERT_TRUE(e);
  EXPECT_STREQ(e->dn, "cn=subschema");
  EXPECT_STREQ(e->normalized_dn, "CN=SUBSCHEMA");
  EXPECT_THAT(values_of(e, "objectClass"), ElementsAre("top", "subentry", "subschema"));
  EXPECT_THAT(values_of(e, "cn"), ElementsAre("subschema"));
  EXPECT_THAT(values_of(e, "createTimestamp"), ElementsAre("19700102000000Z"));
  EXPECT_THAT(values_of(e, "modifyTimestamp"), ElementsAre("19700102000000Z"));
  EXPECT_EQ(values_of(e, "attributeTypes").size(), builtin_schema().attributes().size());
  EXPECT_EQ(values_of(e, "objectClasses").size(), builtin_schema().object_classes().size());
  EXPECT_THAT(values_of(e, "attributeTypes"), Contains(HasSubstr("NAME 'objectClass'")));
  EXPECT_THAT(values_of(e, "objectClasses"), Contains(HasSubstr("NAME 'orv-slapdTop'")));
}

TEST(Subschema, PublishesEverySyntaxAndRuleThatTheSchemaUses) {
  const EntryPtr e = make_subschema(builtin_schema(), 0);
  std::string syntaxes;
  std::string rules;
  for (const std::string& value : values_of(e, "ldapSyntaxes")) syntaxes += value;
  for (const std::string& value : values_of(e, "matchingRules")) rules += value;
  for (const SchemaAttribute& attribute : builtin_schema().attributes()) {
    EXPECT_THAT(syntaxes, HasSubstr("( " + attribute.syntax + " "));
    for (const std::string& rule : {attribute.equality, attribute.ordering, attribute.substrings}) {
      EXPECT_THAT(rules, HasSubstr(rule.empty() ? "" : "'" + rule + "'"));
    }
  }
}

TEST(Subschema, DescriptionsHaveToBeAskedFor) {
  const EntryPtr e = make_subschema(builtin_schema(), 0);
  EXPECT_THAT(types_shown(e, {}), ElementsAre("objectClass", "cn"));
  EXPECT_THAT(types_shown(e, {"attributeTypes", "objectClasses"}),
              ElementsAre("attributeTypes", "objectClasses"));
}

// ---- Filters

class Match : public ::testing::Test {
 protected:
  bool matches(const char* filter) { return entry_matches(*entry_, filter); }
  EntryPtr entry_ = make_subschema(builtin_schema(), 0);
};

TEST_F(Match, PresenceInEverySpelling) {
  EXPECT_TRUE(matches("(objectClass=*)"));
  EXPECT_TRUE(matches("(OBJECTCLASS=*)"));
  EXPECT_TRUE(matches("(2.5.4.0=*)"));
  EXPECT_TRUE(matches("(commonName=*)"));
  EXPECT_FALSE(matches("(description=*)"));
  EXPECT_FALSE(matches("(noSuchType=*)"));
}

TEST_F(Match, EqualityByTheRuleOfTheType) {
  EXPECT_TRUE(matches("(objectClass=subschema)"));
  EXPECT_TRUE(matches("(objectclass=SUBSCHEMA)"));
  EXPECT_TRUE(matches("(objectClass=top)"));
  EXPECT_FALSE(matches("(objectClass=container)"));
  EXPECT_TRUE(matches("(cn=SubSchema)"));
  EXPECT_TRUE(matches("(cn=\\73ubschema)"));
  EXPECT_TRUE(matches("(cn~=subschema)"));
  EXPECT_FALSE(matches("(cn=sub)"));
  EXPECT_FALSE(matches("(cn~=*)"));
}

TEST_F(Match, SetsAndNegations) {
  EXPECT_TRUE(matches("(&(objectClass=top)(cn=subschema))"));
  EXPECT_FALSE(matches("(&(objectClass=top)(cn=other))"));
  EXPECT_TRUE(matches("(|(cn=other)(objectClass=top))"));
  EXPECT_FALSE(matches("(|(cn=other)(cn=another))"));
  EXPECT_TRUE(matches("(!(cn=other))"));
  EXPECT_FALSE(matches("(!(cn=subschema))"));
  EXPECT_TRUE(matches("(&(|(cn=other)(!(cn=other)))(objectClass=*))"));
  EXPECT_TRUE(matches("(!(!(cn=subschema)))"));
}

TEST_F(Match, UndefinedIsNeitherTrueNorFalse) {
  for (const char* item : {"(cn=sub*)", "(cn>=a)", "(cn<=z)", "(cn:=subschema)", "(noSuchType=x)",
                           "(cn:dn:caseExactMatch:=subschema)"}) {
    const std::string text = item;
    EXPECT_FALSE(matches(text.c_str())) << text;
    EXPECT_FALSE(matches(("(!" + text + ")").c_str())) << text;
    EXPECT_TRUE(matches(("(|" + text + "(cn=subschema))").c_str())) << text;
    EXPECT_FALSE(matches(("(&" + text + "(cn=subschema))").c_str())) << text;
  }
}

TEST_F(Match, TextsThatAreNoFiltersMatchNothing) {
  for (const char* text : {"", "(", ")", "()", "(cn", "(cn)", "cn=subschema", "(&)", "(|)", "(!)",
                           "(&(cn=subschema)", "(cn=subschema))", "(cn=subschema)(cn=subschema)",
                           "(!(cn=x)(cn=y))", "(=x)", "(cn=\\7)", "(cn=\\zz)"}) {
    EXPECT_FALSE(matches(text)) << text;
  }
}

TEST_F(Match, DeepNestingCostsNoStack) {
  constexpr int kDepth = 200000;
  std::string text;
  for (int i = 0; i < kDepth; ++i) text += "(!";
  text += "(cn=subschema)" + std::string(kDepth, ')');
  EXPECT_TRUE(matches(text.c_str()));
}

}  // namespace
}  // namespace orv::server
