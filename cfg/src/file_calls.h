// The file calls of a save, in one place: what writes, flushes and renames the configuration goes
// through this seam, so that a test can stand in for a disk that is full, broken or cut off.
//
// Functions answer as the system calls they stand for: -1 with the cause in errno. They do not
// repeat an interrupted call. Thread-safe.
#pragma once

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/types.h>

#include <cstddef>
#include <string>

namespace orv::cfg {

class FileCalls {
 public:
  FileCalls() = default;
  virtual ~FileCalls() = default;
  FileCalls(const FileCalls&) = delete;
  FileCalls& operator=(const FileCalls&) = delete;

  // The path without symbolic links. Throws std::bad_alloc.
  virtual int resolve(const char* path, std::string& resolved);

  virtual int open(const char* path, int flags, mode_t mode);
  virtual ssize_t read(int file, void* to, std::size_t size);
  virtual ssize_t write(int file, const void* from, std::size_t size);
  virtual int flush(int file);  // of a directory: its names
  // Lets the disk begin with what a flush will wait for. A hint: nothing depends on it, and what
  // fails meanwhile the flush tells.
  virtual void start_flush(int file);
  virtual int close(int file);

  virtual int status(int file, struct stat& status);
  virtual int status_of(const char* path, struct stat& status);  // not of a link's target
  virtual int set_owner(int file, uid_t owner, gid_t group);
  virtual int set_mode(int file, mode_t mode);
  // Gives `to` the access list (beyond the mode) of `from`, or none when that has none.
  virtual int copy_access_list(int from, int to);

  virtual int link(const char* from, const char* to);
  virtual int rename(const char* from, const char* to);
  // Makes each of two names that of the other's file in one step; EINVAL, ENOSYS or ENOTSUP where
  // the file system cannot.
  virtual int exchange(const char* a, const char* b);
  virtual int remove(const char* path);

  // Takes the advisory lock of an open file; EWOULDBLOCK when somebody else has it. It ends with
  // the last descriptor of the open file.
  virtual int lock(int file);
  // Between two attempts to get a lock: 10 milliseconds.
  virtual void pause();
};

// Those of the system.
FileCalls& system_file_calls() noexcept;

}  // namespace orv::cfg
