// Who the administrators are: the identities under which they bind, read straight from the
// configuration file.
//
// All functions are called under the session of the operation and take no lock. The texts they
// return are UTF-8 and released with free; null when the identity cannot be read, for whatever
// reason (the trace tells it).
#pragma once

#include "slapi/connection.h"

namespace orv {

// Bind DN of the primary administrator, normalised. Null also when the file names two.
char* getAdminDN(_CFG* session);

// Kerberos identity of the primary administrator, a DN in the light form of
// `dn_normalize_light_esc`; the first value if there are several.
char* getAdminKerberosID(_CFG* session);

// Digest-MD5 user name of the primary administrator, as stored; the first value if there are
// several.
char* getAdminDigestUserName(_CFG* session);

// Bind DN of the member of the administrative group whose entry is `target_dn`, normalised. Uses
// the session in the connection's slot.
char* getAdminGroupMemberDn(Connection* connection, const char* target_dn);

}  // namespace orv
