#include "ops/consequences.h"

#include "cfg/dn.h"
#include "ops/services.h"

namespace orv::server {
namespace {

constexpr std::string_view kTop = "CN=CONFIGURATION";
constexpr std::string_view kGroup = "CN=ADMINGROUP,CN=CONFIGURATION";
constexpr std::string_view kLogs = "CN=LOG MANAGEMENT,CN=CONFIGURATION";
constexpr std::string_view kPolicy = "CN=PWDPOLICY ADMIN,CN=CONFIGURATION";
// Further names of the primary administrator; the realm, which is a setting, is on the first.
constexpr std::string_view kDigest = "CN=DIGEST,CN=CONFIGURATION";
constexpr std::string_view kKerberos = "CN=KERBEROS,CN=CONFIGURATION";
constexpr std::string_view kClassesOfIdentities[] = {"orv-slapdTop", "orv-slapdAdminGroupMember",
                                                     "orv-slapdReplication", "orv-slapdSupplier"};

Consequences of_place(std::string_view normal_dn) noexcept {
  Consequences found;
  found.identities = normal_dn == kDigest || normal_dn == kKerberos;
  found.policy = normal_dn == kPolicy;
  found.methods = normal_dn == kTop || normal_dn == kGroup;
  found.settings = normal_dn == kTop || normal_dn == kGroup || normal_dn == kDigest ||
                   cfg::normal_dn_is_at_or_below(normal_dn, kLogs);
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
  if (normal_dn == kTop || normal_dn == kGroup || authenticator.may_define(normal_dn))
    found.identities = true;
  return found;
}

}  // namespace orv::server
