// Which certificates of clients are believed: whose signatures count, and until when.
//
// Threads: functions are thread-safe for different connections.
#pragma once

#include <openssl/types.h>
#include <sys/types.h>

#include <ctime>
#include <limits>
#include <string>

#include "settings.h"

namespace orv::server {

// What is believed.
struct Trust {
  static constexpr std::time_t kForEver = std::numeric_limits<std::time_t>::max();
  // Equal names, equal judgements, but for time; "" when nobody is asked for a certificate.
  std::string name{};
  // When a newer one should have come for one of the lists of revoked certificates, in seconds of
  // the epoch: from then on certificates of its authority are refused.
  std::time_t revocations_good_until = kForEver;
};

// Has `context` ask clients for certificates as the settings say, and believe those that the
// authorities of the file have signed and not revoked; where there is a file for that, each
// authority up to the root must have a list there. Others than `user` and root must not be able to
// change these files (slapi/file_trust.h). False with the cause and the file in `error`.
// Throws std::bad_alloc.
bool load_trust(ssl_ctx_st* context, const TlsSettings& settings, uid_t user, Trust& trust,
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
