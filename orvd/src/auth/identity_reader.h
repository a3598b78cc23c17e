// Reading the identities out of a configuration file, before anybody asks which of them are good.
//
// Threads: functions without state.
#pragma once

#include <string>
#include <string_view>
#include <vector>

#include "auth/certificate_map.h"
#include "auth/identities.h"

namespace orv::server {

// An entry that defines an identity, as the file has it.
struct IdentityRecord {
  Identity identity;            // bound DN, authority, roles, entry DN; all normalised
  const char* password_type;    // canonical name of the attribute that holds the password
  std::string stored_password;  // as stored; empty: none, never proves anything
  bool enabled = true;          // false: member of a group that is switched off
  std::string user_name{};      // of SASL mechanisms with passwords, UTF-8; "": none
  std::string principal{};      // of Kerberos, in lower case, UTF-8; "": none
};

struct IdentityRecords {
  std::vector<IdentityRecord> records;
  std::vector<CertificateMapping> certificates;
  cfg::KeyPtr key;  // opens sealed passwords; null without a key stash
};

// Reads all of them with one session. Records whose DN is missing, no DN, empty, or inside the
// configuration itself are left out with a warning; so are sealed passwords that do not open, but
// those records stay. Names that are none are left out with a warning. Returns false with the cause
// in `error`. Throws std::bad_alloc.
bool read_identity_records(const char* config_file, const char* key_stash_file,
                           IdentityRecords& result, std::string& error,
                           std::vector<std::string>& warnings);

// A principal's form for comparison: ASCII letters in lower case. Throws std::bad_alloc.
std::string lower_principal(std::string_view principal);

// Whether a normalised DN can be somebody's outside the configuration.
bool may_be_bound(std::string_view normal_dn) noexcept;

}  // namespace orv::server
