// What clients may cost the server by changes that fail.
//
// The backend keeps the copy that it made of a modification's list when the modification fails, for
// as long as the process lives. So each identity has an allowance of such bytes, and each
// connection a part of it: a client that fails in a loop does not shut out others of the same name.
// An allowance that is used up comes back evenly, the whole of it within a day. The change that
// overdraws it is let through, however large it is; those after it wait until what was overdrawn
// has come back, for a day at most.
//
// All identities together have a larger one, so that many of them do not add up. The primary
// administrator is outside of it: members could use it up on purpose to keep him from mending what
// they do.
//
// Threads: `FailedChanges` belongs to one thread at a time, `FailedChangesByName` is thread-safe.
#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <mutex>
#include <string>
#include <string_view>

#include "ops/gate.h"

namespace orv::server {

// One allowance.
class FailedChanges {
 public:
  // Whether `limit` bytes, less what has come back since, are used up.
  bool used_up(std::int64_t limit, Clock::time_point now) noexcept;
  void charge(std::int64_t bytes, std::int64_t limit, Clock::time_point now) noexcept;
  // Nothing is owed any more.
  bool settled(std::int64_t limit, Clock::time_point now) noexcept;

 private:
  void refill(std::int64_t limit, Clock::time_point now) noexcept;

  double used_ = 0;
  Clock::time_point counted_{};  // what came back until then is taken off
};

// Those of all identities, by bind DN.
class FailedChangesByName {
 public:
  bool used_up(std::string_view name, std::int64_t limit, Clock::time_point now) noexcept;
  // Without memory for a name that is new, nothing is noted.
  void charge(std::string_view name, std::int64_t bytes, std::int64_t limit,
              Clock::time_point now) noexcept;
  std::size_t names() const noexcept;

  // That of all together.
  bool all_used_up(std::int64_t limit, Clock::time_point now) noexcept;
  void charge_all(std::int64_t bytes, std::int64_t limit, Clock::time_point now) noexcept;

 private:
  // Names are forgotten again beyond so many, when they owe nothing.
  static constexpr std::size_t kMostNames = 1024;

  void forget_settled(std::int64_t limit, Clock::time_point now) noexcept;

  mutable std::mutex mutex_;
  std::map<std::string, FailedChanges, std::less<>> owed_;  // under the mutex
  FailedChanges of_all_;                                    // the same
};

// A connection may use up so much of its identity's allowance.
constexpr std::int64_t share_of_connection(std::int64_t limit) noexcept {
  constexpr std::int64_t kConnections = 4;
  return limit / kConnections;
}

}  // namespace orv::server
