#include <algorithm>
#include <new>

#include "cfg/text.h"
#include "protocol/encoder.h"
#include "slapi/schema.h"

namespace orv::server {

// RFC 4511, 4.5.1.8; RFC 3673. "1.1" only counts when it stands alone, because beside it every
// other name still selects; a name that the schema does not know selects by its own spelling.
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
      } else if (asked != "1.1") {
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
  const SchemaAttribute* known = current_schema().attribute(type);
  const bool operational = known != nullptr && known->operational;
  return operational ? all_operational_ : all_user_;
}

}  // namespace orv::server
