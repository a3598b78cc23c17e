#include "filter.h"

#include <algorithm>
#include <utility>

#include "cfg/text.h"
#include "characters.h"
#include "interrupt_poll.h"
#include "local_text.h"

namespace orv::cfg {

// ---- Reading ----

class FilterParser {
 public:
  FilterParser(std::string_view text, std::vector<Filter::Node>& nodes) noexcept
      : text_(text), nodes_(nodes) {}

  bool run() {
    skip_blanks();
    while (text_.size() > at_ && text_.back() == ' ') text_.remove_suffix(1);
    if (at_end()) return false;
    const bool bare = peek() != '(';
    const bool read = bare ? read_content(1) : read_filter(1);
    return read && at_end();
  }

 private:
  using Kind = Filter::Kind;
  using Node = Filter::Node;

  [[nodiscard]] bool at_end() const noexcept { return at_ == text_.size(); }
  [[nodiscard]] char peek() const noexcept { return text_[at_]; }
  void skip_blanks() noexcept {
    while (!at_end() && peek() == ' ') ++at_;
  }

  std::size_t add(Kind kind) {
    nodes_.emplace_back().kind = kind;
    return nodes_.size() - 1;
  }

  bool read_filter(int depth) {
    if (depth > Filter::kMaxDepth || at_end() || peek() != '(') return false;
    ++at_;
    skip_blanks();
    if (!read_content(depth) || at_end() || peek() != ')') return false;
    ++at_;
    return true;
  }

  bool read_content(int depth) {
    if (at_end()) return false;
    switch (peek()) {
      case '&':
        return read_list(Kind::all_of, depth);
      case '|':
        return read_list(Kind::any_of, depth);
      case '!':
        return read_negation(depth);
      default:
        return read_item();
    }
  }

  // "(&)" and "(|)" are true and false (RFC 4526).
  bool read_list(Kind kind, int depth) {
    const std::size_t node = add(kind);
    ++at_;
    while (skip_blanks(), !at_end() && peek() == '(') {
      const std::size_t child = nodes_.size();
      if (!read_filter(depth + 1)) return false;
      nodes_[node].children.push_back(child);
    }
    return true;
  }

  bool read_negation(int depth) {
    const std::size_t node = add(Kind::negation);
    ++at_;
    skip_blanks();
    const std::size_t child = nodes_.size();
    if (!read_filter(depth + 1)) return false;
    nodes_[node].children.push_back(child);
    skip_blanks();
    return true;
  }

  bool read_item() {
    const std::string_view rest = text_.substr(at_);
    const std::string_view item = rest.substr(0, rest.find_first_of("()"));
    at_ += item.size();
    const std::size_t equals = item.find('=');
    if (equals == std::string_view::npos) return read_presence(trim(item));
    const std::string_view value = item.substr(equals + 1);
    if (equals == 0) return false;
    const std::string_view before = item.substr(0, equals - 1);
    switch (item[equals - 1]) {
      case ':':
        return read_extensible(before, value);
      case '>':
        return read_comparison(Kind::at_least, before, value);
      case '<':
        return read_comparison(Kind::at_most, before, value);
      case '~':
        return read_comparison(Kind::equality, before, value);
      default:
        return read_simple(item.substr(0, equals), value);
    }
  }

  static std::string_view trim(std::string_view text) noexcept {
    while (!text.empty() && text.front() == ' ') text.remove_prefix(1);
    while (!text.empty() && text.back() == ' ') text.remove_suffix(1);
    return text;
  }

  static bool is_name(std::string_view text) noexcept {
    const bool numeric = !text.empty() && is_ascii_digit(text.front());
    if (text.empty() || (!numeric && !is_ascii_letter(text.front()))) return false;
    return std::all_of(text.begin(), text.end(), [numeric](char c) {
      return is_ascii_digit(c) || (numeric ? c == '.' : is_ascii_letter(c) || c == '-');
    });
  }

  // An attribute description. One with options is well formed and names nothing in this file.
  static bool read_type(std::string_view text, Filter::Type& type, bool& has_options) {
    text = trim(text);
    const std::string_view name = text.substr(0, text.find(';'));
    has_options = name.size() < text.size();
    if (!is_name(name)) return false;
    type.name = name;
    type.known = attribute_lookup().find(name);
    return true;
  }

  // The node of an assertion about `type`; of kind undefined, and so done, when it has options.
  bool add_item(Kind kind, std::string_view type_text, std::size_t& node) {
    Filter::Type type;
    bool has_options = false;
    if (!read_type(type_text, type, has_options)) return false;
    node = add(has_options ? Kind::undefined : kind);
    nodes_[node].type = std::move(type);
    return true;
  }

  bool read_presence(std::string_view type) {
    std::size_t node = 0;
    return add_item(Kind::presence, type, node);
  }

  bool read_comparison(Kind kind, std::string_view type, std::string_view value_text) {
    std::string value;
    std::size_t node = 0;
    if (!unescape(value_text, value) || !add_item(kind, type, node)) return false;
    set_assertion(nodes_[node], nodes_[node].type.equality(), value);
    return true;
  }

  bool read_simple(std::string_view type, std::string_view value_text) {
    if (value_text.find('*') == std::string_view::npos) {
      return read_comparison(Kind::equality, type, value_text);
    }
    std::vector<std::string> parts;
    bool initial = false;
    bool final = false;
    if (!split_parts(value_text, parts, initial, final)) return false;
    if (parts.empty()) return read_presence(type);
    std::size_t node = 0;
    if (!add_item(Kind::substrings, type, node)) return false;
    Node& item = nodes_[node];
    item.parts = std::make_unique<SubstringAssertion>(item.type.equality(), parts, initial, final);
    if (item.type.secret() || !item.parts->valid()) item.kind = Kind::undefined;
    return true;
  }

  bool split_parts(std::string_view text, std::vector<std::string>& parts, bool& initial,
                   bool& final) {
    while (true) {
      const std::size_t star = text.find('*');
      const bool last = star == std::string_view::npos;
      std::string part;
      if (!unescape(text.substr(0, star), part)) return false;
      if (!part.empty()) {
        initial = initial || (first_part_ && !last);
        final = last;
        parts.push_back(std::move(part));
      }
      first_part_ = false;
      if (last) break;
      text.remove_prefix(star + 1);
    }
    first_part_ = true;
    return true;
  }

  // [type][":dn"][":rule"]":=" value
  bool read_extensible(std::string_view text, std::string_view value_text) {
    std::string value;
    if (!unescape(value_text, value)) return false;
    const std::size_t type_end = std::min(text.find(':'), text.size());
    std::string_view rest = text.substr(type_end);
    const bool dn_too = rest.size() >= 3 && equals_ignore_ascii_case(rest.substr(0, 3), ":dn") &&
                        (rest.size() == 3 || rest[3] == ':');
    if (dn_too) rest.remove_prefix(3);
    const bool has_rule = !rest.empty();
    if (has_rule) rest.remove_prefix(1);
    if (has_rule && !is_name(rest)) return false;
    return add_extensible(text.substr(0, type_end), dn_too, has_rule, rest, value);
  }

  bool add_extensible(std::string_view type, bool dn_too, bool has_rule, std::string_view rule,
                      const std::string& value) {
    if (type.empty() && !has_rule) return false;
    std::size_t node = 0;
    if (type.empty()) {
      node = add(Kind::extensible);
    } else if (!add_item(Kind::extensible, type, node)) {
      return false;
    }
    Node& item = nodes_[node];
    item.dn_too = dn_too;
    item.rule = item.type.equality();
    if (has_rule && !find_filter_rule(rule, item.rule)) item.kind = Kind::undefined;
    set_assertion(item, item.rule, value);
    return true;
  }

  // What cannot be decided, or must not be told, for any entry is settled here.
  static void set_assertion(Node& item, MatchingRule rule, const std::string& value) {
    item.assertion = std::make_unique<Assertion>(rule, value);
    if (item.type.secret() || !item.assertion->valid()) item.kind = Kind::undefined;
  }

  static bool unescape(std::string_view text, std::string& value) {
    for (std::size_t i = 0; i < text.size(); ++i) {
      if (text[i] != '\\') {
        if (text[i] == '*' || text[i] == '\0') return false;
        value += text[i];
        continue;
      }
      if (i + 2 >= text.size()) return false;
      const int high = hex_digit(text[i + 1]);
      const int low = hex_digit(text[i + 2]);
      if (high < 0 || low < 0) return false;
      value += static_cast<char>(high << 4 | low);
      i += 2;
    }
    return true;
  }

  std::string_view text_;
  std::vector<Filter::Node>& nodes_;
  std::size_t at_ = 0;
  bool first_part_ = true;
};

bool Filter::parse(std::string_view text) {
  nodes_.clear();
  return FilterParser(text, nodes_).run();
}

// ---- Evaluation ----

bool Filter::Type::is(std::string_view spelled) const noexcept {
  if (known == nullptr) return equals_ignore_ascii_case(name, spelled);
  return is_name_of(*known, spelled);
}

// One entry's evaluation.
class Filter::Evaluation {
 public:
  Evaluation(const std::vector<Node>& nodes, const LdifIndex& index, std::uint32_t entry) noexcept
      : nodes_(nodes), index_(index), entry_(entry) {}

  // Without meaning once it was stopped.
  Truth of(std::size_t at) {
    const Node& node = nodes_[at];
    switch (node.kind) {
      case Kind::all_of: {
        Truth result = Truth::yes;
        for (std::size_t i = 0; i < node.children.size() && result != Truth::no; ++i) {
          if (should_stop()) break;
          result = std::min(result, of(node.children[i]));
        }
        return result;
      }
      case Kind::any_of: {
        Truth result = Truth::no;
        for (std::size_t i = 0; i < node.children.size() && result != Truth::yes; ++i) {
          if (should_stop()) break;
          result = std::max(result, of(node.children[i]));
        }
        return result;
      }
      case Kind::negation: {
        const Truth inner = of(node.children.front());
        if (inner == Truth::undefined) return inner;
        return inner == Truth::yes ? Truth::no : Truth::yes;
      }
      case Kind::undefined:
        return Truth::undefined;
      case Kind::extensible:
        return of_extensible(node);
      default:
        return of_item(node);
    }
  }

  [[nodiscard]] bool was_stopped() const noexcept { return stopped_; }

 private:
  // Asks every so much work, of which a look at a line and one at an item of a list are a unit: the
  // question costs more than either.
  bool should_stop() noexcept {
    constexpr std::size_t kUnits = 1024;
    if (++work_ >= kUnits && !stopped_) {
      work_ = 0;
      stopped_ = interrupted();
    }
    return stopped_;
  }

  // The value of a line, decoded and in UTF-8, wherever that is.
  std::string_view value_of(const AttributeLine& line) {
    return as_utf8(decoded(line, scratch_), utf8_);
  }

  Truth of_item(const Node& node) {
    LineReader reader = index_.lines(entry_);
    AttributeLine line;
    bool present = false;
    reader.next(line);
    for (; reader.next(line); ++work_) {
      if (!node.type.is(line.type)) continue;
      present = true;
      if (node.kind == Kind::presence) return Truth::yes;
      if (value_matches(node, value_of(line))) return Truth::yes;
    }
    // A type that neither the schema nor the entry knows is not recognised (RFC 4511, 4.5.1.7).
    return present || node.type.known != nullptr ? Truth::no : Truth::undefined;
  }

  // Of the kinds for which it matters what the value is.
  static bool value_matches(const Node& node, std::string_view value) {
    switch (node.kind) {
      case Kind::substrings:
        return node.parts->matches(value);
      case Kind::at_least:
        return node.assertion->stored_is_at_least(value);
      case Kind::at_most:
        return node.assertion->stored_is_at_most(value);
      default:
        return node.assertion->equals(value);
    }
  }

  Truth of_extensible(const Node& node) {
    LineReader reader = index_.lines(entry_);
    AttributeLine line;
    bool present = false;
    reader.next(line);
    for (; reader.next(line); ++work_) {
      if (!node.type.name.empty()) {
        if (!node.type.is(line.type)) continue;
      } else {
        // Without a type the rule asks every attribute that compares by it; secrets never answer.
        const KnownType* known = attribute_lookup().find(line.type);
        const MatchingRule own = known != nullptr ? known->equality : MatchingRule::case_ignore;
        if (own != node.rule || (known != nullptr && known->secret)) continue;
      }
      present = true;
      if (node.assertion->equals(value_of(line))) return Truth::yes;
    }
    if (node.dn_too && dn_matches(node)) return Truth::yes;
    const bool recognised = present || node.type.known != nullptr || node.type.name.empty();
    return recognised ? Truth::no : Truth::undefined;
  }

  bool dn_matches(const Node& node) {
    Dn dn;
    parse_local(index_.dn(entry_, scratch_), dn);
    for (const Rdn& rdn : dn) {
      for (const Ava& ava : rdn) {
        const KnownType* known = attribute_lookup().find(ava.type);
        const MatchingRule own = known != nullptr ? known->equality : MatchingRule::case_ignore;
        const bool asked = node.type.name.empty() ? own == node.rule : node.type.is(ava.type);
        if (asked && !(known != nullptr && known->secret) && node.assertion->equals(ava.value)) {
          return true;
        }
      }
    }
    return false;
  }

  const std::vector<Node>& nodes_;
  const LdifIndex& index_;
  const std::uint32_t entry_;
  std::size_t work_ = 0;
  bool stopped_ = false;
  std::string scratch_;
  std::string utf8_;
};

Filter::Match Filter::match(const LdifIndex& index, std::uint32_t entry) const {
  Evaluation evaluation(nodes_, index, entry);
  const Truth truth = evaluation.of(0);
  if (evaluation.was_stopped()) return Match::interrupted;
  return truth == Truth::yes ? Match::yes : Match::no;
}

}  // namespace orv::cfg
