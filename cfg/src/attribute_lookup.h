// The attribute table as the library itself reads it: besides what cfg/attribute_table.h tells,
// what comparing and recognising names costs least with, and a test that rules out, for nearly
// every line of a file, that its type is another spelling of a secret.
#pragma once

#include <array>
#include <atomic>
#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

#include "cfg/attribute_table.h"

namespace orv::cfg {

// A set of names that answers "certainly not" for nearly every name that is not in it, from the
// length, the first and the last character alone and in any letter case.
class NameFilter {
 public:
  void add(std::string_view name) noexcept {
    const unsigned bit = bit_of(name);
    bits_[bit / 64] |= std::uint64_t{1} << bit % 64;
  }
  [[nodiscard]] bool may_hold(std::string_view name) const noexcept {
    const unsigned bit = bit_of(name);
    return (bits_[bit / 64] >> bit % 64 & 1) != 0;
  }

 private:
  static unsigned bit_of(std::string_view name) noexcept {
    if (name.empty()) return 0;
    const auto folded = [](char c) { return static_cast<unsigned>(c | 0x20) & 0xFF; };
    return (static_cast<unsigned>(name.size()) * 37 + folded(name.front()) * 11 +
            folded(name.back())) %
           256;
  }

  std::array<std::uint64_t, 4> bits_{};
};

struct KnownType : AttributeType {
  std::string upper_name;          // for normal DNs
  std::uint32_t hash = 0;          // of its name
  std::uint64_t name_lengths = 0;  // one bit for the length of each of its names, the last: 63 up

  [[nodiscard]] bool may_be_called(std::string_view spelled) const noexcept {
    return (name_lengths >> (spelled.size() < 63 ? spelled.size() : 63) & 1) != 0;
  }
};

// Hash of an attribute's name without regard to letter case.
std::uint32_t hash_attribute_name(std::string_view name) noexcept;

class AttributeLookup {
 public:
  explicit AttributeLookup(std::vector<AttributeType> types);

  [[nodiscard]] const KnownType* find(std::string_view name_or_oid) const noexcept {
    return find(name_or_oid, hash_attribute_name(name_or_oid));
  }
  // As above, for those who have the hash of the name.
  [[nodiscard]] const KnownType* find(std::string_view name_or_oid,
                                      std::uint32_t hash) const noexcept;

  // Every alias and OID of a secret type.
  [[nodiscard]] const NameFilter& secret_aliases() const noexcept { return secret_aliases_; }

 private:
  struct Slot {
    std::uint32_t hash = 0;
    std::uint32_t type = kFree;
    std::string_view name;
  };
  static constexpr std::uint32_t kFree = 0xFFFFFFFF;

  void insert(std::string_view name, std::uint32_t type) noexcept;

  std::vector<KnownType> types_;
  std::vector<Slot> slots_;  // open addressing, a power of two, at most half full
  NameFilter secret_aliases_;
};

// The table in force; valid until the next registration.
const AttributeLookup& attribute_lookup() noexcept;

// Whether `spelled` is one of the type's names, its OID included.
bool is_name_of(const KnownType& type, std::string_view spelled) noexcept;

}  // namespace orv::cfg
