// The prepared form of text does not change when it is prepared again: what a normal DN or a
// canonical value holds can be compared with what is made of it.
#include <gtest/gtest.h>

#include <cstdint>
#include <string>

#include "cfg/matching.h"
#include "cfg/text.h"

namespace orv::cfg {
namespace {

void append(std::string& text, std::uint32_t c) {
  if (c < 0x80) {
    text += static_cast<char>(c);
    return;
  }
  if (c < 0x800) {
    text += static_cast<char>(0xC0 | c >> 6);
  } else if (c < 0x10000) {
    text += static_cast<char>(0xE0 | c >> 12);
    text += static_cast<char>(0x80 | (c >> 6 & 0x3F));
  } else {
    text += static_cast<char>(0xF0 | c >> 18);
    text += static_cast<char>(0x80 | (c >> 12 & 0x3F));
    text += static_cast<char>(0x80 | (c >> 6 & 0x3F));
  }
  text += static_cast<char>(0x80 | (c & 0x3F));
}

std::string form(MatchingRule rule, const std::string& text) {
  std::string canonical;
  EXPECT_EQ(canonical_value(rule, text, canonical), 0);
  return canonical;
}

// Whether preparing once is enough, in both ways.
bool settles(const std::string& text) {
  for (const MatchingRule rule : {MatchingRule::case_ignore, MatchingRule::case_exact}) {
    const std::string once = form(rule, text);
    if (form(rule, once) != once) return false;
  }
  return true;
}

constexpr std::uint32_t kMarks[] = {0x0301, 0x0307, 0x0308, 0x0323, 0x0327, 0x0342,
                                    0x0345, 0x05B4, 0x1161, 0x11A8, 0x200B, 0x3099};

TEST(Preparation, EveryCharacterSettlesAtOnce) {
  for (std::uint32_t c = 1; c < 0x110000; ++c) {
    if (c >= 0xD800 && c < 0xE000) continue;
    std::string text;
    append(text, c);
    ASSERT_TRUE(settles(text)) << std::hex << c;
  }
}

TEST(Preparation, LettersWithMarksSettleAtOnce) {
  for (std::uint32_t c = 0x41; c < 0x3400; ++c) {
    for (const std::uint32_t mark : kMarks) {
      std::string text;
      append(text, c);
      append(text, mark);
      ASSERT_TRUE(settles(text)) << std::hex << c << " " << mark;
    }
  }
}

// Upper case of U+01F0 is two characters; that of U+0390 three, of which two compose again.
TEST(Preparation, WhatUpperCasingTakesApartIsComposedAgain) {
  EXPECT_EQ(form(MatchingRule::case_ignore, "\xC7\xB0"), "J\xCC\x8C");
  EXPECT_EQ(form(MatchingRule::case_ignore, "\xCE\x90"), "\xCE\xAA\xCC\x81");
  EXPECT_EQ(form(MatchingRule::case_ignore, "\xC3\x9F"), "SS");
}

}  // namespace
}  // namespace orv::cfg
