// The SASL mechanisms that Cyrus SASL computes: GSSAPI (RFC 4752), SCRAM-SHA-256 (RFC 7677) and
// DIGEST-MD5 (RFC 2831).
//
// GSSAPI proves a Kerberos principal, with the key of the service "ldap" in a keytab; the other two
// prove a user name with its password, which has to be stored in a way that it can be read back.
// Without TLS, and not over a Unix socket, a client may negotiate a security layer: of integrity
// with DIGEST-MD5, of confidentiality too with GSSAPI. Channel bindings are not supported: clients
// that insist on them are refused.
//
// Whoever fails is told the same, whether the name is nobody's, its password cannot be used, or the
// proof is wrong, and after the same steps: names of nobody get a password that nobody knows.
//
// Threads: `CyrusSasl` is thread-safe once made; it outlives its mechanisms, their exchanges and
// the layers of connections.
#pragma once

#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <string_view>
#include <vector>

#include "auth/sasl.h"
#include "auth/sasl_library.h"
#include "auth/sasl_settings.h"

namespace orv::server {

// Where the mechanisms ask who somebody is. Thread-safe.
class SaslIdentities {
 public:
  virtual ~SaslIdentities() = default;
  // As Identities::of_user and of_principal. May read files; may throw std::bad_alloc.
  virtual std::shared_ptr<const Identity> of_user(std::string_view name, std::string& password) = 0;
  virtual std::shared_ptr<const Identity> of_principal(std::string_view principal) = 0;
  // Counts a proof by password that was right or wrong. Whether the bind stands: it was right, and
  // the identity is not locked out.
  virtual bool settle(const Identity& identity, bool proved) noexcept = 0;
  // Whether of_user and of_principal could find somebody. Do not block.
  virtual bool has_users() const noexcept = 0;
  virtual bool has_principals() const noexcept = 0;
};

// What went wrong in an exchange, in one line, for whoever looks for the cause. It may hold text of
// the client's and no secrets. Must not throw.
using SaslReport = std::function<void(std::string_view line)>;

class CyrusSasl {
 public:
  CyrusSasl(const SaslLibrary& library, SaslIdentities& identities, SaslReport report);
  ~CyrusSasl();

  // Takes settings over, for exchanges that start from now on; reads the keytab. Returns, one line
  // each, what was named and cannot be used. Throws std::bad_alloc.
  std::vector<std::string> configure(const SaslSettings& settings);

  // Whether the settings allow a mechanism, named in upper case.
  bool allows(std::string_view mechanism) const;

  // Appends the mechanisms, the best first.
  void add_mechanisms(SaslMechanisms& mechanisms);

 private:
  friend class CyrusMechanism;
  struct State;
  std::shared_ptr<const State> state() const;

  const SaslLibrary& library_;
  SaslIdentities& identities_;
  const SaslReport report_;
  mutable std::mutex mutex_;  // guards the pointer
  std::shared_ptr<const State> state_;
};

// The same mechanism, offered only while `allowed` says so. `allowed` must not block.
std::unique_ptr<const SaslMechanism> offer_while(std::function<bool()> allowed,
                                                 std::unique_ptr<const SaslMechanism> mechanism);

}  // namespace orv::server
