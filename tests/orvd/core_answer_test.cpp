// Answers: limits, and one result.
#include "ops/answer.h"

#include <gtest/gtest.h>

#include "core_fake_backend.h"

namespace orv::server {
namespace {

TEST(Answer, EndsASearchPastTheEntryLimit) {
  AnswerLimits limits;
  limits.entries = 2;
  Answer answer(1, tag::search_done, limits);
  const EntryPtr entry = test::make_test_entry("CN=X");
  EXPECT_EQ(answer.entry(*entry, nullptr, false, nullptr), 0);
  EXPECT_EQ(answer.entry(*entry, nullptr, false, nullptr), 0);
  EXPECT_EQ(answer.entry(*entry, nullptr, false, nullptr), 4);
  EXPECT_EQ(answer.entries(), 2);
}

TEST(Answer, EndsASearchPastItsDeadline) {
  AnswerLimits limits;
  limits.deadline = Clock::now();
  Answer answer(1, tag::search_done, limits);
  const EntryPtr entry = test::make_test_entry("CN=X");
  EXPECT_EQ(answer.entry(*entry, nullptr, false, nullptr), 3);
}

TEST(Answer, EndsASearchPastTheBudgetWithoutHalfAnEntry) {
  AnswerLimits limits;
  limits.bytes = 1500;
  Answer answer(1, tag::search_done, limits);
  const EntryPtr entry = test::make_test_entry("CN=X", 1000);
  EXPECT_EQ(answer.entry(*entry, nullptr, false, nullptr), 0);
  const std::size_t one = answer.bytes().size();
  EXPECT_EQ(answer.entry(*entry, nullptr, false, nullptr), 11);
  EXPECT_EQ(answer.bytes().size(), one);
}

TEST(Answer, CarriesOneResult) {
  Answer answer(1, tag::delete_response, {});
  answer.result(0, "", "");
  const std::size_t one = answer.bytes().size();
  answer.result(80, "", "second");
  EXPECT_EQ(answer.bytes().size(), one);
  EXPECT_EQ(answer.code(), 0);
}

TEST(Answer, AbandonedOperationSendsNothing) {
  Answer answer(1, tag::search_done, {});
  answer.abandon();
  const EntryPtr entry = test::make_test_entry("CN=X");
  EXPECT_EQ(answer.entry(*entry, nullptr, false, nullptr), 80);
  answer.result(0, "", "");
  EXPECT_TRUE(answer.bytes().empty());
}

TEST(Answer, SendersDropEverythingForAClientThatLeft) {
  Connection connection;
  install_senders(connection);
  Answer answer(1, tag::search_done, {});
  Operation operation;
  operation.server = &answer;
  connection.state = 0;
  const EntryPtr entry = test::make_test_entry("CN=X");
  EXPECT_EQ(connection.send_search_entry(nullptr, &connection, &operation, entry.get(), nullptr, 0,
                                         nullptr, nullptr, nullptr, nullptr),
            80);
  EXPECT_EQ(connection.send_result(&connection, &operation, 0, nullptr, nullptr), 0);
  EXPECT_EQ(connection.send_search_result(&connection, &operation, 0, nullptr, nullptr, 0), 0);
  EXPECT_TRUE(answer.bytes().empty());
}

TEST(Answer, SendersOfTheServersOwnConnectionNeedNoAnswer) {
  Connection connection;
  install_senders(connection);
  Operation operation;
  EXPECT_EQ(connection.send_result(&connection, &operation, 50, nullptr, ""), 0);
  EXPECT_EQ(connection.send_result(nullptr, &operation, 50, nullptr, ""), 80);
}

}  // namespace
}  // namespace orv::server
