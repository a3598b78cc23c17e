#include "cfg/masked_dn.h"

#include <algorithm>
#include <utility>

#include "cfg/attribute_table.h"
#include "cfg/dn.h"
#include "cfg/result_codes.h"

namespace orv::cfg {
namespace {

// DNs within values of DNs are looked at so far down; what lies deeper is not shown.
constexpr int kDepth = 4;

const AttributeType* find_type(std::string_view description) noexcept {
  return find_attribute_type(description.substr(0, description.find(';')));
}

bool is_secret_type(std::string_view description) noexcept {
  const AttributeType* const type = find_type(description);
  return type != nullptr && type->secret;
}

bool is_hidden_type(std::string_view description, UnknownTypes unknown) noexcept {
  const AttributeType* const type = find_type(description);
  return type == nullptr ? unknown == UnknownTypes::hidden : type->secret;
}

int search_dn(std::string_view text, int depth, bool& found);

// Whether the value is to be replaced.
int examine(const Ava& part, UnknownTypes unknown, int depth, bool& found) {
  found = is_hidden_type(part.type, unknown);
  if (found || part.value.find('=') == std::string::npos) return result::success;
  const int code = search_dn(part.value, depth, found);
  return code == result::invalid_dn_syntax ? result::success : code;
}

// Whether a DN holds a secret. 0, 34 or 90.
int search_dn(std::string_view text, int depth, bool& found) {
  Dn dn;
  if (const int code = parse_dn(text, dn)) return code;
  found = depth == 0;
  for (const Rdn& rdn : dn)
    for (const Ava& part : rdn) {
      if (found) return result::success;
      if (const int code = examine(part, UnknownTypes::shown, depth - 1, found)) return code;
    }
  return result::success;
}

// A value as it may stand in a DN: everything that might mean something there as \XX.
void append_value(std::string& out, std::string_view value) {
  constexpr char kHex[] = "0123456789ABCDEF";
  for (const char c : value) {
    const bool plain = (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') ||
                       c == '-' || c == '.' || c == '_' || c == '@' || c == '/' || c == ':';
    if (plain) {
      out += c;
      continue;
    }
    const auto byte = static_cast<unsigned char>(c);
    out += {'\\', kHex[byte >> 4], kHex[byte & 15]};
  }
}

// `replaced`: something was.
int rewrite(const Dn& dn, UnknownTypes unknown, std::string& text, bool& replaced) {
  for (const Rdn& rdn : dn) {
    if (&rdn != &dn.front()) text += ',';
    for (const Ava& part : rdn) {
      bool found = false;
      if (const int code = examine(part, unknown, kDepth, found)) return code;
      if (&part != &rdn.front()) text += '+';
      text.append(part.type) += '=';
      if (found)
        text += kMask;
      else
        append_value(text, part.value);
      replaced = replaced || found;
    }
  }
  return result::success;
}

// ---- other texts

// The length of an equals sign that the text begins with, also of one that is escaped within the
// value of a DN or in a URL; 0 when there is none.
std::size_t length_of_sign(std::string_view text) noexcept {
  if (text.starts_with('=')) return 1;
  if (text.starts_with("\\=")) return 2;
  for (const std::string_view escaped : {"\\3D", "\\3d", "%3D", "%3d"})
    if (text.starts_with(escaped)) return escaped.size();
  return 0;
}

bool may_be_in_type(char c) noexcept {
  return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') || c == '-' ||
         c == '.' || c == ';' || c == ':';
}

// The attribute type that the text, up to an equals sign, ends with: with options, a matching rule
// or the scheme of a URL; blanks, the rest of an operator or escapes of the sign behind it are left
// out.
std::string_view type_before(std::string_view text) noexcept {
  constexpr std::string_view kBehind = " <>~:\\";
  while (!text.empty()) {
    if (text.ends_with("\\5C") || text.ends_with("\\5c"))
      text.remove_suffix(3);
    else if (kBehind.find(text.back()) != std::string_view::npos)
      text.remove_suffix(1);
    else
      break;
  }
  std::size_t begin = text.size();
  while (begin > 0 && may_be_in_type(text[begin - 1])) --begin;
  text.remove_prefix(begin);
  return text;
}

// Whether any part of it is the name of a secret type.
bool names_secret(std::string_view description) noexcept {
  while (!description.empty()) {
    const std::size_t end = std::min(description.find_first_of(";:"), description.size());
    if (is_secret_type(description.substr(0, end))) return true;
    description.remove_prefix(std::min(end + 1, description.size()));
  }
  return false;
}

// A value ends where the next part of a DN begins, or a filter's item ends, or the record.
std::size_t end_of_value(std::string_view text, std::size_t at, bool in_filter) noexcept {
  const std::string_view ends = in_filter ? ")" : ",+";
  if (text.ends_with('\n')) text.remove_suffix(1);
  while (at < text.size() && ends.find(text[at]) == std::string_view::npos)
    at += text[at] == '\\' && at + 1 < text.size() ? 2 : 1;
  return at;
}

}  // namespace

int mask_dn(std::string_view dn, UnknownTypes unknown, std::string& shown) noexcept try {
  Dn parsed;
  if (const int code = parse_dn(dn, parsed)) return code;
  std::string text;
  bool replaced = false;
  if (const int code = rewrite(parsed, unknown, text, replaced)) return code;
  shown = replaced ? std::move(text) : std::string(dn);
  return result::success;
} catch (...) {
  return result::no_memory;
}

// In the normal form every "=", "," and "+" that belongs to a value is escaped.
bool normal_dn_may_need_mask(std::string_view normal) noexcept {
  if (normal.find("\\3D") != std::string_view::npos) return true;  // perhaps a DN within
  for (std::size_t at = 0; at < normal.size();) {
    const std::size_t equals = std::min(normal.find('=', at), normal.size());
    const std::string_view type = normal.substr(at, equals - at);
    if (!type.empty() && is_hidden_type(type, UnknownTypes::hidden)) return true;
    at = normal.find_first_of(",+", equals);
    if (at == std::string_view::npos) return false;
    ++at;
  }
  return false;
}

std::optional<TextPart> find_secret(std::string_view text, std::size_t from) noexcept {
  for (std::size_t at = text.find_first_of("=\\%", from); at != std::string_view::npos;) {
    const std::size_t sign = length_of_sign(text.substr(at));
    const std::string_view type = sign == 0 ? std::string_view() : type_before(text.substr(0, at));
    if (names_secret(type)) {
      const bool in_filter = type.data() > text.data() && type.data()[-1] == '(';
      return TextPart{at + sign, end_of_value(text, at + sign, in_filter)};
    }
    at = text.find_first_of("=\\%", at + std::max<std::size_t>(sign, 1));
  }
  return std::nullopt;
}

}  // namespace orv::cfg
