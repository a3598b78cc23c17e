// Whether a value is one that its attribute type may have: the syntaxes of RFC 4517, section 3.3,
// and what single types of this server's schema ask for beyond them.
//
//   syntax            accepted
//   Boolean           TRUE, FALSE
//   INTEGER           digits, with "-" before them; no leading zeros; any size
//   DN                what cfg/dn.h reads
//   Directory String  UTF-8, not empty
//   IA5 String        ASCII
//   Octet String      anything
//   Telephone Number  printable characters of RFC 4517, 3.2, not empty
//   Country String    two of them
//   OID               a name or a numeric OID
//   Generalized Time  RFC 4517, 3.3.13
//   UUID              RFC 4530, 2.1
//   others            UTF-8
//
// A NUL byte is refused in each. A bound ("{64}") counts characters.
//
//   type                                 beyond its syntax
//   orv-slapdAdminDN, orv-slapdMasterDN  not the empty DN, which is the anonymous
//   orv-slapdKrbAdminDN                  spelled in the light form of cfg/dn.h, since what follows
//                                        the first "=" is compared as text; not empty there
//   orv-slapdDigestAdminUser             not changed by the preparation of names (RFC 4013), or two
//                                        different names could become one at bind
//   orv-slapdAdminPW, orv-slapdMasterPW  not empty
//   orv-slapdLog                         an absolute path without control characters
//   orv-slapdLog, orv-slapdPtaSubtree    ASCII, unless the configuration file is in UTF-8
//
// Threads: may be called from any thread.
#pragma once

#include <string_view>

#include "slapi/schema.h"

namespace orv {

// Holds a value (in UTF-8) against its type. 0; 19 longer than the type allows; 21 not of the
// syntax; 90. For 19 and 21 `*problem`, unless it is null, is a constant text that goes on after
// the type's name, such as "is not a DN".
int check_value(const SchemaAttribute& type, std::string_view value,
                const char** problem = nullptr) noexcept;

}  // namespace orv
