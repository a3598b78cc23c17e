#include "auth/digest_response.h"

#include <set>
#include <string>

namespace orv::server {
namespace {

constexpr std::string_view kSeparators = "()<>@,;:\\\"/[]?={}";

bool is_token_character(char c) noexcept {
  return c > ' ' && c < '\x7F' && kSeparators.find(c) == std::string_view::npos;
}

bool is_blank(char c) noexcept {
  return c == ' ' || c == '\t' || c == '\r' || c == '\n';
}

// Takes the text apart from its beginning on.
class Reader {
 public:
  explicit Reader(std::string_view text) : rest_(text) {}

  bool at_end() const noexcept { return rest_.empty(); }
  void skip_blanks() noexcept {
    while (!rest_.empty() && is_blank(rest_.front())) rest_.remove_prefix(1);
  }
  bool take(char c) noexcept {
    if (!rest_.starts_with(c)) return false;
    rest_.remove_prefix(1);
    return true;
  }
  std::string_view take_token() noexcept {
    std::size_t length = 0;
    while (length < rest_.size() && is_token_character(rest_[length])) ++length;
    const std::string_view token = rest_.substr(0, length);
    rest_.remove_prefix(length);
    return token;
  }
  // What follows the opening quote.
  bool skip_quoted() noexcept {
    while (!rest_.empty()) {
      const char c = rest_.front();
      rest_.remove_prefix(1);
      if (c == '"') return true;
      if (c == '\0') return false;
      if (c != '\\') continue;
      if (rest_.empty() || rest_.front() == '\0') return false;
      rest_.remove_prefix(1);
    }
    return false;
  }

 private:
  std::string_view rest_;
};

std::string in_lower_case(std::string_view name) {
  std::string lower(name);
  for (char& c : lower)
    if (c >= 'A' && c <= 'Z') c = static_cast<char>(c - 'A' + 'a');
  return lower;
}

}  // namespace

bool is_digest_response(std::string_view text) {
  Reader reader(text);
  std::set<std::string> names;
  for (;;) {
    // Empty elements may stand anywhere in a list.
    do reader.skip_blanks();
    while (reader.take(','));
    if (reader.at_end()) return !names.empty();
    const std::string_view name = reader.take_token();
    if (name.empty() || !names.insert(in_lower_case(name)).second) return false;
    reader.skip_blanks();
    if (!reader.take('=')) return false;
    reader.skip_blanks();
    if (reader.take('"') ? !reader.skip_quoted() : reader.take_token().empty()) return false;
    reader.skip_blanks();
    if (!reader.take(',') && !reader.at_end()) return false;
  }
}

}  // namespace orv::server
