// Texts that the configuration file holds in its code page, in UTF-8.
#pragma once

#include <string>
#include <string_view>

#include "slapi/entry.h"

namespace orv::slapi {

// Whether the texts of an entry are in a code page other than UTF-8.
bool has_foreign_texts(const entry& e) noexcept;

// False for a text that the code page lacks; `utf8` is then unchanged. Throws std::bad_alloc.
bool local_to_utf8(std::string_view local, std::string& utf8);

// The same for a text of an entry; one in UTF-8 is taken as it is.
bool text_to_utf8(const entry& e, std::string_view text, std::string& utf8);

}  // namespace orv::slapi
