#include "check.h"

#include <sys/types.h>
#include <unistd.h>

#include <fstream>
#include <iterator>
#include <map>
#include <utility>
#include <vector>

#include "cfg/dn.h"
#include "cfg/secret.h"
#include "file_session.h"
#include "schema_check.h"
#include "slapi/admin_policy.h"
#include "slapi/file_doubts.h"
#include "slapi/file_trust.h"

namespace orv::orvcfg {

namespace {

constexpr const char* kSuffix = "CN=CONFIGURATION";

class FileCheck {
 public:
  // `user` is the one that the server will run as.
  FileCheck(const cfg::Key* key, uid_t user, std::ostream& out)
      : key_(key), user_(user), out_(out) {}

  void check(const FileEntry& entry) {
    const std::vector<std::string> misfits = schema_problems(builtin_schema(), entry);
    for (const std::string& problem : misfits) report(entry, problem);
    if (misfits.empty()) check_policy(entry);
    check_secrets(entry);
    check_addresses(entry);
    check_authorities(entry);
    check_identity(entry, "orv-slapdAdminDN");
    check_identity(entry, "orv-slapdMasterDN");
  }

  void report(const FileEntry& entry, const std::string& problem) {
    out_ << entry.dn << ": " << problem << "\n";
    ++problems_;
  }

  // What concerns no entry but the text of the file.
  void report(const std::string& problem) {
    out_ << problem << "\n";
    ++problems_;
  }

  [[nodiscard]] int problems() const { return problems_; }

 private:
  void check_secrets(const FileEntry& entry) {
    std::string place;
    if (cfg::normalize_dn(entry.dn, place) != 0) return;
    for (const FileAttribute& attribute : entry.attributes) {
      const SchemaAttribute* type = builtin_schema().attribute(attribute.name);
      if (type == nullptr || !type->secret) continue;
      for (const std::string& value : attribute.values) {
        check_secret(entry, {type->names.front(), place}, value);
      }
    }
  }

  // A sealed value is bound to its entry, so opening alone does not show that it may stand here.
  void check_secret(const FileEntry& entry, cfg::SecretPlace place, const std::string& value) {
    if (key_ == nullptr) return;
    std::string clear;
    const cfg::OpenResult opened = cfg::open_secret(key_, value, clear);
    const bool belongs =
        opened != cfg::OpenResult::opened || cfg::verify_secret(key_, place, value, clear);
    cfg::wipe(clear);
    if (opened == cfg::OpenResult::broken) {
      report(entry, std::string(place.type) + " cannot be opened with this key stash");
    } else if (!belongs) {
      report(entry, std::string(place.type) + " was sealed for another entry");
    }
  }

  void check_addresses(const FileEntry& entry) {
    for (const std::string& address : entry.values("orv-slapdIpAddress")) {
      if (const std::string doubt = address_doubt(address); !doubt.empty()) report(entry, doubt);
    }
  }

  void check_authorities(const FileEntry& entry) {
    for (const char* const type :
         {"orv-slapdTlsCaFile", "orv-slapdTlsCrlFile", "orv-slapdKrbKeytab"})
      for (const std::string& file : entry.values(type))
        if (const std::string why = distrust_of_authority(file, user_); !why.empty()) report(why);
  }

  void check_policy(const FileEntry& entry) {
    std::string name;
    if (cfg::normalize_dn(entry.dn, name) != 0 || name != kAdminPolicyEntry) return;
    AdminPolicySettings settings;
    for (const std::string_view type : admin_policy_types()) {
      const std::vector<std::string>& values = entry.values(type);
      if (!values.empty()) settings.emplace(type, values.front());
    }
    const std::string problem = admin_policy_problem(settings);
    if (!problem.empty()) report(entry, problem);
  }

  void check_identity(const FileEntry& entry, const char* type) {
    for (const std::string& value : entry.values(type)) {
      std::string name;
      if (cfg::normalize_dn(value, name) != 0) continue;  // told already
      if (name.empty()) {
        report(entry, std::string(type) + " is not the DN of an administrator");
      } else if (cfg::normal_dn_is_at_or_below(name, kSuffix)) {
        report(entry, std::string(type) + " lies inside " + kSuffix + ", so nobody can bind as it");
      } else if (const auto [owner, is_new] = owners_.emplace(name, entry.dn); !is_new) {
        report(entry, std::string(type) + " is claimed by " + owner->second + " too");
      }
    }
  }

  const cfg::Key* key_;
  uid_t user_;
  std::ostream& out_;
  std::map<std::string, std::string> owners_;  // normalised bind DN, entry that has it
  int problems_ = 0;
};

bool conclude(const std::string& file, std::size_t entries, int problems, std::ostream& out) {
  out << file << ": " << entries << " entries, ";
  if (problems == 0) out << "nothing wrong\n";
  if (problems == 1) out << "1 problem\n";
  if (problems > 1) out << problems << " problems\n";
  return problems == 0;
}

std::string text_of(const std::string& file) {
  std::ifstream in(file, std::ios::binary);
  return {std::istreambuf_iterator<char>(in), {}};
}

// The server runs as the owner of the file.
uid_t user_of(const std::string& file) {
  return owner_of(file, ::geteuid());
}

// As the server would.
std::vector<std::string> distrust(const std::string& file, const std::string& key_stash) {
  return distrusted_files(file, key_stash, user_of(file));
}

bool check_entries(const std::string& file, const std::string& key_stash,
                   const std::vector<FileEntry>& entries, const cfg::Key* key, std::ostream& out) {
  FileCheck check(key, user_of(file), out);
  const std::string prefix = file + ": ";
  for (const std::string& line : distrust(file, key_stash)) check.report(line);
  for (const std::string& line : numbered_types(text_of(file))) check.report(prefix + line);
  for (const FileEntry& entry : entries) check.check(entry);
  return conclude(file, entries.size(), check.problems(), out);
}

}  // namespace

bool check_file(const std::string& file, const std::string& key_stash, std::ostream& out) {
  std::string why;
  cfg::KeyPtr key;
  if (!key_stash.empty() && cfg::load_key_stash(key_stash.c_str(), key, why) != 0) {
    for (const std::string& line : distrust(file, key_stash)) out << line << "\n";
    out << why << "\n";
    return false;
  }
  const CfgSession session = open_file(file, "", why);
  std::vector<FileEntry> entries;
  if (!session || !read_entries(session.get(), kSuffix, entries, why)) {
    out << (session ? file + ": " : "") << why << "\n";
    return false;
  }
  return check_entries(file, key_stash, entries, key.get(), out);
}

}  // namespace orv::orvcfg
