#include "slapi/schema.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <string>
#include <thread>
#include <vector>

namespace orv {
namespace {

using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;
using testing::StartsWith;

constexpr char kSmall[] =
    "# A comment\n"
    " that goes on\n"
    "\n"
    "attributeTypes: ( 2.5.4.0 NAME 'objectClass' EQUALITY objectIdentifierMatch\n"
    "  SYNTAX 1.3.6.1.4.1.1466.115.121.1.38 )\n"
    "attributeTypes: ( 1.2.3.1 NAME ( 'first' 'uno' 'eins' ) DESC 'With a (bracket'\n"
    "  EQUALITY caseExactMatch SUBSTR caseExactSubstringsMatch ORDERING caseExactOrderingMatch\n"
    "  SYNTAX 1.3.6.1.4.1.1466.115.121.1.15{64} SINGLE-VALUE )\r\n"
    "ATTRIBUTETYPES:( 1.2.3.2 NAME 'second' SUP uno NO-USER-MODIFICATION\n"
    "  USAGE directoryOperation )\n"
    "attributeTypes: ( 1.2.3.3 NAME 'hidden' EQUALITY octetStringMatch\n"
    "  SYNTAX 1.3.6.1.4.1.1466.115.121.1.40 X-ORIGIN 'tests' X-ORV-SECRET 'TRUE' )\n"
    "objectClasses: ( 1.2.4.0 NAME 'base' ABSTRACT MUST objectClass )\n"
    "objectClasses: ( 1.2.4.1 NAME ( 'thing' 'cosa' ) SUP base STRUCTURAL\n"
    "  MUST ( 1.2.3.1 $ EINS ) MAY ( second $ late ) )\n"
    "objectClasses: ( 1.2.4.2 NAME 'helper' SUP 1.2.4.0 AUXILIARY )\n"
    "attributeTypes: ( 1.2.3.4 NAME 'late' SYNTAX 1.3.6.1.4.1.1466.115.121.1.27 )";

std::unique_ptr<const Schema> parse(const std::string& text) {
  std::string error;
  std::unique_ptr<const Schema> schema = Schema::parse(text, error);
  EXPECT_NE(schema, nullptr) << error;
  return schema;
}

std::string refusal(const std::string& text) {
  std::string error;
  EXPECT_EQ(Schema::parse(text, error), nullptr);
  return error;
}

const std::string kSyntax = " SYNTAX 1.3.6.1.4.1.1466.115.121.1.15 ";
const std::string kGood = "attributeTypes: ( 1.2.3.1 NAME 'good'" + kSyntax + ")\n";

TEST(Schema, FindsTypesAndClassesByAnyNameAndByOid) {
  const auto schema = parse(kSmall);
  for (const char* name : {"first", "UNO", "eIns", "1.2.3.1"})
    EXPECT_EQ(schema->canonical_attribute(name), "first") << name;
  for (const char* name : {"thing", "COSA", "1.2.4.1"})
    EXPECT_EQ(schema->canonical_object_class(name), "thing") << name;
  EXPECT_EQ(schema->canonical_attribute("thing"), "");
  EXPECT_EQ(schema->canonical_object_class("first"), "");
  EXPECT_EQ(schema->attribute(""), nullptr);
  EXPECT_EQ(schema->object_class("1.2.4"), nullptr);
  EXPECT_EQ(schema->attributes().size(), 5U);
  EXPECT_EQ(schema->object_classes().size(), 3U);
}

TEST(Schema, ReadsWhatATypeSays) {
  const auto schema = parse(kSmall);
  const SchemaAttribute& first = *schema->attribute("first");
  EXPECT_EQ(first.oid, "1.2.3.1");
  EXPECT_THAT(first.names, ElementsAre("first", "uno", "eins"));
  EXPECT_EQ(first.equality, "caseExactMatch");
  EXPECT_EQ(first.ordering, "caseExactOrderingMatch");
  EXPECT_EQ(first.substrings, "caseExactSubstringsMatch");
  EXPECT_EQ(first.syntax, "1.3.6.1.4.1.1466.115.121.1.15");
  EXPECT_EQ(first.max_characters, 64U);
  EXPECT_EQ(schema->attribute("hidden")->max_characters, 0U);
  EXPECT_TRUE(first.single_valued);
  EXPECT_FALSE(first.operational);
  EXPECT_FALSE(first.no_user_modification);
  EXPECT_FALSE(first.secret);
  EXPECT_TRUE(schema->attribute("hidden")->secret);
}

TEST(Schema, InheritsRulesAndSyntaxFromASuperior) {
  const auto schema = parse(kSmall);
  const SchemaAttribute& second = *schema->attribute("second");
  EXPECT_EQ(second.equality, "caseExactMatch");
  EXPECT_EQ(second.ordering, "caseExactOrderingMatch");
  EXPECT_EQ(second.substrings, "caseExactSubstringsMatch");
  EXPECT_EQ(second.syntax, "1.3.6.1.4.1.1466.115.121.1.15");
  EXPECT_EQ(second.max_characters, 64U);
  EXPECT_FALSE(second.single_valued);
  EXPECT_TRUE(second.operational);
  EXPECT_TRUE(second.no_user_modification);
}

TEST(Schema, InheritsSecrecyFromASuperior) {
  const auto schema = parse("attributeTypes: ( 1.2.1 NAME 'a'" + kSyntax +
                            "X-ORV-SECRET 'TRUE' )\nattributeTypes: ( 1.2.2 NAME 'b' SUP a )\n"
                            "attributeTypes: ( 1.2.3 NAME 'c'" +
                            kSyntax + "X-ORV-SECRET 'FALSE' )\n");
  EXPECT_TRUE(schema->attribute("b")->secret);
  EXPECT_FALSE(schema->attribute("c")->secret);
}

TEST(Schema, ReadsWhatAClassSaysUnderCanonicalNames) {
  const auto schema = parse(kSmall);
  const ObjectClass& thing = *schema->object_class("thing");
  EXPECT_THAT(thing.names, ElementsAre("thing", "cosa"));
  EXPECT_THAT(thing.superiors, ElementsAre("base"));
  EXPECT_THAT(thing.must, ElementsAre("first", "first"));
  EXPECT_THAT(thing.may, ElementsAre("second", "late"));
  EXPECT_EQ(thing.kind, ClassKind::structural);
  EXPECT_EQ(schema->object_class("base")->kind, ClassKind::abstract);
  EXPECT_EQ(schema->object_class("helper")->kind, ClassKind::auxiliary);
  EXPECT_THAT(schema->object_class("helper")->superiors, ElementsAre("base"));
}

TEST(Schema, KeepsDescriptionsForPublishing) {
  const auto schema = parse(kSmall);
  EXPECT_EQ(schema->attribute("second")->description,
            "( 1.2.3.2 NAME 'second' SUP uno NO-USER-MODIFICATION USAGE directoryOperation )");
  EXPECT_THAT(schema->object_class("base")->description, StartsWith("( 1.2.4.0 NAME 'base'"));
}

TEST(Schema, GivesTheRowsOfTheAttributeTable) {
  const auto table = parse(kSmall)->attribute_table();
  ASSERT_EQ(table.size(), 5U);
  EXPECT_EQ(table[0].name, "objectClass");
  EXPECT_EQ(table[0].equality, cfg::MatchingRule::object_identifier);
  EXPECT_EQ(table[1].name, "first");
  EXPECT_EQ(table[1].oid, "1.2.3.1");
  EXPECT_THAT(table[1].aliases, ElementsAre("uno", "eins"));
  EXPECT_EQ(table[1].equality, cfg::MatchingRule::case_exact);
  EXPECT_TRUE(table[1].single_valued);
  EXPECT_FALSE(table[1].secret);
  EXPECT_EQ(table[2].equality, cfg::MatchingRule::case_exact);
  EXPECT_TRUE(table[3].secret);
  EXPECT_EQ(table[3].equality, cfg::MatchingRule::octets);
  EXPECT_EQ(table[4].equality, cfg::MatchingRule::octets) << "a type without an equality rule";
}

TEST(Schema, GivesTheRowsOfTheObjectClassTable) {
  const auto schema = parse(kSmall);
  const auto table = schema->object_class_table();
  ASSERT_EQ(table.size(), 3U);
  for (std::size_t i = 0; i < table.size(); ++i) {
    const ObjectClass& known = schema->object_classes()[i];
    EXPECT_EQ(table[i].name, known.names.front());
    EXPECT_EQ(table[i].oid, known.oid);
  }
  const auto thing =
      std::find_if(table.begin(), table.end(), [](const auto& row) { return row.name == "thing"; });
  ASSERT_NE(thing, table.end());
  EXPECT_THAT(thing->aliases, ElementsAre("cosa"));
}

TEST(Schema, MapsEachEqualityRuleToItsComparison) {
  struct Case {
    const char* rule;
    cfg::MatchingRule expected;
  };
  for (const Case& c : {Case{"caseIgnoreMatch", cfg::MatchingRule::case_ignore},
                        Case{"2.5.13.2", cfg::MatchingRule::case_ignore},
                        Case{"caseIgnoreIA5Match", cfg::MatchingRule::case_ignore},
                        Case{"caseExactIA5Match", cfg::MatchingRule::case_exact},
                        Case{"octetStringMatch", cfg::MatchingRule::octets},
                        Case{"distinguishedNameMatch", cfg::MatchingRule::distinguished_name},
                        Case{"integerMatch", cfg::MatchingRule::integer},
                        Case{"booleanMatch", cfg::MatchingRule::boolean},
                        Case{"objectIdentifierMatch", cfg::MatchingRule::object_identifier},
                        Case{"telephoneNumberMatch", cfg::MatchingRule::telephone_number},
                        Case{"generalizedTimeMatch", cfg::MatchingRule::generalized_time}}) {
    const auto schema =
        parse("attributeTypes: ( 1.2.1 NAME 'a' EQUALITY " + std::string(c.rule) + kSyntax + ")\n");
    EXPECT_EQ(schema->attribute_table().at(0).equality, c.expected) << c.rule;
  }
}

TEST(Schema, OfAnEmptyTextIsEmpty) {
  for (const char* text : {"", "\n\n", "# only a comment\n"}) {
    const auto schema = parse(text);
    EXPECT_THAT(schema->attributes(), IsEmpty());
    EXPECT_EQ(schema->attribute("cn"), nullptr);
  }
}

struct Damage {
  std::string text;
  std::string error;  // its beginning
};

TEST(Schema, RefusesDamagedTextsWithLineAndCause) {
  const std::vector<Damage> damages{
      {"attributetype: x\n", "line 1: neither attributeTypes nor objectClasses"},
      {kGood + "\nfoo\n", "line 3: neither attributeTypes nor objectClasses"},
      {" attributeTypes: x\n", "line 1: a continuation of nothing"},
      {kGood + "\n x\n", "line 3: a continuation of nothing"},
      {kGood + std::string("attributeTypes:\0x\n", 18), "line 2: NUL byte"},
      {kGood + "attributeTypes:\n", "line 2: "},
      {kGood + "attributeTypes: ( 1.2.9 NAME 'x'" + kSyntax + "\n", "line 2: "},
      {"attributeTypes: ( 1.2.9 NAME 'x'\n  SINTAX 1.2.3 )\n", "line 2: Unexpected token"},
      {"attributeTypes: ( 1.2.9 NAME 'x\n" + kSyntax + ")\n", "line "},
      {"attributeTypes: ( 1.2.9 NAME 'x'" + kSyntax + ")\n  more\n",
       "line 2: text after the description"},
      {"attributeTypes: ( x-oid NAME 'x'" + kSyntax + ")\n", "line 1: "},
      {"attributeTypes: ( 1..2 NAME 'x'" + kSyntax + ")\n", "line 1: "},
      {"attributeTypes: ( 1.02 NAME 'x'" + kSyntax + ")\n", "line 1: not a numeric OID: '1.02'"},
      {"attributeTypes: ( 1.2.9" + kSyntax + ")\n", "line 1: no NAME"},
      {"attributeTypes: ( 1.2.9 NAME 'a;b'" + kSyntax + ")\n", "line 1: not a name: 'a;b'"},
      {"attributeTypes: ( 1.2.9 NAME '1a'" + kSyntax + ")\n", "line 1: not a name: '1a'"},
      {"attributeTypes: ( 1.2.9 NAME 'x' )\n", "line 1: "},
      {"attributeTypes: ( 1.2.9 NAME 'x' EQUALITY caseIgnorMatch" + kSyntax + ")\n",
       "line 1: unknown matching rule 'caseIgnorMatch'"},
      {"attributeTypes: ( 1.2.9 NAME 'x' SUP good )\n" + kGood, "line 1: unknown superior 'good'"},
      {"attributeTypes: ( 1.2.9 NAME 'x' SUP x )\n", "line 1: unknown superior 'x'"},
      {"attributeTypes: ( 1.2.9 NAME 'x'" + kSyntax + "X-ORV-SECRET 'yes' )\n",
       "line 1: X-ORV-SECRET is neither 'TRUE' nor 'FALSE'"},
      {kGood + "attributeTypes: ( 1.2.9 NAME ( 'x' 'GOOD' )\n " + kSyntax + ")\n",
       "line 2: duplicate name 'GOOD'"},
      {kGood + "attributeTypes: ( 1.2.3.1 NAME 'x'" + kSyntax + ")\n",
       "line 2: duplicate OID '1.2.3.1'"},
      {kGood + "objectClasses: ( 1.2.3.1 NAME 'x' )\n", "line 2: duplicate OID '1.2.3.1'"},
      {"objectClasses: ( 1.2.9 NAME 'x' MUST good )\n", "line 1: unknown attribute type 'good'"},
      {"objectClasses: ( 1.2.9 NAME 'x' MAY ( good $ bad ) )\n" + kGood,
       "line 1: unknown attribute type 'bad'"},
      {"objectClasses: ( 1.2.9 NAME 'x' SUP y )\nobjectClasses: ( 1.2.8 NAME 'y' )\n",
       "line 1: unknown superior 'y'"},
      {"objectClasses: ( 1.2.9 NAME 'x' )\nobjectClasses: ( 1.2.8 NAME 'X' )\n",
       "line 2: duplicate name 'X'"},
      {"objectClasses: ( 1.2.9 NAME 'x' STRUCTURAL )\n"
       "objectClasses: ( 1.2.8 NAME 'y' SUP x AUXILIARY )\n",
       "line 2: a class of another kind as superior: 'x'"},
      {"objectClasses: ( 1.2.9 NAME 'x' STRUCTURAL\n  FOO )\n", "line 2: Unexpected token"},
  };
  for (const Damage& damage : damages)
    EXPECT_THAT(refusal(damage.text), StartsWith(damage.error)) << damage.text;
}

TEST(Schema, RefusesEveryTruncationInsideADescription) {
  const std::string description =
      "attributeTypes: ( 1.2.9 NAME ( 'x' 'y' ) DESC 'it''s' EQUALITY caseIgnoreMatch" + kSyntax +
      "X-ORV-SECRET 'TRUE' )";
  parse("attributeTypes: ( 1.2.9 NAME ( 'x' 'y' ) EQUALITY caseIgnoreMatch" + kSyntax + ")");
  for (std::size_t length = 1; length < description.size(); ++length)
    EXPECT_THAT(refusal(description.substr(0, length)), StartsWith("line 1: ")) << length;
}

TEST(BuiltinSchema, IsReadAndMarksThePasswords) {
  const Schema& schema = builtin_schema();
  EXPECT_EQ(&schema, &builtin_schema());
  EXPECT_EQ(schema.canonical_attribute("OBJECTCLASS"), "objectClass");
  EXPECT_EQ(schema.canonical_attribute("2.5.4.3"), "cn");
  EXPECT_EQ(schema.canonical_object_class("ORV-SLAPDPTA"), "orv-slapdPta");
  for (const char* type : {"orv-slapdAdminPW", "orv-slapdMasterPW"}) {
    ASSERT_NE(schema.attribute(type), nullptr) << type;
    EXPECT_TRUE(schema.attribute(type)->secret) << type;
  }
  EXPECT_FALSE(schema.attribute("orv-slapdAdminDN")->secret);
}

TEST(BuiltinSchema, IsParsedOnceByManyThreads) {
  std::vector<std::thread> threads;
  std::atomic<int> different{0};
  for (int t = 0; t < 8; ++t)
    threads.emplace_back([&] {
      if (&current_schema() != &builtin_schema()) ++different;
      if (builtin_schema().attribute("cn") == nullptr) ++different;
    });
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(different, 0);
}

TEST(CurrentSchema, IsTheBuiltInOneUnlessSet) {
  EXPECT_EQ(&current_schema(), &builtin_schema());
  const auto own = parse(kSmall);
  set_current_schema(own.get());
  EXPECT_EQ(&current_schema(), own.get());
  set_current_schema(nullptr);
  EXPECT_EQ(&current_schema(), &builtin_schema());
}

}  // namespace
}  // namespace orv
