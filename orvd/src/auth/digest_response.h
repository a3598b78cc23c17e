// The form of what a client answers to DIGEST-MD5 (RFC 2831, 2.1.2).
//
// The library that computes the mechanism keeps the memory of a directive that is given twice, for
// ever: strangers could use the server's memory up with it. So nothing but the plain form reaches
// it.
#pragma once

#include <string_view>

namespace orv::server {

// Whether `text` is a list of directives, name=value with values that are tokens or quoted, in
// which no name comes twice. Throws std::bad_alloc.
bool is_digest_response(std::string_view text);

}  // namespace orv::server
