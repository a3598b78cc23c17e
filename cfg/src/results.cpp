// Result chains: walking the entries that a search found, their attributes and values.
#include <cstdlib>
#include <cstring>
#include <forward_list>
#include <new>
#include <unordered_set>
#include <utility>

#include "cfg/result_codes.h"
#include "cfg/text.h"
#include "characters.h"
#include "session_state.h"

namespace orv {

// The attribute names of one entry, collected when the walk begins.
// NOLINTNEXTLINE(bugprone-reserved-identifier): the name is part of the interface
struct _CFGBer {
  struct Name {
    const cfg::KnownType* known;
    std::string_view text;  // canonical, or as first spelled when unknown
  };
  std::vector<Name> names;
  std::size_t next = 0;
  std::forward_list<std::string> copies;  // of names whose line is folded within them
};

}  // namespace orv

namespace orv::cfg {

// ---- Selection ----

Selection::Selection(char** names) {
  if (names == nullptr || names[0] == nullptr) {
    all_ = true;
    return;
  }
  for (; *names != nullptr; ++names) {
    const std::string_view name = *names;
    if (name == "*") all_ = true;
    names_.push_back(Name{attribute_lookup().find(name), std::string(name)});
  }
}

// "1.1" needs no care: no attribute has this name.
bool Selection::has(const KnownType* known, std::string_view name) const noexcept {
  if (all_) return true;
  for (const Name& wanted : names_) {
    if (known != nullptr ? wanted.known == known : equals_ignore_ascii_case(wanted.text, name)) {
      return true;
    }
  }
  return false;
}

// ---- Chains and records ----

Chain::Chain(Session& owner, char** attributes, bool wants_types_only)
    : _CFGMessage{Kind::chain},
      session(&owner),
      types_only(wants_types_only),
      selection(attributes) {
  next_chain = owner.chains;
  if (next_chain != nullptr) next_chain->previous_chain = this;
  owner.chains = this;
}

Chain::~Chain() {
  while (first != nullptr) {
    Record* const record = first;
    first = record->next;
    std::free(record);
  }
  if (next_chain != nullptr) next_chain->previous_chain = previous_chain;
  (previous_chain != nullptr ? previous_chain->next_chain : session->chains) = next_chain;
}

void Chain::append(std::uint32_t entry) {
  auto* const record = static_cast<Record*>(std::malloc(sizeof(Record)));
  if (record == nullptr) throw std::bad_alloc();
  new (record) Record{{Kind::record}, this, last, nullptr, entry};
  (last != nullptr ? last->next : first) = record;
  last = record;
  ++count;
}

void Chain::unlink(Record& record) noexcept {
  (record.previous != nullptr ? record.previous->next : first) = record.next;
  (record.next != nullptr ? record.next->previous : last) = record.previous;
  record.chain = nullptr;
  record.previous = nullptr;
  record.next = nullptr;
  --count;
}

Record* record_of(_CFGMessage* message) noexcept {
  if (message == nullptr || message->kind != _CFGMessage::Kind::record) return nullptr;
  auto* const record = static_cast<Record*>(message);
  return record->chain != nullptr ? record : nullptr;
}

Chain* chain_of(_CFGMessage* message) noexcept {
  if (message == nullptr || message->kind != _CFGMessage::Kind::chain) return nullptr;
  return static_cast<Chain*>(message);
}

namespace {

// ---- Walking ----

// Notes the outcome of a call on the handle, which may be null.
void set_error(_CFG* handle, int code) noexcept {
  if (Session* const session = session_of(handle)) session->last_error = code;
}

// A text of its own from malloc; throws std::bad_alloc.
char* copy_text(std::string_view text) {
  char* const copy = static_cast<char*>(std::malloc(text.size() + 1));
  if (copy == nullptr) throw std::bad_alloc();
  if (!text.empty()) std::memcpy(copy, text.data(), text.size());
  copy[text.size()] = '\0';
  return copy;
}

// Collects each type of an entry once, in the order of first appearance.
class NameCollector {
 public:
  explicit NameCollector(_CFGBer& cursor) noexcept : cursor_(cursor) {}

  void add(const LdifIndex& index, const Record& record) {
    LineReader reader = index.lines(record.entry);
    AttributeLine line;
    reader.next(line);
    std::string_view last;
    while (true) {
      const char* const at = reader.position();
      if (!reader.next(line)) break;
      // Values of one attribute mostly follow one another.
      if (line.type == last) continue;
      const bool in_text = line.type.data() >= at && line.type.data() < reader.position();
      last = in_text ? line.type : std::string_view();
      add(record.chain->selection, line.type, in_text);
    }
  }

 private:
  void add(const Selection& selection, std::string_view spelled, bool in_text) {
    const KnownType* const known = attribute_lookup().find(spelled);
    if (!selection.has(known, spelled) || has(known, spelled)) return;
    std::string_view text = spelled;
    if (known != nullptr) {
      text = known->name;
    } else if (!in_text) {
      text = cursor_.copies.emplace_front(spelled);
    }
    cursor_.names.push_back({known, text});
    if (!seen_.empty() || cursor_.names.size() > kScanned) remember();
  }

  // A scan does for usual entries; one with very many types gets a set.
  bool has(const KnownType* known, std::string_view spelled) const {
    if (!seen_.empty()) return seen_.count(key(known, spelled)) != 0;
    for (const _CFGBer::Name& name : cursor_.names) {
      if (known != nullptr
              ? name.known == known
              : name.known == nullptr && equals_ignore_ascii_case(name.text, spelled)) {
        return true;
      }
    }
    return false;
  }

  static std::string key(const KnownType* known, std::string_view spelled) {
    std::string text(known != nullptr ? std::string_view(known->name) : spelled);
    for (char& c : text) c = ascii_lower(c);
    return text;
  }

  void remember() {
    for (; remembered_ < cursor_.names.size(); ++remembered_) {
      const _CFGBer::Name& name = cursor_.names[remembered_];
      seen_.insert(key(name.known, name.text));
    }
  }

  static constexpr std::size_t kScanned = 64;
  _CFGBer& cursor_;
  std::unordered_set<std::string> seen_;
  std::size_t remembered_ = 0;
};

// Collects the values of one attribute; whoever does not take them loses them with it.
class ValueCollector {
 public:
  ValueCollector() = default;
  ~ValueCollector() { cfg_value_free(values_); }
  ValueCollector(const ValueCollector&) = delete;
  ValueCollector& operator=(const ValueCollector&) = delete;

  void reserve_one() {
    if (count_ + 1 < capacity_) return;
    const std::size_t grown = capacity_ == 0 ? 4 : capacity_ * 2;
    auto* const values = static_cast<char**>(std::realloc(values_, grown * sizeof(char*)));
    if (values == nullptr) throw std::bad_alloc();
    values_ = values;
    capacity_ = grown;
    values_[count_] = nullptr;
  }

  void add(std::string_view value) {
    reserve_one();
    values_[count_] = copy_text(value);
    values_[++count_] = nullptr;
  }

  char** take() noexcept { return std::exchange(values_, nullptr); }

 private:
  char** values_ = nullptr;
  std::size_t count_ = 0;
  std::size_t capacity_ = 0;
};

// The values of an attribute, null when the entry, or what was asked of it, lacks the attribute.
char** collect_values(const Record& record, std::string_view name) {
  const KnownType* const known = attribute_lookup().find(name);
  if (!record.chain->selection.has(known, name)) return nullptr;
  LineReader reader = record.chain->session->index.lines(record.entry);
  AttributeLine line;
  std::string scratch;
  ValueCollector values;
  reader.next(line);
  while (reader.next(line)) {
    const bool wanted = known != nullptr ? is_name_of(*known, line.type)
                                         : equals_ignore_ascii_case(name, line.type);
    if (!wanted) continue;
    values.reserve_one();
    if (record.chain->types_only) break;
    values.add(decoded(line, scratch));
  }
  return values.take();
}

char* next_name(_CFGBer& cursor) {
  if (cursor.next == cursor.names.size()) return nullptr;
  return copy_text(cursor.names[cursor.next++].text);
}

char* first_attribute(const Record& record, std::unique_ptr<_CFGBer>& cursor) {
  cursor = std::make_unique<_CFGBer>();
  NameCollector(*cursor).add(record.chain->session->index, record);
  return next_name(*cursor);
}

// Runs `body`, whose pointer is the result of a call on the handle. Only memory can run out in it.
template <class Body>
auto guarded(_CFG* handle, Body body) noexcept -> decltype(body()) {
  set_error(handle, result::success);
  try {
    return body();
  } catch (...) {
    set_error(handle, result::no_memory);
    return nullptr;
  }
}

}  // namespace

}  // namespace orv::cfg

namespace orv {

using cfg::chain_of;
using cfg::record_of;

int cfg_count_entries(_CFG* session, _CFGMessage* chain) {
  cfg::set_error(session, result::success);
  const cfg::Chain* const head = chain_of(chain);
  return head != nullptr ? head->count : 0;
}

_CFGMessage* cfg_first_entry(_CFG* session, _CFGMessage* chain) {
  cfg::set_error(session, result::success);
  const cfg::Chain* const head = chain_of(chain);
  return head != nullptr ? head->first : nullptr;
}

_CFGMessage* cfg_next_entry(_CFG* session, _CFGMessage* entry) {
  cfg::set_error(session, result::success);
  const cfg::Record* const record = record_of(entry);
  return record != nullptr ? record->next : nullptr;
}

char* cfg_get_dn(_CFG* session, _CFGMessage* entry) {
  const cfg::Record* const record = record_of(entry);
  if (record == nullptr) {
    cfg::set_error(session, result::operations_error);
    return nullptr;
  }
  return cfg::guarded(session, [&] {
    std::string scratch;
    return cfg::copy_text(record->chain->session->index.dn(record->entry, scratch));
  });
}

char* cfg_first_attribute(_CFG* session, _CFGMessage* entry, _CFGBer** cursor) {
  if (cursor != nullptr) *cursor = nullptr;
  const cfg::Record* const record = record_of(entry);
  if (record == nullptr || cursor == nullptr) {
    cfg::set_error(session, result::operations_error);
    return nullptr;
  }
  std::unique_ptr<_CFGBer> made;
  char* const name = cfg::guarded(session, [&] { return cfg::first_attribute(*record, made); });
  if (name != nullptr) *cursor = made.release();
  return name;
}

char* cfg_next_attribute(_CFG* session, _CFGMessage* /*entry*/, _CFGBer* cursor) {
  if (cursor == nullptr) {
    cfg::set_error(session, result::success);
    return nullptr;
  }
  return cfg::guarded(session, [&] { return cfg::next_name(*cursor); });
}

char** cfg_get_values(_CFG* session, _CFGMessage* entry, const char* attribute) {
  const cfg::Record* const record = record_of(entry);
  if (record == nullptr || attribute == nullptr) {
    cfg::set_error(session, result::operations_error);
    return nullptr;
  }
  bool absent = false;
  char** const values = cfg::guarded(session, [&] {
    char** const found = cfg::collect_values(*record, attribute);
    absent = found == nullptr;
    return found;
  });
  if (absent) cfg::set_error(session, result::no_such_attribute);
  return values;
}

void cfg_value_free(char** values) {
  if (values == nullptr) return;
  for (char** value = values; *value != nullptr; ++value) std::free(*value);
  std::free(values);
}

void cfg_memfree(void* memory) {
  std::free(memory);
}

void cfg_ber_free(_CFGBer* cursor) {
  delete cursor;
}

int cfg_msgfree(_CFGMessage* chain) {
  delete chain_of(chain);
  return result::success;
}

void cfg_msg_unlink(_CFG* session, _CFGMessage* record) {
  cfg::set_error(session, result::success);
  if (cfg::Record* const linked = record_of(record)) linked->chain->unlink(*linked);
}

}  // namespace orv
