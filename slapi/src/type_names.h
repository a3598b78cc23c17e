// How attribute types, classes and rules may be named: RFC 4512, 1.4.
#pragma once

#include <algorithm>
#include <cstddef>
#include <string_view>

namespace orv::slapi {

constexpr bool is_digit(char c) noexcept {
  return c >= '0' && c <= '9';
}

constexpr bool is_letter(char c) noexcept {
  return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z');
}

// keystring: a letter, then letters, digits and hyphens.
constexpr bool is_descriptor(std::string_view name) noexcept {
  return !name.empty() && is_letter(name.front()) &&
         std::all_of(name.begin(), name.end(),
                     [](char c) { return is_letter(c) || is_digit(c) || c == '-'; });
}

// numericoid: at least two numbers without leading zeros.
constexpr bool is_numeric_oid(std::string_view oid) noexcept {
  std::size_t numbers = 0;
  for (;;) {
    const std::string_view number = oid.substr(0, oid.find('.'));
    if (number.empty() || !std::all_of(number.begin(), number.end(), is_digit)) return false;
    if (number.front() == '0' && number.size() > 1) return false;
    ++numbers;
    if (number.size() == oid.size()) return numbers > 1;
    oid.remove_prefix(number.size() + 1);
  }
}

}  // namespace orv::slapi
