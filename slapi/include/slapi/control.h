// LDAP controls (RFC 4511, 4.1.11) and the list of those that the server supports.
#pragma once

#include <string>
#include <vector>

#include "cfg/ldapmod.h"

namespace orv {

// A control as it came, or as it is to be sent.
struct LDAPControl {
  char* oid;
  berval value;  // bv_val null: no value
  char critical;
};

// Appends `control` (not copied, not owned) to the null-terminated array at `*list`, which is null
// or a malloc block; the array grows by reallocation and is released with free. 0; 80 a null
// argument; 90, with the array as it was.
int ldap_insert_control(LDAPControl* control, LDAPControl*** list);

// Announces a control in the root DSE. `operations` is the set of operations it applies to, -1 for
// every one. The text is copied; registering twice is one entry. 0, 80 (null), 90. Thread-safe.
int slapi_register_supported_control(const char* oid, int operations);

// The controls registered so far, in order of registration. Thread-safe.
std::vector<std::string> slapi_supported_controls();

}  // namespace orv
