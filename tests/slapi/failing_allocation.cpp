#include "failing_allocation.h"

#include <dlfcn.h>

#include <atomic>
#include <cerrno>
#include <cstddef>
#include <cstdlib>
#include <cstring>
#include <new>

namespace {

struct State {
  bool armed;
  long fail_at;
  long allocations;
  long balance;
  bool hit;
};
// A type without a constructor: the first access comes before any constructor of the program.
thread_local State state;

// What is armed for all threads but one. Constant from the start, as the above.
struct Elsewhere {
  std::atomic<bool> armed{false};
  std::atomic<long> fail_at{0};
  std::atomic<long> times{0};
  std::atomic<long> allocations{0};
  std::atomic<bool> hit{false};
};
constinit Elsewhere elsewhere;
thread_local bool exempt;

bool fails_elsewhere() noexcept {
  if (exempt || !elsewhere.armed.load(std::memory_order_acquire)) return false;
  const long number = elsewhere.allocations.fetch_add(1, std::memory_order_relaxed) + 1;
  const long first = elsewhere.fail_at.load(std::memory_order_relaxed);
  if (first == 0 || number < first ||
      number - first >= elsewhere.times.load(std::memory_order_relaxed))
    return false;
  elsewhere.hit.store(true, std::memory_order_relaxed);
  errno = ENOMEM;
  return true;
}

bool fails() noexcept {
  if (fails_elsewhere()) return true;
  if (!state.armed || ++state.allocations != state.fail_at) return false;
  state.hit = true;
  errno = ENOMEM;
  return true;
}

void count(long blocks) noexcept {
  if (state.armed) state.balance += blocks;
}

// The loader may allocate while it looks the real functions up.
alignas(std::max_align_t) char early[4096];
std::size_t early_used = 0;

bool is_early(const void* block) noexcept {
  const auto* const bytes = static_cast<const char*>(block);
  return bytes >= early && bytes < early + sizeof early;
}

void* early_block(std::size_t size) noexcept {
  constexpr std::size_t alignment = alignof(std::max_align_t);
  size = (size + alignment - 1) / alignment * alignment;
  if (early_used + size > sizeof early) std::abort();
  void* const block = early + early_used;
  early_used += size;
  return block;
}

template <typename Function>
Function next(Function& found, const char* name) noexcept {
  static thread_local bool looking = false;
  if (found == nullptr && !looking) {
    looking = true;
    void* const symbol = dlsym(RTLD_NEXT, name);
    std::memcpy(&found, &symbol, sizeof found);
    looking = false;
  }
  return found;
}

void* (*real_malloc)(std::size_t);
void* (*real_calloc)(std::size_t, std::size_t);
void* (*real_realloc)(void*, std::size_t);
void (*real_free)(void*);

void* allocate(std::size_t size) noexcept {
  if (fails()) return nullptr;
  const auto function = next(real_malloc, "malloc");
  void* const block = function == nullptr ? early_block(size) : function(size);
  if (block != nullptr) count(1);
  return block;
}

// A block that the look-up of free itself wants to release: kept, and no leak, since it stays
// known.
void* parked;

void release(void* block) noexcept {
  if (block == nullptr || is_early(block)) return;
  const auto function = next(real_free, "free");
  if (function == nullptr) {
    parked = block;
    return;
  }
  count(-1);
  function(block);
}

void* allocate_or_throw(std::size_t size) {
  void* const block = allocate(size == 0 ? 1 : size);
  if (block == nullptr) throw std::bad_alloc();
  return block;
}

}  // namespace

extern "C" {

void* malloc(std::size_t size) {
  return allocate(size);
}

void* calloc(std::size_t number, std::size_t size) {
  if (fails()) return nullptr;
  const auto function = next(real_calloc, "calloc");
  void* const block = function == nullptr ? early_block(number * size) : function(number, size);
  if (block != nullptr) count(1);
  return block;
}

void* realloc(void* block, std::size_t size) {
  if (fails()) return nullptr;
  void* const moved = next(real_realloc, "realloc")(block, size);
  if (block == nullptr && moved != nullptr) count(1);
  return moved;
}

void free(void* block) {
  release(block);
}

}  // extern "C"

void* operator new(std::size_t size) {
  return allocate_or_throw(size);
}
void* operator new[](std::size_t size) {
  return allocate_or_throw(size);
}
void* operator new(std::size_t size, const std::nothrow_t&) noexcept {
  return allocate(size);
}
void* operator new[](std::size_t size, const std::nothrow_t&) noexcept {
  return allocate(size);
}
void operator delete(void* block) noexcept {
  release(block);
}
void operator delete[](void* block) noexcept {
  release(block);
}
void operator delete(void* block, std::size_t) noexcept {
  release(block);
}
void operator delete[](void* block, std::size_t) noexcept {
  release(block);
}
void operator delete(void* block, const std::nothrow_t&) noexcept {
  release(block);
}
void operator delete[](void* block, const std::nothrow_t&) noexcept {
  release(block);
}

namespace orv::test {

AllocationFault::AllocationFault(long fail_at) noexcept {
  state = {true, fail_at, 0, 0, false};
}
AllocationFault::~AllocationFault() {
  disarm();
}
void AllocationFault::disarm() noexcept {
  state.armed = false;
}
bool AllocationFault::hit() const noexcept {
  return state.hit;
}
long AllocationFault::allocations() const noexcept {
  return state.allocations;
}
long AllocationFault::balance() const noexcept {
  return state.balance;
}

AllocationFaultElsewhere::AllocationFaultElsewhere(long fail_at, long times) noexcept {
  exempt = true;
  elsewhere.fail_at = fail_at;
  elsewhere.times = times;
  elsewhere.allocations = 0;
  elsewhere.hit = false;
  elsewhere.armed.store(true, std::memory_order_release);
}
AllocationFaultElsewhere::~AllocationFaultElsewhere() {
  disarm();
}
void AllocationFaultElsewhere::disarm() noexcept {
  elsewhere.armed.store(false, std::memory_order_release);
  exempt = false;
}
bool AllocationFaultElsewhere::hit() const noexcept {
  return elsewhere.hit;
}
long AllocationFaultElsewhere::allocations() const noexcept {
  return elsewhere.allocations;
}

}  // namespace orv::test
