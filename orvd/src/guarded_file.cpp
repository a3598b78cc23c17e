#include "guarded_file.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <utility>

namespace orv::server {
namespace {

FileIdentity identity_of(const struct stat& status) noexcept {
  return {status.st_dev, status.st_ino};
}

// O_NONBLOCK: a named pipe without a reader must not hold the server up before it is refused. The
// last attempt may make a file as well: a link that leads to none is there and is not.
Descriptor open_or_make(const char* path, int access, bool& made) noexcept {
  const int flags = access | O_APPEND | O_CLOEXEC | O_NONBLOCK | O_NOCTTY;
  Descriptor file(::open(path, flags));
  if (file || errno != ENOENT) return file;
  file = Descriptor(::open(path, flags | O_CREAT | O_EXCL, 0600));
  made = static_cast<bool>(file);
  if (file || errno != EEXIST) return file;
  return Descriptor(::open(path, flags | O_CREAT, 0600));
}

// Why the opened file cannot be appended to, or "".
std::string refuse(const struct stat& status, const GuardedFiles& guarded) {
  if (!S_ISREG(status.st_mode)) return "not a regular file";
  const FileIdentity file = identity_of(status);
  for (const FileInUse& other : guarded.in_use)
    if (file == other.file) return "the same file as " + other.as;
  for (const std::string& name : guarded.names) {
    struct stat other {};
    if (!name.empty() && ::stat(name.c_str(), &other) == 0 && file == identity_of(other))
      return "the same file as " + name;
  }
  return "";
}

std::string why_not_opened(int error, int access) {
  return error == ELOOP && (access & O_NOFOLLOW) != 0 ? "a symbolic link" : std::strerror(error);
}

}  // namespace

// The file is examined once it is open: what its name meant before may be something else by now.
std::string open_to_append(const std::string& path, int access, const GuardedFiles& guarded,
                           AppendedFile& file) {
  bool made = false;
  struct stat status {};
  Descriptor opened = open_or_make(path.c_str(), access, made);
  if (!opened || ::fstat(opened.number(), &status) != 0) return why_not_opened(errno, access);
  std::string reason = refuse(status, guarded);
  if (!reason.empty()) {
    if (made) ::unlink(path.c_str());
    return reason;
  }
  file = {std::move(opened), identity_of(status), status.st_size};
  return "";
}

FileIdentity file_at(const std::string& path) noexcept {
  struct stat status {};
  if (path.empty() || ::stat(path.c_str(), &status) != 0) return {};
  return identity_of(status);
}

FileIdentity regular_file_of(int descriptor) noexcept {
  struct stat status {};
  if (::fstat(descriptor, &status) != 0 || !S_ISREG(status.st_mode)) return {};
  return identity_of(status);
}

}  // namespace orv::server
