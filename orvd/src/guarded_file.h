// Files that the server appends to for as long as it runs, opened so that none of them is a file in
// which something else belongs, under whatever name: a log that is the configuration, or two logs
// in one file, would destroy what is there.
//
// Threads: functions without state.
#pragma once

#include <sys/types.h>

#include <string>
#include <vector>

#include "descriptor.h"

namespace orv::server {

// Which file it is, whatever its names are.
struct FileIdentity {
  dev_t device = 0;
  ino_t inode = 0;  // 0: none

  explicit operator bool() const noexcept { return inode != 0; }
  friend bool operator==(const FileIdentity&, const FileIdentity&) = default;
};

// A file that somebody has open, and as what: "the audit log".
struct FileInUse {
  FileIdentity file;
  std::string as;
};

// What a file that is opened must not be.
struct GuardedFiles {
  std::vector<std::string> names;  // whatever they stand for when it is opened; "" is nothing
  std::vector<FileInUse> in_use;   // also when they were renamed or have no name any more
};

struct AppendedFile {
  Descriptor descriptor;
  FileIdentity identity;
  off_t size = 0;  // when it was opened
};

// Opens the file at `path` to append to it; one that is not there is made, for its owner only.
// `access` is O_WRONLY or O_RDWR, with O_NOFOLLOW where a symbolic link is refused. Never waits for
// the other end of a pipe. The result is "", or why there is no such file: the system's words,
// "a symbolic link", "not a regular file" or "the same file as ..."; `file` is then unchanged, and
// a file that was made for this is gone again. Throws std::bad_alloc.
std::string open_to_append(const std::string& path, int access, const GuardedFiles& guarded,
                           AppendedFile& file);

// What a path leads to; none when it leads to nothing.
FileIdentity file_at(const std::string& path) noexcept;

// The regular file that a descriptor leads to; none when it leads elsewhere.
FileIdentity regular_file_of(int descriptor) noexcept;

}  // namespace orv::server
