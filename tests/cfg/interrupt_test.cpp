// Stopping a search in the middle of one entry.
#include "cfg/interrupt.h"

#include "cfg_fixture.h"

namespace orv::cfg_test {
namespace {

class InterruptTest : public CfgTest {
 protected:
  static std::string list_of(const char* kind, const std::string& item, int count) {
    std::string filter = std::string("(") + kind;
    for (int i = 0; i < count; ++i) filter += item;
    return filter + ")";
  }

  // How often a base search with this filter asks whether it is to stop.
  int questions_of(const std::string& filter) {
    int questions = 0;
    const cfg::InterruptScope scope(
        [](void* context) noexcept {
          ++*static_cast<int*>(context);
          return false;
        },
        &questions);
    EXPECT_EQ(search_code(session_, "cn=top", kScopeBase, filter.c_str()), 0);
    return questions;
  }

  // The result of a base search that is to stop at the `number`th question.
  int code_when_stopped_at(int number, const std::string& filter) {
    const cfg::InterruptScope scope(
        [](void* context) noexcept { return --*static_cast<int*>(context) == 0; }, &number);
    return search_code(session_, "cn=top", kScopeBase, filter.c_str());
  }

  void SetUp() override {
    CfgTest::SetUp();
    session_ = open("dn: cn=top\ncn: top\ndescription: a\ndescription: b\nou: c\n");
  }
  CfgSession session_;
};

const char* const kItems[] = {"(description=x)",      "(description=x*)",     "(unknown=x)",
                              "(orv-slapdAdminPW=x)", "(!(cn=top))",          "(|(description=x))",
                              "(cn:dn:=x)",           "(:caseIgnoreMatch:=x)"};

TEST_F(InterruptTest, AnEntryIsLeftInTheMiddleOfAListOfManyItems) {
  for (const char* item : kItems) {
    EXPECT_EQ(code_when_stopped_at(2, list_of("|", item, 5000)), 3) << item;
    EXPECT_EQ(code_when_stopped_at(2, list_of("&", "(!" + std::string(item) + ")", 5000)), 3)
        << item;
    EXPECT_EQ(code_when_stopped_at(2, "(!" + list_of("|", item, 5000) + ")"), 3) << item;
  }
}

TEST_F(InterruptTest, QuestionsAreAskedEverySoOftenAndNotForSmallFilters) {
  EXPECT_EQ(questions_of("(|(cn=x)(cn=y))"), 1);
  const int questions = questions_of(list_of("|", "(description=x)", 5000));
  EXPECT_GT(questions, 5000 / 1024);
  EXPECT_LT(questions, 5000 / 10);
}

TEST_F(InterruptTest, ItemsCountByTheLinesTheyLookAt) {
  std::string text = "dn: cn=top\ncn: top\n";
  for (int i = 0; i < 2000; ++i) text += "description: " + std::to_string(i) + "\n";
  session_ = open(text);
  for (const char* item : {"(description=x)", "(description:=x)", "(:caseIgnoreMatch:=x)"}) {
    EXPECT_EQ(code_when_stopped_at(2, list_of("|", item, 3)), 3) << item;
    EXPECT_EQ(code_when_stopped_at(2, item), 0) << item;
  }
}

TEST_F(InterruptTest, AQuestionAnsweredWithNoChangesNothing) {
  int never = 0;
  const cfg::InterruptScope scope([](void*) noexcept { return false; }, &never);
  const std::string none = list_of("|", "(description=x)", 5000);
  EXPECT_TRUE(search(session_, "cn=top", kScopeBase, none.c_str()).empty());
  EXPECT_EQ(search(session_, "cn=top", kScopeBase, ("(!" + none + ")").c_str()).size(), 1U);
}

}  // namespace
}  // namespace orv::cfg_test
