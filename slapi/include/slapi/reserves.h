// What the library puts aside while there is memory.
//
// Thread-safe.
#pragma once

namespace orv {

// Puts blocks aside for those answers of this library that must not fail, where an earlier want of
// memory has used them up. To be called before a handler that changes something; false when memory
// is so short that the handler had better not be called.
bool fill_reserves() noexcept;

}  // namespace orv
