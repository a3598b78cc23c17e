// Text rules that the library and the server share: UTF-8 validity, ASCII letter case, base64.
// All functions are thread-safe and independent of the process's locale.
#pragma once

#include <cstddef>
#include <string>
#include <string_view>

namespace orv::cfg {

// Whether `text` is well-formed UTF-8 (RFC 3629: no overlong forms, no surrogates) up to its end.
bool is_valid_utf8(std::string_view text) noexcept;

// Comparison that folds the letters A to Z only.
bool equals_ignore_ascii_case(std::string_view a, std::string_view b) noexcept;

// Base64 (RFC 4648, 4). Decoding is strict: padding required, no other characters. On failure
// `error_at` is the offset of the first offending character. 0, 21 or 90.
int base64_encode(std::string_view bytes, std::string& text) noexcept;
int base64_decode(std::string_view text, std::string& bytes, std::size_t& error_at) noexcept;

}  // namespace orv::cfg
