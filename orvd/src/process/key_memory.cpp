#include "process/key_memory.h"

#include <openssl/crypto.h>

#include <cstddef>

namespace orv::server {

void protect_keys() noexcept {
  // Some keys of 4096 bits at once, while a new certificate takes the place of an old one.
  constexpr std::size_t kSize = 128 * 1024;
  constexpr std::size_t kSmallest = 32;
  if (!CRYPTO_secure_malloc_initialized()) CRYPTO_secure_malloc_init(kSize, kSmallest);
}

}  // namespace orv::server
