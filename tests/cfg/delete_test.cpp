// Deleting entries: what goes with them, what stays, what is refused.
#include "change_fixture.h"

namespace orv::cfg_test {
namespace {

class DeleteTest : public ChangeTest {};

constexpr const char* kTree =
    "dn: cn=top\ncn: top\n\n"
    "dn: ou=a,cn=top\nou: a\n\n"
    "dn: cn=1,ou=a,cn=top\ncn: 1\n\n"
    "dn: ou=b,cn=top\nou: b\n";

TEST_F(DeleteTest, TheEntryGoesWithOneBlankLine) {
  EXPECT_EQ(after_delete(kTree, "cn=1,ou=a,cn=top"),
            "dn: cn=top\ncn: top\n\ndn: ou=a,cn=top\nou: a\n\ndn: ou=b,cn=top\nou: b\n");
  EXPECT_EQ(after_delete(kTree, "ou=b,cn=top"),
            "dn: cn=top\ncn: top\n\ndn: ou=a,cn=top\nou: a\n\ndn: cn=1,ou=a,cn=top\ncn: 1\n");
}

TEST_F(DeleteTest, FurtherBlankLinesStay) {
  EXPECT_EQ(after_delete("dn: cn=top\ncn: top\n\n\ndn: cn=a,cn=top\ncn: a\n\n\n\n", "cn=a,cn=top"),
            "dn: cn=top\ncn: top\n\n\n\n\n");
}

TEST_F(DeleteTest, CommentsAboveStayAndDoNotComeToStandAboveAnother) {
  EXPECT_EQ(after_delete("dn: cn=top\ncn: top\n\n# about a\ndn: cn=a,cn=top\ncn: a\n\n"
                         "# about b\ndn: cn=b,cn=top\ncn: b\n",
                         "cn=a,cn=top"),
            "dn: cn=top\ncn: top\n\n# about a\n\n# about b\ndn: cn=b,cn=top\ncn: b\n");
  EXPECT_EQ(after_delete("dn: cn=top\ncn: top\n\n# about\n  a\ndn: cn=a,cn=top\ncn: a\n\n"
                         "dn: cn=b,cn=top\ncn: b\n",
                         "cn=a,cn=top"),
            "dn: cn=top\ncn: top\n\n# about\n  a\n\ndn: cn=b,cn=top\ncn: b\n");
  EXPECT_EQ(
      after_delete("dn: cn=top\ncn: top\n\n# about a\ndn: cn=a,cn=top\ncn: a\n", "cn=a,cn=top"),
      "dn: cn=top\ncn: top\n\n# about a\n");
}

TEST_F(DeleteTest, CommentsBetweenTheLinesGo) {
  EXPECT_EQ(after_delete("dn: cn=top\ncn: top\n\ndn: cn=a,cn=top\n# why\ncn: a\n# off: x\n\n"
                         "# next\n",
                         "cn=a,cn=top"),
            "dn: cn=top\ncn: top\n\n# next\n");
  EXPECT_EQ(after_delete("dn: cn=top\ncn: top\n\ndn: cn=a,cn=top\ncn: a\n# end", "cn=a,cn=top"),
            "dn: cn=top\ncn: top\n");
}

TEST_F(DeleteTest, FoldedEncodedAndLongLinesGoWhole) {
  EXPECT_EQ(
      after_delete("dn: cn=top\ncn: top\n\ndn: cn=a,\n cn=top\ncn:: Y\n Q==\nou: x\n y\n z\n\n"
                   "dn: cn=b,cn=top\ncn: b\n",
                   "cn=a,cn=top"),
      "dn: cn=top\ncn: top\n\ndn: cn=b,cn=top\ncn: b\n");
}

TEST_F(DeleteTest, LinesMayEndWithCarriageReturns) {
  EXPECT_EQ(after_delete("dn: cn=top\r\ncn: top\r\n\r\ndn: cn=a,cn=top\r\ncn: a\r\n\r\n"
                         "dn: cn=b,cn=top\r\ncn: b\r\n",
                         "cn=a,cn=top"),
            "dn: cn=top\r\ncn: top\r\n\r\ndn: cn=b,cn=top\r\ncn: b\r\n");
  EXPECT_EQ(
      after_delete("dn: cn=top\r\ncn: top\r\n\r\ndn: cn=a,cn=top\r\ncn: a\r\n", "cn=a,cn=top"),
      "dn: cn=top\r\ncn: top\r\n");
}

TEST_F(DeleteTest, AnyLegalSpellingFindsTheEntry) {
  EXPECT_EQ(after_delete(kTree, " CN = \\31 , 2.5.4.11=A, commonName=#0403746F70"),
            "dn: cn=top\ncn: top\n\ndn: ou=a,cn=top\nou: a\n\ndn: ou=b,cn=top\nou: b\n");
}

TEST_F(DeleteTest, WhatWasAddedCanBeTakenBackToTheLastByte) {
  for (const char* before :
       {kTree, "dn: cn=top\ncn: top\n", "dn: cn=top\r\ncn: top\r\n\r\n",
        "dn: cn=top\ncn: top\n\n\n# end", "# begin\ndn: cn=top\n# in\ncn: top\n\n# x\n\n# y\n"}) {
    const CfgSession session = open_for_change(before);
    ASSERT_EQ(add(session, "cn=new,cn=top", {{"cn", {"new"}}, {"ou", {"a\nb"}}}), 0);
    EXPECT_NE(read_file(path_), before);
    ASSERT_EQ(remove(session, "CN=NEW,CN=TOP"), 0);
    EXPECT_EQ(read_file(path_), before);
  }
}

TEST_F(DeleteTest, Refusals) {
  EXPECT_EQ(refused_delete(kTree, "ou=a,cn=top"), 66);
  EXPECT_EQ(refused_delete(kTree, "cn=top"), 66);
  EXPECT_EQ(refused_delete(kTree, "cn=2,ou=a,cn=top"), 9);
  EXPECT_EQ(refused_delete(kTree, ""), 9);
  EXPECT_EQ(refused_delete(kTree, "no dn"), 34);
  EXPECT_EQ(refused_delete("dn: cn=top\ncn: top\n", "cn=top"), 53);
  EXPECT_EQ(cfg_delete_s(nullptr, "cn=top"), 1);
  EXPECT_EQ(cfg_delete_s(unbound().get(), "cn=top"), 1);
}

TEST_F(DeleteTest, AnEntryWhoseChildStandsFarBehindIsNoLeaf) {
  EXPECT_EQ(refused_delete("dn: cn=top\ncn: top\n\ndn: ou=a,cn=top\nou: a\n\ndn: ou=b,cn=top\n"
                           "ou: b\n\ndn: cn=1,ou=a,cn=top\ncn: 1\n",
                           "ou=a,cn=top"),
            66);
}

}  // namespace
}  // namespace orv::cfg_test
