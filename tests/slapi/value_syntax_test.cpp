// Which values a type may have.

#include "slapi/value_syntax.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "slapi/codepage.h"

namespace orv {
namespace {

using namespace std::string_literals;

const SchemaAttribute& type_named(const char* name) {
  const SchemaAttribute* const type = builtin_schema().attribute(name);
  if (type == nullptr) throw std::invalid_argument(name);
  return *type;
}

int check(const char* type, const std::string& value) {
  return check_value(type_named(type), value);
}

struct SyntaxCase {
  const char* name;
  const char* syntax;
  std::vector<std::string> good;
  std::vector<std::string> bad;
};

void PrintTo(const SyntaxCase& c, std::ostream* out) {
  *out << c.name;
}

class Syntax : public testing::TestWithParam<SyntaxCase> {};

SchemaAttribute type_of(const SyntaxCase& c) {
  SchemaAttribute type;
  type.names = {"x"};
  type.syntax = c.syntax;
  return type;
}

TEST_P(Syntax, AcceptsItsValues) {
  for (const std::string& value : GetParam().good)
    EXPECT_EQ(check_value(type_of(GetParam()), value), 0) << testing::PrintToString(value);
}

TEST_P(Syntax, RefusesOthersAndSaysWhy) {
  std::vector<std::string> bad = GetParam().bad;
  bad.push_back("a\0b"s);
  bad.push_back("\0"s);
  for (const std::string& value : bad) {
    const char* problem = nullptr;
    EXPECT_EQ(check_value(type_of(GetParam()), value, &problem), 21)
        << testing::PrintToString(value);
    EXPECT_NE(problem, nullptr);
    EXPECT_EQ(check_value(type_of(GetParam()), value), 21);
  }
}

const SyntaxCase kCases[] = {
    {"Boolean", "1.3.6.1.4.1.1466.115.121.1.7", {"TRUE", "FALSE"}, {"true", "", "TRUE ", "1"}},
    {"Country",
     "1.3.6.1.4.1.1466.115.121.1.11",
     {"DE", "x."},
     {"", "D", "DEU", "D\xC3", "\xC3\xA4", "D*"}},
    {"Dn",
     "1.3.6.1.4.1.1466.115.121.1.12",
     {"cn=a", "", "CN=a+ou=b, o = c", "cn=\xC3\xA4", "cn=\\2C"},
     {"a", "cn=a,", "cn=a;o=b", "cn=\xFF", "cn=\"a\""}},
    {"DirectoryString",
     "1.3.6.1.4.1.1466.115.121.1.15",
     {"a", " ", "\xC3\xA4", "\n", "\xF0\x9F\x98\x80", std::string(1 << 20, 'x')},
     {"", "\xFF", "\xC3", "\xED\xA0\x80"}},
    {"Time",
     "1.3.6.1.4.1.1466.115.121.1.24",
     {"20260101000000Z", "2026010100Z", "202601010000+0130", "20260101000000.5Z"},
     {"", "20260101000000", "20261301000000Z", " 20260101000000Z", "20260101000000Z ", "now"}},
    {"Ia5", "1.3.6.1.4.1.1466.115.121.1.26", {"", "a", "\x7F"}, {"\xC3\xA4", "\x80"}},
    {"Integer",
     "1.3.6.1.4.1.1466.115.121.1.27",
     {"0", "-1", "12", "123456789012345678901234567890"},
     {"", "-", "-0", "01", "+1", " 1", "1 ", "1.0", "one", "-01"}},
    {"Oid",
     "1.3.6.1.4.1.1466.115.121.1.38",
     {"cn", "a-1", "1.2", "2.5.4.3", "0.0"},
     {"", "1", "1.", ".1", "1..2", "1.02", "-a", "1a", "a.b", "a_b", "cn;x"}},
    {"Octets", "1.3.6.1.4.1.1466.115.121.1.40", {"", "a", "\xFF\xFE", "\n"}, {}},
    {"Telephone",
     "1.3.6.1.4.1.1466.115.121.1.50",
     {"+49 30 1234-5", "(030)"},
     {"", "\xC3\xA4", "a*b", "1\n"}},
    {"Uuid",
     "1.3.6.1.1.16.1",
     {"597ae2f6-16a6-1027-98f4-d28b5365dc14", "597AE2F6-16A6-1027-98F4-D28B5365DC14"},
     {"", "597ae2f616a6102798f4d28b5365dc14", "597ae2f6-16a6-1027-98f4-d28b5365dc1g",
      "597ae2f6-16a6-1027-98f4-d28b5365dc1", "597ae2f6x16a6-1027-98f4-d28b5365dc14"}},
    {"Other", "1.2.3", {"", "a", "\xC3\xA4"}, {"\xFF"}},
};

INSTANTIATE_TEST_SUITE_P(All, Syntax, testing::ValuesIn(kCases),
                         [](const auto& info) { return std::string(info.param.name); });

TEST(Bound, CountsCharacters) {
  SchemaAttribute type;
  type.names = {"x"};
  type.syntax = "1.3.6.1.4.1.1466.115.121.1.15";
  type.max_characters = 3;
  const char* problem = nullptr;
  EXPECT_EQ(check_value(type, "\xC3\xA4\xC3\xB6\xC3\xBC", &problem), 0);
  EXPECT_EQ(problem, nullptr);
  EXPECT_EQ(check_value(type, "\xC3\xA4\xC3\xB6\xC3\xBCx", &problem), 19);
  EXPECT_STREQ(problem, "is longer than its type allows");
  EXPECT_EQ(check_value(type, "\xFF\xFF\xFF\xFF", &problem), 21);
}

// ---- Single types ----------------------------------------------------------------------------

TEST(BindName, IsNeverTheAnonymous) {
  for (const char* type : {"orv-slapdAdminDN", "orv-slapdMasterDN"}) {
    EXPECT_EQ(check(type, "cn=root"), 0);
    EXPECT_EQ(check(type, ""), 21);
    EXPECT_EQ(check(type, " "), 21);
    EXPECT_EQ(check(type, "root"), 21);
  }
  EXPECT_EQ(check("orv-slapdSuffix", ""), 0);
}

TEST(KerberosIdentity, IsSpelledPlainly) {
  for (const char* good : {"orv-kn=admin@R", "ORV-KN=Admin@R.EXAMPLE", "orv-kerberosName=a/b@R",
                           "cn=admin@R", "orv-kn=a\\2Cb@R", "orv-kn=a\\2cb@R"})
    EXPECT_EQ(check("orv-slapdKrbAdminDN", good), 0) << good;
  for (const char* bad :
       {"orv-kn= admin@R", "orv-kn =admin@R", " orv-kn=admin@R", "orv-kn=admin@R ",
        "orv-kn=\\61dmin@R", "orv-kn=a\\,b@R", "orv-kn=#040761646d696e4052", "orv-kn=", "admin@R",
        "", "orv-kn=\\ admin@R"})
    EXPECT_EQ(check("orv-slapdKrbAdminDN", bad), 21) << bad;
}

TEST(DigestName, IsInItsPreparedForm) {
  for (const char* good : {"admin", "Admin", "a b", "caf\xC3\xA9", "\xE6\x97\xA5"})
    EXPECT_EQ(check("orv-slapdDigestAdminUser", good), 0) << good;
  for (const std::string& bad : {""s, " admin"s, "admin "s, "a  b"s,
                                 "a\tb"s,              // a control
                                 "cafe\xCC\x81"s,      // not composed
                                 "\xEF\xBC\xA1"s,      // full-width letter
                                 "a\xC2\xADz"s,        // soft hyphen
                                 "a\xC2\xA0z"s,        // a blank that is none of ASCII
                                 "\xE2\x80\x8Dz"s,     // joiner
                                 "\xEE\x80\x80"s,      // private use
                                 "\xEF\xBF\xBD"s,      // replacement character
                                 "\xF0\x9F\xBF\xBE"s,  // no character
                                 "\xFF"s}) {
    EXPECT_EQ(check("orv-slapdDigestAdminUser", bad), 21) << testing::PrintToString(bad);
  }
}

TEST(Password, IsAnyBytesButNone) {
  for (const char* type : {"orv-slapdAdminPW", "orv-slapdMasterPW"}) {
    EXPECT_EQ(check(type, "\xFFx"), 0);
    EXPECT_EQ(check(type, ""), 21);
    EXPECT_EQ(check(type, "a\0"s), 21);
  }
}

TEST(LogFile, IsAnAbsolutePath) {
  EXPECT_EQ(check("orv-slapdLog", "/var/log/x y.log"), 0);
  EXPECT_EQ(check("orv-slapdLog", "/var/../log"), 0);
  for (const char* bad : {"", "log", "./log", " /log", "/log\n/etc"})
    EXPECT_EQ(check("orv-slapdLog", bad), 21) << bad;
}

TEST(ComparedTexts, AreAsciiUnlessTheFileIsInUtf8) {
  EXPECT_EQ(check("orv-slapdLog", "/caf\xC3\xA9"), 0);
  EXPECT_EQ(check("orv-slapdPtaSubtree", "o=caf\xC3\xA9"), 0);
  set_local_code_page("ISO-8859-1");
  ASSERT_EQ(initIconvHandle(), 0);
  EXPECT_EQ(check("orv-slapdLog", "/caf\xC3\xA9"), 21);
  EXPECT_EQ(check("orv-slapdPtaSubtree", "o=caf\xC3\xA9"), 21);
  EXPECT_EQ(check("orv-slapdPtaSubtree", "o=cafe"), 0);
  EXPECT_EQ(check("description", "caf\xC3\xA9"), 0);
  set_local_code_page("UTF-8");
  ASSERT_EQ(initIconvHandle(), 0);
}

TEST(Vocabulary, IsNotTheSchemas) {
  EXPECT_EQ(check("orv-slapdAdminRole", "Wizard"), 0);
  EXPECT_EQ(check("orv-slapdPwEncryption", "rot13"), 0);
  EXPECT_EQ(check("orv-slapdProxySplitName", "a b"), 0);
  EXPECT_EQ(check("orv-slapdPtaURL", "no URL"), 0);
  EXPECT_EQ(check("orv-slapdIpAddress", "nowhere"), 0);
}

}  // namespace
}  // namespace orv
