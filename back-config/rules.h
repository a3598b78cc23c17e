// What the rules of an added entry (config_add) and those of a modification (config_modify) share.
#pragma once

#include <strings.h>

#include <algorithm>
#include <cstddef>
#include <cstdlib>
#include <cstring>
#include <iterator>
#include <memory>

#include "cfg/owners.h"
#include "cfg/result_codes.h"
#include "config_add.h"
#include "config_names.h"
#include "slapi/strings.h"
#include "slapi/trace.h"

namespace orv {

inline constexpr int kMessageSet = 8;  // of the messages that rules write to the server log

// ---- Refusals

inline constexpr const char* kText = "%s";
inline constexpr const char* kNullPointer = "Invalid NULL pointer passed through.\n";

inline int refuse_null(const ldtr_function_local& trace, const char* text = kNullPointer) {
  trace.debug(trace::error, kText, text);
  return result::other;
}

// ---- Names of entries, in the normal form: byte for byte

inline bool contains(const char* dn, const char* part) {
  return std::strstr(dn, part) != nullptr;
}

inline bool is(const char* dn, const char* constant) {
  return std::strcmp(dn, constant) == 0;
}

// ---- The configuration file

inline int search(_CFG* session, const char* base, int scope, const char* filter,
                  CfgResult& chain) {
  _CFGMessage* found = nullptr;
  const int rc = cfg_search_s(session, base, scope, filter, nullptr, 0, &found);
  chain.reset(found);
  return rc;
}

inline int search_entry(_CFG* session, const char* dn, CfgResult& chain) {
  return search(session, dn, kScopeBase, config_names::any_entry, chain);
}

// A value list of the library, released value by value.
struct EachValueDeleter {
  void operator()(char** values) const noexcept {
    for (char** value = values; *value != nullptr; ++value) std::free(*value);
    std::free(values);
  }
};
using ValueList = std::unique_ptr<char*, EachValueDeleter>;

// ---- Identities; `value` is the first value of an attribute, null when there is none

inline constexpr const char* kBadKerberosMember = "Bad value for Kerberos Admin Group Member DN\n";
inline constexpr const char* kBadKerberosRoot = "Bad value for Kerberos Root Administrator DN\n";

inline bool begins_with(const char* value, const char* prefix) {
  return value != nullptr && strncasecmp(value, prefix, std::strlen(prefix)) == 0;
}

// 80 for a wrong form. Not the code of a bad syntax: clients know this one.
inline int check_kerberos_identity(const ldtr_function_local& trace, _CFG* session,
                                   const char* value, const char* bad_form) {
  if (begins_with(value, config_names::kerberos_prefix) ||
      begins_with(value, config_names::short_kerberos_prefix)) {
    return doesKerberosIDExist(session, value);
  }
  trace.debug(trace::error, kText, bad_form);
  return result::other;
}

inline int check_bind_dn_of_member(_CFG* session, const char* dn) {
  const int rc = doesAdminGroupMemberDNExist(session, dn);
  return rc != 0 ? rc : doesReplicationSupplierDNExist(session, dn);
}

// ---- Roles

// The role that a value names, in any letter case; null for none.
inline const char* role_named(const char* value) {
  const auto* const found =
      std::find_if(std::begin(kAdminRoles), std::end(kAdminRoles),
                   [&](const char* role) { return kel_strcasecmp(value, role) == 0; });
  return found == std::end(kAdminRoles) ? nullptr : *found;
}

// ---- Clear texts of our own: nothing of them is left where they were

struct WipeDeleter {
  void operator()(char* text) const noexcept {
    if (text == nullptr) return;
    explicit_bzero(text, std::strlen(text));
    std::free(text);
  }
};
using ClearText = std::unique_ptr<char, WipeDeleter>;

// ---- Counted values of our own, released with their texts

// Passwords may be among them.
struct CountedValuesDeleter {
  void operator()(berval** values) const noexcept {
    for (berval** value = values; *value != nullptr; ++value) {
      WipeDeleter()((*value)->bv_val);
      std::free(*value);
    }
    std::free(values);
  }
};
using CountedValues = std::unique_ptr<berval*, CountedValuesDeleter>;

// Null without memory.
inline berval* new_value(const char* text) {
  auto* const value = static_cast<berval*>(std::calloc(1, sizeof(berval)));
  if (value == nullptr) return nullptr;
  value->bv_val = slapi_ch_strdup(text);
  if (value->bv_val == nullptr) {
    std::free(value);
    return nullptr;
  }
  value->bv_len = std::strlen(text);
  return value;
}

}  // namespace orv
