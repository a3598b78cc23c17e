#include "slapi/entry.h"

#include <algorithm>
#include <memory>
#include <new>
#include <string>
#include <string_view>
#include <unordered_map>
#include <unordered_set>
#include <vector>

#include "cfg/owners.h"
#include "cfg/result_codes.h"
#include "cfg/text.h"
#include "equality.h"
#include "local_text.h"
#include "memory.h"
#include "slapi/codepage.h"
#include "slapi/dn.h"
#include "slapi/owners.h"

namespace orv {
namespace {

constexpr int kBadArgument = -1;

// ---- Values ----------------------------------------------------------------------------------

std::string_view bytes_of(const berval& value) noexcept {
  if (value.bv_val == nullptr) return {};
  return {value.bv_val, value.bv_len};
}

std::size_t count_values(berval* const* values) noexcept {
  std::size_t count = 0;
  while (values != nullptr && values[count] != nullptr) ++count;
  return count;
}

void free_values(berval** values) noexcept {
  if (values == nullptr) return;
  for (berval** value = values; *value != nullptr; ++value) {
    slapi::wipe_and_free((*value)->bv_val);
    std::free(*value);
  }
  std::free(values);
}

struct ValuesDeleter {
  void operator()(berval** values) const noexcept { free_values(values); }
};
// A null-terminated value list under construction: filled from the front of a zeroed array.
using ValueList = std::unique_ptr<berval*, ValuesDeleter>;

ValueList new_value_list(std::size_t capacity) noexcept {
  return ValueList(static_cast<berval**>(std::calloc(capacity + 1, sizeof(berval*))));
}

// Makes a value that owns `text`, a malloc block with a NUL at `length`. Null without memory: the
// text is then released.
berval* adopt_value(slapi::MallocPtr<char> text, std::size_t length) noexcept {
  auto* const value = static_cast<berval*>(std::malloc(sizeof(berval)));
  if (value == nullptr) return nullptr;
  *value = {length, text.release()};
  return value;
}

// The bytes of a value as an entry is to hold them: as they are, or in the file's code page.
int text_for_entry(const entry& e, const berval& value, slapi::MallocPtr<char>& text,
                   std::size_t& length) noexcept {
  char* converted = nullptr;
  if (slapi::has_foreign_texts(e) && value.bv_val != nullptr) {
    const int rc = xlate_utf8_to_localcp(value.bv_val, &converted, &length);
    if (rc != result::success) return rc;
    --length;  // the converter counts the NUL
  } else {
    length = bytes_of(value).size();
    converted = slapi::copy_bytes(bytes_of(value));
  }
  text.reset(converted);
  return converted == nullptr ? result::no_memory : result::success;
}

int copy_values(const entry& e, berval* const* values, std::size_t count,
                ValueList& copies) noexcept {
  copies = new_value_list(count);
  if (copies == nullptr) return result::no_memory;
  for (std::size_t i = 0; i < count; ++i) {
    slapi::MallocPtr<char> text;
    std::size_t length = 0;
    if (const int rc = text_for_entry(e, *values[i], text, length); rc != result::success)
      return rc;
    copies.get()[i] = adopt_value(std::move(text), length);
    if (copies.get()[i] == nullptr) return result::no_memory;
  }
  return result::success;
}

// ---- Attributes ------------------------------------------------------------------------------

bool is_object_class(std::string_view type) noexcept {
  return cfg::equals_ignore_ascii_case(type, "objectClass");
}

// The rule stands in `attr::syntax` counted from 1. Entries leave the 0 of a zeroed attribute
// there, "look it up": most are only read and sent, and never compare a value.
cfg::MatchingRule rule_of(const attr& a, int syntax) noexcept {
  constexpr int last = static_cast<int>(cfg::MatchingRule::generalized_time) + 1;
  if (syntax >= 1 && syntax <= last) return static_cast<cfg::MatchingRule>(syntax - 1);
  return a.type == nullptr ? cfg::MatchingRule::case_ignore : slapi::equality_of(a.type);
}

void free_attribute(attr* a) noexcept {
  if (a == nullptr) return;
  std::free(a->type);
  free_values(a->values);
  std::free(a);
}

struct AttributeDeleter {
  void operator()(attr* a) const noexcept { free_attribute(a); }
};
using AttributePtr = std::unique_ptr<attr, AttributeDeleter>;

// An attribute that owns both arguments; they are released when there is no memory for it.
AttributePtr make_attribute(slapi::MallocPtr<char> type, ValueList values) noexcept {
  AttributePtr made(static_cast<attr*>(std::calloc(1, sizeof(attr))));
  if (made == nullptr) return made;
  made->count = static_cast<int>(count_values(values.get()));
  made->type = type.release();
  made->values = values.release();
  return made;
}

// The first letter settles most comparisons.
bool is_type(const attr& a, std::string_view type) noexcept {
  if (a.type == nullptr) return false;
  if (!type.empty() && ((*a.type ^ type.front()) & ~0x20) != 0) return false;
  return cfg::equals_ignore_ascii_case(a.type, type);
}

// The link to the attribute of that type, or the one at the end of the list, which is null.
attr** link_of(entry& e, std::string_view type) noexcept {
  attr** link = &e.attributes;
  while (*link != nullptr && !is_type(**link, type)) link = &(*link)->next;
  return link;
}

attr** end_of_attributes(entry& e) noexcept {
  attr** link = &e.attributes;
  while (*link != nullptr) link = &(*link)->next;
  return link;
}

// ---- Object classes --------------------------------------------------------------------------

// The short list over the values of both lists (either may be null). Null without memory.
slapi::MallocPtr<ShortValue> make_short_list(berval* const* values, berval* const* more) noexcept {
  const std::size_t count = count_values(values) + count_values(more);
  slapi::MallocPtr<ShortValue> list(
      static_cast<ShortValue*>(std::calloc(count + 1, sizeof(ShortValue))));
  if (list == nullptr) return list;
  ShortValue* next = list.get();
  for (berval* const* source : {values, more})
    for (; source != nullptr && *source != nullptr; ++source)
      *next++ = {(*source)->bv_val, (*source)->bv_len};
  return list;
}

void set_object_classes(entry& e, attr* classes, slapi::MallocPtr<ShortValue> list) noexcept {
  e.object_classes = classes;
  std::free(e.object_class_list);
  e.object_class_list = list.release();
}

// ---- Merging ---------------------------------------------------------------------------------

// The equality key of a value of an entry, in whatever code page it holds its texts: letters of
// another one than UTF-8 have no case until they are converted.
std::string key_in(const entry& e, cfg::MatchingRule rule, std::string_view value) {
  std::string utf8;
  return slapi::equality_key(
      rule, slapi::has_foreign_texts(e) && slapi::local_to_utf8(value, utf8) ? utf8 : value);
}

// Whether one of the added values is there already, in the attribute or among those added before
// it. Linear in the number of values.
bool adds_duplicate(const entry& e, const attr& present, berval* const* added) {
  const cfg::MatchingRule rule = rule_of(present, present.syntax);
  std::unordered_set<std::string> keys;
  keys.reserve(count_values(present.values) + count_values(added));
  for (berval* const* value = present.values; value != nullptr && *value != nullptr; ++value)
    keys.insert(key_in(e, rule, bytes_of(**value)));
  for (; *added != nullptr; ++added)
    if (!keys.insert(key_in(e, rule, bytes_of(**added))).second) return true;
  return false;
}

// Everything that can fail comes first; the last block of each of these two cannot.
int append_values(entry& e, attr& present, ValueList added, std::size_t added_count) noexcept {
  const bool object_class = is_object_class(present.type);
  slapi::MallocPtr<ShortValue> list;
  if (object_class) {
    list = make_short_list(present.values, added.get());
    if (list == nullptr) return result::no_memory;
  }
  const std::size_t held = count_values(present.values);
  void* const grown = std::realloc(present.values, (held + added_count + 1) * sizeof(berval*));
  if (grown == nullptr) return result::no_memory;

  present.values = static_cast<berval**>(grown);
  std::copy_n(added.get(), added_count + 1, present.values + held);
  present.count = static_cast<int>(held + added_count);
  std::free(added.release());  // the array; its values have moved
  if (object_class) set_object_classes(e, &present, std::move(list));
  return result::success;
}

// `end` is the link at the end of the entry's list.
int append_attribute(entry& e, attr** end, AttributePtr added) noexcept {
  const bool object_class = is_object_class(added->type);
  slapi::MallocPtr<ShortValue> list;
  if (object_class) {
    list = make_short_list(added->values, nullptr);
    if (list == nullptr) return result::no_memory;
  }

  attr* const placed = added.release();
  *end = placed;
  if (object_class) set_object_classes(e, placed, std::move(list));
  return result::success;
}

int create_attribute(entry& e, attr** end, const char* type, ValueList values) noexcept {
  slapi::MallocPtr<char> name(slapi::copy_bytes(type));
  if (name == nullptr) return result::no_memory;
  AttributePtr created = make_attribute(std::move(name), std::move(values));
  if (created == nullptr) return result::no_memory;
  return append_attribute(e, end, std::move(created));
}

// ---- Deleting values -------------------------------------------------------------------------

// Which values of an attribute are to go, by position.
using Doomed = std::vector<bool>;

// The values of a modification, in whichever form it holds them.
std::vector<std::string_view> values_of(const ldapmod& modification) {
  std::vector<std::string_view> values;
  if ((modification.mod_op & kModBvalues) != 0) {
    berval** const counted = modification.mod_vals.modv_bvals;
    for (berval** value = counted; counted != nullptr && *value != nullptr; ++value)
      values.push_back(bytes_of(**value));
  } else {
    char** const strings = modification.mod_vals.modv_strvals;
    for (char** value = strings; strings != nullptr && *value != nullptr; ++value)
      values.emplace_back(*value);
  }
  return values;
}

// Passwords are not compared before the caller's rights are: the code would tell a right guess from
// a wrong one.
int doom_earliest(std::size_t wanted, Doomed& doomed) {
  if (wanted > doomed.size()) return result::no_such_attribute;
  std::fill_n(doomed.begin(), wanted, true);
  return result::success;
}

// Marks one equal value for each wanted one. Linear in the number of values.
int doom_equal(const entry& e, const attr& present, const std::vector<std::string_view>& wanted,
               Doomed& doomed) {
  const cfg::MatchingRule rule = rule_of(present, present.syntax);
  std::unordered_multimap<std::string, std::size_t> held;
  held.reserve(doomed.size());
  for (std::size_t i = 0; i < doomed.size(); ++i)
    held.emplace(key_in(e, rule, bytes_of(*present.values[i])), i);
  for (const std::string_view value : wanted) {
    slapi::MallocPtr<char> text;
    std::size_t length = 0;
    std::string copy(value);  // with the NUL that counted values have behind them
    const berval counted{copy.size(), copy.data()};
    if (const int rc = text_for_entry(e, counted, text, length); rc != result::success) return rc;
    const auto found = held.find(key_in(e, rule, {text.get(), length}));
    if (found == held.end()) return result::no_such_attribute;
    doomed[found->second] = true;
    held.erase(found);
  }
  return result::success;
}

// Takes the marked values out; everything that can fail comes first.
int remove_values(entry& e, attr& present, const Doomed& doomed) noexcept {
  const auto kept_count = static_cast<std::size_t>(std::count(doomed.begin(), doomed.end(), false));
  if (kept_count == 0) return attr_delete(&e, present.type, nullptr);
  slapi::MallocPtr<berval*> kept(
      static_cast<berval**>(std::calloc(kept_count + 1, sizeof(berval*))));
  if (kept == nullptr) return result::no_memory;
  for (std::size_t i = 0, next = 0; i < doomed.size(); ++i)
    if (!doomed[i]) kept.get()[next++] = present.values[i];
  const bool object_class = is_object_class(present.type);
  slapi::MallocPtr<ShortValue> list;
  if (object_class) {
    list = make_short_list(kept.get(), nullptr);
    if (list == nullptr) return result::no_memory;
  }
  for (std::size_t i = 0; i < doomed.size(); ++i) {
    if (!doomed[i]) continue;
    slapi::wipe_and_free(present.values[i]->bv_val);
    std::free(present.values[i]);
  }
  std::free(present.values);
  present.values = kept.release();
  present.count = static_cast<int>(kept_count);
  if (object_class) set_object_classes(e, &present, std::move(list));
  return result::success;
}

// ---- Records of the configuration file -------------------------------------------------------

// The normal form of a DN in the file's code page, in that code page; null when it has none.
int normalize_local_dn(const char* dn, char** normal) noexcept {
  char* utf8 = nullptr;
  std::size_t length = 0;
  int rc = xlate_localcp_to_utf8(dn, &utf8, &length);
  if (rc == result::success) rc = replace_DN(&utf8, 1);
  if (rc == result::success) rc = xlate_utf8_to_localcp(utf8, normal, &length);
  std::free(utf8);
  return rc == result::no_memory ? rc : result::success;
}

int read_dn(_CFG* session, _CFGMessage* record, entry& e) noexcept {
  e.dn = cfg_get_dn(session, record);
  if (e.dn == nullptr)
    return cfg_get_errno(session) == result::no_memory ? result::no_memory : result::success;
  return normalize_local_dn(e.dn, &e.normalized_dn);
}

// Turns the library's texts into counted values without copying them: each is a block of its own.
int adopt_texts(char** texts, ValueList& values) noexcept {
  std::size_t count = 0;
  while (texts[count] != nullptr) ++count;
  values = new_value_list(count);
  if (values == nullptr) return result::no_memory;
  for (std::size_t i = 0; i < count; ++i) {
    berval* const value = adopt_value(slapi::MallocPtr<char>(texts[i]), std::strlen(texts[i]));
    // What follows is still the library's list, which ends at its first null.
    texts[i] = nullptr;
    if (value == nullptr) {
      std::move(texts + i + 1, texts + count + 1, texts);
      return result::no_memory;
    }
    values.get()[i] = value;
  }
  return result::success;
}

// Appends the attribute `name` of the record; one whose values cannot be read is left out.
int read_attribute(_CFG* session, _CFGMessage* record, CfgText name, entry& e) noexcept {
  const CfgValues texts(cfg_get_values(session, record, name.get()));
  if (texts == nullptr)
    return cfg_get_errno(session) == result::no_memory ? result::no_memory : result::success;
  ValueList values;
  if (const int rc = adopt_texts(texts.get(), values); rc != result::success) return rc;
  AttributePtr read = make_attribute(slapi::MallocPtr<char>(name.release()), std::move(values));
  return read == nullptr ? result::no_memory
                         : append_attribute(e, end_of_attributes(e), std::move(read));
}

int read_attributes(_CFG* session, _CFGMessage* record, entry& e) noexcept {
  _CFGBer* started = nullptr;
  CfgText name(cfg_first_attribute(session, record, &started));
  const CfgCursor cursor(started);
  while (name != nullptr) {
    if (const int rc = read_attribute(session, record, std::move(name), e); rc != result::success)
      return rc;
    name.reset(cfg_next_attribute(session, record, cursor.get()));
  }
  return cfg_get_errno(session) == result::no_memory ? result::no_memory : result::success;
}

}  // namespace

void entry_free(entry* e) {
  if (e == nullptr) return;
  while (e->attributes != nullptr) {
    attr* const next = e->attributes->next;
    free_attribute(e->attributes);
    e->attributes = next;
  }
  std::free(e->object_class_list);
  std::free(e->requested_dn);
  std::free(e->normalized_dn);
  std::free(e->dn);
  std::free(e);
}

attr* attr_find(const entry* e, const char* type, int /*reserved1*/, int /*reserved2*/) {
  if (e == nullptr || type == nullptr) return nullptr;
  const std::string_view wanted(type);
  for (attr* a = e->attributes; a != nullptr; a = a->next)
    if (is_type(*a, wanted)) return a;
  return nullptr;
}

int attr_merge(entry* e, const char* type, berval** values, int /*syntax_normalise*/,
               int check_duplicates, void* /*old*/) {
  if (e == nullptr || type == nullptr || values == nullptr) return kBadArgument;
  const std::size_t count = count_values(values);
  ValueList copies;
  if (const int rc = copy_values(*e, values, count, copies); rc != result::success) return rc;
  attr** const link = link_of(*e, type);
  attr* const present = *link;
  if (present == nullptr) return create_attribute(*e, link, type, std::move(copies));
  try {
    // A secret's code must not depend on its content: whoever may not read it would learn it so.
    if (check_duplicates != 0 && count != 0 && !slapi::is_secret_type(type) &&
        adds_duplicate(*e, *present, copies.get()))
      return result::attribute_or_value_exists;
  } catch (const std::bad_alloc&) {
    return result::no_memory;
  }
  return append_values(*e, *present, std::move(copies), count);
}

int attr_delete(entry* e, const char* type, void* /*old*/) {
  if (e == nullptr || type == nullptr) return kBadArgument;
  attr** const link = link_of(*e, type);
  attr* const doomed = *link;
  if (doomed == nullptr) return 1;
  *link = doomed->next;
  if (is_object_class(type)) set_object_classes(*e, nullptr, nullptr);
  free_attribute(doomed);
  return result::success;
}

int delete_values_from_entry(entry* e, ldapmod* modification) {
  if (e == nullptr || modification == nullptr || modification->mod_type == nullptr)
    return result::other;
  attr* const present = attr_find(e, modification->mod_type, 0, 0);
  if (present == nullptr) return result::no_such_attribute;
  try {
    const std::vector<std::string_view> wanted = values_of(*modification);
    if (wanted.empty()) return attr_delete(e, modification->mod_type, nullptr);
    Doomed doomed(count_values(present->values));
    const int rc = slapi::is_secret_type(present->type) ? doom_earliest(wanted.size(), doomed)
                                                        : doom_equal(*e, *present, wanted, doomed);
    return rc == result::success ? remove_values(*e, *present, doomed) : rc;
  } catch (const std::bad_alloc&) {
    return result::no_memory;
  }
}

int value_find(const attr* a, const berval* value, int syntax, int /*normalise*/) {
  constexpr int present = 0;
  constexpr int absent = 1;
  if (a == nullptr || value == nullptr || a->values == nullptr) return absent;
  const cfg::MatchingRule rule = rule_of(*a, syntax);
  try {
    const std::string key = slapi::equality_key(rule, bytes_of(*value));
    for (berval** held = a->values; *held != nullptr; ++held)
      if (slapi::equality_key(rule, bytes_of(**held)) == key) return present;
  } catch (const std::bad_alloc&) {
    return result::no_memory;
  }
  return absent;
}

int value_find_short_list(const ShortValue* list, const char* bytes, std::size_t length) {
  constexpr int present = 0;
  constexpr int absent = 1;
  if (list == nullptr || bytes == nullptr) return absent;
  const std::string_view wanted(bytes, length);
  for (; list->bytes != nullptr; ++list)
    if (cfg::equals_ignore_ascii_case({list->bytes, list->length}, wanted)) return present;
  return absent;
}

entry* CFGMessage2Entry(_CFG* session, _CFGMessage* record) {
  EntryPtr e(static_cast<entry*>(std::calloc(1, sizeof(entry))));
  if (e == nullptr) return nullptr;
  e->local_code_page = true;
  if (read_dn(session, record, *e) != result::success) return nullptr;
  if (read_attributes(session, record, *e) != result::success) return nullptr;
  return e.release();
}

void charray_free(char** array) {
  if (array == nullptr) return;
  for (char** text = array; *text != nullptr; ++text) std::free(*text);
  std::free(array);
}

}  // namespace orv
