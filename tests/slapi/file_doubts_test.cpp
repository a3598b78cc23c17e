// What is told of a configuration file that somebody edited by hand.

#include "slapi/file_doubts.h"

#include <gtest/gtest.h>

namespace orv {
namespace {

using Lines = std::vector<std::string>;

TEST(FileDoubts, NumberedTypesAreFoundWhereALineBeginsWithThem) {
  EXPECT_EQ(numbered_types("version: 1\n# 2.5.4.3: no\ndn: cn=x\n2.5.4.3: x\n 2.5.4.4: folded\n"
                           "2.5.4.0:: dG9w\n2.5.4.3;x: y\ncn: 2.5.4.3: z\n2.5.4"),
            (Lines{"line 4: the attribute type 2.5.4.3 stands under its number",
                   "line 6: the attribute type 2.5.4.0 stands under its number",
                   "line 7: the attribute type 2.5.4.3 stands under its number"}));
  EXPECT_TRUE(numbered_types("").empty());
}

TEST(FileDoubts, AddressOfThisHostIsNoDoubt) {
  EXPECT_EQ(address_doubt("127.0.0.1"), "");
  EXPECT_EQ(address_doubt("::ffff:127.0.0.1"), "");
}

TEST(FileDoubts, AddressThatTheHostLacksIsNamed) {
  for (const char* address : {"192.0.2.1", "2001:db8::1", "localhost", "[::1]", " 127.0.0.1", ""})
    EXPECT_EQ(address_doubt(address),
              std::string("orv-slapdIpAddress ") + address +
                  " is no address of this host; changes of this entry will be refused");
}

TEST(FileDoubts, WildcardsAreRefusedByTheRuleOnAddressesToo) {
  for (const char* address : {"0.0.0.0", "::"})
    EXPECT_EQ(address_doubt(address),
              std::string("orv-slapdIpAddress ") + address +
                  " stands for every address of the host, which is what no value says; changes of "
                  "this entry will be refused");
}

}  // namespace
}  // namespace orv
