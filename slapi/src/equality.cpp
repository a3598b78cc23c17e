#include "equality.h"

#include <algorithm>
#include <new>

#include "cfg/dn.h"
#include "cfg/result_codes.h"
#include "cfg/text.h"

namespace orv::slapi {
namespace {

using cfg::MatchingRule;

struct NamedRule {
  std::string_view name;
  std::string_view oid;
  MatchingRule rule;
};

constexpr NamedRule kRules[] = {
    {"objectIdentifierMatch", "2.5.13.0", MatchingRule::object_identifier},
    {"distinguishedNameMatch", "2.5.13.1", MatchingRule::distinguished_name},
    {"caseIgnoreMatch", "2.5.13.2", MatchingRule::case_ignore},
    {"caseExactMatch", "2.5.13.5", MatchingRule::case_exact},
    {"numericStringMatch", "2.5.13.8", MatchingRule::telephone_number},
    {"caseIgnoreListMatch", "2.5.13.11", MatchingRule::case_ignore},
    {"booleanMatch", "2.5.13.13", MatchingRule::boolean},
    {"integerMatch", "2.5.13.14", MatchingRule::integer},
    {"bitStringMatch", "2.5.13.16", MatchingRule::octets},
    {"octetStringMatch", "2.5.13.17", MatchingRule::octets},
    {"telephoneNumberMatch", "2.5.13.20", MatchingRule::telephone_number},
    {"uniqueMemberMatch", "2.5.13.23", MatchingRule::distinguished_name},
    {"generalizedTimeMatch", "2.5.13.27", MatchingRule::generalized_time},
    {"integerFirstComponentMatch", "2.5.13.29", MatchingRule::case_ignore},
    {"objectIdentifierFirstComponentMatch", "2.5.13.30", MatchingRule::case_ignore},
    {"directoryStringFirstComponentMatch", "2.5.13.31", MatchingRule::case_ignore},
    {"caseExactIA5Match", "1.3.6.1.4.1.1466.109.114.1", MatchingRule::case_exact},
    {"caseIgnoreIA5Match", "1.3.6.1.4.1.1466.109.114.2", MatchingRule::case_ignore},
    {"UUIDMatch", "1.3.6.1.1.16.2", MatchingRule::case_ignore},
};

char upper(char c) noexcept {
  return c >= 'a' && c <= 'z' ? static_cast<char>(c - 'a' + 'A') : c;
}

std::string upper_cased(std::string_view value) {
  std::string key(value);
  std::transform(key.begin(), key.end(), key.begin(), upper);
  return key;
}

// Blanks at the ends count for nothing, several in a row for one.
std::string_view trimmed(std::string_view value) noexcept {
  const std::size_t first = value.find_first_not_of(' ');
  if (first == std::string_view::npos) return {};
  return value.substr(first, value.find_last_not_of(' ') - first + 1);
}

std::string with_single_blanks(std::string_view value) {
  std::string key;
  key.reserve(value.size());
  for (const char c : trimmed(value))
    if (c != ' ' || key.back() != ' ') key.push_back(c);
  return key;
}

bool is_ascii(std::string_view value) noexcept {
  return std::all_of(value.begin(), value.end(),
                     [](char c) { return static_cast<unsigned char>(c) < 0x80; });
}

void append_to_dn(std::string& dn, char c) {
  static constexpr char kDigits[] = "0123456789ABCDEF";
  const auto byte = static_cast<unsigned char>(c);
  if (byte >= 0x80) return dn.push_back(c);
  dn.push_back('\\');
  dn.push_back(kDigits[byte >> 4]);
  dn.push_back(kDigits[byte & 0xF]);
}

// False when the text is no DN.
bool normalize(std::string_view dn, std::string& normal) {
  const int rc = cfg::normalize_dn(dn, normal);
  if (rc == result::no_memory) throw std::bad_alloc();
  return rc == result::success;
}

// The rules for letters beyond ASCII are those of the normal form of DNs, the only place that knows
// them: the value is read as the name of an entry.
std::string folded(std::string_view value) {
  const std::string text = with_single_blanks(value);
  if (is_ascii(text)) return upper_cased(text);
  std::string dn = "CN=";
  for (const char c : text) append_to_dn(dn, c);
  std::string normal;
  return normalize(dn, normal) ? normal : upper_cased(text);
}

std::string dn_key(std::string_view value) {
  std::string normal;
  return normalize(value, normal) ? normal : std::string(value);
}

std::string integer_key(std::string_view value) {
  const bool negative = value.starts_with('-');
  if (negative) value.remove_prefix(1);
  const std::size_t first = std::min(value.find_first_not_of('0'), value.size());
  value.remove_prefix(first);
  if (value.empty() && first != 0) return "0";
  return (negative ? "-" : "") + std::string(value);
}

std::string object_identifier_key(std::string_view value) {
  const std::string_view name = trimmed(value);
  const Schema& schema = current_schema();
  std::string_view canonical = schema.canonical_object_class(name);
  if (canonical.empty()) canonical = schema.canonical_attribute(name);
  return upper_cased(canonical.empty() ? name : canonical);
}

std::string telephone_key(std::string_view value) {
  std::string key = upper_cased(value);
  std::erase_if(key, [](char c) { return c == ' ' || c == '-'; });
  return key;
}

}  // namespace

bool find_matching_rule(std::string_view name_or_oid, cfg::MatchingRule& rule) noexcept {
  if (name_or_oid.empty()) {
    rule = MatchingRule::octets;
    return true;
  }
  for (const NamedRule& known : kRules) {
    if (!cfg::equals_ignore_ascii_case(known.name, name_or_oid) && known.oid != name_or_oid)
      continue;
    rule = known.rule;
    return true;
  }
  return false;
}

cfg::MatchingRule equality_of(std::string_view type) noexcept {
  MatchingRule rule = MatchingRule::case_ignore;
  if (const SchemaAttribute* const known = current_schema().attribute(type); known != nullptr)
    find_matching_rule(known->equality, rule);
  return rule;
}

bool is_secret_type(std::string_view type) noexcept {
  const std::string_view without_options = type.substr(0, type.find(';'));
  const SchemaAttribute* const known = current_schema().attribute(without_options);
  return known != nullptr && known->secret;
}

std::string equality_key(cfg::MatchingRule rule, std::string_view value) {
  switch (rule) {
    case MatchingRule::case_ignore:
      return folded(value);
    case MatchingRule::case_exact:
      return with_single_blanks(value);
    case MatchingRule::octets:
      return std::string(value);
    case MatchingRule::distinguished_name:
      return dn_key(value);
    case MatchingRule::integer:
      return integer_key(value);
    case MatchingRule::object_identifier:
      return object_identifier_key(value);
    case MatchingRule::telephone_number:
      return telephone_key(value);
    case MatchingRule::boolean:
    case MatchingRule::generalized_time:
      return upper_cased(value);
  }
  return std::string(value);
}

}  // namespace orv::slapi
