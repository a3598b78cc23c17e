#include "template.h"

#include "ldif_text.h"

namespace orv::orvcfg {

namespace {

void replace_word(std::string& text, std::string_view word, std::string_view replacement) {
  for (auto at = text.find(word); at != std::string::npos;
       at = text.find(word, at + replacement.size())) {
    text.replace(at, word.size(), replacement);
  }
}

// A line with a word to replace is written anew; every other line is kept byte for byte.
bool append_line(std::string& filled, std::string_view line, const TemplateValues& values) {
  const auto colon = line.find(": ");
  const bool has_word = line.find('@') != std::string_view::npos;
  if (!has_word || line.starts_with('#') || colon == std::string_view::npos) {
    filled.append(line).push_back('\n');
    return true;
  }
  std::string value(line.substr(colon + 2));
  replace_word(value, "@DIR@", values.directory);
  replace_word(value, "@ADMINPW@", values.admin_password);
  return append_ldif_line(filled, line.substr(0, colon), value);
}

}  // namespace

bool fill_template(std::string_view text, const TemplateValues& values, std::string& filled) {
  filled.clear();
  while (!text.empty()) {
    const auto end = text.find('\n');
    if (!append_line(filled, text.substr(0, end), values)) return false;
    if (end == std::string_view::npos) break;
    text.remove_prefix(end + 1);
  }
  return true;
}

}  // namespace orv::orvcfg
