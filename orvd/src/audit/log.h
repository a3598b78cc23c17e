// The audit log: one file to which every attempt to change the configuration is appended.
//
// A thread of its own writes, so that nobody waits for a disk who must not. A change that was
// performed waits for its record, for a moment: its client hears of it when the record is with the
// system. What cannot be written never holds a change up and does not undo it either; the error log
// is told, once when it begins and once when it is over, with the number of records that were lost.
//
// A record is written with one call, and one that was written in part is taken back, so that the
// file stays readable. Nothing is flushed to the disk: after a power failure the last records may
// be missing, while the configuration is not.
//
// Threads: thread-safe.
#pragma once

#include <atomic>
#include <chrono>
#include <functional>
#include <memory>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

namespace orv::server {

class AuditLog {
 public:
  // The most that may wait to be written.
  static constexpr std::size_t kMaxQueuedBytes = std::size_t{16} << 20;
  // How long a change waits for its record, and the end of the process for all of them.
  static constexpr std::chrono::milliseconds kPatience{1000};
  static constexpr std::chrono::milliseconds kLastPatience{3000};

  // `complain` is called with a line for the error log when records cannot be written, and when
  // they can be again. From any thread; must not block or throw.
  explicit AuditLog(std::function<void(std::string_view)> complain);
  ~AuditLog();
  AuditLog(const AuditLog&) = delete;
  AuditLog& operator=(const AuditLog&) = delete;

  // Writes to `path` from now on, also when it is the same path again (somebody may have moved the
  // file away); "" switches the log off. The file is made when it is missing, for its owner only.
  // Refused, with the reason returned and the file before kept: a symbolic link, anything but a
  // regular file, and whatever is one of the `guarded` files under another name. "" on success.
  std::string open(const std::string& path, const std::vector<std::string>& guarded);

  // Whether records are wanted. While the file could not be opened they are, and count as lost.
  bool enabled() const noexcept { return enabled_.load(std::memory_order_relaxed); }

  // Queues a record and returns.
  void write(std::string record) noexcept;

  // Queues a record and waits until it is written or cannot be, but not longer than `kPatience`,
  // and not at all while the file does not keep up. Not for a thread that serves clients.
  void write_and_wait(std::string record) noexcept;

  // Writes what is queued and ends. False when that takes longer than `patience`; the thread is
  // then left behind.
  bool finish(std::chrono::milliseconds patience = kLastPatience) noexcept;

 private:
  struct File;
  struct Writer;

  std::shared_ptr<Writer> writer_;  // shared with its thread
  std::thread thread_;
  std::atomic<bool> enabled_{false};
};

}  // namespace orv::server
