#include "cfg/dn.h"

#include <random>

#include "cfg_fixture.h"

namespace orv::cfg {
namespace {

class DnTest : public cfg_test::CfgTest {
 protected:
  static std::string normal(std::string_view text) {
    std::string out = "unchanged";
    const int rc = normalize_dn(text, out);
    if (rc != 0) {
      EXPECT_EQ(out, "unchanged");
      return "error " + std::to_string(rc);
    }
    std::string again;
    EXPECT_EQ(normalize_dn(out, again), 0) << out;
    EXPECT_EQ(again, out) << "the normal form must be stable";
    return out;
  }
  static std::string light(std::string_view text) {
    std::string out;
    const int rc = normalize_dn_light(text, out);
    return rc == 0 ? out : "error " + std::to_string(rc);
  }
};

TEST_F(DnTest, NormalFormOfPlainDns) {
  EXPECT_EQ(normal(""), "");
  EXPECT_EQ(normal("   "), "");
  EXPECT_EQ(normal("cn=Configuration"), "CN=CONFIGURATION");
  EXPECT_EQ(normal(" cn = Master  Server ,  CN=configuration "),
            "CN=MASTER SERVER,CN=CONFIGURATION");
  EXPECT_EQ(normal("commonName=a,2.5.4.3=b"), "CN=A,CN=B");
  EXPECT_EQ(normal("unknown-Type=a,1.2.3=b"), "UNKNOWN-TYPE=A,1.2.3=B");
  EXPECT_EQ(normal("cn="), "CN=");
}

TEST_F(DnTest, ValuesCannotImitateAnRdn) {
  EXPECT_EQ(normal("cn=XCN=ADMINGROUP"), "CN=XCN\\3DADMINGROUP");
  EXPECT_EQ(normal("cn=a\\,CN=ADMINGROUP,cn=Configuration"),
            "CN=A\\2CCN\\3DADMINGROUP,CN=CONFIGURATION");
}

TEST_F(DnTest, EscapesStayOnlyWhereTheyAreNeeded) {
  EXPECT_EQ(normal("cn=\\61\\62c"), "CN=ABC");
  EXPECT_EQ(normal("cn=\\2c\\2B\\22\\5c\\3c\\3E\\3b\\3d"), "CN=\\2C\\2B\\22\\5C\\3C\\3E\\3B\\3D");
  EXPECT_EQ(normal("cn=\\#a#"), "CN=\\23A#");
  EXPECT_EQ(normal("cn=\\ a\\ "), "CN=\\20A\\20");
  EXPECT_EQ(normal("cn=\\20\\20a b\\20 c\\20\\20"), "CN=\\20A B C\\20");
  EXPECT_EQ(normal("cn=a\\09b\\7f"), "CN=A\\09B\\7F");
  EXPECT_EQ(normal("cn=a\tb"), "CN=A\\09B");
  EXPECT_EQ(normal("cn=\\c2\\85"), "CN=\\C2\\85");
  EXPECT_EQ(normal("cn=\\c2\\9f"), "CN=\\C2\\9F");
  EXPECT_EQ(normal("cn=\\c2\\a1"), "CN=\xC2\xA1");
}

TEST_F(DnTest, HexValuesOfStringTypesAreDecoded) {
  EXPECT_EQ(normal("cn=#0C03616263"), "CN=ABC");
  EXPECT_EQ(normal("2.5.4.3=#1303616263 , o=x"), "CN=ABC,O=X");
  EXPECT_EQ(normal("cn=#0403616263"), "CN=ABC");
  EXPECT_EQ(normal("cn=#1e0400610062"), "CN=AB");
  EXPECT_EQ(normal("cn=#1c0400000061"), "CN=A");
  EXPECT_EQ(normal("cn=#1401e4"), "CN=\xC3\x84");
  EXPECT_EQ(normal("cn=#0C81036162632"), "error 34");
  EXPECT_EQ(normal("cn=#0C8103616263"), "CN=ABC");
  EXPECT_EQ(normal("cn=#0C8400000003616263"), "CN=ABC");
  EXPECT_EQ(normal("cn=#0C850000000003616263"), "error 34");
  EXPECT_EQ(normal("cn=#1C0400110000"), "error 34");
  for (const char* text :
       {"cn=#", "cn=#0", "cn=#0C", "cn=#0C04616263", "cn=#0C02616263", "cn=#020101",
        "cn=#3003616263", "cn=#0C80616263", "cn=#0C0100", "cn=#0C01FF", "cn=#xyz", "cn=#1e03006100",
        "cn=#1e02D800", "1.2.3=#020101", "cn=#0C0161zz"}) {
    EXPECT_EQ(normal(text), "error 34") << text;
  }
}

TEST_F(DnTest, LettersAreUpperCasedByFullUnicodeRules) {
  EXPECT_EQ(normal("cn=stra\xC3\x9F"
                   "e"),
            "CN=STRASSE");
  EXPECT_EQ(normal("cn=\xC3\xA4rger"), normal("cn=A\xCC\x88RGER"));
  EXPECT_EQ(normal("cn=\xEF\xAC\x81sch"), "CN=FISCH");
  EXPECT_EQ(normal("cn=\xEF\xBC\xA1"), "CN=A");  // fullwidth A
  EXPECT_EQ(normal("cn=a\xEF\xBC\x8C"
                   "b"),
            "CN=A\\2CB");  // fullwidth comma
  EXPECT_EQ(normal("cn=\xCF\x83\xCF\x82"), "CN=\xCE\xA3\xCE\xA3");
  EXPECT_EQ(normal("cn=ad\xE2\x80\x8Bmin"), "CN=ADMIN");  // zero width space
  EXPECT_EQ(normal("cn=a\xC2\xA0\xC2\xA0"
                   "b"),
            "CN=A B");  // no-break spaces
}

TEST_F(DnTest, PartsOfAnRdnAreSortedByTypeThenValue) {
  EXPECT_EQ(normal("ou=b + cn=z+cn=a,o=x"), "CN=A+CN=Z+OU=B,O=X");
  EXPECT_EQ(normal("cn=z+cn=a+ou=b,o=x"), normal("OU=B+2.5.4.3=a+CN=Z,o=x"));
  EXPECT_EQ(normal("a-b=1+a=2"), "A=2+A-B=1");
}

TEST_F(DnTest, WhatIsNoDnIsRefused) {
  const std::string deep = [] {
    std::string text = "cn=a";
    for (int i = 0; i < 256; ++i) text += ",cn=a";
    return text;
  }();
  for (const std::string& text : {std::string("a"),
                                  std::string("=a"),
                                  std::string("cn"),
                                  std::string("cn=a,"),
                                  std::string(",cn=a"),
                                  std::string("cn=a,,cn=b"),
                                  std::string("cn=a;cn=b"),
                                  std::string("cn=\"a\""),
                                  std::string("cn=a+"),
                                  std::string("+cn=a"),
                                  std::string("cn=a<b"),
                                  std::string("cn=a>b"),
                                  std::string("cn=\\"),
                                  std::string("cn=\\4"),
                                  std::string("cn=\\zz"),
                                  std::string("cn=\\00"),
                                  std::string("cn=a\0b", 6),
                                  std::string("cn=\xFF"),
                                  std::string("cn=\\ff"),
                                  std::string("c n=a"),
                                  std::string("1=a"),
                                  std::string("1.=a"),
                                  std::string("01.2=a"),
                                  std::string("-cn=a"),
                                  std::string("cn;x=a"),
                                  std::string("cn_=a"),
                                  "cn=" + std::string(kMaxDnLength, 'a'),
                                  deep}) {
    EXPECT_EQ(normal(text), "error 34") << text.substr(0, 80);
    Dn dn;
    EXPECT_EQ(parse_dn(text, dn), 34) << text.substr(0, 80);
    EXPECT_EQ(light(text), "error 34") << text.substr(0, 80);
  }
  EXPECT_EQ(normal("cn=" + std::string(kMaxDnLength - 3, 'a')).size(), kMaxDnLength);
  Dn dn;
  EXPECT_EQ(parse_dn(deep.substr(5), dn), 0);
  EXPECT_EQ(dn.size(), kMaxRdns);
}

// Short DNs take a path of their own.
TEST_F(DnTest, TheLengthOfAValueDoesNotMatter) {
  for (std::size_t length = 490; length < 530; ++length) {
    const std::string a(length, 'a');
    const std::string upper(length, 'A');
    EXPECT_EQ(normal("cn=" + a), "CN=" + upper);
    EXPECT_EQ(normal("ou=b, ou = " + a + " ,ou=c"), "OU=B,OU=" + upper + ",OU=C");
  }
}

TEST_F(DnTest, ANormalFormIsNotLongerThanADnMayBe) {
  const std::string fits((kMaxDnLength - 3) / 3, '=');
  EXPECT_EQ(normal("cn=" + fits).size(), 3 + 3 * fits.size());
  EXPECT_EQ(normal("cn==" + fits), "error 34");
}

TEST_F(DnTest, ParsedPartsHaveCanonicalTypesAndRawValues) {
  Dn dn;
  ASSERT_EQ(parse_dn("COMMONNAME= a\\2c  b +x-Y=#0c0161,o=Top", dn), 0);
  ASSERT_EQ(dn.size(), 2U);
  ASSERT_EQ(dn[0].size(), 2U);
  EXPECT_EQ(dn[0][0].type, "cn");
  EXPECT_EQ(dn[0][0].value, "a,  b");
  EXPECT_EQ(dn[0][1].type, "x-Y");
  EXPECT_EQ(dn[0][1].value, "a");
  EXPECT_EQ(dn[1][0].value, "Top");
}

TEST_F(DnTest, LightFormKeepsLetterCaseTypesAndOrder) {
  EXPECT_EQ(light(" OrV-kn = \\41dmin@Realm , o= x"), "OrV-kn=Admin@Realm,o=x");
  EXPECT_EQ(light("ou=b+cn=a"), "ou=b+cn=a");
  EXPECT_EQ(light("cn=a\\3db"), "cn=a=b");
  EXPECT_EQ(light("cn=a\\,b\\20"), "cn=a\\2Cb\\20");
  EXPECT_EQ(light("cn=#0c0161"), "cn=a");
  EXPECT_EQ(light("cn=a  b"), "cn=a  b");
}

TEST_F(DnTest, CanonicalTypesReplaceSpelledOnesAndNothingElse) {
  std::string out;
  ASSERT_EQ(canonicalize_dn_types("2.5.4.3 = X\\,commonName=y , COMMONNAME=#0c0161+zz=1", out), 0);
  EXPECT_EQ(out, "cn = X\\,commonName=y , cn=#0c0161+zz=1");
  EXPECT_EQ(canonicalize_dn_types("cn", out), 34);
}

TEST_F(DnTest, ParentsAndAncestorsSplitAtUnescapedCommasOnly) {
  EXPECT_EQ(parent_of_normal_dn("CN=A\\2CB,CN=C,O=D"), "CN=C,O=D");
  EXPECT_EQ(parent_of_normal_dn("CN=A\\,B,CN=C"), "CN=C");
  EXPECT_EQ(parent_of_normal_dn("CN=A"), "");
  EXPECT_EQ(parent_of_normal_dn(""), "");
  EXPECT_TRUE(normal_dn_is_at_or_below("CN=A,CN=B", "CN=B"));
  EXPECT_TRUE(normal_dn_is_at_or_below("CN=B", "CN=B"));
  EXPECT_TRUE(normal_dn_is_at_or_below("CN=B", ""));
  EXPECT_TRUE(normal_dn_is_at_or_below("", ""));
  EXPECT_FALSE(normal_dn_is_at_or_below("CN=XCN=B", "CN=B"));
  EXPECT_FALSE(normal_dn_is_at_or_below("CN=B", "CN=A,CN=B"));
  EXPECT_FALSE(normal_dn_is_at_or_below("", "CN=B"));
  EXPECT_FALSE(normal_dn_is_at_or_below("CN=A\\2CCN=B", "CN=B"));
}

// ---- Many spellings of one DN ----

class Speller {
 public:
  explicit Speller(unsigned seed) : random_(seed) {}

  std::string spell(const Dn& dn) {
    std::string out = blanks();
    for (std::size_t i = 0; i < dn.size(); ++i) {
      if (i > 0) out += blanks() + "," + blanks();
      Rdn rdn = dn[i];
      std::shuffle(rdn.begin(), rdn.end(), random_);
      for (std::size_t k = 0; k < rdn.size(); ++k) {
        if (k > 0) out += blanks() + "+" + blanks();
        out += type(rdn[k].type) + blanks() + "=" + blanks() + value(rdn[k].value);
      }
    }
    return out + blanks();
  }

 private:
  bool coin() { return random_() % 2 == 0; }
  std::string blanks() { return std::string(random_() % 3, ' '); }
  static std::string hex(char c) {
    char text[4];
    std::snprintf(text, sizeof text, "%02x", static_cast<unsigned char>(c));
    return text;
  }
  std::string type(const std::string& name) {
    const AttributeType* const known = find_attribute_type(name);
    std::string spelled = name;
    if (known != nullptr && coin()) spelled = known->oid;
    if (known != nullptr && coin() && !known->aliases.empty()) spelled = known->aliases[0];
    return letters(spelled);
  }
  std::string letters(std::string text) {
    for (char& c : text) {
      if (((c | 0x20) >= 'a' && (c | 0x20) <= 'z') && coin()) c = static_cast<char>(c ^ 0x20);
    }
    return text;
  }
  std::string value(const std::string& raw) {
    const std::string text = letters(raw);
    if (random_() % 5 == 0 && text.size() < 128) {
      std::string ber = "#0c" + hex(static_cast<char>(text.size()));
      for (const char c : text) ber += hex(c);
      return ber;
    }
    std::string out;
    for (std::size_t i = 0; i < text.size(); ++i) {
      const char c = text[i];
      const bool edge = i == 0 || i + 1 == text.size();
      const bool special = std::string_view(",+\"\\<>;").find(c) != std::string_view::npos ||
                           (edge && (c == ' ' || c == '#'));
      if (c == ' ' && !edge && coin()) out += " ";
      if (special) {
        out += coin() ? std::string("\\") + c : "\\" + hex(c);
      } else if (random_() % 4 == 0) {
        out += "\\" + hex(c);
      } else {
        out += c;
      }
    }
    return out;
  }
  std::mt19937 random_;
};

TEST_F(DnTest, EverySpellingOfADnHasTheSameNormalForm) {
  std::mt19937 random(20240501);
  const std::string alphabet = "abcxyz09 ,+\"\\<>;=#-_.@!\xC3\xA4";
  const char* types[] = {"cn", "ou", "o", "member", "zz-unknown"};
  for (int round = 0; round < 400; ++round) {
    Dn dn(1 + random() % 4);
    for (Rdn& rdn : dn) {
      rdn.resize(1 + random() % 2);
      for (Ava& ava : rdn) {
        ava.type = types[random() % 5];
        for (std::size_t n = random() % 12; n > 0; --n) {
          const char c = alphabet[random() % (alphabet.size() - 2)];
          if (c == '\xC3') continue;
          if (random() % 16 == 0) {
            ava.value += "\xC3\xA4";
          } else {
            ava.value += c;
          }
        }
      }
    }
    std::string expected;
    for (unsigned spelling = 0; spelling < 20; ++spelling) {
      const std::string text = Speller(static_cast<unsigned>(round) * 100 + spelling).spell(dn);
      const std::string found = normal(text);
      if (spelling == 0) expected = found;
      ASSERT_EQ(found, expected) << text;
    }
    ASSERT_EQ(expected.find("error"), std::string::npos) << expected;
  }
}

}  // namespace
}  // namespace orv::cfg
