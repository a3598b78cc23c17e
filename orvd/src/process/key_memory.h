// Memory for keys.
//
// Threads: one, before keys are read.
#pragma once

namespace orv::server {

// From here on OpenSSL keeps private keys, and the key of the stash is kept, in memory that is left
// out of core dumps, stays out of the swap where the limit of the process allows that, and lies
// between pages that cannot be read. Where there is none, keys are in ordinary memory, wiped after
// use like everything else that is secret.
void protect_keys() noexcept;

}  // namespace orv::server
