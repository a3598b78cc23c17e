// LDIF (RFC 2849) for programs that write records of their own, and filters on an entry that is in
// no file.
//
// Thread-safe.
#pragma once

#include <string>
#include <string_view>

namespace orv::cfg {

// Appends the line "type: value", in base64 where the value could not be read back otherwise,
// folded at 76 columns. `type` is written as it is. Throws std::bad_alloc.
void append_ldif_line(std::string& out, std::string_view type, std::string_view value);

// Whether the entry whose content record is `record`, in the code page of the file
// (cfg/code_page.h), matches `filter`, which is in UTF-8, by the same rules as in cfg_search_s. 0;
// 1 `record` is not one well-formed record; 2 the filter cannot be read; 3 it was interrupted
// (cfg/interrupt.h); 90. `matches` is left alone on failure. Does not throw.
int ldif_record_matches(std::string_view record, const char* filter, bool& matches) noexcept;

}  // namespace orv::cfg
