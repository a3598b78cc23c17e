#include "cfg/text.h"

#include <gtest/gtest.h>

#include "cfg/result_codes.h"

namespace orv::cfg {
namespace {

TEST(Utf8, WellFormedTextOfEveryLengthIsValid) {
  EXPECT_TRUE(is_valid_utf8(""));
  EXPECT_TRUE(is_valid_utf8("plain text that is longer than a word"));
  EXPECT_TRUE(
      is_valid_utf8("\xC2\x80\xDF\xBF\xE0\xA0\x80\xEF\xBF\xBF\xF0\x90\x80\x80\xF4\x8F\xBF\xBF"));
}

TEST(Utf8, OverlongSurrogateTruncatedAndStrayBytesAreInvalid) {
  for (const char* text : {"\xC0\x80", "\xC1\xBF", "\xE0\x9F\xBF", "\xED\xA0\x80",
                           "\xF0\x8F\xBF\xBF", "\xF4\x90\x80\x80", "\xF5\x80\x80\x80", "\x80",
                           "\xC3", "\xE2\x82", "a\xFF", "eight by\xC3("}) {
    EXPECT_FALSE(is_valid_utf8(text)) << text;
  }
}

TEST(AsciiCase, FoldsLettersAToZOnly) {
  EXPECT_TRUE(equals_ignore_ascii_case("objectClass", "OBJECTCLASS"));
  EXPECT_FALSE(equals_ignore_ascii_case("a", "ab"));
  EXPECT_FALSE(equals_ignore_ascii_case("\xC3\xA4", "\xC3\x84"));
  EXPECT_FALSE(equals_ignore_ascii_case("@", "`"));
}

TEST(Base64, EncodesAndDecodesTheVectorsOfRfc4648) {
  const std::pair<const char*, const char*> vectors[] = {{"", ""},
                                                         {"f", "Zg=="},
                                                         {"fo", "Zm8="},
                                                         {"foo", "Zm9v"},
                                                         {"foob", "Zm9vYg=="},
                                                         {"fooba", "Zm9vYmE="},
                                                         {"foobar", "Zm9vYmFy"}};
  for (const auto& [bytes, text] : vectors) {
    std::string out;
    EXPECT_EQ(base64_encode(bytes, out), result::success);
    EXPECT_EQ(out, text);
    std::size_t at = 0;
    EXPECT_EQ(base64_decode(text, out, at), result::success);
    EXPECT_EQ(out, bytes);
  }
}

TEST(Base64, RoundTripsAllBytes) {
  std::string bytes;
  for (int i = 0; i < 256; ++i) bytes += static_cast<char>(i);
  std::string text;
  std::string back;
  std::size_t at = 0;
  ASSERT_EQ(base64_encode(bytes, text), result::success);
  ASSERT_EQ(base64_decode(text, back, at), result::success);
  EXPECT_EQ(back, bytes);
}

TEST(Base64, DamagedTextIsRefusedWithThePlaceOfTheDamage) {
  const std::pair<const char*, std::size_t> damaged[] = {
      {"Zg", 2}, {"Zg=", 3},  {"Zg==x", 4}, {"Z", 1},    {"Zm9v!", 4}, {"Zm 9", 2},
      {"=", 0},  {"Zg=a", 3}, {"Zm9vZ", 5}, {"Zh==", 1}, {"Zo==", 1},  {"Zm9=", 2}};
  for (const auto& [text, place] : damaged) {
    std::string out = "kept";
    std::size_t at = 99;
    EXPECT_EQ(base64_decode(text, out, at), result::invalid_attribute_syntax) << text;
    EXPECT_EQ(at, place) << text;
    EXPECT_EQ(out, "kept");
  }
}

}  // namespace
}  // namespace orv::cfg
