#include "cfg/dn.h"

#include <sys/random.h>

#include <algorithm>
#include <array>
#include <cstring>
#include <optional>
#include <utility>

#include "cfg/result_codes.h"
#include "cfg/text.h"
#include "characters.h"
#include "dn_text.h"
#include "preparation.h"

namespace orv::cfg {

namespace {

// ---- Parser (RFC 4514, section 3; blanks around separators are allowed as in RFC 2253) ----

struct ParsedAva {
  std::string_view type;  // as spelled
  const KnownType* known = nullptr;
  std::string value;
};
using ParsedRdn = std::vector<ParsedAva>;
using ParsedDn = std::vector<ParsedRdn>;

bool is_escapable(char c) noexcept {
  return std::string_view(" \"#+,;<=>\\").find(c) != std::string_view::npos;
}

bool is_descriptor(std::string_view type) noexcept {
  if (type.empty() || !is_ascii_letter(type.front())) return false;
  return std::all_of(type.begin(), type.end(),
                     [](char c) { return is_ascii_letter(c) || is_ascii_digit(c) || c == '-'; });
}

// Two or more numbers without leading zeros, separated by dots (RFC 4512, 1.4).
bool is_numeric_oid(std::string_view type) noexcept {
  std::size_t numbers = 0;
  while (true) {
    std::size_t digits = 0;
    while (digits < type.size() && is_ascii_digit(type[digits])) ++digits;
    if (digits == 0 || (digits > 1 && type.front() == '0')) return false;
    ++numbers;
    if (digits == type.size()) return numbers >= 2;
    if (type[digits] != '.') return false;
    type.remove_prefix(digits + 1);
  }
}

void append_utf8(std::string& text, std::uint32_t c) {
  if (c < 0x80) {
    text += static_cast<char>(c);
  } else if (c < 0x800) {
    text += static_cast<char>(0xC0 | c >> 6);
    text += static_cast<char>(0x80 | (c & 0x3F));
  } else if (c < 0x10000) {
    text += static_cast<char>(0xE0 | c >> 12);
    text += static_cast<char>(0x80 | (c >> 6 & 0x3F));
    text += static_cast<char>(0x80 | (c & 0x3F));
  } else {
    text += static_cast<char>(0xF0 | c >> 18);
    text += static_cast<char>(0x80 | (c >> 12 & 0x3F));
    text += static_cast<char>(0x80 | (c >> 6 & 0x3F));
    text += static_cast<char>(0x80 | (c & 0x3F));
  }
}

// Big-endian characters of `width` bytes. Surrogates and values beyond Unicode are left for the
// UTF-8 check to find.
bool widen(std::string_view content, std::size_t width, std::string& value) {
  if (content.size() % width != 0) return false;
  for (std::size_t i = 0; i < content.size(); i += width) {
    std::uint32_t c = 0;
    for (std::size_t k = 0; k < width; ++k) c = c << 8 | static_cast<unsigned char>(content[i + k]);
    if (c > 0x10FFFF) return false;
    append_utf8(value, c);
  }
  return true;
}

// The content of a BER element that spans `ber` exactly (definite length).
std::optional<std::string_view> ber_content(std::string_view ber) noexcept {
  if (ber.size() < 2) return std::nullopt;
  const auto first = static_cast<unsigned char>(ber[1]);
  std::size_t length = first;
  std::size_t header = 2;
  if (first >= 0x80) {
    const std::size_t octets = first & 0x7F;
    if (octets == 0 || octets > 4 || ber.size() < 2 + octets) return std::nullopt;
    length = 0;
    for (std::size_t i = 0; i < octets; ++i) {
      length = length << 8 | static_cast<unsigned char>(ber[2 + i]);
    }
    header += octets;
  }
  if (ber.size() - header != length) return std::nullopt;
  return ber.substr(header);
}

// The text of a BER-encoded string type; false for anything else.
bool decode_ber_string(std::string_view ber, std::string& value) {
  const std::optional<std::string_view> content = ber_content(ber);
  if (!content) return false;
  switch (static_cast<unsigned char>(ber[0])) {
    case 0x04:  // OCTET STRING
    case 0x0C:  // UTF8String
      value = *content;
      return true;
    case 0x12:  // NumericString
    case 0x13:  // PrintableString
    case 0x16:  // IA5String
    case 0x1A:  // VisibleString
      value = *content;
      return is_all_ascii(value);
    case 0x14:  // TeletexString, in practice Latin-1
      return widen(*content, 1, value);
    case 0x1C:  // UniversalString
      return widen(*content, 4, value);
    case 0x1E:  // BMPString
      return widen(*content, 2, value);
    default:
      return false;
  }
}

class Parser {
 public:
  Parser(std::string_view text, DnText encoding) noexcept : text_(text), encoding_(encoding) {}

  bool run(ParsedDn& dn) {
    if (text_.size() > kMaxDnLength) return false;
    skip_blanks();
    if (at_end()) return true;
    do {
      if (dn.size() == kMaxRdns || !read_rdn(dn.emplace_back())) return false;
    } while (take(','));
    return at_end();
  }

 private:
  [[nodiscard]] bool at_end() const noexcept { return at_ == text_.size(); }
  [[nodiscard]] char peek() const noexcept { return text_[at_]; }

  void skip_blanks() noexcept {
    while (!at_end() && peek() == ' ') ++at_;
  }

  bool take(char c) noexcept {
    if (at_end() || peek() != c) return false;
    ++at_;
    return true;
  }

  bool read_rdn(ParsedRdn& rdn) {
    do {
      if (!read_ava(rdn.emplace_back())) return false;
    } while (take('+'));
    return true;
  }

  bool read_ava(ParsedAva& ava) {
    skip_blanks();
    if (!read_type(ava)) return false;
    skip_blanks();
    if (!take('=')) return false;
    skip_blanks();
    const bool read = !at_end() && peek() == '#' ? read_hex(ava.value) : read_string(ava.value);
    if (!read || ava.value.find('\0') != std::string::npos) return false;
    return encoding_ == DnText::any_code_page || is_valid_utf8(ava.value);
  }

  bool read_type(ParsedAva& ava) noexcept {
    const std::size_t start = at_;
    while (!at_end() && peek() != '=' && peek() != ' ') ++at_;
    ava.type = text_.substr(start, at_ - start);
    if (!is_descriptor(ava.type) && !is_numeric_oid(ava.type)) return false;
    ava.known = attribute_lookup().find(ava.type);
    return true;
  }

  bool read_hex(std::string& value) {
    ++at_;
    std::string ber;
    while (at_ + 1 < text_.size() && hex_digit(text_[at_]) >= 0 && hex_digit(text_[at_ + 1]) >= 0) {
      ber += static_cast<char>(hex_digit(text_[at_]) << 4 | hex_digit(text_[at_ + 1]));
      at_ += 2;
    }
    skip_blanks();
    if (!at_end() && peek() != ',' && peek() != '+') return false;
    return decode_ber_string(ber, value);
  }

  bool read_string(std::string& value) {
    std::size_t kept = 0;  // length up to the last character that is no unescaped blank
    while (!at_end() && peek() != ',' && peek() != '+') {
      const char c = text_[at_++];
      if (c == '\\') {
        if (!read_escape(value)) return false;
      } else if (c == '"' || c == ';' || c == '<' || c == '>') {
        return false;
      } else {
        value += c;
        if (c == ' ') continue;
      }
      kept = value.size();
    }
    value.resize(kept);
    return true;
  }

  bool read_escape(std::string& value) {
    if (at_end()) return false;
    if (is_escapable(peek())) {
      value += text_[at_++];
      return true;
    }
    if (at_ + 1 >= text_.size()) return false;
    const int high = hex_digit(text_[at_]);
    const int low = hex_digit(text_[at_ + 1]);
    if (high < 0 || low < 0) return false;
    value += static_cast<char>(high << 4 | low);
    at_ += 2;
    return true;
  }

  std::string_view text_;
  DnText encoding_;
  std::size_t at_ = 0;
};

// ---- Writer ----

void append_escaped(std::string& out, char c) {
  constexpr char kDigits[] = "0123456789ABCDEF";
  const auto byte = static_cast<unsigned char>(c);
  out += '\\';
  out += kDigits[byte >> 4];
  out += kDigits[byte & 15];
}

// Whether the character that starts at `at` is a control one: ASCII, or of U+0080 to U+009F.
bool is_control_at(std::string_view value, std::size_t at) noexcept {
  if (is_control(value[at])) return true;
  const auto byte = static_cast<unsigned char>(value[at]);
  if (byte == 0xC2 && at + 1 < value.size()) {
    return static_cast<unsigned char>(value[at + 1]) - 0x80U < 0x20U;
  }
  return false;
}

// Writes a value with everything escaped that stands in `specials` or could be misread.
void append_value(std::string& out, std::string_view value, std::string_view specials) {
  for (std::size_t i = 0; i < value.size(); ++i) {
    const char c = value[i];
    const bool at_edge = i == 0 || i + 1 == value.size();
    if (is_control_at(value, i)) {
      append_escaped(out, c);
      if (!is_ascii(c)) append_escaped(out, value[++i]);
    } else if ((c == ' ' && at_edge) || (c == '#' && i == 0) ||
               specials.find(c) != std::string_view::npos) {
      append_escaped(out, c);
    } else {
      out += c;
    }
  }
}

std::string normal_ava(const ParsedAva& ava) {
  std::string out;
  if (ava.known != nullptr) {
    out = ava.known->upper_name;
  } else {
    out = ava.type;
    for (char& c : out) c = ascii_upper(c);
  }
  out += '=';
  std::string value = prepare(ava.value, LetterCase::folded);
  fold_blanks(value);
  append_value(out, value, ",+\"\\<>;=");
  return out;
}

// Type, then value; not the texts as a whole, in which "=" would sort behind "-".
bool ava_before(const std::string& a, const std::string& b) {
  const std::size_t end_a = a.find('=');
  const std::size_t end_b = b.find('=');
  const int types = a.compare(0, end_a, b, 0, end_b);
  return types != 0 ? types < 0 : a.compare(end_a, std::string::npos, b, end_b) < 0;
}

void append_normal_rdn(std::string& out, const ParsedRdn& rdn) {
  std::vector<std::string> parts;
  parts.reserve(rdn.size());
  for (const ParsedAva& ava : rdn) parts.push_back(normal_ava(ava));
  std::sort(parts.begin(), parts.end(), &ava_before);
  for (const std::string& part : parts) {
    if (&part != &parts.front()) out += '+';
    out += part;
  }
}

// ---- Fast path ----

// What becomes of a byte of a plain value in the normal form; 0 for bytes that need the parser.
constexpr std::array<char, 256> kPlain = [] {
  std::array<char, 256> table{};
  for (int i = 0x20; i < 0x7F; ++i) {
    table[static_cast<std::size_t>(i)] = ascii_upper(static_cast<char>(i));
  }
  for (const char c : {'"', '+', ',', ';', '<', '=', '>', '\\'}) {
    table[static_cast<unsigned char>(c)] = 0;
  }
  return table;
}();

constexpr std::array<bool, 256> kTypeCharacter = [] {
  std::array<bool, 256> table{};
  for (int i = 0; i < 256; ++i) {
    const char c = static_cast<char>(i);
    table[static_cast<std::size_t>(i)] = is_ascii_letter(c) || is_ascii_digit(c) || c == '-';
  }
  return table;
}();

// Writes the type and its "=" to the start of `rdn.normal`; false when it does not fit.
bool write_type(std::string_view spelled, LeadingRdn& rdn) noexcept {
  if (rdn.spelled_length != 0 && spelled == std::string_view(rdn.spelled, rdn.spelled_length)) {
    return true;
  }
  rdn.spelled_length = 0;
  rdn.type = attribute_lookup().find(spelled);
  const std::string_view name = rdn.type != nullptr ? rdn.type->upper_name : spelled;
  if (name.size() + 1 > sizeof rdn.normal) return false;
  for (std::size_t i = 0; i < name.size(); ++i) rdn.normal[i] = ascii_upper(name[i]);
  rdn.normal[name.size()] = '=';
  rdn.value_at = name.size() + 1;
  if (spelled.size() <= sizeof rdn.spelled) {
    rdn.spelled_length = spelled.size();
    std::memcpy(rdn.spelled, spelled.data(), spelled.size());
  }
  return true;
}

// Reads the type and its "="; null when the full parser has to look.
const char* read_plain_type(const char* p, const char* end, LeadingRdn& rdn) noexcept {
  const char* const start = p;
  while (p != end && kTypeCharacter[static_cast<unsigned char>(*p)]) ++p;
  if (p == start || !is_ascii_letter(*start)) return nullptr;
  const std::string_view spelled(start, static_cast<std::size_t>(p - start));
  while (p != end && *p == ' ') ++p;
  if (p == end || *p != '=' || !write_type(spelled, rdn)) return nullptr;
  return p + 1;
}

bool normalize_plain(std::string_view text, std::string& normal) {
  if (text.size() > kMaxDnLength) return false;
  std::string out;
  out.reserve(text.size() + 16);
  LeadingRdn rdn;
  std::size_t count = 0;
  do {
    if (++count > kMaxRdns || !read_plain_rdn(text, rdn)) return false;
    if (!out.empty()) out += ',';
    out.append(rdn.normal, rdn.length);
    text = rdn.rest;
  } while (!rdn.last);
  normal = std::move(out);
  return true;
}

// ---- Hash ----

// Differs from process to process, so that nobody can prepare a file full of collisions.
std::uint64_t hash_seed() noexcept {
  static const std::uint64_t seed = [] {
    std::uint64_t value = 0x9E3779B97F4A7C15U;
    if (getrandom(&value, sizeof value, GRND_NONBLOCK) != sizeof value) value ^= 0x5851F42D4C957F2D;
    return value | 1;
  }();
  return seed;
}

std::uint64_t mix(std::uint64_t a, std::uint64_t b) noexcept {
  __extension__ using Wide = unsigned __int128;
  const Wide product = static_cast<Wide>(a) * b;
  return static_cast<std::uint64_t>(product) ^ static_cast<std::uint64_t>(product >> 64);
}

}  // namespace

bool read_plain_rdn(std::string_view text, LeadingRdn& rdn) noexcept {
  const char* p = text.data();
  const char* const end = p + text.size();
  while (p != end && *p == ' ') ++p;
  p = read_plain_type(p, end, rdn);
  if (p == nullptr) return false;
  while (p != end && *p == ' ') ++p;
  if (p != end && *p == '#') return false;
  const std::size_t room = sizeof rdn.normal - rdn.value_at;
  if (static_cast<std::size_t>(end - p) > room) {
    // Only the value has to fit, but its end is not known yet.
    if (std::memchr(p, ',', room) == nullptr) return false;
  }
  char* const start = rdn.normal + rdn.value_at;
  char* out = start;
  for (; p != end; ++p) {
    const char c = kPlain[static_cast<unsigned char>(*p)];
    if (c == 0) break;
    if (c == ' ' && out != start && out[-1] == ' ') continue;
    *out++ = c;
  }
  if (p != end && *p != ',') return false;
  if (out != start && out[-1] == ' ') --out;
  rdn.length = static_cast<std::size_t>(out - rdn.normal);
  rdn.last = p == end;
  if (!rdn.last) {
    ++p;
    while (p != end && *p == ' ') ++p;
  }
  rdn.rest = std::string_view(p, static_cast<std::size_t>(end - p));
  return true;
}

bool parse(std::string_view text, DnText encoding, Dn& dn) {
  ParsedDn parsed;
  if (!Parser(text, encoding).run(parsed)) return false;
  dn.clear();
  for (ParsedRdn& rdn : parsed) {
    Rdn& out = dn.emplace_back();
    for (ParsedAva& ava : rdn) {
      out.push_back(Ava{ava.known != nullptr ? ava.known->name : std::string(ava.type),
                        std::move(ava.value)});
    }
  }
  return true;
}

bool normalize(std::string_view text, DnText encoding, std::string& normal) {
  if (normalize_plain(text, normal)) return true;
  ParsedDn parsed;
  if (!Parser(text, encoding).run(parsed)) return false;
  std::string out;
  for (const ParsedRdn& rdn : parsed) {
    if (!out.empty()) out += ',';
    append_normal_rdn(out, rdn);
  }
  if (out.size() > kMaxDnLength) return false;
  normal = std::move(out);
  return true;
}

std::size_t leading_rdn_length(std::string_view normal) noexcept {
  std::size_t i = 0;
  while (i < normal.size() && normal[i] != ',') i += normal[i] == '\\' ? 2 : 1;
  return i < normal.size() ? i : normal.size();
}

std::uint32_t combine_dn_hash(std::uint32_t parent_hash, std::string_view normal_rdn) noexcept {
  const std::uint64_t seed = hash_seed();
  std::uint64_t hash = mix(parent_hash ^ seed, normal_rdn.size() ^ 0xD6E8FEB86659FD93U);
  const char* p = normal_rdn.data();
  std::size_t left = normal_rdn.size();
  for (; left >= 8; p += 8, left -= 8) {
    std::uint64_t word = 0;
    std::memcpy(&word, p, 8);
    hash = mix(hash ^ word, 0xA0761D6478BD642FU);
  }
  std::uint64_t tail = 0;
  std::memcpy(&tail, p, left);
  hash = mix(hash ^ tail, seed);
  return static_cast<std::uint32_t>(hash ^ hash >> 32);
}

std::uint32_t hash_normal_dn(std::string_view normal) noexcept {
  if (normal.empty()) return 0;
  std::array<std::string_view, kMaxRdns> rdns;
  std::size_t count = 0;
  while (!normal.empty() && count < rdns.size()) {
    const std::size_t length = leading_rdn_length(normal);
    rdns[count++] = normal.substr(0, length);
    normal.remove_prefix(length < normal.size() ? length + 1 : length);
  }
  std::uint32_t hash = 0;
  while (count > 0) hash = combine_dn_hash(hash, rdns[--count]);
  return hash;
}

// ---- Public functions ----

namespace {

std::string light_form(const ParsedDn& dn) {
  std::string out;
  for (const ParsedRdn& rdn : dn) {
    if (&rdn != &dn.front()) out += ',';
    for (const ParsedAva& ava : rdn) {
      if (&ava != &rdn.front()) out += '+';
      out += ava.type;
      out += '=';
      append_value(out, ava.value, ",+\"\\<>;");
    }
  }
  return out;
}

// `text` with each type spelled as its canonical name; the types are views into it.
std::string with_canonical_types(std::string_view text, const ParsedDn& dn) {
  std::string out;
  const char* copied = text.data();
  for (const ParsedRdn& rdn : dn) {
    for (const ParsedAva& ava : rdn) {
      if (ava.known == nullptr) continue;
      out.append(copied, ava.type.data());
      out += ava.known->name;
      copied = ava.type.data() + ava.type.size();
    }
  }
  out.append(copied, text.data() + text.size());
  return out;
}

}  // namespace

int parse_dn(std::string_view text, Dn& dn) noexcept try {
  Dn parsed;
  if (!parse(text, DnText::utf8, parsed)) return result::invalid_dn_syntax;
  dn = std::move(parsed);
  return result::success;
} catch (...) {
  return result::no_memory;
}

int normalize_dn(std::string_view text, std::string& normal) noexcept try {
  return normalize(text, DnText::utf8, normal) ? result::success : result::invalid_dn_syntax;
} catch (...) {
  return result::no_memory;
}

int normalize_dn_light(std::string_view text, std::string& light) noexcept try {
  ParsedDn parsed;
  if (!Parser(text, DnText::utf8).run(parsed)) return result::invalid_dn_syntax;
  light = light_form(parsed);
  return result::success;
} catch (...) {
  return result::no_memory;
}

int canonicalize_dn_types(std::string_view text, std::string& canonical) noexcept try {
  ParsedDn parsed;
  if (!Parser(text, DnText::utf8).run(parsed)) return result::invalid_dn_syntax;
  canonical = with_canonical_types(text, parsed);
  return result::success;
} catch (...) {
  return result::no_memory;
}

std::string_view parent_of_normal_dn(std::string_view normal) noexcept {
  const std::size_t length = leading_rdn_length(normal);
  return length < normal.size() ? normal.substr(length + 1) : std::string_view();
}

bool normal_dn_is_at_or_below(std::string_view normal, std::string_view ancestor) noexcept {
  if (ancestor.empty()) return true;
  while (normal.size() > ancestor.size()) normal = parent_of_normal_dn(normal);
  return normal == ancestor;
}

}  // namespace orv::cfg
