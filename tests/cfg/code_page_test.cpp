// Files in another code page than UTF-8: names and values are compared as the text that they are.
#include "cfg/code_page.h"

#include "cfg_fixture.h"

namespace orv::cfg_test {
namespace {

// ISO-8859-1, but with an overline in the place of the tilde as some code pages have it, and
// without a text for the byte FF.
int decode(std::string_view text, std::string& utf8) noexcept {
  std::string decoded;
  for (const char c : text) {
    const auto byte = static_cast<unsigned char>(c);
    if (byte == 0xFF) return result::invalid_attribute_syntax;
    if (c == '~') {
      decoded += "\xE2\x80\xBE";
    } else if (byte < 0x80) {
      decoded += c;
    } else {
      decoded += static_cast<char>(0xC0 | byte >> 6);
      decoded += static_cast<char>(0x80 | (byte & 0x3F));
    }
  }
  utf8 = decoded;
  return result::success;
}

class CodePageTest : public CfgTest {
 protected:
  void SetUp() override {
    CfgTest::SetUp();
    cfg::set_text_decoder(&decode);
  }
  void TearDown() override { cfg::set_text_decoder(nullptr); }
};

// "ärger", with a child below it, and one that needs both.
constexpr const char* kTree =
    "dn: cn=top\ncn: top\n\n"
    "dn: cn=\xE4rger,cn=top\ncn: \xE4rger\nmember: cn=\xF8,cn=top\nexactText: \xC4\n\n"
    "dn: cn=below,CN=\xC4RGER,cn=top\ncn: below\n\n"
    "dn: cn=\xE6\xF8,cn=below,cn=\xE4rger,cn=top\ncn: \xE6\xF8\n";

TEST_F(CodePageTest, BaseIsFoundInAnyLetterCase) {
  const CfgSession session = open(kTree);
  for (const char* base : {"cn=\xE4rger,cn=top", "CN=\xC4RGER,CN=TOP", "cn=\\c3\\a4rger,cn=top",
                           "cn=\\C3\\84RGER,cn=top"}) {
    EXPECT_EQ(dns(search(session, base, kScopeBase, nullptr)), (Values{"cn=\xE4rger,cn=top"}));
    EXPECT_EQ(search(session, base, kScopeSubtree, nullptr).size(), 3U);
  }
  EXPECT_EQ(search(session, "CN=\xC6\xD8,CN=BELOW,CN=\xC4RGER,CN=TOP", kScopeBase, nullptr).size(),
            1U);
  EXPECT_EQ(search_code(session, "cn=\xE5rger,cn=top", kScopeBase, nullptr), 32);
}

TEST_F(CodePageTest, BaseThatIsNoTextOfTheCodePageIsNoDn) {
  const CfgSession session = open(kTree);
  EXPECT_EQ(search_code(session, "cn=\xFF,cn=top", kScopeBase, nullptr), 34);
}

TEST_F(CodePageTest, SameNameInOtherLettersIsASecondEntry) {
  EXPECT_EQ(refusal("dn: cn=\xE4\ncn: a\n\ndn: CN=\xC4\ncn: a\n"),
            path_ + ": line 4, column 5: line 1 has an entry with the same DN");
}

TEST_F(CodePageTest, DnThatIsNoTextOfTheCodePageIsRefused) {
  EXPECT_EQ(refusal("dn: cn=top\ncn: top\n\ndn: cn=\xFF,cn=top\ncn: a\n"),
            path_ + ": line 4, column 5: the DN holds bytes that are no text of the code page");
}

TEST_F(CodePageTest, EscapesInADnAreUtf8InEveryCodePage) {
  EXPECT_EQ(refusal("dn: cn=\\e4\ncn: a\n"),
            path_ + ": line 1, column 5: the DN is not well formed");
  const CfgSession session = open("dn: cn=\\c3\\a4\ncn: a\n");
  EXPECT_EQ(search(session, "cn=\xC4", kScopeBase, nullptr).size(), 1U);
}

TEST_F(CodePageTest, SecretInADnBeyondAsciiIsRefused) {
  EXPECT_NE(refusal("dn: orv-slapdAdminPW=\xE4\ncn: a\n").find("secret attribute in a DN"),
            std::string::npos);
}

TEST_F(CodePageTest, TildeOfPlainNamesIsTheOneOfOthers) {
  const CfgSession session = open(
      "dn: cn=top\ncn: t\n\ndn: cn=a~,cn=top\ncn: a\n\ndn: cn=\xE4,cn=A~,cn=top\ncn: x\n\n"
      "dn: cn=c,cn=\xC4,cn=a~,cn=top\ncn: c\n");
  EXPECT_EQ(search(session, "cn=a~,cn=top", kScopeSubtree, nullptr).size(), 3U);
  EXPECT_EQ(search(session, "cn=c,cn=\xE4,cn=a\\e2\\80\\be,cn=top", kScopeBase, nullptr).size(),
            1U);
}

TEST_F(CodePageTest, FilterComparesTexts) {
  const CfgSession session = open(kTree);
  for (const char* filter : {"(cn=\xC4RGER)", "(cn=\xC4r*)", "(cn=*\xC4*)",
                             "(member=CN=\xD8,CN=TOP)", "(exactText=\xC4)", "(cn=\\c3\\a4rger)",
                             "(:caseIgnoreMatch:=\xC4RGER)", "(cn>=\xC4RGER)"}) {
    EXPECT_EQ(search(session, "cn=\xC4rger,cn=top", kScopeBase, filter).size(), 1U) << filter;
  }
  EXPECT_TRUE(search(session, "cn=\xC4rger,cn=top", kScopeBase, "(exactText=\xE4)").empty());
  EXPECT_EQ(dns(search(session, "cn=top", kScopeSubtree, "(cn:dn:=\xC4RGER)")).size(), 3U);
}

TEST_F(CodePageTest, ValueThatIsNoTextOfTheCodePageIsComparedByItsBytes) {
  const CfgSession session = open("dn: cn=top\ncn: a\xFF\n");
  EXPECT_EQ(search(session, "cn=top", kScopeBase, "(cn=A\\ff)").size(), 1U);
  EXPECT_TRUE(search(session, "cn=top", kScopeBase, "(cn=b*)").empty());
}

TEST_F(CodePageTest, NamesAndValuesComeBackAsStored) {
  const CfgSession session = open(kTree);
  const std::vector<FoundEntry> found = search(session, "cn=\xC4rger,cn=top", kScopeBase, nullptr);
  ASSERT_EQ(found.size(), 1U);
  EXPECT_EQ(found[0].dn, "cn=\xE4rger,cn=top");
  EXPECT_EQ(found[0].attributes[0].second, Values{"\xE4rger"});
}

}  // namespace
}  // namespace orv::cfg_test
