// Character classes of ASCII text, independent of any locale.
#pragma once

namespace orv::cfg {

constexpr char ascii_upper(char c) noexcept {
  return c >= 'a' && c <= 'z' ? static_cast<char>(c - 'a' + 'A') : c;
}
constexpr char ascii_lower(char c) noexcept {
  return c >= 'A' && c <= 'Z' ? static_cast<char>(c - 'A' + 'a') : c;
}
constexpr bool is_ascii_digit(char c) noexcept {
  return c >= '0' && c <= '9';
}
constexpr bool is_ascii_letter(char c) noexcept {
  return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z');
}
constexpr bool is_ascii(char c) noexcept {
  return static_cast<unsigned char>(c) < 0x80;
}
constexpr bool is_control(char c) noexcept {
  return static_cast<unsigned char>(c) < 0x20 || c == 0x7F;
}

// Value of a hexadecimal digit, -1 when it is none.
constexpr int hex_digit(char c) noexcept {
  if (is_ascii_digit(c)) return c - '0';
  const char lower = ascii_lower(c);
  return lower >= 'a' && lower <= 'f' ? lower - 'a' + 10 : -1;
}

}  // namespace orv::cfg
