// How large changes may make an entry.
//
// A message bounds what one change brings, but an entry grows by one change after the other, and
// each search reads all of it.
//
// Threads: thread-safe.
#pragma once

#include <cstddef>
#include <limits>

namespace orv::cfg {

struct EntryLimits {
  std::size_t attributes = std::numeric_limits<std::size_t>::max();
  std::size_t values = std::numeric_limits<std::size_t>::max();  // of all attributes together
};

// In force for changes that begin from now on, in the whole process; at first nothing is bounded.
// cfg_add_s and cfg_modify_s refuse with 11 what would be larger. An entry that is larger already,
// by a smaller limit or an edit of the file, may be changed as long as it does not grow.
void set_entry_limits(EntryLimits limits) noexcept;
EntryLimits entry_limits() noexcept;

}  // namespace orv::cfg
