// The functions of the C library that the linker leads here. Outside of observed code they do what
// they always did.
#include <pthread.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <new>

#include "platform/platform.h"
#include "platform/real.h"

using orv::scripted::Call;
using orv::scripted::observed;
using orv::scripted::Owned;
using orv::scripted::Platform;
using orv::scripted::Unobserved;

namespace {

// An allocation by the code under test: null when it is to fail.
template <typename Allocate>
void* allocate(Allocate allocate_real) {
  if (!observed()) return allocate_real();
  const Unobserved unobserved;
  Platform& platform = *Platform::current();
  if (platform.allocation_fails()) {
    errno = ENOMEM;
    return nullptr;
  }
  void* block = allocate_real();
  platform.note(block, Owned::memory);
  return block;
}

void note_size(std::size_t size) {
  if (!observed()) return;
  const Unobserved unobserved;
  Platform::current()->sizes.push_back(size);
}

}  // namespace

extern "C" {

// ---- Memory

void* __wrap_malloc(std::size_t size) {
  note_size(size);
  void* block = allocate([&] { return __real_malloc(size); });
  if (block != nullptr && observed()) std::memset(block, 0xA5, size);  // whoever wants zeros asks
  return block;
}

void* __wrap_calloc(std::size_t count, std::size_t size) {
  note_size(count * size);
  return allocate([&] { return __real_calloc(count, size); });
}

char* __wrap_strdup(const char* text) {
  return static_cast<char*>(allocate([&] { return __real_strdup(text); }));
}

void* __real__ZnwmRKSt9nothrow_t(std::size_t size, const std::nothrow_t&);
void* __wrap__ZnwmRKSt9nothrow_t(std::size_t size, const std::nothrow_t& tag) {
  return allocate([&] { return __real__ZnwmRKSt9nothrow_t(size, tag); });
}

void __wrap_free(void* block) {
  Platform* platform = Platform::current();
  if (block != nullptr && platform != nullptr) {
    const Unobserved unobserved;
    if (!platform->freed(block)) return;
  }
  __real_free(block);
}

void* __wrap_realloc(void* block, std::size_t size) {
  if (!observed()) return __real_realloc(block, size);
  if (block == nullptr) return __wrap_malloc(size);
  void* grown = __wrap_malloc(size);
  if (grown == nullptr) return nullptr;
  // A copy of the new size: reads past the old block are what the sanitizers are for.
  void* resized = __real_realloc(block, size);
  const Unobserved unobserved;
  Platform& platform = *Platform::current();
  platform.dispose(grown);
  if (resized != block) platform.freed(block);
  platform.note(resized, Owned::memory);
  return resized;
}

// ---- Mutexes

int __real_pthread_mutex_init(pthread_mutex_t* mutex, const pthread_mutexattr_t* attributes);
int __wrap_pthread_mutex_init(pthread_mutex_t* mutex, const pthread_mutexattr_t* attributes) {
  if (!observed()) return __real_pthread_mutex_init(mutex, attributes);
  const Call call("pthread_mutex_init", mutex, attributes);
  Platform::current()->mutex_made(mutex);
  if (call.failure()) return *call.failure();
  return Platform::current()->real_mutexes ? __real_pthread_mutex_init(mutex, attributes) : 0;
}

int __real_pthread_mutex_destroy(pthread_mutex_t* mutex);
int __wrap_pthread_mutex_destroy(pthread_mutex_t* mutex) {
  if (!observed()) return __real_pthread_mutex_destroy(mutex);
  const Call call("pthread_mutex_destroy", mutex);
  Platform::current()->mutex_gone();
  if (call.failure()) return *call.failure();
  return Platform::current()->real_mutexes ? __real_pthread_mutex_destroy(mutex) : 0;
}

int __real_pthread_mutex_lock(pthread_mutex_t* mutex);
int __wrap_pthread_mutex_lock(pthread_mutex_t* mutex) {
  if (!observed()) return __real_pthread_mutex_lock(mutex);
  const Call call("pthread_mutex_lock", mutex);
  if (call.failure()) return *call.failure();
  if (Platform::current()->real_mutexes) return __real_pthread_mutex_lock(mutex);
  return Platform::current()->lock(mutex);
}

int __real_pthread_mutex_trylock(pthread_mutex_t* mutex);
int __wrap_pthread_mutex_trylock(pthread_mutex_t* mutex) {
  if (!observed()) return __real_pthread_mutex_trylock(mutex);
  const Call call("pthread_mutex_trylock", mutex);
  if (call.failure()) return *call.failure();
  if (Platform::current()->real_mutexes) return __real_pthread_mutex_trylock(mutex);
  return Platform::current()->try_lock(mutex);
}

int __real_pthread_mutex_unlock(pthread_mutex_t* mutex);
int __wrap_pthread_mutex_unlock(pthread_mutex_t* mutex) {
  if (!observed()) return __real_pthread_mutex_unlock(mutex);
  const Call call("pthread_mutex_unlock", mutex);
  if (call.failure()) return *call.failure();
  if (Platform::current()->real_mutexes) return __real_pthread_mutex_unlock(mutex);
  return Platform::current()->unlock(mutex);
}

pthread_t __real_pthread_self();
pthread_t __wrap_pthread_self() {
  if (!observed()) return __real_pthread_self();
  return Platform::current()->thread;
}

// ---- Time and files

int __real_usleep(useconds_t microseconds);
int __wrap_usleep(useconds_t microseconds) {
  if (!observed()) return __real_usleep(microseconds);
  const Call call("usleep", microseconds);
  return call.failure().value_or(0);
}

ssize_t __real_readlink(const char* path, char* buffer, std::size_t size);
ssize_t __wrap_readlink(const char* path, char* buffer, std::size_t size) {
  if (!observed()) return __real_readlink(path, buffer, size);
  const Call call("readlink", path, size);
  const Platform& platform = *Platform::current();
  if (platform.link_errno != 0) {
    errno = platform.link_errno;
    return -1;
  }
  const std::size_t length = std::min(size, platform.link_target.size());
  std::memcpy(buffer, platform.link_target.data(), length);
  return static_cast<ssize_t>(length);
}

char* __real_realpath(const char* path, char* resolved);
char* __wrap_realpath(const char* path, char* resolved) {
  if (!observed()) return __real_realpath(path, resolved);
  const Call call("realpath", path);
  const Platform& platform = *Platform::current();
  const auto reason = platform.path_errors.find(path);
  const auto found = platform.real_paths.find(path);
  if (reason != platform.path_errors.end() || found == platform.real_paths.end()) {
    std::strcpy(resolved, "/as/far/as/it/went");  // which it may leave there
    errno = reason != platform.path_errors.end() ? reason->second : ENOENT;
    return nullptr;
  }
  std::strcpy(resolved, found->second.c_str());
  return resolved;
}

}  // extern "C"
