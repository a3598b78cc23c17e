#include "assertion.h"

#include <array>
#include <cstring>

#include "cfg/text.h"
#include "characters.h"
#include "preparation.h"

namespace orv::cfg {

namespace {

enum class Quick { equal, unequal, undecided };

// Compares without a copy as far as the stored value is ASCII; `prepared` is.
Quick equals_quickly(std::string_view stored, std::string_view prepared) noexcept {
  const std::string_view text = trim_blanks(stored);
  std::size_t at = 0;
  for (std::size_t i = 0; i < text.size(); ++i, ++at) {
    if (text[i] == ' ') {
      while (text[i + 1] == ' ') ++i;
      if (!is_ascii(text[i + 1])) return Quick::undecided;
    }
    if (!is_ascii(text[i])) return Quick::undecided;
    if (at == prepared.size() || ascii_upper(text[i]) != prepared[at]) return Quick::unequal;
  }
  return at == prepared.size() ? Quick::equal : Quick::unequal;
}

int compare_integers(std::string_view a, std::string_view b) noexcept {
  const bool negative_a = a.front() == '-';
  const bool negative_b = b.front() == '-';
  if (negative_a != negative_b) return negative_a ? -1 : 1;
  const int magnitudes = a.size() != b.size() ? (a.size() < b.size() ? -1 : 1) : a.compare(b);
  return negative_a ? -magnitudes : magnitudes;
}

}  // namespace

// ---- Equality and order ----

Assertion::Assertion(MatchingRule rule, std::string_view value) : rule_(rule) {
  std::optional<std::string> prepared = canonical_form(rule, value);
  if (!prepared) return;
  valid_ = true;
  prepared_ = std::move(*prepared);
  ascii_ = is_all_ascii(prepared_);
}

bool Assertion::equals(std::string_view stored) const {
  if (rule_ == MatchingRule::octets) return stored == prepared_;
  if (rule_ == MatchingRule::object_identifier) {
    return equals_ignore_ascii_case(trim_blanks(stored), prepared_);
  }
  if (rule_ == MatchingRule::case_ignore && ascii_) {
    const Quick quick = equals_quickly(stored, prepared_);
    if (quick != Quick::undecided) return quick == Quick::equal;
  }
  const std::optional<std::string> other = canonical_form(rule_, stored);
  return other && *other == prepared_;
}

Assertion::Order Assertion::order_of(std::string_view stored) const {
  const std::optional<std::string> other = canonical_form(rule_, stored);
  if (!other) return Order::unordered;
  const int order = rule_ == MatchingRule::integer ? compare_integers(*other, prepared_)
                                                   : other->compare(prepared_);
  if (order == 0) return Order::same;
  return order < 0 ? Order::below : Order::above;
}

bool Assertion::stored_is_at_least(std::string_view stored) const {
  const Order order = order_of(stored);
  return order == Order::same || order == Order::above;
}

bool Assertion::stored_is_at_most(std::string_view stored) const {
  const Order order = order_of(stored);
  return order == Order::same || order == Order::below;
}

// ---- Substrings ----

namespace {

// std::string_view::find compares the whole part at each place where it may begin: for a part and a
// value that are long and all but alike, the product of their lengths. The C library's search takes
// the sum.
std::size_t find_part(std::string_view text, std::string_view part) noexcept {
  const void* const found = ::memmem(text.data(), text.size(), part.data(), part.size());
  if (found == nullptr) return std::string_view::npos;
  return static_cast<std::size_t>(static_cast<const char*>(found) - text.data());
}

// Where a part of a substring assertion stands.
struct Anchors {
  bool start;
  bool end;
};

// Insignificant blanks of RFC 4518, 2.6.1: one at each end of a whole value, two between its words,
// so that a part may begin or end with a blank at either side of the same gap.
std::string spaced(std::string_view text, Anchors anchors) {
  const std::string_view words = trim_blanks(text);
  if (words.empty()) return " ";
  std::string result;
  if (anchors.start || text.front() == ' ') result += ' ';
  for (const char c : words) {
    if (c == ' ' && result.size() >= 2 && result.compare(result.size() - 2, 2, "  ") == 0) continue;
    result += c;
    if (c == ' ') result += ' ';
  }
  if (anchors.end || text.back() == ' ') result += ' ';
  return result;
}

std::string substring_form(MatchingRule rule, std::string_view value, Anchors anchors) {
  switch (rule) {
    case MatchingRule::octets:
    case MatchingRule::telephone_number:
      return canonical_form(rule, value).value_or("");
    case MatchingRule::case_exact:
      return spaced(prepare(value, LetterCase::kept), anchors);
    default:
      return spaced(prepare(value, LetterCase::folded), anchors);
  }
}

// As substring_form for a whole ASCII value, but into memory that has room for twice the value and
// two characters more: most values are short, and many are looked at.
std::string_view write_spaced(std::string_view value, bool folded, char* to) noexcept {
  char* out = to;
  *out++ = ' ';
  for (const char c : trim_blanks(value)) {
    if (c != ' ') {
      *out++ = folded ? ascii_upper(c) : c;
    } else if (out[-1] != ' ') {
      *out++ = ' ';
      *out++ = ' ';
    }
  }
  if (out != to + 1) *out++ = ' ';
  return {to, static_cast<std::size_t>(out - to)};
}

bool has_substring_form(MatchingRule rule) noexcept {
  return rule == MatchingRule::case_ignore || rule == MatchingRule::case_exact ||
         rule == MatchingRule::octets || rule == MatchingRule::telephone_number;
}

}  // namespace

SubstringAssertion::SubstringAssertion(MatchingRule rule, const std::vector<std::string>& parts,
                                       bool initial, bool final)
    : rule_(rule), valid_(has_substring_form(rule)), initial_(initial), final_(final) {
  if (!valid_) return;
  for (std::size_t i = 0; i < parts.size(); ++i) {
    const Anchors anchors{initial && i == 0, final && i + 1 == parts.size()};
    parts_.push_back(substring_form(rule, parts[i], anchors));
  }
}

bool SubstringAssertion::matches(std::string_view stored) const {
  if (rule_ == MatchingRule::octets) return form_matches(stored);
  std::array<char, 1024> room;
  const bool spaces = rule_ == MatchingRule::case_ignore || rule_ == MatchingRule::case_exact;
  if (spaces && stored.size() * 2 + 2 <= room.size() && is_all_ascii(stored)) {
    return form_matches(write_spaced(stored, rule_ == MatchingRule::case_ignore, room.data()));
  }
  return form_matches(substring_form(rule_, stored, {true, true}));
}

bool SubstringAssertion::form_matches(std::string_view rest) const {
  std::size_t first = 0;
  std::size_t last = parts_.size();
  if (initial_ && first < last) {
    const std::string& part = parts_[first++];
    if (rest.substr(0, part.size()) != part) return false;
    rest.remove_prefix(part.size());
  }
  if (final_ && first < last) {
    const std::string& part = parts_[--last];
    if (rest.size() < part.size() || rest.substr(rest.size() - part.size()) != part) return false;
    rest.remove_suffix(part.size());
  }
  for (; first < last; ++first) {
    const std::size_t found = find_part(rest, parts_[first]);
    if (found == std::string_view::npos) return false;
    rest.remove_prefix(found + parts_[first].size());
  }
  return true;
}

}  // namespace orv::cfg
