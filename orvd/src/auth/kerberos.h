// The server's side of Kerberos (MIT's GSS-API): the keys of its service, and principals.
//
// Threads: an acceptor is immutable and shared freely.
#pragma once

#include <memory>
#include <string>

namespace orv::server {

// The keys of the service "ldap", on whatever host, that a keytab holds. The keytab is read anew
// for each client, so keys may be changed in it while the server runs.
class KerberosAcceptor {
 public:
  // Null, with the cause in `error`, when the keytab cannot be read, holds no such key, or others
  // than its owner and group may read it, or others than its owner may change it. May ask a name
  // service for the name of the host. Throws std::bad_alloc.
  static std::shared_ptr<const KerberosAcceptor> open(const std::string& keytab,
                                                      std::string& error);
  ~KerberosAcceptor();
  KerberosAcceptor(const KerberosAcceptor&) = delete;
  KerberosAcceptor& operator=(const KerberosAcceptor&) = delete;

  // A gss_cred_id_t, which lives as long as this does.
  void* credentials() const noexcept { return credentials_; }

 private:
  KerberosAcceptor() = default;
  void* credentials_ = nullptr;
};

// A principal with its realm, as Kerberos spells it ("alice@EXAMPLE.COM"), of one that may lack it:
// then it is of the default realm. "" when it is none. Throws std::bad_alloc.
std::string full_principal(const std::string& name);

// Whether the process has a second implementation of the GSS-API loaded, whose names and
// credentials must not be mixed with those of this one.
bool has_foreign_gssapi() noexcept;

}  // namespace orv::server
