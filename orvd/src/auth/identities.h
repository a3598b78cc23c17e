// Who may bind: the identities that the configuration file defines, and what each is granted.
//
//   primary administrator   orv-slapdAdminDN of CN=CONFIGURATION            flags 0x0C
//   group member            entries of class orv-slapdAdminGroupMember below
//                           CN=ADMINGROUP,CN=CONFIGURATION, while
//                           orv-slapdAdminGroupEnabled is TRUE              flags 0x14 + role bits
//   supplier of the server  CN=MASTER SERVER,CN=CONFIGURATION               flags 0x01
//   supplier of a suffix    entries of class orv-slapdSupplier              flags 0x02
//   everybody else                                                          flags 0x24
//
// To these come certificates of clients that orv-slapdCertificateMap of CN=ADMINGROUP maps to one
// of them; they prove an identity that has no password, too. So do the Kerberos identities
// (orv-slapdKrbAdminDN of CN=KERBEROS and of members); the user names (orv-slapdDigestAdminUser of
// CN=DIGEST and of members) go with the password, where it can be read back.
//
// Only the first value of an identity's DN, names and password counts. A DN or name that two
// entries claim binds as neither. DNs inside CN=CONFIGURATION and the empty DN are nobody's. User
// names are compared byte for byte, Kerberos identities by what follows their first "=", in any
// letter case: as the rules for changes do.
//
// Threads: `Identities` is an immutable snapshot, shared freely; `IdentityStore` is thread-safe.
#pragma once

#include <array>
#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <string_view>
#include <vector>

#include "cfg/secret.h"

namespace orv::server {

struct Identity {
  std::string bound_dn;  // normal form
  unsigned authority = 0x24;
  unsigned roles = 0;
  std::string entry_dn;                             // normal form of the entry that defines it
  std::array<unsigned char, 32> password_digest{};  // SHA-256 of the password as it is stored
  std::string certificate_subject{};  // normal form; of whom a certificate has proved to be it
  std::string user_name{};            // by which a SASL mechanism with passwords has proved it
  std::string principal{};            // in lower case; by which Kerberos has proved it
  std::string shown_dn{};             // the bind DN as the file spells it; "": as above
};

// Role bits of a list of orv-slapdAdminRole values; 0 when "NoAdmin" is among them.
unsigned role_bits(const std::vector<std::string>& roles) noexcept;

class Identities {
 public:
  // Reads them with a session of its own. Null on failure, with the cause in `error`. Doubtful
  // entries (a DN claimed twice, a member DN inside the configuration, second values, a sealed
  // password that does not open) are described in `warnings`, without values of secrets.
  static std::shared_ptr<const Identities> read(const char* config_file, const char* key_stash_file,
                                                std::string& error,
                                                std::vector<std::string>& warnings) noexcept;

  // Checks a password against a stored one, as cfg::verify_secret does.
  using Verify = bool (*)(const cfg::Key* key, cfg::SecretPlace place, std::string_view stored,
                          std::string_view clear) noexcept;

  // The identity that `name` (any spelling) and `password` prove; null when they prove none. So
  // that time does not tell which names exist, an unknown name takes the work of the costliest
  // password of all, and a wrong password takes it too where its own is cheap. Only passwords
  // that are hashed at different expense can be told apart. Throws std::bad_alloc: want of
  // memory is no wrong password.
  const Identity* authenticate(std::string_view name, std::string_view password,
                               Verify verify = cfg::verify_secret) const;

  // The primary administrator, whom somebody proves to be without a password; null when nobody can
  // bind as it.
  const Identity* primary_administrator() const noexcept;

  // The identity that the subject of a certificate (a normal form) is mapped to; null when it is
  // mapped to nobody, or more than once, or who it is mapped to cannot bind. Throws std::bad_alloc.
  std::shared_ptr<const Identity> of_certificate(std::string_view subject) const;

  // Who binds with a user name, and in `password` the password in clear, in UTF-8, which the caller
  // wipes. Null, and no password, when nobody can; if only because the password is stored in a way
  // that cannot be read back, `unreadable` is then the normal form of the entry. Takes the same
  // work whoever is asked for. Throws std::bad_alloc.
  std::shared_ptr<const Identity> of_user(std::string_view name, std::string& password,
                                          std::string& unreadable) const;

  // The identity of a Kerberos principal, as Kerberos spells it; or null. Throws std::bad_alloc.
  std::shared_ptr<const Identity> of_principal(std::string_view principal) const;

  // Whether of_user and of_principal could find somebody.
  bool has_users() const noexcept;
  bool has_principals() const noexcept;

  // Whether any certificate is mapped to somebody who can bind.
  bool maps_certificates() const noexcept;

  // Whether what `bound` (of any snapshot) was granted still stands here: the same entry, bind DN,
  // flags, roles and stored password, the map of the certificate or the name that proved it, and it
  // may bind.
  bool still_valid(const Identity& bound) const noexcept;

  // Whether more than one entry claims the DN that is spelled so. Throws std::bad_alloc.
  bool claimed_twice(std::string_view name) const;

  // Whether somebody is defined by the entry of this normal form, and be it one who cannot bind.
  bool defined_by(std::string_view entry_dn) const noexcept;

  ~Identities();

 private:
  Identities();
  struct Data;
  std::unique_ptr<Data> data_;
};

// What was found when a changed file was read: the cause of a failure ("" when there is none), and
// doubts. Must not throw.
using IdentityReport =
    std::function<void(const std::string& error, const std::vector<std::string>& warnings)>;

// The current snapshot. It is read again when the configuration file is not the file it was read
// from any more (device, inode, size, times), and on reload(); when that fails the last good one
// stays, and it is read again after a pause: what was in the way may have passed (memory, open
// files, the disk), and somebody may have lost rights meanwhile.
class IdentityStore {
 public:
  using Clock = std::chrono::steady_clock;

  // Between two attempts on the same files, each pause twice the one before.
  static constexpr std::chrono::seconds kFirstPause{1};
  static constexpr std::chrono::seconds kLongestPause{60};

  // `report` (may be empty) is told what current() finds, once for each state of the files and
  // cause. `follow` (may be empty) takes over what else goes by the same entries, after each
  // successful reading and before anybody is served by it; false when that failed, and is then
  // tried again as a reading is. One at a time; must not throw.
  IdentityStore(std::string config_file, std::string key_stash_file, IdentityReport report = {},
                std::function<bool()> follow = {});
  ~IdentityStore();

  // Reads anew whatever the file's times say. False (with the cause) when the last good one stays.
  bool reload(std::string& error, std::vector<std::string>& warnings) noexcept;

  // Never null after the first successful reload.
  std::shared_ptr<const Identities> current(Clock::time_point now = Clock::now()) noexcept;

  // The same without looking at the files, and how often they were read with success. Never block.
  std::shared_ptr<const Identities> latest() const noexcept;
  std::uint64_t generation() const noexcept;

 private:
  struct State;
  std::unique_ptr<State> state_;
};

}  // namespace orv::server
