#include "cfg/text.h"

#include <array>
#include <cstdint>
#include <cstring>

#include "cfg/result_codes.h"
#include "characters.h"

namespace orv::cfg {

// ---- UTF-8 ----

namespace {

// Length of the well-formed sequence at `p`, 0 when it is none (RFC 3629, section 4).
std::size_t utf8_sequence_length(const unsigned char* p, std::size_t left) noexcept {
  const unsigned char lead = p[0];
  if (lead < 0x80) return 1;
  if (lead < 0xC2) return 0;
  const std::size_t length = lead < 0xE0 ? 2 : lead < 0xF0 ? 3 : lead < 0xF5 ? 4 : 0;
  if (length == 0 || length > left) return 0;
  unsigned char low = 0x80;
  unsigned char high = 0xBF;
  if (lead == 0xE0) low = 0xA0;
  if (lead == 0xED) high = 0x9F;
  if (lead == 0xF0) low = 0x90;
  if (lead == 0xF4) high = 0x8F;
  if (p[1] < low || p[1] > high) return 0;
  for (std::size_t i = 2; i < length; ++i) {
    if ((p[i] & 0xC0) != 0x80) return 0;
  }
  return length;
}

}  // namespace

bool is_valid_utf8(std::string_view text) noexcept {
  const auto* p = reinterpret_cast<const unsigned char*>(text.data());
  std::size_t left = text.size();
  while (left >= 8) {
    std::uint64_t word = 0;
    std::memcpy(&word, p, 8);
    if ((word & 0x8080808080808080U) != 0) break;
    p += 8;
    left -= 8;
  }
  while (left > 0) {
    const std::size_t length = utf8_sequence_length(p, left);
    if (length == 0) return false;
    p += length;
    left -= length;
  }
  return true;
}

bool equals_ignore_ascii_case(std::string_view a, std::string_view b) noexcept {
  if (a.size() != b.size()) return false;
  for (std::size_t i = 0; i < a.size(); ++i) {
    if (ascii_upper(a[i]) != ascii_upper(b[i])) return false;
  }
  return true;
}

// ---- base64 ----

namespace {

constexpr std::string_view kAlphabet =
    "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";

constexpr std::array<signed char, 256> kDigitOf = [] {
  std::array<signed char, 256> digits{};
  digits.fill(-1);
  for (std::size_t i = 0; i < kAlphabet.size(); ++i) {
    digits[static_cast<unsigned char>(kAlphabet[i])] = static_cast<signed char>(i);
  }
  return digits;
}();

int digit(char c) noexcept {
  return kDigitOf[static_cast<unsigned char>(c)];
}

// Number of characters before the padding when the text is well formed; else false with the offset
// of the first offending character.
bool check_base64(std::string_view text, std::size_t& digits, std::size_t& error_at) noexcept {
  digits = 0;
  while (digits < text.size() && digit(text[digits]) >= 0) ++digits;
  const std::size_t padding = digits % 4 == 0 ? 0 : 4 - digits % 4;
  error_at = digits;
  if (padding == 3) return false;
  for (std::size_t i = 0; i < padding; ++i, ++error_at) {
    if (error_at >= text.size() || text[error_at] != '=') return false;
  }
  if (error_at != text.size()) return false;
  if (padding == 0) return true;
  // Bits that no byte comes from must be zero, so that each value has one encoding.
  const int unused = padding == 1 ? 0x03 : 0x0F;
  error_at = digits - 1;
  return (digit(text[digits - 1]) & unused) == 0;
}

}  // namespace

int base64_encode(std::string_view bytes, std::string& text) noexcept try {
  std::string out;
  out.reserve((bytes.size() + 2) / 3 * 4);
  for (std::size_t i = 0; i < bytes.size(); i += 3) {
    const std::size_t n = bytes.size() - i < 3 ? bytes.size() - i : 3;
    std::uint32_t group = 0;
    for (std::size_t k = 0; k < 3; ++k) {
      group = group << 8 | (k < n ? static_cast<unsigned char>(bytes[i + k]) : 0U);
    }
    for (std::size_t k = 0; k < 4; ++k) {
      out += k <= n ? kAlphabet[group >> (18 - 6 * k) & 63] : '=';
    }
  }
  text = std::move(out);
  return result::success;
} catch (...) {
  return result::no_memory;
}

int base64_decode(std::string_view text, std::string& bytes, std::size_t& error_at) noexcept try {
  std::size_t digits = 0;
  if (!check_base64(text, digits, error_at)) return result::invalid_attribute_syntax;
  std::string out;
  out.reserve(digits / 4 * 3 + 2);
  std::uint32_t group = 0;
  int bits = 0;
  for (std::size_t i = 0; i < digits; ++i) {
    group = group << 6 | static_cast<std::uint32_t>(digit(text[i]));
    bits += 6;
    if (bits >= 8) {
      bits -= 8;
      out += static_cast<char>(group >> bits & 0xFF);
    }
  }
  bytes = std::move(out);
  return result::success;
} catch (...) {
  return result::no_memory;
}

}  // namespace orv::cfg
