// Records that are in no file: how they are written, and what matches them.
#include "cfg/ldif.h"

#include "cfg_fixture.h"

namespace orv::cfg {
namespace {

class LdifTest : public cfg_test::CfgTest {
 protected:
  static std::string line(std::string_view type, std::string_view value) {
    std::string out = "before\n";
    append_ldif_line(out, type, value);
    return out.substr(7);
  }

  static int code(std::string_view record, const char* filter) {
    bool matches = true;
    const int rc = ldif_record_matches(record, filter, matches);
    EXPECT_TRUE(rc == 0 || matches);
    return rc;
  }

  static bool matches(const char* filter) {
    bool result = false;
    EXPECT_EQ(ldif_record_matches(kRecord, filter, result), 0) << filter;
    return result;
  }

  static constexpr const char* kRecord =
      "dn: cn=a,cn=somewhere\ncn: a\nou: Two  Words\nnumber: 7\norv-slapdAdminPW: secret\n";
};

TEST_F(LdifTest, LinesAreWrittenSoThatTheyReadBackTheSame) {
  EXPECT_EQ(line("cn", ""), "cn:\n");
  EXPECT_EQ(line("cn", "a b"), "cn: a b\n");
  EXPECT_EQ(line("cn", " a"), "cn:: IGE=\n");
  EXPECT_EQ(line("cn", "a\n"), "cn:: YQo=\n");
  EXPECT_EQ(line("cn", std::string(80, 'x')),
            "cn: " + std::string(72, 'x') + "\n " + std::string(8, 'x') + "\n");
}

TEST_F(LdifTest, ARecordMatchesByTheRulesOfASearch) {
  EXPECT_TRUE(matches("(cn=A)"));
  EXPECT_TRUE(matches("(ou=two words)"));
  EXPECT_TRUE(matches("(&(number>=7)(!(o=*)))"));
  EXPECT_TRUE(matches("orv-slapdAdminPW"));
  EXPECT_FALSE(matches("(orv-slapdAdminPW=secret)"));
  EXPECT_FALSE(matches("(!(orv-slapdAdminPW=secret))"));
  EXPECT_FALSE(matches("(cn=b)"));
}

TEST_F(LdifTest, WhatIsNotOneRecordIsRefused) {
  for (const char* record : {"", "cn: a\n", "dn: cn=a\n", "dn: cn=a\ncn: a", "dn: a\ncn: a\n",
                             "dn: cn=a\ncn;x: a\n", "dn: cn=a\ncn: a\n\ndn: cn=b,cn=a\ncn: b\n"}) {
    EXPECT_EQ(code(record, "(cn=*)"), 1) << record;
  }
  EXPECT_EQ(code(std::string_view("dn: cn=a\ncn: \0\n", 15), "(cn=*)"), 1);
  for (const char* filter : {"(", "(cn=a", "(&(cn=a)", "()"}) {
    EXPECT_EQ(code(kRecord, filter), 2) << filter;
  }
}

}  // namespace
}  // namespace orv::cfg
