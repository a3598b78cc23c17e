#include "slapi/control.h"

#include <algorithm>
#include <cstdlib>
#include <mutex>
#include <new>

#include "cfg/result_codes.h"

namespace orv {
namespace {

struct Registry {
  std::mutex mutex;
  std::vector<std::string> oids;  // guarded by mutex
};

Registry& registry() noexcept {
  static Registry controls;
  return controls;
}

}  // namespace

int ldap_insert_control(LDAPControl* control, LDAPControl*** list) {
  if (control == nullptr || list == nullptr) return result::other;
  std::size_t count = 0;
  while (*list != nullptr && (*list)[count] != nullptr) ++count;
  void* const grown = std::realloc(*list, (count + 2) * sizeof(LDAPControl*));
  if (grown == nullptr) return result::no_memory;
  *list = static_cast<LDAPControl**>(grown);
  (*list)[count] = control;
  (*list)[count + 1] = nullptr;
  return result::success;
}

// The set of operations is for servers that pick controls by operation; this one lets every
// operation look at every control it supports.
int slapi_register_supported_control(const char* oid, int /*operations*/) {
  if (oid == nullptr) return result::other;
  try {
    Registry& controls = registry();
    const std::lock_guard lock(controls.mutex);
    if (std::find(controls.oids.begin(), controls.oids.end(), oid) == controls.oids.end())
      controls.oids.emplace_back(oid);
  } catch (const std::bad_alloc&) {
    return result::no_memory;
  }
  return result::success;
}

std::vector<std::string> slapi_supported_controls() {
  try {
    Registry& controls = registry();
    const std::lock_guard lock(controls.mutex);
    return controls.oids;
  } catch (const std::bad_alloc&) {
    return {};
  }
}

}  // namespace orv
