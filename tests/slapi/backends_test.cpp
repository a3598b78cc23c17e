// Which backend serves a DN, and what backends offer one another.

#include "slapi/backends.h"

#include <gtest/gtest.h>

#include <thread>
#include <vector>

namespace orv {
namespace {

int first_function(Backend*, int method, char**) {
  return method + 1;
}
int second_function(Backend*, int method, char**) {
  return method + 2;
}

class Backends : public testing::Test {
 protected:
  void TearDown() override {
    for (Backend* backend : {&directory_, &subtree_, &configuration_}) unregister_backend(backend);
  }
  static Backend serving(const char* const* suffixes) {
    Backend made;
    made.suffixes = suffixes;
    return made;
  }
  static std::vector<PluginFunction> offered(Backend* backend, int number) {
    PluginFunction* list = nullptr;
    std::vector<PluginFunction> functions;
    if (getAllPluginFuncs(backend, number, &list) != 0) return functions;
    for (; *list != nullptr; ++list) functions.push_back(*list);
    return functions;
  }

  static constexpr const char* kDirectory[] = {"O=EXAMPLE", "CN=LOCALHOST", nullptr};
  static constexpr const char* kSubtree[] = {"OU=PEOPLE,O=EXAMPLE", nullptr};
  static constexpr const char* kConfiguration[] = {"CN=CONFIGURATION", nullptr};
  Backend directory_ = serving(kDirectory);
  Backend subtree_ = serving(kSubtree);
  Backend configuration_ = serving(kConfiguration);
};

TEST_F(Backends, ServeWhatIsAtOrBelowTheirSuffixes) {
  ASSERT_EQ(register_backend(&directory_), 0);
  ASSERT_EQ(register_backend(&configuration_), 0);
  const struct {
    const char* dn;
    Backend* backend;
  } rows[] = {
      {"CN=LOCALHOST", &directory_},
      {"cn = localhost", &directory_},
      {"cn=a,o=example", &directory_},
      {"o=example", &directory_},
      {"CN=DIGEST,CN=CONFIGURATION", &configuration_},
      {"CN=XCONFIGURATION", nullptr},
      {"o=other", nullptr},
      {"", nullptr},
      {"no DN", nullptr},
  };
  for (const auto& row : rows) EXPECT_EQ(select_backend_opt(row.dn), row.backend) << row.dn;
  EXPECT_EQ(select_backend_opt(nullptr), nullptr);
}

TEST_F(Backends, TheNearestSuffixDecides) {
  ASSERT_EQ(register_backend(&subtree_), 0);
  ASSERT_EQ(register_backend(&directory_), 0);
  EXPECT_EQ(select_backend_opt("cn=a,ou=people,o=example"), &subtree_);
  EXPECT_EQ(select_backend_opt("ou=groups,o=example"), &directory_);
}

TEST_F(Backends, ThatWereTakenOutServeNothing) {
  ASSERT_EQ(register_backend(&directory_), 0);
  ASSERT_EQ(register_plugin_function(&directory_, -159, first_function), 0);
  unregister_backend(&directory_);
  unregister_backend(&directory_);
  EXPECT_EQ(select_backend_opt("CN=LOCALHOST"), nullptr);
  EXPECT_TRUE(offered(&directory_, -159).empty());
}

TEST_F(Backends, WithoutASuffixOfTheirOwnAreRefused) {
  static constexpr const char* kNone[] = {nullptr};
  Backend bare;
  EXPECT_EQ(register_backend(nullptr), 80);
  EXPECT_EQ(register_backend(&bare), 80);
  bare.suffixes = kNone;
  EXPECT_EQ(register_backend(&bare), 80);
  ASSERT_EQ(register_backend(&directory_), 0);
  EXPECT_EQ(register_backend(&directory_), 80);
  Backend second = serving(kDirectory);
  EXPECT_EQ(register_backend(&second), 80);
}

TEST_F(Backends, OfferFunctionsInTheOrderOfRegistration) {
  ASSERT_EQ(register_backend(&directory_), 0);
  ASSERT_EQ(register_plugin_function(&directory_, -159, first_function), 0);
  ASSERT_EQ(register_plugin_function(&directory_, -159, second_function), 0);
  ASSERT_EQ(register_plugin_function(&directory_, -160, second_function), 0);
  EXPECT_EQ(offered(&directory_, -159),
            (std::vector<PluginFunction>{first_function, second_function}));
  EXPECT_EQ(offered(&directory_, -160), std::vector<PluginFunction>{second_function});
  EXPECT_EQ(offered(&directory_, -159)[1](&directory_, 8, nullptr), 10);
}

TEST_F(Backends, WithNothingToOfferGiveANullList) {
  ASSERT_EQ(register_backend(&directory_), 0);
  PluginFunction any = first_function;
  PluginFunction* list = &any;
  EXPECT_EQ(getAllPluginFuncs(&directory_, -159, &list), 80);
  EXPECT_EQ(list, nullptr);
  list = &any;
  EXPECT_EQ(getAllPluginFuncs(nullptr, -159, &list), 80);
  EXPECT_EQ(list, nullptr);
  list = &any;
  EXPECT_EQ(getAllPluginFuncs(&configuration_, -159, &list), 80) << "not registered";
  EXPECT_EQ(list, nullptr);
  EXPECT_EQ(getAllPluginFuncs(&directory_, -159, nullptr), 80);
}

TEST_F(Backends, NeedAFunctionAndARegistrationToOffer) {
  EXPECT_EQ(register_plugin_function(&directory_, -159, first_function), 80);
  EXPECT_EQ(register_plugin_function(nullptr, -159, first_function), 80);
  ASSERT_EQ(register_backend(&directory_), 0);
  EXPECT_EQ(register_plugin_function(&directory_, -159, nullptr), 80);
  EXPECT_TRUE(offered(&directory_, -159).empty());
}

TEST_F(Backends, AListThatWasHandedOutStaysGoodWhenItGrows) {
  ASSERT_EQ(register_backend(&directory_), 0);
  ASSERT_EQ(register_plugin_function(&directory_, -159, first_function), 0);
  PluginFunction* before = nullptr;
  ASSERT_EQ(getAllPluginFuncs(&directory_, -159, &before), 0);
  for (int i = 0; i < 20; ++i)
    ASSERT_EQ(register_plugin_function(&directory_, -159, second_function), 0);
  EXPECT_EQ(before[0], &first_function);
  EXPECT_EQ(before[1], nullptr);
  EXPECT_EQ(offered(&directory_, -159).size(), 21U);
}

TEST_F(Backends, AreFoundWhileOthersComeAndGo) {
  ASSERT_EQ(register_backend(&directory_), 0);
  std::thread other([this] {
    for (int i = 0; i < 1000; ++i) {
      ASSERT_EQ(register_backend(&configuration_), 0);
      unregister_backend(&configuration_);
    }
  });
  for (int i = 0; i < 1000; ++i) ASSERT_EQ(select_backend_opt("CN=LOCALHOST"), &directory_);
  other.join();
}

}  // namespace
}  // namespace orv
