#include "settings.h"

#include <charconv>
#include <optional>

#include "auth/certificate_map.h"
#include "cfg/owners.h"
#include "cfg/result_codes.h"
#include "cfg/session.h"
#include "cfg/text.h"
#include "config/setting_ranges.h"
#include "slapi/administrators.h"
#include "slapi/password_method.h"
#include "slapi/services.h"

namespace orv::server {
namespace {

// A row with the bounds that the tools know too; a setting without any does not compile.
consteval SettingRow row(std::string_view name, std::int64_t Settings::*member,
                         bool needs_restart = false) {
  for (const SettingRange& range : kSettingRanges)
    if (range.name == name) return {name, range.minimum, range.maximum, member, needs_restart};
  throw "a setting without a range";
}

constexpr SettingRow kRows[] = {
    row("orv-slapdPort", &Settings::port, true),
    row("orv-slapdSizeLimit", &Settings::size_limit),
    row("orv-slapdTimeLimit", &Settings::time_limit),
    row("orv-slapdIdleTimeOut", &Settings::idle_timeout),
    row("orv-slapdMaxMessageSize", &Settings::max_message_size),
    row("orv-slapdMaxUnauthenticatedMessageSize", &Settings::max_unauthenticated_message_size),
    row("orv-slapdMaxConnections", &Settings::max_connections),
    row("orv-slapdMaxConnectionsPerAddress", &Settings::max_connections_per_address),
    row("orv-slapdMaxPendingOperations", &Settings::max_pending_operations),
    row("orv-slapdMaxFilterDepth", &Settings::max_filter_depth),
    row("orv-slapdMaxFilterItems", &Settings::max_filter_items),
    row("orv-slapdMaxControls", &Settings::max_controls),
    row("orv-slapdMaxAttributes", &Settings::max_attributes),
    row("orv-slapdMaxValues", &Settings::max_values),
    row("orv-slapdMaxResultSize", &Settings::max_result_size),
    row("orv-slapdOperationWait", &Settings::operation_wait),
    row("orv-slapdWriteTimeOut", &Settings::write_timeout),
    row("orv-slapdMinReadRate", &Settings::min_read_rate),
    row("orv-slapdMessageTimeOut", &Settings::message_timeout),
    row("orv-slapdMaxPersistentSearches", &Settings::max_persistent_searches),
    row("orv-slapdMaxPersistentSearchesPerConnection",
        &Settings::max_persistent_searches_per_connection),
    row("orv-slapdMaxPagedSearches", &Settings::max_paged_searches),
    row("orv-slapdMaxPagedResultSize", &Settings::max_paged_result_size),
    row("orv-slapdMaxFailedChangeSize", &Settings::max_failed_change_size),
    row("orv-slapdMaxFailedChangeTotalSize", &Settings::max_failed_change_total_size),
    row("orv-slapdSecurePort", &Settings::secure_port, true),
    row("orv-slapdMaxUnauthenticatedConnections", &Settings::max_unauthenticated_connections),
    row("orv-slapdUnauthenticatedTimeOut", &Settings::unauthenticated_timeout),
    row("orv-slapdBindTimeOut", &Settings::bind_timeout),
    row("orv-slapdTlsHandshakeTimeOut", &Settings::handshake_timeout),
};

constexpr const char* kAddresses = "orv-slapdIpAddress";
constexpr const char* kLocalSocket = "orv-slapdLocalSocket";
constexpr const char* kConfiguration = "CN=CONFIGURATION";
constexpr const char* kGroup = "CN=ADMINGROUP,CN=CONFIGURATION";
constexpr const char* kSaslMechanismSetting = "orv-slapdSaslMechanisms";
constexpr const char* kDigestEntry = "CN=DIGEST,CN=CONFIGURATION";
constexpr const char* kDigestRealm = "orv-slapdDigestRealm";
constexpr const char* kErrorLogEntry = "CN=DEFAULT,CN=LOG MANAGEMENT,CN=CONFIGURATION";
constexpr const char* kAccessLogEntry = "CN=ACCESS,CN=LOG MANAGEMENT,CN=CONFIGURATION";
constexpr const char* kAuditLogEntry = "CN=AUDIT,CN=LOG MANAGEMENT,CN=CONFIGURATION";
// Where changes are recorded when no file is named. No other log may be there.
constexpr const char* kDefaultAuditLog = "/var/ldap/V6.0/audit.log";

CfgSession open_session(const std::string& config_file, const std::string& key_stash_file,
                        std::string& error) {
  CfgSession session(cfg_init(nullptr, 0));
  if (!session) {
    error = "out of memory";
    return session;
  }
  cfg_set_option(session.get(), kCfgOptDiagnostics, 1);
  cfg_set_option(session.get(), kCfgOptDiagnosticsFile, 1);
  cfg_set_option(session.get(), kCfgOptConfigFile, config_file.c_str());
  if (!key_stash_file.empty())
    cfg_set_option(session.get(), kCfgOptKeyStashFile, key_stash_file.c_str());
  if (cfg_bind_s(session.get(), nullptr, nullptr, 128) == result::success) return session;
  error = cfg_dump_exception(session.get());
  if (error.empty()) error = config_file + ": cannot be read";
  return nullptr;
}

// One entry of the file, for as long as the session lives.
class FileEntry {
 public:
  FileEntry(_CFG* session, const char* dn) : session_(session) {
    _CFGMessage* chain = nullptr;
    code_ = cfg_search_s(session, dn, kScopeBase, nullptr, nullptr, 0, &chain);
    chain_.reset(chain);
    entry_ = code_ == result::success ? cfg_first_entry(session, chain) : nullptr;
  }

  int code() const { return code_; }

  std::vector<std::string> values(const char* attribute) const {
    std::vector<std::string> found;
    const CfgValues values(entry_ ? cfg_get_values(session_, entry_, attribute) : nullptr);
    for (char** value = values.get(); value && *value; ++value) found.emplace_back(*value);
    return found;
  }

  std::optional<std::string> first(const char* attribute) const {
    std::vector<std::string> found = values(attribute);
    if (found.empty()) return std::nullopt;
    return std::move(found.front());
  }

 private:
  _CFG* session_;
  int code_ = 0;
  CfgResult chain_;
  _CFGMessage* entry_ = nullptr;
};

bool read_log(_CFG* session, const char* dn, std::string& path, std::string& level,
              std::string& error) {
  const FileEntry entry(session, dn);
  if (entry.code() == result::success) level = "info";
  path = entry.first("orv-slapdLog").value_or("");
  level = entry.first("orv-slapdLogLevel").value_or(level);
  for (char& c : level)
    if (c >= 'A' && c <= 'Z') c = static_cast<char>(c - 'A' + 'a');
  if (!path.empty() && path.front() != '/') {
    error = std::string(dn) + ": orv-slapdLog is not an absolute path";
    return false;
  }
  for (const std::string_view known : kLogLevels)
    if (level == known) return true;
  error = std::string(dn) + ": orv-slapdLogLevel is none of error, warning, info, debug, off";
  return false;
}

// Changes are recorded unless the entry says otherwise.
bool read_audit_log(_CFG* session, std::string& path, std::string& error) {
  std::string level = "info";
  if (!read_log(session, kAuditLogEntry, path, level, error)) return false;
  if (path.empty()) path = kDefaultAuditLog;
  if (level == "off") path.clear();
  return true;
}

bool read_path(const FileEntry& entry, const char* name, std::string& path, std::string& error) {
  path = entry.first(name).value_or("");
  if (path.empty() || path.front() == '/') return true;
  error = std::string(name) + " is not an absolute path";
  return false;
}

// Which of the words stands there; the first one when none does.
bool read_word(const FileEntry& entry, const char* name, std::span<const std::string_view> words,
               std::size_t& number, std::string& error) {
  const std::string word = entry.first(name).value_or(std::string(words.front()));
  for (number = 0; number < words.size(); ++number)
    if (cfg::equals_ignore_ascii_case(words[number], word)) return true;
  error = std::string(name) + " " + value_problem(name, word);
  return false;
}

void read_flag(const FileEntry& entry, const char* name, bool& flag) {
  if (const std::optional<std::string> value = entry.first(name))
    flag = !cfg::equals_ignore_ascii_case(*value, "FALSE");
}

// What an absent entry would say is the default.
bool read_tls(_CFG* session, Settings& settings, std::string& error) {
  const FileEntry group(session, kGroup);
  TlsSettings& tls = settings.tls;
  std::size_t version = 0;
  std::size_t clients = 0;
  if (!read_path(group, "orv-slapdTlsCertificateFile", tls.certificate_file, error) ||
      !read_path(group, "orv-slapdTlsKeyFile", tls.key_file, error) ||
      !read_path(group, "orv-slapdTlsCaFile", tls.ca_file, error) ||
      !read_path(group, "orv-slapdTlsCrlFile", tls.crl_file, error) ||
      !read_word(group, "orv-slapdTlsMinimumVersion", kTlsVersions, version, error) ||
      !read_word(group, "orv-slapdTlsClientCertificate", kClientCertificates, clients, error))
    return false;
  tls.tls_1_2 = version == 0;
  tls.client_certificates = static_cast<ClientCertificates>(clients);
  read_flag(group, "orv-slapdTlsForPasswords", settings.tls_for_passwords);
  read_flag(group, "orv-slapdTlsForLocalPasswords", settings.tls_for_local_passwords);
  return true;
}

bool is_good(const char* name, const std::string& value, std::string& error) {
  const std::string problem = value_problem(name, value);
  if (!problem.empty()) error = std::string(name) + " " + problem;
  return problem.empty();
}

// Mechanisms and keytab decide whom the server believes, the realm only what clients are asked.
bool read_sasl(_CFG* session, SaslSettings& sasl, std::string& error) {
  const FileEntry group(session, kGroup);
  sasl.mechanisms = group.values(kSaslMechanismSetting);
  for (std::string& name : sasl.mechanisms) {
    if (!is_good(kSaslMechanismSetting, name, error)) return false;
    for (char& c : name)
      if (c >= 'a' && c <= 'z') c = static_cast<char>(c - 'a' + 'A');
  }
  const std::optional<std::string> realm = FileEntry(session, kDigestEntry).first(kDigestRealm);
  if (realm && !is_good(kDigestRealm, *realm, error)) return false;
  sasl.digest_realm = realm.value_or("");
  return read_path(group, "orv-slapdKrbKeytab", sasl.keytab, error);
}

bool read_integers(const FileEntry& top, Settings& settings, std::string& error) {
  for (const SettingRow& row : setting_rows()) {
    const std::optional<std::string> value = top.first(std::string(row.name).c_str());
    if (value && !apply_setting(row, *value, settings, error)) return false;
  }
  return true;
}

}  // namespace

std::span<const SettingRow> setting_rows() noexcept {
  return kRows;
}

std::string value_problem(std::string_view name, std::string_view value) {
  const auto none_of = [value](std::span<const std::string_view> words) {
    std::string problem = "is none of";
    for (const std::string_view word : words) {
      if (cfg::equals_ignore_ascii_case(word, value)) return std::string();
      problem.append(" ").append(word);
    }
    return problem;
  };
  if (name == "orv-slapdLogLevel") return none_of(kLogLevels);
  if (name == "orv-slapdTlsClientCertificate") return none_of(kClientCertificates);
  if (name == "orv-slapdTlsMinimumVersion") return none_of(kTlsVersions);
  if (name == kSaslMechanismSetting) return none_of(kSaslMechanisms);
  if (name == kAllowedMethods) return password_method_problem(value);
  if (name == kDigestRealm && !is_digest_realm(value))
    return "is not 1 to 255 characters of ASCII without quotes and backslashes";
  CertificateMapping mapping;
  if (name == kCertificateMap && !parse_certificate_mapping(value, mapping))
    return "is not SUBJECT => NAME, two DNs";
  return "";
}

bool apply_tls_file(std::string_view name, std::string_view value, TlsSettings& tls) {
  if (name == "orv-slapdTlsCertificateFile") {
    tls.certificate_file = value;
  } else if (name == "orv-slapdTlsKeyFile") {
    tls.key_file = value;
  } else if (name == "orv-slapdTlsCaFile") {
    tls.ca_file = value;
  } else if (name == "orv-slapdTlsCrlFile") {
    tls.crl_file = value;
  } else if (name == "orv-slapdTlsClientCertificate") {
    std::size_t word = 0;
    while (word < std::size(kClientCertificates) &&
           !cfg::equals_ignore_ascii_case(kClientCertificates[word], value))
      ++word;
    tls.client_certificates = static_cast<ClientCertificates>(
        word < std::size(kClientCertificates) ? word : std::size_t{0});
  } else {
    return false;
  }
  return true;
}

bool apply_setting(const SettingRow& row, std::string_view value, Settings& settings,
                   std::string& error) {
  std::int64_t number = 0;
  const auto [end, status] = std::from_chars(value.data(), value.data() + value.size(), number);
  if (status == std::errc() && end == value.data() + value.size() && number >= row.minimum &&
      number <= row.maximum) {
    settings.*row.member = number;
    return true;
  }
  error = std::string(row.name) + " must be an integer from " + std::to_string(row.minimum) +
          " to " + std::to_string(row.maximum);
  return false;
}

bool can_open(const std::string& config_file, const std::string& key_stash_file,
              std::string& cause) {
  return open_session(config_file, key_stash_file, cause) != nullptr;
}

int renew_password_policy(const std::string& config_file, const std::string& key_stash_file,
                          std::string& error) {
  const CfgSession session = open_session(config_file, key_stash_file, error);
  return session ? load_admin_password_policy(session.get()) : result::operations_error;
}

bool read_policy_settings(const std::string& config_file, const std::string& key_stash_file,
                          AdminPolicySettings& settings) {
  std::string error;
  const CfgSession session = open_session(config_file, key_stash_file, error);
  if (!session) return false;
  const FileEntry entry(session.get(), std::string(kAdminPolicyEntry).c_str());
  if (entry.code() != result::success) return entry.code() == result::no_such_object;
  for (const std::string_view type : admin_policy_types())
    if (std::optional<std::string> value = entry.first(std::string(type).c_str()))
      settings.insert_or_assign(std::string(type), std::move(*value));
  return true;
}

int renew_administrators(const std::string& config_file, const std::string& key_stash_file,
                         std::string& error) {
  const CfgSession session = open_session(config_file, key_stash_file, error);
  return session ? load_administrators(session.get()) : result::operations_error;
}

int renew_password_methods(const std::string& config_file, const std::string& key_stash_file,
                           std::string& error) {
  const CfgSession session = open_session(config_file, key_stash_file, error);
  return session ? load_password_methods(session.get()) : result::operations_error;
}

bool read_settings(const std::string& config_file, const std::string& key_stash_file,
                   Settings& settings, std::string& error) {
  const CfgSession session = open_session(config_file, key_stash_file, error);
  if (!session) return false;
  const FileEntry top(session.get(), kConfiguration);
  if (top.code() != result::success) {
    error = config_file + ": has no entry " + kConfiguration;
    return false;
  }
  Settings read;
  read.addresses = top.values(kAddresses);
  if (read_integers(top, read, error) && read_path(top, kLocalSocket, read.local_socket, error) &&
      read_tls(session.get(), read, error) && read_sasl(session.get(), read.sasl, error) &&
      read_log(session.get(), kErrorLogEntry, read.error_log, read.error_log_level, error) &&
      read_log(session.get(), kAccessLogEntry, read.access_log, read.access_log_level, error) &&
      read_audit_log(session.get(), read.audit_log, error)) {
    settings = std::move(read);
    return true;
  }
  error = config_file + ": " + error;
  return false;
}

std::vector<std::string> restart_settings() {
  std::vector<std::string> names;
  for (const SettingRow& row : setting_rows())
    if (row.needs_restart) names.emplace_back(row.name);
  names.emplace_back(kAddresses);
  names.emplace_back(kLocalSocket);
  return names;
}

std::vector<std::string_view> restart_needed(const Settings& running, const Settings& wanted) {
  std::vector<std::string_view> names;
  for (const SettingRow& row : setting_rows())
    if (row.needs_restart && running.*row.member != wanted.*row.member) names.push_back(row.name);
  if (running.addresses != wanted.addresses) names.push_back(kAddresses);
  if (running.local_socket != wanted.local_socket) names.push_back(kLocalSocket);
  return names;
}

}  // namespace orv::server
