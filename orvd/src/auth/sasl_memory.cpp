#include "auth/sasl_memory.h"

#include <malloc.h>

#include <algorithm>
#include <array>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <limits>
#include <mutex>

#include "cfg/secret.h"

namespace orv::server {
namespace {

thread_local bool lacked = false;

// Several times what a step of an exchange allocates, and one frame of a security layer.
constexpr std::size_t kBlock = 1024;
constexpr std::size_t kBlocks = 384;

class Reserve {
 public:
  void* allocate(std::size_t size) noexcept {
    if (size > memory_.size()) return nullptr;
    const std::size_t wanted = std::max<std::size_t>(1, (size + kBlock - 1) / kBlock);
    const std::lock_guard lock(mutex_);
    std::size_t run = 0;
    for (std::size_t i = 0; i < kBlocks; ++i) {
      run = taken_[i] ? 0 : run + 1;
      if (run < wanted) continue;
      const std::size_t first = i + 1 - wanted;
      std::fill_n(taken_.begin() + static_cast<std::ptrdiff_t>(first), wanted, true);
      lengths_[first] = static_cast<std::uint16_t>(wanted);
      return memory_.data() + first * kBlock;
    }
    return nullptr;
  }
  bool holds(const void* memory) const noexcept {
    const auto* const byte = static_cast<const unsigned char*>(memory);
    return byte >= memory_.data() && byte < memory_.data() + memory_.size();
  }
  std::size_t size_of(const void* memory) noexcept {
    const std::lock_guard lock(mutex_);
    return lengths_[index_of(memory)] * kBlock;
  }
  void release(const void* memory) noexcept {
    const std::lock_guard lock(mutex_);
    const std::size_t first = index_of(memory);
    std::fill_n(taken_.begin() + static_cast<std::ptrdiff_t>(first), lengths_[first], false);
  }

 private:
  std::size_t index_of(const void* memory) const noexcept {
    return static_cast<std::size_t>(static_cast<const unsigned char*>(memory) - memory_.data()) /
           kBlock;
  }

  std::mutex mutex_;
  std::array<bool, kBlocks> taken_{};
  std::array<std::uint16_t, kBlocks> lengths_{};  // at the first block of each
  alignas(std::max_align_t) std::array<unsigned char, kBlock * kBlocks> memory_{};
};

constinit Reserve reserve;

std::size_t size_of(void* memory) noexcept {
  return reserve.holds(memory) ? reserve.size_of(memory) : malloc_usable_size(memory);
}

}  // namespace

void* allocate_for_sasl(std::size_t size) noexcept {
  void* const memory = std::malloc(size);
  if (memory != nullptr) return memory;
  lacked = true;
  return reserve.allocate(size);
}

void* allocate_zeroed_for_sasl(std::size_t count, std::size_t size) noexcept {
  void* memory = std::calloc(count, size);
  if (memory != nullptr) return memory;
  lacked = true;
  if (size != 0 && count > std::numeric_limits<std::size_t>::max() / size) return nullptr;
  memory = reserve.allocate(count * size);
  if (memory != nullptr) std::memset(memory, 0, count * size);
  return memory;
}

void* reallocate_for_sasl(void* memory, std::size_t size) noexcept {
  void* const moved = allocate_for_sasl(size);
  if (moved == nullptr || memory == nullptr) return moved;
  std::memcpy(moved, memory, std::min(size, size_of(memory)));
  release_of_sasl(memory);
  return moved;
}

void release_of_sasl(void* memory) noexcept {
  if (memory == nullptr) return;
  cfg::wipe(memory, size_of(memory));
  if (reserve.holds(memory))
    reserve.release(memory);
  else
    std::free(memory);
}

bool sasl_lacked_memory() noexcept {
  const bool did = lacked;
  lacked = false;
  return did;
}

}  // namespace orv::server
