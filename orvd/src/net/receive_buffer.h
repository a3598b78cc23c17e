// Where a connection keeps what its client has sent until it is handled: passwords among it, in
// clear. So it is whole pages of their own, which no core dump shows.
//
// Threads: belongs to one thread.
#pragma once

#include <cstddef>

namespace orv::server {

class ReceiveBuffer {
 public:
  // Zeroed. Throws std::bad_alloc.
  explicit ReceiveBuffer(std::size_t size);
  ~ReceiveBuffer();
  ReceiveBuffer(const ReceiveBuffer&) = delete;
  ReceiveBuffer& operator=(const ReceiveBuffer&) = delete;

  char* data() noexcept { return data_; }
  const char* data() const noexcept { return data_; }
  std::size_t size() const noexcept { return size_; }

  // Becomes another size and keeps the first `kept` bytes, no more than either size; the rest is
  // gone. Throws std::bad_alloc, and is as it was then.
  void resize(std::size_t size, std::size_t kept);

 private:
  char* data_;
  std::size_t size_;
};

}  // namespace orv::server
