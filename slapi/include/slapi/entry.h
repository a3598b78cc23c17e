// Entries as the server and its plug-ins hold them in memory.
//
// Plain structs, valid when filled with zeros, because plug-ins allocate them with calloc and edit
// values in place. Every text, value and array is a malloc block of its own; value lists are
// null-terminated and `count` agrees with them; an attribute in an entry has at least one value,
// except in a types-only result. No cached copy of values exists beside the list.
//
// Threads: an entry belongs to one thread at a time.
#pragma once

#include <cstddef>

#include "cfg/ldapmod.h"
#include "cfg/session.h"

namespace orv {

// An attribute: canonical type name, values, and its place in the entry's list.
struct attr {
  char* type;
  berval** values;  // null-terminated, may be null
  int count;        // number of values
  int syntax;       // opaque to plug-ins; handed back to value_find
  attr* next;
};

// Bytes borrowed from an object class value. A short list ends with {null, 0}.
struct ShortValue {
  const char* bytes;
  std::size_t length;
};

struct entry {
  char* dn;                       // as the client or the file spells it
  char* normalized_dn;            // output of replace_DN for `dn`
  char* requested_dn;             // the DN under which the entry was asked for, or null
  attr* attributes;               // in the order of the request or the file
  attr* object_classes;           // direct reference to the objectClass attribute, or null
  ShortValue* object_class_list;  // its values, for value_find_short_list; or null
  bool local_code_page;           // texts are in the file's code page, not UTF-8
};

// Releases an entry with everything in it; null is a no-op.
void entry_free(entry* e);

// The attribute of that canonical name, ignoring ASCII letter case, or null. The two flags are
// reserved and 0. Null-safe.
attr* attr_find(const entry* e, const char* type, int reserved1, int reserved2);

// Adds copies of `values` to the attribute `type`, creating it at the end of the list when the
// entry lacks it; an empty array creates it without values. `syntax_normalise` and
// `check_duplicates` are passed as 1, `old` is reserved and null. 0; 20 a value is there already
// (never said for secret types, nor when the attribute is new); 21 the entry is in the local code
// page, into which the values are converted, and that lacks a character; 90; -1 a null argument.
// The entry is unchanged on failure. Keeps the object class reference and short list right.
int attr_merge(entry* e, const char* type, berval** values, int syntax_normalise,
               int check_duplicates, void* old);

// Takes an attribute out of the entry. 0; 1 it has none; -1 a null argument.
int attr_delete(entry* e, const char* type, void* old);

// Whether a value is among those of an attribute, by the attribute's equality rule (object class
// names: without regard to letter case). **0 means present**, non-zero absent, also for a null or
// empty attribute.
int value_find(const attr* a, const berval* value, int syntax, int normalise);

// The same on a short list: 0 present (ignoring ASCII letter case), 1 absent; null list 1.
int value_find_short_list(const ShortValue* list, const char* bytes, std::size_t length);

// Makes an entry of a search result without converting its code page (and marks it
// `local_code_page`): DN, normalised DN, attributes in the order of the file, object class
// reference and short list. Null only without memory.
entry* CFGMessage2Entry(_CFG* session, _CFGMessage* record);

// Frees a null-terminated array of texts and each text; null is a no-op.
void charray_free(char** array);

// ---- Changes of entries

// Applies a delete modification: without values the whole attribute goes, else each value by the
// equality rule, all of them or none; a value that is named twice must be there twice. 0; 16
// attribute or value missing; 21 the entry is in the local code page and that lacks a character of
// a value; 90; 80 a null argument. For a secret type each value of the modification takes the
// earliest value of the entry, whatever it says, so that nothing can be learned from the code.
int delete_values_from_entry(entry* e, ldapmod* modification);

// The list form of attributes that the configuration-file library writes: a malloced
// null-terminated array of add records with deep copies of type and values (strings, read up to
// their NUL), linked through `mod_next` in array order. Released with `free_ldmll` on the first
// record, then free on the array.
// Without memory, for a value without a text (its translation failed), and for a list that is
// shorter than the entry whose schema check came last on this thread (both have the same type
// texts), the array holds one record without a type, which no change accepts: a backend would
// otherwise report nothing, or half an entry, as written. Null only for an empty list, and when
// memory fails again while the last such answer is still held.
ldapmod** EntryToLDAPMod(attr* attributes);

// Frees a linked list of records; null is a no-op. And an array of them: each record, and the array
// itself when `free_array` is not 0. Values go by the arm that the flag kModBvalues names,
// and are overwritten: there may be passwords among them.
void free_ldmll(ldapmod* first);
void ldap_mods_free(ldapmod** array, int free_array);

// Checks an entry against the schema in force. The two flags are reserved and 0. 0, or the first of
//   65  no object class, or one that is unknown
//   17  an attribute type that is unknown or carries options
//   19  a second value of a single-valued type, or a value longer than its type allows
//   21  a value that is not of its type's syntax, or an attribute without values
//   65  an attribute that the classes do not allow; none or two structural classes; an attribute
//       that the classes demand and the entry lacks
//   64  a password in the RDN, or a value of the RDN that the entry lacks
//   34  a DN that is none; 90 no memory; 80 a null entry
// What is wrong goes to the server log as a message of set 9, without values.
int ldcf_api_schema_check(entry* e, int reserved1, int reserved2);

// 0 for an entry without object class "referral" (under any of its names), else 53.
int checkReferral(entry* e);

}  // namespace orv
