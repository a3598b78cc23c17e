#include "ldif_index.h"

#include <algorithm>
#include <array>
#include <cstring>
#include <utility>

#include "attribute_lookup.h"
#include "cfg/text.h"
#include "characters.h"
#include "dn_text.h"
#include "local_text.h"
#include "object_class_lookup.h"

namespace orv::cfg {

// ---- Hash table ----

std::string_view LdifIndex::dn(std::uint32_t entry, std::string& scratch) const {
  LineReader reader = lines(entry);
  std::string_view plain;
  if (reader.pass_plain_dn(plain)) return plain;
  AttributeLine line;
  reader.next(line);
  if (line.kind == ValueKind::plain && !line.folded) {
    // The line may lie in the reader's own memory, which ends with it.
    const char* const p = line.value.data();
    if (p < text_->begin() || p > text_->end()) {
      scratch = line.value;
      return scratch;
    }
  }
  return decoded(line, scratch);
}

std::size_t LdifIndex::line(std::uint32_t entry) const noexcept {
  const char* const begin = text_->begin();
  return 1 + static_cast<std::size_t>(std::count(begin, begin + entries()[entry].offset, '\n'));
}

bool LdifIndex::has_dn(std::uint32_t entry, std::string_view normal_dn) const {
  std::string scratch;
  const std::string_view spelled = dn(entry, scratch);
  if (spelled == normal_dn) return true;
  std::string normal;
  return normalize_local(spelled, normal) && normal == normal_dn;
}

std::uint32_t LdifIndex::find(std::string_view normal_dn, std::uint32_t hash) const {
  if (table_size_ == 0) return kNone;
  const std::uint32_t mask = table_size_ - 1;
  for (std::uint32_t at = hash & mask; table()[at] != kNone; at = (at + 1) & mask) {
    const std::uint32_t entry = table()[at];
    if (entries()[entry].hash == hash && has_dn(entry, normal_dn)) return entry;
  }
  return kNone;
}

std::uint32_t LdifIndex::find(std::string_view normal_dn) const {
  if (normal_dn.empty()) return kNone;
  return find(normal_dn, hash_normal_dn(normal_dn));
}

void LdifIndex::grow_table() {
  table_size_ = table_size_ == 0 ? 64 : table_size_ * 2;
  table_.reserve(table_size_ * sizeof(std::uint32_t), 0);
  std::memset(table_.data(), 0xFF, table_size_ * sizeof(std::uint32_t));
  const std::uint32_t mask = table_size_ - 1;
  for (std::uint32_t i = 0; i < size_; ++i) {
    std::uint32_t at = entries()[i].hash & mask;
    while (table()[at] != kNone) at = (at + 1) & mask;
    table()[at] = i;
  }
}

bool LdifIndex::append(const Entry& entry, std::string_view dn, std::uint32_t& existing) {
  if (size_ >= table_size_ / 4 * 3) grow_table();
  const std::uint32_t mask = table_size_ - 1;
  std::uint32_t at = entry.hash & mask;
  std::string normal;
  for (; table()[at] != kNone; at = (at + 1) & mask) {
    existing = table()[at];
    if (entries()[existing].hash != entry.hash) continue;
    if (normal.empty()) normalize_local(dn, normal);
    if (has_dn(existing, normal)) return false;
  }
  const std::size_t used = size_ * sizeof(Entry);
  if (used + sizeof(Entry) > entries_.capacity()) {
    // Growing by a quarter bounds what an entry costs in the index.
    entries_.reserve(std::max(used + used / 4, std::size_t{64} * sizeof(Entry)), used);
  }
  entries()[size_] = entry;
  table()[at] = size_++;
  return true;
}

// ---- Checks ----

namespace {

constexpr const char* kNoEntries = "the file holds no entries";
constexpr const char* kNulByte = "a NUL byte in the file";
constexpr const char* kLoneCarriageReturn = "a carriage return that does not end a line";
constexpr const char* kNothingToContinue =
    "a line begins with a blank, but there is no line before it to continue";
constexpr const char* kNoColon = "the line has no colon behind an attribute name";
constexpr const char* kBadName = "the attribute name is not well formed";
constexpr const char* kOption = "attribute options are not allowed";
constexpr const char* kUrl = "values given as a URL are not allowed";
constexpr const char* kChangeRecord = "change records are not allowed, only entries";
constexpr const char* kBadBase64 = "the base64 value is damaged or cut short";
constexpr const char* kBase64Nul = "the base64 value holds a NUL byte";
constexpr const char* kNoDnLine = "an entry must begin with a \"dn:\" line";
constexpr const char* kSecondDn =
    "a second \"dn:\" line in one entry: the blank line between entries is missing";
constexpr const char* kBadDn = "the DN is not well formed";
constexpr const char* kNotInCodePage = "the DN holds bytes that are no text of the code page";
constexpr const char* kEmptyDn = "the DN is empty";
constexpr const char* kNoParent = "no entry before this one has the DN of its parent";
constexpr const char* kNoAttributes = "the entry has no attributes, it may be cut short";
constexpr const char* kCutShort =
    "the last line does not end with a newline, the file may be cut short";
constexpr const char* kSecretSpelling =
    "a secret attribute is given under another name than its own";
constexpr const char* kSecretInDn = "a secret attribute in a DN";
constexpr const char* kVersion = "only version 1 of LDIF is known";
constexpr const char* kClassSpelling = "the object class must be written as ";

constexpr std::string_view kObjectClass = "objectClass";

bool is_name(std::string_view text, std::string_view name) noexcept {
  return text.size() == name.size() && equals_ignore_ascii_case(text, name);
}

// Where byte `offset` of the unfolded value stands in the text.
const char* folded_position(std::string_view value, std::size_t offset) noexcept {
  const char* p = value.data();
  const char* const end = p + value.size();
  while (p < end) {
    const bool line_end = *p == '\n' || (*p == '\r' && p + 1 < end && p[1] == '\n');
    if (line_end) {
      p += *p == '\r' ? 3 : 2;
    } else if (offset-- == 0) {
      break;
    } else {
      ++p;
    }
  }
  return p;
}

}  // namespace

// ---- The pass ----

class LdifIndex::Builder {
 public:
  Builder(LdifIndex& index, const FileText& text, FileFault& fault) noexcept
      : index_(index),
        text_(text),
        fault_(fault),
        start_(text.begin() + (has_mark(text) ? kByteOrderMark.size() : 0)),
        lookup_(attribute_lookup()),
        classes_(object_class_lookup()),
        object_class_(lookup_.find(kObjectClass)),
        reader_(start_, text.end()) {}

  bool run() {
    if (start_ == text_.end()) return refuse_file("the file is empty");
    skip_between_entries();
    if (!at_end() && !check_version()) return false;
    while (skip_between_entries(), !at_end()) {
      if (!check_bytes() || !read_entry()) return false;
    }
    if (!check_bytes() || !check_last_line()) return false;
    if (index_.size_ == 0) return refuse_file(kNoEntries);
    return true;
  }

 private:
  // What is known of the DN read last and of those above it, so that an entry below one of them,
  // which nearly all entries of a file are, needs no more than its own RDN looked at.
  struct Neighbour {
    std::string_view dn;  // as spelled, in the text; empty when there is none
    std::uint32_t entry = kNone;
    std::size_t depth = 0;
  };

  static bool has_mark(const FileText& text) noexcept {
    return std::string_view(text.begin(), text.size()).substr(0, kByteOrderMark.size()) ==
           kByteOrderMark;
  }

  [[nodiscard]] bool at_end() const noexcept { return reader_.position() >= text_.end(); }

  // The types that have to be looked at: those with a meaning of their own, secrets, and the one
  // whose values are names.
  [[nodiscard]] NameFilter special_names() const noexcept {
    NameFilter names = lookup_.secret_aliases();
    for (const std::string_view name : {kDnName, kChangeTypeName, kControlName, kObjectClass})
      names.add(name);
    if (object_class_ != nullptr) {
      for (const std::string& alias : object_class_->aliases) names.add(alias);
    }
    return names;
  }

  // -- Refusals --

  bool refuse(const char* at, std::string cause) {
    if (at > text_.end()) at = text_.end();
    fault_.cause = std::move(cause);
    fault_.line = 1 + static_cast<std::size_t>(std::count(start_, at, '\n'));
    fault_.column = 1 + static_cast<std::size_t>(at - line_begin(at));
    return false;
  }

  // The beginning of the physical line that `at` stands in or behind.
  const char* line_begin(const char* at) const noexcept {
    while (at > start_ && at[-1] != '\n') --at;
    return at;
  }

  bool refuse_file(const char* cause) {
    fault_ = FileFault{cause, 0, 0};
    return false;
  }

  // -- The file as bytes --

  // Looks for bytes that must not be in the file, a piece ahead of the reader: what was just looked
  // through is in the processor's cache when the lines are read.
  bool check_bytes() {
    constexpr std::ptrdiff_t kPiece = 32 * 1024;
    while (checked_ < text_.end() && checked_ <= reader_.position()) {
      const char* const stop = checked_ + std::min(kPiece, text_.end() - checked_);
      if (!check_piece(checked_, stop)) return false;
      checked_ = stop;
    }
    return true;
  }

  bool check_piece(const char* p, const char* stop) {
    const void* nul = std::memchr(p, '\0', static_cast<std::size_t>(stop - p));
    if (nul != nullptr) return refuse(static_cast<const char*>(nul), kNulByte);
    while (p < stop) {
      const void* found = std::memchr(p, '\r', static_cast<std::size_t>(stop - p));
      if (found == nullptr) return true;
      p = static_cast<const char*>(found) + 1;
      if (p == text_.end() || *p != '\n') return refuse(p - 1, kLoneCarriageReturn);
    }
    return true;
  }

  // A comment may lack its newline; whatever carries meaning may not.
  bool check_last_line() {
    const char* const end = text_.end();
    if (end[-1] == '\n' || last_line_is_comment_) return true;
    return refuse(end, kCutShort);
  }

  // -- Between entries --

  void skip_between_entries() noexcept {
    while (!at_end()) {
      const char* const p = reader_.position();
      last_line_is_comment_ = *p == '#';
      if (*p == '#') {
        reader_.skip_comment();
      } else if (*p == '\n' || (*p == '\r' && p[1] == '\n')) {
        reader_.skip_blank_line();
      } else {
        break;
      }
    }
  }

  bool check_version() {
    const LineReader saved = reader_;
    const char* const at = reader_.position();
    if (*at == ' ') return refuse(at, kNothingToContinue);
    AttributeLine line;
    reader_.next(line);
    if (!line.has_colon || !is_name(line.type, "version")) {
      reader_ = saved;
      return true;
    }
    if (line.kind != ValueKind::plain || line.folded || line.value != "1") {
      return refuse(at, kVersion);
    }
    return true;
  }

  // -- One entry --

  bool read_entry() {
    const char* const at = reader_.position();
    last_line_is_comment_ = false;
    std::string_view dn;
    if (reader_.pass_plain_dn(dn)) {
      if (!index_dn(at, dn.data(), dn, true)) return false;
    } else if (!read_unusual_dn(at)) {
      return false;
    }
    return read_attributes(at);
  }

  bool read_attributes(const char* entry_at) {
    const NameFilter special = special_names_;
    const ObjectClassLookup& classes = classes_;
    const auto plain = [&special, &classes](std::string_view type, std::string_view value) {
      if (type.empty() || !is_ascii_letter(type.front())) return false;
      if (!special.may_hold(type)) return true;
      return type == kObjectClass && classes.is_surely_own_name(plain_value(value));
    };
    std::size_t attributes = 0;
    AttributeLine line;
    while (true) {
      attributes += reader_.pass_plain_lines(plain);
      const char* const before = reader_.position();
      if (!reader_.next(line)) break;
      if (!check_line(before, line, attributes == 0)) return false;
      ++attributes;
    }
    if (at_end()) note_trailing_comment();
    return attributes > 0 || refuse(entry_at, kNoAttributes);
  }

  // `next` skips comments silently; at the end of the text it matters whether one stood last.
  void note_trailing_comment() noexcept {
    const char* const end = text_.end();
    if (end[-1] == '\n') return;
    const char* p = line_begin(end);
    while (*p == ' ' && p > start_) p = line_begin(p - 1);
    last_line_is_comment_ = *p == '#';
  }

  bool check_line(const char* at, const AttributeLine& line, bool first) {
    if (!check_type(at, line)) return false;
    if (is_name(line.type, kDnName)) return refuse(line_start(at), kSecondDn);
    if (is_name(line.type, kChangeTypeName)) return refuse(line_start(at), kChangeRecord);
    if (first && is_name(line.type, kControlName)) return refuse(line_start(at), kChangeRecord);
    if (line.kind != ValueKind::plain && !check_encoded(at, line)) return false;
    return !is_object_class(line.type) || check_class(at, line);
  }

  bool check_type(const char* at, const AttributeLine& line) {
    if (!line.has_colon) return refuse(line_start(at), kNoColon);
    if (!is_attribute_name(line.type)) {
      const std::size_t option = line.type.find(';');
      if (option != std::string_view::npos) return refuse(line_start(at) + option, kOption);
      return refuse(line_start(at), kBadName);
    }
    if (!lookup_.secret_aliases().may_hold(line.type)) return true;
    const KnownType* known = lookup_.find(line.type);
    if (known != nullptr && known->secret && !equals_ignore_ascii_case(known->name, line.type)) {
      return refuse(line_start(at), kSecretSpelling);
    }
    return true;
  }

  bool check_encoded(const char* at, const AttributeLine& line) {
    const char* const start = line_start(at);
    if (line.kind == ValueKind::url) return refuse(start + line.type.size(), kUrl);
    std::string scratch;
    std::string_view value;
    std::size_t error_at = 0;
    if (!decode_value(line, scratch, value, error_at)) {
      return refuse(value_position(start, line, error_at), kBadBase64);
    }
    if (value.find('\0') != std::string_view::npos) {
      return refuse(value_position(start, line, 0), kBase64Nul);
    }
    return true;
  }

  // -- Object classes --

  [[nodiscard]] bool is_object_class(std::string_view type) const noexcept {
    return object_class_ != nullptr ? is_name_of(*object_class_, type)
                                    : is_name(type, kObjectClass);
  }

  // Of what stands behind the colon of a plain line.
  static std::string_view plain_value(std::string_view rest) noexcept {
    while (!rest.empty() && rest.front() == ' ') rest.remove_prefix(1);
    if (!rest.empty() && rest.back() == '\r') rest.remove_suffix(1);
    return rest;
  }

  bool check_class(const char* at, const AttributeLine& line) {
    std::string scratch;
    const std::string* const name = classes_.required_name(decoded(line, scratch));
    if (name == nullptr) return true;
    return refuse(value_position(line_start(at), line, 0), kClassSpelling + *name);
  }

  // The start of the content line that was read from `at` on, behind comments.
  const char* line_start(const char* at) const noexcept {
    LineReader reader(at, text_.end());
    while (reader.position() < text_.end() && *reader.position() == '#') reader.skip_comment();
    return reader.position();
  }

  // Where a byte of a line's unfolded value stands in the text. A line that is folded before its
  // value was joined elsewhere; then the line itself has to do.
  const char* value_position(const char* start, const AttributeLine& line,
                             std::size_t offset) const noexcept {
    const char* const p = line.value.data();
    if (p < text_.begin() || p > text_.end()) return start;
    return line.folded ? folded_position(line.value, offset) : p + offset;
  }

  // -- DNs --

  // A first line that is folded, encoded, spelled otherwise or no "dn:" line at all.
  bool read_unusual_dn(const char* at) {
    if (*at == ' ') return refuse(at, kNothingToContinue);
    AttributeLine line;
    reader_.next(line);
    if (!line.has_colon || !is_name(line.type, kDnName)) return refuse(at, kNoDnLine);
    if (line.kind == ValueKind::url) return refuse(at + line.type.size(), kUrl);
    std::string scratch;
    std::string_view dn;
    std::size_t error_at = 0;
    if (!decode_value(line, scratch, dn, error_at)) {
      return refuse(value_position(at, line, error_at), kBadBase64);
    }
    if (dn.find('\0') != std::string_view::npos) return refuse(at, kBase64Nul);
    const bool plain = line.kind == ValueKind::plain && !line.folded && is_in_text(dn);
    return index_dn(at, value_position(at, line, 0), dn, plain);
  }

  [[nodiscard]] bool is_in_text(std::string_view view) const noexcept {
    return view.data() >= text_.begin() && view.data() <= text_.end();
  }

  bool index_dn(const char* at, const char* dn_at, std::string_view dn, bool plain) {
    Entry entry{static_cast<std::uint32_t>(at - text_.begin()), 0, kNone};
    Neighbour parent;
    if (plain && index_.size_ > 0 && dn.size() <= kMaxDnLength && is_same_in_utf8(dn) &&
        read_plain_rdn(dn, rdn_) && find_parent_on_path(rdn_, parent)) {
      if (is_secret(rdn_.type)) return refuse(dn_at, kSecretInDn);
      entry.parent = parent.entry;
      entry.hash = combine_dn_hash(index_.entries()[parent.entry].hash,
                                   std::string_view(rdn_.normal, rdn_.length));
    } else if (!place(dn_at, dn, entry, parent)) {
      return false;
    }
    std::uint32_t existing = kNone;
    if (!index_.append(entry, dn, existing)) {
      return refuse(dn_at, "line " + std::to_string(index_.line(existing)) +
                               " has an entry with the same DN");
    }
    extend_path(parent, {plain ? dn : std::string_view(), index_.size_ - 1, parent.depth + 1});
    return true;
  }

  // Whether what a plain RDN may hold means the same in UTF-8. Some code pages have an overline in
  // the place of the tilde; their currency sign in the place of the backslash is never plain.
  [[nodiscard]] bool is_same_in_utf8(std::string_view dn) const noexcept {
    return !decodes_ || dn.find('~') == std::string_view::npos;
  }

  // Shortens the path to the parent when it is there.
  bool find_parent_on_path(const LeadingRdn& rdn, Neighbour& parent) noexcept {
    if (rdn.last || rdn.rest.empty()) return false;
    for (std::size_t i = path_length_; i-- > 0;) {
      if (path_[i].dn != rdn.rest || path_[i].depth >= kMaxRdns) continue;
      parent = path_[i];
      path_length_ = i + 1;
      return true;
    }
    return false;
  }

  // Puts an entry behind its parent, with which a path begins anew that does not end there or is
  // too long.
  void extend_path(const Neighbour& parent, const Neighbour& entry) noexcept {
    const bool goes_on = path_length_ > 0 && path_length_ < path_.size() &&
                         path_[path_length_ - 1].entry == parent.entry;
    if (!goes_on) {
      path_[0] = parent;
      path_length_ = 1;
    }
    path_[path_length_++] = entry;
  }

  // The long way: the whole DN in normal form.
  bool place(const char* dn_at, std::string_view dn, Entry& entry, Neighbour& parent) {
    std::string normal;
    if (!normalize_local(dn, normal)) {
      return refuse(dn_at, is_local_text(dn) ? kBadDn : kNotInCodePage);
    }
    if (normal.empty()) return refuse(dn_at, kEmptyDn);
    LeadingRdn rdn;
    const bool plain = read_plain_rdn(dn, rdn);
    // What is above any other entry was looked at with its parent.
    const bool leading_is_enough = plain && index_.size_ > 0;
    if (leading_is_enough ? is_secret(rdn.type) : names_secret(dn))
      return refuse(dn_at, kSecretInDn);
    const std::string_view above = parent_of_normal_dn(normal);
    const std::uint32_t above_hash = hash_normal_dn(above);
    entry.hash =
        combine_dn_hash(above_hash, std::string_view(normal).substr(0, leading_rdn_length(normal)));
    parent = Neighbour{};
    parent.depth = depth_of(above);
    if (index_.size_ == 0) return true;
    entry.parent = above.empty() ? kNone : index_.find(above, above_hash);
    if (entry.parent == kNone) {
      // A second entry with the DN of the first is told apart when it is appended.
      if (index_.find(normal, entry.hash) == kNone) return refuse(dn_at, kNoParent);
    }
    parent.entry = entry.parent;
    if (plain && is_in_text(dn) && !rdn.last) parent.dn = rdn.rest;
    return true;
  }

  static std::size_t depth_of(std::string_view normal) noexcept {
    std::size_t depth = 0;
    for (; !normal.empty(); normal = parent_of_normal_dn(normal)) ++depth;
    return depth;
  }

  static bool is_secret(const KnownType* type) noexcept { return type != nullptr && type->secret; }

  // Everybody who may search sees DNs. All of it counts: what is above the first entry is in none
  // of its own.
  bool names_secret(std::string_view dn) const {
    Dn parsed;
    if (!parse_local(dn, parsed)) return false;
    for (const Rdn& rdn : parsed) {
      for (const Ava& ava : rdn) {
        if (is_secret(lookup_.find(ava.type))) return true;
      }
    }
    return false;
  }

  LdifIndex& index_;
  const FileText& text_;
  FileFault& fault_;
  const char* const start_;
  const AttributeLookup& lookup_;
  const ObjectClassLookup& classes_;
  const KnownType* const object_class_;  // null when the table does not know the type
  LineReader reader_;
  const char* checked_ = start_;  // up to here no forbidden byte
  const NameFilter special_names_ = special_names();
  LeadingRdn rdn_;  // of the DN read last
  const bool decodes_ = text_decoder() != nullptr;
  bool last_line_is_comment_ = false;
  std::array<Neighbour, 8> path_;  // from some entry down to the one read last
  std::size_t path_length_ = 0;
};

bool LdifIndex::build(const FileText& text, FileFault& fault) {
  text_ = &text;
  size_ = 0;
  table_size_ = 0;
  return Builder(*this, text, fault).run();
}

}  // namespace orv::cfg
