#include "process/key_memory.h"

#include <malloc.h>
#include <openssl/crypto.h>

#include <algorithm>
#include <cstddef>
#include <cstdlib>
#include <cstring>

#include "cfg/secret.h"

namespace orv::server {
namespace {

void* allocate(std::size_t size, const char*, int) noexcept {
  return std::malloc(size);
}

void release(void* memory, const char*, int) noexcept {
  if (memory) cfg::wipe(memory, ::malloc_usable_size(memory));
  std::free(memory);
}

// Never in place: what is cut off would stay, and what moves would leave itself behind.
void* resize(void* memory, std::size_t size, const char* file, int line) noexcept {
  void* const moved = std::malloc(size);
  if (!moved || !memory) return moved;
  std::memcpy(moved, memory, std::min(size, ::malloc_usable_size(memory)));
  release(memory, file, line);
  return moved;
}

}  // namespace

bool protect_keys() noexcept {
  // Some keys of 4096 bits at once, while a new certificate takes the place of an old one.
  constexpr std::size_t kSize = 128 * 1024;
  constexpr std::size_t kSmallest = 32;
  const bool wiped = CRYPTO_set_mem_functions(allocate, resize, release) == 1;
  if (!CRYPTO_secure_malloc_initialized()) CRYPTO_secure_malloc_init(kSize, kSmallest);
  return wiped;
}

}  // namespace orv::server
