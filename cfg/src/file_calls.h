// The file calls of a save, in one place: what writes, flushes and renames the configuration goes
// through this seam, so that a test can stand in for a disk that is full, broken or cut off. So
// does what a reader asks about those who write the file in place.
//
// Functions answer as the system calls they stand for: -1 with the cause in errno. They do not
// repeat an interrupted call. Thread-safe.
#pragma once

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/types.h>

#include <cstddef>
#include <ctime>
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

  // From here on, whoever opens this file for writing waits (or gets EWOULDBLOCK, if that is how he
  // opens it), until `let_writers_in`, the end of the descriptor, or the time that the system sets
  // for that (/proc/sys/fs/lease-break-time). The file is open for reading alone. EAGAIN when
  // somebody has it open for writing. Other errors where that cannot be told: EACCES for a file of
  // another user, EINVAL on file systems of the network; some of these say EAGAIN too.
  virtual int hold_writers_off(int file);
  virtual void let_writers_in(int file);
  // Between two attempts to read: one millisecond.
  virtual void pause_for_writer();
  virtual timespec now();  // by the clock that the times of files are of
};

// Those of the system.
FileCalls& system_file_calls() noexcept;

}  // namespace orv::cfg
