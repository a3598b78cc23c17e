#include "logs.h"

#include <fcntl.h>
#include <poll.h>
#include <unistd.h>

#include <cerrno>
#include <charconv>
#include <condition_variable>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <deque>
#include <mutex>
#include <thread>
#include <utility>

#include <spdlog/details/null_mutex.h>
#include <spdlog/logger.h>
#include <spdlog/pattern_formatter.h>
#include <spdlog/sinks/base_sink.h>

#include "descriptor.h"

namespace orv::server {
namespace {

constexpr std::size_t kLaneBytes = 32 * 1024;
// What a queued line costs beside its text.
constexpr std::size_t kLineBytes = 128;
constexpr const char* kErrorPattern = "%Y-%m-%dT%H:%M:%S.%eZ %l %v";

spdlog::level::level_enum spdlog_level(LogLevel level) {
  switch (level) {
    case LogLevel::error:
      return spdlog::level::err;
    case LogLevel::warning:
      return spdlog::level::warn;
    case LogLevel::info:
      return spdlog::level::info;
    case LogLevel::debug:
      return spdlog::level::debug;
    case LogLevel::off:
      break;
  }
  return spdlog::level::off;
}

LogLevel level_of(std::string_view name) {
  if (name == "error") return LogLevel::error;
  if (name == "warning") return LogLevel::warning;
  if (name == "debug") return LogLevel::debug;
  if (name == "off") return LogLevel::off;
  return LogLevel::info;
}

// ---- sinks

void write_all(int fd, const char* text, std::size_t length) noexcept {
  constexpr int kPatience = 1000;  // milliseconds; only the thread of the logs waits
  while (length > 0) {
    const ssize_t written = ::write(fd, text, length);
    if (written >= 0) {
      text += written;
      length -= static_cast<std::size_t>(written);
      continue;
    }
    if (errno == EINTR) continue;
    pollfd polled{fd, POLLOUT, 0};
    if (errno != EAGAIN || ::poll(&polled, 1, kPatience) <= 0) return;
  }
}

// Standard error, or a file of its own. One thread writes.
class Sink final : public spdlog::sinks::base_sink<spdlog::details::null_mutex> {
 public:
  Sink() : number_(STDERR_FILENO) {}
  explicit Sink(Descriptor file) : file_(std::move(file)), number_(file_.number()) {}

 protected:
  void sink_it_(const spdlog::details::log_msg& message) override {
    spdlog::memory_buf_t text;
    formatter_->format(message, text);
    write_all(number_, text.data(), text.size());
  }
  void flush_() override {}

 private:
  Descriptor file_;
  int number_;
};

}  // namespace

// ---- the queue

// One of the two logs: where it goes now, and what waits to be written, each to where it went when
// it was said.
struct Logs::Log {
  struct Line {
    std::shared_ptr<spdlog::logger> logger;
    spdlog::log_clock::time_point time;
    spdlog::level::level_enum level;
    std::string text;
  };

  std::shared_ptr<spdlog::logger> logger;
  FileIdentity file;  // none: standard error
  std::deque<Line> lines;
  std::size_t bytes = 0;
  std::uint64_t lost = 0;

  void push(Line line) {
    const std::size_t size = line.text.size() + kLineBytes;
    while (!lines.empty() && bytes + size > kMaxQueuedBytes) {
      drop_front();
      ++lost;
    }
    if (size > kMaxQueuedBytes) {
      ++lost;
      return;
    }
    lines.push_back(std::move(line));
    bytes += size;
  }

  Line pop() {
    Line line = std::move(lines.front());
    bytes -= line.text.size() + kLineBytes;
    lines.pop_front();
    return line;
  }

 private:
  void drop_front() {
    bytes -= lines.front().text.size() + kLineBytes;
    lines.pop_front();
  }
};

struct Logs::Writer {
  std::mutex mutex;  // guards all
  std::condition_variable changed;
  Log error;
  Log access;
  bool ending = false;
  bool ended = false;

  Log& log(bool of_access) noexcept { return of_access ? access : error; }

  void run() noexcept {
    std::unique_lock lock(mutex);
    while (wait(lock)) write_one(lock);
    ended = true;
    changed.notify_all();
  }

 private:
  // False at the end, when everything is written.
  bool wait(std::unique_lock<std::mutex>& lock) {
    changed.wait(lock, [this] { return !error.lines.empty() || !access.lines.empty() || ending; });
    return !error.lines.empty() || !access.lines.empty();
  }

  void write_one(std::unique_lock<std::mutex>& lock) noexcept {
    try {
      say_what_was_lost();
      const Log::Line line = (error.lines.empty() ? access : error).pop();
      lock.unlock();
      line.logger->log(line.time, {}, line.level, line.text);
    } catch (...) {
      // Without memory the line is lost.
    }
    if (!lock.owns_lock()) lock.lock();
  }

  void say_what_was_lost() {
    const std::uint64_t lost = std::exchange(error.lost, 0) + std::exchange(access.lost, 0);
    if (lost == 0 || !error.logger) return;
    error.push({error.logger, spdlog::log_clock::now(), spdlog::level::warn,
                std::to_string(lost) + " pieces of log were given up, they could not be written"});
  }
};

// ---- opening

namespace {

constexpr const char* kErrorLog = "the error log";
constexpr const char* kAccessLog = "the access log";

// What one log is to become.
struct Candidate {
  AppendedFile file;  // with a path and a level only
  std::string path;
  LogLevel level = LogLevel::off;
  std::string reason;  // it is refused

  bool accepted() const { return reason.empty(); }
};

Candidate examine(const std::string& path, const std::string& level, const GuardedFiles& guarded) {
  Candidate wanted;
  wanted.path = path;
  wanted.level = level_of(level);
  if (path.empty() || wanted.level == LogLevel::off) return wanted;
  wanted.reason = open_to_append(path, O_WRONLY, guarded, wanted.file);
  return wanted;
}

void refuse_if_same(Candidate& wanted, const FileIdentity& other, const char* as) {
  if (!wanted.accepted() || !other || wanted.file.identity != other) return;
  wanted.reason = std::string("the same file as ") + as;
}

std::shared_ptr<spdlog::logger> make_logger(Candidate& wanted, bool access) {
  std::shared_ptr<Sink> sink;
  if (wanted.file.descriptor.number() >= 0)
    sink = std::make_shared<Sink>(std::move(wanted.file.descriptor));
  else
    sink = std::make_shared<Sink>();
  auto made = std::make_shared<spdlog::logger>(access ? "access" : "error", std::move(sink));
  const bool on = wanted.level != LogLevel::off;
  made->set_level(access && on ? spdlog::level::info : spdlog_level(wanted.level));
  // Access lines come finished, with their own time and newline.
  made->set_formatter(std::make_unique<spdlog::pattern_formatter>(
      access ? "%v" : kErrorPattern, spdlog::pattern_time_type::utc, access ? "" : "\n"));
  return made;
}

}  // namespace

Logs::Logs(GuardedFiles guarded)
    : guarded_(std::move(guarded)),
      writer_(std::make_shared<Writer>()),
      thread_([writer = writer_] { writer->run(); }) {
  Candidate standard_error;
  standard_error.level = LogLevel::info;
  writer_->error.logger = make_logger(standard_error, false);
}

Logs::~Logs() {
  finish();
}

std::vector<std::string> Logs::open(const Settings& settings,
                                    const std::vector<FileInUse>& others) {
  std::vector<std::string> problems;
  try {
    GuardedFiles guarded = guarded_;
    guarded.names.push_back(settings.audit_log);
    guarded.in_use.insert(guarded.in_use.end(), others.begin(), others.end());
    Candidate error = examine(settings.error_log, settings.error_log_level, guarded);
    Candidate access = examine(settings.access_log, settings.access_log_level, guarded);
    const std::lock_guard lock(writer_->mutex);
    // Who is refused keeps what it had, which the other one may not take either.
    if (error.accepted()) refuse_if_same(access, error.file.identity, kErrorLog);
    if (!access.accepted()) refuse_if_same(error, writer_->access.file, kAccessLog);
    if (!error.accepted()) refuse_if_same(access, writer_->error.file, kErrorLog);
    for (Candidate* const wanted : {&error, &access}) {
      if (!wanted->accepted()) {
        problems.push_back("cannot log to " + wanted->path + ": " + wanted->reason);
        continue;
      }
      Log& log = writer_->log(wanted == &access);
      log.logger = make_logger(*wanted, wanted == &access);
      log.file = wanted->file.identity;
    }
    if (access.accepted())
      access_on_.store(access.level == LogLevel::info || access.level == LogLevel::debug,
                       std::memory_order_relaxed);
  } catch (const std::exception& e) {
    problems.emplace_back(e.what());
  }
  return problems;
}

std::vector<FileInUse> Logs::files_in_use() const {
  const std::lock_guard lock(writer_->mutex);
  std::vector<FileInUse> files;
  if (writer_->error.file) files.push_back({writer_->error.file, kErrorLog});
  if (writer_->access.file) files.push_back({writer_->access.file, kAccessLog});
  return files;
}

// ---- writing

bool Logs::queue(bool access, LogLevel level, std::string_view text) {
  const std::lock_guard lock(writer_->mutex);
  Log& log = writer_->log(access);
  if (!log.logger || writer_->ending) return false;
  if (!log.logger->should_log(spdlog_level(level))) return true;
  log.push({log.logger, spdlog::log_clock::now(), spdlog_level(level), std::string(text)});
  writer_->changed.notify_all();
  return true;
}

namespace {

// A line may hold values that somebody sent, and these may be as long as messages are.
std::string cut(std::string_view line) {
  std::size_t end = Logs::kMaxErrorLine - 64;
  while (end > 0 && (static_cast<unsigned char>(line[end]) & 0xC0U) == 0x80) --end;
  return std::string(line.substr(0, end)) + "... (" + std::to_string(line.size()) + " bytes)";
}

}  // namespace

void Logs::write(LogLevel level, std::string_view line) noexcept {
  try {
    if (line.size() > kMaxErrorLine) return write(level, cut(line));
    if (!queue(false, level, line) && level <= LogLevel::warning)
      std::fprintf(stderr, "%.*s\n", static_cast<int>(line.size()), line.data());
  } catch (...) {
    // Without memory the line is lost; the server goes on.
  }
}

void Logs::write_access(std::string_view lines) noexcept {
  try {
    queue(true, LogLevel::info, lines);
  } catch (...) {
  }
}

std::size_t Logs::queued_bytes() const {
  const std::lock_guard lock(writer_->mutex);
  return writer_->error.bytes + writer_->access.bytes;
}

bool Logs::finish(std::chrono::milliseconds patience) noexcept {
  access_on_.store(false, std::memory_order_relaxed);
  if (!thread_.joinable()) return true;
  std::unique_lock lock(writer_->mutex);
  writer_->ending = true;
  writer_->changed.notify_all();
  const bool ended = writer_->changed.wait_for(lock, patience, [this] { return writer_->ended; });
  lock.unlock();
  // A thread that a file system or a reader holds up goes with the process.
  if (ended)
    thread_.join();
  else
    thread_.detach();
  return ended;
}

std::string& AccessLane::begin(std::uint64_t connection) {
  const auto now = std::chrono::system_clock::now().time_since_epoch();
  const auto millis = std::chrono::duration_cast<std::chrono::milliseconds>(now).count();
  if (millis / 1000 != second_) {
    second_ = millis / 1000;
    const std::time_t time = second_;
    std::tm parts{};
    gmtime_r(&time, &parts);
    char text[32];
    second_text_.assign(text, std::strftime(text, sizeof text, "%Y-%m-%dT%H:%M:%S.", &parts));
  }
  const auto fraction = millis % 1000;
  lines_ += second_text_;
  lines_ += static_cast<char>('0' + fraction / 100);
  lines_ += static_cast<char>('0' + fraction / 10 % 10);
  lines_ += static_cast<char>('0' + fraction % 10);
  lines_ += "Z conn=";
  append_number(lines_, static_cast<std::int64_t>(connection));
  lines_ += ' ';
  return lines_;
}

void AccessLane::end() {
  lines_ += '\n';
  if (lines_.size() >= kLaneBytes) flush();
}

void AccessLane::flush() noexcept {
  if (lines_.empty()) return;
  logs_.write_access(lines_);
  lines_.clear();
}

void append_quoted(std::string& line, std::string_view text) {
  constexpr char kHex[] = "0123456789ABCDEF";
  line += '"';
  for (const char c : text) {
    const auto byte = static_cast<unsigned char>(c);
    if (byte >= 0x20 && byte != 0x7F && c != '"') {
      line += c;
      continue;
    }
    line += '\\';
    line += kHex[byte >> 4];
    line += kHex[byte & 15];
  }
  line += '"';
}

void append_number(std::string& line, std::int64_t number) {
  char digits[24];
  const auto [end, status] = std::to_chars(digits, digits + sizeof digits, number);
  line.append(digits, end);
}

}  // namespace orv::server
