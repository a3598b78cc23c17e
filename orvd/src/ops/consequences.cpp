#include "ops/consequences.h"

#include "cfg/dn.h"
#include "ops/services.h"

namespace orv::server {
namespace {

constexpr std::string_view kTop = "CN=CONFIGURATION";
constexpr std::string_view kGroup = "CN=ADMINGROUP,CN=CONFIGURATION";
constexpr std::string_view kLogs = "CN=LOG MANAGEMENT,CN=CONFIGURATION";
constexpr std::string_view kPolicy = "CN=PWDPOLICY ADMIN,CN=CONFIGURATION";
constexpr std::string_view kClassesOfIdentities[] = {"orv-slapdTop", "orv-slapdAdminGroupMember",
                                                     "orv-slapdReplication", "orv-slapdSupplier"};

Consequences of_place(std::string_view normal_dn) noexcept {
  Consequences found;
  found.policy = normal_dn == kPolicy;
  found.methods = normal_dn == kTop || normal_dn == kGroup;
  found.settings =
      normal_dn == kTop || normal_dn == kGroup || cfg::normal_dn_is_at_or_below(normal_dn, kLogs);
  return found;
}

}  // namespace

Consequences consequences_of_add(std::string_view normal_dn, const entry& added) noexcept {
  Consequences found = of_place(normal_dn);
  for (const std::string_view name : kClassesOfIdentities)
    if (value_find_short_list(added.object_class_list, name.data(), name.size()) == 0)
      found.identities = true;
  // Its settings say whom certificates belong to.
  if (normal_dn == kGroup) found.identities = true;
  return found;
}

Consequences consequences_of_change(std::string_view normal_dn,
                                    const Authenticator& authenticator) noexcept {
  Consequences found = of_place(normal_dn);
  found.identities =
      normal_dn == kTop || normal_dn == kGroup || authenticator.may_define(normal_dn);
  return found;
}

}  // namespace orv::server
