// What is to be waited for again and again, and may be lost by the context that waits.
#include <gtest/gtest.h>

#include <asio/io_context.hpp>
#include <asio/post.hpp>
#include <functional>
#include <optional>

#include "net/standing.h"

namespace orv::server {
namespace {

TEST(StandingTest, IsUnderWayUntilItsHandlerIsCalled) {
  asio::io_context context;
  Standing standing;
  EXPECT_FALSE(standing.under_way());
  bool meanwhile = true;
  asio::post(context, standing.keep([&] { meanwhile = standing.under_way(); }));
  EXPECT_TRUE(standing.under_way());
  context.run();
  EXPECT_FALSE(meanwhile);
  EXPECT_FALSE(standing.under_way());
}

TEST(StandingTest, StaysUnderWayWhenItsHandlerIsWaitedForAgain) {
  asio::io_context context;
  Standing standing;
  int left = 3;
  std::function<void()> again = [&] {
    asio::post(context, standing.keep([&] {
      if (--left > 0) again();
    }));
  };
  again();
  context.run_one();
  EXPECT_TRUE(standing.under_way());
  context.run();
  EXPECT_EQ(left, 0);
  EXPECT_FALSE(standing.under_way());
}

TEST(StandingTest, IsNoLongerUnderWayWhenItsHandlerIsLost) {
  Standing standing;
  {
    asio::io_context context;
    asio::post(context, standing.keep([] { FAIL(); }));
    EXPECT_TRUE(standing.under_way());
  }
  EXPECT_FALSE(standing.under_way());
}

TEST(StandingTest, HandlersMayOutliveIt) {
  asio::io_context context;
  std::optional<Standing> standing;
  standing.emplace();
  bool called = false;
  asio::post(context, standing->keep([&] { called = true; }));
  standing.reset();
  context.run();
  EXPECT_TRUE(called);
}

}  // namespace
}  // namespace orv::server
