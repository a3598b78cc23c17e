// Result chains: walking the entries that a search found, their attributes and values.
#include <cstdlib>
#include <cstring>
#include <new>
#include <utility>

#include "cfg/result_codes.h"
#include "cfg/text.h"
#include "characters.h"
#include "session_state.h"

namespace orv {

// Where a walk over the attributes of an entry stands. The entry's record may be gone by then.
// NOLINTNEXTLINE(bugprone-reserved-identifier): the name is part of the interface
struct _CFGBer {
  cfg::Session* session;
  cfg::SnapshotPtr snapshot;
  std::uint32_t entry;
  std::uint32_t next;  // the attribute to give out
  bool chooses;        // only some of the attributes were asked for: those in `chosen`
  std::vector<std::uint32_t> chosen;
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
      snapshot(owner.snapshot),
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

// The values of one attribute; whoever does not take them loses them with it.
class ValueList {
 public:
  explicit ValueList(std::uint32_t capacity)
      : values_(static_cast<char**>(std::malloc((std::size_t{capacity} + 1) * sizeof(char*)))) {
    if (values_ == nullptr) throw std::bad_alloc();
    values_[0] = nullptr;
  }
  ~ValueList() { cfg_value_free(values_); }
  ValueList(const ValueList&) = delete;
  ValueList& operator=(const ValueList&) = delete;

  void add(std::string_view value) {
    values_[count_] = copy_text(value);
    values_[++count_] = nullptr;
  }

  char** take() noexcept { return std::exchange(values_, nullptr); }

 private:
  char** values_;
  std::size_t count_ = 0;
};

// The values of an attribute, null when the entry, or what was asked of it, lacks the attribute.
char** collect_values(const Record& record, std::string_view name) {
  const Chain& chain = *record.chain;
  AttributeMap& map = chain.session->attributes;
  map.show(chain.snapshot->index, record.entry);
  const std::uint32_t attribute = map.find(name);
  if (attribute == AttributeMap::kNone) return nullptr;
  if (!chain.selection.has(map.known(attribute), name)) return nullptr;
  ValueList values(chain.types_only ? 0 : map.count_values(attribute));
  if (!chain.types_only) {
    map.for_each_value(attribute, [&values](std::string_view value) { values.add(value); });
  }
  return values.take();
}

char* next_name(_CFGBer& cursor) {
  AttributeMap& map = cursor.session->attributes;
  map.show(cursor.snapshot->index, cursor.entry);
  if (cursor.next == (cursor.chooses ? cursor.chosen.size() : map.size())) return nullptr;
  const std::uint32_t attribute = cursor.chooses ? cursor.chosen[cursor.next] : cursor.next;
  ++cursor.next;
  map.note_named(attribute);
  return copy_text(map.name(attribute));
}

char* first_attribute(const Record& record, std::unique_ptr<_CFGBer>& cursor) {
  Session& session = *record.chain->session;
  const Selection& selection = record.chain->selection;
  // NOLINTNEXTLINE(modernize-make-unique): clang 14 makes no aggregates that way
  cursor.reset(
      new _CFGBer{&session, record.chain->snapshot, record.entry, 0, !selection.has_all(), {}});
  if (cursor->chooses) {
    AttributeMap& map = session.attributes;
    map.show(cursor->snapshot->index, record.entry);
    for (std::uint32_t i = 0; i < map.size(); ++i) {
      if (selection.has(map.known(i), map.name(i))) cursor->chosen.push_back(i);
    }
  }
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
    return cfg::copy_text(record->chain->snapshot->index.dn(record->entry, scratch));
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
