// Modifying entries: the lines whose values change, and no others.
#include <iterator>
#include <list>
#include <new>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>
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
#include "secret_key.h"

namespace orv::cfg {

namespace {

// A value of the entry: on a line of the file, or new.
struct Item {
  ModType type;
  std::string value;  // as stored
  std::optional<Extent> line;
  bool gone = false;
};
using Items = std::list<Item>;  // in the order of the file

// The entry while the records of a modification are applied to it, one after the other.
class EntryEditor {
 public:
  EntryEditor(const Session& session, std::uint32_t entry, std::string_view normal_dn)
      : session_(session), index_(session.snapshot->index), normal_dn_(normal_dn) {
    read(entry);
  }

  Outcome apply(const ldapmod& mod) {
    ModType type;
    Outcome outcome = read_type(mod, type);
    if (!outcome.refused()) outcome = read_values(mod, type, values_);
    if (outcome.refused()) return outcome;
    switch (mod.operation()) {
      case kModAdd:
        return add(type);
      case kModDelete:
        return remove(type);
      case kModReplace:
        return replace(type);
      default:
        return {result::protocol_error, {}};
    }
  }

  [[nodiscard]] bool is_empty() const noexcept {
    for (const Item& item : items_) {
      if (!item.gone) return false;
    }
    return true;
  }

  [[nodiscard]] EntrySize size() const noexcept {
    EntrySize size;
    for (const auto& [name, attribute] : attributes_) {
      size.attributes += attribute.by_key.empty() ? 0 : 1;
      size.values += attribute.by_key.size();
    }
    return size;
  }

  [[nodiscard]] std::vector<Edit> edits() const {
    std::vector<Edit> edits;
    std::size_t at = dn_line_.end;
    for (const Item& item : items_) {
      if (item.line.has_value()) {
        if (item.gone) edits.push_back({*item.line, {}});
        at = item.line->end;
      } else if (!item.gone) {
        std::string text;
        append_line(text, item.type.name, item.value, line_end_at(index_, dn_line_.begin));
        edits.push_back({{at, at}, std::move(text)});
      }
    }
    return edits;
  }

 private:
  // The values of one attribute. Those of a hand-edited file may hold equal ones.
  struct Attribute {
    std::unordered_multimap<std::string, Items::iterator> by_key;
    Items::iterator last;  // behind which new values go, also when it is gone itself
  };

  // -- Reading --

  [[nodiscard]] std::size_t offset(const char* at) const noexcept {
    return static_cast<std::size_t>(at - index_.text_begin());
  }

  void read(std::uint32_t entry) {
    LineReader reader = index_.lines(entry);
    AttributeLine line;
    std::string scratch;
    dn_line_.begin = offset(reader.position());
    reader.next(line);
    dn_line_.end = offset(reader.position());
    while (true) {
      while (reader.position() < index_.text_end() && *reader.position() == '#') {
        reader.skip_comment();
      }
      const std::size_t begin = offset(reader.position());
      if (!reader.next(line)) break;
      const std::size_t end = offset(reader.position());
      const KnownType* const known = attribute_lookup().find(line.type);
      ModType type{known, known != nullptr ? std::string_view(known->name) : keep_name(line.type)};
      insert(items_.end(), {type, std::string(decoded(line, scratch)), Extent{begin, end}, false});
    }
  }

  // A name that the reader may have put together in memory of its own.
  std::string_view keep_name(std::string_view name) { return *names_.emplace(name).first; }

  // -- Items --

  static std::string folded(std::string_view name) {
    std::string text(name);
    for (char& c : text) c = ascii_lower(c);
    return text;
  }

  Attribute* find(const ModType& type) {
    const auto found = attributes_.find(folded(type.name));
    return found == attributes_.end() ? nullptr : &found->second;
  }

  // Passwords, which are found in another way, have none.
  static std::string key_of(const ModType& type, std::string_view value) {
    return type.is_secret() ? std::string() : value_key(type, value);
  }

  void insert(Items::iterator before, Item item) {
    std::string key = key_of(item.type, item.value);
    const auto at = items_.insert(before, std::move(item));
    Attribute& attribute = attributes_[folded(at->type.name)];
    attribute.by_key.emplace(std::move(key), at);
    attribute.last = at;
  }

  void append(const ModType& type, std::string value) {
    const Attribute* const attribute = find(type);
    const auto before = attribute == nullptr ? items_.end() : std::next(attribute->last);
    insert(before, {type, std::move(value), std::nullopt, false});
  }

  // -- Records --

  Outcome add(const ModType& type) {
    if (values_.empty()) return {result::protocol_error, {}};
    for (const std::string_view value : values_) {
      Outcome outcome = add_value(type, value);
      if (outcome.refused()) return outcome;
    }
    return {};
  }

  Outcome add_value(const ModType& type, std::string_view value) {
    Attribute* const attribute = find(type);
    if (attribute != nullptr && !matches(*attribute, type, value).empty()) {
      return {result::attribute_or_value_exists, {}};
    }
    return append_new(type, value);
  }

  // A value that is stored protected when it is a password.
  Outcome append_new(const ModType& type, std::string_view value) {
    std::string stored(type.is_secret() ? std::string_view() : value);
    if (type.is_secret()) {
      Outcome outcome = check_password(type, value);
      if (outcome.refused()) return outcome;
      const SecretPlace place{type.name, normal_dn_};
      outcome.code = protect_secret(session_.owned_key.get(), place, value, stored);
      if (outcome.refused()) return outcome;
    }
    append(type, std::move(stored));
    return {};
  }

  Outcome remove(const ModType& type) {
    Attribute* const attribute = find(type);
    if (attribute == nullptr || attribute->by_key.empty()) return {result::no_such_attribute, {}};
    if (values_.empty()) remove_all(*attribute);
    for (const std::string_view value : values_) {
      const auto found = matches(*attribute, type, value);
      if (found.empty()) return {result::no_such_attribute, {}};
      for (const auto& at : found) {
        at->second->gone = true;
        attribute->by_key.erase(at);
      }
    }
    return {};
  }

  static void remove_all(Attribute& attribute) noexcept {
    for (const auto& [key, item] : attribute.by_key) item->gone = true;
    attribute.by_key.clear();
  }

  // Lines of values that stay are not touched.
  Outcome replace(const ModType& type) {
    std::unordered_set<std::string> wanted;
    std::unordered_set<std::string_view> exact(values_.begin(), values_.end());
    for (const std::string_view value : values_) {
      if (type.is_secret() ? exact.size() < values_.size()
                           : !wanted.insert(value_key(type, value)).second) {
        return given_twice(type);
      }
    }
    Attribute* const attribute = find(type);
    if (attribute != nullptr) keep_only(*attribute, exact);
    for (const std::string_view value : values_) {
      if (exact.find(value) == exact.end()) continue;
      Outcome outcome = append_new(type, value);
      if (outcome.refused()) return outcome;
    }
    return {};
  }

  // Takes the values that are there out of `exact`, and all others out of the attribute.
  static void keep_only(Attribute& attribute, std::unordered_set<std::string_view>& exact) {
    for (auto at = attribute.by_key.begin(); at != attribute.by_key.end();) {
      const Item& item = *at->second;
      // A password that stands there in clear is protected by the method that is in force now.
      const bool may_stay = !item.type.is_secret() || names_scheme(item.value);
      if (may_stay && exact.erase(item.value) > 0) {
        ++at;
      } else {
        at->second->gone = true;
        at = attribute.by_key.erase(at);
      }
    }
  }

  using Found = std::vector<std::unordered_multimap<std::string, Items::iterator>::iterator>;

  // The values equal to this one; of passwords the one that is stored so, or stands for this clear
  // text.
  Found matches(Attribute& attribute, const ModType& type, std::string_view value) const {
    Found found;
    const auto [begin, end] = attribute.by_key.equal_range(key_of(type, value));
    for (auto at = begin; at != end; ++at) {
      if (!type.is_secret() || is_password(*at->second, value)) found.push_back(at);
    }
    return found;
  }

  [[nodiscard]] bool is_password(const Item& item, std::string_view value) const {
    if (item.value == value) return true;
    const SecretPlace place{item.type.name, normal_dn_};
    const Match match = match_secret(session_.owned_key.get(), place, item.value, value);
    if (match == Match::no_memory) throw std::bad_alloc();
    return match == Match::yes;
  }

  const Session& session_;
  const LdifIndex& index_;
  std::string_view normal_dn_;
  Extent dn_line_;
  Items items_;
  std::unordered_map<std::string, Attribute> attributes_;
  std::unordered_set<std::string> names_;
  std::vector<std::string_view> values_;  // of the record being applied
};

Outcome modify(Session& session, std::string_view dn, ldapmod** mods) {
  std::string normal;
  if (!normalize_local(dn, normal)) return {result::invalid_dn_syntax, {}};
  const std::uint32_t entry = session.snapshot->index.find(normal);
  if (entry == LdifIndex::kNone) return {result::no_such_record, {}};
  EntryEditor editor(session, entry, normal);
  const EntrySize before = editor.size();
  for (; mods != nullptr && *mods != nullptr; ++mods) {
    Outcome outcome = editor.apply(**mods);
    if (outcome.refused()) return outcome;
  }
  if (editor.is_empty()) {
    return {result::object_class_violation, "an entry without attributes cannot be stored"};
  }
  if (Outcome outcome = check_growth(before, editor.size()); outcome.refused()) return outcome;
  const std::vector<Edit> edits = editor.edits();
  return edits.empty() ? Outcome{} : commit(session, edits);
}

}  // namespace

}  // namespace orv::cfg

namespace orv {

int cfg_modify_s(_CFG* session, const char* dn, ldapmod** mods) {
  return cfg::run_change(session, &cfg::modify, dn, mods);
}

}  // namespace orv
