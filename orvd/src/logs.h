// The error log and the access log.
//
// Writers never wait for a disk or a terminal: lines go to queues that a thread of its own empties.
// Each queue is bounded by bytes; when a sink stalls for long, the oldest lines are given up, and
// the error log says how many. Each event loop collects its access lines in a lane of its own and
// hands them over in batches.
//
// Threads: `Logs` is thread-safe; an `AccessLane` belongs to one thread.
#pragma once

#include <atomic>
#include <chrono>
#include <cstdint>
#include <memory>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "guarded_file.h"
#include "settings.h"

namespace orv::server {

enum class LogLevel { error, warning, info, debug, off };

class Logs {
 public:
  // The most that one queue holds.
  static constexpr std::size_t kMaxQueuedBytes = 8 * 1024 * 1024;
  // The longest line of the error log, before control characters are escaped; what is longer is
  // cut, with its length behind it.
  static constexpr std::size_t kMaxErrorLine = 8192;
  // How long finish() waits for what is queued.
  static constexpr std::chrono::milliseconds kPatience{3000};

  // Starts with the error log on standard error at level info and no access log. `guarded` are
  // files that no log may ever be (the configuration file, its save file, the key stash).
  explicit Logs(GuardedFiles guarded = {});
  ~Logs();
  Logs(const Logs&) = delete;
  Logs& operator=(const Logs&) = delete;

  // Opens what the settings name, also when they name the same files again (somebody may have moved
  // them away). A log that cannot be opened, or is a guarded file, one of `others` (that further
  // logs have open now), the audit log that the settings name, or the other log, under whatever
  // name, keeps the file it had; the reasons are returned, one line each.
  std::vector<std::string> open(const Settings& settings,
                                const std::vector<FileInUse>& others = {});

  // The files that the logs go to now.
  std::vector<FileInUse> files_in_use() const;

  // Writes one line to the error log.
  void write(LogLevel level, std::string_view line) noexcept;
  void error(std::string_view line) noexcept { write(LogLevel::error, line); }
  void warning(std::string_view line) noexcept { write(LogLevel::warning, line); }
  void info(std::string_view line) noexcept { write(LogLevel::info, line); }

  // Whether operations are to be written to the access log.
  bool access_enabled() const noexcept { return access_on_.load(std::memory_order_relaxed); }

  // Writes finished access lines.
  void write_access(std::string_view lines) noexcept;

  // Bytes that wait to be written.
  std::size_t queued_bytes() const;

  // Waits until everything written so far is out and closes the logs; later errors go straight to
  // standard error. False when something was still waiting after `patience`: the thread that writes
  // is then left behind, and the process should end without destructors. For the end of the
  // process.
  bool finish(std::chrono::milliseconds patience = kPatience) noexcept;

 private:
  struct Log;
  struct Writer;

  // False when the log is not open or closed again.
  bool queue(bool access, LogLevel level, std::string_view text);

  const GuardedFiles guarded_;
  std::shared_ptr<Writer> writer_;  // shared with its thread
  std::thread thread_;
  std::atomic<bool> access_on_{false};
};

// Access lines of one thread that are not handed over yet.
class AccessLane {
 public:
  explicit AccessLane(Logs& logs) : logs_(logs) {}
  ~AccessLane() { flush(); }

  bool enabled() const noexcept { return logs_.access_enabled(); }

  // Appends "TIME conn=N " and lets the caller append the rest; call end() afterwards.
  std::string& begin(std::uint64_t connection);
  void end();

  // Hands over what is collected.
  void flush() noexcept;

 private:
  Logs& logs_;
  std::string lines_;
  std::int64_t second_ = -1;
  std::string second_text_;
};

// Appends `text` in double quotes, with quotes and control characters as \XX.
void append_quoted(std::string& line, std::string_view text);
void append_number(std::string& line, std::int64_t number);

}  // namespace orv::server
