// Blocks of the malloc family, for everything that crosses the interface.
#pragma once

#include <cstdlib>
#include <cstring>
#include <memory>
#include <string_view>

namespace orv::slapi {

struct MallocDeleter {
  void operator()(void* memory) const noexcept { std::free(memory); }
};
template <typename T>
using MallocPtr = std::unique_ptr<T, MallocDeleter>;

// A NUL-terminated copy of `bytes`; null without memory.
inline char* copy_bytes(std::string_view bytes) noexcept {
  char* const copy = static_cast<char*>(std::malloc(bytes.size() + 1));
  if (copy == nullptr) return nullptr;
  if (!bytes.empty()) std::memcpy(copy, bytes.data(), bytes.size());
  copy[bytes.size()] = '\0';
  return copy;
}

}  // namespace orv::slapi
