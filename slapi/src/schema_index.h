// The names of a schema: by any name or numeric OID, ignoring ASCII letter case, to a position.
#pragma once

#include <cstddef>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>

#include "cfg/text.h"
#include "slapi/schema.h"

namespace orv {

struct FoldedHash {
  using is_transparent = void;
  std::size_t operator()(std::string_view name) const noexcept {
    std::size_t hash = 14695981039346656037U;  // FNV-1a
    for (const char c : name) {
      const bool upper = c >= 'A' && c <= 'Z';
      hash = (hash ^ static_cast<unsigned char>(upper ? c - 'A' + 'a' : c)) * 1099511628211U;
    }
    return hash;
  }
};

struct FoldedEqual {
  using is_transparent = void;
  bool operator()(std::string_view a, std::string_view b) const noexcept {
    return cfg::equals_ignore_ascii_case(a, b);
  }
};

using NameIndex = std::unordered_map<std::string, std::size_t, FoldedHash, FoldedEqual>;

inline std::optional<std::size_t> find_name(const NameIndex& index,
                                            std::string_view name) noexcept {
  const auto found = index.find(name);
  if (found == index.end()) return std::nullopt;
  return found->second;
}

struct Schema::Index {
  NameIndex attributes;
  NameIndex object_classes;
};

}  // namespace orv
