// The directory's own backend, as the rest of the server meets it: it has the suffix CN=LOCALHOST,
// serves no entries, and offers function -159, with which a new password method is checked and
// staged before the change that asks for it is written.
//
// Threads: made and destroyed by one thread, before the listeners open and after they have closed.
// What it offers is thread-safe.
#pragma once

#include "slapi/connection.h"

namespace orv::server {

class DirectoryBackend {
 public:
  // Number of the function that takes a password method.
  static constexpr int kTakePasswordMethod = -159;

  // Registers the backend for its lifetime. Throws std::runtime_error when the server has another
  // one for the suffix, and std::bad_alloc.
  DirectoryBackend();
  ~DirectoryBackend();
  DirectoryBackend(const DirectoryBackend&) = delete;
  DirectoryBackend& operator=(const DirectoryBackend&) = delete;

  Backend& record() noexcept { return backend_; }

 private:
  static constexpr const char* kSuffixes[] = {"CN=LOCALHOST", nullptr};
  Backend backend_;
};

}  // namespace orv::server
