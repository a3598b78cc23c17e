#include "record_writer.h"

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <mutex>

#include "masked_text.h"

namespace orv::slapi {
namespace {

std::atomic<int> target{STDERR_FILENO};

// The first file's descriptor is kept for good, and later files are put under its number: a thread
// that is about to write never holds a number that was closed or given to something else.
struct TraceFile {
  std::mutex mutex;
  int descriptor = -1;
};

TraceFile& trace_file() noexcept {
  static TraceFile file;
  return file;
}

int place_descriptor(TraceFile& file, int opened) noexcept {
  if (file.descriptor < 0) {
    file.descriptor = opened;
    return 0;
  }
  const int placed = dup3(opened, file.descriptor, O_CLOEXEC);
  const int error = placed < 0 ? errno : 0;
  close(opened);
  return error;
}

}  // namespace

// The calendar is computed here because the C library's takes a lock and reads the time zone.
Record::Record() noexcept {
  using std::chrono::floor;
  const auto now = floor<std::chrono::microseconds>(std::chrono::system_clock::now());
  const auto day = floor<std::chrono::days>(now);
  const std::chrono::year_month_day date(day);
  const std::chrono::hh_mm_ss time(now - day);
  add("%04d-%02u-%02uT%02d:%02d:%02d.%06dZ %d ", static_cast<int>(date.year()),
      static_cast<unsigned>(date.month()), static_cast<unsigned>(date.day()),
      static_cast<int>(time.hours().count()), static_cast<int>(time.minutes().count()),
      static_cast<int>(time.seconds().count()), static_cast<int>(time.subseconds().count()),
      static_cast<int>(gettid()));
}

void Record::add(const char* format, ...) noexcept {
  std::va_list arguments;
  va_start(arguments, format);
  add_list(format, arguments);
  va_end(arguments);
}

void Record::add_list(const char* format, std::va_list arguments) noexcept {
  if (cut_) return;
  const int saved_errno = errno;
  const std::size_t room = kSize - kRoomForEnd - length_;
  const int wanted = std::vsnprintf(text_ + length_, room, format, arguments);
  if (wanted > 0) {
    cut_ = static_cast<std::size_t>(wanted) >= room;
    length_ += std::min(static_cast<std::size_t>(wanted), room - 1);
  }
  errno = saved_errno;
}

void Record::write() noexcept {
  static constexpr char kCutMark[] = " ...\n";
  const int saved_errno = errno;
  length_ = mask_secrets(text_, 0, length_, kSize - kRoomForEnd);
  if (cut_) {
    std::memcpy(text_ + length_, kCutMark, sizeof kCutMark - 1);
    length_ += sizeof kCutMark - 1;
  } else if (length_ == 0 || text_[length_ - 1] != '\n') {
    text_[length_++] = '\n';
  }
  while (::write(record_descriptor(), text_, length_) < 0 && errno == EINTR) {
  }
  errno = saved_errno;
}

int record_descriptor() noexcept {
  return target.load(std::memory_order_relaxed);
}

int set_record_file(const char* path) noexcept {
  TraceFile& file = trace_file();
  const std::lock_guard lock(file.mutex);
  if (path == nullptr) {
    target.store(STDERR_FILENO, std::memory_order_relaxed);
    return 0;
  }
  const int opened = open(path, O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC | O_NOCTTY, 0600);
  if (opened < 0) return errno;
  if (const int error = place_descriptor(file, opened); error != 0) return error;
  target.store(file.descriptor, std::memory_order_relaxed);
  return 0;
}

}  // namespace orv::slapi
