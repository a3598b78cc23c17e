// What names in requests may look like (RFC 4512, 1.4 and 2.5; RFC 4511, 4.1).
// Pure functions, thread-safe, ASCII only.
#pragma once

#include <string_view>

namespace orv::server {

// "1.3.6.1": two or more numbers without leading zeros, separated by dots.
bool is_numeric_oid(std::string_view text) noexcept;

// A short name ("cn") or a numeric OID.
bool is_oid(std::string_view text) noexcept;

// A type with any number of options: "cn", "2.5.4.3;lang-de".
bool is_attribute_description(std::string_view text) noexcept;

// Text that may stand in a protocol string at all: well-formed UTF-8 without NUL.
bool is_clean_text(std::string_view text) noexcept;

}  // namespace orv::server
