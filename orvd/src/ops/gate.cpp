#include "ops/gate.h"

#include <thread>
#include <utility>

namespace orv::server {
namespace {

// About the time of a few searches for one entry.
constexpr std::chrono::microseconds kMoment{40};

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
  if (!elsewhere) wait_a_moment();
  {
    const std::lock_guard lock(mutex_);
    if (closed_) return Entry::closed;
    if (held_.load(std::memory_order_relaxed)) {
      queue_.push_back({waiter, deadline});
      queued_.store(true, std::memory_order_relaxed);
      return Entry::queued;
    }
    // Open means that nobody waits: a holder that leaves hands over while there is a queue.
    held_.store(true, std::memory_order_relaxed);
  }
  if (!elsewhere) return Entry::inside;
  waiter->gate_decided(Verdict::admitted);
  return Entry::queued;
}

void Gate::wait_a_moment() const noexcept {
  const auto worth_it = [this] {
    return held_.load(std::memory_order_relaxed) && !queued_.load(std::memory_order_relaxed);
  };
  if (!worth_it()) return;
  const Clock::time_point end = Clock::now() + kMoment;
  while (worth_it() && Clock::now() < end) std::this_thread::yield();
}

void Gate::leave() noexcept {
  std::shared_ptr<GateWaiter> next;
  {
    const std::lock_guard lock(mutex_);
    if (queue_.empty()) {
      held_.store(false, std::memory_order_relaxed);
      emptied_.notify_all();
      return;
    }
    next = std::move(queue_.front().waiter);
    queue_.pop_front();
    queued_.store(!queue_.empty(), std::memory_order_relaxed);
  }
  next->gate_decided(Verdict::admitted);
}

bool Gate::withdraw(const GateWaiter& waiter) noexcept {
  std::list<Place> removed;  // destroyed after the mutex is released
  const std::lock_guard lock(mutex_);
  for (auto it = queue_.begin(); it != queue_.end(); ++it) {
    if (it->waiter.get() != &waiter) continue;
    removed.splice(removed.begin(), queue_, it);
    queued_.store(!queue_.empty(), std::memory_order_relaxed);
    return true;
  }
  return false;
}

void Gate::expire(Clock::time_point now) {
  std::list<Place> late;
  {
    const std::lock_guard lock(mutex_);
    for (auto it = queue_.begin(); it != queue_.end();) {
      const auto place = it++;
      if (place->deadline <= now) late.splice(late.end(), queue_, place);
    }
    queued_.store(!queue_.empty(), std::memory_order_relaxed);
  }
  for (const Place& place : late) place.waiter->gate_decided(Verdict::late);
}

void Gate::close() noexcept {
  std::list<Place> refused;
  {
    const std::lock_guard lock(mutex_);
    closed_ = true;
    refused.swap(queue_);
    queued_.store(false, std::memory_order_relaxed);
  }
  for (const Place& place : refused) place.waiter->gate_decided(Verdict::closed);
}

bool Gate::close_and_wait_until_empty(std::chrono::milliseconds patience) {
  close();
  std::unique_lock lock(mutex_);
  return emptied_.wait_for(lock, patience,
                           [this] { return !held_.load(std::memory_order_relaxed); });
}

std::size_t Gate::waiting() const {
  const std::lock_guard lock(mutex_);
  return queue_.size();
}

}  // namespace orv::server
