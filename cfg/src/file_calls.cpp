#include "file_calls.h"

#include <sys/file.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <climits>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <new>
#include <vector>

namespace orv::cfg {

namespace {

constexpr const char* kAccessList = "system.posix_acl_access";

bool has_no_access_list(int error) noexcept {
  return error == ENODATA || error == ENOTSUP;
}

}  // namespace

int FileCalls::resolve(const char* path, std::string& resolved) {
  // Memory of our own: where the call has to find some, it does not say that there was none.
  std::array<char, PATH_MAX> text{};
  if (::realpath(path, text.data()) == nullptr) return -1;
  resolved = text.data();
  return 0;
}

int FileCalls::open(const char* path, int flags, mode_t mode) {
  return ::open(path, flags, mode);
}

ssize_t FileCalls::read(int file, void* to, std::size_t size) {
  return ::read(file, to, size);
}

ssize_t FileCalls::write(int file, const void* from, std::size_t size) {
  return ::write(file, from, size);
}

int FileCalls::flush(int file) {
  return ::fsync(file);
}

void FileCalls::start_flush(int file) {
  ::sync_file_range(file, 0, 0, SYNC_FILE_RANGE_WRITE);
}

int FileCalls::close(int file) {
  return ::close(file);
}

int FileCalls::status(int file, struct stat& status) {
  return ::fstat(file, &status);
}

int FileCalls::status_of(const char* path, struct stat& status) {
  return ::lstat(path, &status);
}

int FileCalls::set_owner(int file, uid_t owner, gid_t group) {
  return ::fchown(file, owner, group);
}

int FileCalls::set_mode(int file, mode_t mode) {
  return ::fchmod(file, mode);
}

int FileCalls::copy_access_list(int from, int to) try {
  const ssize_t size = ::fgetxattr(from, kAccessList, nullptr, 0);
  if (size < 0 && !has_no_access_list(errno)) return -1;
  if (size <= 0) {
    // A new file may have inherited one from its directory.
    return ::fremovexattr(to, kAccessList) == 0 || has_no_access_list(errno) ? 0 : -1;
  }
  std::vector<char> list(static_cast<std::size_t>(size));
  const ssize_t got = ::fgetxattr(from, kAccessList, list.data(), list.size());
  if (got < 0) return -1;
  return ::fsetxattr(to, kAccessList, list.data(), static_cast<std::size_t>(got), 0);
} catch (const std::bad_alloc&) {
  errno = ENOMEM;
  return -1;
}

int FileCalls::link(const char* from, const char* to) {
  return ::link(from, to);
}

int FileCalls::rename(const char* from, const char* to) {
  return std::rename(from, to);
}

int FileCalls::exchange(const char* a, const char* b) {
  return ::renameat2(AT_FDCWD, a, AT_FDCWD, b, RENAME_EXCHANGE);
}

int FileCalls::remove(const char* path) {
  return ::unlink(path);
}

int FileCalls::lock(int file) {
  return ::flock(file, LOCK_EX | LOCK_NB);
}

void FileCalls::pause() {
  const timespec time{0, 10'000'000};
  ::nanosleep(&time, nullptr);
}

int FileCalls::hold_writers_off(int file) {
  // The signal that says that a writer waits would end the process. Nobody needs to hear it: a
  // reader is done in no time. This one is ignored by whoever does not ask for it.
  if (::fcntl(file, F_SETSIG, SIGURG) != 0) return -1;
  return ::fcntl(file, F_SETLEASE, F_RDLCK);
}

void FileCalls::let_writers_in(int file) {
  ::fcntl(file, F_SETLEASE, F_UNLCK);
}

void FileCalls::pause_for_writer() {
  const timespec time{0, 1'000'000};
  ::nanosleep(&time, nullptr);
}

timespec FileCalls::now() {
  timespec time{};
  ::clock_gettime(CLOCK_REALTIME, &time);
  return time;
}

FileCalls& system_file_calls() noexcept {
  static FileCalls calls;
  return calls;
}

}  // namespace orv::cfg
