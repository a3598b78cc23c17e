// Scoped owners: of a mutex, and of a buffer that is read under a mutex of its own.
#pragma once

#include <pthread.h>

#include "function_ids.h"
#include "slapi/trace.h"

namespace orv {

// Holds a mutex from construction to destruction. A null mutex makes both a no-op.
class AutoLock {
 public:
  // Untimed: blocks until the mutex is free. Timed: as the server's lock policy says, either the
  // same, or tries for 300 x 0.1 s and then 570 x 1 s; throws a `const char*` when that was in vain
  // (nothing is then held). Every answer of the try-lock but "busy" counts as acquired.
  AutoLock(pthread_mutex_t* mutex, bool timed);
  virtual ~AutoLock();
  AutoLock(const AutoLock&) = delete;
  AutoLock& operator=(const AutoLock&) = delete;

  // The lock policy to use: 1 timed, 0 blocking. `current`, unless the server has read its
  // configuration again since the last call: then the environment variable AUTOLOCKTYPE decides,
  // where exactly "REGULARLOCK" means blocking. Two threads that race here only read it twice.
  static int ReadAndSetLockType(int current);

 private:
  pthread_mutex_t* mutex_;
};

// Owns a buffer (which may be null) together with the function that releases it.
template <typename T>
class AutoFree {
 public:
  using Release = void (*)(void*);

  AutoFree(T* buffer, Release release) : buffer_(buffer), release_(release) {
    const ldtr_function_local trace(function_id::auto_free_make);
    pthread_mutex_init(&mutex_, nullptr);
  }
  virtual ~AutoFree() {
    const ldtr_function_local trace(function_id::auto_free_release);
    if (buffer_ != nullptr) release_(buffer_);
    pthread_mutex_destroy(&mutex_);
  }
  AutoFree(const AutoFree&) = delete;
  AutoFree& operator=(const AutoFree&) = delete;

  // The buffer, still owned here. Thread-safe.
  T* get() {
    const ldtr_function_local trace(function_id::auto_free_get);
    const AutoLock lock(&mutex_, false);
    return buffer_;
  }

 private:
  T* buffer_;
  Release release_;
  pthread_mutex_t mutex_;
};

extern template class AutoFree<char>;

}  // namespace orv
