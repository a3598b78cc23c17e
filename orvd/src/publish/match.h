// Whether an entry that the server made itself passes a search filter.
//
// Three-valued as in RFC 4511, 4.5.1.7: and, or, not, presence, equality and approximate match (as
// equality) are decided by the schema's rules; substrings, ordering and extensible matches are
// Undefined here, because nobody looks for the root DSE or the schema by them. Only True matches.
//
// Threads: thread-safe.
#pragma once

#include <string_view>

#include "slapi/entry.h"

namespace orv::server {

// `filter` is RFC 4515 text with its outer parentheses, as the decoder writes it. False also when
// it cannot be read. Throws std::bad_alloc.
bool entry_matches(const entry& e, std::string_view filter);

}  // namespace orv::server
