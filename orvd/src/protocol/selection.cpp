#include <algorithm>
#include <array>
#include <cstdint>
#include <cstring>

#include "cfg/text.h"
#include "protocol/encoder.h"
#include "slapi/schema.h"

namespace orv::server {
namespace {

// Tells most user attributes from operational ones without a look-up in the schema, which would be
// half of what encoding an entry costs: which first letters the operational names of each length
// have.
class OperationalNames {
 public:
  bool contains(const char* type) noexcept {
    const Schema& schema = current_schema();
    if (&schema != schema_) learn(schema);
    if (!possible(type)) return false;
    const SchemaAttribute* known = schema.attribute(type);
    return known != nullptr && known->operational;
  }

 private:
  static constexpr std::size_t kLengths = 64;

  static bool is_letter(char c) noexcept {
    return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z');
  }
  static std::uint32_t bit_of(char letter) noexcept { return 1U << (letter & 0x1F); }

  void learn(const Schema& schema) noexcept {
    letters_ = {};
    for (const SchemaAttribute& attribute : schema.attributes()) {
      if (!attribute.operational) continue;
      for (const std::string& name : attribute.names) {
        if (name.size() < kLengths) letters_[name.size()] |= bit_of(name.front());
      }
    }
    schema_ = &schema;
  }

  bool possible(const char* type) const noexcept {
    const std::size_t length = std::strlen(type);
    if (length >= kLengths || !is_letter(*type)) return true;
    return (letters_[length] & bit_of(*type)) != 0;
  }

  const Schema* schema_ = nullptr;
  std::array<std::uint32_t, kLengths> letters_{};
};

bool is_operational(const char* type) noexcept {
  static thread_local OperationalNames names;
  return names.contains(type);
}

}  // namespace

// RFC 4511, 4.5.1.8; RFC 3673. "1.1" needs no case of its own: it is the name of no type, so alone
// it selects nothing and beside others it changes nothing. A name that the schema does not know
// selects by its own spelling.
bool AttributeSelection::assign(char** names) noexcept {
  try {
    all_user_ = names == nullptr || *names == nullptr;
    all_operational_ = false;
    names_.clear();
    for (char** name = names; name != nullptr && *name != nullptr; ++name) {
      const std::string_view asked = *name;
      if (asked == "*") {
        all_user_ = true;
      } else if (asked == "+") {
        all_operational_ = true;
      } else {
        const std::string_view canonical = current_schema().canonical_attribute(asked);
        names_.emplace_back(canonical.empty() ? asked : canonical);
      }
    }
    return true;
  } catch (...) {
    return false;
  }
}

bool AttributeSelection::wants(const char* type) const noexcept {
  if (all_user_ && all_operational_) return true;
  const auto same = [type](const std::string& name) {
    return cfg::equals_ignore_ascii_case(name, type);
  };
  if (std::any_of(names_.begin(), names_.end(), same)) return true;
  if (!all_user_ && !all_operational_) return false;
  return is_operational(type) ? all_operational_ : all_user_;
}

}  // namespace orv::server
