// The C library behind the linker's wrapping.
#pragma once

#include <cstddef>

extern "C" {
void* __real_malloc(std::size_t size);
void* __real_calloc(std::size_t count, std::size_t size);
void* __real_realloc(void* block, std::size_t size);
char* __real_strdup(const char* text);
void __real_free(void* block);
}

namespace orv::scripted::real {

inline void* calloc(std::size_t count, std::size_t size) {
  return __real_calloc(count, size);
}
inline void free(void* block) {
  __real_free(block);
}

}  // namespace orv::scripted::real
