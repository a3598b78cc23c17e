#include "cfg/matching.h"

#include <algorithm>
#include <cstdint>
#include <optional>
#include <utility>

#include "assertion.h"
#include "cfg/result_codes.h"
#include "cfg/text.h"
#include "characters.h"
#include "dn_text.h"
#include "preparation.h"

namespace orv::cfg {

// ---- Canonical values ----

namespace {

std::string prepared_text(std::string_view value, LetterCase letter_case) {
  std::string text = prepare(value, letter_case);
  fold_blanks(text);
  return std::string(trim_blanks(text));
}

std::string without(std::string_view value, std::string_view dropped) {
  std::string text;
  for (const char c : value) {
    if (dropped.find(c) == std::string_view::npos) text += c;
  }
  return text;
}

// Sign and digits without leading zeros; nothing when it is no integer.
std::optional<std::string> canonical_integer(std::string_view value) {
  value = trim_blanks(value);
  const bool negative = !value.empty() && value.front() == '-';
  if (negative) value.remove_prefix(1);
  if (value.empty() || !std::all_of(value.begin(), value.end(), &is_ascii_digit)) {
    return std::nullopt;
  }
  while (value.size() > 1 && value.front() == '0') value.remove_prefix(1);
  if (value == "0") return std::string(value);
  std::string number(negative ? "-" : "");
  number += value;
  return number;
}

// Generalized time (RFC 4517, 3.3.13) as seconds since 1970, then "." and the fraction's digits.
class TimeReader {
 public:
  explicit TimeReader(std::string_view text) noexcept : text_(text) {}

  bool run(std::int64_t& seconds, std::string& fraction) {
    int year = 0, month = 0, day = 0, hour = 0, minute = 0, second = 0;
    if (!number(4, 0, 9999, year) || !number(2, 1, 12, month) || !number(2, 1, 31, day) ||
        !number(2, 0, 23, hour)) {
      return false;
    }
    std::int64_t unit = 3600;
    if (digit_follows()) {
      if (!number(2, 0, 59, minute)) return false;
      unit = 60;
      if (digit_follows()) {
        if (!number(2, 0, 60, second)) return false;
        unit = 1;
      }
    }
    std::int64_t offset = 0;
    std::int64_t fraction_seconds = 0;
    if (!read_fraction(unit, fraction_seconds, fraction) || !zone(offset)) return false;
    seconds = days(year, month, day) * 86400 + hour * 3600 + minute * 60 + second +
              fraction_seconds - offset;
    return true;
  }

 private:
  [[nodiscard]] bool digit_follows() const noexcept {
    return !text_.empty() && is_ascii_digit(text_.front());
  }

  bool number(std::size_t digits, int low, int high, int& value) noexcept {
    if (text_.size() < digits) return false;
    value = 0;
    for (std::size_t i = 0; i < digits; ++i) {
      if (!is_ascii_digit(text_[i])) return false;
      value = value * 10 + (text_[i] - '0');
    }
    text_.remove_prefix(digits);
    return value >= low && value <= high;
  }

  // A fraction of the smallest unit given. Nine digits are looked at, enough for nanoseconds.
  bool read_fraction(std::int64_t unit, std::int64_t& seconds, std::string& fraction) {
    fraction = "000000000";
    if (text_.empty() || (text_.front() != '.' && text_.front() != ',')) return true;
    text_.remove_prefix(1);
    if (!digit_follows()) return false;
    std::int64_t billionths = 0;
    for (int i = 0; i < 9; ++i) {
      billionths = billionths * 10 + (digit_follows() ? text_.front() - '0' : 0);
      if (digit_follows()) text_.remove_prefix(1);
    }
    while (digit_follows()) text_.remove_prefix(1);
    billionths *= unit;
    seconds = billionths / 1000000000;
    std::int64_t rest = billionths % 1000000000;
    for (std::size_t i = 9; i-- > 0; rest /= 10) fraction[i] = static_cast<char>('0' + rest % 10);
    return true;
  }

  bool zone(std::int64_t& offset) noexcept {
    if (text_ == "Z") return true;
    if (text_.empty() || (text_.front() != '+' && text_.front() != '-')) return false;
    const int sign = text_.front() == '-' ? -1 : 1;
    text_.remove_prefix(1);
    int hours = 0;
    int minutes = 0;
    if (!number(2, 0, 23, hours)) return false;
    if (!text_.empty() && !number(2, 0, 59, minutes)) return false;
    offset = sign * (hours * 3600 + minutes * 60);
    return text_.empty();
  }

  // Days since 1970-01-01 in the proleptic Gregorian calendar.
  static std::int64_t days(int year, int month, int day) noexcept {
    const std::int64_t y = month <= 2 ? year - 1 : year;
    const std::int64_t era = (y >= 0 ? y : y - 399) / 400;
    const std::int64_t year_of_era = y - era * 400;
    const std::int64_t day_of_year = (153 * (month + (month > 2 ? -3 : 9)) + 2) / 5 + day - 1;
    return era * 146097 + year_of_era * 365 + year_of_era / 4 - year_of_era / 100 + day_of_year -
           719468;
  }

  std::string_view text_;
};

// A text that orders as the time does: the seconds are moved into the positive and padded.
std::optional<std::string> canonical_time(std::string_view value) {
  std::int64_t seconds = 0;
  std::string fraction;
  if (!TimeReader(trim_blanks(value)).run(seconds, fraction)) return std::nullopt;
  const std::string digits = std::to_string(seconds + 1000000000000);
  std::string text(20 - digits.size(), '0');
  text += digits;
  text += '.';
  text += fraction;
  return text;
}

std::optional<std::string> canonical_boolean(std::string_view value) {
  value = trim_blanks(value);
  if (equals_ignore_ascii_case(value, "TRUE")) return "TRUE";
  if (equals_ignore_ascii_case(value, "FALSE")) return "FALSE";
  return std::nullopt;
}

std::optional<std::string> canonical_dn(std::string_view value) {
  std::string normal;
  if (!normalize(value, DnText::any_code_page, normal)) return std::nullopt;
  return normal;
}

std::string canonical_telephone(std::string_view value) {
  return without(prepare(value, LetterCase::folded), " -");
}

std::string canonical_object_identifier(std::string_view value) {
  std::string text(trim_blanks(value));
  for (char& c : text) c = ascii_upper(c);
  return text;
}

}  // namespace

std::optional<std::string> canonical_form(MatchingRule rule, std::string_view value) {
  switch (rule) {
    case MatchingRule::case_ignore:
      return prepared_text(value, LetterCase::folded);
    case MatchingRule::case_exact:
      return prepared_text(value, LetterCase::kept);
    case MatchingRule::octets:
      return std::string(value);
    case MatchingRule::distinguished_name:
      return canonical_dn(value);
    case MatchingRule::integer:
      return canonical_integer(value);
    case MatchingRule::boolean:
      return canonical_boolean(value);
    case MatchingRule::object_identifier:
      return canonical_object_identifier(value);
    case MatchingRule::telephone_number:
      return canonical_telephone(value);
    case MatchingRule::generalized_time:
      return canonical_time(value);
  }
  return std::nullopt;
}

int canonical_value(MatchingRule rule, std::string_view value, std::string& canonical) noexcept
    try {
  std::optional<std::string> form = canonical_form(rule, value);
  if (!form) return result::invalid_attribute_syntax;
  canonical = std::move(*form);
  return result::success;
} catch (...) {
  return result::no_memory;
}

int equality_key(MatchingRule rule, std::string_view value, std::string& key) noexcept try {
  const std::optional<std::string> form = canonical_form(rule, value);
  // No value outside the syntax is taken for the form of one within.
  std::string made(1, form ? '=' : '#');
  made += form ? std::string_view(*form) : value;
  key = std::move(made);
  return result::success;
} catch (...) {
  return result::no_memory;
}

// ---- Names of matching rules ----

namespace {

// Whether a filter may name the rule. Not if its own comparison differs from the one that values of
// the type get here: a rule for first components asserts a part of the value.
enum class InFilters { no, yes };

struct RuleName {
  std::string_view name;
  std::string_view oid;
  MatchingRule rule;
  InFilters in_filters = InFilters::yes;
};

constexpr RuleName kRules[] = {
    {"objectIdentifierMatch", "2.5.13.0", MatchingRule::object_identifier},
    {"distinguishedNameMatch", "2.5.13.1", MatchingRule::distinguished_name},
    {"caseIgnoreMatch", "2.5.13.2", MatchingRule::case_ignore},
    {"caseExactMatch", "2.5.13.5", MatchingRule::case_exact},
    {"numericStringMatch", "2.5.13.8", MatchingRule::telephone_number, InFilters::no},
    {"caseIgnoreListMatch", "2.5.13.11", MatchingRule::case_ignore, InFilters::no},
    {"booleanMatch", "2.5.13.13", MatchingRule::boolean},
    {"integerMatch", "2.5.13.14", MatchingRule::integer},
    {"bitStringMatch", "2.5.13.16", MatchingRule::octets, InFilters::no},
    {"octetStringMatch", "2.5.13.17", MatchingRule::octets},
    {"telephoneNumberMatch", "2.5.13.20", MatchingRule::telephone_number},
    {"uniqueMemberMatch", "2.5.13.23", MatchingRule::distinguished_name, InFilters::no},
    {"generalizedTimeMatch", "2.5.13.27", MatchingRule::generalized_time},
    {"integerFirstComponentMatch", "2.5.13.29", MatchingRule::case_ignore, InFilters::no},
    {"objectIdentifierFirstComponentMatch", "2.5.13.30", MatchingRule::case_ignore, InFilters::no},
    {"directoryStringFirstComponentMatch", "2.5.13.31", MatchingRule::case_ignore, InFilters::no},
    {"caseExactIA5Match", "1.3.6.1.4.1.1466.109.114.1", MatchingRule::case_exact},
    {"caseIgnoreIA5Match", "1.3.6.1.4.1.1466.109.114.2", MatchingRule::case_ignore},
    {"UUIDMatch", "1.3.6.1.1.16.2", MatchingRule::case_ignore, InFilters::no},
};

const RuleName* find_rule_name(std::string_view name_or_oid) noexcept {
  for (const RuleName& known : kRules) {
    if (equals_ignore_ascii_case(known.name, name_or_oid) || known.oid == name_or_oid) {
      return &known;
    }
  }
  return nullptr;
}

}  // namespace

bool find_matching_rule(std::string_view name_or_oid, MatchingRule& rule) noexcept {
  const RuleName* const known = find_rule_name(name_or_oid);
  if (known == nullptr) return false;
  rule = known->rule;
  return true;
}

bool find_filter_rule(std::string_view name_or_oid, MatchingRule& rule) noexcept {
  const RuleName* const known = find_rule_name(name_or_oid);
  if (known == nullptr || known->in_filters == InFilters::no) return false;
  rule = known->rule;
  return true;
}

}  // namespace orv::cfg
