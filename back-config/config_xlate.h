// Reading entries of the configuration file, and the way between the file's local code page and the
// server's UTF-8.
//
// All functions work on a session that the caller holds (see config_session.h).
#pragma once

#include <cstddef>

#include "slapi/entry.h"
#include "slapi/owners.h"

namespace orv {

// Converts a NUL-terminated text. On success `*result` is a new text, released with free, and
// `*length` counts its bytes with the terminating NUL. 0, or the converter's code with `*result`
// null.
int cfg_xlate_localcp_to_utf8(const char* text, char** result, std::size_t* length);
int cfg_xlate_utf8_to_localcp(const char* text, char** result, std::size_t* length);

// The same with an owner for the result: `direction` is one of the two above. Its code; `owner` is
// null when nothing was made.
using CodePageDirection = int(const char* text, char** result, std::size_t* length);
int convert(CodePageDirection& direction, const char* text, MallocText& owner);

// The normal form of a copy of `dn`, both in UTF-8. 0; 90 no copy could be made (also of null); the
// code of `replace_DN`, with `copy` as `dn` was.
int normalized_copy(const char* dn, MallocText& copy);

// Searches at `dn` for "(objectclass=*)", asking for one attribute. `dn` goes to the library as it
// is: the callers give it in UTF-8, unconverted. 0 with the result in `*chain`, for `cfg_msgfree`;
// 32 no such entry; 90 no memory; 80 any other failure.
int cfg_read_cfg_entry(_CFG* session, const char* dn, const char* attribute, int scope,
                       _CFGMessage** chain);

// Makes a server entry of a record, in UTF-8. What the library cannot read (the DN, an attribute)
// is left out and reported with `cfg_perror`. What the converter refuses is not reported: a DN is
// left out, a value becomes an empty one; nor is the result of `attr_merge` looked at. The entry is
// released with `entry_free`. Null without memory. **The record itself may then have been
// released**, and taken out of its chain: the caller must not touch it again, not even to find the
// one after it.
entry* CFGMessage2EntryTrans(_CFG* session, _CFGMessage* record);

// Fetches the entry `dn` as the file has it, without conversion, and notes `dn` in `requested_dn`.
// 0 with `*out` for `entry_free`; otherwise `*out` is null: 32 no such entry, 1 it cannot be taken
// or converted, 90 no memory, or the library's error number.
int retrieve_entry(_CFG* session, const char* dn, entry** out);

// Whether an attribute has a value, by its own equality rule. **0 means present.**
int cfg_value_find(attr* attribute, const char* value);

}  // namespace orv
