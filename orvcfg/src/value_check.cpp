#include "value_check.h"

#include <algorithm>
#include <charconv>
#include <iterator>
#include <optional>
#include <span>
#include <string_view>

#include "cfg/dn.h"
#include "cfg/text.h"
#include "config/setting_ranges.h"
#include "slapi/password_method.h"

namespace orv::orvcfg {

namespace {

// Numbers of syntaxes, RFC 4517, 3.3.
constexpr std::string_view kBoolean = "1.3.6.1.4.1.1466.115.121.1.7";
constexpr std::string_view kDn = "1.3.6.1.4.1.1466.115.121.1.12";
constexpr std::string_view kIa5String = "1.3.6.1.4.1.1466.115.121.1.26";
constexpr std::string_view kInteger = "1.3.6.1.4.1.1466.115.121.1.27";

// RFC 4517, 3.3.16: no blanks, no "+", no leading zeros. Numbers of any size.
bool is_integer(std::string_view text) {
  const bool negative = text.starts_with('-');
  if (negative) text.remove_prefix(1);
  if (text.empty() || (text.front() == '0' && (negative || text.size() > 1))) return false;
  return std::all_of(text.begin(), text.end(), [](char c) { return c >= '0' && c <= '9'; });
}

std::string integer_problem(const std::string& name, std::string_view value) {
  if (!is_integer(value)) return "is not an integer";
  for (const SettingRange& range : kSettingRanges) {
    if (range.name != name) continue;
    std::int64_t number = 0;
    const auto [end, status] = std::from_chars(value.data(), value.data() + value.size(), number);
    if (status == std::errc() && number >= range.minimum && number <= range.maximum) return "";
    return "must be an integer from " + std::to_string(range.minimum) + " to " +
           std::to_string(range.maximum);
  }
  return "";
}

std::string syntax_problem(const SchemaAttribute& type, const std::string& value) {
  const std::string_view syntax = std::string_view(type.syntax).substr(0, type.syntax.find('{'));
  if (syntax == kInteger) return integer_problem(type.names.front(), value);
  if (syntax == kBoolean) {
    return value == "TRUE" || value == "FALSE" ? "" : "is neither TRUE nor FALSE";
  }
  std::string normal;
  if (syntax == kDn) return cfg::normalize_dn(value, normal) == 0 ? "" : "is not a DN";
  const auto is_ascii = [](char c) { return static_cast<unsigned char>(c) < 0x80; };
  if (syntax == kIa5String && !std::all_of(value.begin(), value.end(), is_ascii)) {
    return "holds characters outside ASCII";
  }
  return "";
}

// Settings whose values are words.
struct Vocabulary {
  std::string_view name;
  std::span<const std::string_view> words;
};
constexpr Vocabulary kVocabularies[] = {{"orv-slapdLogLevel", kLogLevels},
                                        {"orv-slapdTlsClientCertificate", kClientCertificates},
                                        {"orv-slapdTlsMinimumVersion", kTlsVersions},
                                        {"orv-slapdSaslMechanisms", kSaslMechanisms},
                                        {"orv-slapdAdminRole", kAdminRoles}};

std::string word_problem(std::string_view name, const std::string& value) {
  if (name == "orv-slapdPwEncryption" || name == "orv-slapdPwEncryptionAllowed") {
    return password_method_problem(value);
  }
  for (const Vocabulary& known : kVocabularies) {
    if (known.name != name) continue;
    const auto is_value = [&](std::string_view word) {
      return cfg::equals_ignore_ascii_case(word, value);
    };
    if (std::any_of(known.words.begin(), known.words.end(), is_value)) return "";
    std::string problem = "is none of";
    for (const std::string_view word : known.words) problem.append(" ").append(word);
    return problem;
  }
  return "";
}

}  // namespace

std::string value_problem(const SchemaAttribute& type, const std::string& value) {
  std::string problem = syntax_problem(type, value);
  if (problem.empty()) problem = word_problem(type.names.front(), value);
  const bool is_path = std::find(std::begin(kPathSettings), std::end(kPathSettings),
                                 type.names.front()) != std::end(kPathSettings);
  if (problem.empty() && is_path && !value.starts_with('/')) {
    problem = "is not an absolute path";
  }
  if (problem.empty() && type.names.front() == "orv-slapdDigestRealm" && !is_digest_realm(value))
    problem = "is not 1 to 255 characters of ASCII without quotes and backslashes";
  return problem;
}

}  // namespace orv::orvcfg
