// Lines of the error log about clients that met a limit, and no more of them than somebody can
// read.
//
// Whoever floods the server with what it refuses must not flood its log as well: of each kind, so
// many lines are written within an interval, and of the others only their number, when it has
// passed. The access log has a line for each connection all the same.
//
// Threads: thread-safe.
#pragma once

#include <array>
#include <chrono>
#include <cstdint>
#include <mutex>
#include <string_view>

#include "logs.h"
#include "ops/gate.h"

namespace orv::server {

// What was met; the number of lines is bounded for each.
enum class CutOff {
  connections,  // too many
  descriptors,  // none is left for a connection
  message,      // too big, or not finished in time
  handshake,    // of TLS, not finished in time
  certificate,  // of the client, not good any more
  bind,         // not finished in time, or nobody bound for too long
  output,       // not read
  changes,      // too many failed
};

class CutOffLog {
 public:
  static constexpr int kLines = 10;
  static constexpr std::chrono::seconds kInterval{60};

  explicit CutOffLog(Logs& logs) noexcept : logs_(logs) {}

  // Writes the line as a warning, or counts it.
  void tell(CutOff what, std::string_view line, Clock::time_point now = Clock::now()) noexcept;

  // Tells how many lines were not written in intervals that have passed. To be called now and then.
  void tick(Clock::time_point now) noexcept;

 private:
  struct Interval {
    Clock::time_point begun{};
    int written = 0;
    std::int64_t left_out = 0;
  };
  static constexpr std::size_t kKinds = static_cast<std::size_t>(CutOff::changes) + 1;

  void end(CutOff what, Interval& interval) noexcept;

  Logs& logs_;
  std::mutex mutex_;
  std::array<Interval, kKinds> intervals_;  // under the mutex
};

}  // namespace orv::server
