// What an operation tells about its caller.
#pragma once

#include "slapi/connection.h"

namespace orv {

constexpr bool has_all(unsigned flags, unsigned wanted) {
  return (flags & wanted) == wanted;
}

inline bool is_primary_administrator(const Operation& operation) {
  return has_all(operation.authority, authority::primary_administrator);
}

// A master server, of the server as a whole or of a suffix.
inline bool is_supplier(const Operation& operation) {
  constexpr unsigned kAnySupplier = authority::supplier_of_server | authority::supplier_of_suffix;
  return (operation.authority & kAnySupplier) != 0;
}

// Callers who are kept out: exactly that value, not every set of flags that has it.
inline bool is_kept_out(const Operation& operation) {
  return operation.authority == authority::no_configuration_access;
}

inline bool has_no_configuration_access(const Operation& operation) {
  return is_supplier(operation) || is_kept_out(operation);
}

// A member of the administrative group: what it may do is told by its role bits.
inline bool is_admin_group_member(const Operation& operation) {
  return has_all(operation.authority, authority::admin_group_member);
}

// The entries of the master server and of suppliers let others write all data: these role bits are
// asked for together. Of the two bits of replication only 0x04.
inline constexpr unsigned kAllForSuppliers = 0x04 | role::schema | role::server_config;

}  // namespace orv
