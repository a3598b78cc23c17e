// The subschema subentry "cn=subschema" (RFC 4512, 4.2): the schema as clients read it. Everything
// but objectClass and cn is operational and has to be asked for.
//
// Threads: functions without state; the entry belongs to the caller.
#pragma once

#include <ctime>

#include "slapi/owners.h"
#include "slapi/schema.h"

namespace orv::server {

// Makes the entry. `changed` is when this schema came into force; clients compare it with the time
// of their cached copy. Null without memory.
EntryPtr make_subschema(const Schema& schema, std::time_t changed) noexcept;

}  // namespace orv::server
