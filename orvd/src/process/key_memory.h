// Memory for keys and for what OpenSSL does with them.
//
// Threads: protect_keys() in one, before anything of OpenSSL is used; the rest any.
#pragma once

#include <cstdint>

namespace orv::server {

// From here on OpenSSL wipes whatever memory it gives back: it leaves copies of private keys behind
// when it reads them. And private keys, and the key of the stash, are kept in memory that is left
// out of core dumps, stays out of the swap where the limit of the process allows that, and lies
// between pages that cannot be read. Where the system gives none, keys are in ordinary memory.
// False when OpenSSL was in use before.
bool protect_keys() noexcept;

// How many connections with TLS at once that memory has room for: each keeps a key of its own for
// as long as it lasts, and OpenSSL does nothing more where there is no room. The largest number
// where keys are in ordinary memory.
std::int64_t connections_with_room_for_keys() noexcept;

}  // namespace orv::server
