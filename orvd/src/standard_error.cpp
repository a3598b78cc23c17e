#include "standard_error.h"

#include <fcntl.h>
#include <limits.h>
#include <poll.h>
#include <sys/eventfd.h>
#include <sys/ioctl.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <condition_variable>
#include <csignal>
#include <cstdint>
#include <ctime>
#include <mutex>
#include <string>
#include <string_view>

#include "descriptor.h"
#include "process/privileges.h"

#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
// The reports of the sanitizers end the process before anybody could carry them over.
extern "C" void __sanitizer_set_report_fd(void* descriptor);
#define ORV_REPORTS_OF_SANITIZERS 1
#endif

namespace orv::server {
namespace {

constexpr std::size_t kKept = 1 << 20;
constexpr int kPipeBytes = 1 << 20;

// What came out of the pipe and has not been taken yet.
class Backlog {
 public:
  void take(std::string_view text) {
    if (dropped_ > 0 && text_.size() <= kKept / 2) announce();
    if (inside_dropped_line_) text.remove_prefix(drop(text.substr(0, end_of_line(text))));
    if (text.empty()) return;
    if (dropped_ == 0 && text.size() <= kKept - text_.size()) return append(text);
    if (dropped_ == 0) drop_unfinished_line(text);
    const std::size_t room = dropped_ > 0 ? 0 : kKept - text_.size();
    const std::size_t fits = text.substr(0, room).rfind('\n') + 1;  // 0 when there is none
    append(text.substr(0, fits));
    drop(text.substr(fits));
  }

  bool empty() const noexcept { return text_.empty(); }
  std::string_view next() const noexcept {
    return std::string_view(text_).substr(0, std::size_t{PIPE_BUF});
  }

  void taken(std::size_t bytes) {
    text_.erase(0, bytes);
    if (text_.empty() && (dropped_ > 0 || (overflowed_ && last_ == '\n'))) announce();
  }

  // More came than could be carried, nobody knows how much.
  void overflow() noexcept { overflowed_ = true; }
  void clear() noexcept { text_.clear(); }

 private:
  static std::size_t end_of_line(std::string_view text) {
    const std::size_t newline = text.find('\n');
    return newline == std::string_view::npos ? text.size() : newline + 1;
  }

  void append(std::string_view text) {
    if (text.empty()) return;
    text_ += text;
    last_ = text.back();
  }

  std::size_t drop(std::string_view text) {
    dropped_ += text.size();
    if (!text.empty()) inside_dropped_line_ = text.back() != '\n';
    return text.size();
  }

  // A line whose end does not fit is dropped whole, as far as it is still here.
  void drop_unfinished_line(std::string_view& text) {
    const std::size_t newline = text_.rfind('\n');
    if (last_ == '\n' || newline == std::string::npos) return;
    if (end_of_line(text) <= kKept - text_.size()) return;
    dropped_ += text_.size() - newline - 1;
    text_.resize(newline + 1);
    last_ = '\n';
    text.remove_prefix(drop(text.substr(0, end_of_line(text))));
  }

  void announce() {
    if (last_ != '\n') append("\n");
    append("orvd: " + std::to_string(dropped_) + " bytes of standard error were dropped" +
           (overflowed_ ? ", and more that came too fast to be counted\n" : "\n"));
    dropped_ = 0;
    overflowed_ = false;
  }

  std::string text_;
  std::uint64_t dropped_ = 0;
  bool inside_dropped_line_ = false;
  bool overflowed_ = false;
  char last_ = '\n';
};

}  // namespace

struct StandardError::State {
  Descriptor original;                // where descriptor 2 led before
  Descriptor outlet;                  // reading end of the pipe, does not block
  Descriptor wake;                    // becomes readable when the thread is to end
  std::atomic<bool> carrying{false};  // something was taken out of the pipe and is not written

  std::mutex mutex;
  std::condition_variable changed;
  bool done = false;

  bool open() noexcept {
    int ends[2];
    original = Descriptor(::fcntl(STDERR_FILENO, F_DUPFD_CLOEXEC, STDERR_FILENO + 1));
    wake = Descriptor(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK));
    if (!original || !wake) return false;
    if (::pipe2(ends, O_CLOEXEC | O_NONBLOCK) != 0) return false;
    outlet = Descriptor(ends[0]);
    const Descriptor inlet(ends[1]);
    ::fcntl(inlet.number(), F_SETPIPE_SZ, kPipeBytes);  // a larger one loses less; any will do
    return ::dup2(inlet.number(), STDERR_FILENO) == STDERR_FILENO;
  }

  void end() noexcept {
    const std::uint64_t one = 1;
    [[maybe_unused]] const ssize_t written = ::write(wake.number(), &one, sizeof one);
  }

  void carry() noexcept {
    try {
      Backlog backlog;
      for (;;) {
        const bool all = fill(backlog);
        empty(backlog);
        carrying.store(!backlog.empty(), std::memory_order_release);
        if (ending_ && all && backlog.empty()) break;
        if (all) wait(backlog);
      }
    } catch (...) {
      // Without memory the rest is lost.
    }
    carrying.store(false, std::memory_order_release);
    const std::lock_guard lock(mutex);
    done = true;
    changed.notify_all();
  }

  bool wait_until_done(std::chrono::milliseconds patience) {
    std::unique_lock lock(mutex);
    return changed.wait_for(lock, patience, [this] { return done; });
  }

 private:
  // Until there is something to read, room for what is kept, or the end.
  void wait(const Backlog& backlog) noexcept {
    pollfd polled[] = {{outlet.number(), POLLIN, 0},
                       {ending_ ? -1 : wake.number(), POLLIN, 0},
                       {backlog.empty() ? -1 : original.number(), POLLOUT, 0}};
    if (::poll(polled, 3, -1) < 0) return;
    if ((polled[1].revents & POLLIN) != 0) ending_ = true;
    writable_ = polled[2].revents != 0;
  }

  bool is_nearly_full() const noexcept {
    int waiting = 0;
    const int size = ::fcntl(outlet.number(), F_GETPIPE_SZ);
    return size > 0 && ::ioctl(outlet.number(), FIONREAD, &waiting) == 0 && waiting >= size / 8 * 7;
  }

  // Whether the pipe is empty now; false when it never seems to get there.
  bool fill(Backlog& backlog) {
    constexpr int kAtOnce = 64;
    char chunk[16384];
    carrying.store(true, std::memory_order_release);
    if (is_nearly_full()) backlog.overflow();
    for (int i = 0; i < kAtOnce; ++i) {
      const ssize_t length = ::read(outlet.number(), chunk, sizeof chunk);
      if (length <= 0) return true;
      if (!gone_) backlog.take({chunk, static_cast<std::size_t>(length)});
    }
    return false;
  }

  // A pipe that has room takes PIPE_BUF bytes at once. Somebody else who writes to it may be faster
  // now and then: then this thread waits, and only this one.
  void empty(Backlog& backlog) {
    if (!writable_ || backlog.empty()) return;
    writable_ = false;
    const std::string_view next = backlog.next();
    const ssize_t written = ::write(original.number(), next.data(), next.size());
    if (written >= 0) return backlog.taken(static_cast<std::size_t>(written));
    if (errno == EAGAIN || errno == EINTR) return;
    gone_ = true;  // nobody will ever read it
    backlog.clear();
  }

  bool ending_ = false;
  bool writable_ = false;
  bool gone_ = false;
};

namespace {

// What drain_standard_error looks at; null while nothing is in place.
struct Watched {
  std::atomic<int> outlet{-1};
  std::atomic<const std::atomic<bool>*> carrying{nullptr};
} watched;

bool is_carried_over() noexcept {
  const int outlet = watched.outlet.load(std::memory_order_acquire);
  const std::atomic<bool>* const carrying = watched.carrying.load(std::memory_order_acquire);
  int waiting = 0;
  if (outlet < 0 || carrying == nullptr || ::ioctl(outlet, FIONREAD, &waiting) != 0) return true;
  return waiting == 0 && !carrying->load(std::memory_order_acquire);
}

// What the C++ runtime says before it gives up.
void wait_for_last_words(int) {
  drain_standard_error(std::chrono::milliseconds(1000));
}

}  // namespace

StandardError::StandardError() noexcept {
  try {
    auto state = std::make_shared<State>();
    if (!state->open()) return;
    state_ = state;
    thread_ = std::thread([state] {
      // It is here before the server gives up what a service manager may have let it keep.
      std::string ignored;
      give_up_capabilities(ignored);
      state->carry();
    });
    watched.carrying.store(&state->carrying, std::memory_order_release);
    watched.outlet.store(state->outlet.number(), std::memory_order_release);
#ifdef ORV_REPORTS_OF_SANITIZERS
    __sanitizer_set_report_fd(reinterpret_cast<void*>(std::intptr_t{state->original.number()}));
#endif
    std::signal(SIGABRT, wait_for_last_words);
  } catch (...) {
    if (state_) ::dup2(state_->original.number(), STDERR_FILENO);
    state_.reset();
  }
}

StandardError::~StandardError() {
  if (!state_) return;
  state_->end();
  const bool done = state_->wait_until_done(kPatience);
  std::signal(SIGABRT, SIG_DFL);
  watched.outlet.store(-1, std::memory_order_release);
  watched.carrying.store(nullptr, std::memory_order_release);
  // A thread that waits for a reader goes with the process.
  if (!done) {
    thread_.detach();
    return;
  }
  thread_.join();
  ::dup2(state_->original.number(), STDERR_FILENO);
#ifdef ORV_REPORTS_OF_SANITIZERS
  __sanitizer_set_report_fd(reinterpret_cast<void*>(std::intptr_t{STDERR_FILENO}));
#endif
}

void drain_standard_error(std::chrono::milliseconds patience) noexcept {
  constexpr std::chrono::milliseconds kStep{2};
  const timespec step{0, std::chrono::nanoseconds(kStep).count()};
  for (auto waited = kStep * 0; waited < patience && !is_carried_over(); waited += kStep)
    ::nanosleep(&step, nullptr);
}

}  // namespace orv::server
