#include "protocol/syntax.h"

#include <algorithm>

#include "cfg/text.h"

namespace orv::server {
namespace {

bool is_digit(char c) noexcept {
  return c >= '0' && c <= '9';
}
bool is_letter(char c) noexcept {
  return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z');
}
bool is_key_char(char c) noexcept {
  return is_letter(c) || is_digit(c) || c == '-';
}

bool is_number(std::string_view text) noexcept {
  if (text.empty() || !std::all_of(text.begin(), text.end(), is_digit)) return false;
  return text.size() == 1 || text.front() != '0';
}

bool is_short_name(std::string_view text) noexcept {
  return !text.empty() && is_letter(text.front()) &&
         std::all_of(text.begin(), text.end(), is_key_char);
}

// Takes what stands before the next separator off the front of `rest`; `last` when there was none.
std::string_view take_part(std::string_view& rest, char separator, bool& last) noexcept {
  const std::size_t end = rest.find(separator);
  last = end == std::string_view::npos;
  const std::string_view part = rest.substr(0, end);
  rest.remove_prefix(last ? rest.size() : end + 1);
  return part;
}

}  // namespace

bool is_numeric_oid(std::string_view text) noexcept {
  if (text.find('.') == std::string_view::npos) return false;
  for (bool last = false; !last;) {
    if (!is_number(take_part(text, '.', last))) return false;
  }
  return true;
}

bool is_oid(std::string_view text) noexcept {
  return is_short_name(text) || is_numeric_oid(text);
}

bool is_attribute_description(std::string_view text) noexcept {
  bool last = false;
  if (!is_oid(take_part(text, ';', last))) return false;
  while (!last) {
    const std::string_view option = take_part(text, ';', last);
    if (option.empty() || !std::all_of(option.begin(), option.end(), is_key_char)) return false;
  }
  return true;
}

bool is_clean_text(std::string_view text) noexcept {
  return text.find('\0') == std::string_view::npos && cfg::is_valid_utf8(text);
}

}  // namespace orv::server
