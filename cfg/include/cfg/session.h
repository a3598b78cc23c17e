// Sessions on the configuration file: open, search, walk results, change.
//
// The interface mirrors the LDAP C API (RFC 1823) with the prefix cfg_, so that whoever knows one
// knows the other: a session handle instead of a connection, a file instead of a server.
//
// What a session sees: `cfg_bind_s` reads the file whole into private memory and checks that it is
// well formed; all searches of the session answer from that text, none of which is kept for others.
// Readers take no lock on the file, but a file that somebody is writing in place is waited for: up
// to a second in all, as long as he has it open and goes on writing. Somebody who opens it for
// writing while it is read may wait for the reader in turn. SIGURG, which is ignored by default,
// may be sent to the process then.
//
// Errors: functions return LDAP result codes; those that return a pointer give null and leave the
// code to `cfg_get_errno`, which always tells the outcome of the *last* call on the handle (0 after
// a success; reaching the end of entries or attributes is a success). Nothing throws.
//
// Memory: everything returned to the caller is from the malloc family, one block for each text and
// each array. All release functions accept null.
//
// Threads: a handle, and the results obtained through it, belong to one thread at a time. Different
// handles are independent.
#pragma once

#include <cstddef>

#include "cfg/ldapmod.h"

namespace orv {

// The session handle. The library derives its own state from it; the one public field is the key.
// NOLINTNEXTLINE(bugprone-reserved-identifier): the name is part of the interface
struct _CFG {
  // The key that opens sealed values, opaque; set when a key stash was given (option 1007) and
  // loaded by `cfg_bind_s`, null otherwise. Handed to `unformat_password`. Owned by the handle.
  const void* key = nullptr;
};

struct _CFGMessage;  // NOLINT(bugprone-reserved-identifier) a result chain, and each record in it
struct _CFGBer;      // NOLINT(bugprone-reserved-identifier) the cursor of an attribute walk

// Options of cfg_set_option and cfg_get_option.
enum CfgOption : int {
  kCfgOptDiagnostics = 1001,      // int: keep the details of a failed bind for cfg_dump_exception
  kCfgOptDiagnosticsFile = 1002,  // int: include the file's name and position in them
  kCfgOptConfigFile = 1005,       // text: path of the configuration file
  kCfgOptSaveFile = 1006,         // text: path that keeps the version before the last change
  kCfgOptKeyStashFile = 1007,     // text: path of the file with the key for sealed values
};

// Search scopes (RFC 4511, 4.5.1.2).
enum CfgScope : int { kScopeBase = 0, kScopeOneLevel = 1, kScopeSubtree = 2 };

// Makes a new, unbound handle. Both arguments are reserved and 0. Never null in this library: when
// memory is short it hands out a reserved handle whose bind returns 90. Callers nevertheless guard
// against null and against exceptions, since other implementations of this interface have both.
_CFG* cfg_init(const char* host, int port);

// Sets an option on an unbound handle; texts are copied. 0, 90 (no memory), 1 (unknown option or
// wrong type, or a null handle).
int cfg_set_option(_CFG* session, int option, const char* value);
int cfg_set_option(_CFG* session, int option, int value);

// Reads a text option back: a text borrowed from the handle, valid until `cfg_unbind`, never null
// ("" when unset). 0 or 1 (unknown option, null handle).
int cfg_get_option(_CFG* session, int option, const char** value);

// Opens the file named by option 1005, reads it and checks it: RFC 2849 content records, parents
// before children, no DN twice, no NUL bytes, secret attributes only under their own name. Then
// loads the key stash, when one is named (refused unless only its owner may read it); while that
// file stays the same, sessions share one key in memory.
// `who` and `credentials` are reserved and null; `flags` is passed as 128 and not examined.
// 0; 90 when memory is short; 1 in every other case, with file, line, column and cause in
// `cfg_dump_exception`. After a failure the handle still serves set and get option, dump and
// unbind; other calls return 1 and a null chain.
int cfg_bind_s(_CFG* session, const char* who, const char* credentials, int flags);

// Ends the session and releases the handle, with every chain that was never released. 0, also for
// null and for a handle that was never bound.
int cfg_unbind(_CFG* session);

// What went wrong in the last bind or change, in words: file, line, column and cause, never a value
// from the file. Borrowed, valid until the next call on the handle, never null.
const char* cfg_dump_exception(_CFG* session);

// Searches below `base` (a DN in the file's code page, in any spelling).
//   scope       0 the entry itself, 1 its direct children, 2 the whole subtree with the base first
//   filter      RFC 4515, with or without the outer parentheses; a bare attribute name is a
//               presence test; null means every entry. Comparison follows the attribute's matching
//               rule. An assertion on the value of a secret attribute is Undefined.
//   attributes  null-terminated list of names, null for all; "*" all, "1.1" none. An entry that
//               matches is returned even if it has none of them.
//   types_only  non-zero: value arrays come back empty, and not null
//   chain       receives the result chain, for `cfg_msgfree`; null on every non-zero return
// Entries come base first, then in the order of the file. A base that exists but does not match is
// a success with no entries. 0; 32 no such base; 34 `base` is not a DN; 2 a filter that cannot be
// read; 3 interrupted (cfg/interrupt.h); 1 session not bound; 90.
int cfg_search_s(_CFG* session, const char* base, int scope, const char* filter, char** attributes,
                 int types_only, _CFGMessage** chain);

// Number of entries in a chain; 0 for null.
int cfg_count_entries(_CFG* session, _CFGMessage* chain);

// The first record of a chain, the record after `entry`; null at the end or for null.
_CFGMessage* cfg_first_entry(_CFG* session, _CFGMessage* chain);
_CFGMessage* cfg_next_entry(_CFG* session, _CFGMessage* entry);

// The DN as it is spelled in the file; released with `cfg_memfree`. Null only without memory (90)
// or for a null entry.
char* cfg_get_dn(_CFG* session, _CFGMessage* entry);

// Walks the attribute names of an entry: each once, under its canonical name, in the order of first
// appearance. Names are released with `cfg_memfree`, the cursor with `cfg_ber_free`. `*cursor` is
// null when nothing was returned. For a null entry: null, with error number 1. A walk with a null
// cursor is at its end.
char* cfg_first_attribute(_CFG* session, _CFGMessage* entry, _CFGBer** cursor);
char* cfg_next_attribute(_CFG* session, _CFGMessage* entry, _CFGBer* cursor);

// All values of one attribute (name in any letter case) in the order of the file, decoded but
// otherwise as stored: sealed values stay sealed. A null-terminated array of texts that no longer
// depends on the chain; released with `cfg_value_free`, or each text and then the array with free.
// Null with error number 16 when the entry lacks the attribute. Empty for a types-only search.
char** cfg_get_values(_CFG* session, _CFGMessage* entry, const char* attribute);

void cfg_value_free(char** values);
void cfg_memfree(void* memory);
void cfg_ber_free(_CFGBer* cursor);

// Releases a chain and every record in it. Returns 0.
int cfg_msgfree(_CFGMessage* chain);

// Takes a record out of its chain, so that somebody else may release it with free; the chain stays
// good for `cfg_msgfree` and for walking. A record is one malloc block of its own.
void cfg_msg_unlink(_CFG* session, _CFGMessage* record);

// The outcome of the last call on the handle; 1 for a null handle.
int cfg_get_errno(_CFG* session);

// Writes "text: reason" for the handle's error number to the diagnostics stream
// (cfg/diagnostics.h). `text` may be null.
void cfg_perror(_CFG* session, const char* text);

// Changes.
//
// A change that returned 0 survives a power failure. At every instant the file is the old version
// or the new one, whole; after any other answer it is the old one. (Only when the disk fails in the
// last step, and again while the change is taken back, the answer is its failure and the new one
// may stay; the diagnostics stream tells.) Only the lines of the entry that is meant change: every
// other byte of the file stays as it was. The version before the change becomes the save file
// (option 1006), and permissions, access list, owner and group are kept.
//
// Writers exclude each other by an advisory lock on a file beside the configuration file (its name
// with ".lock" added, which stays there). A file that somebody edited or replaced since this
// session read it is left as it is, and the change answered with 51; the session then still shows
// what it read. After a change of its own, searches of the session see the new text; results
// obtained before still show the old one.
//
// Codes that all of them have, besides their own:
//   1   the session is not bound
//   11  the file would grow beyond 1 GiB
//   34  `dn` is not a DN
//   51  another writer holds the lock, or the file is not the one that was read
//   53  the file, its directory or its media may not be written, or its owner cannot be kept
//   80  an error of the file system: disk full, quota, input/output
//   90  no memory
// Why a change was refused with 11, 19, 21, 51, 53 or 80 is written to the diagnostics stream
// (cfg/diagnostics.h), without values; `cfg_dump_exception` tells it too.

// Adds the entry `dn`, whose spelling is kept, with the attributes of `mods`: a null-terminated
// list of records with the code add, strings or counted values; the order of records and values is
// the order in the file. The entry goes behind the last entry at or below its parent. Types that
// are known are written under their canonical names. Passwords are protected here (cfg/secret.h).
// 0; 68 the entry exists; 9 its parent does not; 2 no attributes, one without values, a record that
// is no add; 17 an attribute type that is not well formed (options are refused) or has a meaning of
// its own in the format; 11 more attributes or values than cfg/entry_limits.h lets an entry have;
// 19 a password that looks like a stored one; 20 a value given twice, by the type's equality rule;
// 21 a value with a null text, with a NUL byte, or an empty password; 64 a password attribute in
// the DN.
int cfg_add_s(_CFG* session, const char* dn, ldapmod** mods);

// Removes a leaf: its lines, comments between them, and one blank line that separated it. Comments
// above the entry stay, and so does the blank line then. 0; 9 the entry is missing; 66 it has
// children; 53 it is the only entry.
int cfg_delete_s(_CFG* session, const char* dn);

// Applies the records of a list in their order to one copy of the entry and writes that: all or
// nothing. Lines of values that stay are not touched; a new value stands behind the last one of its
// attribute, or at the end of the entry. Values are compared by the type's equality rule. A
// password is given in clear and protected as in cfg_add_s; to delete one, its clear text will do,
// or the text that is stored. A replace keeps values that are there byte for byte, protected ones
// too, but protects a password that stands there in clear. 0, also for a null or empty list and
// when nothing changes, without writing; 9 the entry is missing; 16 a value or an attribute to
// delete is; 20 a value to add exists, or is given twice; 2 add without values, or an unknown code;
// 11, 17, 19 and 21 as in cfg_add_s; 65 no attribute would be left.
int cfg_modify_s(_CFG* session, const char* dn, ldapmod** mods);

// How many calls of the three above this thread has had answered with 0. Whoever stands behind
// somebody who makes changes can tell by it whether a success that is reported was one.
unsigned long cfg_changes_made();

}  // namespace orv
