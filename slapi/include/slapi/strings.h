// The server's string routines. ASCII rules only, whatever the locale; all are thread-safe.
#pragma once

#include <cstddef>

namespace orv {

// strcmp without regard to the case of A to Z. Null sorts before everything and equals null.
int kel_strcasecmp(const char* a, const char* b);

// The first occurrence of `needle` in `text` under the same rule, or null.
const char* kel_strcasestr(const char* text, const char* needle);

// Bounded copy and append: `size` is that of the whole buffer; the result is always terminated
// (when size is not 0). Both return the length that was asked for; `size` or more means it was cut.
std::size_t kel_strlcpy(char* target, const char* source, std::size_t size);
std::size_t kel_strlcat(char* target, const char* source, std::size_t size);

// Formats into a new malloced text. Length, or -1 (no memory) with `*result` null.
[[gnu::format(printf, 2, 3)]] int kel_asprintf(char** result, const char* format, ...);

// A malloced copy; null for null or without memory. Only the platform's own allocation hooks differ
// from strdup.
char* slapi_ch_strdup(const char* text);

// realloc; null on failure, with `memory` kept.
void* safe_realloc(void* memory, std::size_t size);

// An environment variable, borrowed; null when unset.
const char* ldap_getenv(const char* name);

// Whether `text` is one or more ASCII letters and digits. Null and "" are not.
bool is_string_alphanum(const char* text);

}  // namespace orv
