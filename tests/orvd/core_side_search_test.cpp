// Assertions on an entry that is to be added.
#include "ops/side_search.h"

#include <gtest/gtest.h>

#include <string>

#include "cfg/attribute_table.h"
#include "cfg/interrupt.h"
#include "core_fake_backend.h"
#include "slapi/codepage.h"
#include "slapi/globals.h"

namespace orv::server {
namespace {

constexpr unsigned kRoot = authority::primary_administrator;
constexpr unsigned kMember = authority::admin_group_member;

class AddedEntry : public testing::Test {
 protected:
  static void SetUpTestSuite() {
    ASSERT_EQ(cfg::register_attribute_types(builtin_schema().attribute_table()), 0);
  }
  static void speak(const char* code_page) {
    set_local_code_page(code_page);
    ASSERT_EQ(initIconvHandle(), 0);
  }
  void TearDown() override { speak("UTF-8"); }
  void give(const char* type, std::string value) const {
    berval counted{value.size(), value.data()};
    berval* values[] = {&counted, nullptr};
    ASSERT_EQ(attr_merge(added.get(), type, values, 1, 1, nullptr), 0);
  }
  bool holds(const char* filter, unsigned who = kRoot) const {
    const int code = test_assertion(builtin_schema(), *added, filter, who);
    EXPECT_TRUE(code == 0 || code == 122) << code;
    return code == 0;
  }
  const EntryPtr added = test::make_test_entry("cn=x,cn=configuration");
};

TEST_F(AddedEntry, FulfilsWhatASearchWouldFind) {
  give("description", "Some Text");
  EXPECT_TRUE(holds("(description=some text)"));
  EXPECT_TRUE(holds("(&(description=*text)(!(description=other)))"));
  EXPECT_FALSE(holds("(description=other)"));
  EXPECT_FALSE(holds("(noSuchType=x)"));
  EXPECT_FALSE(holds("(!(noSuchType=x))"));
  EXPECT_FALSE(holds("(description="));
}

TEST_F(AddedEntry, TellsNothingAboutThePasswordInItButThatThereIsOne) {
  give("orv-slapdAdminPW", "secret");
  EXPECT_TRUE(holds("(orv-slapdAdminPW=*)"));
  for (const unsigned who : {kRoot, kMember})
    for (const char* filter :
         {"(orv-slapdAdminPW=secret)", "(!(orv-slapdAdminPW=secret))", "(orv-slapdAdminPW=sec*)",
          "(orv-slapdAdminPW>=a)", "(:caseExactMatch:=secret)"})
      EXPECT_FALSE(holds(filter, who)) << filter;
}

TEST_F(AddedEntry, IsComparedByCharactersInAnyCodePage) {
  give("description", "Caf\xC3\xA9");
  for (const char* code_page : {"UTF-8", "ISO-8859-1"}) {
    speak(code_page);
    EXPECT_TRUE(holds("(description=caf\xC3\x89)")) << code_page;
    EXPECT_FALSE(holds("(description=caf\xC3\x83\xC2\xA9)")) << code_page;
  }
}

TEST_F(AddedEntry, IsGivenUpWhenWhoeverRunsItSaysSo) {
  for (int i = 0; i < 2000; ++i) give("description", "value " + std::to_string(i));
  std::string filter = "(|";
  for (int i = 0; i < 4; ++i) filter += "(description=nobody)";
  filter += ")";
  EXPECT_FALSE(holds(filter.c_str()));
  const cfg::InterruptScope scope([](void*) noexcept { return true; }, nullptr);
  EXPECT_EQ(test_assertion(builtin_schema(), *added, filter, kRoot), 3);
}

TEST(WhoMaySearch, AreAdministratorsAlone) {
  EXPECT_TRUE(may_search(kRoot));
  EXPECT_TRUE(may_search(kMember));
  EXPECT_FALSE(may_search(authority::no_configuration_access));
  EXPECT_FALSE(may_search(authority::supplier_of_server));
  EXPECT_FALSE(may_search(authority::supplier_of_suffix));
}

}  // namespace
}  // namespace orv::server
