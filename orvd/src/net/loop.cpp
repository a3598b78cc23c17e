#include "net/loop.h"

#include <sys/epoll.h>
#include <sys/eventfd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <exception>
#include <string>
#include <system_error>
#include <utility>

#include "cfg/result_codes.h"
#include "net/client.h"

namespace orv::server {
namespace {

// How often deadlines of connections are looked at; their settings are in seconds.
constexpr std::chrono::milliseconds kSweepInterval{200};
// After some work the next request is often only microseconds away: looking for it a little longer
// saves the system the wake-up, which costs as much as a small search.
constexpr std::chrono::microseconds kLookLonger{40};
constexpr int kEventsAtOnce = 64;

Descriptor checked(int descriptor) {
  if (descriptor < 0) throw std::system_error(errno, std::generic_category(), "event loop");
  return Descriptor(descriptor);
}

}  // namespace

Loop::Loop(Logs& logs, std::shared_ptr<const Settings> settings)
    : epoll_(checked(::epoll_create1(EPOLL_CLOEXEC))),
      wake_up_(checked(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK))),
      logs_(logs),
      settings_(std::move(settings)),
      access_(logs) {
  // Edge-triggered: each write wakes once, and nobody has to read the counter.
  epoll_event event{};
  event.events = EPOLLIN | EPOLLET;
  if (::epoll_ctl(epoll_.number(), EPOLL_CTL_ADD, wake_up_.number(), &event) != 0)
    throw std::system_error(errno, std::generic_category(), "event loop");
}

Loop::~Loop() {
  stop();
}

void Loop::start() {
  thread_ = std::thread([this] { run(); });
}

void Loop::stop() noexcept {
  if (!thread_.joinable()) return;
  stopping_.store(true, std::memory_order_release);
  wake();
  thread_.join();
  access_.flush();
}

void Loop::wake() noexcept {
  const std::uint64_t one = 1;
  // It fails only when the counter is full of wake-ups already.
  [[maybe_unused]] const ssize_t written = ::write(wake_up_.number(), &one, sizeof one);
}

// ---- turning

void Loop::run() {
  while (!stopping_.load(std::memory_order_acquire)) {
    try {
      if (turn()) last_work_ = now_;
    } catch (const std::exception& error) {
      logs_.error(std::string("event loop: ") + error.what());
    }
  }
}

// One look at everything that may have happened; whether there was something to do.
bool Loop::turn() {
  std::array<epoll_event, kEventsAtOnce> events{};
  const int timeout = wait_time();
  const int ready = ::epoll_wait(epoll_.number(), events.data(), kEventsAtOnce, timeout);
  if (timeout != 0) asleep_.store(false, std::memory_order_relaxed);
  now_ = Clock::now();
  bool worked = false;
  for (int i = 0; i < ready; ++i) {
    const epoll_event& event = events[static_cast<std::size_t>(i)];
    if (!event.data.ptr) continue;  // woken for what was posted
    static_cast<Client*>(event.data.ptr)->ready(event.events);
    worked = true;
  }
  if (run_posted()) worked = true;
  // Clients whose bytes still wait to be read are not idle: a full batch postpones the sweep.
  if (ready < kEventsAtOnce) sweep_if_due();
  return worked;
}

// In milliseconds, as epoll_wait takes it.
int Loop::wait_time() {
  if (work_posted_.load(std::memory_order_relaxed)) return 0;
  if (now_ - last_work_ < kLookLonger) {
    // Others that want the processor get it in between.
    if (now_ != last_work_) std::this_thread::yield();
    return 0;
  }
  if (!fall_asleep()) return 0;
  if (clients_.empty()) {
    access_.flush();  // nobody will sweep before somebody connects
    return -1;
  }
  const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(next_sweep_ - now_);
  return static_cast<int>(std::max<std::int64_t>(left.count(), 0)) + 1;
}

// From here on whoever posts wakes the loop. False when somebody has posted.
bool Loop::fall_asleep() noexcept {
  const std::lock_guard lock(mutex_);
  if (!posted_.empty()) return false;
  asleep_.store(true, std::memory_order_relaxed);
  return true;
}

void Loop::post(std::function<void()> work) {
  bool wake_it = false;
  {
    const std::lock_guard lock(mutex_);
    posted_.push_back(std::move(work));
    work_posted_.store(true, std::memory_order_relaxed);
    wake_it = asleep_.exchange(false, std::memory_order_relaxed);
  }
  if (wake_it) wake();
}

void Loop::run_one(const std::function<void()>& work) {
  try {
    work();
  } catch (const std::exception& error) {
    logs_.error(std::string("event loop: ") + error.what());
  }
}

// What is posted meanwhile waits for the next turn, so that descriptors get theirs.
bool Loop::run_posted() {
  if (!work_posted_.load(std::memory_order_relaxed)) return false;
  {
    const std::lock_guard lock(mutex_);
    running_.swap(posted_);
    work_posted_.store(false, std::memory_order_relaxed);
  }
  for (auto& work : running_) run_one(work);
  running_.clear();
  return true;
}

void Loop::renew(std::shared_ptr<const Settings> settings) {
  post([this, settings = std::move(settings)]() mutable { settings_ = std::move(settings); });
}

// ---- clients

void Loop::add(std::shared_ptr<Client> client) {
  clients_.insert(std::move(client));
}

void Loop::remove(const std::shared_ptr<Client>& client) {
  clients_.erase(client);
}

bool Loop::watch(Client& client, int descriptor, std::uint32_t events) noexcept {
  epoll_event event{};
  event.events = events;
  event.data.ptr = &client;
  return ::epoll_ctl(epoll_.number(), EPOLL_CTL_ADD, descriptor, &event) == 0;
}

bool Loop::change(Client& client, int descriptor, std::uint32_t events) noexcept {
  epoll_event event{};
  event.events = events;
  event.data.ptr = &client;
  return ::epoll_ctl(epoll_.number(), EPOLL_CTL_MOD, descriptor, &event) == 0;
}

void Loop::unwatch(int descriptor) noexcept {
  ::epoll_ctl(epoll_.number(), EPOLL_CTL_DEL, descriptor, nullptr);
}

void Loop::disconnect_all() {
  post([this] {
    const std::vector<std::shared_ptr<Client>> all(clients_.begin(), clients_.end());
    for (const auto& client : all) client->disconnect(result::unavailable, "server is stopping");
  });
}

void Loop::sweep_if_due() {
  if (now_ < next_sweep_) return;
  next_sweep_ = now_ + kSweepInterval;
  const std::vector<std::shared_ptr<Client>> all(clients_.begin(), clients_.end());
  for (const auto& client : all) client->sweep(now_);
  access_.flush();
}

}  // namespace orv::server
