#include "config_xlate.h"

#include <cstdlib>
#include <cstring>
#include <memory>

#include "cfg/owners.h"
#include "cfg/result_codes.h"
#include "config_names.h"
#include "function_ids.h"
#include "name_list.h"
#include "slapi/codepage.h"
#include "slapi/dn.h"
#include "slapi/owners.h"
#include "slapi/strings.h"
#include "slapi/trace.h"

namespace orv {
namespace {

constexpr const char* kNoList = "Error - cfg_read_cfg_entry: rc = %d\n";
constexpr const char* kNoEntry = "Error - cfg_read_cfg_entry: entry %s does not exist!\n";
constexpr const char* kSearchFailed =
    "Error - cfg_read_cfg_entry: cfg_search_s failed with rc =%d for %s.\n";
constexpr const char* kNoFirstRecord = "retrieve_entry: no c_entry\n";

// Tells the library's diagnostics which call failed. True when the last call on the session did.
bool failed_in(_CFG* session, const char* call) {
  if (cfg_get_errno(session) == 0) return false;
  cfg_perror(session, call);
  return true;
}

}  // namespace

// ---- The two directions of the code page

int cfg_xlate_localcp_to_utf8(const char* text, char** result, std::size_t* length) {
  ldtr_function_local trace(function_id::local_to_utf8);
  return trace.exit(xlate_localcp_to_utf8(text, result, length));
}

int cfg_xlate_utf8_to_localcp(const char* text, char** result, std::size_t* length) {
  ldtr_function_local trace(function_id::utf8_to_local);
  return trace.exit(xlate_utf8_to_localcp(text, result, length));
}

int convert(CodePageDirection& direction, const char* text, MallocText& owner) {
  char* converted = nullptr;
  std::size_t length = 0;
  const int rc = direction(text, &converted, &length);
  owner.reset(converted);
  return rc;
}

int normalized_copy(const char* dn, MallocText& copy) {
  char* text = slapi_ch_strdup(dn);
  if (text == nullptr) return result::no_memory;
  const int rc = replace_DN(&text, 1);
  copy.reset(text);
  return rc;
}

// ---- One attribute of one entry

int cfg_read_cfg_entry(_CFG* session, const char* dn, const char* attribute, int scope,
                       _CFGMessage** chain) {
  ldtr_function_local trace(function_id::read_entry);

  const NameList names(attribute);
  if (!names.complete()) {
    trace.debug(trace::error, kNoList, result::no_memory);
    return trace.exit(result::no_memory);
  }

  const int rc = cfg_search_s(session, dn, scope, config_names::any_entry_in_parentheses,
                              names.get(), 0, chain);
  if (rc == result::no_such_object) {
    trace.debug(trace::error, kNoEntry, dn);
    return trace.exit(result::no_such_object);
  }
  if (rc != 0) {
    trace.debug(trace::error, kSearchFailed, rc, dn);
    return trace.exit(result::other);  // the library's own code stays in the trace
  }
  return trace.exit(result::success);
}

// ---- A record of the file as a server entry

namespace {

// The values of one attribute, converted, in the two arrays that `attr_merge` reads them through.
class ConvertedValues {
 public:
  explicit ConvertedValues(char** values) : count_(count(values)) {
    pointers_.reset(static_cast<berval**>(std::calloc(count_ + 1, sizeof(berval*))));
    counted_.reset(static_cast<berval*>(std::calloc(count_ + 1, sizeof(berval))));
    if (complete()) convert(values);
  }
  ~ConvertedValues() {
    pointers_.reset();
    if (counted_ == nullptr) return;
    for (std::size_t i = 0; i < count_; ++i) std::free(counted_.get()[i].bv_val);
  }
  ConvertedValues(const ConvertedValues&) = delete;
  ConvertedValues& operator=(const ConvertedValues&) = delete;

  [[nodiscard]] bool complete() const noexcept {
    return pointers_ != nullptr && counted_ != nullptr;
  }
  [[nodiscard]] berval** get() const noexcept { return pointers_.get(); }

 private:
  static std::size_t count(char** values) noexcept {
    std::size_t n = 0;
    while (values[n] != nullptr) ++n;
    return n;
  }

  void convert(char** values) {
    for (std::size_t i = 0; i < count_; ++i) {
      berval& value = counted_.get()[i];
      // Its code is not looked at: what it refuses is merged as an empty value.
      cfg_xlate_localcp_to_utf8(values[i], &value.bv_val, &value.bv_len);
      if (value.bv_len != 0) --value.bv_len;  // converters count the NUL, entries do not
      pointers_.get()[i] = &value;
    }
  }

  std::size_t count_;
  std::unique_ptr<berval*, FreeDeleter> pointers_;
  std::unique_ptr<berval, FreeDeleter> counted_;
};

void take_dn(_CFG* session, _CFGMessage* record, entry& e) {
  const CfgText dn(cfg_get_dn(session, record));
  if (failed_in(session, "cfg_get_dn") || dn == nullptr) return;
  std::size_t length = 0;
  // Its code is not looked at: an entry whose DN it refuses goes on without one.
  cfg_xlate_localcp_to_utf8(dn.get(), &e.dn, &length);
}

// Without memory for a record's values, the record goes with the entry. It is taken out of its
// chain first, so that the owner of the chain can still release that.
void release_record_of_caller(_CFG* session, _CFGMessage* record) {
  cfg_msg_unlink(session, record);
  std::free(record);
}

// Adds one attribute to the entry. False when there is no memory for it, and then the record is
// gone; what the library cannot read is only left out.
bool take_attribute(_CFG* session, _CFGMessage* record, const char* name, entry& e) {
  CfgValues values(cfg_get_values(session, record, name));
  if (failed_in(session, "cfg_get_values") || values == nullptr) return true;
  const ConvertedValues converted(values.get());
  if (!converted.complete()) {
    // Kept on purpose, like the walk's cursor: whoever runs out of memory here gives up the record,
    // its walk and the values just read.
    static_cast<void>(values.release());
    release_record_of_caller(session, record);  // before the array that there may be
    return false;
  }
  // Its result is not looked at: an attribute that is not merged is only left out.
  attr_merge(&e, name, converted.get(), 1, 1, nullptr);
  return true;
}

}  // namespace

entry* CFGMessage2EntryTrans(_CFG* session, _CFGMessage* record) {
  ldtr_function_local trace(function_id::message_to_entry);

  EntryPtr e(static_cast<entry*>(std::calloc(1, sizeof(entry))));
  if (e == nullptr) {
    trace.exit(result::no_memory);
    return nullptr;
  }
  take_dn(session, record, *e);

  _CFGBer* walk = nullptr;
  CfgText name(cfg_first_attribute(session, record, &walk));
  CfgCursor cursor(walk);
  if (failed_in(session, "cfg_first_attribute")) return e.release();

  while (name != nullptr) {
    if (!take_attribute(session, record, name.get(), *e)) {
      static_cast<void>(cursor.release());  // kept on purpose, see take_attribute
      trace.exit(result::no_memory);
      return nullptr;
    }
    name.reset();
    name.reset(cfg_next_attribute(session, record, cursor.get()));
    failed_in(session, "cfg_next_attribute");
  }
  return e.release();
}

// ---- One entry by its DN

int retrieve_entry(_CFG* session, const char* dn, entry** out) {
  ldtr_function_local trace(function_id::retrieve_entry);
  *out = nullptr;

  // Its code is not looked at: whether there is an entry is told by their number.
  _CFGMessage* found = nullptr;
  cfg_search_s(session, dn, kScopeBase, config_names::any_entry, nullptr, 0, &found);
  CfgResult chain(found);
  if (cfg_count_entries(session, chain.get()) <= 0) return trace.exit(result::no_such_object);

  _CFGMessage* const record = cfg_first_entry(session, chain.get());
  const int error = cfg_get_errno(session);
  if (error != 0) {
    cfg_perror(session, "retrieve_entry: cfg_first_entry");
    return trace.exit(error);
  }
  if (record == nullptr) {
    trace.debug(trace::error, kNoFirstRecord);
    return trace.exit(result::operations_error);
  }

  EntryPtr e(CFGMessage2Entry(session, record));
  chain.reset();
  if (e == nullptr) return trace.exit(result::operations_error);
  e->requested_dn = slapi_ch_strdup(dn);
  if (e->requested_dn == nullptr) return trace.exit(result::no_memory);
  *out = e.release();
  return trace.exit(result::success);
}

// ---- Values

int cfg_value_find(attr* attribute, const char* value) {
  ldtr_function_local trace(function_id::value_find);
  // Borrowed: value_find only reads it.
  const berval borrowed{std::strlen(value), const_cast<char*>(value)};
  return trace.exit(value_find(attribute, &borrowed, attribute->syntax, 1));
}

}  // namespace orv
