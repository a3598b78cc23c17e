#include "slapi/administrators.h"

#include <openssl/evp.h>

#include <array>
#include <charconv>
#include <iterator>
#include <map>
#include <memory>
#include <mutex>
#include <new>
#include <string>
#include <utility>
#include <vector>

#include "cfg/dn.h"
#include "cfg/owners.h"
#include "cfg/result_codes.h"
#include "local_text.h"
#include "messages.h"
#include "slapi/dn.h"
#include "slapi/owners.h"
#include "slapi/services.h"

namespace orv {
namespace {

constexpr const char* kTop = "CN=CONFIGURATION";
constexpr const char* kGroup = "CN=ADMINGROUP,CN=CONFIGURATION";
constexpr const char* kMasterServer = "CN=MASTER SERVER,CN=CONFIGURATION";

// ---- Records ---------------------------------------------------------------------------------

using PasswordDigest = std::array<unsigned char, 32>;

struct Record : AdminPasswordRecord {
  bool active = false;  // somebody has this name
  PasswordDigest password{};
  int failures = 0;
  LockoutTime last_failure{};
  bool locked = false;  // since the last failure

  void forget() noexcept {
    failures = 0;
    locked = false;
  }

  void forget_if_old(const _Admin_pwdPolicy& policy, LockoutTime now) noexcept {
    const int seconds = locked ? policy.pwdLockoutDuration : policy.pwdFailureCountInterval;
    if (seconds > 0 && now - last_failure >= std::chrono::seconds(seconds)) forget();
  }

  // True when this failure locks the identity out.
  bool count(const _Admin_pwdPolicy& policy, LockoutTime now) noexcept {
    last_failure = now;
    if (failures < policy.pwdMaxFailure) ++failures;
    locked = failures >= policy.pwdMaxFailure;
    return locked;
  }
};

using Records = std::map<std::string, std::unique_ptr<Record>, std::less<>>;  // by normal DN

// ---- Identities ------------------------------------------------------------------------------

struct SuffixSupplier {
  std::string dn;
  std::vector<std::string> suffixes;
};

// All in normal form.
struct Suppliers {
  std::string of_server;  // "": nobody
  std::vector<SuffixSupplier> of_suffixes;
};

struct Identities {
  std::map<std::string, PasswordDigest> passwords;
  Suppliers suppliers;
};

struct Known {
  std::mutex mutex;
  Records records;
  Suppliers suppliers;

  // Null for a name that is nobody's.
  Record* find(std::string_view normal) noexcept {
    const auto found = records.find(normal);
    return found == records.end() || !found->second->active ? nullptr : found->second.get();
  }
};

// Never destroyed: whoever asked for a record may keep it as long as the process lives.
Known& known() {
  static Known& all = *new Known;
  return all;
}

// ---- Reading ---------------------------------------------------------------------------------

struct Kind {
  const char* base;
  int scope;
  const char* filter;
  const char* name_type;
  const char* password_type;
};
constexpr Kind kPrimary{kTop, kScopeBase, "(objectclass=*)", "orv-slapdAdminDN",
                        "orv-slapdAdminPW"};
constexpr Kind kMember{kGroup, kScopeSubtree, "(objectclass=orv-slapdAdminGroupMember)",
                       "orv-slapdAdminDN", "orv-slapdAdminPW"};
constexpr Kind kServerSupplier{kMasterServer, kScopeBase, "(objectclass=*)", "orv-slapdMasterDN",
                               "orv-slapdMasterPW"};
constexpr Kind kSuffixSupplier{kTop, kScopeSubtree, "(objectclass=orv-slapdSupplier)",
                               "orv-slapdMasterDN", "orv-slapdMasterPW"};

// An answer of the session that ends the reading.
struct ReadFailure {
  int code;
};

// Texts of the file are in its own code page. False for what is no DN. Throws std::bad_alloc.
bool normalize(std::string_view dn, std::string& normal) {
  std::string utf8;
  const int rc = slapi::local_to_utf8(dn, utf8) ? cfg::normalize_dn(utf8, normal)
                                                : static_cast<int>(result::invalid_dn_syntax);
  if (rc == result::no_memory) throw std::bad_alloc();
  return rc == result::success;
}

// Throws ReadFailure and std::bad_alloc.
class AdministratorReader {
 public:
  AdministratorReader(_CFG* session, Identities& found) : session_(session), found_(found) {}

  void read() {
    for (const Kind* const kind : {&kPrimary, &kMember, &kServerSupplier, &kSuffixSupplier})
      read_kind(*kind);
  }

 private:
  void read_kind(const Kind& kind) {
    _CFGMessage* found = nullptr;
    const int rc = cfg_search_s(session_, kind.base, kind.scope, kind.filter, nullptr, 0, &found);
    const CfgResult chain(found);
    if (rc == result::no_such_object && kind.base != kTop) return;
    if (rc != result::success) throw ReadFailure{rc};
    for (_CFGMessage* record = cfg_first_entry(session_, found); record != nullptr;
         record = cfg_next_entry(session_, record))
      read_entry(kind, record);
    const int end = cfg_get_errno(session_);
    if (end != result::success && end != result::no_such_attribute) throw ReadFailure{end};
  }

  // The container of the group defines nobody, and the supplier of the whole server is no other's.
  bool defines_somebody(const Kind& kind, _CFGMessage* record) {
    const CfgText dn(cfg_get_dn(session_, record));
    if (dn == nullptr) throw std::bad_alloc();
    std::string normal;
    if (!normalize(dn.get(), normal)) throw ReadFailure{result::invalid_dn_syntax};
    if (&kind == &kMember) return normal != kGroup;
    return &kind != &kSuffixSupplier || normal != kMasterServer;
  }

  void read_entry(const Kind& kind, _CFGMessage* record) {
    if (!defines_somebody(kind, record)) return;
    const CfgValues names = values(record, kind.name_type);
    std::string name;
    if (is_empty(names) || !normalize(names.get()[0], name)) return;
    if (name.empty() || cfg::normal_dn_is_at_or_below(name, kTop)) return;
    const CfgValues passwords = values(record, kind.password_type);
    found_.passwords[name] = digest(is_empty(passwords) ? "" : passwords.get()[0]);
    if (&kind == &kServerSupplier) found_.suppliers.of_server = name;
    if (&kind == &kSuffixSupplier)
      found_.suppliers.of_suffixes.push_back({std::move(name), read_suffixes(record)});
  }

  std::vector<std::string> read_suffixes(_CFGMessage* record) {
    const CfgValues stored = values(record, "orv-slapdMasterSuffix");
    std::vector<std::string> suffixes;
    for (char** value = stored.get(); value != nullptr && *value != nullptr; ++value) {
      std::string suffix;
      if (normalize(*value, suffix)) suffixes.push_back(std::move(suffix));
    }
    return suffixes;
  }

  // Null for an attribute that the entry lacks.
  CfgValues values(_CFGMessage* record, const char* type) {
    CfgValues read(cfg_get_values(session_, record, type));
    if (read != nullptr) return read;
    const int error = cfg_get_errno(session_);
    if (error != result::no_such_attribute) throw ReadFailure{error};
    return read;
  }

  static bool is_empty(const CfgValues& values) noexcept {
    return values == nullptr || values.get()[0] == nullptr;
  }

  static PasswordDigest digest(std::string_view stored) {
    PasswordDigest made{};
    if (EVP_Digest(stored.data(), stored.size(), made.data(), nullptr, EVP_sha256(), nullptr) != 1)
      throw std::bad_alloc();
    return made;
  }

  _CFG* session_;
  Identities& found_;
};

// ---- Taking over -----------------------------------------------------------------------------

Records make_records(const std::map<std::string, PasswordDigest>& passwords) {
  Records records;
  for (const auto& [dn, password] : passwords) {
    auto record = std::make_unique<Record>();
    record->changed = 0;
    record->password = password;
    records.emplace(dn, std::move(record));
  }
  return records;
}

// Cannot fail: everything was allocated before.
void take_over(Identities& identities, Records& fresh) noexcept {
  Known& all = known();
  const std::lock_guard lock(all.mutex);
  all.records.merge(fresh);  // those that are new; records that were handed out stay
  for (auto& [dn, record] : all.records) {
    const auto stated = identities.passwords.find(dn);
    record->active = stated != identities.passwords.end();
    if (!record->active) record->forget();
    if (!record->active || record->password == stated->second) continue;
    record->forget();
    record->password = stated->second;
  }
  std::swap(all.suppliers, identities.suppliers);
}

// ---- Asking ----------------------------------------------------------------------------------

void tell_of_lockout(const char* dn, int failures) noexcept {
  char count[16] = "";
  std::to_chars(std::begin(count), std::end(count) - 1, failures);
  PrintMessage(0, message::password_set, message::locked_out, dn, count);
}

bool supplies(const Suppliers& suppliers, std::string_view suffix, std::string_view dn) noexcept {
  for (const SuffixSupplier& supplier : suppliers.of_suffixes) {
    if (supplier.dn != dn) continue;
    for (const std::string& own : supplier.suffixes)
      if (own == suffix) return true;
  }
  return false;
}

}  // namespace

int load_administrators(_CFG* session) noexcept try {
  Identities identities;
  AdministratorReader(session, identities).read();
  Records fresh = make_records(identities.passwords);
  known();
  take_over(identities, fresh);
  return result::success;
} catch (const ReadFailure& failure) {
  return failure.code;
} catch (...) {
  return result::no_memory;
}

bool settle_administrator_bind(std::string_view dn, bool proved, LockoutTime now) noexcept try {
  const _Admin_pwdPolicy policy = getGlobalAdminPWDPolicyLocal();
  std::string normal;
  const int rc = cfg::normalize_dn(dn, normal);
  if (rc != result::success) return rc == result::invalid_dn_syntax && proved;
  Known& all = known();
  bool locks = false;
  {
    const std::lock_guard lock(all.mutex);
    Record* const record = all.find(normal);
    if (record == nullptr) return proved;
    if (policy.pwdLockout == 0) {
      record->forget();
      return proved;
    }
    record->forget_if_old(policy, now);
    if (record->locked) return false;
    if (proved) {
      record->forget();
      return true;
    }
    locks = record->count(policy, now);
  }
  if (locks) tell_of_lockout(normal.c_str(), policy.pwdMaxFailure);
  return false;
} catch (...) {
  return false;
}

bool is_administrator_locked_out(std::string_view dn, LockoutTime now) noexcept try {
  const _Admin_pwdPolicy policy = getGlobalAdminPWDPolicyLocal();
  std::string normal;
  if (policy.pwdLockout == 0 || cfg::normalize_dn(dn, normal) != result::success) return false;
  Known& all = known();
  const std::lock_guard lock(all.mutex);
  Record* const record = all.find(normal);
  if (record == nullptr) return false;
  record->forget_if_old(policy, now);
  return record->locked;
} catch (...) {
  return false;
}

void settle_password_changes(bool written) noexcept try {
  Known& all = known();
  const std::lock_guard lock(all.mutex);
  for (const auto& [dn, record] : all.records) {
    if (record->changed != 0 && written) record->forget();
    record->changed = 0;
  }
} catch (...) {
}

AdminPasswordRecord* findAdminPWDPAttrib(const char* dn) try {
  if (dn == nullptr) return nullptr;
  std::string normal;
  if (!normalize(dn, normal)) return nullptr;
  Known& all = known();
  const std::lock_guard lock(all.mutex);
  return all.find(normal);
} catch (...) {
  return nullptr;
}

int checkMasterSrvDn(const char* suffix, const char* dn) try {
  constexpr int no = 0;
  constexpr int yes = 1;
  if (dn == nullptr) return no;
  std::string who;
  std::string where;
  if (cfg::normalize_dn(dn, who) != result::success || who.empty()) return no;
  if (suffix != nullptr && cfg::normalize_dn(suffix, where) != result::success) return no;
  Known& all = known();
  const std::lock_guard lock(all.mutex);
  const bool is =
      suffix == nullptr ? all.suppliers.of_server == who : supplies(all.suppliers, where, who);
  return is ? yes : no;
} catch (...) {
  return 0;
}

}  // namespace orv
