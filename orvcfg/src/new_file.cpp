#include "new_file.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <system_error>

#include "cfg/secret.h"

namespace orv::orvcfg {

namespace {

bool write_all(int fd, std::string_view content) {
  while (!content.empty()) {
    const ssize_t written = ::write(fd, content.data(), content.size());
    if (written < 0 && errno == EINTR) continue;
    if (written < 0) return false;
    content.remove_prefix(static_cast<std::size_t>(written));
  }
  return true;
}

// Mode by fchmod as well: the process's umask may take bits from the owner.
bool write_flushed(const std::string& path, std::string_view content) {
  Descriptor file(::open(path.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC | O_NOFOLLOW, 0600));
  if (!file.valid()) return false;
  return ::fchmod(file.get(), 0600) == 0 && write_all(file.get(), content) &&
         ::fsync(file.get()) == 0 && file.close();
}

// Gives the file its name unless the name is taken. Not every file system can refuse in the rename
// itself; a hard link can always refuse.
bool rename_unless_taken(const std::string& from, const std::string& to) {
  if (::renameat2(AT_FDCWD, from.c_str(), AT_FDCWD, to.c_str(), RENAME_NOREPLACE) == 0) return true;
  if (errno != EINVAL && errno != ENOSYS) return false;
  return ::link(from.c_str(), to.c_str()) == 0 && ::unlink(from.c_str()) == 0;
}

bool is_private(const struct stat& status) {
  return S_ISREG(status.st_mode) && (status.st_mode & (S_IRWXG | S_IRWXO)) == 0;
}

bool read_up_to(int fd, std::size_t limit, std::string& content) {
  std::string bytes(limit, '\0');
  std::size_t length = 0;
  while (length < limit) {
    const ssize_t count = ::read(fd, bytes.data() + length, limit - length);
    if (count < 0 && errno == EINTR) continue;
    if (count < 0) return false;
    if (count == 0) break;
    length += static_cast<std::size_t>(count);
  }
  content.assign(bytes, 0, length);
  cfg::wipe(bytes);
  return true;
}

}  // namespace

Descriptor::~Descriptor() {
  if (fd_ >= 0) ::close(fd_);
}

bool Descriptor::close() noexcept {
  const int fd = fd_;
  fd_ = -1;
  return ::close(fd) == 0;
}

std::string system_failure(std::string_view what, const std::string& path) {
  const int code = errno;
  std::string text(what);
  return text.append(": ").append(path).append(": ").append(std::generic_category().message(code));
}

bool write_new_file(const std::string& path, std::string_view content, std::string& why) {
  const std::string temporary = path + ".new";
  ::unlink(temporary.c_str());
  if (!write_flushed(temporary, content) || !rename_unless_taken(temporary, path)) {
    why = system_failure("cannot write", path);
    ::unlink(temporary.c_str());
    return false;
  }
  return true;
}

bool flush_directory(const std::string& path, std::string& why) {
  Descriptor directory(::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (directory.valid() && ::fsync(directory.get()) == 0) return true;
  why = system_failure("cannot flush the directory", path);
  return false;
}

bool read_private_file(const std::string& path, std::size_t limit, std::string& content,
                       std::string& why) {
  // Not blocking: a pipe under this name would otherwise hold the caller for ever.
  Descriptor file(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK));
  struct stat status {};
  if (!file.valid() || ::fstat(file.get(), &status) != 0) {
    why = system_failure("cannot read", path);
    return false;
  }
  if (!is_private(status)) {
    why = path + " must be a regular file that only its owner may read (chmod 600)";
    return false;
  }
  if (!read_up_to(file.get(), limit, content)) {
    why = system_failure("cannot read", path);
    return false;
  }
  return true;
}

}  // namespace orv::orvcfg
