// Work of clients on a few threads, a turn for each address they come from.
//
// To verify a password takes time by intention. Whoever sends thousands of binds must wait for them
// alone: the bind of somebody else comes next, whatever is queued for him.
//
// Threads: thread-safe, except `clear`.
#pragma once

#include <asio/thread_pool.hpp>
#include <functional>
#include <list>
#include <mutex>
#include <string>
#include <unordered_map>

namespace orv::server {

class FairQueue {
 public:
  using Work = std::function<void()>;

  // No more than so many run at one time; the pool, which must outlive the queue's work, may be
  // used for other things as well.
  static constexpr int kAtOnce = 2;

  explicit FairQueue(asio::thread_pool& pool) noexcept : pool_(pool) {}

  // Runs `work` on the pool when it is the turn of `whose` and all that came before it of the same
  // has run or runs. It must not throw. Throws std::bad_alloc; it is not run then.
  void post(const std::string& whose, Work work);

  // Forgets what has not run. When the pool does not run any more.
  void clear() noexcept;

 private:
  using Line = std::list<Work>;

  void run() noexcept;
  Work next() noexcept;

  asio::thread_pool& pool_;
  std::mutex mutex_;
  // Under the mutex: the lines of all who wait, and whose turn is when.
  std::unordered_map<std::string, Line> lines_;
  std::list<const std::string*> turns_;  // keys of `lines_`
  int running_ = 0;                      // or about to
};

}  // namespace orv::server
