// The audit log: one file to which every attempt to change the configuration is appended.
//
// A thread of its own writes, so that nobody waits for a disk who must not. The client of a change
// that was performed hears of it when the record is with the system, or after a moment without; no
// thread waits for that. What cannot be written never holds a change up and does not undo it
// either; the error log is told, once when it begins and once when it is over, with the number of
// records that were lost.
//
// A record is written with one call, and one that was written in part is taken back, so that the
// file stays readable. Nothing is flushed to the disk: after a power failure the last records may
// be missing, while the configuration is not.
//
// Threads: thread-safe.
#pragma once

#include <atomic>
#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "guarded_file.h"

namespace orv::server {

// Whose attempt a record is about: of somebody with access to the configuration, or of anybody who
// can connect.
enum class Attempt { of_administrator, of_stranger };

class AuditLog {
 public:
  // The most that may wait to be written. Strangers have room of their own, so that no flood of
  // theirs takes it from administrators.
  static constexpr std::size_t kMaxQueuedBytes = std::size_t{16} << 20;
  static constexpr std::size_t kMaxStrangersBytes = std::size_t{2} << 20;
  // How long a change waits for its record, and the end of the process for all of them.
  static constexpr std::chrono::milliseconds kPatience{1000};
  static constexpr std::chrono::milliseconds kLastPatience{3000};
  // How often it is told at most that records of strangers were given up.
  static constexpr std::chrono::seconds kStrangersInterval{60};

  // `complain` is called with a line for the error log when records cannot be written, and when
  // they can be again. From any thread; must not block or throw. Not called any more once finish()
  // or the destructor has returned.
  explicit AuditLog(std::function<void(std::string_view)> complain);
  ~AuditLog();
  AuditLog(const AuditLog&) = delete;
  AuditLog& operator=(const AuditLog&) = delete;

  // Writes to `path` from now on, also when it is the same path again (somebody may have moved the
  // file away); "" switches the log off. The file is made when it is missing, for its owner only.
  // Refused, with the reason returned and the file before kept: a symbolic link, anything but a
  // regular file, and whatever is one of the `guarded` files under another name. "" on success.
  std::string open(const std::string& path, const GuardedFiles& guarded);

  // The file that records go to, if there is one; it need not be the one that was wanted last.
  std::vector<FileInUse> files_in_use() const;

  // Whether records are wanted. While the file could not be opened they are, and count as lost.
  bool enabled() const noexcept { return enabled_.load(std::memory_order_relaxed); }

  // A record that was queued; 0: it was given up.
  using Ticket = std::uint64_t;

  // Queues a record for the file that is open now, and returns.
  Ticket write(std::string record, Attempt attempt = Attempt::of_administrator) noexcept;

  // Calls `then` once: when the record is written or cannot be, but when `kPatience` is over at the
  // latest, and at once while the file does not keep up. On the calling thread or on one of the
  // log's own, which it must not hold up; must not throw. Records are waited for in their order.
  void when_written(Ticket record, std::function<void()> then) noexcept;

  // Returns when every `then` has been called, which takes `kPatience` at most.
  void settle() noexcept;

  // Writes what is queued and ends. False when that takes longer than `patience`: the thread that
  // writes is then left behind, and the process should end without destructors.
  bool finish(std::chrono::milliseconds patience = kLastPatience) noexcept;

 private:
  struct Writer;

  std::shared_ptr<Writer> writer_;  // shared with its threads
  std::thread thread_;
  std::thread watch_;  // over how long records take
  std::atomic<bool> enabled_{false};
};

}  // namespace orv::server
