// The code-page converter: the configuration file is in the machine's local code page, the server
// works in UTF-8.
//
// The local code page is the one named with set_local_code_page, else the codeset of the locale
// that the environment names (LC_ALL, LC_CTYPE, LANG), read without changing the process's own "C"
// locale; the "C" and "POSIX" locales mean UTF-8. When it is UTF-8 (or a subset of it) conversion
// is a checked copy. Conversion descriptors are per thread.
#pragma once

#include <cstddef>

namespace orv {

// Names the code page before initIconvHandle; null or "" asks the environment. Not thread-safe.
void set_local_code_page(const char* name);

// Sets the converter up, and the configuration-file library to compare texts in that code page. 0;
// 80 when the system knows no such code page; 90.
int initIconvHandle();

// Name of the code page in force ("UTF-8" by default), and whether it is UTF-8.
const char* local_code_page();
bool local_code_page_is_utf8();

// Converts a NUL-terminated text. On success `*result` is a new text that the caller frees and
// `*length` counts its bytes with the NUL (1 for ""). 0; 21 a character that is invalid or that the
// other side lacks; 90; 80 a null argument. On failure `*result` is null and `*length` 0.
int xlate_localcp_to_utf8(const char* text, char** result, std::size_t* length);
int xlate_utf8_to_localcp(const char* text, char** result, std::size_t* length);

}  // namespace orv
