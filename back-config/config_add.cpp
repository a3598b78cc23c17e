#include "config_add.h"

#include <strings.h>

#include <cstdlib>
#include <cstring>
#include <memory>

#include "cfg/owners.h"
#include "cfg/result_codes.h"
#include "config_names.h"
#include "config_xlate.h"
#include "function_ids.h"
#include "handlers.h"
#include "slapi/dn.h"
#include "slapi/owners.h"
#include "slapi/trace.h"

namespace orv {

// ======== The handler

int config_back_add(pblock* pb) {
  ldtr_function_local trace(function_id::config_back_add, "pb=0x%p", static_cast<void*>(pb));
  Connection* connection = nullptr;
  Operation* operation = nullptr;
  slapi_pblock_get(pb, parameter::connection, &connection);
  slapi_pblock_get(pb, parameter::operation, &operation);

  send_ldap_result(connection, operation, result::unwilling_to_perform, nullptr, "");
  return trace.exit(result::unwilling_to_perform);
}

// ======== Identities of the administrators

namespace {

constexpr const char* kRetrieving = "Retrieving values for attribute %s ! \n";
constexpr const char* kProblems = "Problems retrieving values for %s ! \n";
constexpr const char* kWalkFailed = "cfg_first_attribute error ! \n";
constexpr const char* kSecondAdminDn = "Error: more then one admin DN ";
constexpr const char* kFailed = "Retrieving %s FAILED rc = %d\n";

// A value list of the library, released value by value.
struct EachValueDeleter {
  void operator()(char** values) const noexcept {
    for (char** value = values; *value != nullptr; ++value) std::free(*value);
    std::free(values);
  }
};
using ValueList = std::unique_ptr<char*, EachValueDeleter>;

// What is looked for, and what becomes of it.
struct Identity {
  const char* attribute;
  const char* untraced;  // attribute whose values stay out of the trace, or null
  bool second_value_fails;
  // Makes the identity of the attribute's first value, in the file's code page.
  int (*take)(const char* value, MallocText& identity);
};

bool names(const char* attribute, const char* wanted) {
  return wanted != nullptr && strcasecmp(attribute, wanted) == 0;
}

// ---- Forms of an identity

int take_as_stored(const char* value, MallocText& identity) {
  char* text = nullptr;
  std::size_t length = 0;
  const int rc = cfg_xlate_localcp_to_utf8(value, &text, &length);
  identity.reset(text);
  return rc;
}

int take_normalized_dn(const char* value, MallocText& identity) {
  int rc = take_as_stored(value, identity);
  if (rc != 0 || identity == nullptr) return rc;
  char* dn = identity.release();
  rc = replace_DN(&dn, 1);
  identity.reset(dn);
  return rc;
}

int take_light_dn(const char* value, MallocText& identity) {
  MallocText text;
  const int rc = take_as_stored(value, text);
  if (rc != 0 || text == nullptr) return rc;
  const EscapedDn escaped(dn_normalize_light_esc(text.get()));
  text.reset();
  if (escaped == nullptr) return result::no_memory;
  if (escaped->error != 0) return escaped->error;
  identity.reset(strdup(escaped->normalized));
  return identity != nullptr ? result::success : result::no_memory;
}

// A member's DN that cannot be made is only absent: the walk over its entry goes on.
int take_member_dn(const char* value, MallocText& identity) {
  if (take_normalized_dn(value, identity) != 0) identity.reset();
  return result::success;
}

// ---- The walk over an entry's attributes

void trace_values(const ldtr_function_local& trace, const char* name, char** values) {
  for (char** value = values; *value != nullptr; ++value) {
    trace.debug(trace::detail, trace::name_and_value, name, *value);
  }
}

// The attribute that holds the identity has been found.
int take_identity(const ldtr_function_local& trace, const Identity& wanted, char** values,
                  MallocText& identity) {
  if (values[0] == nullptr) return result::success;
  if (wanted.second_value_fails && values[1] != nullptr) {
    trace.debug(trace::error, kSecondAdminDn);
    return result::operations_error;
  }
  return wanted.take(values[0], identity);
}

int visit_attribute(const ldtr_function_local& trace, _CFG* session, _CFGMessage* record,
                    const char* name, const Identity& wanted, ValueList& values,
                    MallocText& identity) {
  trace.debug(trace::detail, kRetrieving, name);
  values.reset(cfg_get_values(session, record, name));
  if (cfg_get_errno(session) != 0) {
    trace.debug(trace::error, kProblems, name);
    return result::operations_error;
  }
  if (values == nullptr) return result::success;
  if (!names(name, wanted.untraced)) trace_values(trace, name, values.get());
  if (!names(name, wanted.attribute)) return result::success;
  return take_identity(trace, wanted, values.get(), identity);
}

// Puts the identity that `record` holds into `identity`; goes on to the last attribute after it was
// found, and stops at the first failure.
int walk(const ldtr_function_local& trace, _CFG* session, _CFGMessage* record,
         const Identity& wanted, MallocText& identity) {
  _CFGBer* position = nullptr;
  CfgText name(cfg_first_attribute(session, record, &position));
  const CfgCursor cursor(position);
  int rc = result::success;
  const auto step_failed = [&] {
    if (cfg_get_errno(session) == 0) return;
    trace.debug(trace::error, kWalkFailed);
    rc = result::operations_error;
  };
  step_failed();
  while (rc == 0 && name != nullptr) {
    ValueList values;
    rc = visit_attribute(trace, session, record, name.get(), wanted, values, identity);
    name.reset();
    name.reset(cfg_next_attribute(session, record, cursor.get()));
    step_failed();
  }
  return rc;
}

int search_entry(_CFG* session, const char* dn, CfgResult& chain) {
  _CFGMessage* found = nullptr;
  const int rc = cfg_search_s(session, dn, kScopeBase, config_names::any_entry, nullptr, 0, &found);
  chain.reset(found);
  return rc;
}

// ---- The three identities of the primary administrator

int read_identity(const ldtr_function_local& trace, _CFG* session, const char* dn,
                  const Identity& wanted, MallocText& identity) {
  CfgText readable;  // the entry's DN, fetched only to see that it can be read
  CfgResult chain;
  const int rc = search_entry(session, dn, chain);
  if (rc != 0) return rc;
  _CFGMessage* const record = cfg_first_entry(session, chain.get());
  if (record != nullptr) {
    readable.reset(cfg_get_dn(session, record));
    if (readable == nullptr) return result::no_memory;
  }
  return walk(trace, session, record, wanted, identity);
}

char* lookup(ldtr_function_local& trace, _CFG* session, const char* dn, const Identity& wanted) {
  MallocText identity;
  const int rc = read_identity(trace, session, dn, wanted, identity);
  trace.exit(rc);
  if (rc == 0 && identity != nullptr) return identity.release();
  trace.debug(trace::error, kFailed, wanted.attribute, rc);
  return nullptr;
}

}  // namespace

char* getAdminDN(_CFG* session) {
  ldtr_function_local trace(function_id::get_admin_dn);
  static constexpr Identity kWanted = {config_names::admin_dn, config_names::admin_password, true,
                                       take_normalized_dn};
  return lookup(trace, session, config_names::configuration_dn, kWanted);
}

char* getAdminKerberosID(_CFG* session) {
  ldtr_function_local trace(function_id::get_admin_kerberos_id);
  static constexpr Identity kWanted = {config_names::kerberos_admin_dn, nullptr, false,
                                       take_light_dn};
  return lookup(trace, session, config_names::kerberos_dn, kWanted);
}

char* getAdminDigestUserName(_CFG* session) {
  ldtr_function_local trace(function_id::get_admin_digest_user_name);
  static constexpr Identity kWanted = {config_names::digest_admin_user, nullptr, false,
                                       take_as_stored};
  return lookup(trace, session, config_names::digest_dn, kWanted);
}

// ---- The members of the administrative group

char* getAdminGroupMemberDn(Connection* connection, const char* target_dn) {
  ldtr_function_local trace(function_id::get_admin_group_member_dn);
  static constexpr Identity kWanted = {config_names::admin_dn, nullptr, false, take_member_dn};
  _CFG* const session = connection->config_session;

  CfgResult chain;
  int rc = search_entry(session, target_dn, chain);
  if (trace.exit(rc) != 0 || cfg_count_entries(session, chain.get()) != 1) return nullptr;
  _CFGMessage* const record = cfg_first_entry(session, chain.get());
  if (cfg_get_errno(session) != 0 || record == nullptr) {
    cfg_perror(session, "cfg_first_entry");
    trace.exit(result::operations_error);
    return nullptr;
  }

  MallocText member;
  rc = walk(trace, session, record, kWanted, member);
  trace.exit(rc);
  return rc == 0 ? member.release() : nullptr;
}

}  // namespace orv
