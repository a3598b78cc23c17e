// The attribute table as the library itself reads it: besides what cfg/attribute_table.h tells,
// each type's name in upper case (for normal DNs) and a test that rules out, for nearly every line
// of a file, that its type is another spelling of a secret.
#pragma once

#include <atomic>
#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

#include "cfg/attribute_table.h"

namespace orv::cfg {

struct KnownType : AttributeType {
  std::string upper_name;
};

class AttributeLookup {
 public:
  explicit AttributeLookup(std::vector<AttributeType> types);

  [[nodiscard]] const KnownType* find(std::string_view name_or_oid) const noexcept;

  // One bit for each length, up to 63, that an alias or OID of a secret type has.
  [[nodiscard]] std::uint64_t secret_alias_lengths() const noexcept {
    return secret_alias_lengths_;
  }

  // False when no secret type has an alias or OID of this length.
  [[nodiscard]] bool may_be_secret_alias(std::size_t length) const noexcept {
    return length >= 64 || (secret_alias_lengths_ >> length & 1) != 0;
  }

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
  std::uint64_t secret_alias_lengths_ = 0;
};

// The table in force; valid until the next registration.
const AttributeLookup& attribute_lookup() noexcept;

// Whether `spelled` is one of the type's names, its OID included.
bool is_name_of(const AttributeType& type, std::string_view spelled) noexcept;

}  // namespace orv::cfg
