// What is doubtful about a configuration file though it can be read: for the server, which says so
// at its start, and for the tools that examine a file before a server does.
//
// Thread-safe. Throws std::bad_alloc and nothing else.
#pragma once

#include <string>
#include <string_view>
#include <vector>

namespace orv {

// The lines of an LDIF text whose attribute type is a number, as "line N: ...". Such a line means
// what it says, but who searches the file for the name of the type does not find it.
std::vector<std::string> numbered_types(std::string_view ldif);

// Why a change of CN=CONFIGURATION is refused as long as this value of orv-slapdIpAddress stands
// there: it is none of this host's addresses, as isValidIPAddressOnSystem (slapi/services.h) says.
// "" for one that is.
std::string address_doubt(const std::string& address);

}  // namespace orv
