#include "object_class_lookup.h"

#include <algorithm>
#include <atomic>
#include <memory>
#include <utility>

#include "cfg/result_codes.h"
#include "cfg/text.h"
#include "preparation.h"

namespace orv::cfg {

namespace {

// The table in force. The empty one is built when the library is loaded, so that a lookup never has
// to allocate.
std::unique_ptr<const ObjectClassLookup>& owner() {
  static std::unique_ptr<const ObjectClassLookup> table =
      std::make_unique<const ObjectClassLookup>(std::vector<ObjectClassNames>());
  return table;
}
std::atomic<const ObjectClassLookup*> current{owner().get()};

bool is_other_name_of(const ObjectClassNames& object_class, std::string_view name) noexcept {
  return equals_ignore_ascii_case(object_class.oid, name) ||
         std::any_of(
             object_class.aliases.begin(), object_class.aliases.end(),
             [name](const std::string& alias) { return equals_ignore_ascii_case(alias, name); });
}

}  // namespace

ObjectClassLookup::ObjectClassLookup(std::vector<ObjectClassNames> classes)
    : classes_(std::move(classes)) {
  for (const ObjectClassNames& object_class : classes_) {
    for (const std::string& alias : object_class.aliases) aliases_.add(alias);
  }
}

// A walk: it happens once for a file that is then refused, and for the rare names that look like
// another one to the filter.
const std::string* ObjectClassLookup::required_name(std::string_view value) const noexcept {
  const std::string_view name = trim_blanks(value);
  if (name.empty()) return nullptr;
  for (const ObjectClassNames& object_class : classes_) {
    if (!equals_ignore_ascii_case(object_class.name, name)) continue;
    return name.size() == value.size() ? nullptr : &object_class.name;
  }
  for (const ObjectClassNames& object_class : classes_) {
    if (is_other_name_of(object_class, name)) return &object_class.name;
  }
  return nullptr;
}

const ObjectClassLookup& object_class_lookup() noexcept {
  return *current.load(std::memory_order_acquire);
}

int register_object_classes(std::vector<ObjectClassNames> classes) noexcept try {
  auto table = std::make_unique<const ObjectClassLookup>(std::move(classes));
  current.store(table.get(), std::memory_order_release);
  owner() = std::move(table);
  return result::success;
} catch (...) {
  return result::no_memory;
}

}  // namespace orv::cfg
