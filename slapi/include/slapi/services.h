// Services of the server that guard identities, passwords, addresses and back ends.
//
// None of them enters a backend, waits for the server's admission of operations, or blocks: they
// are called from inside handlers. None throws; all are thread-safe.
#pragma once

#include <cstddef>

#include "slapi/pblock.h"

namespace orv {

// ---- The password policy of administrators: the entry CN=PWDPOLICY ADMIN,CN=CONFIGURATION.
//
// The policy in force is a copy in memory. Whoever reads the configuration file for the server
// renews it with `load_admin_password_policy`: at the start, when the server is told to read its
// settings again, and after a change of the tree. Until the first good reading the strict policy of
// the default configuration is in force, afterwards the last good one: neither a damaged entry nor
// one that was taken out opens anything.

// Handed around by value.
struct _Admin_pwdPolicy {  // NOLINT(bugprone-reserved-identifier) the name is part of the interface
  char enabled;
  char pwdLockout;
  int pwdLockoutDuration;  // seconds; 0: until the password is set anew
  int pwdMaxFailure;
  int pwdFailureCountInterval;  // seconds; 0: until the next success
  int pwdMinLength;             // characters
  int passwordMinAlphaChars;
  int passwordMinOtherChars;
  int passwordMaxRepeatedChars;  // occurrences of one character; 0: no limit
  int passwordMinDiffChars;      // different characters that the old password does not have
  int reserved[2];
};

// Whether new passwords of administrators must comply, and, apart from that, whether failed binds
// lock an administrator out.
bool pwdIsAdminPolicyOn();
bool pwdIsAdminPasswordLockoutOn();
_Admin_pwdPolicy getGlobalAdminPWDPolicyLocal();

// 0 acceptable; 19 the limits are out of range (0 to 1,000,000, lengths to 256) or contradict one
// another: more letters and others than characters, more new characters than characters, a lockout
// without a number of failures. `check_all` is passed as true; false looks at the ranges only.
int validate_new_settings(_Admin_pwdPolicy policy, bool check_all);

// Puts a policy in force. 0; 19, with the policy before still in force.
int set_admin_password_policy(const _Admin_pwdPolicy& policy) noexcept;

// Reads the policy entry with a bound session and puts it in force; settings that it lacks have the
// strict policy's values. 0; 32 no such entry; 19 limits that `validate_new_settings` refuses; 21 a
// value that is no number or boolean; 90; else the session's code. After anything but 0 the policy
// before is still in force, and message 8 of set 10 tells why.
int load_admin_password_policy(_CFG* session) noexcept;

// Whether a password that is to be set complies with the policy in force, on or off. `new_password`
// is the clear text. `old_password` may be null, a clear text or a stored hash; of a hash only
// whether the new password is the same can be told. 0; 19 it does not comply (the reason goes to
// the server log as a message of set 10, never the password); 90; 80 a null password.
int verify_admin_password(char* new_password, char* old_password, Operation* operation);

// ---- Pass-through authentication

// Whether an attribute mapping is well formed: 0; 21, also for null. The grammar, with blanks
// allowed around "=" and ",":
//   mapping = pair *( "," pair )        ; at most 16 pairs, 1024 bytes
//   pair    = local "=" remote          ; attribute types: names or numeric OIDs of RFC 4512, 1.4
// The local types are those of this server's schema, none twice; passwords are not mapped.
// The other two arguments are reserved and null.
int verifyAttributeMapping(const char* mapping, void* reserved1, void* reserved2);

// LDAP URLs (RFC 4516), as the LDAP client library reads them: also "ldaps" and "ldapi", a URL in
// angle brackets, without a host ("") or with a port of 0 where none is given for a local socket.
// Whoever connects checks host and port.
struct LDAPURLDesc {
  char* scheme;
  char* host;
  int port;
  char* dn;
};
// 0, with a description for `ldap_free_urldesc`; else, with null: not a URL, or no memory.
int ldap_url_parse(const char* url, LDAPURLDesc** description);
void ldap_free_urldesc(LDAPURLDesc* description);  // null is a no-op

// ---- Identities: what they are read from, and by whom, see slapi/administrators.h

// Non-zero when `dn` is the master server identity of `suffix`, or of the whole server when suffix
// is null. The whole server's is named by CN=MASTER SERVER,CN=CONFIGURATION; a suffix's by an entry
// of class orv-slapdSupplier that has the suffix, itself and not one above or below it, in
// orv-slapdMasterSuffix. Both arguments may be spelled in any way; what is no DN, and the empty DN,
// is nobody's. 0 without memory.
int checkMasterSrvDn(const char* suffix, const char* dn);

// The server's record of an administrator's or supplier's failures; lives as long as the process.
struct AdminPasswordRecord {
  // Set to 1 by a rule that accepted a new password. Read and cleared by the server between two
  // calls of handlers (`settle_password_changes`).
  int changed;
};
// The record of the identity with that name, spelled in any way, in the code page of the
// configuration file. Null for a null DN, for nobody's name, and without memory.
AdminPasswordRecord* findAdminPWDPAttrib(const char* dn);

// ---- Stored passwords: methods and their names, see slapi/password_method.h

// Opens a sealed value with the key of a session handle (`_CFG::key`): 1 and a malloced clear text,
// which its owner wipes; 0 for a clear or hashed value; -1 when it is broken, the key is another
// one or missing, a null argument, or no memory (`*clear` null).
int unformat_password(const char* stored, char** clear, const void* key, int reserved);

// Finds a password method by name, ignoring ASCII letter case: 0 with its number in `*method`; 0
// with `*method` untouched for an unknown name and for null; 1, untouched too, for a name that the
// configuration forbids. No method has the number 16.
int convertPWEncryptionMethod(const char* name, int* method);

// ---- Addresses

// Whether a literal address is one of the host's, on whatever interface, up or down. Read are the
// forms of inet_pton(3), at most 64 bytes: no names, no blanks, no brackets. An IPv4-mapped IPv6
// address is the IPv4 address. A link-local address carries a zone, the name or number of its
// interface ("fe80::1%eth0"); no other address may. Wildcards (0.0.0.0, ::) and null are false, and
// so is everything while the system does not tell its addresses.
bool isValidIPAddressOnSystem(const char* address);

// ---- Backends, as the server registered them (slapi/backends.h)

// The backend whose suffix is the DN or the nearest above it; null when there is none, for null and
// for what is no DN, and without memory.
Backend* select_backend_opt(const char* dn);

// A function that a backend offers to others under a number; -159 checks and stages a new password
// method: `text` receives a malloced reason for a refusal.
using PluginFunction = int (*)(Backend* backend, int method, char** text);
// The functions that a backend offers under `number`, in the order of registration: a
// null-terminated list of at least one, owned by the server for as long as the backend is
// registered. 0; 80 with a null list for an unknown backend and for none.
int getAllPluginFuncs(Backend* backend, int number, PluginFunction** list);

}  // namespace orv
