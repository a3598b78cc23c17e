// The schema that is built into the server: the text of the files in schema/.
#pragma once

namespace orv {

// "attributeTypes:" and "objectClasses:" lines in the notation of RFC 4512, 4.1, folded as in LDIF,
// with "#" comments and blank lines between them. ASCII, terminated by NUL. Initialised before any
// code runs.
extern const char* const kBuiltinSchemaText;

}  // namespace orv
