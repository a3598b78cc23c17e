// The blocks that the library puts aside for answers that must not fail.
#pragma once

#include "memory.h"

namespace orv::slapi {

// Large enough for a text of one character.
inline constexpr std::size_t kReservedText = 2;
Reserve& text_reserve() noexcept;

// For an array of one modification record: without a list a caller of EntryToLDAPMod would report
// a success that wrote nothing.
Reserve& list_reserve() noexcept;

}  // namespace orv::slapi
