#include "process/key_memory.h"

#include <malloc.h>
#include <openssl/crypto.h>

#include <algorithm>
#include <cstddef>
#include <cstdlib>
#include <cstring>
#include <limits>

#include "cfg/secret.h"

namespace orv::server {
namespace {

// Not only for keys of certificates, of which some of 4096 bits are there at once while a new one
// takes the place of an old one: OpenSSL keeps here what a connection with TLS 1.3 agreed on its
// key with, until it ends, and the random generators of threads. When this is full, it takes no
// other memory: nobody could connect any more, and nothing be sealed. A power of two, as OpenSSL
// wants.
constexpr std::size_t kKeyMemory = std::size_t{8} * 1024 * 1024;
constexpr std::size_t kSmallest = 32;
// A connection takes half of it, by the curves that are agreed on; the other half is for the rest.
constexpr std::size_t kForEachConnection = 128;

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
  const bool wiped = CRYPTO_set_mem_functions(allocate, resize, release) == 1;
  if (!CRYPTO_secure_malloc_initialized()) CRYPTO_secure_malloc_init(kKeyMemory, kSmallest);
  return wiped;
}

std::int64_t connections_with_room_for_keys() noexcept {
  return CRYPTO_secure_malloc_initialized()
             ? static_cast<std::int64_t>(kKeyMemory / kForEachConnection)
             : std::numeric_limits<std::int64_t>::max();
}

}  // namespace orv::server
