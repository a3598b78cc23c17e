// What an entry holds, attribute by attribute: which there are and where their values stand. Made
// in one pass over the entry's lines, so that walking an entry reads each of them once.
#pragma once

#include <cstddef>
#include <cstdint>
#include <forward_list>
#include <string>
#include <string_view>
#include <vector>

#include "attribute_lookup.h"
#include "ldif_index.h"

namespace orv::cfg {

// The map of one entry at a time: that of the entry last asked for. It holds for as long as the
// text of the index does not change.
class AttributeMap {
 public:
  static constexpr std::uint32_t kNone = 0xFFFFFFFF;

  // Makes it the map of this entry, if it is not. Throws std::bad_alloc, and is then no entry's.
  void show(const LdifIndex& index, std::uint32_t entry) {
    if (entry_ != entry || index_ != &index) build(index, entry);
  }

  // Attributes are numbered from 0 in the order of their first appearance.
  [[nodiscard]] std::uint32_t size() const noexcept {
    return static_cast<std::uint32_t>(attributes_.size());
  }
  // The attribute with this name in any spelling, or kNone. Whoever walks the entry asks for the
  // values of the attribute whose name he was just given: that one is looked at first.
  [[nodiscard]] std::uint32_t find(std::string_view name) const noexcept;
  // Null when the type is unknown.
  [[nodiscard]] const KnownType* known(std::uint32_t attribute) const noexcept {
    return attributes_[attribute].known;
  }
  // The canonical name, or as first spelled when the type is unknown. Holds as long as the map.
  [[nodiscard]] std::string_view name(std::uint32_t attribute) const noexcept {
    return attributes_[attribute].name;
  }
  [[nodiscard]] std::uint32_t count_values(std::uint32_t attribute) const noexcept {
    return attributes_[attribute].count;
  }

  // Notes the attribute whose name was given to somebody last.
  void note_named(std::uint32_t attribute) noexcept { named_ = attribute; }

  // Calls `take` with each value of the attribute, decoded, in the order of the file.
  template <class Take>
  void for_each_value(std::uint32_t attribute, Take take) const {
    for (std::uint32_t at = attributes_[attribute].first; at != kNone; at = values_[at].next) {
      const Value& value = values_[at];
      if (value.length != kUnusual) {
        take(std::string_view(index_->text_begin() + value.offset, value.length));
      } else {
        take_unusual(value, take);
      }
    }
  }

 private:
  struct Attribute {
    const KnownType* known;
    std::string_view name;
    std::uint32_t first;  // of its values
    std::uint32_t last;
    std::uint32_t count;
  };
  // Where a value stands in the text; of one that is folded or encoded, where its line begins.
  struct Value {
    std::uint32_t offset;
    std::uint32_t length;
    std::uint32_t next;
  };
  static constexpr std::uint32_t kUnusual = 0xFFFFFFFF;

  // A type as it is looked for: by its place in the attribute table, else by its name.
  struct Key {
    explicit Key(std::string_view spelled) noexcept
        : name(spelled),
          hash(hash_attribute_name(spelled)),
          known(attribute_lookup().find(spelled, hash)) {
      if (known != nullptr) hash = known->hash;
    }
    std::string_view name;
    std::uint32_t hash;
    const KnownType* known;
  };

  void build(const LdifIndex& index, std::uint32_t entry);
  void add_value(std::uint32_t attribute, const Value& value);
  std::uint32_t attribute_for(std::string_view spelled, bool in_text);
  // The slot of the attribute, or the free one where it belongs.
  [[nodiscard]] std::size_t slot_of(const Key& key) const noexcept;
  void grow_slots();

  template <class Take>
  void take_unusual(const Value& value, Take& take) const {
    LineReader reader(index_->text_begin() + value.offset, index_->text_end());
    AttributeLine line;
    std::string scratch;
    if (reader.next(line)) take(decoded(line, scratch));
  }

  const LdifIndex* index_ = nullptr;
  std::uint32_t entry_ = kNone;
  std::uint32_t named_ = kNone;
  std::vector<Attribute> attributes_;
  std::vector<Value> values_;
  std::vector<std::uint32_t> slots_;  // open addressing, a power of two, at most half full
  std::forward_list<std::string> folded_names_;  // of unknown types, when folded within
};

}  // namespace orv::cfg
