// What a change of the configuration changes about the server that serves it.
//
// Identities, the password policy and the method of storing are taken over before the next
// operation is admitted, so that nobody acts with rights that an acknowledged change took away.
// Settings (limits, logs) follow when the change has left the backend, and are in force before its
// result leaves.
#pragma once

#include <string_view>

#include "slapi/entry.h"

namespace orv::server {

class Authenticator;

struct Consequences {
  bool identities = false;  // somebody may bind, or may not any more
  bool policy = false;      // the password policy of administrators
  bool methods = false;     // how passwords are stored
  bool settings = false;    // everything else that the server reads from the file
  bool any() const noexcept { return identities || policy || methods || settings; }
};

// Of adding an entry; to be asked before the backend has it, which rewrites entries.
Consequences consequences_of_add(std::string_view normal_dn, const entry& added) noexcept;

// Of deleting or modifying one.
Consequences consequences_of_change(std::string_view normal_dn,
                                    const Authenticator& authenticator) noexcept;

}  // namespace orv::server
