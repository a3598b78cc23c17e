#include "auth/identity_reader.h"

#include <cstring>
#include <new>
#include <utility>

#include "cfg/dn.h"
#include "cfg/owners.h"
#include "cfg/result_codes.h"
#include "cfg/text.h"
#include "slapi/codepage.h"
#include "slapi/connection.h"
#include "slapi/owners.h"

namespace orv::server {
namespace {

constexpr const char* kTop = "CN=CONFIGURATION";
constexpr const char* kGroup = "CN=ADMINGROUP,CN=CONFIGURATION";
constexpr const char* kMasterServer = "CN=MASTER SERVER,CN=CONFIGURATION";
constexpr const char* kKerberos = "CN=KERBEROS,CN=CONFIGURATION";
constexpr const char* kDigest = "CN=DIGEST,CN=CONFIGURATION";

constexpr const char* kAdminDn = "orv-slapdAdminDN";
constexpr const char* kAdminPassword = "orv-slapdAdminPW";
constexpr const char* kMasterDn = "orv-slapdMasterDN";
constexpr const char* kMasterPassword = "orv-slapdMasterPW";
constexpr const char* kRole = "orv-slapdAdminRole";
constexpr const char* kGroupEnabled = "orv-slapdAdminGroupEnabled";
constexpr const char* kKerberosDn = "orv-slapdKrbAdminDN";
constexpr const char* kUserName = "orv-slapdDigestAdminUser";

constexpr const char* kEveryEntry = "(objectclass=*)";
constexpr const char* kMembers = "(objectclass=orv-slapdAdminGroupMember)";
constexpr const char* kSuppliers = "(objectclass=orv-slapdSupplier)";

constexpr int kBindFlags = 128;

// One kind of identity: where its entries are found and what they are worth.
struct Kind {
  const char* base;
  int scope;
  const char* filter;
  const char* dn_type;
  const char* password_type;
  unsigned authority;
  bool base_required;
};

constexpr Kind kPrimary{kTop,     kScopeBase,     kEveryEntry,
                        kAdminDn, kAdminPassword, authority::primary_administrator,
                        true};
constexpr Kind kMember{kGroup,   kScopeSubtree,  kMembers,
                       kAdminDn, kAdminPassword, authority::admin_group_member,
                       false};
constexpr Kind kServerSupplier{kMasterServer, kScopeBase,      kEveryEntry,
                               kMasterDn,     kMasterPassword, authority::supplier_of_server,
                               false};
constexpr Kind kSuffixSupplier{kTop,      kScopeSubtree,   kSuppliers,
                               kMasterDn, kMasterPassword, authority::supplier_of_suffix,
                               true};

class RecordReader {
 public:
  RecordReader(IdentityRecords& result, std::string& error, std::vector<std::string>& warnings)
      : result_(result), error_(error), warnings_(warnings) {}

  bool read(const char* config_file, const char* key_stash_file) {
    return load_key(key_stash_file) && open(config_file, key_stash_file) && read_kind(kPrimary) &&
           read_names_of_primary() && read_kind(kMember) && read_kind(kServerSupplier) &&
           read_kind(kSuffixSupplier) && read_certificate_map();
  }

 private:
  // ---- The session

  bool load_key(const char* key_stash_file) {
    if (key_stash_file == nullptr || *key_stash_file == '\0') return true;
    return cfg::load_key_stash(key_stash_file, result_.key, error_) == 0;
  }

  bool open(const char* config_file, const char* key_stash_file) {
    session_.reset(cfg_init(nullptr, 0));
    if (!session_) throw std::bad_alloc();
    int code = cfg_set_option(session_.get(), kCfgOptDiagnostics, 1);
    if (code == 0) code = cfg_set_option(session_.get(), kCfgOptDiagnosticsFile, 1);
    if (code == 0) code = cfg_set_option(session_.get(), kCfgOptConfigFile, config_file);
    if (code == 0 && key_stash_file != nullptr && *key_stash_file != '\0') {
      code = cfg_set_option(session_.get(), kCfgOptKeyStashFile, key_stash_file);
    }
    if (code == 0) code = cfg_bind_s(session_.get(), nullptr, nullptr, kBindFlags);
    if (code == result::no_memory) throw std::bad_alloc();
    if (code != 0) error_ = cfg_dump_exception(session_.get());
    return code == 0;
  }

  // ---- Entries

  bool read_kind(const Kind& kind) {
    _CFGMessage* found = nullptr;
    const int code =
        cfg_search_s(session_.get(), kind.base, kind.scope, kind.filter, nullptr, 0, &found);
    const CfgResult chain(found);
    if (code == result::no_such_object && !kind.base_required) return true;
    if (code != 0) return fail(code, kind.base);
    for (_CFGMessage* record = cfg_first_entry(session_.get(), chain.get()); record != nullptr;
         record = cfg_next_entry(session_.get(), record)) {
      if (!read_entry(kind, record)) return false;
    }
    return true;
  }

  // Finds the one entry, if it is there.
  bool find(const char* dn, CfgResult& chain, _CFGMessage*& entry) {
    _CFGMessage* found = nullptr;
    const int code = cfg_search_s(session_.get(), dn, kScopeBase, kEveryEntry, nullptr, 0, &found);
    chain.reset(found);
    if (code != 0 && code != result::no_such_object) return fail(code, dn);
    entry = code == 0 ? cfg_first_entry(session_.get(), chain.get()) : nullptr;
    return true;
  }

  // They stand in entries of their own.
  bool read_names_of_primary() {
    CfgResult chain;
    _CFGMessage* entry = nullptr;
    if (!find(kDigest, chain, entry)) return false;
    std::string user_name = entry ? read_user_name(entry, kDigest) : std::string();
    if (!find(kKerberos, chain, entry)) return false;
    std::string principal = entry ? read_principal(entry, kKerberos) : std::string();
    if (result_.records.empty()) return true;
    result_.records.front().user_name = std::move(user_name);
    result_.records.front().principal = std::move(principal);
    return true;
  }

  bool read_certificate_map() {
    CfgResult chain;
    _CFGMessage* entry = nullptr;
    if (!find(kGroup, chain, entry)) return false;
    if (entry == nullptr) return true;
    for (const std::string& value : values(entry, kCertificateMap)) {
      CertificateMapping mapping;
      std::string text;
      if (!to_utf8(value.c_str(), text) || !parse_certificate_mapping(text, mapping))
        warn(kGroup, std::string("a value of ") + kCertificateMap + " is not SUBJECT => NAME");
      else
        result_.certificates.push_back(std::move(mapping));
    }
    return true;
  }

  bool fail(int code, const char* where) {
    if (code == result::no_memory) throw std::bad_alloc();
    error_ = code == result::no_such_object
                 ? std::string("the configuration file has no entry ") + where
                 : std::string("reading ") + where + " failed with code " + std::to_string(code);
    return false;
  }

  bool read_entry(const Kind& kind, _CFGMessage* entry) {
    const CfgText dn(cfg_get_dn(session_.get(), entry));
    if (!dn) throw std::bad_alloc();
    IdentityRecord record{};
    record.password_type = kind.password_type;
    record.identity.authority = kind.authority;
    if (!normalize_from_file(dn.get(), record.identity.entry_dn)) {
      return fail(result::invalid_dn_syntax, dn.get());
    }
    if (!belongs_to(kind, record.identity.entry_dn)) return true;
    if (&kind == &kPrimary) group_enabled_ = is_group_enabled(entry);
    if (&kind == &kMember) {
      record.enabled = group_enabled_;
      record.identity.roles = role_bits(values(entry, kRole));
      record.user_name = read_user_name(entry, record.identity.entry_dn);
      record.principal = read_principal(entry, record.identity.entry_dn);
    }
    record.stored_password = first_value(entry, kind.password_type, record.identity.entry_dn);
    doubt_sealed_password(record);
    const std::string bound = first_value(entry, kind.dn_type, record.identity.entry_dn);
    if (accept_bound_dn(kind, bound, record)) result_.records.push_back(std::move(record));
    return true;
  }

  // The container defines nobody, and the entry of the whole server's supplier grants one thing
  // only, whatever further classes it has.
  static bool belongs_to(const Kind& kind, std::string_view entry_dn) noexcept {
    if (&kind == &kMember) return entry_dn != kGroup;
    return &kind != &kSuffixSupplier || entry_dn != kMasterServer;
  }

  bool accept_bound_dn(const Kind& kind, const std::string& bound, IdentityRecord& record) {
    const std::string& entry_dn = record.identity.entry_dn;
    if (bound.empty()) {
      warn(entry_dn, std::string("has no ") + kind.dn_type + " and defines nobody");
    } else if (!normalize_from_file(bound.c_str(), record.identity.bound_dn) ||
               !to_utf8(bound.c_str(), record.identity.shown_dn)) {
      warn(entry_dn, std::string(kind.dn_type) + " is not a DN");
    } else if (!may_be_bound(record.identity.bound_dn)) {
      warn(entry_dn, std::string(kind.dn_type) +
                         " is empty or lies inside the configuration, nobody can bind with it");
    } else {
      return true;
    }
    return false;
  }

  // ---- Values

  std::vector<std::string> values(_CFGMessage* entry, const char* type) {
    std::vector<std::string> texts;
    const CfgValues stored(cfg_get_values(session_.get(), entry, type));
    if (!stored && cfg_get_errno(session_.get()) == result::no_memory) throw std::bad_alloc();
    for (char** value = stored.get(); value != nullptr && *value != nullptr; ++value) {
      texts.emplace_back(*value);
    }
    return texts;
  }

  std::string first_value(_CFGMessage* entry, const char* type, const std::string& entry_dn) {
    std::vector<std::string> all = values(entry, type);
    if (all.size() > 1) warn(entry_dn, std::string("only the first value of ") + type + " counts");
    return all.empty() ? std::string() : std::move(all.front());
  }

  std::string read_user_name(_CFGMessage* entry, const std::string& entry_dn) {
    const std::string stored = first_value(entry, kUserName, entry_dn);
    std::string name;
    if (!to_utf8(stored.c_str(), name))
      warn(entry_dn, std::string(kUserName) + " is not text, nobody can bind with it");
    return name;
  }

  std::string read_principal(_CFGMessage* entry, const std::string& entry_dn) {
    const std::string stored = first_value(entry, kKerberosDn, entry_dn);
    std::string principal;
    if (!stored.empty() && !principal_of(stored, principal))
      warn(entry_dn, std::string(kKerberosDn) +
                         " is not orv-kerberosName= or orv-kn= and a principal, nobody can bind "
                         "with it");
    return principal;
  }

  // What follows the first "=" of the plain form, whole: the rules for changes compare just that.
  static bool principal_of(const std::string& stored, std::string& principal) {
    std::string text;
    std::string light;
    if (!to_utf8(stored.c_str(), text)) return false;
    const int code = cfg::normalize_dn_light(text, light);
    if (code == result::no_memory) throw std::bad_alloc();
    const std::size_t equals = light.find('=');
    if (code != 0 || equals == std::string::npos) return false;
    const std::string_view type = std::string_view(light).substr(0, equals);
    if (!cfg::equals_ignore_ascii_case(type, "orv-kerberosName") &&
        !cfg::equals_ignore_ascii_case(type, "orv-kn"))
      return false;
    principal = lower_principal(std::string_view(light).substr(equals + 1));
    return !principal.empty();
  }

  // Whoever it belongs to would be told no more than that a password is wrong.
  void doubt_sealed_password(const IdentityRecord& record) {
    const std::string& entry_dn = record.identity.entry_dn;
    const cfg::SecretPlace place{record.password_type, entry_dn};
    std::string clear;
    const cfg::OpenResult opened =
        cfg::open_secret(result_.key.get(), record.stored_password, clear);
    const bool belongs_here =
        opened != cfg::OpenResult::opened ||
        cfg::verify_secret(result_.key.get(), place, record.stored_password, clear);
    cfg::wipe(clear);
    if (opened == cfg::OpenResult::broken) {
      warn(entry_dn, std::string(record.password_type) +
                         (result_.key ? " does not open with the key of the stash file"
                                      : " is sealed, and no key stash is named") +
                         ", nobody can bind with it");
    } else if (!belongs_here) {
      warn(entry_dn, std::string(record.password_type) +
                         " was sealed for another entry, nobody can bind with it");
    }
  }

  bool is_group_enabled(_CFGMessage* entry) {
    const std::vector<std::string> all = values(entry, kGroupEnabled);
    return all.empty() || cfg::equals_ignore_ascii_case(all.front(), "TRUE");
  }

  // DNs in the file are in its own code page.
  static bool normalize_from_file(const char* dn, std::string& normal) {
    std::string text;
    if (!to_utf8(dn, text)) return false;
    const int code = cfg::normalize_dn(text, normal);
    if (code == result::no_memory) throw std::bad_alloc();
    return code == 0;
  }

  static bool to_utf8(const char* local, std::string& text) {
    char* converted = nullptr;
    std::size_t length = 0;
    const int code = xlate_localcp_to_utf8(local, &converted, &length);
    const MallocText owned(converted);
    if (code == result::no_memory) throw std::bad_alloc();
    if (code == 0) text = owned.get();
    return code == 0;
  }

  void warn(const std::string& entry_dn, const std::string& what) {
    warnings_.push_back(entry_dn + ": " + what);
  }

  IdentityRecords& result_;
  std::string& error_;
  std::vector<std::string>& warnings_;
  CfgSession session_;
  bool group_enabled_ = true;
};

}  // namespace

std::string lower_principal(std::string_view principal) {
  std::string lower(principal);
  for (char& c : lower)
    if (c >= 'A' && c <= 'Z') c = static_cast<char>(c - 'A' + 'a');
  return lower;
}

bool may_be_bound(std::string_view normal_dn) noexcept {
  return !normal_dn.empty() && !cfg::normal_dn_is_at_or_below(normal_dn, kTop);
}

bool read_identity_records(const char* config_file, const char* key_stash_file,
                           IdentityRecords& result, std::string& error,
                           std::vector<std::string>& warnings) {
  return RecordReader(result, error, warnings).read(config_file, key_stash_file);
}

}  // namespace orv::server
