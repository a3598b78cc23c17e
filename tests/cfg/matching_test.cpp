// Canonical values: what is equal under each rule, and what is no value of it.
#include "cfg/matching.h"

#include <gtest/gtest.h>

#include "cfg/result_codes.h"
#include "cfg_fixture.h"

namespace orv::cfg {
namespace {

std::string canonical(MatchingRule rule, std::string_view value) {
  std::string form = "unchanged";
  EXPECT_EQ(canonical_value(rule, value, form), result::success) << value;
  return form;
}

// Names are compared by the table, which another test may have replaced.
class CanonicalValue : public ::testing::Test {
 protected:
  void SetUp() override { ASSERT_EQ(register_attribute_types(cfg_test::test_types()), 0); }
};

struct Pair {
  MatchingRule rule;
  const char* a;
  const char* b;
};

TEST_F(CanonicalValue, IsTheSameForEqualValues) {
  for (const Pair& pair :
       {Pair{MatchingRule::case_ignore, " Two   Words ", "TWO WORDS"},
        Pair{MatchingRule::case_ignore,
             "stra\xC3\x9F"
             "e",
             "STRASSE"},
        Pair{MatchingRule::case_ignore, "A\xCC\x88", "\xC3\xA4"},
        Pair{MatchingRule::case_exact, " Two   Words ", "Two Words"},
        Pair{MatchingRule::case_exact, "A\xCC\x88", "\xC3\x84"},
        Pair{MatchingRule::distinguished_name, "cn = A , O=x", "CN=a,o=X"},
        Pair{MatchingRule::distinguished_name, "cn=a+ou=b", "ou=B+commonName=A"},
        Pair{MatchingRule::integer, "007", " 7 "}, Pair{MatchingRule::integer, "-0", "000"},
        Pair{MatchingRule::integer, "-012", "-12"}, Pair{MatchingRule::boolean, "true", " TRUE"},
        Pair{MatchingRule::boolean, "False", "FALSE"},
        Pair{MatchingRule::object_identifier, " Top ", "tOP"},
        Pair{MatchingRule::telephone_number, "+49 30-12 ab", "+493012AB"},
        Pair{MatchingRule::generalized_time, "2024022913+01", "20240229120000Z"},
        Pair{MatchingRule::generalized_time, "2024022912,25Z", "202402291215Z"},
        Pair{MatchingRule::generalized_time, "202402291200.5Z", "20240229120030Z"},
        Pair{MatchingRule::generalized_time, "19991231233000-0045", "200001010015Z"}}) {
    EXPECT_EQ(canonical(pair.rule, pair.a), canonical(pair.rule, pair.b)) << pair.a;
  }
}

TEST_F(CanonicalValue, TellsUnequalValuesApart) {
  for (const Pair& pair :
       {Pair{MatchingRule::case_ignore, "twowords", "two words"},
        Pair{MatchingRule::case_ignore, "a", "\xC3\xA4"}, Pair{MatchingRule::case_exact, "a", "A"},
        Pair{MatchingRule::octets, "a", "a "}, Pair{MatchingRule::octets, "a", "A"},
        Pair{MatchingRule::distinguished_name, "cn=a,o=b", "cn=a\\,o\\3Db"},
        Pair{MatchingRule::integer, "7", "-7"}, Pair{MatchingRule::integer, "7", "70"},
        Pair{MatchingRule::boolean, "TRUE", "FALSE"},
        Pair{MatchingRule::object_identifier, "2.5.6.0", "2.5.6.00"},
        Pair{MatchingRule::telephone_number, "123", "12 4"},
        Pair{MatchingRule::generalized_time, "20240228235959Z", "20240229000000Z"},
        Pair{MatchingRule::generalized_time, "20240229120000.1Z", "20240229120000.2Z"}}) {
    EXPECT_NE(canonical(pair.rule, pair.a), canonical(pair.rule, pair.b)) << pair.a;
  }
}

TEST_F(CanonicalValue, KeepsOctetsAsTheyAre) {
  const std::string bytes("a\0 \xFF ", 5);
  EXPECT_EQ(canonical(MatchingRule::octets, bytes), bytes);
  EXPECT_EQ(canonical(MatchingRule::octets, ""), "");
}

TEST_F(CanonicalValue, OfAnotherSyntaxIsRefusedAndNothingIsWritten) {
  const std::pair<MatchingRule, const char*> strangers[] = {
      {MatchingRule::distinguished_name, "no dn"},
      {MatchingRule::distinguished_name, "cn=a,"},
      {MatchingRule::distinguished_name, "cn=#1C0400110000"},
      {MatchingRule::integer, ""},
      {MatchingRule::integer, "-"},
      {MatchingRule::integer, "+1"},
      {MatchingRule::integer, "1 2"},
      {MatchingRule::integer, "--1"},
      {MatchingRule::boolean, "yes"},
      {MatchingRule::boolean, ""},
      {MatchingRule::generalized_time, ""},
      {MatchingRule::generalized_time, "2024022912"},
      {MatchingRule::generalized_time, "2024002912Z"},
      {MatchingRule::generalized_time, "2024132912Z"},
      {MatchingRule::generalized_time, "2024010012Z"},
      {MatchingRule::generalized_time, "2024013212Z"},
      {MatchingRule::generalized_time, "2024022924Z"},
      {MatchingRule::generalized_time, "202402291260Z"},
      {MatchingRule::generalized_time, "20240229120061Z"},
      {MatchingRule::generalized_time, "2024022912.Z"},
      {MatchingRule::generalized_time, "2024022912+24"},
      {MatchingRule::generalized_time, "2024022912+0060"},
      {MatchingRule::generalized_time, "2024022912+01000"},
      {MatchingRule::generalized_time, "2024022912Zx"}};
  for (const auto& [rule, value] : strangers) {
    std::string form = "kept";
    EXPECT_EQ(canonical_value(rule, value, form), result::invalid_attribute_syntax) << value;
    EXPECT_EQ(form, "kept");
  }
}

TEST_F(CanonicalValue, OfATimeCountsALeapSecondAsTheNextDays) {
  EXPECT_EQ(canonical(MatchingRule::generalized_time, "20161231235960Z"),
            canonical(MatchingRule::generalized_time, "2017010100Z"));
}

TEST_F(CanonicalValue, DropsCharactersWithoutMeaning) {
  for (const char* dropped :
       {"\xC2\xAD", "\xCD\x8F", "\xE1\xA0\x8B", "\xE1\xA0\x8E", "\xE2\x80\x8B", "\xE2\x80\x8F",
        "\xE2\x80\xAA", "\xE2\x80\xAE", "\xE2\x81\xA0", "\xE2\x81\xA3", "\xE2\x81\xAA",
        "\xE2\x81\xAF", "\xEF\xB8\x80", "\xEF\xB8\x8F", "\xEF\xBB\xBF", "\xEF\xBF\xBC",
        "\xF3\xA0\x81\xBF"}) {
    EXPECT_EQ(canonical(MatchingRule::case_exact, std::string("a") + dropped + "b"), "ab")
        << dropped;
  }
}

TEST_F(CanonicalValue, OfATimeCountsDaysOverLeapYearsAndCenturies) {
  // The last hour of a day in one zone is the first of the next day in another.
  for (const auto& [late, early] :
       {std::pair{"2024022823-0100", "2024022900Z"}, std::pair{"2024022923-0100", "2024030100Z"},
        std::pair{"2023022823-0100", "2023030100Z"}, std::pair{"1900022823-0100", "1900030100Z"},
        std::pair{"2000022923-0100", "2000030100Z"}, std::pair{"2023123123-0100", "2024010100Z"},
        std::pair{"1969123123-0100", "1970010100Z"}, std::pair{"0000022923-0100", "0000030100Z"},
        std::pair{"2024043023-0100", "2024050100Z"}}) {
    EXPECT_EQ(canonical(MatchingRule::generalized_time, late),
              canonical(MatchingRule::generalized_time, early))
        << late;
  }
}

std::string key(MatchingRule rule, std::string_view value) {
  std::string text = "unchanged";
  EXPECT_EQ(equality_key(rule, value, text), result::success) << value;
  return text;
}

using EqualityKey = CanonicalValue;

TEST_F(EqualityKey, IsTheSameForEqualValuesAndForNoOthers) {
  EXPECT_EQ(key(MatchingRule::case_ignore, "A  b"), key(MatchingRule::case_ignore, "a B "));
  EXPECT_NE(key(MatchingRule::case_exact, "a"), key(MatchingRule::case_exact, "A"));
  EXPECT_EQ(key(MatchingRule::integer, "007"), key(MatchingRule::integer, "7"));
}

TEST_F(EqualityKey, OfAValueOutsideTheSyntaxIsThatOfNoOtherValue) {
  EXPECT_EQ(key(MatchingRule::integer, "seven"), key(MatchingRule::integer, "seven"));
  EXPECT_NE(key(MatchingRule::integer, "seven"), key(MatchingRule::integer, "SEVEN"));
  // Neither by the form that a value within has, nor by its key.
  EXPECT_NE(key(MatchingRule::boolean, " true"), key(MatchingRule::boolean, "=TRUE"));
  EXPECT_NE(key(MatchingRule::boolean, "TRUE"), key(MatchingRule::boolean, "#TRUE"));
}

TEST(MatchingRuleName, IsKnownByNameInAnyLetterCaseAndByOid) {
  MatchingRule rule{};
  for (const char* name : {"integerMatch", "INTEGERMATCH", "2.5.13.14"}) {
    rule = MatchingRule::octets;
    ASSERT_TRUE(find_matching_rule(name, rule)) << name;
    EXPECT_EQ(rule, MatchingRule::integer);
  }
  rule = MatchingRule::boolean;
  for (const char* name : {"", "integer", "2.5.13", "integerMatch "}) {
    EXPECT_FALSE(find_matching_rule(name, rule)) << name;
    EXPECT_EQ(rule, MatchingRule::boolean);
  }
}

TEST(MatchingRuleName, EveryRuleStandsForItsComparison) {
  struct Named {
    const char* name;
    const char* oid;
    MatchingRule rule;
  };
  for (const Named& named :
       {Named{"objectIdentifierMatch", "2.5.13.0", MatchingRule::object_identifier},
        Named{"distinguishedNameMatch", "2.5.13.1", MatchingRule::distinguished_name},
        Named{"caseIgnoreMatch", "2.5.13.2", MatchingRule::case_ignore},
        Named{"caseExactMatch", "2.5.13.5", MatchingRule::case_exact},
        Named{"numericStringMatch", "2.5.13.8", MatchingRule::telephone_number},
        Named{"caseIgnoreListMatch", "2.5.13.11", MatchingRule::case_ignore},
        Named{"booleanMatch", "2.5.13.13", MatchingRule::boolean},
        Named{"bitStringMatch", "2.5.13.16", MatchingRule::octets},
        Named{"octetStringMatch", "2.5.13.17", MatchingRule::octets},
        Named{"telephoneNumberMatch", "2.5.13.20", MatchingRule::telephone_number},
        Named{"uniqueMemberMatch", "2.5.13.23", MatchingRule::distinguished_name},
        Named{"generalizedTimeMatch", "2.5.13.27", MatchingRule::generalized_time},
        Named{"integerFirstComponentMatch", "2.5.13.29", MatchingRule::case_ignore},
        Named{"objectIdentifierFirstComponentMatch", "2.5.13.30", MatchingRule::case_ignore},
        Named{"directoryStringFirstComponentMatch", "2.5.13.31", MatchingRule::case_ignore},
        Named{"caseExactIA5Match", "1.3.6.1.4.1.1466.109.114.1", MatchingRule::case_exact},
        Named{"caseIgnoreIA5Match", "1.3.6.1.4.1.1466.109.114.2", MatchingRule::case_ignore},
        Named{"UUIDMatch", "1.3.6.1.1.16.2", MatchingRule::case_ignore}}) {
    for (const char* spelled : {named.name, named.oid}) {
      MatchingRule rule{};
      EXPECT_TRUE(find_matching_rule(spelled, rule)) << spelled;
      EXPECT_EQ(rule, named.rule) << spelled;
    }
  }
}

}  // namespace
}  // namespace orv::cfg
