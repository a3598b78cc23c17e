#include "net/receive_buffer.h"

#include <sys/mman.h>

#include <cstring>
#include <new>

namespace orv::server {
namespace {

char* map(std::size_t size) {
  void* const mapped =
      ::mmap(nullptr, size, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
  if (mapped == MAP_FAILED) throw std::bad_alloc();
  // A kernel that cannot leaves the other bounds: the process makes no core dumps.
  static_cast<void>(::madvise(mapped, size, MADV_DONTDUMP));
  return static_cast<char*>(mapped);
}

// The kernel zeroes what it takes back.
void unmap(char* data, std::size_t size) noexcept {
  ::munmap(data, size);
}

}  // namespace

ReceiveBuffer::ReceiveBuffer(std::size_t size) : data_(map(size)), size_(size) {}

ReceiveBuffer::~ReceiveBuffer() {
  unmap(data_, size_);
}

void ReceiveBuffer::resize(std::size_t size, std::size_t kept) {
  char* const larger = map(size);
  std::memcpy(larger, data_, kept);
  unmap(data_, size_);
  data_ = larger;
  size_ = size;
}

}  // namespace orv::server
