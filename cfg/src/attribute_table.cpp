#include "cfg/attribute_table.h"

#include <algorithm>
#include <bit>
#include <cstring>
#include <memory>
#include <utility>

#include "attribute_lookup.h"
#include "cfg/result_codes.h"
#include "cfg/text.h"
#include "characters.h"

namespace orv::cfg {

namespace {

std::string upper(std::string_view text) {
  std::string result(text);
  for (char& c : result) c = ascii_upper(c);
  return result;
}

AttributeType well_known(const char* name, const char* oid, const char* long_name) {
  AttributeType type;
  type.name = name;
  type.oid = oid;
  type.aliases.emplace_back(long_name);
  return type;
}

// RFC 4514, section 3.
std::vector<AttributeType> default_types() {
  return {
      well_known("cn", "2.5.4.3", "commonName"),
      well_known("l", "2.5.4.7", "localityName"),
      well_known("st", "2.5.4.8", "stateOrProvinceName"),
      well_known("o", "2.5.4.10", "organizationName"),
      well_known("ou", "2.5.4.11", "organizationalUnitName"),
      well_known("c", "2.5.4.6", "countryName"),
      well_known("street", "2.5.4.9", "streetAddress"),
      well_known("dc", "0.9.2342.19200300.100.1.25", "domainComponent"),
      well_known("uid", "0.9.2342.19200300.100.1.1", "userId"),
  };
}

// The table in force. The default one is built when the library is loaded, so that a lookup never
// has to allocate.
std::unique_ptr<const AttributeLookup>& owner() {
  static std::unique_ptr<const AttributeLookup> table =
      std::make_unique<const AttributeLookup>(default_types());
  return table;
}
std::atomic<const AttributeLookup*> current{owner().get()};

}  // namespace

// Setting bit 5 folds the letters and leaves every other
// character of an attribute name as it is; equality is checked exactly afterwards.
std::uint32_t hash_attribute_name(std::string_view name) noexcept {
  constexpr std::uint64_t kFold = 0x2020202020202020U;
  constexpr std::uint64_t kFactor = 0x9E3779B97F4A7C15U;
  std::uint64_t hash = name.size();
  const char* p = name.data();
  std::size_t left = name.size();
  for (; left >= 8; p += 8, left -= 8) {
    std::uint64_t word = 0;
    std::memcpy(&word, p, 8);
    hash = (std::rotl(hash, 23) ^ (word | kFold)) * kFactor;
  }
  std::uint64_t tail = 0;
  for (std::size_t i = 0; i < left; ++i) {
    tail = tail << 8 | static_cast<unsigned char>(p[i]);
  }
  hash = (std::rotl(hash, 23) ^ (tail | kFold)) * kFactor;
  return static_cast<std::uint32_t>(hash >> 32);
}

namespace {

std::uint64_t lengths_of_names(const AttributeType& type) noexcept {
  const auto bit = [](std::string_view name) {
    return std::uint64_t{1} << (name.size() < 63 ? name.size() : 63);
  };
  std::uint64_t lengths = bit(type.name);
  if (!type.oid.empty()) lengths |= bit(type.oid);
  for (const std::string& alias : type.aliases) lengths |= bit(alias);
  return lengths;
}

}  // namespace

AttributeLookup::AttributeLookup(std::vector<AttributeType> types) {
  std::size_t names = 0;
  types_.reserve(types.size());
  for (AttributeType& type : types) {
    names += 2 + type.aliases.size();
    std::string upper_name = upper(type.name);
    const std::uint32_t hash = hash_attribute_name(type.name);
    const std::uint64_t lengths = lengths_of_names(type);
    types_.push_back(KnownType{std::move(type), std::move(upper_name), hash, lengths});
  }
  slots_.resize(std::bit_ceil(names * 2 + 2));
  for (std::uint32_t i = 0; i < types_.size(); ++i) insert(types_[i].name, i);
  for (std::uint32_t i = 0; i < types_.size(); ++i) {
    insert(types_[i].oid, i);
    for (const std::string& alias : types_[i].aliases) insert(alias, i);
  }
}

void AttributeLookup::insert(std::string_view name, std::uint32_t type) noexcept {
  if (name.empty() || find(name) != nullptr) return;
  const std::uint32_t hash = hash_attribute_name(name);
  std::size_t at = hash & (slots_.size() - 1);
  while (slots_[at].type != kFree) at = (at + 1) & (slots_.size() - 1);
  slots_[at] = Slot{hash, type, name};
  if (types_[type].secret && !equals_ignore_ascii_case(name, types_[type].name)) {
    secret_aliases_.add(name);
  }
}

const KnownType* AttributeLookup::find(std::string_view name, std::uint32_t hash) const noexcept {
  for (std::size_t at = hash & (slots_.size() - 1); slots_[at].type != kFree;
       at = (at + 1) & (slots_.size() - 1)) {
    const Slot& slot = slots_[at];
    if (slot.hash == hash && (slot.name == name || equals_ignore_ascii_case(slot.name, name))) {
      return &types_[slot.type];
    }
  }
  return nullptr;
}

const AttributeLookup& attribute_lookup() noexcept {
  return *current.load(std::memory_order_acquire);
}

int register_attribute_types(std::vector<AttributeType> types) noexcept try {
  auto table = std::make_unique<const AttributeLookup>(std::move(types));
  current.store(table.get(), std::memory_order_release);
  owner() = std::move(table);
  return result::success;
} catch (...) {
  return result::no_memory;
}

const AttributeType* find_attribute_type(std::string_view name_or_oid) noexcept {
  return attribute_lookup().find(name_or_oid);
}

bool is_name_of(const KnownType& type, std::string_view spelled) noexcept {
  if (!type.may_be_called(spelled)) return false;
  if (type.name == spelled || equals_ignore_ascii_case(type.name, spelled)) return true;
  if (equals_ignore_ascii_case(type.oid, spelled)) return true;
  return std::any_of(type.aliases.begin(), type.aliases.end(), [spelled](const std::string& alias) {
    return equals_ignore_ascii_case(alias, spelled);
  });
}

}  // namespace orv::cfg
