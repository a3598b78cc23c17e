// Search filters (RFC 4515): read once, evaluated on the text of each candidate entry. Filters are
// in UTF-8, whatever code page the entries are in.
#pragma once

#include <cstddef>
#include <memory>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include "assertion.h"
#include "attribute_lookup.h"
#include "ldif_index.h"

namespace orv::cfg {

// The three truth values of RFC 4511, 4.5.1.7, in the order that makes "and" the minimum.
enum class Truth : unsigned char { no, undefined, yes };

class Filter {
 public:
  static constexpr int kMaxDepth = 64;

  // Reads a filter: with or without its outer parentheses; a bare attribute name is a presence
  // test. Blanks around filters are skipped. False when it cannot be read or nests deeper than
  // kMaxDepth; throws std::bad_alloc.
  bool parse(std::string_view text);

  // Whether the entry matches; Undefined is not a match. A filter of many items is a search of its
  // own within one entry: the answer is `interrupted` when the check of cfg/interrupt.h says so on
  // the way. Throws std::bad_alloc.
  enum class Match : unsigned char { no, yes, interrupted };
  [[nodiscard]] Match match(const LdifIndex& index, std::uint32_t entry) const;
  [[nodiscard]] bool matches(const LdifIndex& index, std::uint32_t entry) const {
    return match(index, entry) == Match::yes;
  }

 private:
  friend class FilterParser;

  // The attribute an assertion is about.
  struct Type {
    const KnownType* known = nullptr;
    std::string name;  // as written in the filter
    [[nodiscard]] bool is(std::string_view spelled) const noexcept;
    [[nodiscard]] bool secret() const noexcept { return known != nullptr && known->secret; }
    [[nodiscard]] MatchingRule equality() const noexcept {
      return known != nullptr ? known->equality : MatchingRule::case_ignore;
    }
  };
  enum class Kind {
    all_of,
    any_of,
    negation,
    presence,
    equality,
    at_least,
    at_most,
    substrings,
    extensible,
    undefined
  };
  struct Node {
    Kind kind = Kind::undefined;
    std::vector<std::size_t> children;  // of all_of, any_of, negation
    Type type;                          // extensible: without a name stands for every type
    std::unique_ptr<Assertion> assertion;
    std::unique_ptr<SubstringAssertion> parts;
    MatchingRule rule = MatchingRule::case_ignore;  // extensible
    bool dn_too = false;                            // extensible
  };

  class Evaluation;

  std::vector<Node> nodes_;  // the first is the root
};

}  // namespace orv::cfg
