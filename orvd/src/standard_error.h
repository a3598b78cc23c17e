// Standard error that never makes anybody wait.
//
// Whoever starts the server decides what standard error is: a terminal, a file, a pipe to somebody
// who has stopped reading. Much is written there in places that must not wait, some of it by a
// plug-in that knows nothing about this. So descriptor 2 becomes a pipe of the server's own whose
// writing end does not block, and a thread carries what comes out of it to the standard error that
// was there before. What that one does not take is kept up to a bound; beyond it lines are dropped
// and counted, and the count is written once there is room again.
//
// The flags of the original descriptor are left alone: others may share it.
#pragma once

#include <chrono>
#include <memory>
#include <thread>

namespace orv::server {

class StandardError {
 public:
  // Puts the pipe in place. When that is not possible, standard error stays what it is. One object
  // a process, made before other threads are.
  StandardError() noexcept;

  // Carries over what was written so far, as long as somebody takes it, and puts the original back.
  // When it is stuck for the patience below, the pipe stays and the rest is lost.
  ~StandardError();
  StandardError(const StandardError&) = delete;
  StandardError& operator=(const StandardError&) = delete;

  static constexpr std::chrono::milliseconds kPatience{2000};

 private:
  struct State;
  std::shared_ptr<State> state_;  // shared with the thread, which may have to be left behind
  std::thread thread_;
};

// Waits until what was written to standard error so far has been carried over, at most `patience`.
// For the last words before _Exit. Nothing to do while no `StandardError` is in place. Usable in a
// signal handler.
void drain_standard_error(std::chrono::milliseconds patience) noexcept;

}  // namespace orv::server
