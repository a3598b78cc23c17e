// How large changes may make an entry.
#include "cfg/entry_limits.h"

#include <utility>

#include "change_fixture.h"

namespace orv::cfg_test {
namespace {

class EntryLimitsTest : public ChangeTest {
 protected:
  EntryLimitsTest() : ChangeTest(memory_directory()) {}
  ~EntryLimitsTest() override { cfg::set_entry_limits({}); }

  // Changes "cn=a" of the tree that the calls before have left.
  int change(const NewEntry& list) {
    const CfgSession session = open_for_change(content_);
    const int rc = modify(session, "cn=a,cn=top", list);
    const std::string before = std::exchange(content_, read_file(path_));
    EXPECT_EQ(content_ == before, rc != 0);
    return rc;
  }
  int add_entry(const NewEntry& list) {
    const CfgSession session = open_for_change(content_);
    return add(session, "cn=n,cn=top", list);
  }
  static NewAttribute adds(const char* type, Values values) {
    return {type, std::move(values), true, kModAdd};
  }
  static NewAttribute deletes(const char* type, Values values = {}) {
    return {type, std::move(values), true, kModDelete};
  }
  static NewAttribute replaces(const char* type, Values values) {
    return {type, std::move(values), false, kModReplace};
  }

  std::string content_ =
      "dn: cn=top\ncn: top\n\ndn: cn=a,cn=top\ncn: a\nou: 1\nou: 2\ndescription: x\n";
};

TEST_F(EntryLimitsTest, ValuesAddUpOverChanges) {
  cfg::set_entry_limits({100, 6});
  EXPECT_EQ(change({adds("ou", {"3"})}), 0);
  EXPECT_EQ(change({adds("ou", {"4"})}), 0);
  EXPECT_EQ(change({adds("ou", {"5"})}), 11);
  EXPECT_NE(told.find("more than 6 values"), std::string::npos) << told;
  EXPECT_EQ(change({adds("o", {"5"})}), 11);
  EXPECT_EQ(change({replaces("ou", {"a", "b", "c", "d", "e"})}), 11);
  EXPECT_EQ(change({deletes("description"), adds("ou", {"5"})}), 0);
}

TEST_F(EntryLimitsTest, AttributesAddUpOverChanges) {
  cfg::set_entry_limits({4, 100});
  EXPECT_EQ(change({adds("o", {"1"})}), 0);
  EXPECT_EQ(change({adds("O", {"2"})}), 0);
  EXPECT_EQ(change({adds("l", {"1"})}), 11);
  EXPECT_NE(told.find("more than 4 attributes"), std::string::npos) << told;
  EXPECT_EQ(change({deletes("description"), adds("l", {"1"})}), 0);
}

TEST_F(EntryLimitsTest, AreForAddedEntriesToo) {
  cfg::set_entry_limits({2, 3});
  EXPECT_EQ(add_entry({adds("cn", {"n"}), adds("ou", {"1", "2", "3"})}), 11);
  EXPECT_EQ(add_entry({adds("cn", {"n"}), adds("ou", {"1"}), adds("o", {"1"})}), 11);
  EXPECT_EQ(add_entry({adds("cn", {"n"}), adds("ou", {"1"}), adds("OU", {"2"})}), 0);
}

TEST_F(EntryLimitsTest, EntryThatIsTooLargeAlreadyMayShrinkAndBeChanged) {
  cfg::set_entry_limits({1, 1});
  EXPECT_EQ(change({replaces("description", {"y"})}), 0);
  EXPECT_EQ(change({deletes("ou", {"1"})}), 0);
  EXPECT_EQ(change({adds("ou", {"1"})}), 11);
}

TEST_F(EntryLimitsTest, NothingIsBoundedBeforeSomebodySaysSo) {
  Values many;
  for (int i = 0; i < 20000; ++i) many.push_back("v" + std::to_string(i));
  EXPECT_EQ(change({adds("ou", many)}), 0);
}

}  // namespace
}  // namespace orv::cfg_test
