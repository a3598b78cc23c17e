#include "preparation.h"

#include <utf8proc.h>

#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <new>

#include "cfg/text.h"
#include "characters.h"

namespace orv::cfg {

namespace {

struct Range {
  utf8proc_int32_t first;
  utf8proc_int32_t last;
};

// Characters that preparation drops (RFC 4518, 2.2), without the control characters, which would
// make unequal names equal and stay visible as escapes instead.
constexpr Range kDropped[] = {
    {0x00AD, 0x00AD}, {0x034F, 0x034F},   {0x06DD, 0x06DD},   {0x070F, 0x070F},
    {0x1806, 0x1806}, {0x180B, 0x180E},   {0x200B, 0x200F},   {0x202A, 0x202E},
    {0x2060, 0x2063}, {0x206A, 0x206F},   {0xFE00, 0xFE0F},   {0xFEFF, 0xFEFF},
    {0xFFF9, 0xFFFC}, {0x1D173, 0x1D17A}, {0xE0001, 0xE0001}, {0xE0020, 0xE007F},
};

bool is_dropped(utf8proc_int32_t c) noexcept {
  for (const Range& range : kDropped) {
    if (c >= range.first && c <= range.last) return true;
  }
  return false;
}

std::string ascii_prepared(std::string_view value, LetterCase letter_case) {
  std::string result(value);
  if (letter_case == LetterCase::folded) {
    for (char& c : result) c = ascii_upper(c);
  }
  return result;
}

// Applies `change` to each character; a negative result drops it.
template <class Change>
std::string map_characters(const std::string& text, Change change) {
  std::string result;
  result.reserve(text.size());
  const auto* p = reinterpret_cast<const utf8proc_uint8_t*>(text.data());
  auto left = static_cast<utf8proc_ssize_t>(text.size());
  while (left > 0) {
    utf8proc_int32_t c = 0;
    const utf8proc_ssize_t length = utf8proc_iterate(p, left, &c);
    if (length <= 0) break;
    p += length;
    left -= length;
    utf8proc_uint8_t encoded[4];
    const utf8proc_int32_t changed = change(c);
    if (changed < 0) continue;
    const utf8proc_ssize_t written = utf8proc_encode_char(changed, encoded);
    result.append(reinterpret_cast<const char*>(encoded), static_cast<std::size_t>(written));
  }
  return result;
}

constexpr int kComposed = UTF8PROC_STABLE | UTF8PROC_COMPAT | UTF8PROC_COMPOSE;
constexpr int kFoldedApart =
    UTF8PROC_STABLE | UTF8PROC_COMPAT | UTF8PROC_DECOMPOSE | UTF8PROC_CASEFOLD;

// By options of the Unicode library.
std::string normalized(const std::string& text, int options) {
  utf8proc_uint8_t* mapped = nullptr;
  const utf8proc_ssize_t length = utf8proc_map(
      reinterpret_cast<const utf8proc_uint8_t*>(text.data()),
      static_cast<utf8proc_ssize_t>(text.size()), &mapped, static_cast<utf8proc_option_t>(options));
  const std::unique_ptr<utf8proc_uint8_t, decltype(&std::free)> owned(mapped, &std::free);
  if (length == UTF8PROC_ERROR_NOMEM) throw std::bad_alloc();
  if (length < 0) return text;
  return {reinterpret_cast<const char*>(mapped), static_cast<std::size_t>(length)};
}

// Upper-cases by full rules: folding makes "ss" of sharp s, and letters that have no upper case as
// one character are taken apart from their marks, so that the simple upper case of each character
// is enough. Prepared once, a text does not change any more.
std::string prepared_characters(const std::string& value, LetterCase letter_case) {
  const std::string kept =
      map_characters(value, [](utf8proc_int32_t c) { return is_dropped(c) ? -1 : c; });
  if (letter_case == LetterCase::kept) return normalized(kept, kComposed);
  return normalized(map_characters(normalized(kept, kFoldedApart), &utf8proc_toupper), kComposed);
}

}  // namespace

bool is_all_ascii(std::string_view value) noexcept {
  const char* p = value.data();
  std::size_t left = value.size();
  for (; left >= 8; p += 8, left -= 8) {
    std::uint64_t word = 0;
    std::memcpy(&word, p, 8);
    if ((word & 0x8080808080808080U) != 0) return false;
  }
  for (; left > 0; ++p, --left) {
    if (!is_ascii(*p)) return false;
  }
  return true;
}

std::string prepare(std::string_view value, LetterCase letter_case) {
  if (is_all_ascii(value) || !is_valid_utf8(value)) return ascii_prepared(value, letter_case);
  return prepared_characters(std::string(value), letter_case);
}

void fold_blanks(std::string& value) noexcept {
  std::size_t out = 0;
  for (std::size_t in = 0; in < value.size(); ++in) {
    if (value[in] == ' ' && out > 0 && value[out - 1] == ' ') continue;
    value[out++] = value[in];
  }
  value.resize(out);
}

std::string_view trim_blanks(std::string_view value) noexcept {
  while (!value.empty() && value.front() == ' ') value.remove_prefix(1);
  while (!value.empty() && value.back() == ' ') value.remove_suffix(1);
  return value;
}

}  // namespace orv::cfg
