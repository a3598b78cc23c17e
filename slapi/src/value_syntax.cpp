#include "slapi/value_syntax.h"

#include <algorithm>
#include <cstdint>
#include <new>
#include <string>

#include "cfg/attribute_table.h"
#include "cfg/dn.h"
#include "cfg/matching.h"
#include "cfg/result_codes.h"
#include "cfg/text.h"
#include "slapi/codepage.h"
#include "type_names.h"

namespace orv {
namespace {

// Null for a value that passes, else what is wrong with it. Throws std::bad_alloc.
using Test = const char* (*)(std::string_view value);

// ---- Characters ------------------------------------------------------------------------------

using slapi::is_digit;
using slapi::is_letter;

bool is_ascii(char c) noexcept {
  return static_cast<unsigned char>(c) < 0x80;
}

bool is_control(char c) noexcept {
  return static_cast<unsigned char>(c) < 0x20 || c == 0x7F;
}

bool is_hex_digit(char c) noexcept {
  return is_digit(c) || (c >= 'a' && c <= 'f') || (c >= 'A' && c <= 'F');
}

// PrintableCharacter of RFC 4517, 3.2.
bool is_printable(char c) noexcept {
  return is_digit(c) || is_letter(c) ||
         std::string_view("'()+,-./:? =").find(c) != std::string_view::npos;
}

template <typename Predicate>
bool all(std::string_view text, Predicate predicate) noexcept {
  return std::all_of(text.begin(), text.end(), predicate);
}

const char* unless(bool passes, const char* problem) noexcept {
  return passes ? nullptr : problem;
}

std::size_t count_characters(std::string_view utf8) noexcept {
  return static_cast<std::size_t>(std::count_if(utf8.begin(), utf8.end(), [](char c) {
    return (static_cast<unsigned char>(c) & 0xC0) != 0x80;
  }));
}

// ---- Syntaxes --------------------------------------------------------------------------------

const char* test_boolean(std::string_view value) {
  return unless(value == "TRUE" || value == "FALSE", "is neither TRUE nor FALSE");
}

const char* test_integer(std::string_view value) {
  const bool negative = value.starts_with('-');
  const std::string_view digits = value.substr(negative ? 1 : 0);
  const bool plain = !digits.empty() && all(digits, is_digit);
  const bool leading_zero = digits.starts_with('0') && (negative || digits.size() > 1);
  return unless(plain && !leading_zero, "is not an integer");
}

const char* test_dn(std::string_view value) {
  std::string normal;
  const int rc = cfg::normalize_dn(value, normal);
  if (rc == result::no_memory) throw std::bad_alloc();
  return unless(rc == result::success, "is not a DN");
}

const char* test_utf8(std::string_view value) {
  return unless(cfg::is_valid_utf8(value), "is not UTF-8");
}

const char* test_directory_string(std::string_view value) {
  return value.empty() ? "is empty" : test_utf8(value);
}

const char* test_ia5_string(std::string_view value) {
  return unless(all(value, is_ascii), "holds characters outside ASCII");
}

const char* test_octet_string(std::string_view /*value*/) {
  return nullptr;
}

const char* test_telephone_number(std::string_view value) {
  return unless(!value.empty() && all(value, is_printable), "is not a telephone number");
}

const char* test_country_string(std::string_view value) {
  return unless(value.size() == 2 && all(value, is_printable), "is not a country code");
}

const char* test_oid(std::string_view value) {
  return unless(slapi::is_descriptor(value) || slapi::is_numeric_oid(value),
                "is not an object identifier");
}

const char* test_generalized_time(std::string_view value) {
  std::string canonical;
  const int rc = cfg::canonical_value(cfg::MatchingRule::generalized_time, value, canonical);
  if (rc == result::no_memory) throw std::bad_alloc();
  const bool has_blank = value.find(' ') != std::string_view::npos;
  return unless(rc == result::success && !has_blank, "is not a time");
}

const char* test_uuid(std::string_view value) {
  constexpr std::string_view shape = "xxxxxxxx-xxxx-xxxx-xxxx-xxxxxxxxxxxx";
  bool fits = value.size() == shape.size();
  for (std::size_t i = 0; fits && i < shape.size(); ++i)
    fits = shape[i] == '-' ? value[i] == '-' : is_hex_digit(value[i]);
  return unless(fits, "is not a UUID");
}

struct Syntax {
  std::string_view oid;
  Test test;
};

constexpr Syntax kSyntaxes[] = {
    {"1.3.6.1.4.1.1466.115.121.1.7", test_boolean},
    {"1.3.6.1.4.1.1466.115.121.1.11", test_country_string},
    {"1.3.6.1.4.1.1466.115.121.1.12", test_dn},
    {"1.3.6.1.4.1.1466.115.121.1.15", test_directory_string},
    {"1.3.6.1.4.1.1466.115.121.1.24", test_generalized_time},
    {"1.3.6.1.4.1.1466.115.121.1.26", test_ia5_string},
    {"1.3.6.1.4.1.1466.115.121.1.27", test_integer},
    {"1.3.6.1.4.1.1466.115.121.1.38", test_oid},
    {"1.3.6.1.4.1.1466.115.121.1.40", test_octet_string},
    {"1.3.6.1.4.1.1466.115.121.1.50", test_telephone_number},
    {"1.3.6.1.1.16.1", test_uuid},
};

Test test_of_syntax(std::string_view oid) noexcept {
  for (const Syntax& known : kSyntaxes)
    if (known.oid == oid) return known.test;
  return test_utf8;
}

// ---- Single types ----------------------------------------------------------------------------

const char* test_not_empty(std::string_view value) {
  return unless(!value.empty(), "is empty");
}

// Blanks alone are the empty DN too.
const char* test_named_dn(std::string_view value) {
  std::string normal;
  if (cfg::normalize_dn(value, normal) == result::no_memory) throw std::bad_alloc();
  return unless(!normal.empty(), "is the empty DN");
}

// "cn" with nothing after it is not reached: the syntax came first.
const char* test_light_spelling(std::string_view value) {
  std::string light;
  const int rc = cfg::normalize_dn_light(value, light);
  if (rc == result::no_memory) throw std::bad_alloc();
  const std::size_t equals = value.find('=');
  const bool named = equals != std::string_view::npos && equals + 1 < value.size();
  return unless(named && rc == result::success && cfg::equals_ignore_ascii_case(light, value),
                "is not spelled in its plain form");
}

struct CharacterRange {
  std::uint32_t first;
  std::uint32_t last;
};

// What names may not hold (RFC 4013, 2.3) and the preparation of values lets through: controls,
// private use, characters that stand for nothing. Non-characters are beyond.
constexpr CharacterRange kNotInNames[] = {
    {0x00, 0x1F},       {0x7F, 0x9F},       {0x0340, 0x0341},    {0x06DD, 0x06DD}, {0x070F, 0x070F},
    {0x2028, 0x2029},   {0x2FF0, 0x2FFB},   {0xE000, 0xF8FF},    {0xFDD0, 0xFDEF}, {0xFFF9, 0xFFFF},
    {0x1D173, 0x1D17A}, {0xE0000, 0xE007F}, {0xF0000, 0x10FFFF},
};

// Of valid UTF-8; takes the character off the text.
std::uint32_t take_character(std::string_view& utf8) noexcept {
  const auto lead = static_cast<unsigned char>(utf8.front());
  const std::size_t length = lead < 0x80 ? 1 : lead < 0xE0 ? 2 : lead < 0xF0 ? 3 : 4;
  std::uint32_t character = length == 1 ? lead : lead & (0xFFU >> (length + 1));
  for (std::size_t i = 1; i < length; ++i)
    character = (character << 6) | (static_cast<unsigned char>(utf8[i]) & 0x3FU);
  utf8.remove_prefix(length);
  return character;
}

bool may_be_in_names(std::uint32_t character) noexcept {
  return std::none_of(std::begin(kNotInNames), std::end(kNotInNames),
                      [character](const CharacterRange& range) {
                        return character >= range.first && character <= range.last;
                      }) &&
         (character & 0xFFFE) != 0xFFFE;
}

const char* test_stable_name(std::string_view value) {
  constexpr const char* kProblem = "is not in the form in which names are prepared";
  std::string prepared;
  const int rc = cfg::canonical_value(cfg::MatchingRule::case_exact, value, prepared);
  if (rc == result::no_memory) throw std::bad_alloc();
  if (rc != result::success || prepared != value) return kProblem;
  while (!value.empty())
    if (!may_be_in_names(take_character(value))) return kProblem;
  return nullptr;
}

const char* test_absolute_path(std::string_view value) {
  return unless(value.starts_with('/') && std::none_of(value.begin(), value.end(), is_control),
                "is not an absolute path");
}

// Rules compare these as the client wrote them with what the file holds in its own code page.
const char* test_ascii_in_other_code_pages(std::string_view value) {
  return unless(local_code_page_is_utf8() || all(value, is_ascii),
                "holds characters outside ASCII, and the file is not in UTF-8");
}

struct TypeTest {
  std::string_view type;
  Test test;
};

constexpr TypeTest kTypeTests[] = {
    {"orv-slapdAdminDN", test_named_dn},
    {"orv-slapdMasterDN", test_named_dn},
    {"orv-slapdKrbAdminDN", test_light_spelling},
    {"orv-slapdDigestAdminUser", test_stable_name},
    {"orv-slapdAdminPW", test_not_empty},
    {"orv-slapdMasterPW", test_not_empty},
    {"orv-slapdLog", test_absolute_path},
    {"orv-slapdLocalSocket", test_absolute_path},
    {"orv-slapdTlsCertificateFile", test_absolute_path},
    {"orv-slapdTlsKeyFile", test_absolute_path},
    {"orv-slapdTlsCaFile", test_absolute_path},
    {"orv-slapdTlsCrlFile", test_absolute_path},
    {"orv-slapdKrbKeytab", test_absolute_path},
    {"orv-slapdLog", test_ascii_in_other_code_pages},
    {"orv-slapdPtaSubtree", test_ascii_in_other_code_pages},
};

const char* test_of_type(std::string_view type, std::string_view value) {
  for (const TypeTest& known : kTypeTests) {
    if (known.type != type) continue;
    if (const char* const problem = known.test(value); problem != nullptr) return problem;
  }
  return nullptr;
}

// ---- The whole -------------------------------------------------------------------------------

const char* problem_of(const SchemaAttribute& type, std::string_view value) {
  if (value.find('\0') != std::string_view::npos) return "holds a NUL byte";
  if (const char* const problem = test_of_syntax(type.syntax)(value); problem != nullptr)
    return problem;
  return test_of_type(type.names.front(), value);
}

bool is_too_long(const SchemaAttribute& type, std::string_view value) noexcept {
  return type.max_characters != 0 && count_characters(value) > type.max_characters;
}

}  // namespace

int check_value(const SchemaAttribute& type, std::string_view value, const char** problem) noexcept
    try {
  const char* found = problem_of(type, value);
  int code = found == nullptr ? result::success : result::invalid_attribute_syntax;
  if (found == nullptr && is_too_long(type, value)) {
    found = "is longer than its type allows";
    code = result::constraint_violation;
  }
  if (problem != nullptr && found != nullptr) *problem = found;
  return code;
} catch (...) {
  return result::no_memory;
}

}  // namespace orv
