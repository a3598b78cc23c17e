// The name by which messages call a source of this backend.
#pragma once

#include <string_view>

namespace orv {

// Returns `path` (`__FILE__`) from the last "back-config/" on, or all of it without one. Which path
// the compiler was given depends on the build folder and on compiler caches; messages do not.
// Result: a part of the literal. Thread-safe: computed by the compiler.
consteval const char* source_name(const char* path) {
  const std::size_t folder = std::string_view(path).rfind("back-config/");
  return folder == std::string_view::npos ? path : path + folder;
}

}  // namespace orv
