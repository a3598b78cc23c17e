// The library's side of cfg/code_page.h: texts of the file, and of those who ask about it, in
// UTF-8.
#pragma once

#include <string>
#include <string_view>

#include "cfg/code_page.h"
#include "cfg/dn.h"

namespace orv::cfg {

// The decoder in force, null for UTF-8.
TextDecoder text_decoder() noexcept;

// The text in UTF-8, in `utf8` or where it was. Bytes that are no text of the code page are left as
// they are: they equal nothing but themselves. Throws std::bad_alloc.
std::string_view as_utf8(std::string_view local, std::string& utf8);

// Whether the text is one of the code page at all; of files in UTF-8 that is not asked.
bool is_local_text(std::string_view local);

// As `normalize` and `parse` of dn_text.h, for a DN in the file's code page. Without a decoder it
// may hold any bytes; then letters outside ASCII are folded only where it is UTF-8.
bool normalize_local(std::string_view local, std::string& normal);
bool parse_local(std::string_view local, Dn& dn);

}  // namespace orv::cfg
