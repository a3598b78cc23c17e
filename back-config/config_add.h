// Who the administrators are, and what an entry must be to be added.
//
// All functions are called inside an operation; those that read the configuration file use its
// session and take no lock. DNs named "normalized" are in the normal form and are compared byte for
// byte. Results are 0 to go on, or the code that ends the operation; the client is told no reason
// by these functions, and the trace or the server log has it where a rule gives one.
#pragma once

#include "slapi/connection.h"

namespace orv {

// ---- Identities under which administrators bind, read straight from the configuration file. The
// texts are UTF-8 and released with free; null when the identity cannot be read, for whatever
// reason. The trace tells it for the three of the primary administrator.

// Bind DN of the primary administrator, normalised. Null also when the file names two.
char* getAdminDN(_CFG* session);

// Kerberos identity of the primary administrator, a DN in the light form of
// `dn_normalize_light_esc`; the first value if there are several.
char* getAdminKerberosID(_CFG* session);

// Digest-MD5 user name of the primary administrator, as stored; the first value if there are
// several.
char* getAdminDigestUserName(_CFG* session);

// Bind DN of the member of the administrative group whose entry is `target_dn`, normalised; the
// first value if there are several. Uses the session in the connection's slot.
char* getAdminGroupMemberDn(Connection* connection, const char* target_dn);

// ---- Whether an identity (UTF-8) is already in the configuration file. Every stored one counts,
// also that of an entry that is just being changed.
//   0 it is free (also when nothing in the file could hold it); 68 it is taken
//   80 a null candidate; 90 no memory, or an entry of the file cannot be taken or has no DN; 1 its
//   attributes or values cannot be read; or the code of whatever else failed (search, code page,
//   normalisation)

// A bind DN, among those of the primary administrator and of the members of the group. 80 also when
// the administrator's cannot be read.
int doesAdminGroupMemberDNExist(_CFG* session, const char* candidate);
// A bind DN, among those of the (first) replication entry and of all suppliers.
int doesReplicationSupplierDNExist(_CFG* session, const char* candidate);
// A Kerberos identity, among those of the primary administrator and of the members. What follows
// the first "=" counts, in any letter case.
int doesKerberosIDExist(_CFG* session, const char* candidate);
// A Digest-MD5 user name, among the same, byte for byte.
int doesDigestUserNameExist(_CFG* session, const char* candidate);
// The name of a proxy split, byte for byte.
int doesProxySplitNameExist(_CFG* session, const char* candidate);

// ---- Rules of an entry that is to be added. None changes the entry. Each decides by itself
// whether the entry is its concern and gives 0 when it is not; 80 for a null argument; what the
// functions above return is passed on. Of attributes only the first value counts.

// The administrative group and its members: 50 the caller may not; 65 a class or the bind DN is
// missing; 80 not a Kerberos identity. And three entries of log management: 50.
int checkIfAdminGroupEntry(const char* normalized_dn, entry* e, Connection* connection,
                           Operation* operation);
// Any entry with a bind DN of a supplier, which must be no administrator's. An entry that has both
// classes, the replication entry's and a supplier's, is let pass, and so is one without an object
// class attribute.
int checkIfReplSupplierEntry(const char* normalized_dn, entry* e, Connection* connection);
// The Kerberos identity of the primary administrator: 50, 65, or 80 for anything else.
int checkIfKerberosEntry(const char* normalized_dn, entry* e, Connection* connection,
                         Operation* operation);
// The Digest-MD5 user name of the primary administrator, which is optional: 50, 65.
int checkIfDigestEntry(const char* normalized_dn, entry* e, Connection* connection,
                       Operation* operation);
// Any entry with the name of a proxy split: 21 not alphanumeric; 68, which is also told in the
// server log. Only the entry may be null.
int checkIfProxySplitContainer(entry* e, Connection* connection);
// The password of a member or of a supplier, under the policy that the caller has found to be on:
// the code of the policy; 90.
int checkAdminPolicyEntry(const char* normalized_dn, entry* e, Connection* connection,
                          Operation* operation);

// ---- Roles

// Settles the roles of a member that is to be added: none becomes the default roles, and "NoAdmin"
// becomes the only one when it is among them. 0, also for every other entry; 21 a value is no role
// (the entry is unchanged); 50 the caller may not add to the group; 80 a null argument; 90, and
// whatever `attr_merge` returns.
int processRolesIfAdminGroupEntry(const char* normalized_dn, entry* e, Operation* operation);

// ---- Pass-through authentication

// An entry that is to be added below the container of pass-through authentication. 0, also for
// every other entry; 50 the caller may not; 53 it is not directly below the container; 65 a class
// is missing; 80 a null argument (the operation must not be null); and what the next one returns.
// The role bit 0x20 lets add whatever the authority flags are. An entry whose parent cannot be told
// gives 0 before its classes and settings are looked at.
int checkIfPassthruSubtreeEntry(entry* e, Connection* connection, Backend* backend,
                                Operation* operation);

// The settings of a pass-through entry, as it is to be in the file. 0, also for every entry whose
// DN does not contain that of the container; 21 its URL is none; 19 one of its subtrees overlaps
// another of them, a suffix of the server's own, or a subtree of another entry of the file (the
// server log tells which); 1 a value cannot be converted or read; 90; or the code of the search or
// of the attribute mapping. Entry and connection must not be null.
//
// On a server in safe mode or of kind 1 the first call in a process for an entry below the
// container also looks at all such entries of the file. What it finds is told in the server log and
// changes no result.
int verifyPassthroughServerEntry(const char* normalized_dn, entry* e, Connection* connection);

// ---- Adding

// Whether the role bits of a member of the administrative group let it add or delete the entry
// `dn`, where `supplier` tells whether the entry is of class "orv-slapdSupplier". DNs are compared
// without regard to case.
bool roles_cover(unsigned roles, const char* dn, bool supplier);

// Whether the caller may add the entry: 0 or 50. The connection is not used.
int check_add_authority(const Connection* connection, const Operation* operation, const entry* e);

// 0 the file has no such entry; 68 it has; or the code of the search.
int checkIfExists(const char* normalized_dn, Connection* connection);

// 0 the entry's parent is in the file, or it has none; 32 the parent is missing; or the code of the
// search.
int checkForParent(const char* normalized_dn, Connection* connection, Backend* backend);

// 92 for an entry that is a replication context, else 0.
int checkForRep(entry* e);

// Makes a list of attributes with their values in the local code page, in the same order, for
// `cleanup_attrs`. Names are shared with `source`; lengths of values count the NUL.
// The result is that of the **last** value: one that failed before it is passed on as it is (null).
// 90, with no list, when there is no memory for an array of values, a value, or the text of the
// last value. Without memory for an attribute the list ends before it and the result is that of the
// last value before.
int xlate_attrs(attr* source, attr** result);

// Releases such a list and makes it empty; a null argument is a no-op. Returns 0.
int cleanup_attrs(attr** list);

}  // namespace orv
