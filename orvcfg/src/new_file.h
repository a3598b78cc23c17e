// Files that come into being whole or not at all, and never take the place of another.
#pragma once

#include <string>
#include <string_view>

namespace orv::orvcfg {

// Owner of a file descriptor.
class Descriptor {
 public:
  explicit Descriptor(int fd) noexcept : fd_(fd) {}
  ~Descriptor();
  Descriptor(const Descriptor&) = delete;
  Descriptor& operator=(const Descriptor&) = delete;

  [[nodiscard]] bool valid() const noexcept { return fd_ >= 0; }
  [[nodiscard]] int get() const noexcept { return fd_; }
  // Closes now. False when the system reports that data was lost.
  [[nodiscard]] bool close() noexcept;

 private:
  int fd_;
};

// "what: path: reason", the reason taken from errno.
std::string system_failure(std::string_view what, const std::string& path);

// Makes `path` with `content`, readable and writable by its owner only: written to "<path>.new",
// flushed, and given its name when nothing has that name yet. What an interrupted run left under
// "<path>.new" is removed first, so callers hold a lock against one another. False with the cause
// in `why`; nothing is left behind then.
bool write_new_file(const std::string& path, std::string_view content, std::string& why);

// Flushes a directory, so that names made in it survive a power failure.
bool flush_directory(const std::string& path, std::string& why);

// Reads a file that only its owner may read or write, at most `limit` bytes. False with `why`.
bool read_private_file(const std::string& path, std::size_t limit, std::string& content,
                       std::string& why);

}  // namespace orv::orvcfg
