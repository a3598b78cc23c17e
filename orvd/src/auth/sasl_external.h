// The SASL mechanism EXTERNAL (RFC 4422, appendix A): who the client is, the transport has proved.
//
// On a Unix socket root and the user that the server runs as are the primary administrator: both
// could read and change the configuration file anyway. Under TLS a client is whom the configuration
// maps the subject of its verified certificate to. No password is involved, so nobody can be locked
// out of it.
#pragma once

#include <memory>

#include "auth/sasl.h"

namespace orv::server {

// Where EXTERNAL asks who somebody is. Thread-safe; outlives the mechanism.
class ExternalIdentities {
 public:
  virtual ~ExternalIdentities() = default;
  // Null when there is none. May read files.
  virtual std::shared_ptr<const Identity> primary_administrator() = 0;
  // The identity that the subject (a normal form) is mapped to, or null. May read files.
  virtual std::shared_ptr<const Identity> of_certificate(std::string_view subject) = 0;
  // Whether certificates stand for anybody, by what was read last. Must not block.
  virtual bool maps_certificates() const noexcept { return true; }
};

std::unique_ptr<const SaslMechanism> make_external(ExternalIdentities& identities);

}  // namespace orv::server
