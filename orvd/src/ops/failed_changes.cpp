#include "ops/failed_changes.h"

#include <algorithm>
#include <iterator>

namespace orv::server {
namespace {

constexpr std::chrono::duration<double> kWholeAllowance = std::chrono::hours(24);

}  // namespace

// ---- One allowance

void FailedChanges::refill(std::int64_t limit, Clock::time_point now) noexcept {
  if (now <= counted_) return;
  const std::chrono::duration<double> elapsed = now - counted_;
  used_ = std::max(0.0, used_ - static_cast<double>(limit) * (elapsed / kWholeAllowance));
  counted_ = now;
}

bool FailedChanges::used_up(std::int64_t limit, Clock::time_point now) noexcept {
  refill(limit, now);
  return used_ > static_cast<double>(limit);
}

void FailedChanges::charge(std::int64_t bytes, std::int64_t limit, Clock::time_point now) noexcept {
  refill(limit, now);
  used_ = std::min(used_ + static_cast<double>(bytes), 2 * static_cast<double>(limit));
}

bool FailedChanges::settled(std::int64_t limit, Clock::time_point now) noexcept {
  refill(limit, now);
  return used_ == 0;
}

// ---- Those of all identities

bool FailedChangesByName::used_up(std::string_view name, std::int64_t limit,
                                  Clock::time_point now) noexcept {
  const std::lock_guard lock(mutex_);
  const auto found = owed_.find(name);
  return found != owed_.end() && found->second.used_up(limit, now);
}

void FailedChangesByName::charge(std::string_view name, std::int64_t bytes, std::int64_t limit,
                                 Clock::time_point now) noexcept {
  try {
    const std::lock_guard lock(mutex_);
    if (owed_.size() >= kMostNames) forget_settled(limit, now);
    owed_[std::string(name)].charge(bytes, limit, now);
  } catch (...) {
    // The connection's own allowance is charged all the same.
  }
}

bool FailedChangesByName::all_used_up(std::int64_t limit, Clock::time_point now) noexcept {
  const std::lock_guard lock(mutex_);
  return of_all_.used_up(limit, now);
}

void FailedChangesByName::charge_all(std::int64_t bytes, std::int64_t limit,
                                     Clock::time_point now) noexcept {
  const std::lock_guard lock(mutex_);
  of_all_.charge(bytes, limit, now);
}

void FailedChangesByName::forget_settled(std::int64_t limit, Clock::time_point now) noexcept {
  for (auto name = owed_.begin(); name != owed_.end();)
    name = name->second.settled(limit, now) ? owed_.erase(name) : std::next(name);
}

std::size_t FailedChangesByName::names() const noexcept {
  const std::lock_guard lock(mutex_);
  return owed_.size();
}

}  // namespace orv::server
