#include "slapi/dn.h"

#include <gtest/gtest.h>

#include <cstring>
#include <string>

#include "slapi/owners.h"

namespace orv {
namespace {

TEST(ReplaceDn, PutsTheNormalFormInPlaceOfTheText) {
  char* dn = strdup("cn = Master  Server , CN=configuration");
  ASSERT_EQ(replace_DN(&dn, 1), 0);
  EXPECT_STREQ(dn, "CN=MASTER SERVER,CN=CONFIGURATION");
  std::free(dn);
}

TEST(ReplaceDn, AcceptsTheEmptyDn) {
  char* dn = strdup("");
  ASSERT_EQ(replace_DN(&dn, 1), 0);
  EXPECT_STREQ(dn, "");
  std::free(dn);
}

TEST(ReplaceDn, LeavesWhatIsNoDnToTheCaller) {
  char* const text = strdup("cn=a;cn=b,=");
  char* dn = text;
  EXPECT_EQ(replace_DN(&dn, 1), 34);
  EXPECT_EQ(dn, text);
  EXPECT_STREQ(dn, "cn=a;cn=b,=");
  std::free(text);
}

TEST(ReplaceDn, RefusesNullArguments) {
  char* dn = nullptr;
  EXPECT_EQ(replace_DN(nullptr, 1), 80);
  EXPECT_EQ(replace_DN(&dn, 1), 80);
}

TEST(ReplaceDn, KeepsValuesFromImitatingAnRdn) {
  char* dn = strdup("cn=X\\,CN\\=ADMINGROUP,cn=a");
  ASSERT_EQ(replace_DN(&dn, 1), 0);
  EXPECT_EQ(std::string(dn).find("CN=ADMINGROUP"), std::string::npos);
  std::free(dn);
}

TEST(LightForm, KeepsLetterCaseTypesAndOrder) {
  const EscapedDn dn(dn_normalize_light_esc("orv-kn = Admin@Realm , cn=B+cn=A"));
  ASSERT_NE(dn, nullptr);
  EXPECT_EQ(dn->error, 0);
  EXPECT_STREQ(dn->normalized, "orv-kn=Admin@Realm,cn=B+cn=A");
}

TEST(LightForm, UndoesNeedlessEscapes) {
  const EscapedDn dn(dn_normalize_light_esc("cn=\\61dmin"));
  ASSERT_NE(dn, nullptr);
  EXPECT_STREQ(dn->normalized, "cn=admin");
}

TEST(LightForm, TellsWhatIsNoDnInTheRecord) {
  const EscapedDn dn(dn_normalize_light_esc("no dn"));
  ASSERT_NE(dn, nullptr);
  EXPECT_EQ(dn->error, 34);
  EXPECT_EQ(dn->normalized, nullptr);
}

TEST(LightForm, AcceptsNull) {
  EXPECT_EQ(dn_normalize_light_esc(nullptr), nullptr);
  free_ldap_escDN(nullptr);
}

TEST(Parent, IsWhatFollowsTheFirstUnescapedComma) {
  const MallocText parent(dn_parent_norm(nullptr, "CN=A\\2CB,CN=C,CN=D"));
  EXPECT_STREQ(parent.get(), "CN=C,CN=D");
}

TEST(Parent, IsMissingAtASuffixAtTheTopAndForNull) {
  const char* const suffixes[] = {"CN=OTHER", "CN=CONFIGURATION,O=X", nullptr};
  Backend backend;
  backend.suffixes = suffixes;
  EXPECT_EQ(dn_parent_norm(&backend, "CN=CONFIGURATION,O=X"), nullptr);
  EXPECT_EQ(dn_parent_norm(nullptr, "CN=CONFIGURATION"), nullptr);
  EXPECT_EQ(dn_parent_norm(nullptr, ""), nullptr);
  EXPECT_EQ(dn_parent_norm(&backend, nullptr), nullptr);
  const MallocText parent(dn_parent_norm(nullptr, "CN=CONFIGURATION,O=X"));
  EXPECT_STREQ(parent.get(), "O=X");
}

TEST(NestedDns, AreEqualOrOneBelowTheOther) {
  EXPECT_EQ(are_nested_dn("CN=A,CN=B", "CN=B"), 1);
  EXPECT_EQ(are_nested_dn("CN=B", "CN=A,CN=B"), 1);
  EXPECT_EQ(are_nested_dn("CN=B", "CN=B"), 1);
  EXPECT_EQ(are_nested_dn("", "CN=B"), 1);
  EXPECT_EQ(are_nested_dn("CN=AB", "CN=B"), 0);
  EXPECT_EQ(are_nested_dn("CN=A\\2CCN\\3DB", "CN=B"), 0);
  EXPECT_EQ(are_nested_dn(nullptr, "CN=B"), 0);
  EXPECT_EQ(are_nested_dn("CN=B", nullptr), 0);
}

TEST(CompareDns, LooksAtTheNormalForms) {
  EXPECT_EQ(slapi_dn_compare_v3("cn=a, CN=b", "CN=A,cn=B"), 0);
  EXPECT_EQ(slapi_dn_compare_v3("2.5.4.3=a", "commonName=A"), 0);
  EXPECT_NE(slapi_dn_compare_v3("cn=a", "cn=b"), 0);
  EXPECT_NE(slapi_dn_compare_v3("not a dn", "not a dn"), 0);
  EXPECT_NE(slapi_dn_compare_v3(nullptr, "cn=a"), 0);
  EXPECT_NE(slapi_dn_compare_v3("cn=a", nullptr), 0);
}

}  // namespace
}  // namespace orv
