// Stopping a search from outside: a server sets a check for the thread that is about to run an
// operation, the library polls it for each entry it looks at, and within an entry when the filter
// has much to compare, and the search ends with 3.
#pragma once

namespace orv::cfg {

// Returns true when the running search is to stop. Must be cheap and must not block or throw.
using InterruptCheck = bool (*)(void* context) noexcept;

// Installs a check for the calling thread for the lifetime of the object; nests.
class InterruptScope {
 public:
  InterruptScope(InterruptCheck check, void* context) noexcept;
  ~InterruptScope();
  InterruptScope(const InterruptScope&) = delete;
  InterruptScope& operator=(const InterruptScope&) = delete;

 private:
  InterruptCheck previous_check_;
  void* previous_context_;
};

}  // namespace orv::cfg
