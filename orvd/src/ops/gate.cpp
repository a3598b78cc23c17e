#include "ops/gate.h"

#include <algorithm>
#include <utility>

namespace orv::server {
namespace {

constexpr int kMostInARow = 16;

}  // namespace

Gate::Entry Gate::enter(const std::shared_ptr<GateWaiter>& waiter, Clock::time_point deadline) {
  return join(waiter, deadline, false);
}

Gate::Entry Gate::enter_elsewhere(const std::shared_ptr<GateWaiter>& waiter,
                                  Clock::time_point deadline) {
  return join(waiter, deadline, true);
}

Gate::Entry Gate::join(const std::shared_ptr<GateWaiter>& waiter, Clock::time_point deadline,
                       bool elsewhere) {
  {
    const std::lock_guard lock(mutex_);
    if (closed_) return Entry::closed;
    if (held_) {
      queue_.push_back({waiter, deadline, std::this_thread::get_id()});
      return Entry::queued;
    }
    // Open means that nobody waits: a holder that leaves hands over while there is a queue.
    held_ = true;
  }
  if (!elsewhere) return Entry::inside;
  waiter->gate_decided(Verdict::admitted);
  return Entry::queued;
}

void Gate::leave() noexcept {
  Queue next;  // destroyed after the mutex is released
  {
    const std::lock_guard lock(mutex_);
    if (queue_.empty()) {
      held_ = false;
      in_a_row_ = 0;
      if (closed_) emptied_.notify_all();
      return;
    }
    next.splice(next.begin(), queue_, next_in_turn());
  }
  next.front().waiter->gate_decided(Verdict::admitted);
}

// The queue is not empty.
Gate::Queue::iterator Gate::next_in_turn() noexcept {
  const std::thread::id here = std::this_thread::get_id();
  const auto own = in_a_row_ < kMostInARow
                       ? std::find_if(queue_.begin(), queue_.end(),
                                      [here](const Place& place) { return place.thread == here; })
                       : queue_.end();
  if (own == queue_.begin() || own == queue_.end()) {
    in_a_row_ = 0;
    return queue_.begin();
  }
  ++in_a_row_;
  return own;
}

bool Gate::withdraw(const GateWaiter& waiter) noexcept {
  Queue removed;  // destroyed after the mutex is released
  const std::lock_guard lock(mutex_);
  for (auto it = queue_.begin(); it != queue_.end(); ++it) {
    if (it->waiter.get() != &waiter) continue;
    removed.splice(removed.begin(), queue_, it);
    return true;
  }
  return false;
}

void Gate::expire(Clock::time_point now) {
  Queue late;
  {
    const std::lock_guard lock(mutex_);
    for (auto it = queue_.begin(); it != queue_.end();) {
      const auto place = it++;
      if (place->deadline <= now) late.splice(late.end(), queue_, place);
    }
  }
  for (const Place& place : late) place.waiter->gate_decided(Verdict::late);
}

void Gate::close() noexcept {
  Queue refused;
  {
    const std::lock_guard lock(mutex_);
    closed_ = true;
    refused.swap(queue_);
  }
  for (const Place& place : refused) place.waiter->gate_decided(Verdict::closed);
}

bool Gate::close_and_wait_until_empty(std::chrono::milliseconds patience) {
  close();
  std::unique_lock lock(mutex_);
  return emptied_.wait_for(lock, patience, [this] { return !held_; });
}

std::size_t Gate::waiting() const {
  const std::lock_guard lock(mutex_);
  return queue_.size();
}

}  // namespace orv::server
