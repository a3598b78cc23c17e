// Adding and deleting entries.
#include <memory>
#include <set>
#include <string>
#include <string_view>
#include <unordered_set>
#include <utility>
#include <vector>

#include "cfg/secret.h"
#include "cfg/session.h"
#include "change.h"
#include "characters.h"
#include "dn_text.h"
#include "entry_size.h"
#include "local_text.h"

namespace orv::cfg {

namespace {

// ---- The new entry's lines ----

std::string folded_name(const ModType& type) {
  std::string name(type.name);
  for (char& c : name) c = ascii_lower(c);
  return name;
}

// The values of an entry that were seen, to find one that is given twice.
class SeenValues {
 public:
  // False when an equal value of the attribute was seen before. Of passwords no copy is made.
  bool add(const ModType& type, std::string_view value) {
    if (type.is_secret()) return secrets_.emplace(type.known, value).second;
    return seen_.insert(folded_name(type) + '\0' + value_key(type, value)).second;
  }

 private:
  std::unordered_set<std::string> seen_;
  std::set<std::pair<const KnownType*, std::string_view>> secrets_;
};

// Makes the record of an entry to add.
class RecordWriter {
 public:
  RecordWriter(const Session& session, std::string_view normal_dn, std::string_view line_end)
      : session_(session), normal_dn_(normal_dn), line_end_(line_end) {}

  Outcome write(std::string_view dn, ldapmod** mods) {
    append_line(record_, "dn", dn, line_end_);
    if (mods == nullptr || mods[0] == nullptr) return {result::protocol_error, {}};
    for (; *mods != nullptr; ++mods) {
      Outcome outcome = write_attribute(**mods);
      if (outcome.refused()) return outcome;
    }
    return check_growth({}, {names_.size(), values_});
  }

  std::string take() noexcept { return std::move(record_); }

 private:
  Outcome write_attribute(const ldapmod& mod) {
    if (mod.operation() != kModAdd) return {result::protocol_error, {}};
    ModType type;
    std::vector<std::string_view> values;
    Outcome outcome = read_type(mod, type);
    if (!outcome.refused()) outcome = read_values(mod, type, values);
    if (outcome.refused()) return outcome;
    if (values.empty()) return {result::protocol_error, {}};
    names_.insert(folded_name(type));
    for (const std::string_view value : values) {
      if (!seen_.add(type, value)) return given_twice(type);
      ++values_;
      outcome = write_value(type, value);
      if (outcome.refused()) return outcome;
    }
    return {};
  }

  Outcome write_value(const ModType& type, std::string_view value) {
    if (type.is_secret()) return write_secret(type, value);
    append_line(record_, type.name, value, line_end_);
    return {};
  }

  Outcome write_secret(const ModType& type, std::string_view clear) {
    Outcome outcome = check_password(type, clear);
    if (outcome.refused()) return outcome;
    std::string stored;
    const SecretPlace place{type.name, normal_dn_};
    outcome.code = protect_secret(session_.owned_key.get(), place, clear, stored);
    if (!outcome.refused()) append_line(record_, type.name, stored, line_end_);
    return outcome;
  }

  const Session& session_;
  std::string_view normal_dn_;
  std::string_view line_end_;
  SeenValues seen_;
  std::unordered_set<std::string> names_;
  std::size_t values_ = 0;
  std::string record_;
};

// ---- Add ----

// Everybody who may search sees DNs.
bool names_secret(std::string_view dn) {
  Dn parsed;
  if (!parse_local(dn, parsed)) return false;
  for (const Rdn& rdn : parsed) {
    for (const Ava& ava : rdn) {
      const KnownType* const known = attribute_lookup().find(ava.type);
      if (known != nullptr && known->secret) return true;
    }
  }
  return false;
}

// The last entry at or below `top`.
std::uint32_t last_of_subtree(const LdifIndex& index, std::uint32_t top) {
  std::vector<bool> below(index.size() - top);
  below[0] = true;
  std::uint32_t last = top;
  for (std::uint32_t entry = top + 1; entry < index.size(); ++entry) {
    const std::uint32_t parent = index.parent(entry);
    if (parent < top || parent == LdifIndex::kNone || !below[parent - top]) continue;
    below[entry - top] = true;
    last = entry;
  }
  return last;
}

Outcome add(Session& session, std::string_view dn, ldapmod** mods) {
  const LdifIndex& index = session.snapshot->index;
  std::string normal;
  if (!normalize_local(dn, normal)) return {result::invalid_dn_syntax, {}};
  if (names_secret(dn)) return {result::naming_violation, "a password attribute in a DN"};
  if (index.find(normal) != LdifIndex::kNone) return {result::already_exists, {}};
  const std::uint32_t parent = index.find(parent_of_normal_dn(normal));
  if (parent == LdifIndex::kNone) return {result::no_such_record, {}};

  const Extent anchor = entry_extent(index, last_of_subtree(index, parent));
  const std::string_view line_end = line_end_at(index, anchor.begin);
  RecordWriter writer(session, normal, line_end);
  Outcome outcome = writer.write(dn, mods);
  if (outcome.refused()) return outcome;
  // The blank line that ended the anchor's record ends the new one.
  std::string text(line_end);
  if (index.text_begin()[anchor.end - 1] != '\n') text += line_end;
  text += writer.take();
  return commit(session, {{{anchor.end, anchor.end}, std::move(text)}});
}

// ---- Delete ----

bool is_blank_line(std::string_view text, std::size_t at) noexcept {
  return text.substr(at, 1) == "\n" || text.substr(at, 2) == "\r\n";
}

// What a delete takes out: the entry's lines, and one of the blank lines around it. A comment
// directly above stays; without the blank line it would come to stand above another entry.
Extent removed_with(const LdifIndex& index, std::uint32_t entry) {
  const std::string_view text(index.text_begin(),
                              static_cast<std::size_t>(index.text_end() - index.text_begin()));
  Extent extent = entry_extent(index, entry);
  if (extent.begin < 2 || text[extent.begin - 1] != '\n') return extent;
  const std::size_t line_end = text[extent.begin - 2] == '\r' ? 2 : 1;
  const std::size_t above_end = extent.begin - line_end;  // of the content of the line above
  const bool blank_above = above_end == 0 || text[above_end - 1] == '\n';
  if (!blank_above) return extent;
  if (is_blank_line(text, extent.end)) {
    extent.end = text.find('\n', extent.end) + 1;
  } else {
    extent.begin = above_end;
  }
  return extent;
}

bool has_children(const LdifIndex& index, std::uint32_t entry) noexcept {
  for (std::uint32_t other = entry + 1; other < index.size(); ++other) {
    if (index.parent(other) == entry) return true;
  }
  return false;
}

Outcome remove(Session& session, std::string_view dn, ldapmod** /*mods*/) {
  const LdifIndex& index = session.snapshot->index;
  std::string normal;
  if (!normalize_local(dn, normal)) return {result::invalid_dn_syntax, {}};
  const std::uint32_t entry = index.find(normal);
  if (entry == LdifIndex::kNone) return {result::no_such_record, {}};
  if (has_children(index, entry)) return {result::not_allowed_on_non_leaf, {}};
  if (index.size() == 1) {
    return {result::unwilling_to_perform, "the only entry of the file cannot be deleted"};
  }
  return commit(session, {{removed_with(index, entry), {}}});
}

}  // namespace

}  // namespace orv::cfg

namespace orv {

int cfg_add_s(_CFG* session, const char* dn, ldapmod** mods) {
  return cfg::run_change(session, &cfg::add, dn, mods);
}

int cfg_delete_s(_CFG* session, const char* dn) {
  return cfg::run_change(session, &cfg::remove, dn, nullptr);
}

}  // namespace orv
