#include "logs.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <charconv>
#include <cstdio>
#include <cstring>
#include <ctime>

#include <spdlog/async.h>
#include <spdlog/pattern_formatter.h>
#include <spdlog/sinks/basic_file_sink.h>
#include <spdlog/sinks/stdout_sinks.h>

namespace orv::server {
namespace {

constexpr std::size_t kQueuedMessages = 1024;
constexpr std::size_t kLaneBytes = 32 * 1024;
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

bool same_file(const struct stat& a, const std::string& path) {
  struct stat b {};
  return stat(path.c_str(), &b) == 0 && a.st_dev == b.st_dev && a.st_ino == b.st_ino;
}

// Why a path cannot be a log, or "". Creates the file, for its owner only, when it is not there.
std::string refuse_target(const std::string& path, const std::vector<std::string>& guarded) {
  // O_NONBLOCK: a named pipe without a reader must not hold the server up.
  const int fd = ::open(path.c_str(), O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC | O_NONBLOCK, 0600);
  if (fd < 0) return std::strerror(errno);
  struct stat found {};
  const bool known = fstat(fd, &found) == 0;
  ::close(fd);
  if (!known || !S_ISREG(found.st_mode)) return "not a regular file";
  for (const std::string& other : guarded)
    if (same_file(found, other)) return "the same file as " + other;
  return "";
}

std::shared_ptr<spdlog::sinks::sink> make_sink(const std::string& path) {
  if (path.empty()) return std::make_shared<spdlog::sinks::stderr_sink_mt>();
  return std::make_shared<spdlog::sinks::basic_file_sink_mt>(path);
}

}  // namespace

Logs::Logs(std::vector<std::string> guarded_files)
    : guarded_files_(std::move(guarded_files)),
      writer_(std::make_shared<spdlog::details::thread_pool>(kQueuedMessages, 1)) {
  open_one("", "info", false);
}

Logs::~Logs() {
  finish();
}

std::vector<std::string> Logs::open(const Settings& settings) {
  std::vector<std::string> problems;
  for (const bool access : {false, true}) {
    const std::string& path = access ? settings.access_log : settings.error_log;
    const std::string reason =
        open_one(path, access ? settings.access_log_level : settings.error_log_level, access);
    if (!reason.empty()) problems.push_back("cannot log to " + path + ": " + reason);
  }
  return problems;
}

std::string Logs::open_one(const std::string& path, const std::string& level, bool access) {
  const LogLevel wanted = level_of(level);
  try {
    if (!path.empty() && wanted != LogLevel::off) {
      std::string reason = refuse_target(path, guarded_files_);
      if (!reason.empty()) return reason;
    }
    auto made = std::make_shared<spdlog::async_logger>(
        access ? "access" : "error", make_sink(wanted == LogLevel::off ? "" : path), writer_,
        spdlog::async_overflow_policy::overrun_oldest);
    made->set_level(access && wanted != LogLevel::off ? spdlog::level::info : spdlog_level(wanted));
    // Access lines come finished, with their own time and newline.
    made->set_formatter(std::make_unique<spdlog::pattern_formatter>(
        access ? "%v" : kErrorPattern, spdlog::pattern_time_type::utc, access ? "" : "\n"));
    // Errors are to be seen at once; access lines come in batches anyway.
    made->flush_on(spdlog::level::trace);
    const std::lock_guard lock(mutex_);
    (access ? access_ : error_) = std::move(made);
    if (access)
      access_on_.store(wanted == LogLevel::info || wanted == LogLevel::debug,
                       std::memory_order_relaxed);
    return "";
  } catch (const std::exception& e) {
    return e.what();
  }
}

Logs::Logger Logs::logger(const Logger& which) const {
  const std::lock_guard lock(mutex_);
  return which;
}

void Logs::write(LogLevel level, std::string_view line) noexcept {
  try {
    if (const Logger log = logger(error_))
      log->log(spdlog_level(level), spdlog::string_view_t(line.data(), line.size()));
    else if (level <= LogLevel::warning)
      std::fprintf(stderr, "%.*s\n", static_cast<int>(line.size()), line.data());
  } catch (...) {
    // Without memory the line is lost; the server goes on.
  }
}

void Logs::write_access(std::string_view lines) noexcept {
  try {
    if (const Logger access = logger(access_))
      access->info(spdlog::string_view_t(lines.data(), lines.size()));
  } catch (...) {
  }
}

void Logs::finish() noexcept {
  std::shared_ptr<spdlog::details::thread_pool> drained;
  Logger loggers[2];
  const std::lock_guard lock(mutex_);
  access_on_.store(false, std::memory_order_relaxed);
  loggers[0].swap(error_);
  loggers[1].swap(access_);
  drained.swap(writer_);  // its thread writes what is queued before it ends
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
