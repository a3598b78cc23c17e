// The server's own settings, as CN=CONFIGURATION and the log entries below it hold them.
//
// A `Settings` is a value, read whole from the file with a session of its own and never changed
// afterwards; the threads share it as a pointer to const and are given a new one after a reload.
#pragma once

#include <cstdint>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "auth/sasl_settings.h"
#include "slapi/admin_policy.h"

namespace orv::server {

enum class ClientCertificates { none, optional, required };

// How TLS is spoken; on CN=ADMINGROUP,CN=CONFIGURATION, which the primary administrator alone may
// change: these settings decide whom the server believes, and what administrators take for it.
struct TlsSettings {
  std::string certificate_file;  // PEM, the server's own first; "": TLS is not offered
  std::string key_file;          // PEM; "": the key is in the certificate file
  std::string ca_file;           // PEM: who may sign clients' certificates
  ClientCertificates client_certificates = ClientCertificates::none;
  bool tls_1_2 = true;     // besides 1.3
  std::string crl_file{};  // PEM: what these have revoked; "": nothing is looked up
  bool operator==(const TlsSettings&) const = default;
};

struct Settings {
  std::int64_t port = 3389;                               // TCP; 0 lets the kernel choose
  std::int64_t size_limit = 0;                            // entries of one search, 0 no limit
  std::int64_t time_limit = 60;                           // seconds of one search, 0 no limit
  std::int64_t idle_timeout = 600;                        // seconds, 0 no limit
  std::int64_t max_message_size = 1048576;                // bytes
  std::int64_t max_unauthenticated_message_size = 65536;  // bytes, while nobody is bound
  std::int64_t max_connections = 4096;                    // in all
  std::int64_t max_connections_per_address = 1024;
  std::int64_t max_pending_operations = 64;  // outstanding on one connection
  std::int64_t max_filter_depth = 32;
  std::int64_t max_filter_items = 4096;
  std::int64_t max_controls = 32;             // in one message
  std::int64_t max_attributes = 1024;         // in one message
  std::int64_t max_values = 10000;            // in one message
  std::int64_t max_result_size = 67108864;    // bytes of one answer
  std::int64_t operation_wait = 30;           // seconds until an operation that waits gets 51
  std::int64_t write_timeout = 30;            // seconds without progress of a slow reader
  std::int64_t min_read_rate = 4096;          // bytes a second of a reader, 0 no limit
  std::int64_t message_timeout = 30;          // seconds to finish a message once begun
  std::int64_t max_persistent_searches = 64;  // in all, 0: there are none
  std::int64_t max_persistent_searches_per_connection = 8;
  std::int64_t max_paged_searches = 8;                   // of one connection, 0: there are none
  std::int64_t max_paged_result_size = 16777216;         // bytes that they keep
  std::int64_t max_failed_change_size = 16777216;        // bytes of one identity within a day
  std::int64_t max_failed_change_total_size = 67108864;  // the same of all but the primary one
  std::int64_t secure_port = 0;                          // of ldaps; 0: none
  std::int64_t max_unauthenticated_connections = 3072;   // on which nobody is bound
  std::int64_t unauthenticated_timeout = 300;            // seconds with nobody bound, 0 no limit
  std::int64_t bind_timeout = 30;       // seconds to finish a bind in several steps
  std::int64_t handshake_timeout = 10;  // seconds to finish a handshake of TLS
  std::vector<std::string> addresses;   // empty: every address
  std::string local_socket;             // path; empty: none

  TlsSettings tls;
  SaslSettings sasl;
  bool tls_for_passwords = true;         // binds with passwords need it
  bool tls_for_local_passwords = false;  // also from the same host

  std::string error_log;  // path; empty: standard error
  std::string error_log_level = "info";
  std::string access_log;  // path; empty: standard error
  std::string access_log_level = "off";
  std::string audit_log;  // path; empty: no changes are recorded
};

// One integer setting: attribute, bounds and the member that holds it. The member's initial value
// is the default.
struct SettingRow {
  std::string_view name;
  std::int64_t minimum;
  std::int64_t maximum;
  std::int64_t Settings::*member;
  bool needs_restart;  // a reload keeps the running value and says so
};

// All integer settings, in the order of the documentation.
std::span<const SettingRow> setting_rows() noexcept;

// Attribute of the methods of storing passwords that may be used.
inline constexpr std::string_view kAllowedMethods = "orv-slapdPwEncryptionAllowed";

// What is wrong with a value of a setting that is a word or a realm, or of a map of certificates;
// "" when nothing is, or the setting is another one. With such a word or realm the server would not
// start; of a map it would leave the value out, and warn; a list of methods with such a name in it
// (orv-slapdPwEncryptionAllowed) would not be put in force. The method itself is looked at by the
// rules.
std::string value_problem(std::string_view name, std::string_view value);

// Takes one value over. False, with the reason in `error`, when `value` is not an integer within
// the row's bounds.
bool apply_setting(const SettingRow& row, std::string_view value, Settings& settings,
                   std::string& error);

// Puts a value into what certificates are loaded by; "" where the setting is gone. False when it is
// none of those settings, and nothing is done.
bool apply_tls_file(std::string_view name, std::string_view value, TlsSettings& tls);

// Reads the file (opened with the key stash when one is named; "" for none). False when it cannot
// be read (`error` then names file, line, column and cause) or when a setting is out of its bounds.
bool read_settings(const std::string& config_file, const std::string& key_stash_file,
                   Settings& settings, std::string& error);

// Whether a session on the file can be opened; the cause (file, line, column, in words) when not.
bool can_open(const std::string& config_file, const std::string& key_stash_file,
              std::string& cause);

// The settings that are read when the server starts and not again, by attribute name.
std::vector<std::string> restart_settings();

// The settings that a reload cannot change while the server runs and in which the two differ, by
// attribute name.
std::vector<std::string_view> restart_needed(const Settings& running, const Settings& wanted);

// Puts the password policy of the configuration file in force. 0; 32 the file has no policy entry;
// 19 or 21 it cannot be taken over (told as a message); else the code of the session, with the
// cause in `error`. After anything but 0 the policy stays as it was.
int renew_password_policy(const std::string& config_file, const std::string& key_stash_file,
                          std::string& error);

// The same for what the library of the rules knows: who administers and supplies, with their
// failures (slapi/administrators.h), and how passwords are stored (slapi/password_method.h).
int renew_administrators(const std::string& config_file, const std::string& key_stash_file,
                         std::string& error);
int renew_password_methods(const std::string& config_file, const std::string& key_stash_file,
                           std::string& error);

// The settings of the policy entry as they stand in the file; none where it lacks the entry. False
// when it cannot be read.
bool read_policy_settings(const std::string& config_file, const std::string& key_stash_file,
                          AdminPolicySettings& settings);

}  // namespace orv::server
