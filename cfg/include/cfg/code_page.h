// Configuration files in another code page than UTF-8: how their texts come to UTF-8, in which
// names and values are compared.
#pragma once

#include <string>
#include <string_view>

namespace orv::cfg {

// Writes `text`, which is in the file's code page, to `utf8` in UTF-8. 0; 21 the code page has no
// such text; 90. Leaves `utf8` unchanged on failure. Thread-safe. The code page has the characters
// of ASCII, but for the backslash and the tilde, in the bytes of ASCII.
using TextDecoder = int (*)(std::string_view text, std::string& utf8) noexcept;

// Puts a decoder in force for the whole process; null, as at first, for files in UTF-8. The DNs and
// filters that a session is asked with are in the file's code page too. Call while no session is
// open.
void set_text_decoder(TextDecoder decoder) noexcept;

}  // namespace orv::cfg
