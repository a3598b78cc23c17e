// Which certificates of clients are believed: whose signatures count, and until when.
//
// Threads: functions are thread-safe for different connections.
#pragma once

#include <openssl/types.h>

#include <ctime>
#include <string>

#include "settings.h"

namespace orv::server {

// Has `context` ask clients for certificates as the settings say, and believe those that the
// authorities of the file have signed. `trust` names what is believed: equal texts, equal
// judgements, but for time; "" when nobody is asked. False with the cause and the file in `error`.
// Throws std::bad_alloc.
bool load_trust(ssl_ctx_st* context, const TlsSettings& settings, std::string& trust,
                std::string& error);

// What there is to say about the certificate that a client has shown.
struct Judgement {
  std::string problem;         // why it is not good; "" when it is
  std::time_t good_until = 0;  // seconds of the epoch: the first end of those up to the authority
};

// The certificate that was shown on `connection` and those sent along with it, by what `context`
// believes, at `now` (seconds of the epoch). As a handshake would have it. Throws std::bad_alloc.
Judgement judge_client(ssl_ctx_st* context, ssl_st* connection, std::time_t now);

// The same of one whose handshake has just found it good.
Judgement judged_in_handshake(const ssl_st* connection);

}  // namespace orv::server
