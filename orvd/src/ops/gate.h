// The gate: one call into the configuration backend at a time.
//
// Whoever finds it open goes through at once on the thread he is on. Whoever does not leaves a
// waiter; the gate passes from one holder to the next without opening in between. Waiters are
// admitted in the order they came, with one exception: those that queued on the thread that leaves
// go first, up to a bound of a few in a row, because passing the gate to another thread costs as
// much as a search. A waiter that is not admitted by its deadline is told so. Nothing here ever
// blocks a thread, except close_and_wait_until_empty, which the stopping server calls.
//
// All functions are thread-safe. Waiters are told their verdict without the gate's mutex held.
#pragma once

#include <chrono>
#include <condition_variable>
#include <list>
#include <memory>
#include <mutex>
#include <thread>

namespace orv::server {

using Clock = std::chrono::steady_clock;

enum class Verdict {
  admitted,  // the waiter holds the gate now and must leave() it
  late,      // its deadline passed
  closed,    // the gate admits nobody any more
};

// Somebody who waits at the gate.
class GateWaiter {
 public:
  virtual ~GateWaiter() = default;

  // Called exactly once for a waiter that was queued and not withdrawn, on whatever thread opened
  // the gate or noticed the deadline. Must only arrange for the work to go on elsewhere: the caller
  // may be about to serve a client of its own.
  virtual void gate_decided(Verdict verdict) noexcept = 0;
};

class Gate {
 public:
  enum class Entry { inside, queued, closed };

  Gate() = default;
  Gate(const Gate&) = delete;
  Gate& operator=(const Gate&) = delete;

  // Goes in when the gate is open and nobody waits; queues `waiter` otherwise, to be decided by
  // `deadline` (Clock::time_point::max(): no deadline). When the gate was closed, `waiter` is not
  // called.
  Entry enter(const std::shared_ptr<GateWaiter>& waiter, Clock::time_point deadline);

  // Queues `waiter` also when the gate is open: it is then admitted at once, but runs where its
  // gate_decided puts it. `queued` or `closed`.
  Entry enter_elsewhere(const std::shared_ptr<GateWaiter>& waiter, Clock::time_point deadline);

  // The holder is done: admits the next waiter or opens the gate.
  void leave() noexcept;

  // Takes a waiter out of the queue; false when it has been decided already (its gate_decided was
  // called or is being called).
  bool withdraw(const GateWaiter& waiter) noexcept;

  // Tells all waiters whose deadline is not after `now` that they are late.
  void expire(Clock::time_point now);

  // Admits nobody from now on and tells all waiters.
  void close() noexcept;

  // The same, then waits for the holder to leave; false when it has not within `patience`.
  bool close_and_wait_until_empty(std::chrono::milliseconds patience);

  // Number of waiters.
  std::size_t waiting() const;

 private:
  struct Place {
    std::shared_ptr<GateWaiter> waiter;
    Clock::time_point deadline;
    std::thread::id thread;  // on which it queued
  };
  using Queue = std::list<Place>;

  Entry join(const std::shared_ptr<GateWaiter>& waiter, Clock::time_point deadline, bool elsewhere);

  Queue::iterator next_in_turn() noexcept;

  mutable std::mutex mutex_;
  std::condition_variable emptied_;
  Queue queue_;
  bool held_ = false;
  bool closed_ = false;
  // How many waiters were admitted on the thread that left, while others waited.
  int in_a_row_ = 0;
};

}  // namespace orv::server
