#include "ops/guards.h"

#include <strings.h>

#include <algorithm>
#include <string>

#include "cfg/result_codes.h"
#include "config/setting_ranges.h"
#include "slapi/connection.h"

namespace orv::server {
namespace {

constexpr std::string_view kPolicy = "CN=PWDPOLICY ADMIN,CN=CONFIGURATION";
constexpr std::string_view kPassThrough = "CN=PASSTHROUGH AUTHENTICATION,CN=CONFIGURATION";
constexpr std::string_view kMasterServer = "CN=MASTER SERVER,CN=CONFIGURATION";
constexpr std::string_view kSupplierOfServer = "orv-slapdReplication";

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

bool is_primary(unsigned flags) noexcept {
  return flags == authority::primary_administrator;
}

// The rules of uniqueness know the first entry of that class only, which must be the one that the
// supplier binds by.
bool is_second_supplier_of_server(std::string_view normal_dn, const entry& added) noexcept {
  return normal_dn != kMasterServer &&
         value_find_short_list(added.object_class_list, kSupplierOfServer.data(),
                               kSupplierOfServer.size()) == 0;
}

// With such a level in its file the server would not start again.
bool has_unknown_log_level(const entry& added) noexcept {
  const attr* const levels = attr_find(&added, "orv-slapdLogLevel", 0, 0);
  if (levels == nullptr || levels->values == nullptr) return false;
  return std::any_of(levels->values, levels->values + levels->count, [](const berval* level) {
    return std::none_of(std::begin(kLogLevels), std::end(kLogLevels), [level](auto known) {
      return known.size() == level->bv_len &&
             strncasecmp(known.data(), level->bv_val, known.size()) == 0;
    });
  });
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
  if (added && is_second_supplier_of_server(normal_dn, *added))
    return {result::unwilling_to_perform,
            "the supplier of the whole server is " + std::string(kMasterServer)};
  if (added && has_unknown_log_level(*added))
    return {result::invalid_attribute_syntax,
            "orv-slapdLogLevel is none of error, warning, info, debug, off"};
  return {};
}

}  // namespace orv::server
