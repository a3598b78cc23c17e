// Whether a client takes its answers fast enough: something of them within each so many seconds,
// and on average so many bytes a second.
//
// Threads: none of its own.
#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>

#include "ops/gate.h"

namespace orv::server {

class Pace {
 public:
  // There is something to take, and was nothing before.
  void begin(Clock::time_point now) noexcept {
    progress_ = period_ = now;
    taken_ = 0;
  }
  void took(std::size_t bytes, Clock::time_point now) noexcept {
    progress_ = now;
    taken_ += bytes;
  }

  // `patience` in seconds, `rate` in bytes a second (0: one byte is progress enough). The average
  // is that of periods as long as the patience, one after the other.
  bool too_slow(Clock::time_point now, std::int64_t patience, std::int64_t rate) noexcept {
    const std::chrono::seconds length(patience);
    if (now - progress_ >= length) return true;
    if (now - period_ < length) return false;
    if (taken_ < static_cast<std::uint64_t>(patience * rate)) return true;
    period_ = now;
    taken_ = 0;
    return false;
  }

 private:
  Clock::time_point progress_{};
  Clock::time_point period_{};
  std::uint64_t taken_ = 0;  // since the period began
};

}  // namespace orv::server
