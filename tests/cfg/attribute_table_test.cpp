#include "cfg/attribute_table.h"

#include <gtest/gtest.h>

namespace orv::cfg {
namespace {

TEST(AttributeTable, FindsNamesAliasesAndOidsInAnyLetterCase) {
  AttributeType type;
  type.name = "orv-slapdAdminDN";
  type.oid = "2.25.17";
  type.aliases = {"adminDN"};
  ASSERT_EQ(register_attribute_types({type}), 0);
  const AttributeType* const found = find_attribute_type("ORV-SLAPDADMINDN");
  ASSERT_NE(found, nullptr);
  EXPECT_EQ(found->name, "orv-slapdAdminDN");
  EXPECT_EQ(find_attribute_type("admindn"), found);
  EXPECT_EQ(find_attribute_type("2.25.17"), found);
  EXPECT_EQ(find_attribute_type("2.25.1"), nullptr);
  EXPECT_EQ(find_attribute_type(""), nullptr);
  EXPECT_EQ(find_attribute_type("orv_slapdAdminDN"), nullptr);
  EXPECT_EQ(find_attribute_type("cn"), nullptr);
}

TEST(AttributeTable, CanonicalNamesWinOverAliasesOfOthers) {
  AttributeType first;
  first.name = "a";
  first.aliases = {"b"};
  AttributeType second;
  second.name = "b";
  ASSERT_EQ(register_attribute_types({first, second}), 0);
  EXPECT_EQ(find_attribute_type("b")->name, "b");
}

TEST(AttributeTable, HoldsThousandsOfTypes) {
  std::vector<AttributeType> types(5000);
  for (std::size_t i = 0; i < types.size(); ++i) types[i].name = "type-" + std::to_string(i);
  ASSERT_EQ(register_attribute_types(types), 0);
  for (const AttributeType& type : types) {
    const AttributeType* const found = find_attribute_type(type.name);
    ASSERT_NE(found, nullptr);
    EXPECT_EQ(found->name, type.name);
  }
  EXPECT_EQ(find_attribute_type("type-5000"), nullptr);
}

TEST(AttributeTable, AnEmptyTableKnowsNothing) {
  ASSERT_EQ(register_attribute_types({}), 0);
  EXPECT_EQ(find_attribute_type("cn"), nullptr);
}

}  // namespace
}  // namespace orv::cfg
