#include "ops/log_text.h"

#include "cfg/text.h"
#include "logs.h"

namespace orv::server {
namespace {

bool continues(char c) noexcept {
  return (static_cast<unsigned char>(c) & 0xC0) == 0x80;
}

// Length of the character that begins the text; 0 when it is no UTF-8.
std::size_t character_length(std::string_view text) noexcept {
  std::size_t length = 1;
  while (length < text.size() && length < 4 && continues(text[length])) ++length;
  return cfg::is_valid_utf8(text.substr(0, length)) ? length : 0;
}

bool is_printable(std::string_view character) noexcept {
  const auto first = static_cast<unsigned char>(character.front());
  if (first < 0x80) return first >= 0x20 && first != 0x7F && first != '"';
  // U+0080 to U+009F: terminals take them for the beginning of a command.
  return first != 0xC2 || static_cast<unsigned char>(character[1]) >= 0xA0;
}

void append_escaped(std::string& line, std::string_view bytes) {
  constexpr char kHex[] = "0123456789ABCDEF";
  for (const char c : bytes) {
    const auto byte = static_cast<unsigned char>(c);
    line += '\\';
    line += kHex[byte >> 4];
    line += kHex[byte & 15];
  }
}

// Beside what is never shown as it is, `also`.
void append_text(std::string& line, std::string_view text, char also) {
  std::string_view rest = logged_part(text);
  const bool cut = rest.size() < text.size();
  line += '"';
  while (!rest.empty()) {
    const std::size_t length = character_length(rest);
    const std::string_view character = rest.substr(0, length == 0 ? 1 : length);
    if (length != 0 && is_printable(character) && character.front() != also)
      line += character;
    else
      append_escaped(line, character);
    rest.remove_prefix(character.size());
  }
  line += '"';
  if (!cut) return;
  line += "...(";
  append_number(line, static_cast<std::int64_t>(text.size()));
  line += " bytes)";
}

}  // namespace

std::string_view logged_part(std::string_view text) noexcept {
  if (text.size() <= kLoggedBytes) return text;
  std::size_t end = kLoggedBytes;
  while (end > kLoggedBytes - 3 && continues(text[end])) --end;
  return text.substr(0, end);
}

void append_client_text(std::string& line, std::string_view text) {
  append_text(line, text, '\\');
}

void append_normal_dn(std::string& line, std::string_view normal) {
  append_text(line, normal, '"');
}

}  // namespace orv::server
