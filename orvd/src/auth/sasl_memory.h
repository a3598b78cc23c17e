// What the SASL library allocates. It is wiped when it is released, since passwords and keys pass
// through it.
//
// The library's mechanisms write where they were given nothing. So an allocation that the system
// refuses comes from a small reserve instead, and whoever called the library learns of it: what the
// call was about is then thrown away, which fills the reserve again.
//
// Thread-safe. Nothing throws.
#pragma once

#include <cstddef>

namespace orv::server {

// As malloc, calloc, realloc and free. Null when there is no reserve left either.
void* allocate_for_sasl(std::size_t size) noexcept;
void* allocate_zeroed_for_sasl(std::size_t count, std::size_t size) noexcept;
void* reallocate_for_sasl(void* memory, std::size_t size) noexcept;
void release_of_sasl(void* memory) noexcept;

// Whether this thread was given something of the reserve, or nothing at all, since it asked last.
bool sasl_lacked_memory() noexcept;

}  // namespace orv::server
