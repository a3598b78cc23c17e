// The sizes of configurations that a benchmark is asked for on its command line.
#pragma once

#include <algorithm>
#include <cstddef>
#include <string>
#include <vector>

namespace orv::bench {

// Reads a list like "100,1000"; sizes below `least` become that.
inline std::vector<std::size_t> read_sizes(const std::string& list, std::size_t least) {
  std::vector<std::size_t> sizes;
  for (std::size_t at = 0; at < list.size();) {
    const std::size_t comma = std::min(list.find(',', at), list.size());
    sizes.push_back(std::max<std::size_t>(least, std::stoul(list.substr(at, comma - at))));
    at = comma + 1;
  }
  return sizes;
}

}  // namespace orv::bench
