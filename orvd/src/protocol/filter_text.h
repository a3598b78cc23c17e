// Search filters: from BER (RFC 4511, 4.5.1.7) to text (RFC 4515).
//
// The text is what handlers get, so it must not be possible to smuggle syntax into it: types and
// rule names are checked, and in values every ( ) * \ and NUL is escaped, as is every octet that is
// not part of well-formed UTF-8. The absolute filters of RFC 4526 (an empty and, an empty or) are
// not offered. Nesting is walked with a stack of our own, bounded by the limit, never by recursion.
#pragma once

#include <string>
#include <string_view>

#include "protocol/ber_parser.h"

namespace orv::server {

struct FilterLimits {
  int depth;  // levels of nesting; a plain item alone has 1
  int items;  // items and the pieces of substring assertions, in all
};

struct FilterOutcome {
  int code = 0;         // 0; 2 a filter that RFC 4511 does not allow; 11 beyond a limit
  bool broken = false;  // with 2: the encoding itself is wrong, the connection is not worth keeping
  const char* text = "";
};

// Appends the text of the filter `element` to `text`. Throws std::bad_alloc only.
FilterOutcome filter_to_text(BerParser& parser, const Element& element, const FilterLimits& limits,
                             std::string& text);

// Appends one assertion value with the escapes described above. Throws std::bad_alloc only.
void append_escaped_value(std::string& text, std::string_view value);

}  // namespace orv::server
