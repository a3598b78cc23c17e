// Services of the server that guard identities, passwords, addresses and back ends. Declared for
// those who write against this interface; a program that calls them does not link yet.
//
// None of them enters a backend, waits for the server's admission of operations, or blocks: they
// are called from inside handlers.
#pragma once

#include <cstddef>

#include "slapi/pblock.h"

namespace orv {

// Non-zero when `dn` is the master server identity of `suffix`, or of the whole server when suffix
// is null.
int checkMasterSrvDn(const char* suffix, const char* dn);

// The administrator password policy, handed around by value.
struct _Admin_pwdPolicy {  // NOLINT(bugprone-reserved-identifier) the name is part of the interface
  char enabled;
  char pwdLockout;
  int pwdLockoutDuration;  // seconds
  int pwdMaxFailure;
  int pwdFailureCountInterval;  // seconds
  int pwdMinLength;
  int passwordMinAlphaChars;
  int passwordMinOtherChars;
  int passwordMaxRepeatedChars;
  int passwordMinDiffChars;
  int reserved[2];
};

bool pwdIsAdminPolicyOn();
bool pwdIsAdminPasswordLockoutOn();
_Admin_pwdPolicy getGlobalAdminPWDPolicyLocal();
// 0 acceptable, 19 the limits are out of range or contradict one another.
int validate_new_settings(_Admin_pwdPolicy policy, bool check_all);
// 0 the new password complies, 19 it does not (the reason goes to the error log). `old_password`
// may be null, a clear text or a stored hash.
int verify_admin_password(char* new_password, char* old_password, Operation* operation);

// The server's record of an administrator's failures; lives as long as the process.
struct AdminPasswordRecord {
  int changed;  // set to 1 after an accepted change of the password
};
// Null for a null DN or one without a record.
AdminPasswordRecord* findAdminPWDPAttrib(const char* dn);

// Opens a sealed value with the key of a session handle: 1 and a malloced clear text; 0 for a clear
// or hashed value; -1 when it is broken or the key is missing (`*clear` null).
int unformat_password(const char* stored, char** clear, const void* key, int reserved);

// Finds a password method by name: 0, with `*method` untouched for an unknown name; 1 when the
// configuration forbids it. No method has the number 16.
int convertPWEncryptionMethod(const char* name, int* method);

// Whether a literal address is one of the host's.
bool isValidIPAddressOnSystem(const char* address);

// Whether an attribute mapping of pass-through authentication is well formed: 0 or 21.
int verifyAttributeMapping(const char* mapping, void* reserved1, void* reserved2);

// The backend that serves a DN, or null.
Backend* select_backend_opt(const char* dn);

// A function that a backend offers to others under a number; -159 checks and stages a new password
// method: `text` receives a malloced reason for a refusal.
using PluginFunction = int (*)(Backend* backend, int method, char** text);
// The functions registered under `number`, null-terminated, owned by the server. 0 or non-zero.
int getAllPluginFuncs(Backend* backend, int number, PluginFunction** list);

// LDAP URLs (RFC 4516).
struct LDAPURLDesc {
  char* scheme;
  char* host;
  int port;
  char* dn;
};
int ldap_url_parse(const char* url, LDAPURLDesc** description);  // 0, else not a URL
void ldap_free_urldesc(LDAPURLDesc* description);

}  // namespace orv
