// Writing LDIF (RFC 2849).
#pragma once

#include <string>
#include <string_view>

namespace orv::orvcfg {

// Appends "name: value" and a newline, the value as base64 where it needs that. False without
// memory.
bool append_ldif_line(std::string& ldif, std::string_view name, std::string_view value);

// The same, folded after `kLineLength` characters.
inline constexpr std::size_t kLineLength = 78;
bool append_folded_ldif_line(std::string& ldif, std::string_view name, std::string_view value);

// Whether a value may stand in LDIF as it is (SAFE-STRING, and no trailing blank).
bool is_safe_ldif_value(std::string_view value);

}  // namespace orv::orvcfg
