// Entries, attributes and filters of the configuration that more than one source file looks at.
// DNs stand in the normal form, so that they can be compared byte for byte.
#pragma once

namespace orv::config_names {

inline constexpr const char* configuration_dn = "CN=CONFIGURATION";
inline constexpr const char* admin_group_dn = "CN=ADMINGROUP,CN=CONFIGURATION";
inline constexpr const char* kerberos_dn = "CN=KERBEROS,CN=CONFIGURATION";
inline constexpr const char* digest_dn = "CN=DIGEST,CN=CONFIGURATION";
inline constexpr const char* directory_backend_dn =
    "CN=DIRECTORY,CN=RDBM BACKENDS,CN=ORV DIRECTORY,CN=SCHEMAS,CN=CONFIGURATION";

inline constexpr const char* admin_dn = "orv-slapdAdminDN";
inline constexpr const char* admin_password = "orv-slapdAdminPW";
inline constexpr const char* admin_group_enabled = "orv-slapdAdminGroupEnabled";
inline constexpr const char* kerberos_admin_dn = "orv-slapdKrbAdminDN";
inline constexpr const char* digest_admin_user = "orv-slapdDigestAdminUser";

// Every entry. Which function uses which spelling is settled; the library takes both.
inline constexpr const char* any_entry = "objectclass=*";
inline constexpr const char* any_entry_in_parentheses = "(objectclass=*)";

}  // namespace orv::config_names
