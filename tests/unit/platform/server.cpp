// The server's side of the scripted platform: entries, names, code page, parameter block, trace.
#include <cctype>
#include <cerrno>
#include <cstdarg>
#include <cstring>

#include "platform/platform.h"
#include "platform/real.h"
#include "slapi/codepage.h"
#include "slapi/dn.h"
#include "slapi/globals.h"
#include "slapi/log.h"
#include "slapi/psearch.h"
#include "slapi/services.h"
#include "slapi/strings.h"
#include "slapi/trace.h"

namespace orv {
namespace {

using scripted::Call;
using scripted::Event;
using scripted::Owned;
using scripted::Platform;
using scripted::Unobserved;

Platform& platform() {
  return *Platform::current();
}

std::string formatted(const char* format, std::va_list arguments) {
  char text[8192];
  std::vsnprintf(text, sizeof text, format, arguments);
  return text;
}

}  // namespace

// ---- Settings

std::atomic<int> g_srvType{0};
std::atomic<int> g_safe_mode{0};
std::atomic<int> default_autolock{1};
std::atomic<int> al_configfile_counter{0};
std::atomic<int> configfile_read{1};
std::atomic<std::uint32_t> trcEvents{0};

const char* ldap_getenv(const char* name) {
  const Call call("ldap_getenv", name);
  const auto found = platform().environment.find(name);
  return found == platform().environment.end() ? nullptr : found->second.c_str();
}

// ---- Trace and debug output

ldtr_function_local::ldtr_function_local(std::uint32_t function) noexcept : function_(function) {
  const Unobserved unobserved;
  if ((trcEvents & kTraceEntry) == 0) return;
  platform().record({Event::Kind::entry, {}, "", function_});
}

ldtr_function_local::ldtr_function_local(std::uint32_t function, const char* format, ...) noexcept
    : function_(function) {
  const Unobserved unobserved;
  if ((trcEvents & kTraceEntry) == 0) return;
  std::va_list arguments;
  va_start(arguments, format);
  platform().record({Event::Kind::entry, {}, formatted(format, arguments), function_});
  va_end(arguments);
}

ldtr_function_local::~ldtr_function_local() {
  const Unobserved unobserved;
  if ((trcEvents & kTraceExit) == 0) return;
  platform().record({Event::Kind::exit, {}, std::to_string(code_), function_});
}

void ldtr_function_local::debug(std::uint32_t category, const char* format, ...) const noexcept {
  const Unobserved unobserved;
  if (!debugging()) return;
  std::va_list arguments;
  va_start(arguments, format);
  platform().record({Event::Kind::debug, {}, formatted(format, arguments), category});
  va_end(arguments);
  errno = EIO;  // as output may: whoever needs the number has kept it
}

bool read_ldap_debug() {
  return platform().server_debug;
}

void PrintDebug(std::uint32_t category, const char* format, ...) {
  const Unobserved unobserved;
  std::va_list arguments;
  va_start(arguments, format);
  platform().record({Event::Kind::print_debug, {}, formatted(format, arguments), category});
  va_end(arguments);
}

// The arguments that come with a message are texts; their number goes with the message's.
void PrintMessage(int severity, int set, int number, ...) {
  const Unobserved unobserved;
  const int count = number == 179 ? 1 : number == 174 || number == 167 ? 2 : 0;
  std::string text =
      scripted::show(severity) + ", " + scripted::show(set) + ", " + scripted::show(number);
  std::va_list arguments;
  va_start(arguments, number);
  for (int i = 0; i < count; ++i) text += ", " + scripted::show(va_arg(arguments, const char*));
  va_end(arguments);
  platform().begin_call("PrintMessage", "PrintMessage(" + text + ")");
}

// ---- Texts

char* slapi_ch_strdup(const char* text) {
  const Call call("slapi_ch_strdup", text);
  if (text == nullptr || call.failure_or_no_memory()) return nullptr;
  return platform().give_text(Owned::text, text);
}

int kel_strcasecmp(const char* a, const char* b) {
  const Call call("kel_strcasecmp", a, b);
  if (call.failure()) return *call.failure();
  if (a == nullptr || b == nullptr) return a == b ? 0 : 1;
  return strcasecmp(a, b);
}

const char* kel_strcasestr(const char* text, const char* needle) {
  const Call call("kel_strcasestr", text, needle);
  if (text == nullptr || needle == nullptr) return nullptr;
  return strcasestr(text, needle);
}

bool is_string_alphanum(const char* text) {
  const Call call("is_string_alphanum", text);
  if (call.failure()) return *call.failure() != 0;
  if (text == nullptr || *text == '\0') return false;
  for (const char* c = text; *c != '\0'; ++c) {
    if (std::isalnum(static_cast<unsigned char>(*c)) == 0) return false;
  }
  return true;
}

std::size_t kel_strlcpy(char* target, const char* source, std::size_t size) {
  const Call call("kel_strlcpy", source, size);
  std::snprintf(target, size, "%s", source);
  if (call.failure()) return static_cast<std::size_t>(*call.failure());
  return std::strlen(source);
}

std::size_t kel_strlcat(char* target, const char* source, std::size_t size) {
  const Call call("kel_strlcat", target, source, size);
  const std::size_t before = std::strlen(target);
  std::snprintf(target + before, size - before, "%s", source);
  if (call.failure()) return static_cast<std::size_t>(*call.failure());
  return before + std::strlen(source);
}

int kel_asprintf(char** result, const char* format, ...) {
  const Call call("kel_asprintf", format);
  *result = nullptr;
  if (call.failure_or_no_memory()) return -1;
  std::va_list arguments;
  va_start(arguments, format);
  const std::string text = formatted(format, arguments);
  va_end(arguments);
  *result = platform().give_text(Owned::text, text);
  platform().name(*result, "text");
  return static_cast<int>(text.size());
}

void* safe_realloc(void* memory, std::size_t size) {
  const Call call("safe_realloc", size);
  if (call.failure_or_no_memory()) return nullptr;
  platform().freed(memory);
  void* resized = __real_realloc(memory, size);
  platform().note(resized, Owned::memory);
  return resized;
}

// ---- Addresses

bool isValidIPAddressOnSystem(const char* address) {
  const Call call("isValidIPAddressOnSystem", address);
  return platform().addresses.contains(address);
}

// ---- Code page: Latin-1, of which only the letter a-umlaut counts

namespace {

int convert(const Call& call, const char* text, const char* from, const char* to, char** result,
            std::size_t* length) {
  if (!call.failure() || !platform().results_left_alone) {
    *result = nullptr;
    *length = 0;
  }
  const auto failure = call.failure_or_no_memory();
  if (failure && !(call.failure() && platform().failed_text_is_left)) return *failure;
  std::string converted = text;
  for (std::size_t at = converted.find(from); at != std::string::npos;
       at = converted.find(from, at + std::strlen(to))) {
    converted.replace(at, std::strlen(from), to);
  }
  *result = platform().give_text(Owned::text, converted);
  *length = converted.size() + 1;
  return failure.value_or(0);
}

constexpr const char* kLocalLetter = "\xE4";
constexpr const char* kUtf8Letter = "\xC3\xA4";

}  // namespace

int initIconvHandle() {
  const Call call("initIconvHandle");
  return call.failure().value_or(0);
}

int xlate_localcp_to_utf8(const char* text, char** result, std::size_t* length) {
  const Call call("xlate_localcp_to_utf8", text);
  return convert(call, text, kLocalLetter, kUtf8Letter, result, length);
}

int xlate_utf8_to_localcp(const char* text, char** result, std::size_t* length) {
  const Call call("xlate_utf8_to_localcp", text);
  return convert(call, text, kUtf8Letter, kLocalLetter, result, length);
}

// ---- Names: blanks around separators go; the normal form is in upper case

namespace {

std::string cleaned(const char* dn, bool upper) {
  std::string text;
  for (const char* c = dn; *c != '\0'; ++c) {
    const bool separator_before = !text.empty() && (text.back() == ',' || text.back() == '=');
    if (*c == ' ' && separator_before) continue;
    while ((*c == ',' || *c == '=') && !text.empty() && text.back() == ' ') text.pop_back();
    text += upper ? static_cast<char>(std::toupper(static_cast<unsigned char>(*c))) : *c;
  }
  return text;
}

}  // namespace

int replace_DN(char** dn, int fold) {
  const Call call("replace_DN", *dn, fold);
  if (const auto failure = call.failure_or_no_memory()) return *failure;
  char* normalized =
      platform().give_text(Owned::text, cleaned(*dn, fold == 1 && !platform().keeps_letter_case));
  platform().take_back(*dn, Owned::text, "replace_DN");
  *dn = normalized;
  return 0;
}

ldap_escDN* dn_normalize_light_esc(const char* dn) {
  const Call call("dn_normalize_light_esc", dn);
  if (call.failure_or_no_memory() && call.failure().value_or(0) == 0) return nullptr;
  auto* escaped = static_cast<ldap_escDN*>(platform().give(Owned::escaped_dn, sizeof(ldap_escDN)));
  escaped->error = call.failure().value_or(0);
  if (escaped->error == 0) {
    escaped->normalized = platform().give_text(Owned::part, cleaned(dn, false));
  }
  platform().name(escaped, "escaped DN");
  return escaped;
}

void free_ldap_escDN(ldap_escDN* dn) {
  const Call call("free_ldap_escDN", dn);
  if (dn == nullptr) return;
  platform().dispose(dn->normalized);
  platform().take_back(dn, Owned::escaped_dn, "free_ldap_escDN");
}

int slapi_dn_compare_v3(const char* a, const char* b) {
  const Call call("slapi_dn_compare_v3", a, b);
  if (call.failure()) return *call.failure();
  if (a == nullptr || b == nullptr) return -1;
  return cleaned(a, true) == cleaned(b, true) ? 0 : 1;
}

// The parent of a scripted DN begins after its first comma.
char* dn_parent_norm(const Backend* backend, const char* normalized_dn) {
  const Call call("dn_parent_norm", backend, normalized_dn);
  const char* comma = std::strchr(normalized_dn, ',');
  if (comma == nullptr || call.failure_or_no_memory()) return nullptr;
  return platform().give_text(Owned::text, comma + 1);
}

int are_nested_dn(const char* a, const char* b) {
  const Call call("are_nested_dn", a, b);
  if (call.failure()) return *call.failure();
  const bool first_is_longer = std::strlen(a) > std::strlen(b);
  const std::string longer = "," + std::string(first_is_longer ? a : b);
  return longer.ends_with("," + std::string(first_is_longer ? b : a)) ? 1 : 0;
}

// ---- Entries

namespace {

attr** place_of(entry* e, const char* type) {
  attr** place = &e->attributes;
  while (*place != nullptr && strcasecmp((*place)->type, type) != 0) place = &(*place)->next;
  return place;
}

void dispose_attribute(attr* a) {
  for (berval** value = a->values; value != nullptr && *value != nullptr; ++value) {
    platform().dispose((*value)->bv_val);
    platform().dispose(*value);
  }
  platform().dispose(a->values);
  platform().dispose(a->type);
  platform().dispose(a);
}

berval* copy_of(const berval& value) {
  auto* copy = static_cast<berval*>(platform().give(Owned::value, sizeof(berval)));
  const std::string bytes =
      value.bv_val == nullptr ? std::string() : std::string(value.bv_val, value.bv_len);
  copy->bv_len = bytes.size();
  copy->bv_val = platform().give_text(Owned::value, bytes);
  return copy;
}

attr* make_attribute(const char* type, berval** values) {
  auto* a = static_cast<attr*>(platform().give(Owned::part, sizeof(attr)));
  a->type = platform().give_text(Owned::part, type);
  while (values[a->count] != nullptr) ++a->count;
  if (a->count == 0 && platform().empty_lists_are_null) return a;
  const auto count = static_cast<std::size_t>(a->count);
  a->values = static_cast<berval**>(platform().give(Owned::part, (count + 1) * sizeof(berval*)));
  for (std::size_t i = 0; i < count; ++i) a->values[i] = copy_of(*values[i]);
  return a;
}

void append_values(attr& a, berval** values) {
  std::size_t count = 0;
  while (values[count] != nullptr) ++count;
  const auto before = static_cast<std::size_t>(a.count);
  auto** all =
      static_cast<berval**>(platform().give(Owned::part, (before + count + 1) * sizeof(berval*)));
  for (std::size_t i = 0; i < before; ++i) all[i] = a.values[i];
  for (std::size_t i = 0; i < count; ++i) all[before + i] = copy_of(*values[i]);
  platform().dispose(a.values);
  a.values = all;
  a.count = static_cast<int>(before + count);
}

// False when the attribute has no such value.
bool take_value(attr& a, const berval& value) {
  berval** place = a.values;
  while (*place != nullptr && std::strcmp((*place)->bv_val, value.bv_val) != 0) ++place;
  if (*place == nullptr) return false;
  platform().dispose((*place)->bv_val);
  platform().dispose(*place);
  for (; *place != nullptr; ++place) place[0] = place[1];
  --a.count;
  return true;
}

// The reference to the object class attribute, and its values in short.
void refresh_object_classes(entry* e) {
  e->object_classes = *place_of(e, "objectClass");
  platform().dispose(e->object_class_list);
  e->object_class_list = nullptr;
  if (e->object_classes == nullptr) return;
  const auto count = static_cast<std::size_t>(e->object_classes->count);
  e->object_class_list =
      static_cast<ShortValue*>(platform().give(Owned::part, (count + 1) * sizeof(ShortValue)));
  for (std::size_t i = 0; i < count; ++i) {
    const berval& value = *e->object_classes->values[i];
    e->object_class_list[i] = {value.bv_val, value.bv_len};
  }
}

void fill(entry* e, const std::vector<scripted::ScriptedAttribute>& attributes) {
  for (const scripted::ScriptedAttribute& a : attributes) {
    std::vector<berval> values;
    for (const std::string& text : a.values) {
      values.push_back({text.size(), const_cast<char*>(text.c_str())});
    }
    std::vector<berval*> pointers;
    pointers.reserve(values.size() + 1);
    for (berval& value : values) pointers.push_back(&value);
    pointers.push_back(nullptr);
    *place_of(e, a.type.c_str()) = make_attribute(a.type.c_str(), pointers.data());
  }
  refresh_object_classes(e);
}

std::string show_values(berval** values) {
  std::string text;
  for (berval** value = values; value != nullptr && *value != nullptr; ++value) {
    text += (value == values ? "" : ",");
    text += (*value)->bv_val == nullptr ? "<null " + std::to_string((*value)->bv_len) + ">"
                                        : std::string((*value)->bv_val, (*value)->bv_len);
  }
  return text;
}

}  // namespace

void entry_free(entry* e) {
  const Call call("entry_free", e == nullptr ? nullptr : "entry");
  if (e == nullptr) return;
  while (e->attributes != nullptr) {
    attr* next = e->attributes->next;
    dispose_attribute(e->attributes);
    e->attributes = next;
  }
  platform().dispose(e->dn);
  platform().dispose(e->normalized_dn);
  platform().dispose(e->requested_dn);
  platform().dispose(e->object_class_list);
  platform().dispose(e);
}

attr* attr_find(const entry* e, const char* type, int reserved1, int reserved2) {
  const Call call("attr_find", type, reserved1, reserved2);
  return e == nullptr ? nullptr : *place_of(const_cast<entry*>(e), type);
}

int attr_merge(entry* e, const char* type, berval** values, int syntax_normalise,
               int check_duplicates, void* old) {
  const Call call("attr_merge", type, show_values(values).c_str(), syntax_normalise,
                  check_duplicates, old);
  if (const auto failure = call.failure_or_no_memory()) return *failure;
  attr** place = place_of(e, type);
  if (*place == nullptr) {
    *place = make_attribute(type, values);
  } else {
    append_values(**place, values);
  }
  refresh_object_classes(e);
  return 0;
}

int attr_delete(entry* e, const char* type, void* old) {
  const Call call("attr_delete", type, old);
  if (call.failure()) return *call.failure();
  attr** place = place_of(e, type);
  attr* found = *place;
  if (found == nullptr) return 1;
  *place = found->next;
  dispose_attribute(found);
  refresh_object_classes(e);
  return 0;
}

// Value by value: what was taken before one that is missing stays away.
int delete_values_from_entry(entry* e, ldapmod* modification) {
  berval** values = modification->mod_vals.modv_bvals;
  const Call call("delete_values_from_entry", modification->mod_type, show_values(values).c_str());
  if (const auto failure = call.failure_or_no_memory()) return *failure;
  attr** place = place_of(e, modification->mod_type);
  attr* found = *place;
  if (found == nullptr) return 16;
  for (berval** value = values; value != nullptr && *value != nullptr; ++value) {
    if (!take_value(*found, **value)) return 16;
  }
  if (values == nullptr || values[0] == nullptr || found->count == 0) {
    *place = found->next;
    dispose_attribute(found);
  }
  refresh_object_classes(e);
  return 0;
}

int value_find(const attr* a, const berval* value, int syntax, int normalise) {
  const Call call("value_find", a->type, std::string(value->bv_val, value->bv_len).c_str(), syntax,
                  normalise);
  if (call.failure()) return *call.failure();
  for (berval** v = a->values; v != nullptr && *v != nullptr; ++v) {
    if ((*v)->bv_len == value->bv_len &&
        std::memcmp((*v)->bv_val, value->bv_val, value->bv_len) == 0) {
      return 0;
    }
  }
  return 1;
}

int value_find_short_list(const ShortValue* list, const char* bytes, std::size_t length) {
  const Call call("value_find_short_list", std::string(bytes, length).c_str(), length);
  if (call.failure()) return *call.failure();
  for (const ShortValue* v = list; v != nullptr && v->bytes != nullptr; ++v) {
    if (v->length == length && strncasecmp(v->bytes, bytes, length) == 0) return 0;
  }
  return 1;
}

entry* CFGMessage2Entry(_CFG* session, _CFGMessage* record) {
  const Call call("CFGMessage2Entry", session, record);
  if (call.failure_or_no_memory()) return nullptr;
  entry* e = static_cast<entry*>(platform().give(Owned::part, sizeof(entry)));
  e->dn = platform().give_text(Owned::part, "as the file spells it");
  e->local_code_page = true;
  fill(e, scripted::attributes_of(record));
  return e;
}

void charray_free(char** array) {
  const Call call("charray_free", array == nullptr ? nullptr : "array");
  if (array == nullptr) return;
  for (char** value = array; *value != nullptr; ++value) {
    platform().take_back(*value, Owned::cfg_value, "charray_free");
  }
  platform().take_back(array, Owned::cfg_values, "charray_free");
}

int ldcf_api_schema_check(entry* e, int reserved1, int reserved2) {
  const Call call("ldcf_api_schema_check", e, reserved1, reserved2);
  return call.failure().value_or(0);
}

int checkReferral(entry* e) {
  const Call call("checkReferral", e);
  return call.failure().value_or(0);
}

// ---- Lists of modifications

namespace {

// A record that adds the texts of an attribute; null texts are shown.
ldapmod* make_modification(const attr& a) {
  auto* mod = static_cast<ldapmod*>(platform().give(Owned::mods, sizeof(ldapmod)));
  mod->mod_type = platform().give_text(Owned::part, a.type);
  std::size_t count = 0;
  while (a.values != nullptr && a.values[count] != nullptr) ++count;
  auto** texts = static_cast<char**>(platform().give(Owned::part, (count + 1) * sizeof(char*)));
  for (std::size_t i = 0; i < count; ++i) {
    const char* text = a.values[i]->bv_val;
    texts[i] = platform().give_text(Owned::part, text == nullptr ? "<null>" : text);
  }
  mod->mod_vals.modv_strvals = texts;
  return mod;
}

}  // namespace

ldapmod** EntryToLDAPMod(attr* attributes) {
  const Call call("EntryToLDAPMod");
  if (attributes == nullptr || call.failure_or_no_memory()) return nullptr;
  std::size_t count = 0;
  for (const attr* a = attributes; a != nullptr; a = a->next) ++count;
  auto** list =
      static_cast<ldapmod**>(platform().give(Owned::text, (count + 1) * sizeof(ldapmod*)));
  platform().name(list, "modifications");
  ldapmod** place = list;
  for (const attr* a = attributes; a != nullptr; a = a->next, ++place) {
    *place = make_modification(*a);
    if (place != list) place[-1]->mod_next = *place;
  }
  platform().name(list[0], "first modification");
  return list;
}

namespace {

// Values go by the arm that the flag names.
void dispose_modification(ldapmod* mod, Owned kind, const char* function) {
  if ((mod->mod_op & kModBvalues) != 0) {
    berval** const values = mod->mod_vals.modv_bvals;
    for (berval** value = values; value != nullptr && *value != nullptr; ++value) {
      platform().dispose((*value)->bv_val);
      platform().dispose(*value);
    }
    platform().dispose(values);
  } else {
    char** const texts = mod->mod_vals.modv_strvals;
    for (char** text = texts; text != nullptr && *text != nullptr; ++text) {
      platform().dispose(*text);
    }
    platform().dispose(texts);
  }
  platform().dispose(mod->mod_type);
  platform().take_back(mod, kind, function);
}

}  // namespace

void free_ldmll(ldapmod* first) {
  const Call call("free_ldmll", first);
  while (first != nullptr) {
    ldapmod* next = first->mod_next;
    dispose_modification(first, Owned::mods, "free_ldmll");
    first = next;
  }
}

void ldap_mods_free(ldapmod** array, int free_array) {
  const Call call("ldap_mods_free", array == nullptr ? nullptr : "list", free_array);
  if (array == nullptr) return;
  for (ldapmod** mod = array; *mod != nullptr; ++mod) {
    dispose_modification(*mod, Owned::memory, "ldap_mods_free");
  }
  if (free_array != 0) platform().take_back(array, Owned::memory, "ldap_mods_free");
}

// ---- Pass-through authentication

int verifyAttributeMapping(const char* mapping, void* reserved1, void* reserved2) {
  const Call call("verifyAttributeMapping", mapping, reserved1, reserved2);
  return call.failure().value_or(0);
}

int ldap_url_parse(const char* url, LDAPURLDesc** description) {
  const Call call("ldap_url_parse", url);
  *description = nullptr;
  if (const auto failure = call.failure_or_no_memory()) return *failure;
  *description = static_cast<LDAPURLDesc*>(platform().give(Owned::url, sizeof(LDAPURLDesc)));
  platform().name(*description, "description");
  return 0;
}

void ldap_free_urldesc(LDAPURLDesc* description) {
  const Call call("ldap_free_urldesc", description);
  platform().take_back(description, Owned::url, "ldap_free_urldesc");
}

// ---- Persistent searches

bool PSearchMonitor::begin(int most) noexcept {
  if (current_ >= most) return false;
  ++current_;
  return true;
}

// ---- Passwords

bool pwdIsAdminPolicyOn() {
  const Call call("pwdIsAdminPolicyOn");
  return platform().admin_policy;
}

bool pwdIsAdminPasswordLockoutOn() {
  const Call call("pwdIsAdminPasswordLockoutOn");
  return call.failure().value_or(0) != 0;
}

_Admin_pwdPolicy getGlobalAdminPWDPolicyLocal() {
  const Call call("getGlobalAdminPWDPolicyLocal");
  return platform().policy;
}

int validate_new_settings(_Admin_pwdPolicy policy, bool check_all) {
  const Call call("validate_new_settings", static_cast<int>(check_all));
  platform().validated = policy;
  return call.failure().value_or(0);
}

AdminPasswordRecord* findAdminPWDPAttrib(const char* dn) {
  const Call call("findAdminPWDPAttrib", dn);
  return platform().administrator_record;
}

int unformat_password(const char* stored, char** clear, const void* key, int reserved) {
  const Call call("unformat_password", stored, key, reserved);
  *clear = nullptr;
  if (call.failure()) return *call.failure();
  const std::string text = stored;
  if (!text.starts_with("{sealed}")) return 0;
  if (call.failure_or_no_memory()) return -1;
  *clear = platform().give_text(Owned::text, text.substr(std::strlen("{sealed}")));
  return 1;
}

int convertPWEncryptionMethod(const char* name, int* method) {
  const Call call("convertPWEncryptionMethod", name, *method);
  if (name != nullptr && std::string(name) == "known") *method = 3;  // also with a failure
  return call.failure().value_or(0);
}

Backend* select_backend_opt(const char* dn) {
  const Call call("select_backend_opt", dn);
  return platform().localhost_backend;
}

int getAllPluginFuncs(Backend* backend, int number, PluginFunction** list) {
  const Call call("getAllPluginFuncs", backend, number);
  *list = platform().plugin_functions;  // also where the code says that there are none
  return call.failure().value_or(0);
}

// A supplier of the suffixes that the script names; null for the server as a whole.
int checkMasterSrvDn(const char* suffix, const char* dn) {
  const Call call("checkMasterSrvDn", suffix, dn);
  if (call.failure()) return *call.failure();
  const auto found = platform().supplied.find(suffix == nullptr ? "" : suffix);
  return found == platform().supplied.end() ? 0 : found->second;
}

int verify_admin_password(char* new_password, char* old_password, Operation* operation) {
  const Call call("verify_admin_password", new_password, old_password, operation);
  if (platform().password_is_overwritten) std::memset(new_password, 0, std::strlen(new_password));
  return call.failure().value_or(0);
}

// ---- Controls

int ldap_insert_control(LDAPControl* control, LDAPControl*** list) {
  const Call call("ldap_insert_control", control);
  if (const auto failure = call.failure_or_no_memory()) return *failure;
  *list = static_cast<LDAPControl**>(platform().give(Owned::text, 2 * sizeof(LDAPControl*)));
  platform().name(*list, "controls");
  (*list)[0] = control;
  return 0;
}

int slapi_register_supported_control(const char* oid, int operations) {
  const Call call("slapi_register_supported_control", oid, operations);
  return call.failure().value_or(0);
}

// ---- The parameter block

int slapi_pblock_get(pblock* pb, int number, void* value) {
  const Call call("slapi_pblock_get", number);
  if (call.failure()) return *call.failure();
  const auto found = pb->values.find(number);
  const bool required = number == 50 || number == 60 || (number >= 130 && number <= 132);
  if (required && found == pb->values.end()) return -1;
  const pblock::Value unset{nullptr, 0, number == 110 || number == 117 || number == -141};
  const pblock::Value& stored = found == pb->values.end() ? unset : found->second;
  if (stored.is_number) {
    std::memcpy(value, &stored.number, sizeof stored.number);
  } else {
    std::memcpy(value, &stored.pointer, sizeof stored.pointer);
  }
  return 0;
}

int slapi_pblock_set(pblock* pb, int number, Handler value) {
  const Call call("slapi_pblock_set", number, value);
  if (call.failure()) return *call.failure();
  pb->put(number, reinterpret_cast<const void*>(value));
  return 0;
}

int slapi_pblock_set(pblock* pb, int number, InstanceStart value) {
  const Call call("slapi_pblock_set", number, value);
  if (call.failure()) return *call.failure();
  pb->put(number, reinterpret_cast<const void*>(value));
  return 0;
}

int slapi_pblock_set(pblock* pb, int number, std::nullptr_t value) {
  const Call call("slapi_pblock_set", number, value);
  if (call.failure()) return *call.failure();
  pb->put(number, static_cast<const void*>(nullptr));
  return 0;
}

int slapi_pblock_set(pblock* pb, int number, void* value) {
  const Call call("slapi_pblock_set", pb, number, value);
  if (call.failure()) return *call.failure();
  pb->put(number, static_cast<const void*>(value));
  return 0;
}

pblock* getGlobalPBlock() {
  const Call call("getGlobalPBlock");
  return &platform().global_parameters;
}

// ---- Answers to the client

int send_ldap_result(Connection* connection, Operation* operation, int code, const char* matched_dn,
                     const char* text) {
  const Call call("send_ldap_result", connection, operation, code, matched_dn, text);
  if (connection == nullptr) return 80;
  return call.failure().value_or(0);
}

namespace {

int send_search_entry(Backend* backend, Connection* connection, Operation* operation, entry* e,
                      char** attributes, int types_only, void* reserved1, void* reserved2,
                      void* reserved3, LDAPControl** controls) {
  const Call call("send_search_entry", backend, connection, operation, e->dn, attributes,
                  types_only, reserved1, reserved2, reserved3,
                  controls == nullptr ? static_cast<LDAPControl*>(nullptr) : controls[0]);
  if (call.failure()) return *call.failure();
  platform().sent.push_back(scripted::text_of(*e));
  return 0;
}

int send_search_result(Connection* connection, Operation* operation, int code,
                       const char* matched_dn, const char* text, int entries) {
  const Call call("send_search_result", connection, operation, code, matched_dn, text, entries);
  return call.failure().value_or(0);
}

}  // namespace

namespace scripted {

void connect(Connection& connection) {
  connection.send_search_entry = send_search_entry;
  connection.send_search_result = send_search_result;
  connection.send_result = nullptr;  // only through send_ldap_result
}

entry* make_entry(const ScriptedEntry& script) {
  auto* e = static_cast<entry*>(platform().give(Owned::part, sizeof(entry)));
  e->dn = platform().give_text(Owned::part, script.dn);
  e->normalized_dn = platform().give_text(Owned::part, cleaned(script.dn.c_str(), true));
  fill(e, script.attributes);
  return e;
}

namespace {

berval** make_values(const std::vector<std::string>& texts) {
  auto** const values =
      static_cast<berval**>(platform().give(Owned::value, (texts.size() + 1) * sizeof(berval*)));
  for (std::size_t i = 0; i < texts.size(); ++i) {
    values[i] = static_cast<berval*>(platform().give(Owned::value, sizeof(berval)));
    values[i]->bv_len = texts[i].size();
    values[i]->bv_val = platform().give_text(Owned::value, texts[i]);
  }
  return values;
}

char** make_strings(const std::vector<std::string>& texts) {
  auto** const strings =
      static_cast<char**>(platform().give(Owned::value, (texts.size() + 1) * sizeof(char*)));
  for (std::size_t i = 0; i < texts.size(); ++i) {
    strings[i] = platform().give_text(Owned::value, texts[i]);
  }
  return strings;
}

}  // namespace

ldapmod* make_modifications(const std::vector<ScriptedModification>& script) {
  ldapmod* first = nullptr;
  ldapmod** place = &first;
  for (const ScriptedModification& scripted : script) {
    auto* const mod = static_cast<ldapmod*>(platform().give(Owned::mods, sizeof(ldapmod)));
    mod->mod_op = scripted.code;
    mod->mod_type = platform().give_text(Owned::part, scripted.type);
    if (scripted.values && (scripted.code & kModBvalues) != 0) {
      mod->mod_vals.modv_bvals = make_values(*scripted.values);
    } else if (scripted.values) {
      mod->mod_vals.modv_strvals = make_strings(*scripted.values);
    }
    *place = mod;
    place = &mod->mod_next;
  }
  if (first != nullptr) platform().name(first, "modifications");
  return first;
}

std::string text_of(const ldapmod* first) {
  std::string text;
  for (const ldapmod* m = first; m != nullptr; m = m->mod_next) {
    char code[16];
    std::snprintf(code, sizeof code, "0x%02x ", static_cast<unsigned>(m->mod_op));
    text += (m == first ? "" : "|") + std::string(code) + m->mod_type;
    if (m->mod_vals.modv_bvals != nullptr) text += "=" + show_values(m->mod_vals.modv_bvals);
  }
  return text;
}

std::string text_of(const entry& e) {
  std::string text = e.dn == nullptr ? "<null>" : e.dn;
  for (const attr* a = e.attributes; a != nullptr; a = a->next) {
    text += "|" + std::string(a->type) + "=" + show_values(a->values);
  }
  return text;
}

}  // namespace scripted
}  // namespace orv
