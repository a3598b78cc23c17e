#include "net/limits.h"

#include <utility>

namespace orv::server {

ConnectionCounter::Ticket::Ticket(Ticket&& other) noexcept
    : counter_(std::exchange(other.counter_, nullptr)), address_(std::move(other.address_)) {}

ConnectionCounter::Ticket& ConnectionCounter::Ticket::operator=(Ticket&& other) noexcept {
  if (this == &other) return *this;
  release();
  counter_ = std::exchange(other.counter_, nullptr);
  address_ = std::move(other.address_);
  return *this;
}

void ConnectionCounter::Ticket::release() noexcept {
  if (counter_) std::exchange(counter_, nullptr)->leave(address_);
}

ConnectionCounter::Ticket ConnectionCounter::admit(const std::string& address, std::int64_t in_all,
                                                   std::int64_t per_address) {
  const std::lock_guard lock(mutex_);
  if (count_ >= in_all) return {};
  std::int64_t& here = by_address_[address];
  if (here >= per_address) return {};
  ++here;
  ++count_;
  return Ticket(*this, address);
}

void ConnectionCounter::leave(const std::string& address) noexcept {
  const std::lock_guard lock(mutex_);
  --count_;
  const auto found = by_address_.find(address);
  if (found != by_address_.end() && --found->second == 0) by_address_.erase(found);
}

std::int64_t ConnectionCounter::count() const {
  const std::lock_guard lock(mutex_);
  return count_;
}

}  // namespace orv::server
