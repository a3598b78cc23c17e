#include "ops/guards.h"

#include <algorithm>
#include <new>
#include <string>

#include "auth/identity_reader.h"
#include "cfg/dn.h"
#include "cfg/result_codes.h"
#include "cfg/text.h"
#include "net/tls.h"
#include "settings.h"
#include "slapi/connection.h"
#include "slapi/value_syntax.h"

namespace orv::server {
namespace {

constexpr std::string_view kPolicy = kAdminPolicyEntry;
constexpr std::string_view kPassThrough = "CN=PASSTHROUGH AUTHENTICATION,CN=CONFIGURATION";
constexpr std::string_view kAdminGroup = "CN=ADMINGROUP,CN=CONFIGURATION";
constexpr std::string_view kObjectClass = "objectClass";
constexpr std::string_view kAdminDn = "orv-slapdAdminDN";
constexpr std::string_view kMasterDn = "orv-slapdMasterDN";

constexpr Guard kGuards[] = {
    // With a policy of their own making, members could set any password they like.
    {GuardedChange::add, kPolicy, true, result::insufficient_access,
     "only the primary administrator sets the password policy"},
    {GuardedChange::remove, kPolicy, true, result::insufficient_access,
     "only the primary administrator deletes the password policy"},
    // No rule lets it be added again.
    {GuardedChange::remove, kPassThrough, false, result::unwilling_to_perform,
     "the container of pass-through entries could not be added again"},
};

std::string_view text_of(const berval* value) noexcept {
  return {value->bv_val, value->bv_len};
}

bool is_primary(unsigned flags) noexcept {
  return flags == authority::primary_administrator;
}

// Classes that stand at one entry only.
struct Placed {
  std::string_view name;
  std::string_view dn;
  std::string_view text;  // for the client
};
constexpr Placed kPlaced[] = {
    // The rules of uniqueness know the first entry of that class only, which must be the one that
    // the supplier binds by.
    {"orv-slapdReplication", "CN=MASTER SERVER,CN=CONFIGURATION",
     "the supplier of the whole server is CN=MASTER SERVER,CN=CONFIGURATION"},
    // Members may change almost any entry but this one, and must not grant themselves anything.
    {"orv-slapdAdminGroupSettings", "CN=ADMINGROUP,CN=CONFIGURATION",
     "these settings stand at CN=ADMINGROUP,CN=CONFIGURATION and nowhere else"},
};

Refusal refuse_class(std::string_view normal_dn, std::string_view name) {
  for (const Placed& placed : kPlaced)
    if (normal_dn != placed.dn && cfg::equals_ignore_ascii_case(placed.name, name))
      return {result::unwilling_to_perform, std::string(placed.text)};
  return {};
}

// The empty name, and what is none, are for the schema to refuse.
Refusal refuse_bind_dn(std::string_view type, std::string_view value) {
  std::string normal;
  if (cfg::normalize_dn(value, normal) == result::no_memory) throw std::bad_alloc();
  if (normal.empty() || may_be_bound(normal)) return {};
  return {result::constraint_violation,
          std::string(type) + " lies inside CN=CONFIGURATION, so nobody could bind with it"};
}

// A method that nobody knows is answered as the rules answer it where it is to be used.
int code_of_problem(std::string_view type) noexcept {
  return type == kAllowedMethods ? result::invalid_attribute_syntax : result::constraint_violation;
}

Refusal refuse_value(std::string_view normal_dn, std::string_view type, std::string_view value) {
  if (type == kObjectClass) return refuse_class(normal_dn, value);
  if (type == kAdminDn || type == kMasterDn) return refuse_bind_dn(type, value);
  if (const std::string problem = value_problem(type, value); !problem.empty())
    return {code_of_problem(type), std::string(type) + " " + problem};
  for (const SettingRow& row : setting_rows()) {
    Settings scratch;
    std::string error;
    if (row.name == type && !apply_setting(row, value, scratch, error))
      return {result::constraint_violation, error};
  }
  return {};
}

Refusal refuse_values(std::string_view normal_dn, std::string_view type,
                      const berval* const* values) {
  for (; values && *values; ++values)
    if (Refusal refusal = refuse_value(normal_dn, type, {(*values)->bv_val, (*values)->bv_len}))
      return refusal;
  return {};
}

// ---- the password policy

// Whether a value is put into one of its settings.
enum class PolicyValue { none, good, refused_by_schema };

PolicyValue policy_value(const Schema& schema, std::string_view type, const berval* const* values) {
  const auto types = admin_policy_types();
  if (std::find(types.begin(), types.end(), type) == types.end()) return PolicyValue::none;
  for (; values && *values; ++values)
    if (check_value(*schema.attribute(type), text_of(*values), nullptr) != result::success)
      return PolicyValue::refused_by_schema;
  return PolicyValue::good;
}

Refusal refuse_policy(const AdminPolicySettings& settings) {
  const std::string problem = admin_policy_problem(settings);
  if (problem.empty()) return {};
  return {result::constraint_violation,
          "the password policy could not be put in force: " + problem +
              "; change settings that belong together in one request"};
}

// One value each; as of the settings of TLS, what is taken away goes first.
void apply_policy_changes(const ldapmod* first, AdminPolicySettings& settings) {
  for (const ldapmod* change = first; change; change = change->mod_next)
    if (change->operation() != kModAdd) settings.erase(change->mod_type);
  for (const ldapmod* change = first; change; change = change->mod_next) {
    const berval* const* const values = change->mod_vals.modv_bvals;
    if (change->operation() != kModDelete && values && *values)
      settings.insert_or_assign(change->mod_type, std::string(text_of(*values)));
  }
}

// ---- the files of TLS

// The settings have one value each. What is taken away goes first, as the order of a folded list
// does not matter. Whether there is anything for them.
bool apply_tls_changes(const ldapmod* first, TlsSettings& tls) {
  bool any = false;
  for (const ldapmod* change = first; change; change = change->mod_next)
    if (change->operation() != kModAdd) any |= apply_tls_file(change->mod_type, "", tls);
  for (const ldapmod* change = first; change; change = change->mod_next) {
    const berval* const* const values = change->mod_vals.modv_bvals;
    if (change->operation() != kModDelete && values && *values)
      any |= apply_tls_file(change->mod_type, text_of(*values), tls);
  }
  return any;
}

Refusal refuse_files(const TlsSettings& tls) {
  std::string error;
  if (tls.certificate_file.empty() || TlsContext::load(tls, error)) return {};
  return {result::unwilling_to_perform,
          "the server could not start with these files of TLS: " + error +
              "; change those that belong together in one request"};
}

}  // namespace

std::span<const Guard> entry_guards() noexcept {
  return kGuards;
}

Refusal guarded(GuardedChange change, std::string_view normal_dn, unsigned authority,
                const entry* added) {
  for (const Guard& guard : kGuards) {
    if (guard.change != change || guard.dn != normal_dn) continue;
    if (guard.primary_may && is_primary(authority)) continue;
    return {guard.code, std::string(guard.text)};
  }
  for (const attr* a = added ? added->attributes : nullptr; a; a = a->next)
    if (Refusal refusal = refuse_values(normal_dn, a->type, a->values)) return refusal;
  return {};
}

Refusal guarded_modification(std::string_view normal_dn, const ldapmod* first) {
  for (; first; first = first->mod_next) {
    if (first->operation() == kModDelete) continue;
    if (Refusal refusal = refuse_values(normal_dn, first->mod_type, first->mod_vals.modv_bvals))
      return refusal;
  }
  return {};
}

Refusal guarded_policy(const Schema& schema, std::string_view normal_dn, const ldapmod* first,
                       unsigned authority,
                       const std::function<bool(AdminPolicySettings&)>& read_policy) {
  if (!read_policy || normal_dn != kPolicy || !is_primary(authority)) return {};
  bool any = false;
  for (const ldapmod* change = first; change; change = change->mod_next) {
    const bool puts_in = change->operation() != kModDelete;
    const PolicyValue value =
        policy_value(schema, change->mod_type, puts_in ? change->mod_vals.modv_bvals : nullptr);
    if (value == PolicyValue::refused_by_schema) return {};
    any |= value == PolicyValue::good;
  }
  AdminPolicySettings settings;
  if (!any || !read_policy(settings)) return {};
  apply_policy_changes(first, settings);
  return refuse_policy(settings);
}

Refusal guarded_policy(const Schema& schema, std::string_view normal_dn, const entry& added,
                       unsigned authority) {
  if (normal_dn != kPolicy || !is_primary(authority)) return {};
  AdminPolicySettings settings;
  for (const attr* a = added.attributes; a; a = a->next) {
    const PolicyValue value = policy_value(schema, a->type, a->values);
    if (value == PolicyValue::refused_by_schema) return {};
    if (value == PolicyValue::good && a->values && *a->values)
      settings.insert_or_assign(a->type, std::string(text_of(*a->values)));
  }
  return refuse_policy(settings);
}

Refusal guarded_tls_files(std::string_view normal_dn, const ldapmod* first, unsigned authority,
                          const std::function<bool(Settings&)>& read_settings) {
  TlsSettings scratch;
  Settings wanted;
  if (!read_settings || normal_dn != kAdminGroup || !is_primary(authority) ||
      !apply_tls_changes(first, scratch) || !read_settings(wanted))
    return {};
  apply_tls_changes(first, wanted.tls);
  return refuse_files(wanted.tls);
}

Refusal guarded_tls_files(std::string_view normal_dn, const entry& added, unsigned authority) {
  if (normal_dn != kAdminGroup || !is_primary(authority)) return {};
  TlsSettings wanted;
  for (const attr* a = added.attributes; a; a = a->next)
    if (a->values && *a->values) apply_tls_file(a->type, text_of(*a->values), wanted);
  return refuse_files(wanted);
}

}  // namespace orv::server
