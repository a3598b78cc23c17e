// What a connection keeps of searches in pages.
#include "ops/paged_results.h"

#include <gtest/gtest.h>

#include <string>
#include <utility>
#include <vector>

#include "core_fake_backend.h"
#include "ops/answer.h"

namespace orv::server {
namespace {

constexpr PagedSearches::Limits kLimits{4, 1 << 20};

FoundEntries found_entries(int count, std::size_t value_bytes = 8) {
  Answer answer(1, tag::search_done, {});
  const EntryPtr entry = test::make_test_entry("CN=CONFIGURATION", value_bytes);
  for (int i = 0; i < count; ++i) answer.entry(*entry, nullptr, false, nullptr);
  answer.result(0, "", "");
  return {answer.bytes(), answer.entries(), answer.code()};
}

class KeptSearches : public testing::Test {
 protected:
  std::string keep(const std::string& key, FoundEntries found,
                   const PagedSearches::Limits& limits = kLimits) {
    std::string cookie;
    return searches.keep(key, std::move(found), limits, cookie) == PagedSearches::Kept::yes ? cookie
                                                                                            : "";
  }
  bool take(const std::string& cookie, const std::string& key) {
    FoundEntries found;
    return searches.take(cookie, key, found);
  }
  KeptMeter meter;
  PagedSearches searches{meter};
};

TEST_F(KeptSearches, AreTakenOnceByTheirCookieAndKey) {
  const std::string cookie = keep("a", found_entries(3));
  ASSERT_EQ(cookie.size(), 16U);
  FoundEntries found;
  ASSERT_TRUE(searches.take(cookie, "a", found));
  EXPECT_EQ(found.left(), 3);
  EXPECT_FALSE(take(cookie, "a"));
  EXPECT_EQ(meter.bytes(), 0U);
}

TEST_F(KeptSearches, AreForgottenWhenTheyAreAskedForByAnotherSearch) {
  const std::string cookie = keep("a", found_entries(3));
  EXPECT_FALSE(take(cookie, "b"));
  EXPECT_FALSE(take(cookie, "a"));
  EXPECT_EQ(meter.bytes(), 0U);
}

TEST_F(KeptSearches, HaveCookiesOfTheirOwn) {
  const std::string one = keep("a", found_entries(1));
  const std::string other = keep("a", found_entries(1));
  EXPECT_NE(one, other);
  EXPECT_TRUE(take(one, "a"));
  EXPECT_TRUE(take(other, "a"));
}

TEST_F(KeptSearches, MakeRoomByForgettingTheOldest) {
  std::vector<std::string> cookies;
  for (int i = 0; i < 5; ++i) cookies.push_back(keep("a", found_entries(1)));
  EXPECT_EQ(searches.size(), 4U);
  EXPECT_FALSE(take(cookies[0], "a"));
  EXPECT_TRUE(take(cookies[1], "a"));
}

TEST_F(KeptSearches, AreBoundedInBytes) {
  const PagedSearches::Limits small{10, 3000};
  EXPECT_EQ(keep("a", found_entries(1, 4000), small), "");
  const std::string first = keep("a", found_entries(1, 2000), small);
  const std::string second = keep("a", found_entries(1, 2000), small);
  EXPECT_FALSE(take(first, "a"));
  EXPECT_TRUE(take(second, "a"));
}

TEST_F(KeptSearches, AreBoundedOverAllConnections) {
  KeptMeter narrow(5000);
  PagedSearches one(narrow);
  PagedSearches other(narrow);
  std::string cookie;
  EXPECT_EQ(one.keep("a", found_entries(1, 3000), kLimits, cookie), PagedSearches::Kept::yes);
  EXPECT_EQ(other.keep("a", found_entries(1, 3000), kLimits, cookie), PagedSearches::Kept::no_room);
  one.forget_all();
  EXPECT_EQ(narrow.bytes(), 0U);
  EXPECT_EQ(other.keep("a", found_entries(1, 3000), kLimits, cookie), PagedSearches::Kept::yes);
}

TEST_F(KeptSearches, GiveEverythingBackWithTheirConnection) {
  {
    PagedSearches short_lived(meter);
    std::string cookie;
    short_lived.keep("a", found_entries(5), kLimits, cookie);
    EXPECT_GT(meter.bytes(), 0U);
  }
  EXPECT_EQ(meter.bytes(), 0U);
}

TEST(FoundEntries, GiveBackMemoryNowAndThenOnly) {
  FoundEntries found = found_entries(100, 100);
  const std::size_t all = found.bytes();
  std::string out;
  ASSERT_TRUE(found.append_entries(out, 10, 2));
  found.shrink();
  const std::size_t first = found.bytes();
  ASSERT_TRUE(found.append_entries(out, 10, 2));
  found.shrink();
  EXPECT_EQ(found.bytes(), first);  // one by one they would cost a copy of the rest each
  ASSERT_TRUE(found.append_entries(out, 60, 2));
  found.shrink();
  EXPECT_LT(found.bytes(), all / 3);
  EXPECT_EQ(found.left(), 20);
  ASSERT_TRUE(found.append_entries(out, 100, 2));
  EXPECT_EQ(found.left(), 0);
  ASSERT_TRUE(found.append_result(out, 2));
}

TEST(PagedSearchKey, TellsSearchesApart) {
  SearchRequest request;
  request.filter = "(cn=*)";
  request.attributes = {"a", "bc"};
  const std::string key = paged_search_key(request, "CN=X");
  EXPECT_EQ(paged_search_key(request, "CN=X"), key);
  EXPECT_NE(paged_search_key(request, "CN=Y"), key);
  const auto differs = [&](auto change) {
    SearchRequest other = request;
    change(other);
    return paged_search_key(other, "CN=X") != key;
  };
  EXPECT_TRUE(differs([](SearchRequest& r) { r.scope = 2; }));
  EXPECT_TRUE(differs([](SearchRequest& r) { r.types_only = true; }));
  EXPECT_TRUE(differs([](SearchRequest& r) { r.filter = "(cn=a*)"; }));
  EXPECT_TRUE(differs([](SearchRequest& r) { r.attributes = {"ab", "c"}; }));
  EXPECT_TRUE(differs([](SearchRequest& r) { r.attributes = {}; }));
}

}  // namespace
}  // namespace orv::server
