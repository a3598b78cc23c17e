// Entries, classes, attributes, filters and roles of the configuration that the backend knows by
// name.
// DNs stand in the normal form, so that they can be compared byte for byte.
#pragma once

namespace orv::config_names {

inline constexpr const char* configuration_dn = "CN=CONFIGURATION";
inline constexpr const char* admin_group_dn = "CN=ADMINGROUP,CN=CONFIGURATION";
inline constexpr const char* kerberos_dn = "CN=KERBEROS,CN=CONFIGURATION";
inline constexpr const char* digest_dn = "CN=DIGEST,CN=CONFIGURATION";
inline constexpr const char* default_log_dn = "CN=DEFAULT,CN=LOG MANAGEMENT,CN=CONFIGURATION";
inline constexpr const char* audit_log_dn = "CN=AUDIT,CN=LOG MANAGEMENT,CN=CONFIGURATION";
inline constexpr const char* admin_audit_log_dn =
    "CN=ADMIN AUDIT,CN=LOG MANAGEMENT,CN=CONFIGURATION";
inline constexpr const char* replication_dn = "CN=REPLICATION,CN=CONFIGURATION";
inline constexpr const char* master_server_dn = "CN=MASTER SERVER,CN=CONFIGURATION";
inline constexpr const char* passthrough_dn = "CN=PASSTHROUGH AUTHENTICATION,CN=CONFIGURATION";
inline constexpr const char* proxy_backend_dn =
    "CN=PROXYDB,CN=PROXY BACKENDS,CN=ORV DIRECTORY,CN=SCHEMAS,CN=CONFIGURATION";
inline constexpr const char* directory_backend_dn =
    "CN=DIRECTORY,CN=RDBM BACKENDS,CN=ORV DIRECTORY,CN=SCHEMAS,CN=CONFIGURATION";
inline constexpr const char* backends_dn = "CN=ORV DIRECTORY,CN=SCHEMAS,CN=CONFIGURATION";
inline constexpr const char* password_policy_dn = "CN=PWDPOLICY ADMIN,CN=CONFIGURATION";
// Not in the configuration: where the directory backend is found.
inline constexpr const char* localhost_dn = "CN=LOCALHOST";

inline constexpr const char* admin_dn = "orv-slapdAdminDN";
inline constexpr const char* admin_password = "orv-slapdAdminPW";
inline constexpr const char* admin_group_enabled = "orv-slapdAdminGroupEnabled";
inline constexpr const char* kerberos_admin_dn = "orv-slapdKrbAdminDN";
inline constexpr const char* admin_role = "orv-slapdAdminRole";
inline constexpr const char* digest_admin_user = "orv-slapdDigestAdminUser";
inline constexpr const char* master_dn = "orv-slapdMasterDN";
inline constexpr const char* master_password = "orv-slapdMasterPW";
inline constexpr const char* proxy_split_name = "orv-slapdProxySplitName";
inline constexpr const char* passthrough_url = "orv-slapdPtaURL";
inline constexpr const char* passthrough_subtree = "orv-slapdPtaSubtree";
inline constexpr const char* passthrough_mapping = "orv-slapdPtaAttrMapping";
inline constexpr const char* suffix = "orv-slapdSuffix";
inline constexpr const char* ip_address = "orv-slapdIpAddress";
inline constexpr const char* log_file = "orv-slapdLog";
inline constexpr const char* password_encryption = "orv-slapdPwEncryption";

// What a Kerberos identity of an administrator begins with, in any letter case.
inline constexpr const char* kerberos_prefix = "orv-kerberosName=";
inline constexpr const char* short_kerberos_prefix = "orv-kn=";

inline constexpr const char* top_class = "top";
inline constexpr const char* top_entry_class = "orv-slapdTop";
inline constexpr const char* container_class = "container";
inline constexpr const char* config_entry_class = "orv-slapdConfigEntry";
inline constexpr const char* admin_group_member_class = "orv-slapdAdminGroupMember";
inline constexpr const char* kerberos_class = "orv-slapdKerberos";
inline constexpr const char* digest_class = "orv-slapdDigest";
inline constexpr const char* replication_class = "orv-slapdReplication";
inline constexpr const char* supplier_class = "orv-slapdSupplier";
inline constexpr const char* passthrough_class = "orv-slapdPta";
inline constexpr const char* replication_context_class = "orv-replicationContext";

// Every entry. Which function uses which spelling is settled; the library takes both.
inline constexpr const char* any_entry = "objectclass=*";
inline constexpr const char* any_entry_in_parentheses = "(objectclass=*)";
inline constexpr const char* replication_entries = "objectclass=orv-slapdReplication";
inline constexpr const char* supplier_entries = "objectclass=orv-slapdSupplier";
inline constexpr const char* passthrough_entries = "objectclass=orv-slapdPta";
inline constexpr const char* audit_log_entries = "(objectclass=orv-auditConfig)";

}  // namespace orv::config_names

namespace orv {

// The role that excludes every other.
inline constexpr const char* kNoAdminRole = "NoAdmin";

// Every administrative role, in the order in which a value is held against them. None is shorter
// than "NoAdmin", which may be written over any of them.
inline constexpr const char* kAdminRoles[] = {"AuditAdmin",           "DirDataAdmin",
                                              kNoAdminRole,           "ReplicationAdmin",
                                              "SchemaAdmin",          "ServerConfigGroupMember",
                                              "ServerStartStopAdmin", "PasswordAdmin"};

// The roles of a member that is added without any. Without inline on purpose: each source file has
// a copy of its own.
constexpr const char* DEFAULT_ADMIN_ROLES[] = {"DirDataAdmin",         "PasswordAdmin",
                                               "SchemaAdmin",          "ServerConfigGroupMember",
                                               "ServerStartStopAdmin", nullptr};

}  // namespace orv
