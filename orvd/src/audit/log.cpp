#include "audit/log.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <condition_variable>
#include <cstdint>
#include <cstring>
#include <deque>
#include <mutex>
#include <utility>

#include "descriptor.h"

namespace orv::server {
namespace {

// What a queued record costs beside its text.
constexpr std::size_t kRecordBytes = 128;
constexpr std::string_view kVersion = "version: 1\n\n";

std::string error_text(int number) {
  return std::strerror(number);
}

}  // namespace

// ---- the file

struct AuditLog::File {
  std::string path;
  Descriptor descriptor;
  std::string before_next;  // what has to stand between the end of the file and the next record

  // 0 or an error number. Nothing of the record stays behind after a failure.
  int append(std::string_view record) noexcept;
};

namespace {

// O_NONBLOCK: a named pipe without a reader must not hold the server up before it is refused.
int open_file(const char* path, bool& made) noexcept {
  constexpr int kFlags = O_RDWR | O_APPEND | O_CLOEXEC | O_NONBLOCK | O_NOCTTY | O_NOFOLLOW;
  int number = ::open(path, kFlags);
  if (number >= 0 || errno != ENOENT) return number;
  number = ::open(path, kFlags | O_CREAT | O_EXCL, 0600);
  made = number >= 0;
  return number >= 0 || errno != EEXIST ? number : ::open(path, kFlags);
}

// Why the opened file cannot be the audit log, or "".
std::string refuse(const struct stat& file, const std::vector<std::string>& guarded) {
  if (!S_ISREG(file.st_mode)) return "not a regular file";
  for (const std::string& other : guarded) {
    struct stat status {};
    if (!other.empty() && ::stat(other.c_str(), &status) == 0 && status.st_dev == file.st_dev &&
        status.st_ino == file.st_ino)
      return "the same file as " + other;
  }
  return "";
}

// A record begins behind an empty line, also when whoever wrote here last was cut off.
std::string separator(int descriptor, off_t size) {
  if (size == 0) return std::string(kVersion);
  char end[2] = {'\n', '\n'};
  const off_t length = size < 2 ? size : 2;
  if (::pread(descriptor, end + 2 - length, static_cast<std::size_t>(length), size - length) !=
      length)
    return "\n\n";
  if (end[1] != '\n') return "\n\n";
  return end[0] == '\n' ? "" : "\n";
}

// All or nothing, as far as the system lets it.
int append_whole(int descriptor, std::string_view text) noexcept {
  struct stat before {};
  if (::fstat(descriptor, &before) != 0) return errno;
  std::size_t written = 0;
  while (written < text.size()) {
    const ssize_t now = ::write(descriptor, text.data() + written, text.size() - written);
    if (now > 0) {
      written += static_cast<std::size_t>(now);
      continue;
    }
    if (now < 0 && errno == EINTR) continue;
    const int failure = now < 0 ? errno : ENOSPC;
    if (written > 0 && ::ftruncate(descriptor, before.st_size) != 0) return failure;
    return failure;
  }
  return 0;
}

}  // namespace

int AuditLog::File::append(std::string_view record) noexcept {
  if (!before_next.empty()) {
    if (const int failure = append_whole(descriptor.number(), before_next)) return failure;
    before_next.clear();
  }
  return append_whole(descriptor.number(), record);
}

// ---- the thread

struct AuditLog::Writer {
  struct Record {
    std::shared_ptr<File> file;  // null: there is none
    std::string text;
  };

  explicit Writer(std::function<void(std::string_view)> told) : complain(std::move(told)) {}

  const std::function<void(std::string_view)> complain;
  std::mutex mutex;
  std::condition_variable changed;
  // All under the mutex.
  std::shared_ptr<File> file;
  std::deque<Record> records;
  std::size_t bytes = 0;
  std::uint64_t queued = 0;  // number of the record queued last
  std::uint64_t done = 0;    // and of the one that was written, or given up, last
  bool behind = false;       // somebody waited in vain for his record since one was done
  bool ending = false;
  bool ended = false;
  std::uint64_t lost = 0;  // since the last good write

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

  void write_one(std::unique_lock<std::mutex>& lock) noexcept {
    const Record record = std::move(records.front());
    records.pop_front();
    bytes -= record.text.size() + kRecordBytes;
    lock.unlock();
    const int failure = record.file ? record.file->append(record.text) : ENOENT;
    lock.lock();
    ++done;
    behind = false;
    changed.notify_all();
    if (failure != 0) return lose(record.file.get(), failure);
    if (lost > 0) say("the audit log is written again; records lost: ", std::exchange(lost, 0));
  }

  // The first of a row of lost records is told at once, the others with their number at its end.
  void lose(const File* where, int failure) noexcept {
    if (lost++ > 0) return;
    try {
      complain("the audit log cannot be written" + (where ? ": " + where->path : std::string()) +
               ": " + (where ? error_text(failure) : std::string("no file is open")) +
               "; changes are made without record");
    } catch (...) {
      // Without memory to say it.
    }
  }

  void say(const char* text, std::uint64_t number) noexcept {
    try {
      complain(text + std::to_string(number));
    } catch (...) {
    }
  }

  // The number of the record; 0 when there was no room for it.
  std::uint64_t push(std::string&& text) noexcept {
    const std::size_t size = text.size() + kRecordBytes;
    if (ending || bytes + size > kMaxQueuedBytes) {
      lose(file.get(), EAGAIN);
      return 0;
    }
    try {
      records.push_back({file, std::move(text)});
    } catch (...) {
      lose(file.get(), ENOMEM);
      return 0;
    }
    bytes += size;
    changed.notify_all();
    return ++queued;
  }
};

AuditLog::AuditLog(std::function<void(std::string_view)> complain)
    : writer_(std::make_shared<Writer>(std::move(complain))),
      thread_([writer = writer_] { writer->run(); }) {}

AuditLog::~AuditLog() {
  finish();
}

std::string AuditLog::open(const std::string& path, const std::vector<std::string>& guarded) {
  std::shared_ptr<File> file;
  if (!path.empty()) {
    bool made = false;
    file = std::make_shared<File>();
    file->path = path;
    file->descriptor = Descriptor(path.front() == '/' ? open_file(path.c_str(), made) : -1);
    enabled_.store(true, std::memory_order_relaxed);
    if (path.front() != '/') return "not an absolute path";
    struct stat status {};
    if (file->descriptor.number() < 0 || ::fstat(file->descriptor.number(), &status) != 0)
      return errno == ELOOP ? "a symbolic link" : error_text(errno);
    if (std::string reason = refuse(status, guarded); !reason.empty()) {
      if (made) ::unlink(path.c_str());
      return reason;
    }
    file->before_next = separator(file->descriptor.number(), status.st_size);
  }
  enabled_.store(!path.empty(), std::memory_order_relaxed);
  const std::lock_guard lock(writer_->mutex);
  writer_->file.swap(file);
  return "";
}

void AuditLog::write(std::string record) noexcept {
  const std::lock_guard lock(writer_->mutex);
  writer_->push(std::move(record));
}

void AuditLog::write_and_wait(std::string record) noexcept {
  std::unique_lock lock(writer_->mutex);
  const std::uint64_t number = writer_->push(std::move(record));
  if (number == 0 || writer_->behind) return;
  const bool written = writer_->changed.wait_for(
      lock, kPatience, [this, number] { return writer_->done >= number; });
  if (!written) writer_->behind = true;
}

bool AuditLog::finish(std::chrono::milliseconds patience) noexcept {
  enabled_.store(false, std::memory_order_relaxed);
  if (!thread_.joinable()) return true;
  std::unique_lock lock(writer_->mutex);
  writer_->ending = true;
  writer_->changed.notify_all();
  const bool ended = writer_->changed.wait_for(lock, patience, [this] { return writer_->ended; });
  if (ended && writer_->lost > 0) writer_->say("records of the audit log lost: ", writer_->lost);
  lock.unlock();
  // A thread that a file system holds up goes with the process.
  if (ended)
    thread_.join();
  else
    thread_.detach();
  return ended;
}

}  // namespace orv::server
