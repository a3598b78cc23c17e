// What the tests of adds and deletes share: who calls, entries of the configuration under names
// that the tests spell themselves, and the entry that is to be added.
#pragma once

#include "backend_test.h"
#include "slapi/owners.h"

namespace orv {

// ---- Callers

inline constexpr unsigned kPrimary = 0x0C;
inline constexpr unsigned kGroupMember = 0x14;

// ---- Entries

inline constexpr const char* kConfiguration = "CN=CONFIGURATION";
inline constexpr const char* kGroup = "CN=ADMINGROUP,CN=CONFIGURATION";
inline constexpr const char* kMember = "CN=ONE,CN=ADMINGROUP,CN=CONFIGURATION";
inline constexpr const char* kKerberos = "CN=KERBEROS,CN=CONFIGURATION";
inline constexpr const char* kDigest = "CN=DIGEST,CN=CONFIGURATION";
inline constexpr const char* kDefaultLog = "CN=DEFAULT,CN=LOG MANAGEMENT,CN=CONFIGURATION";
inline constexpr const char* kAudit = "CN=AUDIT,CN=LOG MANAGEMENT,CN=CONFIGURATION";
inline constexpr const char* kAdminAudit = "CN=ADMIN AUDIT,CN=LOG MANAGEMENT,CN=CONFIGURATION";
inline constexpr const char* kMaster = "CN=MASTER SERVER,CN=CONFIGURATION";
inline constexpr const char* kReplication = "CN=REPLICATION,CN=CONFIGURATION";
inline constexpr const char* kContainer = "CN=PASSTHROUGH AUTHENTICATION,CN=CONFIGURATION";
inline constexpr const char* kProxies =
    "CN=PROXYDB,CN=PROXY BACKENDS,CN=ORV DIRECTORY,CN=SCHEMAS,CN=CONFIGURATION";

// Searches, as the script of the file knows them.
inline constexpr const char* kReplicationSearch =
    "CN=CONFIGURATION?objectclass=orv-slapdReplication";
inline constexpr const char* kSupplierSearch = "CN=CONFIGURATION?objectclass=orv-slapdSupplier";

// ---- The entry that is to be added

using Attributes = std::vector<scripted::ScriptedAttribute>;

class AddedEntryTest : public BackendTest {
 protected:
  void TearDown() override {
    e.reset();
    BackendTest::TearDown();
  }

  // With a new record of calls.
  void make(const std::string& dn, const Attributes& attributes) {
    e.reset(scripted::make_entry({dn, attributes}));
    platform.name(e.get(), "entry");
    platform.forget();
  }

  EntryPtr e;
};

// ---- Authority

// Runs `authority`, which gives 0 or 50, for a member under each set of role bits.
template <typename Authority, typename Allowed>
void expect_roles(Operation& operation, Authority authority, Allowed allowed) {
  operation.authority = kGroupMember;
  for (unsigned roles = 0; roles < 0x80; ++roles) {
    operation.roles = roles;
    EXPECT_EQ(authority(), allowed(roles) ? 0 : 50) << "with " << roles;
  }
}

}  // namespace orv
