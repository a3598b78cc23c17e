// The owner of a file descriptor.
#pragma once

#include <unistd.h>

#include <utility>

namespace orv::server {

class Descriptor {
 public:
  Descriptor() = default;
  explicit Descriptor(int number) noexcept : number_(number) {}
  Descriptor(Descriptor&& other) noexcept : number_(std::exchange(other.number_, -1)) {}
  Descriptor& operator=(Descriptor&& other) noexcept {
    std::swap(number_, other.number_);
    return *this;
  }
  ~Descriptor() { close(); }

  // -1 when there is none.
  int number() const noexcept { return number_; }
  explicit operator bool() const noexcept { return number_ >= 0; }

  int release() noexcept { return std::exchange(number_, -1); }

  void close() noexcept {
    if (number_ >= 0) ::close(std::exchange(number_, -1));
  }

 private:
  int number_ = -1;
};

}  // namespace orv::server
