// Blocks of the malloc family, for everything that crosses the interface.
#pragma once

#include <atomic>
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

// Frees a NUL-terminated text that may be a password; null is a no-op.
inline void wipe_and_free(char* text) noexcept {
  if (text == nullptr) return;
  explicit_bzero(text, std::strlen(text));
  std::free(text);
}

// A zeroed block put aside while there is memory, for the one answer that must not fail: where null
// would be read as "nothing to do". Whoever gets the block releases it with free; the next call of
// `fill` puts another one aside. Thread-safe.
class Reserve {
 public:
  explicit Reserve(std::size_t size) noexcept : size_(size) { fill(); }
  ~Reserve() { std::free(block_.load()); }
  Reserve(const Reserve&) = delete;
  Reserve& operator=(const Reserve&) = delete;

  // False when there is no memory for one.
  bool fill() noexcept {
    if (block_.load(std::memory_order_relaxed) != nullptr) return true;
    void* const made = std::calloc(1, size_);
    if (made == nullptr) return false;
    void* none = nullptr;
    if (!block_.compare_exchange_strong(none, made)) std::free(made);
    return true;
  }
  // Null only when it was taken and could not be filled again.
  void* take() noexcept { return block_.exchange(nullptr); }

 private:
  std::size_t size_;
  std::atomic<void*> block_{nullptr};
};

}  // namespace orv::slapi
