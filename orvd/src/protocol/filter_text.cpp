#include "protocol/filter_text.h"

#include <vector>

#include "cfg/result_codes.h"
#include "cfg/text.h"
#include "protocol/syntax.h"

namespace orv::server {
namespace {

namespace filter_tag {
constexpr ber_tag_t conjunction = 0xA0;
constexpr ber_tag_t disjunction = 0xA1;
constexpr ber_tag_t negation = 0xA2;
constexpr ber_tag_t equality = 0xA3;
constexpr ber_tag_t substrings = 0xA4;
constexpr ber_tag_t greater_or_equal = 0xA5;
constexpr ber_tag_t less_or_equal = 0xA6;
constexpr ber_tag_t present = 0x87;
constexpr ber_tag_t approximate = 0xA8;
constexpr ber_tag_t extensible = 0xA9;

constexpr ber_tag_t initial_piece = 0x80;
constexpr ber_tag_t any_piece = 0x81;
constexpr ber_tag_t final_piece = 0x82;

constexpr ber_tag_t rule = 0x81;
constexpr ber_tag_t rule_type = 0x82;
constexpr ber_tag_t rule_value = 0x83;
constexpr ber_tag_t rule_dn_attributes = 0x84;
}  // namespace filter_tag

// Length that the first octet of a UTF-8 sequence announces; 1 for what cannot begin one.
std::size_t announced_length(unsigned char first) noexcept {
  if (first >= 0xF0) return 4;
  if (first >= 0xE0) return 3;
  return first >= 0xC0 ? 2 : 1;
}

void append_hex(std::string& text, unsigned char octet) {
  static constexpr char kDigits[] = "0123456789ABCDEF";
  text += '\\';
  text += kDigits[octet >> 4];
  text += kDigits[octet & 0x0F];
}

bool needs_escape(char c) noexcept {
  return c == '(' || c == ')' || c == '*' || c == '\\' || c == '\0';
}

class FilterWriter {
 public:
  FilterWriter(BerParser& parser, const FilterLimits& limits, std::string& text)
      : parser_(parser), limits_(limits), text_(text) {}

  FilterOutcome write(const Element& root) {
    if (!open(root)) return outcome_;
    while (!levels_.empty()) {
      if (!advance()) return outcome_;
    }
    return outcome_;
  }

 private:
  struct Level {
    std::string_view rest;  // elements not yet written
  };

  bool refuse(int code, const char* text) noexcept {
    outcome_ = {code, false, text};
    return false;
  }
  bool broken(const char* text) noexcept {
    outcome_ = {result::protocol_error, true, text};
    return false;
  }

  // Writes the next element of the innermost set, or closes the set.
  bool advance() {
    std::string_view& rest = levels_.back().rest;
    if (rest.empty()) {
      text_ += ')';
      levels_.pop_back();
      return true;
    }
    Element element;
    if (!parser_.take(rest, element)) return broken("malformed filter");
    return open(element);
  }

  bool count_item() noexcept {
    return ++items_ <= limits_.items || refuse(result::admin_limit_exceeded, "filter too large");
  }

  bool open(const Element& element) {
    if (!count_item()) return false;
    if (levels_.size() >= static_cast<std::size_t>(limits_.depth)) {
      return refuse(result::admin_limit_exceeded, "filter nested too deeply");
    }
    switch (element.tag) {
      case filter_tag::conjunction:
        return open_set(element, '&');
      case filter_tag::disjunction:
        return open_set(element, '|');
      case filter_tag::negation:
        return open_negation(element);
      case filter_tag::equality:
        return comparison(element, "=");
      case filter_tag::greater_or_equal:
        return comparison(element, ">=");
      case filter_tag::less_or_equal:
        return comparison(element, "<=");
      case filter_tag::approximate:
        return comparison(element, "~=");
      case filter_tag::substrings:
        return substrings(element);
      case filter_tag::present:
        return presence(element);
      case filter_tag::extensible:
        return extensible(element);
      default:
        return refuse(result::protocol_error, "unknown kind of filter");
    }
  }

  bool open_set(const Element& element, char sign) {
    if (element.contents.empty()) return refuse(result::protocol_error, "empty set in filter");
    text_ += '(';
    text_ += sign;
    levels_.push_back({element.contents});
    return true;
  }

  bool open_negation(const Element& element) {
    std::string_view rest = element.contents;
    Element negated;
    if (!parser_.take(rest, negated) || !rest.empty()) return broken("malformed filter");
    text_ += "(!";
    levels_.push_back({element.contents});
    return true;
  }

  bool take_text(std::string_view& rest, std::string_view& contents) noexcept {
    Element element;
    if (!parser_.take(rest, element) || element.tag != LBER_OCTETSTRING) {
      return broken("malformed filter item");
    }
    contents = element.contents;
    return true;
  }

  bool check_type(std::string_view type) noexcept {
    return is_attribute_description(type) ||
           refuse(result::protocol_error, "attribute description in filter not valid");
  }

  bool comparison(const Element& element, const char* sign) {
    std::string_view rest = element.contents;
    std::string_view type;
    std::string_view value;
    if (!take_text(rest, type) || !take_text(rest, value)) return false;
    if (!parser_.skip_extensions(rest)) return broken("malformed filter item");
    if (!check_type(type)) return false;
    text_ += '(';
    text_ += type;
    text_ += sign;
    append_escaped_value(text_, value);
    text_ += ')';
    return true;
  }

  bool presence(const Element& element) {
    if (!check_type(element.contents)) return false;
    text_ += '(';
    text_ += element.contents;
    text_ += "=*)";
    return true;
  }

  bool substrings(const Element& element) {
    std::string_view rest = element.contents;
    std::string_view type;
    Element pieces;
    if (!take_text(rest, type)) return false;
    if (!parser_.take(rest, pieces) || pieces.tag != LBER_SEQUENCE ||
        !parser_.skip_extensions(rest)) {
      return broken("malformed filter item");
    }
    if (!check_type(type)) return false;
    if (pieces.contents.empty()) return refuse(result::protocol_error, "empty substring assertion");
    text_ += '(';
    text_ += type;
    text_ += '=';
    if (!write_pieces(pieces.contents)) return false;
    text_ += ')';
    return true;
  }

  // A piece never follows a final one, an initial one only comes first, and none is empty: an empty
  // piece would have no spelling of its own in the text.
  bool write_pieces(std::string_view rest) {
    bool first = true;
    bool ended = false;
    while (!rest.empty()) {
      Element piece;
      if (!parser_.take(rest, piece)) return broken("malformed filter item");
      if (!count_item()) return false;
      if (!check_piece(piece, first, ended)) return false;
      if (piece.tag != filter_tag::initial_piece) text_ += '*';
      append_escaped_value(text_, piece.contents);
      ended = piece.tag == filter_tag::final_piece;
      first = false;
    }
    if (!ended) text_ += '*';
    return true;
  }

  bool check_piece(const Element& piece, bool first, bool ended) noexcept {
    const bool known = piece.tag == filter_tag::any_piece || piece.tag == filter_tag::final_piece ||
                       (piece.tag == filter_tag::initial_piece && first);
    if (!known || ended) return refuse(result::protocol_error, "substring pieces out of order");
    return !piece.contents.empty() || refuse(result::protocol_error, "empty substring piece");
  }

  struct RuleAssertion {
    std::string_view rule;
    std::string_view type;
    std::string_view value;
    bool has_rule = false;
    bool has_type = false;
    bool dn_attributes = false;
  };

  bool extensible(const Element& element) {
    RuleAssertion assertion;
    if (!read_rule_assertion(element.contents, assertion)) return false;
    if (!assertion.has_type && !assertion.has_rule) {
      return refuse(result::protocol_error, "matching without attribute and rule");
    }
    if (assertion.has_type && !check_type(assertion.type)) return false;
    if (assertion.has_rule && !is_oid(assertion.rule)) {
      return refuse(result::protocol_error, "matching rule in filter not valid");
    }
    text_ += '(';
    text_ += assertion.type;
    if (assertion.dn_attributes) text_ += ":dn";
    if (assertion.has_rule) (text_ += ':') += assertion.rule;
    text_ += ":=";
    append_escaped_value(text_, assertion.value);
    text_ += ')';
    return true;
  }

  // The components are told apart by their tags and come in ascending order of them; numbers beyond
  // the known ones are extensions.
  bool read_rule_assertion(std::string_view rest, RuleAssertion& assertion) noexcept {
    unsigned previous = 0;
    bool has_value = false;
    while (!rest.empty()) {
      Element component;
      if (!parser_.take(rest, component)) return broken("malformed filter item");
      const unsigned number = component.first_octet & 0x1FU;
      if (number <= previous) return broken("malformed filter item");
      previous = number;
      switch (component.tag) {
        case filter_tag::rule:
          assertion.rule = component.contents;
          assertion.has_rule = true;
          break;
        case filter_tag::rule_type:
          assertion.type = component.contents;
          assertion.has_type = true;
          break;
        case filter_tag::rule_value:
          assertion.value = component.contents;
          has_value = true;
          break;
        case filter_tag::rule_dn_attributes:
          if (!read_flag(component.contents, assertion.dn_attributes)) return false;
          break;
        default:
          if (number <= 4) return broken("malformed filter item");
      }
    }
    return has_value || broken("malformed filter item");
  }

  bool read_flag(std::string_view contents, bool& flag) noexcept {
    if (contents.size() != 1) return broken("malformed filter item");
    const auto octet = static_cast<unsigned char>(contents.front());
    if (octet != 0 && octet != 0xFF) {
      return refuse(result::protocol_error, "boolean is neither 00 nor FF");
    }
    flag = octet != 0;
    return true;
  }

  BerParser& parser_;
  const FilterLimits& limits_;
  std::string& text_;
  std::vector<Level> levels_;
  int items_ = 0;
  FilterOutcome outcome_;
};

}  // namespace

void append_escaped_value(std::string& text, std::string_view value) {
  while (!value.empty()) {
    const auto first = static_cast<unsigned char>(value.front());
    const std::string_view sequence = value.substr(0, announced_length(first));
    const bool raw = first < 0x80 ? !needs_escape(value.front()) : cfg::is_valid_utf8(sequence);
    if (raw) {
      text += sequence;
    } else {
      append_hex(text, first);
    }
    value.remove_prefix(raw ? sequence.size() : 1);
  }
}

FilterOutcome filter_to_text(BerParser& parser, const Element& element, const FilterLimits& limits,
                             std::string& text) {
  return FilterWriter(parser, limits, text).write(element);
}

}  // namespace orv::server
