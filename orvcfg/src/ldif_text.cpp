#include "ldif_text.h"

#include <algorithm>

#include "cfg/text.h"

namespace orv::orvcfg {

namespace {

bool is_blank(char c) {
  return c == ' ' || c == '\t';
}

// No control characters: what is shown may go to a terminal.
bool is_safe(char c) {
  const auto byte = static_cast<unsigned char>(c);
  return (byte >= 0x20 || c == '\t') && byte < 0x7F;
}

void append_folded(std::string& ldif, std::string_view line) {
  ldif.append(line.substr(0, kLineLength)).push_back('\n');
  for (std::size_t at = kLineLength; at < line.size(); at += kLineLength - 1) {
    ldif.append(" ").append(line.substr(at, kLineLength - 1)).push_back('\n');
  }
}

}  // namespace

bool is_safe_ldif_value(std::string_view value) {
  if (value.empty()) return true;
  const char first = value.front();
  return !is_blank(first) && first != ':' && first != '<' && !is_blank(value.back()) &&
         std::all_of(value.begin(), value.end(), is_safe);
}

bool append_ldif_line(std::string& ldif, std::string_view name, std::string_view value) {
  if (is_safe_ldif_value(value)) {
    ldif.append(name).append(": ").append(value).push_back('\n');
    return true;
  }
  std::string encoded;
  if (cfg::base64_encode(value, encoded) != 0) return false;
  ldif.append(name).append(":: ").append(encoded).push_back('\n');
  return true;
}

bool append_folded_ldif_line(std::string& ldif, std::string_view name, std::string_view value) {
  std::string line;
  if (!append_ldif_line(line, name, value)) return false;
  line.pop_back();
  append_folded(ldif, line);
  return true;
}

}  // namespace orv::orvcfg
