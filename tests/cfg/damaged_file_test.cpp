// Files that must be refused: where, and why, never with a value from the file.
#include "cfg_fixture.h"

namespace orv::cfg_test {
namespace {

using std::string_literals::operator""s;

struct Damage {
  const char* name;
  std::string content;
  int line;  // 0 when the cause is not in one place
  int column;
  const char* cause;
};

const std::string kTop = "dn: cn=top\ncn: top\n\n";  // three lines

const Damage kDamages[] = {
    {"Empty", "", 0, 0, "is empty"},
    {"OnlyAByteOrderMark", "\xEF\xBB\xBF", 0, 0, "is empty"},
    {"OnlyComments", "# a\n\n# b\n", 0, 0, "no entries"},
    {"OnlyAVersion", "version: 1\n", 0, 0, "no entries"},
    {"OtherVersion", "# c\nversion: 2\n\n" + kTop, 2, 1, "version 1"},
    {"VersionInBase64", "version:: MQ==\n\n" + kTop, 1, 1, "version 1"},
    {"VersionNotFirst", kTop + "version: 1\n\n", 4, 1, "begin with a \"dn:\""},
    {"NulByteInValue", "dn: cn=top\ncn: t\0p\n"s, 2, 6, "NUL byte in the file"},
    {"NulByteInComment", "# \0\ndn: cn=top\ncn: top\n"s, 1, 3, "NUL byte in the file"},
    {"NulByteAtTheEnd", kTop + "\0"s, 4, 1, "NUL byte in the file"},
    {"CarriageReturnInValue", "dn: cn=top\ncn: t\rp\n", 2, 6, "carriage return"},
    {"OnlyCarriageReturns", "dn: cn=top\rcn: top\r", 1, 11, "carriage return"},
    {"CarriageReturnAtTheEnd", "dn: cn=top\ncn: top\n\r", 3, 1, "carriage return"},
    {"TwoCarriageReturns", "dn: cn=top\ncn: top\r\r\n", 2, 8, "carriage return"},
    {"ContinuationOfNothing", " cn: top\n" + kTop, 1, 1, "no line before it to continue"},
    {"ContinuationBehindABlankLine", kTop + " cn: x\n", 4, 1, "no line before it to continue"},
    {"LineWithoutColon", "dn: cn=top\ncn: top\nobjectCl\n", 3, 1, "no colon"},
    {"FoldedLineWithoutColon", "dn: cn=top\ncn: top\nobj\n ectCl\n", 3, 1, "no colon"},
    {"EmptyName", "dn: cn=top\n: top\n", 2, 1, "not well formed"},
    {"BlankInName", "dn: cn=top\ncn : top\n", 2, 1, "not well formed"},
    {"UnderscoreInName", "dn: cn=top\nc_n: top\n", 2, 1, "not well formed"},
    {"DigitFirstInName", "dn: cn=top\n1cn: top\n", 2, 1, "not well formed"},
    {"HyphenFirstInName", "dn: cn=top\n-cn: top\n", 2, 1, "not well formed"},
    {"LetterInOid", "dn: cn=top\n1.2.x: top\n", 2, 1, "not well formed"},
    {"NumberAsName", "dn: cn=top\n12: top\n", 2, 1, "not well formed"},
    {"NonAsciiName", "dn: cn=top\n\xC3\xA4: top\n", 2, 1, "not well formed"},
    {"Option", "dn: cn=top\ndescription;lang-en: x\n", 2, 12, "options"},
    {"OptionBehindComment", "dn: cn=top\ncn: a\n# c\n#  d\ncn;x: y\n", 5, 3, "options"},
    {"OptionOnASecret", "dn: cn=top\norv-slapdAdminPW;binary: x\n", 2, 17, "options"},
    {"SecretByAlias", "dn: cn=top\ncn: top\nadminPassword: x\n", 3, 1, "another name than its own"},
    {"SecretByOid", "dn: cn=top\ncn: top\n1.9.6: x\n", 3, 1, "another name than its own"},
    {"SecretByAliasFirst", "dn: cn=top\nADMINPASSWORD:: eA==\n", 2, 1, "another name than its own"},
    {"SecretByFoldedAlias", "dn: cn=top\nadmin\n Password: x\n", 2, 1, "another name than its own"},
    {"SecretInTheFirstDn", "dn: orv-slapdAdminPW=x\ncn: top\n", 1, 5, "secret attribute in a DN"},
    {"SecretAboveTheFirstEntry", "dn: cn=top,o=x+1.9.6=y,o=z\ncn: top\n", 1, 5,
     "secret attribute in a DN"},
    {"SecretInADn", kTop + "dn: orv-slapdAdminPW=x,cn=top\ncn: x\n", 4, 5,
     "secret attribute in a DN"},
    {"SecretInAnRdn", kTop + "dn: cn=x+1.9.6=y,cn=top\ncn: x\n", 4, 5, "secret attribute in a DN"},
    {"Url", "dn: cn=top\ncn:< file:///etc/passwd\n", 2, 3, "URL"},
    {"UrlAsDn", "dn:< file:///etc/passwd\ncn: top\n", 1, 3, "URL"},
    {"ChangeType", "dn: cn=top\nchangetype: add\ncn: top\n", 2, 1, "change records"},
    {"ChangeTypeLater", "dn: cn=top\ncn: top\nChangeType: add\n", 3, 1, "change records"},
    {"Control", "dn: cn=top\ncontrol: 1.2.3 true\ncn: top\n", 2, 1, "change records"},
    {"SearchResultTrailer", kTop + "search: 2\nresult: 0 Success\n", 4, 1, "begin with a \"dn:\""},
    {"Base64CutShort", "dn: cn=top\ncn:: dG9\n", 2, 9, "base64"},
    {"Base64ForeignCharacter", "dn: cn=top\ncn:: dG!w\n", 2, 8, "base64"},
    {"Base64TrailingBlank", "dn: cn=top\ncn:: dG9w \n", 2, 10, "base64"},
    {"Base64Folded", "dn: cn=top\ncn:: dG9\n w!\n", 3, 3, "base64"},
    {"Base64FoldedWithCarriageReturns", "dn: cn=top\r\ncn:: dG9\r\n w\r\n !\r\n", 4, 2, "base64"},
    {"Base64UnusedBits", "dn: cn=top\ncn:: dG9=\n", 2, 8, "base64"},
    {"Base64WithNul", "dn: cn=top\ncn:: YQBi\n", 2, 6, "holds a NUL"},
    {"DnBase64CutShort", "dn:: Y249\ncn: top\n\ndn:: Y24\ncn: x\n", 4, 9, "base64"},
    {"DnBase64WithNul", "dn:: Y249YQA=\ncn: top\n", 1, 1, "holds a NUL"},
    {"NoDnLine", "cn: top\nobjectClass: top\n", 1, 1, "begin with a \"dn:\""},
    {"DnOnly", "dn: cn=top\n", 1, 1, "no attributes"},
    {"SecondEntryDnOnly", kTop + "dn: cn=a,cn=top\n", 4, 1, "no attributes"},
    {"DnAndComment", "dn: cn=top\n# nothing\n\n", 1, 1, "no attributes"},
    {"MissingBlankLine", "dn: cn=top\ncn: top\ndn: cn=a,cn=top\ncn: a\n", 3, 1, "a second \"dn:\""},
    {"BadDn", kTop + "dn: cn=a,\ncn: a\n", 4, 5, "DN is not well formed"},
    {"BadDnBelowABrother", kTop + "dn: cn=a,cn=top\ncn: a\n\ndn: a,cn=top\ncn: a\n", 7, 5,
     "DN is not well formed"},
    {"NameAsDn", "dn: top\ncn: top\n", 1, 5, "DN is not well formed"},
    {"EmptyDn", "dn:\ncn: top\n", 1, 4, "DN is empty"},
    {"BlankDn", "dn:   \ncn: top\n", 1, 7, "DN is empty"},
    {"Duplicate", kTop + "dn: cn=a,cn=top\ncn: a\n\ndn: CN=A , commonName=TOP\ncn: a\n", 7, 5,
     "line 4 has an entry with the same DN"},
    {"DuplicateOfTheFirst", kTop + "dn: CN=\\54OP\ncn: a\n", 4, 5,
     "line 1 has an entry with the same DN"},
    {"DuplicateBrother", kTop + "dn: cn=a,cn=top\ncn: a\n\ndn: cn=A,cn=top\ncn: a\n", 7, 5,
     "line 4 has"},
    {"SecondTree", kTop + "dn: cn=other\ncn: other\n", 4, 5, "DN of its parent"},
    {"AboveTheFirst", "dn: cn=a,cn=top\ncn: a\n\ndn: cn=top\ncn: top\n", 4, 5, "DN of its parent"},
    {"ChildBeforeParent", kTop + "dn: cn=b,cn=a,cn=top\ncn: b\n\ndn: cn=a,cn=top\ncn: a\n", 4, 5,
     "DN of its parent"},
    {"MissingParent", kTop + "dn: cn=b,cn=a,cn=top\ncn: b\n", 4, 5, "DN of its parent"},
    {"CutInAValue", "dn: cn=top\ncn: top\nobjectClass: orv-sl", 3, 20,
     "does not end with a newline"},
    {"CutInAFoldedValue", "dn: cn=top\ncn: top\nx: a\n b", 4, 3, "does not end with a newline"},
    {"CutInADn", kTop + "dn: cn=a,cn=top", 4, 1, "no attributes"},
    {"CutInAName", kTop + "d", 4, 1, "begin with"},
    {"CutBehindAColon", "dn: cn=top\ncn:", 2, 4, "does not end with a newline"},
};

class DamagedFile : public CfgTest, public ::testing::WithParamInterface<Damage> {};

TEST_P(DamagedFile, IsRefusedWithItsPlaceAndCause) {
  const Damage& damage = GetParam();
  const std::string said = refusal(damage.content);
  std::string place = path_ + ": ";
  if (damage.line > 0) {
    place +=
        "line " + std::to_string(damage.line) + ", column " + std::to_string(damage.column) + ": ";
  }
  EXPECT_EQ(said.substr(0, place.size()), place) << said;
  EXPECT_NE(said.find(damage.cause), std::string::npos) << said;
}

INSTANTIATE_TEST_SUITE_P(Table, DamagedFile, ::testing::ValuesIn(kDamages),
                         [](const auto& info) { return std::string(info.param.name); });

class DamagedFileTest : public CfgTest {};

TEST_F(DamagedFileTest, ColumnsDoNotCountTheByteOrderMark) {
  EXPECT_NE(refusal("\xEF\xBB\xBF"
                    "cn: top\n")
                .find("line 1, column 1: "),
            std::string::npos);
}

TEST_F(DamagedFileTest, RefusalsNeverTellAValue) {
  for (const char* content :
       {"dn: cn=top\norv-slapdAdminPW:: c2VjcmV0LW1hcmtlcg=\n",
        "dn: cn=top\nadminPassword: c2VjcmV0\n", "dn: cn=top\norv-slapdAdminPW: c2VjcmV0",
        "dn: orv-slapdAdminPW=c2VjcmV0\ncn: x\n"}) {
    EXPECT_EQ(refusal(content).find("c2VjcmV0"), std::string::npos);
  }
}

TEST_F(DamagedFileTest, EveryTruncationIsRefusedOrEndsAtALineOfAnEntry) {
  const std::string whole =
      "version: 1\n\ndn: cn=top\nobjectClass: top\ncn:: dG9w\n\n# comment\ndn: cn=a,cn=top\n"
      "description: folded\n  text\ncn: a\n";
  for (std::size_t length = 0; length < whole.size(); ++length) {
    const std::string cut = whole.substr(0, length);
    write_file(path_, cut);
    const CfgSession session = unbound();
    const int rc = cfg_bind_s(session.get(), nullptr, nullptr, 128);
    const std::size_t last_line = cut.rfind('\n', cut.size() - 2) + 1;
    const bool ends_well = !cut.empty() && (cut.back() == '\n' || cut[last_line] == '#');
    EXPECT_TRUE(rc == 1 || (rc == 0 && ends_well)) << length;
  }
}

TEST_F(DamagedFileTest, DnsDeeperThanTheLimitAreRefused) {
  std::string content = "dn: cn=a\ncn: a\n\n";
  std::string dn = "cn=a";
  for (int depth = 2; depth <= 256; ++depth) {
    dn = "cn=a," + dn;
    content += "dn: " + dn + "\ncn: a\n\n";
  }
  open(content);
  EXPECT_NE(refusal(content + "dn: cn=a," + dn + "\ncn: a\n").find("DN is not well formed"),
            std::string::npos);
}

}  // namespace
}  // namespace orv::cfg_test
