// CFGMessage2Entry, on the library's own results.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "configuration_file.h"
#include "slapi/codepage.h"
#include "slapi/entry.h"
#include "slapi/owners.h"
#include "values.h"

namespace orv {
namespace {

using test::ConfigurationFile;
using test::texts_of;
using test::to_text;
using testing::ElementsAre;
using testing::IsEmpty;

constexpr char kLdif[] =
    "dn: cn=Configuration\n"
    "objectClass: top\n"
    "objectClass: orv-slapdTop\n"
    "cn: Configuration\n"
    "\n"
    "dn: cn=Admin  Group, cn=Configuration\n"
    "cn: Admin  Group\n"
    "description: first\n"
    "objectClass: top\n"
    "objectClass: container\n"
    "description: second\n"
    "description:\n";

EntryPtr read(ConfigurationFile& file, const char* dn, bool types_only = false) {
  const CfgResult result = file.find(dn, types_only);
  return EntryPtr(CFGMessage2Entry(file.session(), file.first(result)));
}

TEST(EntryOfAFile, HasItsAttributesInTheOrderOfTheFile) {
  ConfigurationFile file(kLdif);
  const EntryPtr e = read(file, "cn=admin group,cn=configuration");
  ASSERT_NE(e, nullptr);
  EXPECT_EQ(to_text(*e),
            "cn=Admin  Group|; description=first|second||; objectClass=top|container|; ");
  EXPECT_EQ(attr_find(e.get(), "description", 0, 0)->count, 3);
}

TEST(EntryOfAFile, HasItsDnAsWrittenAndInNormalForm) {
  ConfigurationFile file(kLdif);
  const EntryPtr e = read(file, "cn=admin group,cn=configuration");
  EXPECT_STREQ(e->dn, "cn=Admin  Group, cn=Configuration");
  EXPECT_STREQ(e->normalized_dn, "CN=ADMIN GROUP,CN=CONFIGURATION");
  EXPECT_EQ(e->requested_dn, nullptr);
  EXPECT_TRUE(e->local_code_page);
}

TEST(EntryOfAFile, HasItsObjectClassReferenceAndShortList) {
  ConfigurationFile file(kLdif);
  const EntryPtr e = read(file, "cn=configuration");
  EXPECT_EQ(e->object_classes, attr_find(e.get(), "objectClass", 0, 0));
  EXPECT_THAT(texts_of(e->object_class_list), ElementsAre("top", "orv-slapdTop"));
  EXPECT_EQ(value_find_short_list(e->object_class_list, "ORV-SLAPDTOP", 12), 0);
}

TEST(EntryOfAFile, OutlivesTheResultAndTheSession) {
  EntryPtr e;
  {
    ConfigurationFile file(kLdif);
    e = read(file, "cn=configuration");
  }
  EXPECT_EQ(to_text(*e), "objectClass=top|orv-slapdTop|; cn=Configuration|; ");
  test::Values more{"referral"};
  EXPECT_EQ(attr_merge(e.get(), "objectClass", more.list(), 1, 1, nullptr), 0);
  EXPECT_THAT(texts_of(e->object_class_list), ElementsAre("top", "orv-slapdTop", "referral"));
}

TEST(EntryOfAFile, HasTypesWithoutValuesWhenOnlyTheyWereAskedFor) {
  ConfigurationFile file(kLdif);
  const EntryPtr e = read(file, "cn=configuration", true);
  ASSERT_NE(e, nullptr);
  EXPECT_EQ(to_text(*e), "objectClass=; cn=; ");
  EXPECT_THAT(texts_of(e->object_class_list), IsEmpty());
}

TEST(EntryOfAFile, KeepsTheFilesCodePage) {
  set_local_code_page("ISO-8859-1");
  ASSERT_EQ(initIconvHandle(), 0);
  ConfigurationFile file(
      "dn: cn=configuration\nobjectClass: top\ncn: configuration\ndescription: caf\xE9\n");
  const EntryPtr e = read(file, "cn=configuration");
  EXPECT_THAT(texts_of(attr_find(e.get(), "description", 0, 0)), ElementsAre("caf\xE9"));
  set_local_code_page("UTF-8");
  ASSERT_EQ(initIconvHandle(), 0);
}

}  // namespace
}  // namespace orv
