// What a log shows of a DN.
#include "cfg/masked_dn.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "cfg/attribute_table.h"
#include "cfg/dn.h"

namespace orv::cfg {
namespace {

class MaskedDn : public testing::Test {
 protected:
  void SetUp() override {
    AttributeType password;
    password.name = "vaultKey";
    password.oid = "1.2.3.4";
    password.aliases = {"vaultWord"};
    password.secret = true;
    AttributeType name;
    name.name = "cn";
    ASSERT_EQ(register_attribute_types({password, name}), 0);
  }
  void TearDown() override { ASSERT_EQ(register_attribute_types({}), 0); }

  static std::string shown(const std::string& dn, UnknownTypes unknown = UnknownTypes::shown) {
    std::string text = "unchanged";
    const int code = mask_dn(dn, unknown, text);
    return code == 0 ? text : std::to_string(code) + " " + text;
  }
  static bool may_need_mask(const std::string& dn) {
    std::string normal;
    EXPECT_EQ(normalize_dn(dn, normal), 0) << dn;
    return normal_dn_may_need_mask(normal);
  }
};

TEST_F(MaskedDn, IsAsItWasWithoutASecret) {
  for (const char* dn :
       {"", "cn=a", "CN = a\\,b , unknown=x+cn=#040161", "cn=vaultKey", "cn=a\\=b"})
    EXPECT_EQ(shown(dn), dn);
}

TEST_F(MaskedDn, HidesASecretUnderEveryNameOfItsType) {
  for (const char* name : {"vaultKey", "VAULTKEY", "vaultWord", "1.2.3.4"})
    EXPECT_EQ(shown(std::string("cn=a+") + name + "=hidden,cn=b"), "cn=a+vaultKey=********,cn=b");
}

TEST_F(MaskedDn, KeepsTheRestAsADnThatIsTheSame) {
  EXPECT_EQ(shown("vaultKey=hidden,cn=a\\,b\\+\\22 c"), "vaultKey=********,cn=a\\2Cb\\2B\\22\\20c");
}

TEST_F(MaskedDn, HidesValuesThatAreDnsWithASecret) {
  EXPECT_EQ(shown("cn=cn\\=a\\,vaultKey\\=hidden,cn=b"), "cn=********,cn=b");
  std::string nested = "vaultKey=hidden";
  for (int i = 0; i < 8; ++i) {
    std::string escaped = "cn=";
    for (const char c : nested)
      escaped += c == '=' || c == '\\' ? std::string("\\") + c : std::string(1, c);
    nested = escaped;
    EXPECT_EQ(shown(nested), "cn=********") << i;
  }
}

TEST_F(MaskedDn, HidesValuesOfUnknownTypesWhereItIsToldTo) {
  const auto hidden = [](const char* dn) { return shown(dn, UnknownTypes::hidden); };
  EXPECT_EQ(hidden("vaultKeys=hidden,cn=a"), "vaultKeys=********,cn=a");
  EXPECT_EQ(hidden("cn=a+userPassword=hidden,cn=b"), "cn=a+userPassword=********,cn=b");
  EXPECT_EQ(hidden("1.2.3.5=hidden,CN=b"), "1.2.3.5=********,cn=b");
  EXPECT_EQ(hidden("CN = a\\,b,vaultKey=hidden"), "cn=a\\2Cb,vaultKey=********");
  EXPECT_EQ(hidden("cn=other\\=a"), "cn=other\\=a");
}

TEST_F(MaskedDn, IsNoDnWhenTheNameIsNone) {
  for (const char* text : {"vaultKey=hidden,,", "hidden", "vaultKey=hidden,cn", "=hidden"})
    EXPECT_EQ(shown(text), "34 unchanged");
}

TEST_F(MaskedDn, CanBeToldFromTheNormalForm) {
  for (const char* dn : {"vaultKey=hidden", "cn=a,vaultWord=x,cn=b", "cn=a+1.2.3.4=x",
                         "cn=cn\\=a\\,vaultKey\\=hidden,cn=b"})
    EXPECT_TRUE(may_need_mask(dn)) << dn;
  for (const char* dn : {"cn=a,vault=x", "cn=b+vault=x,cn=a", "1.2.3.5=x"})
    EXPECT_TRUE(may_need_mask(dn)) << dn;
  for (const char* dn : {"", "cn=a", "cn=vaultKey,cn=b+cn=x", "cn=\\,vaultKey,cn=b"})
    EXPECT_FALSE(may_need_mask(dn)) << dn;
}

TEST_F(MaskedDn, SecretIsFoundInTextsOfAnyKind) {
  const auto found = [](std::string_view text) {
    const std::optional<TextPart> part = find_secret(text, 0);
    return part ? text.substr(part->begin, part->end - part->begin) : "none";
  };
  EXPECT_EQ(found("cn=a,vaultKey=hidden,,"), "hidden");
  EXPECT_EQ(found("ldap://h/VAULTWORD=hidden??sub"), "hidden??sub");
  EXPECT_EQ(found("ldap://h/1.2.3.4%3Dhidden"), "hidden");
  EXPECT_EQ(found("ldap:vaultKey=hidden"), "hidden");
  EXPECT_EQ(found("(&(cn=a)(vaultKey;x:dn:>=hid,den)(cn=b))"), "hid,den");
  EXPECT_EQ(found("vaultKey = hidden\\, too\n"), " hidden\\, too");
  EXPECT_EQ(found("vaultKey="), "");
  for (const char* text : {"", "=", "cn=a", "vaultKey", "vaultKeys=a", "my-vaultKey=a", "%3", "\\"})
    EXPECT_EQ(found(text), "none") << text;
}

}  // namespace
}  // namespace orv::cfg
