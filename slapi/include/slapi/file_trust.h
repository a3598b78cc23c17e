// Whether the files of an instance are safe from others on the host: for the server, which does not
// start with files that others could read or put something else in the place of, and for the tools.
//
// Thread-safe. Throws std::bad_alloc and nothing else.
#pragma once

#include <sys/types.h>

#include <string>
#include <vector>

namespace orv {

// What is wrong with the files, one line each with what to do about it; none: they can be relied
// on. Looked at are the files themselves, the folders they stand in, and symbolic links in place of
// the last part of their names, with the folders of those. The configuration file must be a regular
// file that others than its group cannot read and others than its owner cannot write; the key stash
// one that nobody but its owner can read; each belongs to `user` or to root. Nobody else may own
// such a folder or write in it, except where the sticky bit keeps files of others from being
// replaced. `key_stash` may be "". A file that is not there is no matter of this.
std::vector<std::string> distrusted_files(const std::string& config_file,
                                          const std::string& key_stash, uid_t user);

// The same of one file that says whom the server believes, such as the authorities that sign
// certificates of clients; "" when nothing is wrong with it. It may be read by everybody.
std::string distrust_of_authority(const std::string& file, uid_t user);

// The owner of the file; `otherwise` when there is none.
uid_t owner_of(const std::string& file, uid_t otherwise) noexcept;

}  // namespace orv
