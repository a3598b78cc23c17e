#include <iterator>

#include "auth/identities.h"
#include "cfg/text.h"
#include "slapi/connection.h"

namespace orv::server {
namespace {

struct RoleName {
  const char* name;
  unsigned bits;
};

// Roles that concern no part of the configuration lie above role::any_configuration.
constexpr RoleName kRoles[] = {
    {"AuditAdmin", role::audit},     {"ReplicationAdmin", role::replication},
    {"SchemaAdmin", role::schema},   {"ServerConfigGroupMember", role::server_config},
    {"DirDataAdmin", 0x40},          {"PasswordAdmin", 0x80},
    {"ServerStartStopAdmin", 0x100},
};

constexpr const char* kNoRole = "NoAdmin";

}  // namespace

unsigned role_bits(const std::vector<std::string>& roles) noexcept {
  unsigned bits = 0;
  for (const std::string& value : roles) {
    if (cfg::equals_ignore_ascii_case(value, kNoRole)) return 0;
    for (const RoleName& known : kRoles) {
      if (cfg::equals_ignore_ascii_case(value, known.name)) bits |= known.bits;
    }
  }
  return bits;
}

}  // namespace orv::server
