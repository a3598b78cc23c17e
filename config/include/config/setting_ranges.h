// What the values of settings may be: for the server that reads them and for the tools that examine
// a file before a server does.
#pragma once

#include <cstdint>
#include <limits>
#include <string_view>

namespace orv {

struct SettingRange {
  std::string_view name;  // canonical name of an attribute of INTEGER syntax
  std::int64_t minimum;
  std::int64_t maximum;
};

namespace setting_bounds {
inline constexpr std::int64_t seconds = 86400;
inline constexpr std::int64_t count = 1000000;
inline constexpr std::int64_t bytes = 1 << 30;
// Of the password policy: what validate_new_settings (slapi/services.h) accepts.
inline constexpr std::int64_t policy_number = 1000000;
inline constexpr std::int64_t policy_length = 256;
inline constexpr std::int64_t any = std::numeric_limits<std::int32_t>::max();
}  // namespace setting_bounds

// All integer settings.
inline constexpr SettingRange kSettingRanges[] = {
    {"orv-slapdPort", 0, 65535},
    {"orv-slapdSizeLimit", 0, setting_bounds::any},
    {"orv-slapdTimeLimit", 0, setting_bounds::seconds},
    {"orv-slapdIdleTimeOut", 0, setting_bounds::seconds},
    {"orv-slapdMaxMessageSize", 1024, setting_bounds::bytes},
    {"orv-slapdMaxUnauthenticatedMessageSize", 1024, setting_bounds::bytes},
    {"orv-slapdMaxConnections", 1, setting_bounds::count},
    {"orv-slapdMaxConnectionsPerAddress", 1, setting_bounds::count},
    {"orv-slapdMaxPendingOperations", 1, setting_bounds::count},
    // The library that evaluates filters reads no deeper ones.
    {"orv-slapdMaxFilterDepth", 1, 64},
    {"orv-slapdMaxFilterItems", 1, setting_bounds::count},
    {"orv-slapdMaxControls", 1, setting_bounds::count},
    {"orv-slapdMaxAttributes", 1, setting_bounds::count},
    {"orv-slapdMaxValues", 1, setting_bounds::count},
    {"orv-slapdMaxResultSize", 1024, setting_bounds::bytes},
    {"orv-slapdOperationWait", 1, setting_bounds::seconds},
    {"orv-slapdWriteTimeOut", 1, setting_bounds::seconds},
    {"orv-slapdMinReadRate", 0, setting_bounds::bytes},
    {"orv-slapdMessageTimeOut", 1, setting_bounds::seconds},
    {"orv-slapdMaxPersistentSearches", 0, setting_bounds::count},
    {"orv-slapdMaxPersistentSearchesPerConnection", 1, setting_bounds::count},
    {"orv-slapdMaxPagedSearches", 0, setting_bounds::count},
    {"orv-slapdMaxPagedResultSize", 1024, setting_bounds::bytes},
    {"orv-slapdSecurePort", 0, 65535},
    {"orv-slapdMaxUnauthenticatedConnections", 1, setting_bounds::count},
    {"orv-slapdUnauthenticatedTimeOut", 0, setting_bounds::seconds},
    {"orv-slapdBindTimeOut", 1, setting_bounds::seconds},
    {"orv-slapdTlsHandshakeTimeOut", 1, setting_bounds::seconds},
    // A client must be able to fail now and then whatever it sends.
    {"orv-slapdMaxFailedChangeSize", 65536, setting_bounds::bytes / 4},
    {"orv-slapdMaxFailedChangeTotalSize", 65536, setting_bounds::bytes},
    {"pwdMinLength", 0, setting_bounds::policy_length},
    {"passwordMinAlphaChars", 0, setting_bounds::policy_length},
    {"passwordMinOtherChars", 0, setting_bounds::policy_length},
    {"passwordMaxRepeatedChars", 0, setting_bounds::policy_length},
    {"passwordMinDiffChars", 0, setting_bounds::policy_length},
    {"pwdMaxFailure", 0, setting_bounds::policy_number},
    {"pwdFailureCountInterval", 0, setting_bounds::policy_number},
    {"pwdLockoutDuration", 0, setting_bounds::policy_number},
};

// Values of orv-slapdTlsClientCertificate, in any letter case.
inline constexpr std::string_view kClientCertificates[] = {"none", "optional", "required"};

// Values of orv-slapdTlsMinimumVersion.
inline constexpr std::string_view kTlsVersions[] = {"1.2", "1.3"};

// Values of orv-slapdSaslMechanisms, in any letter case.
inline constexpr std::string_view kSaslMechanisms[] = {"EXTERNAL", "GSSAPI", "SCRAM-SHA-256",
                                                       "DIGEST-MD5", "none"};

// Whether a value of orv-slapdDigestRealm can be quoted in a challenge as it is.
constexpr bool is_digest_realm(std::string_view value) noexcept {
  for (const char c : value)
    if (c < ' ' || c > '~' || c == '"' || c == '\\') return false;
  return !value.empty() && value.size() <= 255;
}

// Settings whose values are absolute paths of files.
inline constexpr std::string_view kPathSettings[] = {
    "orv-slapdLog",        "orv-slapdLocalSocket", "orv-slapdTlsCertificateFile",
    "orv-slapdTlsKeyFile", "orv-slapdTlsCaFile",   "orv-slapdTlsCrlFile",
    "orv-slapdKrbKeytab",
};

// Values of orv-slapdLogLevel, in any letter case.
inline constexpr std::string_view kLogLevels[] = {"error", "warning", "info", "debug", "off"};

// Values of orv-slapdAdminRole, in any letter case.
inline constexpr std::string_view kAdminRoles[] = {
    "AuditAdmin",   "ReplicationAdmin", "SchemaAdmin",          "ServerConfigGroupMember",
    "DirDataAdmin", "PasswordAdmin",    "ServerStartStopAdmin", "NoAdmin",
};

}  // namespace orv
