// In builds with sanitizers, against which the whole suite runs, assertions are on: a request that
// could reach one ends that run.
#include <gtest/gtest.h>

#include <string_view>

namespace orv::server {
namespace {

#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
#ifdef NDEBUG
#error "assert() is off in a build with sanitizers"
#endif
#ifndef _GLIBCXX_ASSERTIONS
#error "the C++ library's assertions are off in a build with sanitizers"
#endif

TEST(AssertionsDeathTest, OfTheLibraryEndTheProcess) {
  const std::string_view none;
  EXPECT_DEATH(static_cast<void>(none.front()), "Assertion");
}
#endif

}  // namespace
}  // namespace orv::server
