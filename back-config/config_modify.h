// What a modification must leave of an entry, and of what the server relies on.
//
// All functions are called inside an operation, under its session, and take no lock. DNs named
// "normalized" are in the normal form. Lists of modifications are the server's: linked through
// `mod_next`, with the flag kModBvalues masked off wherever a code is looked at. Of several values
// only the first counts, unless a function says otherwise. Results are 0 to go on, or the code that
// ends the operation; the client is told no reason but those texts that a function hands out
// (malloc family, released by the caller), and the trace or the server log has it where a rule
// gives one.
#pragma once

#include "slapi/connection.h"

namespace orv {

// ---- The modification list for the file, and the entry as it would be

// Appends one value to the null-terminated list at `*list` (null for an empty one), for
// `ldap_mods_free(list, 1)`: to the first record of that type (in any letter case) and that code,
// or to a new one. `value` is UTF-8, or null for a record without values. 0, 90, or the code of the
// code page; what was stored before a failure stays in the list.
int addmodifyop(ldapmod*** list, int operation, const char* type, const char* value);

// Applies the modifications to `e`, in their order. The result is that of the last one that was
// looked at: a delete, a replace or an unknown code overwrites the failure of one before it. 80 an
// unknown code; 1 where `attr_delete` or `attr_merge` gives -1; or what the server's functions
// give.
int mod_entry(entry* e, ldapmod** modifications);

// Whether the entry `dn` may be what the modifications would make of it: schema, referral,
// replication context, addresses, pass-through. Works on a copy; nothing is written. `*text` is
// null, or what the client is to be told. 0; 32 no such entry; 80 it cannot be taken, or a
// modification has an unknown code; 90; or the code of what refuses.
int mod_schema_check(Connection* connection, const char* dn, ldapmod** modifications, char** text);

// ---- Addresses on which the server listens

// Whether the host has every address of the top entry `e` (others pass): 0, or 19 for the first one
// that it lacks, with what the client is to be told in `*text`, or null without memory. `*text` is
// left alone otherwise.
int checkIPaddrs(entry* e, char** text);

// What is told about an address, for free; null without memory. `kind` is 19 (not one of the
// host's) or 21 (not an address); null for any other. **Each text costs memory for good**: a copy
// of the address stays behind. Lengths are bounded by the schema, and callers by the server.
char* gen_checkIPaddrs_err(int kind, const berval* value);

// ---- Identities: each gives 80 for a null argument, and what the functions of config_add.h return
// that look for the identity

// What a member of the administrative group may change at all: 0 or 50; 80 its bind DN cannot be
// told. The audit log's entry asks for the role bits of the connection. `bound_dn` is the caller's,
// normalised.
int checkIfAdminGroupCanModify(Connection* connection, const char* normalized_dn,
                               const char* bound_dn, ldapmod* modifications);

// What the primary administrator makes of administrators, in the top entry and in the group: bind
// DN, roles, Kerberos identity, Digest-MD5 user, in this order. Rewrites the list where its values
// delete as many roles as the member has and it adds: the first delete in it, whatever it deletes,
// then stores "NoAdmin". A refusal of a later identity leaves it rewritten.
//   16  the member has no roles, or not the last one that is deleted
//   32  no such entry
//   80  a value is no role or no Kerberos identity, or the roles cannot be read
//   90  no memory; the list is as it was where the roles are concerned
int checkRootAdminModify(_CFG* session, const char* normalized_dn, ldapmod* modifications);

// The identities of the primary administrator in their own entries: 50 for everybody else, also to
// delete them; 80 not a Kerberos identity, or no value. A delete is not looked at any further. Only
// the first modification of the type counts, whatever its code, so that a delete in front hides an
// add behind it; the server hands over only lists on which this makes no difference
// (docs/guards.md).
int checkKerberosModify(Operation* operation, _CFG* session, const char* normalized_dn,
                        ldapmod* modifications);
int checkDigestModify(Operation* operation, _CFG* session, const char* normalized_dn,
                      ldapmod* modifications);

// The bind DN of a supplier, in whichever entry: it must be no administrator's; 80 without a value.
// 50 for a member of the group without a replication bit who changes the master server's entry
// (flags and bits of the connection).
int checkReplSupplierModify(Connection* connection, _CFG* session, const char* normalized_dn,
                            ldapmod* modifications);

// The name of a proxy split: 21 not alphanumeric; 68, which is also told in the server log. Only
// the first modification of the type counts, as above. The DN is not used, but must not be null.
int checkProxyNameModify(_CFG* session, const char* normalized_dn, ldapmod* modifications);

// Whether some modification is of that type, in any letter case: 1 or 0. And the first of them, or
// null.
int doesModAttributeExists(const char* type, ldapmod* modifications);
ldapmod* getModAttribute(const char* type, ldapmod* modifications);

// ---- The audit log's file

// The canonical form of a path, or the path itself where no such file exists yet. A buffer for
// free; null for a null or unresolvable path, and without memory.
char* resolve_path(const char* path);

// The audit log's file as the configuration file names it, for free; null when it does not, or when
// that cannot be told.
char* get_audit_log_filename(_CFG* session);

// No other log setting than that of the audit log itself names its file: 0; 53 one does; 80 a null
// DN or list, or the audit log's own path cannot be resolved; 90. Looks at the first value of every
// modification of "orv-slapdLog" that adds or replaces.
int checkAuditLog(_CFG* session, const char* normalized_dn, ldapmod* modifications);

// ---- Passwords of administrators

// A change of the password policy's entry: what `validate_new_settings` says of the policy with the
// modifications in it, whatever their codes. A modification without a value changes nothing.
int checkAdminPolicyEntryModify(ldapmod* modifications);

// A new password of an administrator, or of a supplier, under the policy that the caller has found
// to be on; of both in one list only the administrator's is looked at. 0, also when none is set; 1
// a null argument (the operation may be null); 32 no such entry, or none with such a password; 90;
// the session's error number; the code of the policy. After an accepted password the
// administrator's record is marked as changed.
int checkAdminPolicyModify(Operation* operation, _CFG* session, const char* normalized_dn,
                           ldapmod* modifications);

// A new method of storing passwords, which is also handed to the directory backend. 0, also for
// everything on a server in safe mode; 80 a null argument; 53 the configuration does not allow the
// method, 21 there is none of that name, both with `*text`; or what the directory backend answers.
// `*text` is stored to on a refusal only: without memory null, whatever stood there.
int checkPwEncryptionModify(Operation* operation, _CFG* session, const char* normalized_dn,
                            ldapmod* modifications, char** text);

}  // namespace orv
