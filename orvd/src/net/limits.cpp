#include "net/limits.h"

#include <sys/resource.h>

#include <algorithm>
#include <limits>
#include <utility>

#include "process/key_memory.h"

namespace orv::server {
namespace {

// Descriptors that are no connections of other hosts: logs, loops, files of operations in hand.
constexpr rlim_t kOtherDescriptors = 96;

asio::ip::address_v6 network(const asio::ip::address_v6& address) {
  auto bytes = address.to_bytes();
  std::fill(bytes.begin() + 8, bytes.end(), static_cast<unsigned char>(0));
  return asio::ip::address_v6(bytes, address.scope_id());
}

std::int64_t connections_by_descriptors() noexcept {
  constexpr rlim_t kMost = std::numeric_limits<std::int32_t>::max();
  rlimit files{};
  if (::getrlimit(RLIMIT_NOFILE, &files) != 0) return static_cast<std::int64_t>(kMost);
  const rlim_t all = std::min(files.rlim_cur, kMost);  // RLIM_INFINITY is the largest
  return all > kOtherDescriptors ? static_cast<std::int64_t>(all - kOtherDescriptors) : 0;
}

}  // namespace

std::string counted_as(const asio::ip::address& address) {
  if (!address.is_v6() || address.to_v6().is_link_local()) return address.to_string();
  return network(address.to_v6()).to_string() + "/64";
}

Room room_for_connections() noexcept {
  const std::int64_t by_files = connections_by_descriptors();
  const std::int64_t by_keys = connections_with_room_for_keys();
  if (by_keys < by_files) return {by_keys, "the memory for keys"};
  return {by_files, "the limit of open files (RLIMIT_NOFILE)"};
}

std::int64_t connections_that_fit() noexcept {
  return room_for_connections().connections;
}

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
  std::string kept(address);  // nothing is counted when there is no memory for it
  const std::lock_guard lock(mutex_);
  if (count_ >= in_all) return {};
  std::int64_t& here = by_address_[address];
  if (here >= per_address) return {};
  ++here;
  ++count_;
  return Ticket(*this, std::move(kept));
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
