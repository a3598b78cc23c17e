// The key for sealed values.
#pragma once

#include <openssl/crypto.h>

#include <array>
#include <cstddef>
#include <memory>
#include <new>
#include <string>

#include "cfg/secret.h"

namespace orv::cfg {

class Key {
 public:
  using Bytes = std::array<unsigned char, 32>;

  explicit Key(const Bytes& bytes) noexcept : bytes_(bytes) {}
  ~Key() { wipe(bytes_.data(), bytes_.size()); }
  Key(const Key&) = delete;
  Key& operator=(const Key&) = delete;

  [[nodiscard]] const unsigned char* data() const noexcept { return bytes_.data(); }

  // In the memory for keys, where the process has set some apart and some is left; in ordinary
  // memory otherwise. It is wiped in either.
  static void* operator new(std::size_t size, const std::nothrow_t&) noexcept {
    void* const memory = OPENSSL_secure_malloc(size);
    return memory ? memory : OPENSSL_malloc(size);
  }
  static void* operator new(std::size_t size) {
    void* const memory = operator new(size, std::nothrow);
    if (!memory) throw std::bad_alloc();
    return memory;
  }
  static void operator delete(void* key) noexcept { OPENSSL_secure_free(key); }
  static void operator delete(void* key, const std::nothrow_t&) noexcept {
    OPENSSL_secure_free(key);
  }

 private:
  Bytes bytes_;
};

using SharedKey = std::shared_ptr<const Key>;

// As load_key_stash, for those who ask again and again: while the file is the same as when it was
// read last, and as trustworthy, the key is the same one. It is wiped when the file has changed and
// nobody holds it any more. Thread-safe.
int share_key_stash(const char* path, SharedKey& key, std::string& why) noexcept;

// As verify_secret, for those who must not take want of memory for a "no".
enum class Match { no, yes, no_memory };
Match match_secret(const Key* key, SecretPlace place, std::string_view stored,
                   std::string_view clear) noexcept;

// Wipes a buffer when the scope ends.
class WipeAtEnd {
 public:
  explicit WipeAtEnd(std::string& text) noexcept : text_(text) {}
  ~WipeAtEnd() { wipe(text_); }
  WipeAtEnd(const WipeAtEnd&) = delete;
  WipeAtEnd& operator=(const WipeAtEnd&) = delete;

 private:
  std::string& text_;
};

}  // namespace orv::cfg
