// Text of a client's in a log line: short, on one line, and of printable characters only.
//
// Threads: functions without state.
#pragma once

#include <string>
#include <string_view>

namespace orv::server {

// What a log line shows of one text at most, in bytes before escaping.
inline constexpr std::size_t kLoggedBytes = 1024;

// Appends `text` in double quotes: quotes, backslashes, control characters (C0, DEL, C1) and bytes
// that are no UTF-8 as \XX. What is beyond kLoggedBytes is left out, which "..." and the whole
// length after the closing quote tell. Throws std::bad_alloc.
void append_client_text(std::string& line, std::string_view text);

// The same for a DN in normal form, whose own backslashes stay: what is logged is a DN again,
// unless it was cut.
void append_normal_dn(std::string& line, std::string_view normal);

// The part of `text` that would be shown; no character is cut in two.
std::string_view logged_part(std::string_view text) noexcept;

}  // namespace orv::server
