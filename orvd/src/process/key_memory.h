// Memory for keys and for what OpenSSL does with them.
//
// Threads: one, before anything of OpenSSL is used.
#pragma once

namespace orv::server {

// From here on OpenSSL wipes whatever memory it gives back: it leaves copies of private keys behind
// when it reads them. And private keys, and the key of the stash, are kept in memory that is left
// out of core dumps, stays out of the swap where the limit of the process allows that, and lies
// between pages that cannot be read. Where there is none, keys are in ordinary memory. False when
// OpenSSL was in use before.
bool protect_keys() noexcept;

}  // namespace orv::server
