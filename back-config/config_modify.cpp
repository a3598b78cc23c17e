#include "config_modify.h"

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <memory>

#include "callers.h"
#include "cfg/owners.h"
#include "cfg/result_codes.h"
#include "config_add.h"
#include "config_names.h"
#include "config_session.h"
#include "config_xlate.h"
#include "function_ids.h"
#include "handlers.h"
#include "name_list.h"
#include "rules.h"
#include "slapi/globals.h"
#include "slapi/log.h"
#include "slapi/owners.h"
#include "slapi/services.h"
#include "slapi/strings.h"
#include "slapi/trace.h"
#include "source_name.h"

namespace orv {

// ======== What modifications hold

namespace {

// The text of the value at that place, in whichever form the list has it; null past the last one.
const char* value_text(const ldapmod& modification, std::size_t place) {
  if ((modification.mod_op & kModBvalues) != 0) {
    berval** const values = modification.mod_vals.modv_bvals;
    return values == nullptr || values[place] == nullptr ? nullptr : values[place]->bv_val;
  }
  char** const values = modification.mod_vals.modv_strvals;
  return values == nullptr ? nullptr : values[place];
}

// Also an empty array is one.
bool has_value_array(const ldapmod& modification) {
  return (modification.mod_op & kModBvalues) != 0 ? modification.mod_vals.modv_bvals != nullptr
                                                  : modification.mod_vals.modv_strvals != nullptr;
}

bool is_of_type(const ldapmod& modification, const char* type) {
  return kel_strcasecmp(modification.mod_type, type) == 0;
}

bool adds_or_replaces(const ldapmod& modification) {
  return modification.operation() == kModAdd || modification.operation() == kModReplace;
}

}  // namespace

// ======== Addresses on which the server listens

namespace {

// Wording, blanks and the missing newline are kept as they are: readers of traces know them.
constexpr const char* kNoClasses = "checkIPaddrs: entry has no ocs.\n";
constexpr const char* kTopEntry = "checkIPaddrs: entry is orv-slapdTop.\n";
constexpr const char* kEveryAddress = "checkIPaddrs: server is configured to use all addrs.\n";
constexpr const char* kBadAddress = "checkIPaddrs: says the following IP address is not valid %s\n";
constexpr const char* kAddressTextFailed =
    "kel_asprintf failedin gen_checkIPaddrs_err in file %s at line %d";

constexpr const char* kNotAnAddress = "%s is not a valid IP address.";
constexpr const char* kNotOfThisSystem = "IP address %s is not defined for this system.";

bool has_values(const attr* a) {
  return a != nullptr && a->values != nullptr && a->values[0] != nullptr;
}

bool is_top_entry(const attr& object_classes) {
  const berval top{std::strlen(config_names::top_entry_class),
                   const_cast<char*>(config_names::top_entry_class)};  // only read
  return value_find(&object_classes, &top, object_classes.syntax, 1) == 0;
}

const char* address_text_of(int kind) {
  switch (kind) {
    case result::invalid_attribute_syntax:  // nobody asks for it
      return kNotAnAddress;
    case result::constraint_violation:
      return kNotOfThisSystem;
    default:
      return nullptr;
  }
}

// The value with a NUL behind it, whether it has one or not; null without memory. One byte would do
// for that; the second is never read.
char* terminated_copy(const berval& value) {
  auto* const copy = static_cast<char*>(std::malloc(value.bv_len + 2));
  if (copy == nullptr) return nullptr;
  std::memcpy(copy, value.bv_val, value.bv_len);
  copy[value.bv_len] = '\0';
  return copy;
}

}  // namespace

char* gen_checkIPaddrs_err(int kind, const berval* value) {
  ldtr_function_local trace(function_id::gen_check_ip_addrs_err);
  const char* const format = address_text_of(kind);
  if (format == nullptr) return nullptr;
  char* const copy = terminated_copy(*value);
  if (copy == nullptr) return nullptr;
  char* text = nullptr;
  if (kel_asprintf(&text, format, copy) == -1) {
    trace.debug(trace::error, kAddressTextFailed, source_name(__FILE__), __LINE__);
    std::free(copy);
    return nullptr;
  }
  return text;  // the copy stays behind: each refusal with a text costs that much memory for good
}

int checkIPaddrs(entry* e, char** text) {
  ldtr_function_local trace(function_id::check_ip_addrs);
  if (!has_values(e->object_classes)) {
    trace.debug(trace::detail, kNoClasses);
    return trace.exit(result::success);
  }
  if (!is_top_entry(*e->object_classes)) return trace.exit(result::success);  // without a line
  trace.debug(trace::detail, kTopEntry);

  const attr* const addresses = attr_find(e, config_names::ip_address, 0, 0);
  if (!has_values(addresses)) {
    trace.debug(trace::detail, kEveryAddress);
    return trace.exit(result::success);
  }
  for (berval** value = addresses->values; *value != nullptr; ++value) {
    if (isValidIPAddressOnSystem((*value)->bv_val)) continue;
    trace.debug(trace::error, kBadAddress, (*value)->bv_val);
    *text = gen_checkIPaddrs_err(result::constraint_violation, *value);
    return trace.exit(result::constraint_violation);
  }
  return trace.exit(result::success);
}

// ======== The modification list for the file

namespace {

constexpr const char* kListNotGrown = "addmodifyop: safe_realloc returns NULL \n";
constexpr const char* kNoRecord = "addmodifyop: calloc returns NULL \n";
constexpr const char* kNoType = "addmodifyop: strdup returns NULL \n";

int no_memory(const ldtr_function_local& trace, const char* text) {
  trace.debug(trace::error, kText, text);
  return result::no_memory;
}

template <typename T>
std::size_t count_of(T** array) {
  std::size_t count = 0;
  while (array != nullptr && array[count] != nullptr) ++count;
  return count;
}

// One slot more for an array of `count` (null for an empty one), empty like the one behind it.
// False without memory, with the array as it was.
template <typename T>
bool grow(T**& array, std::size_t count) {
  const std::size_t size = (count + 2) * sizeof(T*);
  void* const grown = array == nullptr ? std::malloc(size) : safe_realloc(array, size);
  if (grown == nullptr) return false;
  array = static_cast<T**>(grown);
  array[count] = nullptr;
  array[count + 1] = nullptr;
  return true;
}

// The place of the record of that type and code, or the end of the list.
std::size_t place_of_record(ldapmod** list, int operation, const char* type) {
  std::size_t place = 0;
  for (; list != nullptr && list[place] != nullptr; ++place) {
    if (is_of_type(*list[place], type) && list[place]->mod_op == operation) break;
  }
  return place;
}

int append_record(const ldtr_function_local& trace, ldapmod**& list, std::size_t count,
                  int operation, const char* type) {
  if (!grow(list, count)) return no_memory(trace, kListNotGrown);
  list[count] = static_cast<ldapmod*>(std::calloc(1, sizeof(ldapmod)));
  if (list[count] == nullptr) return no_memory(trace, kNoRecord);
  list[count]->mod_op = operation;
  list[count]->mod_type = strdup(type);
  return list[count]->mod_type == nullptr ? no_memory(trace, kNoType)
                                          : static_cast<int>(result::success);
}

int append_value(const ldtr_function_local& trace, ldapmod& record, const char* value) {
  char**& values = record.mod_vals.modv_strvals;
  const std::size_t count = count_of(values);
  if (!grow(values, count)) return no_memory(trace, kListNotGrown);
  std::size_t length = 0;
  return cfg_xlate_utf8_to_localcp(value, &values[count], &length);
}

}  // namespace

int addmodifyop(ldapmod*** list, int operation, const char* type, const char* value) {
  ldtr_function_local trace(function_id::addmodifyop);
  const std::size_t place = place_of_record(*list, operation, type);
  if (*list == nullptr || (*list)[place] == nullptr) {
    const int rc = append_record(trace, *list, place, operation, type);
    if (rc != 0) return trace.exit(rc);
  }
  if (value == nullptr) return trace.exit(result::success);
  return trace.exit(append_value(trace, *(*list)[place], value));
}

// ======== The entry as it would be

namespace {

bool has_values(const ldapmod& modification) {
  return modification.mod_vals.modv_bvals != nullptr &&
         modification.mod_vals.modv_bvals[0] != nullptr;
}

// Both of the server's functions give -1 for what is no failure of the client's.
int code_of(int rc) {
  return rc == -1 ? static_cast<int>(result::operations_error) : rc;
}

// That the attribute is not there to be replaced is no failure.
int remove_attribute(entry* e, const char* type) {
  const int rc = attr_delete(e, type, nullptr);
  return rc == 1 ? static_cast<int>(result::success) : code_of(rc);
}

int merge_values(entry* e, const ldapmod& modification) {
  return code_of(
      attr_merge(e, modification.mod_type, modification.mod_vals.modv_bvals, 1, 1, nullptr));
}

// The result after `modification`, where `rc` is the one before it. Only an add keeps a failure; a
// replace whose attribute cannot be removed adds nothing.
int apply(entry* e, ldapmod& modification, int rc) {
  switch (modification.operation()) {
    case kModDelete:
      return delete_values_from_entry(e, &modification);
    case kModReplace:
      rc = remove_attribute(e, modification.mod_type);
      [[fallthrough]];
    case kModAdd:
      return rc == 0 && has_values(modification) ? merge_values(e, modification) : rc;
    default:
      return result::other;
  }
}

}  // namespace

int mod_entry(entry* e, ldapmod** modifications) {
  ldtr_function_local trace(function_id::mod_entry);
  int rc = result::success;
  for (ldapmod* m = *modifications; m != nullptr; m = m->mod_next) rc = apply(e, *m, rc);
  return trace.exit(rc);
}

namespace {

// In their order; the first refusal is the result.
int check_changed_entry(Connection* connection, const char* dn, entry* e, ldapmod** modifications,
                        char** text) {
  int rc = mod_entry(e, modifications);
  if (rc == 0) rc = ldcf_api_schema_check(e, 0, 0);
  if (rc == 0) rc = checkReferral(e);
  if (rc == 0) rc = checkForRep(e);
  if (rc == 0) rc = checkIPaddrs(e, text);
  if (rc == 0) rc = verifyPassthroughServerEntry(dn, e, connection);
  return rc;
}

}  // namespace

int mod_schema_check(Connection* connection, const char* dn, ldapmod** modifications, char** text) {
  ldtr_function_local trace(function_id::mod_schema_check);
  *text = nullptr;
  _CFG* const session = connection->config_session;

  // Whether there is an entry is told by their number, before the code of the search.
  CfgResult chain;
  int rc = search_entry(session, dn, chain);
  if (cfg_count_entries(session, chain.get()) <= 0) return trace.exit(result::no_such_object);
  _CFGMessage* const record = cfg_first_entry(session, chain.get());
  if (cfg_get_errno(session) != 0) {
    cfg_perror(session, "cfg_first_entry");
    return trace.exit(result::other);
  }

  const EntryPtr e(CFGMessage2Entry(session, record));
  if (e == nullptr) return trace.exit(result::no_memory);
  if (rc == 0) rc = check_changed_entry(connection, dn, e.get(), modifications, text);
  return trace.exit(rc);
}

// ======== Modifications by the type of their attribute

int doesModAttributeExists(const char* type, ldapmod* modifications) {
  ldtr_function_local trace(function_id::does_mod_attribute_exists);
  if (type == nullptr || modifications == nullptr) {
    refuse_null(trace);
    return trace.exit(0);
  }
  for (const ldapmod* m = modifications; m != nullptr; m = m->mod_next) {
    if (is_of_type(*m, type)) return trace.exit(1);
  }
  return trace.exit(0);
}

ldapmod* getModAttribute(const char* type, ldapmod* modifications) {
  const ldtr_function_local trace(function_id::get_mod_attribute);
  if (type == nullptr || modifications == nullptr) {
    refuse_null(trace);
    return nullptr;
  }
  ldapmod* m = modifications;
  while (m != nullptr && !is_of_type(*m, type)) m = m->mod_next;
  return m;
}

namespace {

// The first modification of that type that sets it: a delete in front of it does not hide it.
const ldapmod* first_setting(const char* type, const ldapmod* modifications) {
  const ldapmod* m = modifications;
  while (m != nullptr && (!is_of_type(*m, type) || !adds_or_replaces(*m))) m = m->mod_next;
  return m;
}

// The same, of those with values.
const ldapmod* first_setting_with_values(const char* type, const ldapmod* modifications) {
  const ldapmod* m = first_setting(type, modifications);
  while (m != nullptr && !has_values(*m)) m = first_setting(type, m->mod_next);
  return m;
}

}  // namespace

// ======== What members of the administrative group may change

namespace {

// Whoever may say who the administrators are is one.
constexpr const char* kSettingsOfThePrimaryAdministrator[] = {
    config_names::admin_dn, config_names::admin_password, config_names::admin_group_enabled};

int check_top_settings(ldapmod* modifications) {
  for (const char* type : kSettingsOfThePrimaryAdministrator) {
    if (doesModAttributeExists(type, modifications) != 0) return result::insufficient_access;
  }
  return result::success;
}

// Its own password and nothing else, one change at a time.
int check_own_password(Connection* connection, const char* dn, const char* bound_dn,
                       const ldapmod* modifications) {
  if (modifications->mod_next != nullptr ||
      !is_of_type(*modifications, config_names::admin_password)) {
    return result::insufficient_access;
  }
  const MallocText member(getAdminGroupMemberDn(connection, dn));
  if (member == nullptr) return result::other;
  return is(member.get(), bound_dn) ? result::success : result::insufficient_access;
}

}  // namespace

int checkIfAdminGroupCanModify(Connection* connection, const char* normalized_dn,
                               const char* bound_dn, ldapmod* modifications) {
  ldtr_function_local trace(function_id::check_if_admin_group_can_modify);
  if (connection == nullptr || normalized_dn == nullptr || bound_dn == nullptr ||
      modifications == nullptr) {
    return trace.exit(refuse_null(trace));
  }
  if (is(normalized_dn, config_names::admin_group_dn)) {
    return trace.exit(result::insufficient_access);
  }
  if (is(normalized_dn, config_names::audit_log_dn)) {
    const bool auditor = (connection->roles & role::audit) != 0;
    return trace.exit(auditor ? result::success : result::insufficient_access);
  }
  if (is(normalized_dn, config_names::configuration_dn)) {
    return trace.exit(check_top_settings(modifications));
  }
  if (contains(normalized_dn, config_names::admin_group_dn)) {
    return trace.exit(check_own_password(connection, normalized_dn, bound_dn, modifications));
  }
  const bool policy = is(normalized_dn, config_names::password_policy_dn);
  return trace.exit(policy ? result::insufficient_access : result::success);
}

// ======== What the primary administrator makes of administrators

namespace {

// Wording and blanks are kept as they are: readers of traces know them.
constexpr const char* kNoRoleList = "Error - checkRootAdminModify: rc = %d\n";
constexpr const char* kNoEntry = "Error - checkRootAdminModify: entry %s does not exist!\n";
constexpr const char* kRoleSearchFailed =
    "Error - checkRootAdminModify: cfg_search_s failed with rc =%d for %s.\n";
constexpr const char* kNotARole = "Error: Invalid attribute value %s\n";

// ---- The roles that a member has

// 0; 32 no such entry; 80 it cannot be searched for.
int search_roles(const ldtr_function_local& trace, _CFG* session, const char* dn, char** names,
                 CfgResult& chain) {
  _CFGMessage* found = nullptr;
  const int rc = cfg_search_s(session, dn, kScopeSubtree, config_names::any_entry_in_parentheses,
                              names, 0, &found);
  chain.reset(found);
  if (rc == result::no_such_object) {
    trace.debug(trace::error, kNoEntry, dn);
    return result::no_such_object;
  }
  if (rc != 0) {
    trace.debug(trace::error, kRoleSearchFailed, rc, dn);
    return result::other;
  }
  return result::success;
}

// The values of the first entry, which is `dn` itself. 16 when it has none.
int read_roles(const ldtr_function_local& trace, _CFG* session, const char* dn, _CFGMessage* chain,
               CfgValues& roles) {
  _CFGMessage* const record = cfg_first_entry(session, chain);
  if (record == nullptr) {
    trace.debug(trace::error, kNoEntry, dn);
    return result::no_such_object;
  }
  roles.reset(cfg_get_values(session, record, config_names::admin_role));
  const bool some = roles != nullptr && roles.get()[0] != nullptr;
  return some ? result::success : result::no_such_attribute;
}

// ---- What the modifications make of them

struct RoleChanges {
  std::size_t deleted = 0;  // values, whether the member has them or not
  std::size_t added = 0;    // replaced ones are not counted
};

// The server's lists always hold counted values.
//
// Each value is checked on the one at its place in the first modification of roles, which is the
// modification itself when there is only one; where that is shorter, on itself. A value that is no
// role gives 80 without a text; on an add it is 21, of which the handler makes 80 with a text.
int check_role_values(const ldtr_function_local& trace, berval** first, const ldapmod& m,
                      RoleChanges& changes) {
  const std::size_t length = count_of(first);
  berval** const values = m.mod_vals.modv_bvals;
  for (std::size_t i = 0; values != nullptr && values[i] != nullptr; ++i) {
    const char* const value = (i < length ? first[i] : values[i])->bv_val;
    if (role_named(value) == nullptr) {
      trace.debug(trace::error, kNotARole, value);
      return result::other;
    }
    if (m.operation() == kModDelete) ++changes.deleted;
    if (m.operation() == kModAdd) ++changes.added;
  }
  return result::success;
}

bool is_among(const char* value, char** roles) {
  for (char** role = roles; *role != nullptr; ++role) {
    if (kel_strcasecmp(*role, value) == 0) return true;
  }
  return false;
}

// Only the last value decides. The others were looked for in the copy of the schema check; of a
// list that is rewritten nobody looks again.
int check_deleted_roles(const ldapmod& m, char** roles) {
  bool found = true;
  berval** const values = m.mod_vals.modv_bvals;
  for (berval** value = values; value != nullptr && *value != nullptr; ++value) {
    found = is_among((*value)->bv_val, roles);
  }
  return found ? result::success : result::no_such_attribute;
}

int check_role_modifications(const ldtr_function_local& trace, ldapmod* modifications, char** roles,
                             RoleChanges& changes) {
  ldapmod* const first = getModAttribute(config_names::admin_role, modifications);
  for (const ldapmod* m = first; m != nullptr; m = m->mod_next) {
    if (!is_of_type(*m, config_names::admin_role)) continue;
    int rc = check_role_values(trace, first->mod_vals.modv_bvals, *m, changes);
    if (rc == 0 && m->operation() == kModDelete) rc = check_deleted_roles(*m, roles);
    if (rc != 0) return rc;
  }
  return result::success;
}

// ---- The last role

void release_values(berval** values) {
  if (values != nullptr) CountedValuesDeleter()(values);
}

// Makes the first delete of the whole list, whatever it deletes, store "NoAdmin" instead; there is
// one. The new value is made before the old ones go, so that without memory the list is as it was.
int store_no_admin(ldapmod* modifications) {
  ldapmod* m = modifications;
  while (m->operation() != kModDelete) m = m->mod_next;
  CountedValues values(static_cast<berval**>(std::calloc(2, sizeof(berval*))));
  if (values == nullptr) return result::no_memory;
  values.get()[0] = new_value(kNoAdminRole);
  if (values.get()[0] == nullptr) return result::no_memory;
  release_values(m->mod_vals.modv_bvals);
  m->mod_op = kModReplace | kModBvalues;
  m->mod_vals.modv_bvals = values.release();
  return result::success;
}

int check_roles(const ldtr_function_local& trace, _CFG* session, const char* dn,
                ldapmod* modifications) {
  CfgValues roles;
  const NameList names(config_names::admin_role);
  if (!names.complete()) {
    trace.debug(trace::error, kNoRoleList, result::no_memory);
    return result::no_memory;
  }
  CfgResult chain;
  RoleChanges changes;
  int rc = search_roles(trace, session, dn, names.get(), chain);
  if (rc == 0) rc = read_roles(trace, session, dn, chain.get(), roles);
  if (rc == 0) rc = check_role_modifications(trace, modifications, roles.get(), changes);
  if (rc != 0) return rc;
  // Added ones on the other side: both are counts, and neither difference is to wrap.
  const bool none_left = changes.deleted == count_of(roles.get()) + changes.added;
  return none_left ? store_no_admin(modifications) : static_cast<int>(result::success);
}

// ---- The identities

int check_new_bind_dn(_CFG* session, const ldapmod* modifications) {
  const ldapmod* const m = first_setting_with_values(config_names::admin_dn, modifications);
  return m == nullptr ? static_cast<int>(result::success)
                      : check_bind_dn_of_member(session, value_text(*m, 0));
}

int check_new_kerberos_identity(const ldtr_function_local& trace, _CFG* session,
                                const ldapmod* modifications) {
  const ldapmod* const m =
      first_setting_with_values(config_names::kerberos_admin_dn, modifications);
  return m == nullptr
             ? static_cast<int>(result::success)
             : check_kerberos_identity(trace, session, value_text(*m, 0), kBadKerberosMember);
}

int check_new_digest_user(_CFG* session, const ldapmod* modifications) {
  const ldapmod* const m =
      first_setting_with_values(config_names::digest_admin_user, modifications);
  return m == nullptr ? static_cast<int>(result::success)
                      : doesDigestUserNameExist(session, value_text(*m, 0));
}

}  // namespace

int checkRootAdminModify(_CFG* session, const char* normalized_dn, ldapmod* modifications) {
  ldtr_function_local trace(function_id::check_root_admin_modify);
  if (session == nullptr || normalized_dn == nullptr || modifications == nullptr) {
    return trace.exit(refuse_null(trace));
  }
  if (!is(normalized_dn, config_names::configuration_dn) &&
      !contains(normalized_dn, config_names::admin_group_dn)) {
    return trace.exit(result::success);
  }
  int rc = check_new_bind_dn(session, modifications);
  if (rc == 0 && doesModAttributeExists(config_names::admin_role, modifications) != 0) {
    rc = check_roles(trace, session, normalized_dn, modifications);
  }
  if (rc == 0) rc = check_new_kerberos_identity(trace, session, modifications);
  if (rc == 0) rc = check_new_digest_user(session, modifications);
  return trace.exit(rc);
}

// ======== Other identities

namespace {

// Wording and blanks are kept as they are: readers of traces know them.
constexpr const char* kNoValueForDn = "Missing value for dn.\n";
constexpr const char* kNullToProxyName =
    "checkProxynameModify::Invalid NULL pointer passed through.\n";

constexpr int kMessageSplitNameTaken = 145;
// Either of these bits opens the master server's entry here; the handler asks for more.
constexpr unsigned kReplicationRoles = role::replication;

}  // namespace

int checkKerberosModify(Operation* operation, _CFG* session, const char* normalized_dn,
                        ldapmod* modifications) {
  ldtr_function_local trace(function_id::check_kerberos_modify);
  if (operation == nullptr || session == nullptr || normalized_dn == nullptr ||
      modifications == nullptr) {
    return trace.exit(refuse_null(trace));
  }
  if (!is(normalized_dn, config_names::kerberos_dn)) return trace.exit(result::success);
  const ldapmod* const m = getModAttribute(config_names::kerberos_admin_dn, modifications);
  if (m == nullptr) return trace.exit(result::success);
  if (!is_primary_administrator(*operation)) return trace.exit(result::insufficient_access);
  if (!adds_or_replaces(*m)) return trace.exit(result::success);
  return trace.exit(check_kerberos_identity(trace, session, value_text(*m, 0), kBadKerberosRoot));
}

int checkDigestModify(Operation* operation, _CFG* session, const char* normalized_dn,
                      ldapmod* modifications) {
  ldtr_function_local trace(function_id::check_digest_modify);
  if (operation == nullptr || session == nullptr || normalized_dn == nullptr ||
      modifications == nullptr) {
    return trace.exit(refuse_null(trace));
  }
  if (!is(normalized_dn, config_names::digest_dn)) return trace.exit(result::success);
  const ldapmod* const m = getModAttribute(config_names::digest_admin_user, modifications);
  if (m == nullptr) return trace.exit(result::success);
  if (!is_primary_administrator(*operation)) return trace.exit(result::insufficient_access);
  if (!adds_or_replaces(*m)) return trace.exit(result::success);
  return trace.exit(doesDigestUserNameExist(session, value_text(*m, 0)));
}

int checkReplSupplierModify(Connection* connection, _CFG* session, const char* normalized_dn,
                            ldapmod* modifications) {
  ldtr_function_local trace(function_id::check_repl_supplier_modify);
  if (connection == nullptr || session == nullptr || normalized_dn == nullptr ||
      modifications == nullptr) {
    return trace.exit(refuse_null(trace));
  }
  if (is(normalized_dn, config_names::master_server_dn) &&
      has_all(connection->authority, authority::admin_group_member) &&
      (connection->roles & kReplicationRoles) == 0) {
    return trace.exit(result::insufficient_access);
  }
  // In every entry: whoever has the attribute can become a supplier.
  const ldapmod* const m = first_setting(config_names::master_dn, modifications);
  if (m == nullptr) return trace.exit(result::success);
  const char* const dn = value_text(*m, 0);
  if (dn == nullptr) {
    trace.debug(trace::error, kText, kNoValueForDn);
    return trace.exit(result::other);
  }
  return trace.exit(doesAdminGroupMemberDNExist(session, dn));
}

int checkProxyNameModify(_CFG* session, const char* normalized_dn, ldapmod* modifications) {
  ldtr_function_local trace(function_id::check_proxy_name_modify);
  if (session == nullptr || normalized_dn == nullptr || modifications == nullptr) {
    return trace.exit(refuse_null(trace, kNullToProxyName));
  }
  const ldapmod* const m = getModAttribute(config_names::proxy_split_name, modifications);
  if (m == nullptr || !adds_or_replaces(*m)) return trace.exit(result::success);
  const char* const name = value_text(*m, 0);
  if (!is_string_alphanum(name)) return trace.exit(result::invalid_attribute_syntax);
  const int rc = doesProxySplitNameExist(session, name);
  if (rc == result::already_exists) PrintMessage(0, kMessageSet, kMessageSplitNameTaken);
  return trace.exit(rc);
}

// ======== The audit log's file

namespace {

constexpr const char* kNoPath = "Error - resolve_path: input filespec is NULL\n";
constexpr const char* kNoPathBuffer =
    "Error - resolve_path: allocation failed in file %s near line %d\n";
constexpr const char* kNoSuchFile = "resolve_path: file name=[%s] errno=%d\n";
constexpr const char* kPathNotResolved =
    "Error - resolve_path: realpath failed for file name=[%s] errno=%d\n";
constexpr const char* kPathResolved = "resolve_path: input file=[%s] resolved file=[%s]\n";

// Wording and blanks are kept as they are: readers of traces know them.
constexpr const char* kNoAuditSession =
    "Error - get_audit_log_filename: invalid configuration session handel\n";
constexpr const char* kAuditSearch =
    "get_audit_log_filename: base search dn=[%s] filter=[%s] for attribute=[%s]\n";
constexpr const char* kNoAuditEntry = "Error - get_audit_log_filename: missing entry for DN=%s\n";
constexpr const char* kNoAuditAttribute =
    "Error - get_audit_log_filename: failed to retrieve attribute, rc=%d\n";
constexpr const char* kNoAuditValues =
    "Error - get_audit_log_filename: failed to retrieve values for %s, rc=%d\n";
constexpr const char* kNoAuditCopy =
    "Error - get_audit_log_filename: allocation failed in file %s near line %d\n";
constexpr const char* kAuditNotRead =
    "Error - get_audit_log_filename: unable to retrieve attributes rc=%d\n";

constexpr const char* kAuditNoDn = "Error - checkAuditLog: invalid dn\n";
constexpr const char* kAuditItself = "checkAuditLog: No check made for changes to entry DN=%s\n";
constexpr const char* kAuditNoMods = "Error - checkAuditLog: invalid mods\n";
constexpr const char* kNoDefaultCopy =
    "Error - checkAuditLog: allocation failed in file %s near line %d\n";
constexpr const char* kBadAuditFile = "Error - checkAuditLog: invalid audit log filename\n";
constexpr const char* kAuditCompared =
    "checkAuditLog: audit log filename=[%s] value=[%s] for attr=%s\n";
constexpr const char* kAuditFileTaken =
    "Error - checkAuditLog: audit log filename %s cannot be used as a value for %s\n";

// What the server logs to while its settings name no file.
constexpr const char* kDefaultAuditLogFile = "/var/ldap/V6.0/audit.log";

constexpr std::size_t kPathSize = 4096;  // what realpath asks for

MallocText resolve(const ldtr_function_local& trace, const char* path) {
  if (path == nullptr) {
    trace.debug(trace::error, kNoPath);
    return nullptr;
  }
  MallocText resolved(static_cast<char*>(std::calloc(1, kPathSize)));
  if (resolved == nullptr) {
    trace.debug(trace::error, kNoPathBuffer, source_name(__FILE__), __LINE__);
    return nullptr;
  }
  if (realpath(path, resolved.get()) != nullptr) return resolved;
  const int reason = errno;  // the trace may change it
  if (reason == ENOENT) {
    // A file that is still to be made is known by the name that it was given.
    trace.debug(trace::detail, kNoSuchFile, path, reason);
    kel_strlcpy(resolved.get(), path, kPathSize);
    return resolved;
  }
  trace.debug(trace::error, kPathNotResolved, path, reason);
  return nullptr;
}

}  // namespace

char* resolve_path(const char* path) {
  const ldtr_function_local trace(function_id::resolve_path);
  MallocText resolved = resolve(trace, path);
  trace.debug(trace::detail, kPathResolved, path != nullptr ? path : "NULL",
              resolved != nullptr ? resolved.get() : "NULL");
  return resolved.release();
}

namespace {

int search_audit_entry(const ldtr_function_local& trace, _CFG* session, CfgResult& chain) {
  char* attributes[] = {const_cast<char*>(config_names::log_file), nullptr};  // only read
  _CFGMessage* found = nullptr;
  const int rc = cfg_search_s(session, config_names::audit_log_dn, kScopeBase,
                              config_names::audit_log_entries, attributes, 0, &found);
  chain.reset(found);
  if (rc != 0) trace.debug(trace::error, kNoAuditEntry, config_names::audit_log_dn);
  return rc;
}

// Reads the first value of the entry's first attribute, if that is the one that was asked for. 0,
// also when there is none; 90, or the code of what failed. Everything but `file` is released.
int read_audit_log_file(const ldtr_function_local& trace, _CFG* session, MallocText& file) {
  // Released in the reverse order: values, name, walk, result.
  CfgResult chain;
  CfgCursor walk;
  CfgText name;
  ValueList values;

  int rc = search_audit_entry(trace, session, chain);
  if (rc != 0) return rc;
  _CFGMessage* const record = cfg_first_entry(session, chain.get());
  if (record == nullptr) return result::success;

  _CFGBer* position = nullptr;
  name.reset(cfg_first_attribute(session, record, &position));
  walk.reset(position);
  rc = cfg_get_errno(session);
  if (rc != 0) {
    trace.debug(trace::error, kNoAuditAttribute, rc);
    return rc;
  }
  if (name == nullptr) return result::success;

  values.reset(cfg_get_values(session, record, name.get()));
  rc = cfg_get_errno(session);
  if (rc != 0) {
    trace.debug(trace::error, kNoAuditValues, name.get(), rc);
    return rc;
  }
  if (values == nullptr || values.get()[0] == nullptr ||
      kel_strcasecmp(name.get(), config_names::log_file) != 0) {
    return result::success;
  }
  file.reset(slapi_ch_strdup(values.get()[0]));
  if (file != nullptr) return result::success;
  trace.debug(trace::error, kNoAuditCopy, source_name(__FILE__), __LINE__);
  return result::no_memory;
}

}  // namespace

char* get_audit_log_filename(_CFG* session) {
  ldtr_function_local trace(function_id::get_audit_log_filename);
  if (session == nullptr) {
    trace.debug(trace::error, kNoAuditSession);
    return nullptr;
  }
  trace.debug(trace::detail, kAuditSearch, config_names::audit_log_dn,
              config_names::audit_log_entries, config_names::log_file);
  MallocText file;
  const int rc = trace.exit(read_audit_log_file(trace, session, file));
  if (rc != 0) {
    cfg_perror(session, nullptr);
    trace.debug(trace::error, kAuditNotRead, rc);
  }
  return file.release();
}

namespace {

// The audit log's own file, resolved: 0, 80 or 90.
int resolve_audit_log_file(const ldtr_function_local& trace, _CFG* session, MallocText& resolved) {
  // Where the settings name no file, or cannot be read, the server's default is protected.
  MallocText file(get_audit_log_filename(session));
  if (file == nullptr) file.reset(slapi_ch_strdup(kDefaultAuditLogFile));
  if (file == nullptr) {
    trace.debug(trace::error, kNoDefaultCopy, source_name(__FILE__), __LINE__);
    return result::no_memory;
  }
  resolved.reset(resolve_path(file.get()));
  file.reset();
  if (resolved != nullptr) return result::success;
  trace.debug(trace::error, kBadAuditFile);
  return result::other;
}

bool takes_audit_log_file(const ldtr_function_local& trace, const char* audit_file,
                          const ldapmod& modification) {
  if (!adds_or_replaces(modification) || modification.mod_type == nullptr ||
      !is_of_type(modification, config_names::log_file)) {
    return false;
  }
  const char* const value = value_text(modification, 0);
  if (value == nullptr) return false;  // nothing to compare
  // A path that cannot be resolved, for whatever reason, also want of memory, is let pass.
  const MallocText resolved(resolve_path(value));
  if (resolved == nullptr) return false;
  trace.debug(trace::detail, kAuditCompared, audit_file, resolved.get(), modification.mod_type);
  // In any letter case, so that a file system without letter case makes no second name.
  if (kel_strcasecmp(resolved.get(), audit_file) != 0) return false;
  trace.debug(trace::error, kAuditFileTaken, audit_file, modification.mod_type);
  return true;
}

}  // namespace

int checkAuditLog(_CFG* session, const char* normalized_dn, ldapmod* modifications) {
  ldtr_function_local trace(function_id::check_audit_log);
  if (normalized_dn == nullptr) {
    trace.debug(trace::error, kAuditNoDn);
    return trace.exit(result::other);
  }
  // The audit log may change its own file: asked before the list, which so may be null. Byte for
  // byte on purpose: any other spelling is examined like every other entry.
  if (is(normalized_dn, config_names::audit_log_dn)) {
    trace.debug(trace::detail, kAuditItself, normalized_dn);
    return trace.exit(result::success);
  }
  if (modifications == nullptr) {
    trace.debug(trace::error, kAuditNoMods);
    return trace.exit(result::other);
  }
  MallocText audit_file;
  int rc = resolve_audit_log_file(trace, session, audit_file);
  if (rc != 0) return trace.exit(rc);
  // To the end, also after a refusal: the trace names every value that was refused.
  for (const ldapmod* m = modifications; m != nullptr; m = m->mod_next) {
    if (takes_audit_log_file(trace, audit_file.get(), *m)) rc = result::unwilling_to_perform;
  }
  return trace.exit(rc);
}

// ======== The policy for administrators' passwords

namespace {

// Wording and blanks are kept as they are: readers of traces know them.
constexpr const char* kUnknownSetting = "checkAdminPolicyEntryModify:invalid mod_type!\n";
constexpr const char* kSettingsRefused =
    "checkAdminPolicyEntryModify:validate_new_setting failed, rc=%d!\n";
constexpr const char* kNoPassword = "Error - no password value\n";
constexpr const char* kNoDn = "Error - no dn value\n";
// Written for every answer but 1, not only for 0.
constexpr const char* kNotSealed = "unformat_password returns 0 for clear text password\n";

// ---- A change of the policy

constexpr const char* kLockoutSetting = "pwdLockout";

struct NumberSetting {
  const char* attribute;
  int _Admin_pwdPolicy::*member;
};
constexpr NumberSetting kNumberSettings[] = {
    {"pwdLockoutDuration", &_Admin_pwdPolicy::pwdLockoutDuration},
    {"pwdMaxFailure", &_Admin_pwdPolicy::pwdMaxFailure},
    {"pwdFailureCountInterval", &_Admin_pwdPolicy::pwdFailureCountInterval},
    {"pwdMinLength", &_Admin_pwdPolicy::pwdMinLength},
    {"passwordMinAlphaChars", &_Admin_pwdPolicy::passwordMinAlphaChars},
    {"passwordMinOtherChars", &_Admin_pwdPolicy::passwordMinOtherChars},
    {"passwordMaxRepeatedChars", &_Admin_pwdPolicy::passwordMaxRepeatedChars},
    {"passwordMinDiffChars", &_Admin_pwdPolicy::passwordMinDiffChars},
};

// What an int cannot hold wraps; the server refuses such numbers before it asks. A value without
// digits is 0.
int number_of(const char* value) {
  return static_cast<int>(std::atol(value));  // NOLINT(cert-err34-c)
}

// Puts the modification's value into the policy, whatever its code. False for a type that is none
// of the policy's.
bool apply_setting(const ldapmod& modification, _Admin_pwdPolicy& policy) {
  const char* const value = value_text(modification, 0);
  if (is_of_type(modification, kLockoutSetting)) {
    if (value != nullptr) policy.pwdLockout = kel_strcasecmp(value, "TRUE") == 0 ? 1 : 0;
    return true;
  }
  for (const NumberSetting& setting : kNumberSettings) {
    if (!is_of_type(modification, setting.attribute)) continue;
    if (value != nullptr) policy.*setting.member = number_of(value);
    return true;
  }
  return false;
}

}  // namespace

int checkAdminPolicyEntryModify(ldapmod* modifications) {
  ldtr_function_local trace(function_id::check_admin_policy_entry_modify);
  _Admin_pwdPolicy policy = getGlobalAdminPWDPolicyLocal();
  for (const ldapmod* m = modifications; m != nullptr; m = m->mod_next) {
    if (!apply_setting(*m, policy)) trace.debug(trace::error, kUnknownSetting);
  }
  const int rc = validate_new_settings(policy, true);
  if (rc != 0) trace.debug(trace::error, kSettingsRefused, rc);
  return trace.exit(rc);
}

// ---- A new password

namespace {

// Whose password it is: where it stands, and how the entry is found.
struct PasswordHolder {
  const char* password;
  const char* dn;
  const char* filter;
  const char* second_filter;  // asked when the first one finds nothing; or null
};
// The filter is the bare name of the attribute: whether it is present.
constexpr PasswordHolder kAdministrator = {config_names::admin_password, config_names::admin_dn,
                                           config_names::admin_password, nullptr};
constexpr PasswordHolder kSupplier = {config_names::master_password, config_names::master_dn,
                                      config_names::replication_entries,
                                      config_names::supplier_entries};

// Told by the entry's DN, not by the attribute that is changed. Both tests are on bytes: any other
// spelling of the administrator's DN is looked for among the suppliers, and only found there if it
// is one.
const PasswordHolder& holder_of(const char* normalized_dn) {
  const bool administrator = is(normalized_dn, config_names::configuration_dn) ||
                             contains(normalized_dn, config_names::admin_group_dn);
  return administrator ? kAdministrator : kSupplier;
}

// 0 something was found; 32, or the code of a search: the first that fails ends it.
int find_holder(_CFG* session, const char* dn, const PasswordHolder& holder, CfgResult& chain) {
  char* attributes[] = {const_cast<char*>(holder.password), const_cast<char*>(holder.dn), nullptr};
  for (const char* filter : {holder.filter, holder.second_filter}) {
    if (filter == nullptr) continue;
    chain.reset();
    _CFGMessage* found = nullptr;
    const int rc = cfg_search_s(session, dn, kScopeBase, filter, attributes, 0, &found);
    chain.reset(found);
    if (rc != 0) return rc;
    if (cfg_count_entries(session, chain.get()) > 0) return result::success;
  }
  return result::no_such_object;
}

// What a check holds until its end. It is then released from the last member to the first: the
// values, the copies, the clear text, the result.
struct PasswordCheck {
  CfgResult chain;
  ClearText clear;      // the old password, where it was sealed
  ClearText password;   // a copy of the new one
  MallocText dn;        // a copy; null where the attribute has no value
  CfgValues dn_values;  // kept, though `dn` is a copy of the first
  CfgValues old_values;
  char* old_password = nullptr;  // in `clear` or in `old_values`; null where there is none
};

int read_old_password(const ldtr_function_local& trace, _CFG* session, _CFGMessage* record,
                      const char* type, bool adding, PasswordCheck& check) {
  check.old_values.reset(cfg_get_values(session, record, type));
  const int rc = cfg_get_errno(session);
  if (rc != 0) {
    trace.debug(trace::error, kNoPassword);
    // Who adds a password need not have had one; who replaces one must.
    return rc == result::no_such_attribute && adding ? static_cast<int>(result::success) : rc;
  }
  if (check.old_values == nullptr || check.old_values.get()[0] == nullptr) return result::success;
  char* const stored = check.old_values.get()[0];
  char* clear = nullptr;
  if (unformat_password(stored, &clear, session->key, 0) == 1) {
    check.clear.reset(clear);
    check.old_password = clear;
  } else {
    trace.debug(trace::detail, kNotSealed);
    check.old_password = stored;
  }
  return result::success;
}

int read_identity_dn(const ldtr_function_local& trace, _CFG* session, _CFGMessage* record,
                     const char* type, PasswordCheck& check) {
  check.dn_values.reset(cfg_get_values(session, record, type));
  const int rc = cfg_get_errno(session);
  if (rc != 0) {
    trace.debug(trace::error, kNoDn);
    return rc;
  }
  if (check.dn_values == nullptr || check.dn_values.get()[0] == nullptr) return result::success;
  check.dn.reset(slapi_ch_strdup(check.dn_values.get()[0]));
  return check.dn != nullptr ? result::success : result::no_memory;
}

int check_new_password(const ldtr_function_local& trace, Operation* operation, _CFG* session,
                       const char* normalized_dn, const ldapmod& modification) {
  const PasswordHolder& holder = holder_of(normalized_dn);
  PasswordCheck check;
  int rc = find_holder(session, normalized_dn, holder, check.chain);
  if (rc != 0) return rc;
  _CFGMessage* const record = cfg_first_entry(session, check.chain.get());

  const bool adding = modification.operation() == kModAdd;
  rc = read_old_password(trace, session, record, holder.password, adding, check);
  if (rc != 0) return rc;
  rc = read_identity_dn(trace, session, record, holder.dn, check);
  if (rc != 0) return rc;

  check.password.reset(slapi_ch_strdup(value_text(modification, 0)));
  if (check.password == nullptr) return result::no_memory;  // also for a replace by nothing
  rc = verify_admin_password(check.password.get(), check.old_password, operation);
  if (rc != 0) return rc;

  // Whether lockout is on is asked for the call's own sake: the answer decides nothing. The server
  // looks at the mark.
  static_cast<void>(pwdIsAdminPasswordLockoutOn());
  AdminPasswordRecord* const failures = findAdminPWDPAttrib(check.dn.get());
  if (failures != nullptr) failures->changed = 1;
  return result::success;
}

}  // namespace

int checkAdminPolicyModify(Operation* operation, _CFG* session, const char* normalized_dn,
                           ldapmod* modifications) {
  ldtr_function_local trace(function_id::check_admin_policy_modify);
  if (session == nullptr || normalized_dn == nullptr || modifications == nullptr) {
    trace.debug(trace::error, kText, kNullPointer);
    return trace.exit(result::operations_error);  // unlike the other rules
  }
  // The administrator's password hides a supplier's in the same list.
  const ldapmod* modification = getModAttribute(config_names::admin_password, modifications);
  if (modification == nullptr) {
    modification = getModAttribute(config_names::master_password, modifications);
  }
  if (modification == nullptr || !adds_or_replaces(*modification)) {
    return trace.exit(result::success);
  }
  return trace.exit(check_new_password(trace, operation, session, normalized_dn, *modification));
}

// ======== How passwords are stored

namespace {

constexpr const char* kMethodNotAllowed =
    "requested orv-slapdPwEncryption value is not allowed by current configuration.";
constexpr const char* kNoSuchMethod =
    "orv-slapdPwEncryption value is not one of the supported values.";

constexpr int kNothingConverted = 16;  // no method has this number
constexpr int kStageMethodFunction = -159;

// Any value but 0, on purpose: the review of pass-through entries asks for exactly 1.
bool in_safe_mode() {
  return g_safe_mode.load(std::memory_order_relaxed) != 0;
}

// Hands the method to the directory backend, if that takes it.
int hand_to_directory_backend(int method, char** text) {
  Backend* const backend = select_backend_opt(config_names::localhost_dn);
  if (backend == nullptr) return result::success;
  PluginFunction* functions = nullptr;
  if (getAllPluginFuncs(backend, kStageMethodFunction, &functions) != 0 || functions == nullptr ||
      functions[0] == nullptr) {
    return result::success;
  }
  return functions[0](backend, method, text);
}

// Without memory the client gets the code alone.
int refuse_method(const char* reason, int code, char** text) {
  *text = slapi_ch_strdup(reason);
  return code;
}

}  // namespace

int checkPwEncryptionModify(Operation* operation, _CFG* session, const char* normalized_dn,
                            ldapmod* modifications, char** text) {
  ldtr_function_local trace(function_id::check_pw_encryption_modify);
  if (operation == nullptr || session == nullptr || normalized_dn == nullptr ||
      modifications == nullptr || text == nullptr) {
    return trace.exit(refuse_null(trace));
  }
  if (in_safe_mode()) return trace.exit(result::success);
  if (!is(normalized_dn, config_names::configuration_dn)) return trace.exit(result::success);
  const ldapmod* const modification =
      getModAttribute(config_names::password_encryption, modifications);
  if (modification == nullptr || !adds_or_replaces(*modification)) {
    return trace.exit(result::success);
  }

  int method = kNothingConverted;
  if (convertPWEncryptionMethod(value_text(*modification, 0), &method) != 0) {
    return trace.exit(refuse_method(kMethodNotAllowed, result::unwilling_to_perform, text));
  }
  if (method == kNothingConverted) {
    return trace.exit(refuse_method(kNoSuchMethod, result::invalid_attribute_syntax, text));
  }
  // Asked again: the server may have gone into safe mode meanwhile.
  if (in_safe_mode()) return trace.exit(result::success);
  return trace.exit(hand_to_directory_backend(method, text));
}

// ======== The handler

namespace {

constexpr const char* kTargetMissing = "Error - config_back_modify: entry %s does not exist!\n";
constexpr const char* kTargetClasses = "OBJECTCLASS";

struct ModifyRequest {
  Backend* backend = nullptr;  // each null when it could not be read
  Connection* connection = nullptr;
  Operation* operation = nullptr;
  const char* dn = nullptr;          // UTF-8, normalised by the server
  ldapmod* modifications = nullptr;  // ours from the moment that it was read

  int schema_result = 0;  // valid from step 3
  MallocText text;        // what the client is told; from the checks of steps 3, 8 and 9

  [[nodiscard]] _CFG* session() const { return connection->config_session; }
};

bool read_request(pblock* pb, ModifyRequest& request) {
  return slapi_pblock_get(pb, parameter::backend, &request.backend) == 0 &&
         slapi_pblock_get(pb, parameter::connection, &request.connection) == 0 &&
         slapi_pblock_get(pb, parameter::operation, &request.operation) == 0 &&
         slapi_pblock_get(pb, parameter::target_dn, &request.dn) == 0 &&
         slapi_pblock_get(pb, parameter::modifications, &request.modifications) == 0;
}

// Step 13: the answer, then the end of what the server gave us.
int answer(pblock* pb, ModifyRequest& request, int rc) {
  if (request.connection != nullptr && request.operation != nullptr) {
    send_ldap_result(request.connection, request.operation, rc, nullptr,
                     request.text != nullptr ? request.text.get() : "");
  }
  request.text.reset();
  if (request.modifications != nullptr) {
    free_ldmll(request.modifications);
    slapi_pblock_set(pb, parameter::modifications, nullptr);
  }
  return rc;
}

// ---- Steps 3 and 8: the schema

int check_schema(ModifyRequest& request) {
  char* text = nullptr;
  const int rc = mod_schema_check(request.connection, request.dn, &request.modifications, &text);
  request.text.reset(text);
  return rc;
}

// Looked for in the normal form, and at the first modification only.
bool begins_with_roles_of_member(const ModifyRequest& request) {
  return contains(request.dn, config_names::admin_group_dn) && request.modifications != nullptr &&
         is_of_type(*request.modifications, config_names::admin_role);
}

// A member that loses its last role is no violation yet: step 6 may put "NoAdmin" in its place, and
// step 8 looks at what became of the list.
int check_schema_before_roles(ModifyRequest& request) {
  const int rc = check_schema(request);
  const bool forgiven =
      rc == result::object_class_violation && begins_with_roles_of_member(request);
  return forgiven ? static_cast<int>(result::success) : rc;
}

// ---- Step 4: who is kept out, and what a supplier may do

// A supplier of a suffix has to be that of each suffix that it adds. Each answer of the server is
// kept in the operation. Only an answer ends the walk: behind another attribute, which is refused
// in any case, the server is still asked about the suffixes that follow.
int check_supplied_suffixes(const ModifyRequest& request) {
  Operation& operation = *request.operation;
  int rc = result::success;
  for (const ldapmod* m = request.modifications; m != nullptr; m = m->mod_next) {
    if (!is_of_type(*m, config_names::suffix)) {
      rc = result::insufficient_access;
      continue;
    }
    for (std::size_t i = 0; const char* suffix = value_text(*m, i); ++i) {
      operation.master_server_result = checkMasterSrvDn(suffix, operation.bound_dn);
      if (operation.master_server_result == 0) return result::insufficient_access;
    }
  }
  return rc;
}

// All that a supplier does here is to add suffixes to the directory backend.
int check_supplier(const ModifyRequest& request) {
  Operation& operation = *request.operation;
  // Asked, and noted, also where the schema has refused already.
  operation.master_server_result = checkMasterSrvDn(nullptr, operation.bound_dn);
  if (request.schema_result != 0) return request.schema_result;
  if (operation.master_server_result == 0) {
    const int rc = check_supplied_suffixes(request);
    if (rc != 0) return rc;
  }
  if (kel_strcasecmp(request.dn, config_names::directory_backend_dn) != 0) {
    return result::insufficient_access;
  }
  for (const ldapmod* m = request.modifications; m != nullptr; m = m->mod_next) {
    if (!is_of_type(*m, config_names::suffix) || m->operation() != kModAdd) {
      return result::insufficient_access;
    }
  }
  return result::success;
}

int check_flags(const ModifyRequest& request) {
  // The refusal hides the schema's code, but not its text.
  if (is_kept_out(*request.operation)) return result::insufficient_access;
  return is_supplier(*request.operation) ? check_supplier(request) : request.schema_result;
}

// ---- Steps 5 and 8: what is written

int copy_modification(const ldapmod& m, ldapmod**& copy) {
  if (!has_value_array(m)) return addmodifyop(&copy, m.operation(), m.mod_type, nullptr);
  // An empty array leaves nothing to write.
  int rc = result::success;
  for (std::size_t i = 0; rc == 0; ++i) {
    const char* const value = value_text(m, i);
    if (value == nullptr) break;
    rc = addmodifyop(&copy, m.operation(), m.mod_type, value);
  }
  return rc;
}

int copy_modifications(const ldapmod* first, ldapmod**& copy) {
  int rc = result::success;
  for (const ldapmod* m = first; rc == 0 && m != nullptr; m = m->mod_next) {
    rc = copy_modification(*m, copy);
  }
  return rc;
}

// ---- Steps 6 and 7: authority

// Whether the entry is that of a supplier: 0, 32, 16, or the code with which it cannot be read.
int read_supplier_mark(const ldtr_function_local& trace, const ModifyRequest& request,
                       bool& supplier) {
  _CFG* const session = request.session();
  CfgValues values;  // independent of the chain, which goes first
  _CFGMessage* found = nullptr;
  int rc = cfg_read_cfg_entry(session, request.dn, kTargetClasses, kScopeBase, &found);
  const CfgResult chain(found);
  if (rc != 0) return rc;
  _CFGMessage* const record = cfg_first_entry(session, chain.get());
  if (record == nullptr) {
    trace.debug(trace::error, kTargetMissing, request.dn);
    return result::no_such_object;
  }
  values.reset(cfg_get_values(session, record, kTargetClasses));
  rc = cfg_get_errno(session);
  if (values == nullptr) return result::no_such_attribute;  // whatever the error number
  for (char** value = values.get(); *value != nullptr; ++value) {
    if (kel_strcasecmp(*value, config_names::supplier_class) == 0) supplier = true;
  }
  return rc;
}

// What a member of the group wants to change.
struct Target {
  const char* dn;
  bool supplier;

  [[nodiscard]] bool is(const char* wanted) const { return kel_strcasecmp(dn, wanted) == 0; }
  [[nodiscard]] bool in_admin_group() const {
    return kel_strcasestr(dn, config_names::admin_group_dn) != nullptr;
  }
};

bool is_ordinary(const Target& t) {
  return !t.is(config_names::default_log_dn) && !t.is(config_names::audit_log_dn) &&
         !t.is(config_names::admin_audit_log_dn) && !t.is(config_names::master_server_dn) &&
         !t.is(config_names::replication_dn) && !t.is(config_names::backends_dn) &&
         !t.in_admin_group() && !t.supplier;
}

struct RoleRule {
  bool (*applies)(const Target& target);
  unsigned bits;
  bool all = false;  // all of them, not only one
};

// In their order. An entry may have to satisfy several.
constexpr RoleRule kRoleRules[] = {
    {is_ordinary, role::server_config},
    {[](const Target& t) {
       return t.is(config_names::audit_log_dn) || t.is(config_names::admin_audit_log_dn);
     },
     role::audit},
    {[](const Target& t) { return t.is(config_names::default_log_dn); },
     role::audit | role::server_config},
    {[](const Target& t) { return t.is(config_names::replication_dn); },
     role::replication | role::server_config},
    {[](const Target& t) { return t.is(config_names::backends_dn); },
     role::schema | role::server_config},
    // The only one that looks at the bytes.
    {[](const Target& t) { return contains(t.dn, config_names::passthrough_dn); },
     role::server_config},
    {[](const Target& t) { return t.is(config_names::master_server_dn) || t.supplier; },
     kAllForSuppliers, true},
};

bool satisfies(unsigned roles, const RoleRule& rule) {
  return rule.all ? has_all(roles, rule.bits) : (roles & rule.bits) != 0;
}

int check_roles_of_member(unsigned roles, const Target& target) {
  for (const RoleRule& rule : kRoleRules) {
    if (rule.applies(target) && !satisfies(roles, rule)) return result::insufficient_access;
  }
  return result::success;
}

int check_member(const ldtr_function_local& trace, const ModifyRequest& request) {
  const Operation& operation = *request.operation;
  Target target{request.dn, false};
  // Without any role a member has only its own entry, which the last check looks at.
  if ((operation.roles & role::any_configuration) == 0 && !target.in_admin_group()) {
    return result::insufficient_access;
  }
  int rc = read_supplier_mark(trace, request, target.supplier);
  if (rc == 0) rc = check_roles_of_member(operation.roles, target);
  if (rc != 0) return rc;
  return checkIfAdminGroupCanModify(request.connection, request.dn, operation.bound_dn,
                                    request.modifications);
}

int check_authority(const ldtr_function_local& trace, const ModifyRequest& request) {
  if (is_primary_administrator(*request.operation)) {
    return checkRootAdminModify(request.session(), request.dn, request.modifications);
  }
  if (is_admin_group_member(*request.operation)) return check_member(trace, request);
  return result::success;  // everybody else meets only the rules of step 9
}

// The list that step 6 may have rewritten, once more; now 65 is not forgiven.
int check_and_copy_again(ModifyRequest& request, ldapmod**& copy) {
  const int rc = check_schema(request);
  if (rc != 0) return rc;
  ldap_mods_free(copy, 1);
  copy = nullptr;
  return copy_modifications(request.modifications, copy);
}

// ---- Step 9: the rules

bool is_password_policy(const ModifyRequest& request) {
  return kel_strcasecmp(request.dn, config_names::password_policy_dn) == 0;
}

int check_password_encryption(ModifyRequest& request) {
  char* text = request.text.release();
  const int rc = checkPwEncryptionModify(request.operation, request.session(), request.dn,
                                         request.modifications, &text);
  request.text.reset(text);
  return rc;
}

using ModifyRule = int (*)(ModifyRequest& request);

// In their order; the first refusal is the answer. All of them look at the server's list.
constexpr ModifyRule kModifyRules[] = {
    [](ModifyRequest& r) {
      return checkReplSupplierModify(r.connection, r.session(), r.dn, r.modifications);
    },
    [](ModifyRequest& r) {
      return checkKerberosModify(r.operation, r.session(), r.dn, r.modifications);
    },
    [](ModifyRequest& r) { return checkAuditLog(r.session(), r.dn, r.modifications); },
    [](ModifyRequest& r) {
      return checkDigestModify(r.operation, r.session(), r.dn, r.modifications);
    },
    // Whether the policy is on is asked for each of the two: it may change in between.
    [](ModifyRequest& r) {
      return pwdIsAdminPolicyOn() && is_password_policy(r)
                 ? checkAdminPolicyEntryModify(r.modifications)
                 : static_cast<int>(result::success);
    },
    [](ModifyRequest& r) {
      return pwdIsAdminPolicyOn()
                 ? checkAdminPolicyModify(r.operation, r.session(), r.dn, r.modifications)
                 : static_cast<int>(result::success);
    },
    [](ModifyRequest& r) { return checkProxyNameModify(r.session(), r.dn, r.modifications); },
    // Last: it hands an accepted method on.
    check_password_encryption,
};

int check_modify_rules(ModifyRequest& request) {
  for (const ModifyRule rule : kModifyRules) {
    const int rc = rule(request);
    if (rc != 0) return rc;
  }
  return result::success;
}

// ---- Step 10

// Where no DN came of the translation nothing is written, and that is a success.
int write_change(const ModifyRequest& request, ldapmod** copy, MallocText& local_dn) {
  const int rc = convert(cfg_xlate_utf8_to_localcp, request.dn, local_dn);
  if (rc != 0 || local_dn == nullptr) return rc;
  return cfg_modify_s(request.session(), local_dn.get(), copy);
}

}  // namespace

int config_back_modify(pblock* pb) {
  ldtr_function_local trace(function_id::config_back_modify, "pb=0x%p", static_cast<void*>(pb));

  // 1. Who changes what. Without all of it no session is opened.
  ModifyRequest request;
  if (!read_request(pb, request)) {
    return trace.exit(answer(pb, request, result::operations_error));
  }

  // 2. The session. When it cannot be opened, the lock, where it was taken, stays taken: the server
  // brings the backend back to rest.
  OperationSession session(request.connection,
                           static_cast<ConfigBackendPrivate*>(request.backend->private_data));
  int rc = session.open();
  if (rc != 0) return trace.exit(answer(pb, request, rc));

  // 3. The schema, for every caller; its refusal waits for step 4.
  request.schema_result = check_schema_before_roles(request);

  // 4. Who is kept out and what a supplier may do, then what the schema has against it.
  rc = check_flags(request);

  // 5. What is to be written. Released in step 11 after a success, the first one in step 8. On
  // every other way it is left, on purpose: who may get here, and how often, is bounded by the
  // server.
  ldapmod** copy = nullptr;
  if (rc == 0) rc = copy_modifications(request.modifications, copy);

  // 6. and 7. May this caller change this entry? The primary administrator's list may be rewritten.
  if (rc == 0) rc = check_authority(trace, request);

  // 8. Then what was forgiven or rewritten is checked and copied again; the first copy goes.
  if (rc == 0 && begins_with_roles_of_member(request)) rc = check_and_copy_again(request, copy);

  // 9. What must hold, whoever asks.
  if (rc == 0) rc = check_modify_rules(request);

  // 10. Then it is written.
  MallocText local_dn;
  if (rc == 0) rc = write_change(request, copy, local_dn);

  // 11. What was made for that goes.
  if (rc == 0 && copy != nullptr) ldap_mods_free(copy, 1);
  local_dn.reset();
  // The library's own code, from whichever step under the session it comes: on purpose, while an
  // add translates that of its write only.
  if (rc == result::no_such_record) rc = result::no_such_object;

  // 12. Back to rest.
  session.close();

  // 13. The one answer.
  return trace.exit(answer(pb, request, rc));
}

}  // namespace orv
