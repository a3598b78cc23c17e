// The gate: one call into the configuration backend at a time.
//
// Whoever finds it open goes through at once on the thread he is on. Whoever does not leaves a
// waiter; the gate passes from one holder to the next without opening in between. Waiters are
// admitted in the order they came, with two exceptions:
// - Brief ones (short searches) go before lasting ones (changes, which wait for the disk, and long
//   searches): what takes microseconds need not wait behind what takes milliseconds. Before the
//   lasting one in front go kMostOvertaking at most, and for kOvertakingTime at most from the first
//   of them on; then the order is again that in which they came, until a lasting one was admitted.
//   No search goes before a lasting waiter of the same connection that was there before it.
// - Among brief ones, those that queued on the thread that leaves go first, a few in a row, because
//   passing the gate to another thread costs as much as a search.
// A waiter that is not admitted by its deadline is told so. Nothing here ever blocks a thread,
// except close_and_wait_until_empty, which the stopping server calls.
//
// All functions are thread-safe. Waiters are told their verdict without the gate's mutex held.
#pragma once

#include <chrono>
#include <condition_variable>
#include <cstdint>
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

// A connection, as the gate has to know it. It outlives those of its waiters that are queued, and
// belongs to the gate.
class GateUser {
  friend class Gate;
  std::size_t lasting_ = 0;  // its waiters that nobody of the same connection may overtake
};

class Gate {
 public:
  enum class Entry { inside, queued, closed };
  using Now = Clock::time_point (*)();

  // How many brief waiters go before the lasting one in front, and for how long.
  static constexpr int kMostOvertaking = 64;
  static constexpr std::chrono::milliseconds kOvertakingTime{5};
  // How many brief waiters are admitted on the thread that leaves, while others wait.
  static constexpr int kMostInARow = 16;

  explicit Gate(Now now = &Clock::now) noexcept : now_(now) {}
  Gate(const Gate&) = delete;
  Gate& operator=(const Gate&) = delete;

  // For brief work: goes in when the gate is open and nobody waits; queues `waiter` otherwise, to
  // be decided by `deadline` (Clock::time_point::max(): no deadline). `user`: whose it is; null:
  // nobody else's. When the gate was closed, `waiter` is not called.
  Entry enter(const std::shared_ptr<GateWaiter>& waiter, Clock::time_point deadline,
              GateUser* user = nullptr);

  // For lasting work: queues `waiter` also when the gate is open: it is then admitted at once, but
  // runs where its gate_decided puts it. `queued` or `closed`.
  Entry enter_elsewhere(const std::shared_ptr<GateWaiter>& waiter, Clock::time_point deadline,
                        GateUser* user = nullptr);

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
    GateUser* user;
    std::uint64_t number;  // in the order of arrival
  };
  using Queue = std::list<Place>;

  Entry join(const Place& place, bool elsewhere);
  bool must_stay_behind(const Place& place) const noexcept;
  bool may_go_first() noexcept;
  Queue::iterator next_brief() noexcept;
  void admit_next(Queue& next) noexcept;
  void take_lasting(Queue& to, Queue::iterator place) noexcept;

  const Now now_;
  mutable std::mutex mutex_;
  std::condition_variable emptied_;
  Queue brief_;
  Queue lasting_;  // with brief waiters of connections that have lasting ones here
  bool held_ = false;
  bool closed_ = false;
  std::uint64_t arrivals_ = 0;
  // How many brief waiters were admitted on the thread that left, while others waited.
  int in_a_row_ = 0;
  // How many went before the lasting waiter in front, and since when.
  int overtaking_ = 0;
  Clock::time_point first_overtaking_{};
};

}  // namespace orv::server
