#include "config_add.h"

#include <strings.h>

#include <algorithm>
#include <atomic>
#include <climits>
#include <cstdlib>
#include <cstring>
#include <memory>

#include "callers.h"
#include "cfg/owners.h"
#include "cfg/result_codes.h"
#include "config_names.h"
#include "config_session.h"
#include "config_xlate.h"
#include "function_ids.h"
#include "handlers.h"
#include "rules.h"
#include "slapi/dn.h"
#include "slapi/globals.h"
#include "slapi/log.h"
#include "slapi/owners.h"
#include "slapi/services.h"
#include "slapi/strings.h"
#include "slapi/trace.h"

namespace orv {

// ======== Identities of the administrators

namespace {

constexpr const char* kRetrieving = "Retrieving values for attribute %s ! \n";
constexpr const char* kProblems = "Problems retrieving values for %s ! \n";
// Kept as they are, by which readers of traces know them: the first also for a failed step to the
// next attribute, the second with its blank at the end and without a newline.
constexpr const char* kWalkFailed = "cfg_first_attribute error ! \n";
constexpr const char* kSecondAdminDn = "Error: more then one admin DN ";
constexpr const char* kFailed = "Retrieving %s FAILED rc = %d\n";

// Makes an identity of the first value of its attribute, which is in the file's code page.
using Take = int (*)(const char* value, MallocText& identity);

enum class SecondValue { ignored, told, refused };

// What is looked for, and what becomes of it.
struct Identity {
  const char* attribute;
  Take take;
  SecondValue second_value = SecondValue::ignored;
  // Attribute whose values are not traced. Only the look-up of the administrator's DN leaves the
  // password out; elsewhere the trace's writer masks it.
  const char* untraced = nullptr;
  // Each attribute is traced before its values are read.
  bool announced = true;
  const char* value_text = trace::name_and_value;  // how each value is traced
};

bool names(const char* attribute, const char* wanted) {
  return wanted != nullptr && strcasecmp(attribute, wanted) == 0;
}

// ---- Forms of an identity

int take_as_stored(const char* value, MallocText& identity) {
  return convert(cfg_xlate_localcp_to_utf8, value, identity);
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

void trace_values(const ldtr_function_local& trace, const Identity& wanted, const char* name,
                  char** values) {
  for (char** value = values; *value != nullptr; ++value) {
    trace.debug(trace::detail, wanted.value_text, name, *value);
  }
}

// The attribute that holds the identity has been found.
int take_identity(const ldtr_function_local& trace, const Identity& wanted, char** values,
                  MallocText& identity) {
  if (values[0] == nullptr) return result::success;
  if (values[1] != nullptr && wanted.second_value != SecondValue::ignored) {
    trace.debug(trace::error, kSecondAdminDn);
    if (wanted.second_value == SecondValue::refused) return result::operations_error;
  }
  return wanted.take(values[0], identity);
}

int visit_attribute(const ldtr_function_local& trace, _CFG* session, _CFGMessage* record,
                    const char* name, const Identity& wanted, ValueList& values,
                    MallocText& identity) {
  if (wanted.announced) trace.debug(trace::detail, kRetrieving, name);
  values.reset(cfg_get_values(session, record, name));
  if (cfg_get_errno(session) != 0) {
    trace.debug(trace::error, kProblems, name);
    return result::operations_error;
  }
  if (values == nullptr) return result::success;
  if (!names(name, wanted.untraced)) trace_values(trace, wanted, name, values.get());
  if (!names(name, wanted.attribute)) return result::success;
  return take_identity(trace, wanted, values.get(), identity);
}

// Puts the identity that `record` holds into `identity`; goes on to the last attribute after it was
// found, and stops at the first failure. The cursor is left to the caller, who knows when to
// release it.
int walk(const ldtr_function_local& trace, _CFG* session, _CFGMessage* record,
         const Identity& wanted, CfgCursor& cursor, MallocText& identity) {
  _CFGBer* position = nullptr;
  CfgText name(cfg_first_attribute(session, record, &position));
  cursor.reset(position);
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
  CfgCursor cursor;
  return walk(trace, session, record, wanted, cursor, identity);
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
  static constexpr Identity kWanted = {config_names::admin_dn, take_normalized_dn,
                                       SecondValue::refused, config_names::admin_password};
  return lookup(trace, session, config_names::configuration_dn, kWanted);
}

char* getAdminKerberosID(_CFG* session) {
  ldtr_function_local trace(function_id::get_admin_kerberos_id);
  static constexpr Identity kWanted = {config_names::kerberos_admin_dn, take_light_dn};
  return lookup(trace, session, config_names::kerberos_dn, kWanted);
}

char* getAdminDigestUserName(_CFG* session) {
  ldtr_function_local trace(function_id::get_admin_digest_user_name);
  static constexpr Identity kWanted = {config_names::digest_admin_user, take_as_stored};
  return lookup(trace, session, config_names::digest_dn, kWanted);
}

// ---- The members of the administrative group

char* getAdminGroupMemberDn(Connection* connection, const char* target_dn) {
  ldtr_function_local trace(function_id::get_admin_group_member_dn);
  static constexpr Identity kWanted = {config_names::admin_dn, take_member_dn};
  _CFG* const session = connection->config_session;

  CfgResult chain;
  int rc = search_entry(session, target_dn, chain);
  // Ends here, where the look-ups above walk over no record at all.
  if (trace.exit(rc) != 0 || cfg_count_entries(session, chain.get()) != 1) return nullptr;
  _CFGMessage* const record = cfg_first_entry(session, chain.get());
  if (cfg_get_errno(session) != 0 || record == nullptr) {
    cfg_perror(session, "cfg_first_entry");
    trace.exit(result::operations_error);
    return nullptr;
  }

  MallocText member;
  CfgCursor cursor;
  rc = walk(trace, session, record, kWanted, cursor, member);
  trace.exit(rc);
  return rc == 0 ? member.release() : nullptr;
}

// ======== Identities that are already taken

namespace {

// Wording and blanks are kept as they are: readers of traces know them.
constexpr const char* kNullSplitName =
    "doesProxySplitNameExist::Invalid NULL pointer passed through.\n";
constexpr const char* kDnOfAdministrator =
    "Error: Bind DN attribute specified on add or modify operation matches the admin bind DN. ";
constexpr const char* kDnOfMember =
    "Error: Bind DN attribute specified on add or modify operation matches an admin group member "
    "bind DN. ";
constexpr const char* kDnOfReplication =
    "Error: Bind DN attribute specified on add or modify operation matches a replication supplier "
    "bind DN. ";
constexpr const char* kDnOfSupplier =
    "Error: Tried to add a DN that already belongs to a replication supplier. ";
constexpr const char* kKerberosIdOfAdministrator =
    "Error: Kerberos ID specified on add or modify operation matches the admin Kerberos ID.";
constexpr const char* kKerberosIdOfMember =
    "Error: Kerberos ID specified on add or modify operation matches a admin group member Kerberos "
    "ID.";
constexpr const char* kDigestUserOfAdministrator =
    "Error: Digest-MD5 User Name specified on add or modify operation matches the admin Digest-MD5 "
    "User Name.";
constexpr const char* kDigestUserOfMember =
    "Error: Digest-MD5 User Name specified on add or modify operation matches an admin group "
    "member Digest-MD5 User Name.";
constexpr const char* kSplitNameTaken =
    "Error: orv-slapdProxySplitName Name specified on add or modify operation matches an existing "
    "split Name.";

constexpr int kEveryEntry = INT_MAX;

// ---- When two identities are the same: for DNs in the normal form and for names, byte for byte;
// for Kerberos identities, by what follows the first "=", in any letter case

using Same = bool (*)(const char* held, const char* candidate);

bool same_bytes(const char* held, const char* candidate) {
  return std::strcmp(held, candidate) == 0;
}

const char* after_equals_sign(const char* text) {
  const char* sign = std::strchr(text, '=');
  return sign == nullptr ? text : sign + 1;
}

bool same_kerberos_name(const char* held, const char* candidate) {
  return strcasecmp(after_equals_sign(held), after_equals_sign(candidate)) == 0;
}

// ---- The entries that a candidate is held against

struct Holders {
  const char* base;
  const char* filter;
  Identity identity;
  Same same;
  const char* taken;  // traced when the candidate is theirs
  int examined = kEveryEntry;
};

// The identity in the entry of a holder. Of several values the first counts, as in most look-ups;
// but the second is told, and the attributes are not announced.
constexpr Identity held_as(const char* attribute, Take take,
                           const char* value_text = trace::name_and_value) {
  return {attribute, take, SecondValue::told, nullptr, false, value_text};
}

int compare(const ldtr_function_local& trace, const char* held, const char* candidate, Same same,
            const char* taken) {
  if (held == nullptr || !same(held, candidate)) return result::success;
  trace.debug(trace::error, kText, taken);
  return result::already_exists;
}

int compare_with_entry(const ldtr_function_local& trace, _CFG* session, _CFGMessage* record,
                       const Holders& holders, const char* candidate) {
  const CfgText readable(cfg_get_dn(session, record));
  if (readable == nullptr) return result::no_memory;
  CfgCursor cursor;
  MallocText held;
  const int rc = walk(trace, session, record, holders.identity, cursor, held);
  if (rc != 0) return rc;
  return compare(trace, held.get(), candidate, holders.same, holders.taken);
}

// 0 nobody has it, 68 somebody has it, or the code of the first failure.
int compare_with_holders(const ldtr_function_local& trace, _CFG* session, const Holders& holders,
                         const char* candidate) {
  CfgResult chain;
  int rc = search(session, holders.base, kScopeSubtree, holders.filter, chain);
  const int count = std::min(cfg_count_entries(session, chain.get()), holders.examined);
  _CFGMessage* record = nullptr;
  for (int i = 0; rc == 0 && i < count; ++i) {
    record = i == 0 ? cfg_first_entry(session, chain.get()) : cfg_next_entry(session, record);
    rc = compare_with_entry(trace, session, record, holders, candidate);
  }
  return rc;
}

// Where there is no entry to hold an identity, nobody has it.
int free_where_missing(int rc) {
  return rc == result::no_such_object ? static_cast<int>(result::success) : rc;
}

// An identity that is compared as it was given: with the administrator's, where there is one, and
// with those of the members.
int compare_name(const ldtr_function_local& trace, _CFG* session, const char* candidate,
                 char* (*administrators)(_CFG*), const char* taken, const Holders& members) {
  const MallocText administrator(administrators(session));
  int rc = compare(trace, administrator.get(), candidate, members.same, taken);
  if (rc == 0) rc = compare_with_holders(trace, session, members, candidate);
  return free_where_missing(rc);
}

}  // namespace

int doesAdminGroupMemberDNExist(_CFG* session, const char* candidate) {
  ldtr_function_local trace(function_id::does_admin_group_member_dn_exist);
  static constexpr Holders kMembers = {config_names::admin_group_dn, config_names::any_entry,
                                       held_as(config_names::admin_dn, take_normalized_dn),
                                       same_bytes, kDnOfMember};
  if (candidate == nullptr) return trace.exit(refuse_null(trace));

  // What cannot be compared with the administrator's is refused, not let pass.
  const MallocText administrator(getAdminDN(session));
  if (administrator == nullptr) return trace.exit(result::other);
  MallocText dn;
  int rc = normalized_copy(candidate, dn);
  if (rc != 0) return trace.exit(rc);

  rc = compare(trace, administrator.get(), dn.get(), same_bytes, kDnOfAdministrator);
  if (rc == 0) rc = compare_with_holders(trace, session, kMembers, dn.get());
  return trace.exit(free_where_missing(rc));
}

int doesReplicationSupplierDNExist(_CFG* session, const char* candidate) {
  ldtr_function_local trace(function_id::does_replication_supplier_dn_exist);
  static constexpr Identity kMasterDn =
      held_as(config_names::master_dn, take_normalized_dn, trace::attribute_and_value);
  static constexpr Holders kReplication = {config_names::configuration_dn,
                                           config_names::replication_entries,
                                           kMasterDn,
                                           same_bytes,
                                           kDnOfReplication,
                                           1};  // there is to be one
  static constexpr Holders kSuppliers = {config_names::configuration_dn,
                                         config_names::supplier_entries, kMasterDn, same_bytes,
                                         kDnOfSupplier};
  if (candidate == nullptr) return trace.exit(refuse_null(trace));
  MallocText dn;
  int rc = normalized_copy(candidate, dn);
  if (rc != 0) return trace.exit(rc);

  rc = compare_with_holders(trace, session, kReplication, dn.get());
  if (free_where_missing(rc) == 0) rc = compare_with_holders(trace, session, kSuppliers, dn.get());
  return trace.exit(free_where_missing(rc));
}

int doesKerberosIDExist(_CFG* session, const char* candidate) {
  ldtr_function_local trace(function_id::does_kerberos_id_exist);
  static constexpr Holders kMembers = {config_names::admin_group_dn, config_names::any_entry,
                                       held_as(config_names::kerberos_admin_dn, take_light_dn),
                                       same_kerberos_name, kKerberosIdOfMember};
  if (candidate == nullptr) return trace.exit(refuse_null(trace));
  return trace.exit(compare_name(trace, session, candidate, getAdminKerberosID,
                                 kKerberosIdOfAdministrator, kMembers));
}

int doesDigestUserNameExist(_CFG* session, const char* candidate) {
  ldtr_function_local trace(function_id::does_digest_user_name_exist);
  static constexpr Holders kMembers = {config_names::admin_group_dn, config_names::any_entry,
                                       held_as(config_names::digest_admin_user, take_as_stored),
                                       same_bytes, kDigestUserOfMember};
  if (candidate == nullptr) return trace.exit(refuse_null(trace));
  return trace.exit(compare_name(trace, session, candidate, getAdminDigestUserName,
                                 kDigestUserOfAdministrator, kMembers));
}

int doesProxySplitNameExist(_CFG* session, const char* candidate) {
  ldtr_function_local trace(function_id::does_proxy_split_name_exist);
  static constexpr Holders kProxies = {config_names::proxy_backend_dn, config_names::any_entry,
                                       held_as(config_names::proxy_split_name, take_as_stored),
                                       same_bytes, kSplitNameTaken};
  if (candidate == nullptr) return trace.exit(refuse_null(trace, kNullSplitName));
  return trace.exit(free_where_missing(compare_with_holders(trace, session, kProxies, candidate)));
}

// ======== What an added entry must be

namespace {

// Wording and blanks are kept as they are: readers of traces know them.
constexpr const char* kNullSplitContainer =
    "CheckIfProxySplitContainer::Invalid NULL pointer passed through.\n";

constexpr int kMessageSplitNameTaken = 146;

// Object class tests follow the attribute's own equality rule.
bool has_class(const entry& e, const char* name) {
  return e.object_classes != nullptr && cfg_value_find(e.object_classes, name) == 0;
}

const attr* find(const entry& e, const char* type) {
  return attr_find(&e, type, 0, 0);
}

std::size_t count_values(const attr& a) {
  std::size_t count = 0;
  while (a.values != nullptr && a.values[count] != nullptr) ++count;
  return count;
}

// The only value that the rules look at; null when there is none.
const char* first_value(const attr& a) {
  if (a.values == nullptr || a.values[0] == nullptr) return nullptr;
  return a.values[0]->bv_val;
}

// The audit log asks for the audit right itself; either right opens the other two.
int check_log_entry(const char* dn, const Operation& operation) {
  const bool audit_log = is(dn, config_names::audit_log_dn);
  if (!audit_log && !is(dn, config_names::admin_audit_log_dn) &&
      !is(dn, config_names::default_log_dn)) {
    return result::success;
  }
  if (!is_admin_group_member(operation)) return result::success;
  const unsigned opens = audit_log ? role::audit : role::audit | role::server_config;
  return (operation.roles & opens) != 0 ? result::success : result::insufficient_access;
}

int check_digest_user(_CFG* session, const entry& e) {
  const attr* const user = find(e, config_names::digest_admin_user);
  if (user == nullptr) return result::success;
  return doesDigestUserNameExist(session, first_value(*user));
}

int check_member(const ldtr_function_local& trace, _CFG* session, const entry& e) {
  if (!has_class(e, config_names::config_entry_class) ||
      !has_class(e, config_names::admin_group_member_class)) {
    return result::object_class_violation;
  }
  const attr* const dn = find(e, config_names::admin_dn);
  if (dn == nullptr) return result::object_class_violation;
  int rc = check_bind_dn_of_member(session, first_value(*dn));
  if (rc != 0) return rc;
  if (const attr* const kerberos = find(e, config_names::kerberos_admin_dn)) {
    rc = check_kerberos_identity(trace, session, first_value(*kerberos), kBadKerberosMember);
    if (rc != 0) return rc;
  }
  return check_digest_user(session, e);
}

}  // namespace

int checkIfAdminGroupEntry(const char* normalized_dn, entry* e, Connection* connection,
                           Operation* operation) {
  ldtr_function_local trace(function_id::check_if_admin_group_entry);
  if (normalized_dn == nullptr || e == nullptr || connection == nullptr || operation == nullptr) {
    return trace.exit(refuse_null(trace));
  }
  if (!contains(normalized_dn, config_names::admin_group_dn)) {
    return trace.exit(check_log_entry(normalized_dn, *operation));
  }
  if (!is_primary_administrator(*operation)) return trace.exit(result::insufficient_access);
  if (!has_class(*e, config_names::top_class)) return trace.exit(result::object_class_violation);
  if (is(normalized_dn, config_names::admin_group_dn)) {
    const bool container = has_class(*e, config_names::container_class);
    return trace.exit(container ? result::success : result::object_class_violation);
  }
  return trace.exit(check_member(trace, connection->config_session, *e));
}

int checkIfReplSupplierEntry(const char* normalized_dn, entry* e, Connection* connection) {
  ldtr_function_local trace(function_id::check_if_repl_supplier_entry);
  if (normalized_dn == nullptr || e == nullptr || connection == nullptr) {
    return trace.exit(refuse_null(trace));
  }
  if (e->object_classes == nullptr) return trace.exit(result::success);
  // Only both together exempt an entry: one with neither is looked at like one with one of them.
  if (has_class(*e, config_names::replication_class) &&
      has_class(*e, config_names::supplier_class)) {
    return trace.exit(result::success);
  }
  const attr* const dn = find(*e, config_names::master_dn);
  if (dn == nullptr) return trace.exit(result::success);
  return trace.exit(doesAdminGroupMemberDNExist(connection->config_session, first_value(*dn)));
}

int checkIfKerberosEntry(const char* normalized_dn, entry* e, Connection* connection,
                         Operation* operation) {
  ldtr_function_local trace(function_id::check_if_kerberos_entry);
  if (normalized_dn == nullptr || e == nullptr || connection == nullptr || operation == nullptr) {
    return trace.exit(refuse_null(trace));
  }
  if (!is(normalized_dn, config_names::kerberos_dn)) return trace.exit(result::success);
  if (!is_primary_administrator(*operation)) return trace.exit(result::insufficient_access);
  if (!has_class(*e, config_names::kerberos_class)) {
    return trace.exit(result::object_class_violation);
  }
  const attr* const identity = find(*e, config_names::kerberos_admin_dn);
  if (identity == nullptr) return trace.exit(result::object_class_violation);
  return trace.exit(check_kerberos_identity(trace, connection->config_session,
                                            first_value(*identity), kBadKerberosRoot));
}

int checkIfDigestEntry(const char* normalized_dn, entry* e, Connection* connection,
                       Operation* operation) {
  ldtr_function_local trace(function_id::check_if_digest_entry);
  if (normalized_dn == nullptr || e == nullptr || connection == nullptr || operation == nullptr) {
    return trace.exit(refuse_null(trace));
  }
  if (!is(normalized_dn, config_names::digest_dn)) return trace.exit(result::success);
  if (!is_primary_administrator(*operation)) return trace.exit(result::insufficient_access);
  if (!has_class(*e, config_names::digest_class)) return trace.exit(result::object_class_violation);
  return trace.exit(check_digest_user(connection->config_session, *e));
}

int checkIfProxySplitContainer(entry* e, Connection* connection) {
  ldtr_function_local trace(function_id::check_if_proxy_split_container);
  if (e == nullptr) return trace.exit(refuse_null(trace, kNullSplitContainer));
  const attr* const name = find(*e, config_names::proxy_split_name);
  if (name == nullptr) return trace.exit(result::success);
  const char* const value = first_value(*name);
  if (!is_string_alphanum(value)) return trace.exit(result::invalid_attribute_syntax);
  const int rc = doesProxySplitNameExist(connection->config_session, value);
  if (rc == result::already_exists) PrintMessage(0, kMessageSet, kMessageSplitNameTaken);
  return trace.exit(rc);
}

// ---- The policy for administrators' passwords

namespace {

// The attribute that holds the entry's password; null for an entry that is not looked at. Outside
// of the group the classes are looked for in the entry's first attribute, whichever that is.
const char* password_attribute(const char* normalized_dn, const entry& e) {
  if (contains(normalized_dn, config_names::admin_group_dn)) return config_names::admin_password;
  attr* const first = e.attributes;
  if (first == nullptr) return nullptr;
  if (cfg_value_find(first, config_names::replication_class) == 0 &&
      cfg_value_find(first, config_names::supplier_class) == 0) {
    return nullptr;
  }
  return config_names::master_password;
}

// The clear text of the new password; null when there is none to check.
const char* new_password(const char* normalized_dn, const entry& e) {
  const char* const type = password_attribute(normalized_dn, e);
  if (type == nullptr) return nullptr;
  const attr* const password = find(e, type);
  const char* const value = password == nullptr ? nullptr : first_value(*password);
  return value == nullptr || *value == '\0' ? nullptr : value;
}

}  // namespace

int checkAdminPolicyEntry(const char* normalized_dn, entry* e, Connection* connection,
                          Operation* operation) {
  ldtr_function_local trace(function_id::check_admin_policy_entry);
  if (normalized_dn == nullptr || e == nullptr || connection == nullptr || operation == nullptr) {
    return trace.exit(refuse_null(trace));
  }
  const char* const password = new_password(normalized_dn, *e);
  if (password == nullptr) return trace.exit(result::success);
  const ClearText copy(strdup(password));
  if (copy == nullptr) return trace.exit(result::no_memory);
  return trace.exit(verify_admin_password(copy.get(), nullptr, operation));
}

// ======== Roles of an added member

namespace {

constexpr const char* kNullToRoles =
    "Invalid NULL pointer passed to processRolesIfAdminGroupEntry()\n";
constexpr const char* kInvalidRole =
    "Error: Invalid administrative role for %s: orv-slapdAdminRole=%s\n";
constexpr const char* kDefaultRole =
    "Admin group member %s is being added with orv-slapdAdminRole: %s\n";

// Makes "NoAdmin" the only value. It is written over the first, which is a role and so has room.
void leave_only_no_admin(attr& roles) {
  for (std::size_t count = count_values(roles); count > 1; --count) {
    std::free(roles.values[count - 1]->bv_val);
    std::free(roles.values[count - 1]);
    roles.values[count - 1] = nullptr;
  }
  kel_strlcpy(roles.values[0]->bv_val, kNoAdminRole, std::strlen(kNoAdminRole) + 1);
  roles.values[0]->bv_len = std::strlen(kNoAdminRole);
  roles.count = 1;
}

// Values are changed only after all of them are known to be roles.
int check_roles(const ldtr_function_local& trace, const char* dn, attr& roles) {
  bool no_admin = false;
  for (berval** value = roles.values; value != nullptr && *value != nullptr; ++value) {
    const char* const role = role_named((*value)->bv_val);
    if (role == nullptr) {
      trace.debug(trace::error, kInvalidRole, dn, (*value)->bv_val);
      return result::invalid_attribute_syntax;
    }
    if (is(role, kNoAdminRole)) no_admin = true;
  }
  if (no_admin) leave_only_no_admin(roles);
  return result::success;
}

std::size_t count_default_roles(const ldtr_function_local& trace, const char* dn) {
  std::size_t count = 0;
  for (; DEFAULT_ADMIN_ROLES[count] != nullptr; ++count) {
    trace.debug(trace::info, kDefaultRole, dn, DEFAULT_ADMIN_ROLES[count]);
  }
  return count;
}

int add_default_roles(const ldtr_function_local& trace, const char* dn, entry& e) {
  const std::size_t count = count_default_roles(trace, dn);
  const CountedValues values(static_cast<berval**>(std::calloc(count + 1, sizeof(berval*))));
  if (values == nullptr) return result::no_memory;
  for (std::size_t i = 0; i < count; ++i) {
    values.get()[i] = new_value(DEFAULT_ADMIN_ROLES[i]);
    if (values.get()[i] == nullptr) return result::no_memory;
  }
  return attr_merge(&e, config_names::admin_role, values.get(), 1, 1, nullptr);
}

}  // namespace

int processRolesIfAdminGroupEntry(const char* normalized_dn, entry* e, Operation* operation) {
  ldtr_function_local trace(function_id::process_roles_if_admin_group_entry);
  if (normalized_dn == nullptr || e == nullptr || operation == nullptr) {
    return trace.exit(refuse_null(trace, kNullToRoles));
  }
  // Letter case counts here, and not where the container is told from its members: both are meant.
  if (!contains(normalized_dn, config_names::admin_group_dn)) return trace.exit(result::success);
  // Also for the container itself.
  if (!is_primary_administrator(*operation)) return trace.exit(result::insufficient_access);
  if (kel_strcasecmp(normalized_dn, config_names::admin_group_dn) == 0) {
    return trace.exit(result::success);
  }
  attr* const roles = attr_find(e, config_names::admin_role, 0, 0);
  return trace.exit(roles != nullptr ? check_roles(trace, normalized_dn, *roles)
                                     : add_default_roles(trace, normalized_dn, *e));
}

// ======== Pass-through authentication

namespace {

constexpr const char* kConflictSearchFailed =
    "doesConflictingPTAsubtreeExists: cfg_search_s rc=%d\n";
constexpr const char* kNothingToConflict = "doesConflictingPTAsubtreeExists: No PTA entry found\n";
// Also for two subtrees of one entry.
constexpr const char* kNested =
    "doesConflictingPTAsubtreeExists: Nested PTA Subtrees found '%s', '%s'\n";
constexpr const char* kProblemsInEntry = "Problems retrieving values for %s in entry %s!\n";
constexpr const char* kReviewSearchFailed = "checkAllPTAEntries: cfg_search_s rc=%d\n";
constexpr const char* kNothingToReview = "checkAllPTAEntries: No PTA entry found\n";

constexpr int kMessageNestedSubtrees = 167;
constexpr int kMessageReservedSubtree = 174;
constexpr int kMessageBadUrl = 179;

constexpr int kReviewingServer = 1;  // kind of server
constexpr int kSafeMode = 1;         // exactly; the rule of password methods asks for any but 0

// Suffixes of the server's own: nobody who has an entry there is verified by another server.
constexpr const char* kReservedSuffixes[] = {
    "CN=CONFIGURATION", "CN=SCHEMA", "CN=PWDPOLICY,CN=ORVPOLICIES", "CN=CHANGELOG", "CN=LOCALHOST"};

// 1 until this process has reviewed the pass-through entries of the file; never set back. A review
// that could not search or that ended early counts as well: it is not repeated.
std::atomic<int> firstTime{1};

// The normal form of a DN that is in the file's code page. 0, or 1 when none can be made, for
// whatever reason, also want of memory.
int normal_form(const char* local_dn, MallocText& dn) {
  const int rc = take_normalized_dn(local_dn, dn);
  return rc == 0 && dn != nullptr ? result::success : result::operations_error;
}

// ---- The subtrees of an entry

// Taken to be in the file's code page, though those of an added entry are UTF-8: where the two
// differ the server lets only ASCII pass for this type.
int normalize_subtrees(const attr& a, ValueList& subtrees) {
  const std::size_t count = count_values(a);
  subtrees.reset(static_cast<char**>(std::calloc(count + 1, sizeof(char*))));
  if (subtrees == nullptr) return result::no_memory;
  for (std::size_t i = 0; i < count; ++i) {
    MallocText dn;
    const int rc = normal_form(a.values[i]->bv_val, dn);
    subtrees.get()[i] = dn.release();  // also one without a normal form: it goes with the others
    if (rc != 0) return rc;
  }
  return result::success;
}

int compare_with_reserved(const char* entry_dn, const char* subtree) {
  for (const char* suffix : kReservedSuffixes) {
    if (are_nested_dn(subtree, suffix) == 0) continue;
    PrintMessage(0, kMessageSet, kMessageReservedSubtree, entry_dn, suffix);
    return result::constraint_violation;
  }
  return result::success;
}

int compare_with_subtrees(const ldtr_function_local& trace, const char* subtree, char** others) {
  for (char** other = others; *other != nullptr; ++other) {
    if (are_nested_dn(subtree, *other) == 0) continue;
    trace.debug(trace::error, kNested, subtree, *other);
    PrintMessage(0, kMessageSet, kMessageNestedSubtrees, subtree, *other);
    return result::constraint_violation;
  }
  return result::success;
}

// Each subtree with the reserved suffixes and then with those after it, before the next one.
int compare_own_subtrees(const ldtr_function_local& trace, const char* entry_dn, char** subtrees) {
  int rc = result::success;
  for (char** subtree = subtrees; rc == 0 && *subtree != nullptr; ++subtree) {
    rc = compare_with_reserved(entry_dn, *subtree);
    if (rc == 0) rc = compare_with_subtrees(trace, *subtree, subtree + 1);
  }
  return rc;
}

// ---- The pass-through entries of the file

int search_passthrough_entries(_CFG* session, CfgResult& chain) {
  return search(session, config_names::passthrough_dn, kScopeOneLevel,
                config_names::passthrough_entries, chain);
}

int normalize_in_place(char** local_dns) {
  for (char** value = local_dns; *value != nullptr; ++value) {
    MallocText dn;
    const int rc = normal_form(*value, dn);
    if (rc != 0) return rc;
    std::free(*value);
    *value = dn.release();
  }
  return result::success;
}

// An entry of the file without the attribute is an error here (16 of the library, 1 as the result),
// and so it stands in the way of every other entry that has subtrees.
int compare_with_values(const ldtr_function_local& trace, _CFG* session, _CFGMessage* record,
                        const char* record_dn, char** subtrees) {
  const ValueList values(cfg_get_values(session, record, config_names::passthrough_subtree));
  if (cfg_get_errno(session) != 0) {
    trace.debug(trace::error, kProblemsInEntry, config_names::passthrough_subtree, record_dn);
    return result::operations_error;
  }
  if (values == nullptr) return result::success;
  int rc = normalize_in_place(values.get());
  for (char** subtree = subtrees; rc == 0 && *subtree != nullptr; ++subtree) {
    rc = compare_with_subtrees(trace, *subtree, values.get());
  }
  return rc;
}

// The DN of a record, as the file has it and in its normal form. The latter is released first.
struct RecordDn {
  CfgText local;
  MallocText normal;

  void release() noexcept {
    normal.reset();
    local.reset();
  }
};

// An entry is not compared with itself, so that it can be modified.
int compare_with_record(const ldtr_function_local& trace, _CFG* session, _CFGMessage* record,
                        const char* record_dn, const char* dn, char** subtrees) {
  if (kel_strcasecmp(record_dn, dn) == 0) return result::success;
  return compare_with_values(trace, session, record, record_dn, subtrees);
}

// Whatever ends the walk, the DN goes with its record, but for one that has no normal form: that is
// left in `record_dn`.
int compare_with_chain(const ldtr_function_local& trace, _CFG* session, _CFGMessage* chain,
                       const char* dn, char** subtrees, RecordDn& record_dn) {
  _CFGMessage* record = cfg_first_entry(session, chain);
  record_dn.local.reset(cfg_get_dn(session, record));
  if (record_dn.local == nullptr) return result::no_memory;
  while (record_dn.local != nullptr) {
    int rc = normal_form(record_dn.local.get(), record_dn.normal);
    if (rc != 0) return rc;
    rc = compare_with_record(trace, session, record, record_dn.normal.get(), dn, subtrees);
    record_dn.release();
    if (rc != 0) return rc;
    record = cfg_next_entry(session, record);
    record_dn.local.reset(record == nullptr ? nullptr : cfg_get_dn(session, record));
  }
  return result::success;
}

// Whether one of `subtrees` (normal forms, null-terminated) overlaps one of another pass-through
// entry of the file than `dn`: 0, 19; 1, 90, or the code of the search.
int doesConflictingPTAsubtreeExists(_CFG* session, const char* dn, char** subtrees) {
  ldtr_function_local trace(function_id::does_conflicting_pta_subtree_exist);
  RecordDn record_dn;  // what is left in it goes after the result
  CfgResult chain;
  const int rc = search_passthrough_entries(session, chain);
  if (rc != 0) {
    trace.debug(trace::error, kConflictSearchFailed, rc);
    return trace.exit(rc);
  }
  if (cfg_count_entries(session, chain.get()) <= 0) {
    chain.reset();
    trace.debug(trace::detail, kNothingToConflict);
    return trace.exit(result::success);
  }
  return trace.exit(compare_with_chain(trace, session, chain.get(), dn, subtrees, record_dn));
}

// ---- The settings of an entry

int check_url(const entry& e) {
  const attr* const setting = find(e, config_names::passthrough_url);
  const char* const url = setting == nullptr ? nullptr : first_value(*setting);
  if (url == nullptr) return result::success;
  LDAPURLDesc* description = nullptr;
  if (ldap_url_parse(url, &description) == 0) {
    ldap_free_urldesc(description);  // only whether there is one matters
    return result::success;
  }
  PrintMessage(0, kMessageSet, kMessageBadUrl, url);
  return result::invalid_attribute_syntax;
}

// `subtrees` is made here and released by the caller.
int check_subtrees(const ldtr_function_local& trace, const char* dn, const entry& e, _CFG* session,
                   ValueList& subtrees) {
  const attr* const setting = find(e, config_names::passthrough_subtree);
  if (setting == nullptr) return result::success;
  int rc = normalize_subtrees(*setting, subtrees);
  if (rc == 0) rc = compare_own_subtrees(trace, dn, subtrees.get());
  if (rc == 0) rc = doesConflictingPTAsubtreeExists(session, dn, subtrees.get());
  return rc;
}

// An attribute without a value is judged too, as null; check_url lets one pass.
int check_mapping(const entry& e) {
  const attr* const setting = find(e, config_names::passthrough_mapping);
  if (setting == nullptr) return result::success;
  return verifyAttributeMapping(first_value(*setting), nullptr, nullptr);
}

// ---- The review of all entries

// False when the walk ends here. `dn` comes with the DN of the record before, and keeps the one of
// this.
bool review(_CFGMessage* record, Connection* connection, RecordDn& dn) {
  _CFG* const session = connection->config_session;
  dn.release();
  dn.local.reset(cfg_get_dn(session, record));
  if (dn.local == nullptr || normal_form(dn.local.get(), dn.normal) != 0) return false;
  const EntryPtr e(CFGMessage2Entry(session, record));
  if (e == nullptr) return false;
  verifyPassthroughServerEntry(dn.normal.get(), e.get(), connection);  // which tells what is wrong
  return true;
}

void checkAllPTAEntries(Connection* connection) {
  ldtr_function_local trace(function_id::check_all_pta_entries);
  _CFG* const session = connection->config_session;
  RecordDn dn;  // the last one goes after the result
  CfgResult chain;
  const int rc = search_passthrough_entries(session, chain);
  if (rc != 0) {
    trace.debug(trace::error, kReviewSearchFailed, rc);
    return;
  }
  if (cfg_count_entries(session, chain.get()) <= 0) {
    chain.reset();
    trace.debug(trace::detail, kNothingToReview);
    return;
  }
  _CFGMessage* record = cfg_first_entry(session, chain.get());
  while (record != nullptr && review(record, connection, dn)) {
    record = cfg_next_entry(session, record);
  }
}

bool has_to_review() {
  return firstTime.load(std::memory_order_relaxed) == 1 &&
         (g_safe_mode.load(std::memory_order_relaxed) == kSafeMode ||
          g_srvType.load(std::memory_order_relaxed) == kReviewingServer);
}

}  // namespace

int checkIfPassthruSubtreeEntry(entry* e, Connection* connection, Backend* backend,
                                Operation* operation) {
  ldtr_function_local trace(function_id::check_if_passthru_subtree_entry);
  if (e == nullptr || connection == nullptr || backend == nullptr) {
    return trace.exit(refuse_null(trace));
  }
  // The container is found here with regard to letter case, and compared with the parent below
  // without. Both are meant.
  const char* const dn = e->normalized_dn;
  if (!contains(dn, config_names::passthrough_dn)) return trace.exit(result::success);
  if (!is_primary_administrator(*operation) && (operation->roles & role::server_config) == 0) {
    return trace.exit(result::insufficient_access);
  }

  // Directly below the container. The container itself is refused by this as well.
  const MallocText parent(dn_parent_norm(backend, dn));
  if (parent == nullptr) return trace.exit(result::success);
  if (kel_strcasecmp(parent.get(), config_names::passthrough_dn) != 0) {
    return trace.exit(result::unwilling_to_perform);
  }

  if (!has_class(*e, config_names::top_class)) return trace.exit(result::object_class_violation);
  if (is(dn, config_names::passthrough_dn)) {
    // Never on an add: the parent has refused the container already. Kept on purpose, for whenever
    // that test is another.
    const bool container = has_class(*e, config_names::container_class);
    return trace.exit(container ? result::success : result::object_class_violation);
  }
  if (!has_class(*e, config_names::config_entry_class) ||
      !has_class(*e, config_names::passthrough_class)) {
    return trace.exit(result::object_class_violation);
  }
  return trace.exit(verifyPassthroughServerEntry(dn, e, connection));
}

int verifyPassthroughServerEntry(const char* normalized_dn, entry* e, Connection* connection) {
  ldtr_function_local trace(function_id::verify_passthrough_server_entry);
  if (!contains(normalized_dn, config_names::passthrough_dn)) return trace.exit(result::success);
  if (has_to_review()) {
    firstTime.store(0, std::memory_order_relaxed);  // first: the review comes back to here
    checkAllPTAEntries(connection);
  }

  ValueList subtrees;
  int rc = check_url(*e);
  if (rc == 0) rc = check_subtrees(trace, normalized_dn, *e, connection->config_session, subtrees);
  if (rc == 0) rc = check_mapping(*e);
  return trace.exit(rc);
}

// ======== Who may add

namespace {

// An entry that asks for a role of its own.
struct ProtectedEntry {
  const char* dn;
  unsigned opened_by;  // one of these bits
  bool for_suppliers = false;
};
constexpr ProtectedEntry kProtectedEntries[] = {
    {config_names::default_log_dn, role::audit | role::server_config},
    {config_names::audit_log_dn, role::audit},
    {config_names::admin_audit_log_dn, role::audit},
    {config_names::replication_dn, role::replication | role::server_config},
    {config_names::master_server_dn, role::any_configuration, true},
};

const ProtectedEntry* find_protected(const char* dn) {
  const auto* const found =
      std::find_if(std::begin(kProtectedEntries), std::end(kProtectedEntries),
                   [&](const ProtectedEntry& e) { return kel_strcasecmp(dn, e.dn) == 0; });
  return found == std::end(kProtectedEntries) ? nullptr : found;
}

bool is_supplier(const entry& e) {
  const attr* const classes = attr_find(&e, "OBJECTCLASS", 0, 0);
  if (classes == nullptr) return false;
  for (berval** value = classes->values; value != nullptr && *value != nullptr; ++value) {
    if (kel_strcasecmp((*value)->bv_val, config_names::supplier_class) == 0) return true;
  }
  return false;
}

}  // namespace

bool roles_cover(unsigned roles, const char* dn, bool supplier) {
  if ((roles & role::any_configuration) == 0) return false;
  const ProtectedEntry* const found = find_protected(dn);
  if (found == nullptr && !supplier) return (roles & role::server_config) != 0;
  // A supplier's entry under a protected DN has to pass both.
  if (found != nullptr && (roles & found->opened_by) == 0) return false;
  return (!supplier && !found->for_suppliers) || has_all(roles, kAllForSuppliers);
}

int check_add_authority(const Connection* /*connection*/, const Operation* operation,
                        const entry* e) {
  ldtr_function_local trace(function_id::check_add_authority);
  if (has_no_configuration_access(*operation)) return trace.exit(result::insufficient_access);
  const bool supplier = is_supplier(*e);
  if (!is_admin_group_member(*operation)) return trace.exit(result::success);
  return trace.exit(roles_cover(operation->roles, e->normalized_dn, supplier)
                        ? result::success
                        : result::insufficient_access);
}

// ======== What the file must say, and what the entry must not be

int checkIfExists(const char* normalized_dn, Connection* connection) {
  ldtr_function_local trace(function_id::check_if_exists);
  _CFG* const session = connection->config_session;
  CfgResult chain;
  const int rc = search_entry(session, normalized_dn, chain);
  if (rc != 0) return trace.exit(free_where_missing(rc));
  const bool exists = cfg_count_entries(session, chain.get()) > 0;
  return trace.exit(exists ? result::already_exists : result::success);
}

int checkForParent(const char* normalized_dn, Connection* connection, Backend* backend) {
  ldtr_function_local trace(function_id::check_for_parent);
  _CFG* const session = connection->config_session;
  MallocText parent(dn_parent_norm(backend, normalized_dn));
  if (parent == nullptr) return trace.exit(result::success);
  CfgResult chain;
  int rc = search_entry(session, parent.get(), chain);
  parent.reset();
  if (rc == 0 && cfg_count_entries(session, chain.get()) < 1) rc = result::no_such_object;
  cfg_msgfree(chain.release());  // also none
  return trace.exit(rc);
}

int checkForRep(entry* e) {
  ldtr_function_local trace(function_id::check_for_rep);
  constexpr const char* kContext = config_names::replication_context_class;
  // 0 is the answer for a class that is there.
  const bool context =
      value_find_short_list(e->object_class_list, kContext, std::strlen(kContext)) == 0;
  return trace.exit(context ? result::replication_context : result::success);
}

// ======== The entry in the file's code page

namespace {

// False without memory. `rc` becomes the code of the last value, whatever those before it gave.
bool translate_values(const attr& source, attr& copy, int& rc) {
  const std::size_t count = count_values(source);
  copy.values = static_cast<berval**>(std::calloc(count + 1, sizeof(berval*)));
  if (copy.values == nullptr) return false;
  for (std::size_t i = 0; i < count; ++i) {
    auto* const value = static_cast<berval*>(std::calloc(1, sizeof(berval)));
    if (value == nullptr) return false;
    copy.values[i] = value;
    ++copy.count;
    rc = cfg_xlate_utf8_to_localcp(source.values[i]->bv_val, &value->bv_val, &value->bv_len);
  }
  return true;
}

}  // namespace

int xlate_attrs(attr* source, attr** result) {
  ldtr_function_local trace(function_id::xlate_attrs);
  *result = nullptr;
  attr** place = result;
  int rc = result::success;
  for (; source != nullptr; source = source->next) {
    // Without memory the list simply ends before this attribute.
    *place = static_cast<attr*>(std::calloc(1, sizeof(attr)));
    if (*place == nullptr) break;
    attr& copy = **place;
    copy.type = source->type;
    if (!translate_values(*source, copy, rc)) {
      rc = result::no_memory;
      break;
    }
    place = &copy.next;
  }
  if (rc == result::no_memory) cleanup_attrs(result);
  return trace.exit(rc);
}

int cleanup_attrs(attr** list) {
  ldtr_function_local trace(function_id::cleanup_attrs);
  if (list == nullptr) return trace.exit(result::success);
  while (*list != nullptr) {
    attr* const first = *list;
    *list = first->next;
    CountedValues(first->values).reset();
    std::free(first);  // its type is the source's
  }
  return trace.exit(result::success);
}

// ======== The handler

namespace {

constexpr const char* kInvalidRoleAnswer = "Invalid administrative role value";

struct AddRequest {
  Backend* backend = nullptr;  // each null when it could not be read
  Connection* connection = nullptr;
  Operation* operation = nullptr;
  entry* e = nullptr;

  const char* text = "";  // what the client is told; settled by step 3
  int schema_result = 0;  // valid from step 4

  [[nodiscard]] const char* dn() const { return e->normalized_dn; }
};

bool read_request(pblock* pb, AddRequest& request) {
  return slapi_pblock_get(pb, parameter::backend, &request.backend) == 0 &&
         slapi_pblock_get(pb, parameter::connection, &request.connection) == 0 &&
         slapi_pblock_get(pb, parameter::operation, &request.operation) == 0 &&
         slapi_pblock_get(pb, parameter::add_entry, &request.e) == 0;
}

int answer(const AddRequest& request, int rc) {
  if (request.connection != nullptr && request.operation != nullptr) {
    send_ldap_result(request.connection, request.operation, rc, nullptr, request.text);
  }
  return rc;
}

// Steps 3 to 5, without the file.
int admit(AddRequest& request) {
  // 3. Roles come first: what the schema and the rules look at is what will be written.
  int rc = processRolesIfAdminGroupEntry(request.dn(), request.e, request.operation);
  if (rc == result::invalid_attribute_syntax) {
    rc = result::other;
    request.text = kInvalidRoleAnswer;
  }

  // 4. The schema, whatever step 3 gave; its refusal waits until step 9.
  request.schema_result = ldcf_api_schema_check(request.e, 0, 0);

  // 5. Authority, of an entry that the schema lets pass.
  if (rc == 0 && request.schema_result == 0) {
    rc = check_add_authority(request.connection, request.operation, request.e);
  }
  return rc;
}

using Rule = int (*)(const AddRequest& request);

// Steps 8 to 18, in their order; the first refusal is the answer.
constexpr Rule kRules[] = {
    // 8. There must be room for the entry...
    [](const AddRequest& r) { return checkIfExists(r.dn(), r.connection); },
    [](const AddRequest& r) { return checkForParent(r.dn(), r.connection, r.backend); },
    // 9. ...which is told before what the schema has against it.
    [](const AddRequest& r) { return r.schema_result; },
    // 10. and 11. What this subtree never holds.
    [](const AddRequest& r) { return checkReferral(r.e); },
    [](const AddRequest& r) { return checkForRep(r.e); },
    // 12. to 17. Each of these knows by itself whether the entry is its concern.
    [](const AddRequest& r) {
      return checkIfAdminGroupEntry(r.dn(), r.e, r.connection, r.operation);
    },
    [](const AddRequest& r) { return checkIfReplSupplierEntry(r.dn(), r.e, r.connection); },
    [](const AddRequest& r) {
      return checkIfKerberosEntry(r.dn(), r.e, r.connection, r.operation);
    },
    [](const AddRequest& r) { return checkIfDigestEntry(r.dn(), r.e, r.connection, r.operation); },
    [](const AddRequest& r) { return checkIfProxySplitContainer(r.e, r.connection); },
    [](const AddRequest& r) {
      return checkIfPassthruSubtreeEntry(r.e, r.connection, r.backend, r.operation);
    },
    // 18. Passwords, while the policy is on.
    [](const AddRequest& r) {
      return pwdIsAdminPolicyOn() ? checkAdminPolicyEntry(r.dn(), r.e, r.connection, r.operation)
                                  : static_cast<int>(result::success);
    },
};

int check_rules(const AddRequest& request) {
  for (const Rule rule : kRules) {
    const int rc = rule(request);
    if (rc != 0) return rc;
  }
  return result::success;
}

struct ModificationsDeleter {
  void operator()(ldapmod** array) const noexcept {
    free_ldmll(array[0]);
    std::free(array);
  }
};
using Modifications = std::unique_ptr<ldapmod*, ModificationsDeleter>;

// What is made of the entry for the file.
struct LocalEntry {
  attr* attributes = nullptr;
  MallocText dn;
};

// Steps 19 and 20.
int write_entry(_CFG* session, const entry& e, LocalEntry& local) {
  // 19. The file speaks the local code page.
  int rc = xlate_attrs(e.attributes, &local.attributes);
  if (rc == 0 && local.attributes != nullptr) {
    rc = convert(cfg_xlate_utf8_to_localcp, e.dn, local.dn);
  }
  if (rc != 0 || local.dn == nullptr) return rc;

  // 20. Where nothing came of the entry nothing is written, and that is a success.
  const Modifications modifications(EntryToLDAPMod(local.attributes));
  if (modifications == nullptr) return result::success;
  rc = cfg_add_s(session, local.dn.get(), modifications.get());
  return rc == result::no_such_record ? static_cast<int>(result::no_such_object) : rc;
}

}  // namespace

int config_back_add(pblock* pb) {
  // 1. No text to send yet.
  ldtr_function_local trace(function_id::config_back_add, "pb=0x%p", static_cast<void*>(pb));
  AddRequest request;

  // 2. Who adds what. Without all of it no lock is taken.
  if (!read_request(pb, request)) return trace.exit(answer(request, result::operations_error));

  // 3. to 6. What can be decided without the file.
  int rc = admit(request);
  if (rc != 0) return trace.exit(answer(request, rc));

  // 7. The session. When it cannot be opened, the lock, where it was taken, stays taken: the server
  // brings the backend back to rest.
  OperationSession session(request.connection,
                           static_cast<ConfigBackendPrivate*>(request.backend->private_data));
  rc = session.open();
  if (rc != 0) return trace.exit(answer(request, rc));

  // 8. to 18. What must hold, under the lock: the file cannot change before it is written.
  rc = check_rules(request);

  // 19. and 20. Then it is written.
  LocalEntry local;
  if (rc == 0) rc = write_entry(session.handle(), *request.e, local);

  // 21. Back to rest.
  if (local.attributes != nullptr) cleanup_attrs(&local.attributes);
  session.close();

  // 22. The one answer.
  local.dn.reset();
  return trace.exit(answer(request, rc));
}

}  // namespace orv
