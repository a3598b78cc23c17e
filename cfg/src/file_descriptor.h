// Owner of a file descriptor.
#pragma once

#include <unistd.h>

namespace orv::cfg {

class FileDescriptor {
 public:
  explicit FileDescriptor(int value) noexcept : value_(value) {}
  ~FileDescriptor() {
    if (value_ >= 0) ::close(value_);
  }
  FileDescriptor(const FileDescriptor&) = delete;
  FileDescriptor& operator=(const FileDescriptor&) = delete;

  [[nodiscard]] int get() const noexcept { return value_; }
  [[nodiscard]] bool is_open() const noexcept { return value_ >= 0; }

 private:
  int value_;
};

}  // namespace orv::cfg
