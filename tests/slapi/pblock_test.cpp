#include "slapi/pblock.h"

#include <gtest/gtest.h>

#include <array>

#include "slapi/owners.h"

namespace orv {
namespace {

int handler_a(pblock*) {
  return 1;
}
int start_a(Backend*) {
  return 2;
}

constexpr std::array kRequired{parameter::target_dn, parameter::add_entry, parameter::backend,
                               parameter::connection, parameter::operation};
constexpr std::array kOptionalPointers{
    parameter::modifications,           parameter::search_filter,
    parameter::search_filter_text,      parameter::search_attributes,
    parameter::search_response_control, parameter::persistent_search_monitor,
    parameter::entry_before_delete};
constexpr std::array kIntegers{parameter::search_scope, parameter::search_types_only,
                               parameter::persistent_search_switch};
constexpr std::array kHandlers{200, 201, 202, 203, 204, 205, 206, 207, 208, 209, 210, -15, -16};

class Pblock : public testing::Test {
 protected:
  PblockPtr block_{slapi_pblock_new()};
};

TEST_F(Pblock, NeverGivesNullWithSuccessForARequiredParameter) {
  for (const int number : kRequired) {
    int marker = 7;
    void* value = &marker;
    EXPECT_EQ(slapi_pblock_get(block_.get(), number, &value), -1) << number;
    EXPECT_EQ(value, &marker) << number;
    EXPECT_EQ(slapi_pblock_set(block_.get(), number, static_cast<void*>(&marker)), 0) << number;
    value = nullptr;
    EXPECT_EQ(slapi_pblock_get(block_.get(), number, &value), 0) << number;
    EXPECT_EQ(value, &marker) << number;
    EXPECT_EQ(slapi_pblock_set(block_.get(), number, nullptr), 0) << number;
    EXPECT_EQ(slapi_pblock_get(block_.get(), number, &value), -1) << number;
  }
}

TEST_F(Pblock, GivesNullForAnUnsetOptionalPointer) {
  for (const int number : kOptionalPointers) {
    int marker = 0;
    void* value = &marker;
    EXPECT_EQ(slapi_pblock_get(block_.get(), number, &value), 0) << number;
    EXPECT_EQ(value, nullptr) << number;
  }
}

TEST_F(Pblock, GivesZeroForAnUnsetNumberAndOnlyWritesAnInt) {
  for (const int number : kIntegers) {
    std::array<int, 2> value{5, 5};
    EXPECT_EQ(slapi_pblock_get(block_.get(), number, value.data()), 0) << number;
    EXPECT_EQ(value[0], 0) << number;
    EXPECT_EQ(value[1], 5) << number;
    EXPECT_EQ(slapi_pblock_set(block_.get(), number, 2), 0) << number;
    EXPECT_EQ(slapi_pblock_get(block_.get(), number, value.data()), 0) << number;
    EXPECT_EQ(value[0], 2) << number;
    EXPECT_EQ(value[1], 5) << number;
  }
}

TEST_F(Pblock, KeepsEachHandlerUnderItsOwnNumber) {
  for (const int number : kHandlers) {
    EXPECT_EQ(slapi_pblock_handler(block_.get(), number), nullptr) << number;
    EXPECT_EQ(slapi_pblock_set(block_.get(), number, &handler_a), 0) << number;
    EXPECT_EQ(slapi_pblock_handler(block_.get(), number), &handler_a) << number;
    Handler got = nullptr;
    EXPECT_EQ(slapi_pblock_get(block_.get(), number, &got), 0) << number;
    EXPECT_EQ(got, &handler_a) << number;
    EXPECT_EQ(slapi_pblock_set(block_.get(), number, nullptr), 0) << number;
    EXPECT_EQ(slapi_pblock_handler(block_.get(), number), nullptr) << number;
  }
}

TEST_F(Pblock, KeepsTheInstanceStartFunctionApartFromHandlers) {
  EXPECT_EQ(slapi_pblock_set(block_.get(), -19, &handler_a), -1);
  EXPECT_EQ(slapi_pblock_set(block_.get(), 200, &start_a), -1);
  EXPECT_EQ(slapi_pblock_set(block_.get(), -19, &start_a), 0);
  EXPECT_EQ(slapi_pblock_instance_start(block_.get()), &start_a);
  EXPECT_EQ(slapi_pblock_handler(block_.get(), -19), nullptr);
}

TEST_F(Pblock, RefusesUnknownNumbers) {
  void* value = nullptr;
  for (const int number : {0, 1, -1, 199, 211, -17, 1 << 30, -(1 << 30)}) {
    EXPECT_EQ(slapi_pblock_get(block_.get(), number, &value), -1) << number;
    EXPECT_EQ(slapi_pblock_set(block_.get(), number, static_cast<void*>(&value)), -1) << number;
    EXPECT_EQ(slapi_pblock_set(block_.get(), number, 1), -1) << number;
    EXPECT_EQ(slapi_pblock_set(block_.get(), number, &handler_a), -1) << number;
    EXPECT_EQ(slapi_pblock_set(block_.get(), number, nullptr), -1) << number;
    EXPECT_EQ(slapi_pblock_handler(block_.get(), number), nullptr) << number;
  }
}

TEST_F(Pblock, RefusesValuesOfAnotherKind) {
  int marker = 0;
  EXPECT_EQ(slapi_pblock_set(block_.get(), parameter::target_dn, 1), -1);
  EXPECT_EQ(slapi_pblock_set(block_.get(), parameter::target_dn, &handler_a), -1);
  EXPECT_EQ(slapi_pblock_set(block_.get(), parameter::search_scope, static_cast<void*>(&marker)),
            -1);
  EXPECT_EQ(slapi_pblock_set(block_.get(), parameter::search_scope, nullptr), -1);
  EXPECT_EQ(slapi_pblock_set(block_.get(), parameter::bind_function, 1), -1);
}

TEST_F(Pblock, RefusesNullArguments) {
  int value = 0;
  EXPECT_EQ(slapi_pblock_get(nullptr, parameter::search_scope, &value), -1);
  EXPECT_EQ(slapi_pblock_get(block_.get(), parameter::search_scope, nullptr), -1);
  EXPECT_EQ(slapi_pblock_iget(nullptr, parameter::search_scope, &value), -1);
  EXPECT_EQ(slapi_pblock_set(nullptr, parameter::search_scope, 1), -1);
  EXPECT_EQ(slapi_pblock_set(nullptr, parameter::target_dn, nullptr), -1);
  EXPECT_EQ(slapi_pblock_handler(nullptr, 200), nullptr);
  EXPECT_EQ(slapi_pblock_instance_start(nullptr), nullptr);
  slapi_pblock_destroy(nullptr);
}

TEST_F(Pblock, TheCachedFormGivesTheSameAnswers) {
  const char* dn = nullptr;
  EXPECT_EQ(slapi_pblock_iget(block_.get(), parameter::target_dn, &dn), -1);
  EXPECT_EQ(slapi_pblock_set(block_.get(), parameter::target_dn, "CN=CONFIGURATION"), 0);
  EXPECT_EQ(slapi_pblock_iget(block_.get(), parameter::target_dn, &dn), 0);
  EXPECT_STREQ(dn, "CN=CONFIGURATION");
}

TEST_F(Pblock, TheGlobalBlockIsAlwaysThereAndTheSame) {
  ASSERT_NE(getGlobalPBlock(), nullptr);
  EXPECT_EQ(getGlobalPBlock(), getGlobalPBlock());
  int active = 5;
  EXPECT_EQ(slapi_pblock_get(getGlobalPBlock(), parameter::persistent_search_switch, &active), 0);
  EXPECT_EQ(active, 0);
}

}  // namespace
}  // namespace orv
