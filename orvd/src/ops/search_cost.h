// Whether a search may take so long that the loop's other clients would notice.
//
// The estimate is the number of entries that searches had to look at lately, times the length of
// the filter. Nothing is known before the first search, which counts as long.
//
// Threads: thread-safe.
#pragma once

#include <algorithm>
#include <atomic>
#include <cstddef>

namespace orv::server {

class SearchCost {
 public:
  bool may_be_long(std::size_t filter_bytes) const noexcept {
    const std::size_t entries = entries_.load(std::memory_order_relaxed);
    return entries == 0 || filter_bytes > kBound ||
           entries > kBound / std::max(filter_bytes, kItem);
  }

  // A search has looked at so many entries. `whole` tells that it went through the whole tree to
  // its end; others only show that there are no fewer.
  void learn(std::size_t entries, bool whole) noexcept {
    if (whole || entries > entries_.load(std::memory_order_relaxed))
      entries_.store(std::max(entries, std::size_t{1}), std::memory_order_relaxed);
  }

 private:
  // About a millisecond of work: a filter item takes some 15 bytes and a quarter of a microsecond.
  static constexpr std::size_t kBound = std::size_t{64} << 10;
  static constexpr std::size_t kItem = 16;

  std::atomic<std::size_t> entries_{0};
};

}  // namespace orv::server
