// Modification records: the list form of an entry, and the release of lists.

#include <memory>
#include <utility>

#include "admitted.h"
#include "memory.h"
#include "reserves.h"
#include "slapi/entry.h"

namespace orv {
namespace {

// ---- Release ---------------------------------------------------------------------------------

void free_strings(char** strings) noexcept {
  if (strings == nullptr) return;
  for (char** text = strings; *text != nullptr; ++text) slapi::wipe_and_free(*text);
  std::free(strings);
}

void free_counted(berval** values) noexcept {
  if (values == nullptr) return;
  for (berval** value = values; *value != nullptr; ++value) {
    slapi::wipe_and_free((*value)->bv_val);
    std::free(*value);
  }
  std::free(values);
}

// Stands in a list that could not be made: an add record without a type, which no change accepts.
ldapmod& refused_record() noexcept {
  static ldapmod record{};
  return record;
}

void free_record(ldapmod* record) noexcept {
  if (record == nullptr || record == &refused_record()) return;
  if ((record->mod_op & kModBvalues) != 0)
    free_counted(record->mod_vals.modv_bvals);
  else
    free_strings(record->mod_vals.modv_strvals);
  std::free(record->mod_type);
  std::free(record);
}

struct RecordDeleter {
  void operator()(ldapmod* record) const noexcept { free_record(record); }
};
using RecordPtr = std::unique_ptr<ldapmod, RecordDeleter>;

// ---- The list form of attributes -------------------------------------------------------------

std::size_t count_values(const attr& a) noexcept {
  std::size_t count = 0;
  while (a.values != nullptr && a.values[count] != nullptr) ++count;
  return count;
}

// Values are read up to their NUL: in a translated list their lengths count it. Null without
// memory, and for a value without a text, which is what is left of one whose translation failed.
char* copy_value(const berval& value) noexcept {
  return value.bv_val == nullptr ? nullptr : slapi::copy_bytes(value.bv_val);
}

// Null without memory.
RecordPtr make_record(const attr& a) noexcept {
  RecordPtr record(static_cast<ldapmod*>(std::calloc(1, sizeof(ldapmod))));
  if (record == nullptr) return nullptr;
  record->mod_op = kModAdd;
  record->mod_type = slapi::copy_bytes(a.type == nullptr ? "" : a.type);
  if (record->mod_type == nullptr) return nullptr;
  const std::size_t count = count_values(a);
  if (count == 0) return record;  // "no values" is a null array
  auto** const strings = static_cast<char**>(std::calloc(count + 1, sizeof(char*)));
  record->mod_vals.modv_strvals = strings;
  if (strings == nullptr) return nullptr;
  for (std::size_t i = 0; i < count; ++i) {
    strings[i] = copy_value(*a.values[i]);
    if (strings[i] == nullptr) return nullptr;
  }
  return record;
}

ldapmod** new_array(std::size_t records) noexcept {
  return static_cast<ldapmod**>(std::calloc(records + 1, sizeof(ldapmod*)));
}

// The array that says that the list could not be made. `array` is reused when there is one.
ldapmod** refusal(ldapmod** array) noexcept {
  if (array == nullptr) array = static_cast<ldapmod**>(slapi::list_reserve().take());
  if (array == nullptr) return nullptr;
  free_ldmll(array[0]);
  array[0] = &refused_record();
  array[1] = nullptr;
  return array;
}

std::size_t count_attributes(const attr* attributes) noexcept {
  std::size_t count = 0;
  for (; attributes != nullptr; attributes = attributes->next) ++count;
  return count;
}

// ---- The entry of this thread's last schema check --------------------------------------------

struct CheckedEntry {
  const char* first_type = nullptr;  // compared, never read
  std::size_t attributes = 0;
};

CheckedEntry& checked_entry() noexcept {
  thread_local CheckedEntry checked;
  return checked;
}

}  // namespace

void slapi::note_checked_entry(const entry& e) noexcept {
  checked_entry() = {e.attributes == nullptr ? nullptr : e.attributes->type,
                     count_attributes(e.attributes)};
}

bool slapi::is_cut_short(const attr* attributes) noexcept {
  const CheckedEntry checked = std::exchange(checked_entry(), CheckedEntry{});
  return attributes != nullptr && attributes->type != nullptr &&
         attributes->type == checked.first_type &&
         count_attributes(attributes) < checked.attributes;
}

ldapmod** EntryToLDAPMod(attr* attributes) {
  if (attributes == nullptr) return nullptr;
  slapi::list_reserve().fill();
  ldapmod** const array = new_array(count_attributes(attributes));
  if (array == nullptr || slapi::is_cut_short(attributes)) return refusal(array);
  ldapmod** next = array;
  ldapmod** link = nullptr;
  for (const attr* a = attributes; a != nullptr; a = a->next) {
    ldapmod* const record = make_record(*a).release();
    if (record == nullptr) return refusal(array);
    *next++ = record;
    if (link != nullptr) *link = record;
    link = &record->mod_next;
  }
  return array;
}

void free_ldmll(ldapmod* first) {
  while (first != nullptr) {
    ldapmod* const next = first->mod_next;
    free_record(first);
    first = next;
  }
}

void ldap_mods_free(ldapmod** array, int free_array) {
  if (array == nullptr) return;
  for (ldapmod** record = array; *record != nullptr; ++record) free_record(*record);
  if (free_array != 0) std::free(array);
}

}  // namespace orv
