// Passwords that stand in a text as "type=value": in a DN, in a filter, in a URL.
//
// Nothing here allocates, throws or locks.
#pragma once

#include <cstddef>

namespace orv::slapi {

// Replaces them by asterisks in `text` from `begin` to `length`, and gives the new length, which is
// `size` at most.
std::size_t mask_secrets(char* text, std::size_t begin, std::size_t length,
                         std::size_t size) noexcept;

}  // namespace orv::slapi
