#include "ops/fair_queue.h"

#include <asio/post.hpp>
#include <utility>

namespace orv::server {

// Whoever is started and finds nothing, since something was thrown after that, just ends.
void FairQueue::post(const std::string& whose, Work work) {
  Line one;
  one.push_back(std::move(work));
  const std::lock_guard lock(mutex_);
  if (running_ < kAtOnce) {
    asio::post(pool_, [this] { run(); });
    ++running_;
  }
  const auto [line, is_new] = lines_.try_emplace(whose);
  try {
    if (is_new) turns_.push_back(&line->first);
  } catch (...) {
    lines_.erase(line);
    throw;
  }
  line->second.splice(line->second.end(), one);
}

// One at a time: what others post to the pool comes in between.
void FairQueue::run() noexcept {
  while (const Work work = next()) {
    work();
    try {
      asio::post(pool_, [this] { run(); });
      return;
    } catch (...) {
      // Without memory the next one comes at once.
    }
  }
}

// Empty when nobody waits: one less runs then.
FairQueue::Work FairQueue::next() noexcept {
  const std::lock_guard lock(mutex_);
  if (turns_.empty()) {
    --running_;
    return {};
  }
  const auto line = lines_.find(*turns_.front());
  Work work = std::move(line->second.front());
  line->second.pop_front();
  turns_.splice(turns_.end(), turns_, turns_.begin());
  if (line->second.empty()) {
    turns_.pop_back();
    lines_.erase(line);
  }
  return work;
}

void FairQueue::clear() noexcept {
  std::unordered_map<std::string, Line> forgotten;  // destroyed after the mutex is released
  const std::lock_guard lock(mutex_);
  turns_.clear();
  forgotten.swap(lines_);
}

}  // namespace orv::server
