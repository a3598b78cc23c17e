#include "cut_off_log.h"

#include <string>

namespace orv::server {
namespace {

constexpr const char* kNames[] = {
    "connections that were refused",
    "connections for which no descriptor was left",
    "messages that were too big or late",
    "TLS handshakes that were late",
    "clients whose certificates were no longer good",
    "connections on which nobody bound in time",
    "clients that did not read",
    "modifications refused after too many had failed",
};

}  // namespace

void CutOffLog::tell(CutOff what, std::string_view line, Clock::time_point now) noexcept {
  const std::lock_guard lock(mutex_);
  Interval& interval = intervals_[static_cast<std::size_t>(what)];
  if (now - interval.begun >= kInterval) {
    end(what, interval);
    interval.begun = now;
  }
  if (interval.written < kLines) {
    ++interval.written;
    logs_.warning(line);
  } else {
    ++interval.left_out;
  }
}

void CutOffLog::tick(Clock::time_point now) noexcept {
  const std::lock_guard lock(mutex_);
  for (std::size_t i = 0; i < kKinds; ++i)
    if (now - intervals_[i].begun >= kInterval) end(static_cast<CutOff>(i), intervals_[i]);
}

void CutOffLog::end(CutOff what, Interval& interval) noexcept {
  const std::int64_t left_out = interval.left_out;
  interval.written = 0;
  interval.left_out = 0;
  if (left_out == 0) return;
  try {
    std::string line = "within " + std::to_string(kInterval.count()) + " s also ";
    append_number(line, left_out);
    logs_.warning(line.append(" ").append(kNames[static_cast<std::size_t>(what)]));
  } catch (...) {
    // Without memory the line is lost.
  }
}

}  // namespace orv::server
