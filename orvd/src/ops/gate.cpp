#include "ops/gate.h"

#include <algorithm>
#include <utility>

namespace orv::server {

Gate::Entry Gate::enter(const std::shared_ptr<GateWaiter>& waiter, Clock::time_point deadline,
                        GateUser* user) {
  return join({waiter, deadline, std::this_thread::get_id(), user, 0}, false);
}

Gate::Entry Gate::enter_elsewhere(const std::shared_ptr<GateWaiter>& waiter,
                                  Clock::time_point deadline, GateUser* user) {
  return join({waiter, deadline, std::this_thread::get_id(), user, 0}, true);
}

Gate::Entry Gate::join(const Place& place, bool elsewhere) {
  {
    const std::lock_guard lock(mutex_);
    if (closed_) return Entry::closed;
    if (held_) {
      const bool lasting = elsewhere || must_stay_behind(place);
      Queue& queue = lasting ? lasting_ : brief_;
      queue.push_back(place);
      queue.back().number = ++arrivals_;
      if (lasting && place.user) ++place.user->lasting_;
      return Entry::queued;
    }
    // Open means that nobody waits: a holder that leaves hands over while there is a queue.
    held_ = true;
  }
  if (!elsewhere) return Entry::inside;
  place.waiter->gate_decided(Verdict::admitted);
  return Entry::queued;
}

bool Gate::must_stay_behind(const Place& place) const noexcept {
  return place.user && place.user->lasting_ > 0;
}

void Gate::leave() noexcept {
  Queue next;  // destroyed after the mutex is released
  {
    const std::lock_guard lock(mutex_);
    if (brief_.empty() && lasting_.empty()) {
      held_ = false;
      in_a_row_ = 0;
      if (closed_) emptied_.notify_all();
      return;
    }
    admit_next(next);
  }
  next.front().waiter->gate_decided(Verdict::admitted);
}

// Somebody waits.
void Gate::admit_next(Queue& next) noexcept {
  if (lasting_.empty()) {
    overtaking_ = 0;
    return next.splice(next.begin(), brief_, next_brief());
  }
  if (!brief_.empty() && may_go_first()) return next.splice(next.begin(), brief_, next_brief());
  if (!brief_.empty() && brief_.front().number < lasting_.front().number)
    return next.splice(next.begin(), brief_, brief_.begin());
  take_lasting(next, lasting_.begin());
  overtaking_ = 0;
}

// Whether one more brief waiter may go before the lasting one in front, and counts it.
bool Gate::may_go_first() noexcept {
  const Clock::time_point now = now_();
  if (overtaking_ == 0) first_overtaking_ = now;
  if (overtaking_ == kMostOvertaking || now - first_overtaking_ >= kOvertakingTime) return false;
  ++overtaking_;
  return true;
}

// Some brief waiter is there.
Gate::Queue::iterator Gate::next_brief() noexcept {
  const std::thread::id here = std::this_thread::get_id();
  const auto own = in_a_row_ < kMostInARow
                       ? std::find_if(brief_.begin(), brief_.end(),
                                      [here](const Place& place) { return place.thread == here; })
                       : brief_.end();
  if (own == brief_.begin() || own == brief_.end()) {
    in_a_row_ = 0;
    return brief_.begin();
  }
  ++in_a_row_;
  return own;
}

void Gate::take_lasting(Queue& to, Queue::iterator place) noexcept {
  if (place->user) --place->user->lasting_;
  to.splice(to.end(), lasting_, place);
}

bool Gate::withdraw(const GateWaiter& waiter) noexcept {
  Queue removed;  // destroyed after the mutex is released
  const std::lock_guard lock(mutex_);
  const auto is_it = [&waiter](const Place& place) { return place.waiter.get() == &waiter; };
  if (const auto it = std::find_if(brief_.begin(), brief_.end(), is_it); it != brief_.end()) {
    removed.splice(removed.begin(), brief_, it);
  } else if (const auto at = std::find_if(lasting_.begin(), lasting_.end(), is_it);
             at != lasting_.end()) {
    take_lasting(removed, at);
  }
  return !removed.empty();
}

void Gate::expire(Clock::time_point now) {
  Queue late;
  {
    const std::lock_guard lock(mutex_);
    for (auto it = brief_.begin(); it != brief_.end();) {
      const auto place = it++;
      if (place->deadline <= now) late.splice(late.end(), brief_, place);
    }
    for (auto it = lasting_.begin(); it != lasting_.end();) {
      const auto place = it++;
      if (place->deadline <= now) take_lasting(late, place);
    }
  }
  for (const Place& place : late) place.waiter->gate_decided(Verdict::late);
}

void Gate::close() noexcept {
  Queue refused;
  {
    const std::lock_guard lock(mutex_);
    closed_ = true;
    refused.swap(brief_);
    while (!lasting_.empty()) take_lasting(refused, lasting_.begin());
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
  return brief_.size() + lasting_.size();
}

}  // namespace orv::server
