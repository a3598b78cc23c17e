#include "slapi/strings.h"

#include <gtest/gtest.h>

#include <cctype>
#include <clocale>
#include <cstdlib>
#include <cstring>
#include <string>

#include "slapi/owners.h"

namespace orv {
namespace {

TEST(CompareIgnoringCase, FoldsTheLettersAToZOnly) {
  EXPECT_EQ(kel_strcasecmp("ConfigDB", "CONFIGdb"), 0);
  EXPECT_LT(kel_strcasecmp("a", "B"), 0);
  EXPECT_GT(kel_strcasecmp("B", "a"), 0);
  EXPECT_LT(kel_strcasecmp("a", "ab"), 0);
  EXPECT_NE(kel_strcasecmp("[", "{"), 0);
  EXPECT_NE(kel_strcasecmp("@", "`"), 0);
  EXPECT_NE(kel_strcasecmp("\xE4", "\xC4"), 0);
  EXPECT_GT(kel_strcasecmp("\xC4", "z"), 0);
}

TEST(CompareIgnoringCase, SortsNullBeforeEverything) {
  EXPECT_EQ(kel_strcasecmp(nullptr, nullptr), 0);
  EXPECT_LT(kel_strcasecmp(nullptr, ""), 0);
  EXPECT_GT(kel_strcasecmp("", nullptr), 0);
}

TEST(CompareIgnoringCase, DoesNotHeedALocaleWhereIIsNoPair) {
  setenv("LOCPATH", ORV_TEST_DATA "/locales", 1);
  ASSERT_NE(std::setlocale(LC_ALL, "tr_TR"), nullptr);
  EXPECT_EQ(std::tolower(0xDD), 'i') << "the locale is not the Turkish one";
  EXPECT_EQ(kel_strcasecmp("CONFIGURATION", "configuration"), 0);
  EXPECT_NE(kel_strcasecmp("\xDD", "i"), 0);
  EXPECT_STREQ(kel_strcasestr("xCONFIGy", "config"), "CONFIGy");
  EXPECT_FALSE(is_string_alphanum("caf\xE9"));
  std::setlocale(LC_ALL, "C");
  unsetenv("LOCPATH");
}

TEST(FindIgnoringCase, GivesTheFirstOccurrence) {
  EXPECT_STREQ(kel_strcasestr("a,CN=B,cn=b", "cn=b"), "CN=B,cn=b");
  EXPECT_STREQ(kel_strcasestr("aab", "AB"), "ab");
  EXPECT_STREQ(kel_strcasestr("abc", ""), "abc");
  EXPECT_EQ(kel_strcasestr("abc", "abcd"), nullptr);
  EXPECT_EQ(kel_strcasestr(nullptr, "a"), nullptr);
  EXPECT_EQ(kel_strcasestr("a", nullptr), nullptr);
}

TEST(BoundedCopy, TerminatesAndReturnsTheLengthAskedFor) {
  char buffer[4] = {'x', 'x', 'x', 'x'};
  EXPECT_EQ(kel_strlcpy(buffer, "abc", sizeof buffer), 3U);
  EXPECT_STREQ(buffer, "abc");
  EXPECT_EQ(kel_strlcpy(buffer, "abcd", sizeof buffer), 4U);
  EXPECT_STREQ(buffer, "abc");
  EXPECT_EQ(kel_strlcpy(buffer, "z", 0), 1U);
  EXPECT_STREQ(buffer, "abc");
  EXPECT_EQ(kel_strlcpy(buffer, nullptr, sizeof buffer), 0U);
  EXPECT_STREQ(buffer, "");
}

TEST(BoundedAppend, TerminatesAndReturnsTheLengthAskedFor) {
  char buffer[6] = "ab";
  EXPECT_EQ(kel_strlcat(buffer, "cd", sizeof buffer), 4U);
  EXPECT_STREQ(buffer, "abcd");
  EXPECT_EQ(kel_strlcat(buffer, "efg", sizeof buffer), 7U);
  EXPECT_STREQ(buffer, "abcde");
  char full[2] = {'x', 'y'};
  EXPECT_EQ(kel_strlcat(full, "z", sizeof full), 3U);
  EXPECT_EQ(full[1], 'y');
}

TEST(FormattedText, IsANewBlockWithItsLength) {
  char* text = nullptr;
  EXPECT_EQ(kel_asprintf(&text, "%s-%d", "a", 5), 3);
  const MallocText owner(text);
  EXPECT_STREQ(text, "a-5");
  EXPECT_EQ(kel_asprintf(nullptr, "a"), -1);
}

TEST(CopiedText, IsNullForNull) {
  EXPECT_EQ(slapi_ch_strdup(nullptr), nullptr);
  const MallocText copy(slapi_ch_strdup("a"));
  EXPECT_STREQ(copy.get(), "a");
}

TEST(GrownBlock, KeepsItsBytesAndIsNeverReleasedByASizeOfZero) {
  char* block = slapi_ch_strdup("ab");
  block = static_cast<char*>(safe_realloc(block, 100));
  EXPECT_STREQ(block, "ab");
  void* const smallest = safe_realloc(block, 0);
  ASSERT_NE(smallest, nullptr);
  std::free(smallest);
}

TEST(EnvironmentVariable, IsNullWhenUnset) {
  setenv("ORV_SLAPI_TEST", "value", 1);
  EXPECT_STREQ(ldap_getenv("ORV_SLAPI_TEST"), "value");
  unsetenv("ORV_SLAPI_TEST");
  EXPECT_EQ(ldap_getenv("ORV_SLAPI_TEST"), nullptr);
  EXPECT_EQ(ldap_getenv(nullptr), nullptr);
}

TEST(Alphanumeric, IsOneOrMoreAsciiLettersAndDigits) {
  EXPECT_TRUE(is_string_alphanum("azAZ09"));
  EXPECT_FALSE(is_string_alphanum(""));
  EXPECT_FALSE(is_string_alphanum(nullptr));
  for (const char* text : {"a b", "a-b", "a_b", "a\n", "@", "[", "`", "{", "/", ":", "\xC3\xA9"})
    EXPECT_FALSE(is_string_alphanum(text)) << text;
}

}  // namespace
}  // namespace orv
