// A certificate for the first start, so that TLS works before anybody has asked an authority for
// one.
#pragma once

#include <string>

namespace orv::orvcfg {

struct SelfSigned {
  std::string certificate;  // PEM
  std::string key;          // PEM, not encrypted; to be wiped
};

// An ECDSA key on P-256 and a certificate for this host under the names "localhost", the host's
// own, 127.0.0.1 and ::1, good for ten years. False with the cause in `why`.
bool make_self_signed(SelfSigned& made, std::string& why);

}  // namespace orv::orvcfg
