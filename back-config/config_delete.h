// Delete below CN=CONFIGURATION: who may.
#pragma once

#include "slapi/connection.h"

namespace orv {

// Whether the caller may delete the entry `dn` (UTF-8). Called under the session in the
// connection's slot, where it reads the entry's object classes; `e` is not used and passed as null.
//   0   yes, as far as roles tell
//   50  suppliers, callers without configuration access (neither makes the file be read), and
//       members of the administrative group whose roles do not cover the entry
//   32  no such entry; 16 its object classes are missing or cannot be read; 80 or 90 when the entry
//       cannot be read; the session's error number when that came beside the classes
int check_delete_authority(Connection* connection, Operation* operation, entry* e, const char* dn);

}  // namespace orv
