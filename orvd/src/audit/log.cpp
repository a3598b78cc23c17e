#include "audit/log.h"

#include <fcntl.h>
#include <pthread.h>

#include <cerrno>
#include <condition_variable>
#include <cstring>
#include <deque>
#include <mutex>
#include <utility>

#include "audit/record_file.h"

namespace orv::server {
namespace {

using Clock = std::chrono::steady_clock;

// What a queued record costs beside its text.
constexpr std::size_t kRecordBytes = 128;

}  // namespace

// ---- the queue

struct AuditLog::Writer {
  struct Record {
    std::shared_ptr<RecordFile> file;  // null: there is none
    std::string text;
    Attempt attempt;

    std::size_t size() const noexcept { return text.size() + kRecordBytes; }
  };
  // Somebody who waits for a record. All have the same patience, so they run out in their order.
  struct Waiter {
    Ticket record;
    Clock::time_point until;
    std::function<void()> then;
  };

  explicit Writer(std::function<void(std::string_view)> told) : complain(std::move(told)) {}

  std::mutex mutex;  // guards all
  std::condition_variable changed;
  std::condition_variable somebody_waits;
  std::function<void(std::string_view)> complain;
  std::shared_ptr<RecordFile> file;
  std::deque<Record> records;
  std::size_t bytes = 0;            // of administrators' records
  std::size_t strangers_bytes = 0;  // of strangers'
  Ticket queued = 0;                // the record queued last
  Ticket done = 0;                  // and the one that was written, or given up, last
  std::deque<Waiter> waiters;
  std::size_t calling = 0;  // waiters that are being called
  bool watching = false;    // until the first one's time is over
  bool behind = false;      // somebody waited in vain for his record since one was done
  bool ending = false;
  bool ended = false;
  std::uint64_t lost = 0;  // since the last good write
  std::uint64_t strangers_lost = 0;
  Clock::time_point next_word_on_strangers{};

  // ---- writing

  void run() noexcept {
    std::unique_lock lock(mutex);
    while (wait(lock)) write_one(lock);
    ended = true;
    changed.notify_all();
  }

  // False at the end, when everything is written.
  bool wait(std::unique_lock<std::mutex>& lock) {
    changed.wait(lock, [this] { return !records.empty() || ending; });
    return !records.empty();
  }

  std::size_t& bytes_of(Attempt attempt) noexcept {
    return attempt == Attempt::of_stranger ? strangers_bytes : bytes;
  }

  void write_one(std::unique_lock<std::mutex>& lock) noexcept {
    Record record = std::move(records.front());
    records.pop_front();
    bytes_of(record.attempt) -= record.size();
    lock.unlock();
    const int failure = record.file ? record.file->append(record.text) : ENOENT;
    lock.lock();
    ++done;
    behind = false;
    if (failure != 0)
      lose(record.file.get(), failure);
    else if (lost > 0)
      say("the audit log is written again; records lost: ", std::exchange(lost, 0));
    call_waiters(lock, [this](const Waiter& waiter) { return waiter.record <= done; });
  }

  Ticket push(std::string&& text, Attempt attempt) noexcept {
    const std::size_t size = text.size() + kRecordBytes;
    const std::size_t room = attempt == Attempt::of_stranger ? kMaxStrangersBytes : kMaxQueuedBytes;
    if (ending || bytes_of(attempt) + size > room) {
      if (attempt == Attempt::of_stranger)
        lose_strangers();
      else
        lose(file.get(), EAGAIN);
      return 0;
    }
    try {
      records.push_back({file, std::move(text), attempt});
    } catch (...) {
      lose(file.get(), ENOMEM);
      return 0;
    }
    bytes_of(attempt) += size;
    changed.notify_all();
    return ++queued;
  }

  // ---- those who wait for a record

  // False when there is no reason, or no room, to wait.
  bool add_waiter(Ticket record, std::function<void()>& then) noexcept {
    if (record <= done || behind) return false;
    try {
      waiters.push_back({record, Clock::now() + kPatience, {}});
    } catch (...) {
      return false;
    }
    waiters.back().then = std::move(then);
    if (!watching) somebody_waits.notify_all();
    return true;
  }

  // Ends the wait of the first ones, as long as `is_over` says so. Unlocks meanwhile.
  template <typename IsOver>
  void call_waiters(std::unique_lock<std::mutex>& lock, IsOver is_over) noexcept {
    while (!waiters.empty() && is_over(waiters.front())) {
      std::function<void()> then = std::move(waiters.front().then);
      waiters.pop_front();
      ++calling;
      lock.unlock();
      then();
      then = nullptr;
      lock.lock();
      --calling;
    }
    changed.notify_all();
    if (ending) somebody_waits.notify_all();
  }

  // Ends waits that last too long, until the log ends.
  void watch() noexcept {
    std::unique_lock lock(mutex);
    for (;;) {
      somebody_waits.wait(lock, [this] { return !waiters.empty() || ending; });
      if (waiters.empty()) return;
      // Who comes meanwhile has time until later.
      const Clock::time_point until = waiters.front().until;
      watching = true;
      somebody_waits.wait_until(
          lock, until, [&] { return Clock::now() >= until || (ending && waiters.empty()); });
      watching = false;
      call_waiters(lock, [this](const Waiter& waiter) {
        const bool is_over = waiter.until <= Clock::now();
        if (is_over) behind = true;
        return is_over;
      });
    }
  }

  // ---- complaints

  // The first of a row of lost records is told at once, the others with their number at its end.
  void lose(const RecordFile* where, int failure) noexcept {
    if (lost++ > 0) return;
    try {
      if (complain)
        complain("the audit log cannot be written" + (where ? ": " + where->path() : "") + ": " +
                 (where ? std::strerror(failure) : "no file is open") +
                 "; changes are made without record");
    } catch (...) {
      // Without memory to say it.
    }
  }

  // Whoever sends more than can be written must not fill the error log instead.
  void lose_strangers() noexcept {
    ++strangers_lost;
    const Clock::time_point now = Clock::now();
    if (now < next_word_on_strangers) return;
    next_word_on_strangers = now + kStrangersInterval;
    tell_of_strangers();
  }

  void tell_of_strangers() noexcept {
    if (strangers_lost == 0) return;
    say("the audit log cannot keep up with attempts from outside; records given up: ",
        std::exchange(strangers_lost, 0));
  }

  void say(const char* text, std::uint64_t number) noexcept {
    try {
      if (complain) complain(text + std::to_string(number));
    } catch (...) {
    }
  }

  // The last words; nothing is said any more afterwards.
  void fall_silent() noexcept {
    tell_of_strangers();
    if (lost > 0) say("records of the audit log lost: ", std::exchange(lost, 0));
    if (done < queued) say("records of the audit log not written: ", queued - done);
    complain = nullptr;
  }
};

AuditLog::AuditLog(std::function<void(std::string_view)> complain)
    : writer_(std::make_shared<Writer>(std::move(complain))),
      thread_([writer = writer_] {
        pthread_setname_np(pthread_self(), "audit-log");
        writer->run();
      }),
      watch_([writer = writer_] {
        pthread_setname_np(pthread_self(), "audit-watch");
        writer->watch();
      }) {}

AuditLog::~AuditLog() {
  finish();
}

std::string AuditLog::open(const std::string& path, const GuardedFiles& guarded) {
  std::shared_ptr<RecordFile> file;
  if (!path.empty()) {
    enabled_.store(true, std::memory_order_relaxed);
    if (path.front() != '/') return "not an absolute path";
    AppendedFile opened;
    if (std::string reason = open_to_append(path, O_RDWR | O_NOFOLLOW, guarded, opened);
        !reason.empty())
      return reason;
    file = std::make_shared<RecordFile>(path, std::move(opened));
  }
  enabled_.store(!path.empty(), std::memory_order_relaxed);
  const std::lock_guard lock(writer_->mutex);
  writer_->file.swap(file);
  return "";
}

std::vector<FileInUse> AuditLog::files_in_use() const {
  const std::lock_guard lock(writer_->mutex);
  if (!writer_->file) return {};
  return {{writer_->file->identity(), "the audit log"}};
}

AuditLog::Ticket AuditLog::write(std::string record, Attempt attempt) noexcept {
  const std::lock_guard lock(writer_->mutex);
  return writer_->push(std::move(record), attempt);
}

void AuditLog::when_written(Ticket record, std::function<void()> then) noexcept {
  {
    const std::lock_guard lock(writer_->mutex);
    if (writer_->add_waiter(record, then)) return;
  }
  then();
}

void AuditLog::settle() noexcept {
  std::unique_lock lock(writer_->mutex);
  writer_->changed.wait(lock, [this] { return writer_->waiters.empty() && writer_->calling == 0; });
}

bool AuditLog::finish(std::chrono::milliseconds patience) noexcept {
  enabled_.store(false, std::memory_order_relaxed);
  if (!thread_.joinable()) return true;
  std::unique_lock lock(writer_->mutex);
  writer_->ending = true;
  writer_->changed.notify_all();
  writer_->somebody_waits.notify_all();
  const bool ended = writer_->changed.wait_for(lock, patience, [this] { return writer_->ended; });
  writer_->fall_silent();
  lock.unlock();
  watch_.join();
  // A thread that a file system holds up goes with the process.
  if (ended)
    thread_.join();
  else
    thread_.detach();
  return ended;
}

}  // namespace orv::server
