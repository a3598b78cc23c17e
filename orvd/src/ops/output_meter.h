// How much of what the backend answered is still unread by its clients, over all connections and
// for each.
//
// A client that pipelines searches and does not read could otherwise make the server keep an answer
// of the full size for each of them. Two bounds hold: operations of a connection with more than
// `OutputShare::kMark` unread are not started before it drains, and all connections together keep
// no more than the meter's ceiling: a search gets what is left of it as its budget, and 51 when
// nothing is left. Answers that anybody may have (root DSE, schema, refusals) are not counted, so
// that strangers cannot use the ceiling up.
#pragma once

#include <algorithm>
#include <atomic>
#include <cstddef>

namespace orv::server {

// Thread-safe; outlives its shares.
class OutputMeter {
 public:
  static constexpr std::size_t kDefaultCeiling = std::size_t{256} << 20;

  explicit OutputMeter(std::size_t ceiling = kDefaultCeiling) : ceiling_(ceiling) {}

  // Bytes that may still be added; 0 when there is no room.
  std::size_t room() const noexcept {
    return ceiling_ - std::min(ceiling_, bytes_.load(std::memory_order_relaxed));
  }

 private:
  friend class OutputShare;
  const std::size_t ceiling_;
  std::atomic<std::size_t> bytes_{0};
};

// One connection's part. `answered` and `full` may be called from any thread, the rest by the
// connection's own.
class OutputShare {
 public:
  static constexpr std::size_t kMark = std::size_t{256} << 10;

  explicit OutputShare(OutputMeter& meter) : meter_(meter) {}
  ~OutputShare() { remove(bytes_.load(std::memory_order_relaxed)); }
  OutputShare(const OutputShare&) = delete;
  OutputShare& operator=(const OutputShare&) = delete;

  // An answer of the backend is ready.
  void answered(std::size_t bytes) noexcept { add(bytes); }

  // It goes to the client's queue now; the same number is to be taken away with `settled` once it
  // is there.
  void queued(std::size_t bytes) noexcept { counted_ += bytes; }
  void settled(std::size_t bytes) noexcept { remove(bytes); }

  // The client's queue holds this much now.
  void unwritten(std::size_t bytes) noexcept {
    if (bytes == 0) counted_ = 0;
    const std::size_t now = std::min(bytes, counted_);
    if (now > in_queue_) add(now - in_queue_);
    if (now < in_queue_) remove(in_queue_ - now);
    in_queue_ = now;
  }

  // Whether operations have to wait for the client.
  bool full() const noexcept { return bytes_.load(std::memory_order_relaxed) >= kMark; }

 private:
  void add(std::size_t bytes) noexcept {
    if (bytes == 0) return;
    bytes_.fetch_add(bytes, std::memory_order_relaxed);
    meter_.bytes_.fetch_add(bytes, std::memory_order_relaxed);
  }
  void remove(std::size_t bytes) noexcept {
    if (bytes == 0) return;
    bytes_.fetch_sub(bytes, std::memory_order_relaxed);
    meter_.bytes_.fetch_sub(bytes, std::memory_order_relaxed);
  }

  OutputMeter& meter_;
  std::atomic<std::size_t> bytes_{0};
  std::size_t counted_ = 0;   // of the backend's answers, since the queue was empty
  std::size_t in_queue_ = 0;  // as last told to the meter
};

}  // namespace orv::server
