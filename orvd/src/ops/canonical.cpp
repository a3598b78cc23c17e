#include "ops/canonical.h"

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <new>
#include <unordered_set>
#include <utility>

#include "cfg/dn.h"
#include "cfg/masked_dn.h"
#include "cfg/result_codes.h"
#include "cfg/secret.h"
#include "cfg/text.h"
#include "ops/equality.h"
#include "ops/modification_list.h"
#include "slapi/codepage.h"

namespace orv::server {
namespace {

constexpr std::string_view kObjectClass = "objectClass";
constexpr std::string_view kDnSyntax = "1.3.6.1.4.1.1466.115.121.1.12";
constexpr std::string_view kTargetNotADn = "the target is not a DN";

Refusal refuse(int code, std::string_view what, std::string_view name = "") {
  if (code == result::no_memory) throw std::bad_alloc();  // that is no fault of the request
  std::string text(what);
  if (!name.empty()) text.append(": ").append(name);
  return {code, std::move(text)};
}

// ---- attribute types and values

Refusal canonical_type(const Schema& schema, const std::string& name, std::string_view& type) {
  if (name.find(';') != std::string::npos)
    return refuse(result::undefined_attribute_type, "attribute options are not supported", name);
  type = schema.canonical_attribute(name);
  if (type.empty()) return refuse(result::undefined_attribute_type, "unknown attribute type", name);
  if (schema.attribute(type)->no_user_modification)
    return refuse(result::constraint_violation, "the server alone sets this attribute", type);
  return {};
}

Refusal check_value(std::string_view type, const std::string& value) {
  if (value.find('\0') != std::string::npos)
    return refuse(result::invalid_attribute_syntax, "value contains a NUL byte", type);
  if (!cfg::is_valid_utf8(value))
    return refuse(result::invalid_attribute_syntax, "value is not UTF-8", type);
  return {};
}

// Canonical spelling of object class values; a class that the schema does not know stays for the
// schema check to refuse.
std::string canonical_value(const Schema& schema, std::string_view type, const std::string& value) {
  if (type != kObjectClass) return value;
  const std::string_view name = schema.canonical_object_class(value);
  return name.empty() ? value : std::string(name);
}

bool has_equal_values(const Schema& schema, std::string_view type,
                      const std::vector<std::string>& values) {
  if (values.size() < 2) return false;
  std::vector<std::string> keys;
  keys.reserve(values.size());
  for (const std::string& value : values) keys.push_back(equality_key(schema, type, value));
  std::sort(keys.begin(), keys.end());
  const bool found = std::adjacent_find(keys.begin(), keys.end()) != keys.end();
  if (schema.attribute(type)->secret)
    for (std::string& key : keys) cfg::wipe(key);
  return found;
}

// ---- the file's code page

bool fits_code_page(const char* text) {
  char* converted = nullptr;
  std::size_t length = 0;
  const int code = xlate_utf8_to_localcp(text, &converted, &length);
  if (converted) cfg::wipe(converted, length);
  std::free(converted);
  if (code == result::no_memory) throw std::bad_alloc();
  return code == result::success;
}

bool continues_character(char c) noexcept {
  return (static_cast<unsigned char>(c) & 0xC0) == 0x80;
}

// The number, from 1, of the first character that the code page lacks.
std::size_t first_misfit(const std::string& text) {
  std::size_t number = 0;
  for (std::size_t at = 0; at < text.size();) {
    std::size_t next = at + 1;
    while (next < text.size() && continues_character(text[next])) ++next;
    ++number;
    std::string character = text.substr(at, next - at);
    const bool fits = fits_code_page(character.c_str());
    cfg::wipe(character);
    if (!fits) break;
    at = next;
  }
  return number;
}

Refusal check_code_page(std::string_view type, const std::string& value) {
  if (local_code_page_is_utf8() || fits_code_page(value.c_str())) return {};
  return refuse(result::invalid_attribute_syntax,
                "character " + std::to_string(first_misfit(value)) +
                    " of a value is not in the code page of the configuration file",
                type);
}

struct CanonicalAttribute {
  std::string_view type;  // lives in the schema
  std::vector<std::string> values;
};

// Wipes the values when it goes: there may be passwords among them.
template <typename List>
struct Wiped {
  ~Wiped() {
    for (auto& item : list)
      for (std::string& value : item.values) cfg::wipe(value);
  }
  List& list;
};

Refusal canonical_attribute(const Schema& schema, const Attribute& given,
                            CanonicalAttribute& made) {
  if (Refusal refusal = canonical_type(schema, given.type, made.type)) return refusal;
  made.values.reserve(given.values.size());
  for (const std::string& value : given.values) {
    if (Refusal refusal = check_value(made.type, value)) return refusal;
    if (Refusal refusal = check_code_page(made.type, value)) return refusal;
    made.values.push_back(canonical_value(schema, made.type, value));
  }
  if (has_equal_values(schema, made.type, made.values))
    return refuse(result::attribute_or_value_exists, "the same value twice", made.type);
  return {};
}

// ---- malloc forms

void* checked(void* memory) {
  if (!memory) throw std::bad_alloc();
  return memory;
}

// There may be passwords among the values.
void wipe_and_free(char* text) noexcept {
  if (!text) return;
  cfg::wipe(text, std::strlen(text));
  std::free(text);
}

void free_values(berval** values) noexcept {
  if (!values) return;
  for (berval** value = values; *value; ++value) {
    wipe_and_free((*value)->bv_val);
    std::free(*value);
  }
  std::free(values);
}

struct ValuesDeleter {
  void operator()(berval** values) const noexcept { free_values(values); }
};
using Values = std::unique_ptr<berval*, ValuesDeleter>;

// Null for an empty list.
Values malloc_values(const std::vector<std::string>& values) {
  if (values.empty()) return nullptr;
  Values array(static_cast<berval**>(checked(std::calloc(values.size() + 1, sizeof(berval*)))));
  for (std::size_t i = 0; i < values.size(); ++i) {
    auto* const value = static_cast<berval*>(checked(std::calloc(1, sizeof(berval))));
    array.get()[i] = value;
    value->bv_val = malloc_text(values[i]).release();
    value->bv_len = values[i].size();
  }
  return array;
}

// ---- entries

Refusal canonical_attributes(const Schema& schema, const AddRequest& request,
                             std::vector<CanonicalAttribute>& attributes) {
  if (request.attributes.empty()) return refuse(result::protocol_error, "no attributes");
  for (const Attribute& given : request.attributes) {
    CanonicalAttribute made;
    if (given.values.empty())
      return refuse(result::protocol_error, "attribute without values", given.type);
    if (Refusal refusal = canonical_attribute(schema, given, made)) return refusal;
    for (const CanonicalAttribute& other : attributes)
      if (other.type == made.type)
        return refuse(result::attribute_or_value_exists, "the same attribute twice", made.type);
    attributes.push_back(std::move(made));
  }
  return {};
}

// Rules of the backend look at the first attribute for the object classes.
void put_object_classes_first(std::vector<CanonicalAttribute>& attributes) {
  std::stable_partition(attributes.begin(), attributes.end(),
                        [](const CanonicalAttribute& a) { return a.type == kObjectClass; });
}

bool holds_rdn_value(const Schema& schema, const CanonicalAttribute& attribute,
                     const std::string& value) {
  const std::string wanted = equality_key(schema, attribute.type, value);
  return std::any_of(attribute.values.begin(), attribute.values.end(),
                     [&](const std::string& held) {
                       return equality_key(schema, attribute.type, held) == wanted;
                     });
}

// RFC 4511, 4.7: values of the RDN that the list lacks are added. RFC 4512, 2.2: of each attribute
// that names an entry, one value does.
Refusal complete_rdn(const Schema& schema, const std::string& dn,
                     std::vector<CanonicalAttribute>& attributes) {
  cfg::Dn parsed;
  if (const int code = cfg::parse_dn(dn, parsed)) return refuse(code, kTargetNotADn);
  if (parsed.empty()) return {};
  std::unordered_set<std::string_view> types;
  for (const cfg::Ava& ava : parsed.front()) {
    std::string_view type;
    if (Refusal refusal = canonical_type(schema, ava.type, type)) return refusal;
    if (!types.insert(type).second)
      return refuse(result::naming_violation, "an entry is named by one value of an attribute",
                    type);
    // Everybody who may search sees DNs.
    if (schema.attribute(type)->secret)
      return refuse(result::naming_violation, "a password cannot be part of a name", type);
    if (Refusal refusal = check_value(type, ava.value)) return refusal;
    if (Refusal refusal = check_code_page(type, ava.value)) return refusal;
    auto found = std::find_if(attributes.begin(), attributes.end(),
                              [&](const CanonicalAttribute& a) { return a.type == type; });
    if (found == attributes.end()) found = attributes.insert(found, {type, {}});
    std::string value = canonical_value(schema, type, ava.value);
    if (!holds_rdn_value(schema, *found, value)) found->values.push_back(std::move(value));
  }
  return {};
}

EntryPtr build_entry(const std::string& dn, const std::string& normal,
                     const std::vector<CanonicalAttribute>& attributes) {
  EntryPtr made(static_cast<entry*>(checked(std::calloc(1, sizeof(entry)))));
  made->dn = malloc_text(dn).release();
  made->normalized_dn = malloc_text(normal).release();
  for (const CanonicalAttribute& attribute : attributes) {
    const Values values = malloc_values(attribute.values);
    if (attr_merge(made.get(), std::string(attribute.type).c_str(), values.get(), 1, 1, nullptr) ==
        result::no_memory)
      throw std::bad_alloc();
  }
  return made;
}

// ---- modifications

struct ModificationsDeleter {
  void operator()(ldapmod* first) const noexcept { free_modifications(first); }
};
using Modifications = std::unique_ptr<ldapmod, ModificationsDeleter>;

ldapmod* malloc_modification(const TypeChange& change) {
  Modifications made(static_cast<ldapmod*>(checked(std::calloc(1, sizeof(ldapmod)))));
  made->mod_op = change.operation | kModBvalues;
  made->mod_type = malloc_text(change.type).release();
  made->mod_vals.modv_bvals = malloc_values(change.values).release();
  return made.release();
}

ldapmod* malloc_modifications(const TypeChanges& changes) {
  Modifications list;
  ldapmod* last = nullptr;
  for (const TypeChange& change : changes) {
    ldapmod* const made = malloc_modification(change);
    if (last)
      last->mod_next = made;
    else
      list.reset(made);
    last = made;
  }
  return list.release();
}

Refusal canonical_changes(const Schema& schema, const ModifyRequest& request,
                          TypeChanges& changes) {
  if (request.modifications.empty()) return refuse(result::protocol_error, "no modifications");
  changes.reserve(request.modifications.size());  // what moves leaves passwords behind
  for (const Modification& given : request.modifications) {
    CanonicalAttribute attribute;
    if (Refusal refusal = canonical_attribute(schema, given.attribute, attribute)) return refusal;
    if (given.operation == kModAdd && attribute.values.empty())
      return refuse(result::protocol_error, "add without values", attribute.type);
    changes.push_back({given.operation, attribute.type, std::move(attribute.values)});
  }
  return {};
}

// ---- filters

// One item, as the text between its parentheses.
struct FilterItem {
  std::string_view attribute;     // with options; empty in an extensible match without a type
  std::string_view before_value;  // attribute, matching rule and operator
  std::string_view value;
};

FilterItem split_item(std::string_view item) {
  const std::size_t equals = std::min(item.find('='), item.size());
  FilterItem parts;
  parts.before_value = item.substr(0, std::min(equals + 1, item.size()));
  parts.value = item.substr(parts.before_value.size());
  parts.attribute = item.substr(0, std::min(item.find_first_of("=~<>:;"), item.size()));
  return parts;
}

bool hidden_from_members(const Schema& schema, std::string_view attribute) {
  // An extensible match without a type looks at every attribute.
  if (attribute.empty()) return true;
  const std::string_view type = schema.canonical_attribute(attribute);
  return type == "orv-slapdAdminDN" || type == "orv-slapdAdminGroupEnabled";
}

int hex_digit(char c) noexcept {
  if (c >= '0' && c <= '9') return c - '0';
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  return c >= 'A' && c <= 'F' ? c - 'A' + 10 : -1;
}

// The escapes of the decoder's text form undone.
std::string unescaped(std::string_view text) {
  std::string value;
  value.reserve(text.size());
  for (std::size_t i = 0; i < text.size(); ++i) {
    const bool escape = text[i] == '\\' && i + 2 < text.size();
    const int high = escape ? hex_digit(text[i + 1]) : -1;
    const int low = escape ? hex_digit(text[i + 2]) : -1;
    const bool whole = high >= 0 && low >= 0;
    value += whole ? static_cast<char>(high * 16 + low) : text[i];
    if (whole) i += 2;
  }
  return value;
}

// The file holds classes under one name, so one that is asked for by its number must be too. A
// pattern stays: it is compared with that name.
void append_evaluated(const Schema& schema, std::string_view item, const FilterItem& parts,
                      std::string& out) {
  std::string_view name;
  if (parts.value.find('*') == std::string_view::npos &&
      schema.canonical_attribute(parts.attribute) == kObjectClass)
    name = schema.canonical_object_class(unescaped(parts.value));
  if (name.empty()) {
    out += item;
  } else {
    out += parts.before_value;
    out += name;
  }
}

// Whether a log may show the value of an assertion: not what may be a password, under a name that
// nobody knows, or within a DN. What should be a DN and is not, is not looked into; nor is a value
// that was cut off.
bool may_be_shown(const Schema& schema, const FilterItem& parts, bool whole) {
  const SchemaAttribute* const type = schema.attribute(parts.attribute);
  if (!type || type->secret || !whole) return false;
  const bool should_be_dn = type->syntax == kDnSyntax;
  if (!should_be_dn && parts.value.find_first_of("=\\%") == std::string_view::npos) return true;
  const std::string value = unescaped(parts.value);
  std::string shown;
  const auto unknown = should_be_dn ? cfg::UnknownTypes::hidden : cfg::UnknownTypes::shown;
  const int code = cfg::mask_dn(value, unknown, shown);
  if (code == result::no_memory) throw std::bad_alloc();
  if (code == result::success) return shown == value;
  return !should_be_dn && !cfg::find_secret(value, 0);
}

void rewrite_item(const Schema& schema, std::string_view item, FilterUse use, bool whole,
                  std::string& out) {
  const FilterItem parts = split_item(item);
  const bool presence =
      parts.value == "*" && parts.before_value.size() == parts.attribute.size() + 1;
  if (presence) {
    out += item;
  } else if (use == FilterUse::show) {
    const bool shown = may_be_shown(schema, parts, whole);
    out += shown ? item : parts.before_value;
    if (!shown) out += "***";
  } else if (use == FilterUse::evaluate_for_administrators &&
             hidden_from_members(schema, parts.attribute)) {
    // No value assertion on a password is ever true or false.
    out += "orv-slapdAdminPW=-";
  } else {
    append_evaluated(schema, item, parts, out);
  }
}

}  // namespace

void free_modifications(ldapmod* first) noexcept {
  while (first) {
    ldapmod* const next = first->mod_next;
    std::free(first->mod_type);
    if (first->mod_op & kModBvalues)
      free_values(first->mod_vals.modv_bvals);
    else
      charray_free(first->mod_vals.modv_strvals);
    std::free(first);
    first = next;
  }
}

MallocText malloc_text(std::string_view text) {
  auto* const copy = static_cast<char*>(checked(std::malloc(text.size() + 1)));
  std::memcpy(copy, text.data(), text.size());
  copy[text.size()] = '\0';
  return MallocText(copy);
}

TextArray canonical_names(const Schema& schema, const std::vector<std::string>& names) {
  if (names.empty()) return nullptr;
  TextArray array(static_cast<char**>(checked(std::calloc(names.size() + 1, sizeof(char*)))));
  for (std::size_t i = 0; i < names.size(); ++i) {
    const std::string_view known = schema.canonical_attribute(names[i]);
    array.get()[i] = malloc_text(known.empty() ? std::string_view(names[i]) : known).release();
  }
  return array;
}

Refusal make_entry(const Schema& schema, const AddRequest& request, EntryPtr& made) {
  std::string normal;
  std::string dn;
  if (const int code = cfg::normalize_dn(request.dn, normal)) return refuse(code, kTargetNotADn);
  if (const int code = cfg::canonicalize_dn_types(request.dn, dn))
    return refuse(code, kTargetNotADn);
  std::vector<CanonicalAttribute> attributes;
  const Wiped<std::vector<CanonicalAttribute>> wiped{attributes};
  if (Refusal refusal = canonical_attributes(schema, request, attributes)) return refusal;
  if (Refusal refusal = complete_rdn(schema, request.dn, attributes)) return refusal;
  put_object_classes_first(attributes);
  made = build_entry(dn, normal, attributes);
  return {};
}

Refusal make_modifications(const Schema& schema, const ModifyRequest& request, ListForm form,
                           ldapmod*& first) {
  TypeChanges given;
  const Wiped<TypeChanges> wiped_given{given};
  if (Refusal refusal = canonical_changes(schema, request, given)) return refusal;
  if (form == ListForm::as_sent) {
    first = malloc_modifications(given);
    return {};
  }
  if (Refusal refusal = check_class_changes(schema, given)) return refusal;
  TypeChanges folded;
  const Wiped<TypeChanges> wiped_folded{folded};
  if (Refusal refusal = fold_changes(schema, given, folded)) return refusal;
  if (Refusal refusal = check_name_stays(schema, request.dn, folded)) return refusal;
  first = malloc_modifications(folded);
  return {};
}

Refusal check_target_code_page(std::string_view normal_dn) {
  const bool ascii = std::all_of(normal_dn.begin(), normal_dn.end(),
                                 [](char c) { return static_cast<unsigned char>(c) < 0x80; });
  if (ascii || local_code_page_is_utf8()) return {};
  return refuse(result::invalid_dn_syntax,
                "the configuration file is not in UTF-8, and the target is not ASCII");
}

std::string rewrite_filter(const Schema& schema, std::string_view filter, FilterUse use) {
  std::string out;
  out.reserve(filter.size());
  std::size_t at = 0;
  while (at < filter.size()) {
    const char c = filter[at];
    const bool opens_item =
        c == '(' && at + 1 < filter.size() && std::strchr("&|!()", filter[at + 1]) == nullptr;
    out += c;
    ++at;
    if (!opens_item) continue;
    // Parentheses inside values are escaped, so the next one closes the item.
    const std::size_t end = std::min(filter.find(')', at), filter.size());
    rewrite_item(schema, filter.substr(at, end - at), use, end < filter.size(), out);
    at = end;
  }
  return out;
}

}  // namespace orv::server
