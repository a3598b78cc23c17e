#include "publish/match.h"

#include <algorithm>
#include <new>
#include <optional>
#include <string>
#include <vector>

#include "cfg/result_codes.h"
#include "slapi/schema.h"

namespace orv::server {
namespace {

enum class Truth { no, undefined, yes };

// ---- Items

// Finds the canonical attribute of the entry under whatever name the filter uses.
const attr* attribute_of(const entry& e, const std::string& type) {
  const std::string canonical(current_schema().canonical_attribute(type));
  return attr_find(&e, canonical.empty() ? type.c_str() : canonical.c_str(), 0, 0);
}

int hex_digit(char c) noexcept {
  if (c >= '0' && c <= '9') return c - '0';
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  return c >= 'A' && c <= 'F' ? c - 'A' + 10 : -1;
}

// A value without wildcards, its escapes undone; nothing when it has some or is malformed.
std::optional<std::string> plain_value(std::string_view text) {
  std::string value;
  for (std::size_t i = 0; i < text.size(); ++i) {
    if (text[i] == '*') return std::nullopt;
    if (text[i] != '\\') {
      value += text[i];
      continue;
    }
    if (i + 2 >= text.size()) return std::nullopt;
    const int high = hex_digit(text[i + 1]);
    const int low = hex_digit(text[i + 2]);
    if (high < 0 || low < 0) return std::nullopt;
    value += static_cast<char>(high * 16 + low);
    i += 2;
  }
  return value;
}

Truth equality(const entry& e, const std::string& type, std::string_view assertion) {
  std::optional<std::string> value = plain_value(assertion);
  if (!value || current_schema().attribute(type) == nullptr) return Truth::undefined;
  const attr* attribute = attribute_of(e, type);
  if (attribute == nullptr) return Truth::no;
  const berval counted{value->size(), value->data()};
  const int found = value_find(attribute, &counted, attribute->syntax, 1);
  if (found == result::no_memory) throw std::bad_alloc();
  return found == 0 ? Truth::yes : Truth::no;
}

// "type=value" and its relatives, without the parentheses.
Truth item(const entry& e, std::string_view text) {
  const std::size_t sign = text.find('=');
  if (sign == std::string_view::npos || sign == 0) return Truth::undefined;
  const std::string_view assertion = text.substr(sign + 1);
  std::string_view type = text.substr(0, sign);
  const char relation = type.back();
  if (relation == '<' || relation == '>' || relation == ':') return Truth::undefined;
  if (relation == '~') type.remove_suffix(1);
  if (relation != '~' && assertion == "*") {
    return attribute_of(e, std::string(type)) != nullptr ? Truth::yes : Truth::no;
  }
  return equality(e, std::string(type), assertion);
}

// ---- Sets

struct Set {
  char sign;    // & | !
  Truth truth;  // of the members so far
  int members = 0;
};

Truth negated(Truth truth) noexcept {
  if (truth == Truth::undefined) return truth;
  return truth == Truth::yes ? Truth::no : Truth::yes;
}

void join(Set& set, Truth member) noexcept {
  ++set.members;
  if (set.sign == '&') set.truth = std::min(set.truth, member);
  if (set.sign == '|') set.truth = std::max(set.truth, member);
  if (set.sign == '!') set.truth = negated(member);
}

// Walks the text with a stack of open sets, so that nesting costs no recursion.
class Evaluation {
 public:
  explicit Evaluation(const entry& e) : entry_(e) {}

  // Nothing when the text cannot be read.
  std::optional<Truth> of(std::string_view text) {
    rest_ = text;
    while (!rest_.empty() && !result_) {
      if (!(rest_.front() == ')' ? close() : open())) return std::nullopt;
    }
    return rest_.empty() ? result_ : std::nullopt;
  }

 private:
  bool open() {
    if (rest_.front() != '(' || rest_.size() < 2) return false;
    const char sign = rest_[1];
    if (sign == '&' || sign == '|' || sign == '!') {
      sets_.push_back({sign, sign == '&' ? Truth::yes : Truth::no});
      rest_.remove_prefix(2);
      return true;
    }
    const std::size_t end = rest_.find(')');
    if (end == std::string_view::npos) return false;
    const Truth truth = item(entry_, rest_.substr(1, end - 1));
    rest_.remove_prefix(end + 1);
    return finish(truth);
  }

  bool close() {
    if (sets_.empty() || sets_.back().members == 0) return false;
    const Truth truth = sets_.back().truth;
    sets_.pop_back();
    rest_.remove_prefix(1);
    return finish(truth);
  }

  bool finish(Truth truth) {
    if (sets_.empty()) {
      result_ = truth;
      return true;
    }
    join(sets_.back(), truth);
    return sets_.back().sign != '!' || sets_.back().members == 1;
  }

  const entry& entry_;
  std::string_view rest_;
  std::vector<Set> sets_;
  std::optional<Truth> result_;
};

}  // namespace

bool entry_matches(const entry& e, std::string_view filter) {
  return Evaluation(e).of(filter) == Truth::yes;
}

}  // namespace orv::server
