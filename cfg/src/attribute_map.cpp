#include "attribute_map.h"

#include "cfg/text.h"

namespace orv::cfg {

// ---- Building ----

void AttributeMap::build(const LdifIndex& index, std::uint32_t entry) {
  entry_ = kNone;
  named_ = kNone;
  index_ = &index;
  attributes_.clear();
  values_.clear();
  folded_names_.clear();
  attributes_.reserve(32);
  values_.reserve(64);
  slots_.assign(128, kNone);
  LineReader reader = index.lines(entry);
  AttributeLine line;
  reader.next(line);  // the DN
  std::string_view last;
  std::uint32_t attribute = kNone;
  while (true) {
    const char* const at = reader.position();
    if (!reader.next(line)) break;
    // A line that is folded before its value begins lies in the reader's memory.
    const bool in_text = line.type.data() >= at && line.type.data() < reader.position();
    // Values of one attribute mostly follow one another.
    if (attribute == kNone || line.type != last) {
      attribute = attribute_for(line.type, in_text);
      last = in_text ? line.type : std::string_view();
    }
    const bool plain = in_text && line.kind == ValueKind::plain && !line.folded;
    add_value(attribute,
              {static_cast<std::uint32_t>((plain ? line.value.data() : at) - index.text_begin()),
               plain ? static_cast<std::uint32_t>(line.value.size()) : kUnusual, kNone});
  }
  entry_ = entry;
}

void AttributeMap::add_value(std::uint32_t attribute, const Value& value) {
  const auto at = static_cast<std::uint32_t>(values_.size());
  values_.push_back(value);
  Attribute& holder = attributes_[attribute];
  (holder.count++ == 0 ? holder.first : values_[holder.last].next) = at;
  holder.last = at;
}

std::uint32_t AttributeMap::attribute_for(std::string_view spelled, bool in_text) {
  const Key key(spelled);
  const std::size_t slot = slot_of(key);
  if (slots_[slot] != kNone) return slots_[slot];
  std::string_view name = spelled;
  if (key.known != nullptr) {
    name = key.known->name;
  } else if (!in_text) {
    name = folded_names_.emplace_front(spelled);
  }
  attributes_.push_back({key.known, name, kNone, kNone, 0});
  slots_[slot] = size() - 1;
  if (attributes_.size() * 2 > slots_.size()) grow_slots();
  return size() - 1;
}

void AttributeMap::grow_slots() {
  slots_.assign(slots_.size() * 2, kNone);
  const std::size_t mask = slots_.size() - 1;
  for (std::uint32_t i = 0; i < size(); ++i) {
    std::size_t at = hash_attribute_name(attributes_[i].name) & mask;
    while (slots_[at] != kNone) at = (at + 1) & mask;
    slots_[at] = i;
  }
}

// ---- Looking up ----

std::size_t AttributeMap::slot_of(const Key& key) const noexcept {
  const std::size_t mask = slots_.size() - 1;
  std::size_t at = key.hash & mask;
  for (; slots_[at] != kNone; at = (at + 1) & mask) {
    const Attribute& attribute = attributes_[slots_[at]];
    if (attribute.known != key.known) continue;
    if (key.known != nullptr || equals_ignore_ascii_case(attribute.name, key.name)) break;
  }
  return at;
}

std::uint32_t AttributeMap::find(std::string_view name) const noexcept {
  if (named_ < size() && attributes_[named_].name == name) return named_;
  return slots_[slot_of(Key(name))];
}

}  // namespace orv::cfg
