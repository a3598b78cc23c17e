// Comparison of stored values with the values of a filter, by matching rule (RFC 4517,
// section 4.2).
#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "cfg/matching.h"

namespace orv::cfg {

// The value of an equality or ordering assertion, prepared once for many comparisons.
// Constructing and comparing throws std::bad_alloc only.
class Assertion {
 public:
  Assertion(MatchingRule rule, std::string_view value);

  // Whether the value is one of the rule's syntax; if not, the assertion is Undefined.
  [[nodiscard]] bool valid() const noexcept { return valid_; }

  [[nodiscard]] bool equals(std::string_view stored) const;
  // Whether the stored value is at or above (below) the asserted one: numbers and times by their
  // value, everything else by its prepared bytes. A stored value of another syntax is neither.
  [[nodiscard]] bool stored_is_at_least(std::string_view stored) const;
  [[nodiscard]] bool stored_is_at_most(std::string_view stored) const;

 private:
  enum class Order { unordered, below, same, above };
  [[nodiscard]] Order order_of(std::string_view stored) const;

  MatchingRule rule_;
  bool valid_ = false;
  bool ascii_ = false;
  std::string prepared_;
};

// A substring assertion: the parts between the asterisks, prepared.
class SubstringAssertion {
 public:
  // `parts` in order; the first is anchored to the start when `initial`, the last to the end when
  // `final`.
  SubstringAssertion(MatchingRule rule, const std::vector<std::string>& parts, bool initial,
                     bool final);

  // False for rules that have no substring form.
  [[nodiscard]] bool valid() const noexcept { return valid_; }
  [[nodiscard]] bool matches(std::string_view stored) const;

 private:
  // `form` is the whole value, prepared.
  [[nodiscard]] bool form_matches(std::string_view form) const;

  MatchingRule rule_;
  bool valid_ = false;
  bool initial_;
  bool final_;
  std::vector<std::string> parts_;
};

// As `canonical_value`, but throws std::bad_alloc; nothing when the value is not of the rule's
// syntax.
std::optional<std::string> canonical_form(MatchingRule rule, std::string_view value);

// The rule with this name or OID, if an extensible match may name it; else false.
bool find_filter_rule(std::string_view name_or_oid, MatchingRule& rule) noexcept;

}  // namespace orv::cfg
