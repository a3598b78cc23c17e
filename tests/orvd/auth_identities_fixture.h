// Configurations that say who may bind, and a fixture that reads them from a file.
#pragma once

#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <memory>
#include <string>
#include <vector>

#include "../temporary_directory.h"
#include "auth/identities.h"
#include "cfg/secret.h"

namespace orv::server {

// ---- Entries, in LDIF. A configuration is some of them one after another, a top first; lines of
// attributes may follow an entry.

inline const std::string kTopWithoutPassword =
    "dn: cn=configuration\nobjectClass: orv-slapdTop\ncn: configuration\n"
    "orv-slapdAdminDN: cn=root\n";

inline std::string top_with(const std::string& stored_password) {
  return kTopWithoutPassword + "orv-slapdAdminPW: " + stored_password + "\n";
}

inline const std::string kTop = top_with("rootpw");
inline const std::string kGroup =
    "\ndn: cn=AdminGroup,cn=configuration\n"
    "objectClass: container\n"
    "cn: AdminGroup\n";
inline const std::string kAuditRole = "orv-slapdAdminRole: AuditAdmin\n";

inline std::string member(const std::string& name, const std::string& dn,
                          const std::string& password, const std::string& more = kAuditRole) {
  return "\ndn: cn=" + name + ",cn=AdminGroup,cn=configuration\n" +
         "objectClass: orv-slapdAdminGroupMember\ncn: " + name + "\norv-slapdAdminDN: " + dn +
         "\norv-slapdAdminPW: " + password + "\n" + more;
}

// ---- The file

class IdentitiesOfAFile : public ::testing::Test {
 protected:
  std::string config() const { return folder_.file("config.ldif"); }
  std::string stash() const { return folder_.file("key.stash"); }

  void write(const std::string& text) { std::ofstream(config(), std::ios::trunc) << text; }

  // As every writer of ours does it: a new file put in the old one's place.
  void replace(const std::string& text) {
    std::ofstream(config() + ".new", std::ios::trunc) << text;
    std::filesystem::rename(config() + ".new", config());
  }

  std::shared_ptr<const Identities> read(const std::string& text) {
    write(text);
    error_.clear();
    warnings_.clear();
    return Identities::read(config().c_str(), use_stash_ ? stash().c_str() : "", error_, warnings_);
  }

  // Readings from now on use it, too.
  cfg::KeyPtr make_key() {
    std::string why;
    EXPECT_EQ(cfg::create_key_stash(stash().c_str(), why), 0) << why;
    use_stash_ = true;
    cfg::KeyPtr key;
    EXPECT_EQ(cfg::load_key_stash(stash().c_str(), key, why), 0) << why;
    return key;
  }

  static std::string sealed(const cfg::Key& key, const char* type, const char* entry_dn,
                            const char* clear) {
    std::string stored;
    EXPECT_EQ(cfg::seal_secret(key, {type, entry_dn}, clear, stored), 0);
    return stored;
  }

  const orv::test::TemporaryDirectory folder_;
  std::string error_;
  std::vector<std::string> warnings_;
  bool use_stash_ = false;
};

}  // namespace orv::server
