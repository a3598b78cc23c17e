// Search below CN=CONFIGURATION: who may search, and what of the administrators' credentials each
// caller sees.
#pragma once

#include "slapi/connection.h"

namespace orv {

// Whether the caller may search at all: 0; 32 on a server of kind 3 without its marker, before
// anything else is looked at; 50 for suppliers and callers without configuration access.
int has_search_authority(const Connection* connection, const Operation* operation);

// Sends the entries of a search result and the final result; returns the code of the latter. Called
// under the session of `session`.
//   chain             released here, except when its first record cannot be taken: then the session
//                     releases it when it is unbound
//   attributes        requested attributes, null for all; handed to the sender with `types_only`
//   full_view         1: every entry, without the credentials that the caller may not see.
//                     Any other value: only the entry of the directory backend
//   response_control  attached to each entry when the connection asks for it; or null
// 0, also when the first record cannot be taken: then no entry is sent; 90 no memory; 16 a
// credential could not be taken out; 80 whose credentials an entry holds cannot be told; 34, or
// what else `replace_DN` makes of an entry's DN; the code with which the sender ended the search.
int sendCFGSearchResults(_CFG* session, _CFGMessage* chain, Connection* connection,
                         Operation* operation, Backend* backend, char** attributes, int types_only,
                         int full_view, LDAPControl* response_control);

}  // namespace orv
