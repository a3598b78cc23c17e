// What an entry holds, for its limits (cfg/entry_limits.h).
#pragma once

#include <cstddef>

#include "change.h"

namespace orv::cfg {

struct EntrySize {
  std::size_t attributes = 0;
  std::size_t values = 0;
};

// 11 when the entry has grown beyond a limit. Throws std::bad_alloc.
Outcome check_growth(EntrySize before, EntrySize after);

}  // namespace orv::cfg
