// The name of a Unix socket in the file system: made when the server listens, gone when it ends.
//
// Threads: one.
#pragma once

#include <sys/types.h>

#include <string>

#include "descriptor.h"

namespace orv::server {

class LocalSocket {
 public:
  LocalSocket() = default;
  ~LocalSocket() { remove(); }
  LocalSocket(const LocalSocket&) = delete;
  LocalSocket& operator=(const LocalSocket&) = delete;

  // A listening socket at `path`, which its owner and root may connect to. A socket that is there
  // and that nobody listens at is what a server that was killed left behind: it is replaced.
  // Without a descriptor, `error` has the cause: somebody listens there, something else is there,
  // the path is too long for a socket, or the system refuses.
  Descriptor listen(const std::string& path, std::string& error);

  // Removes the name, if it still is the socket that was made.
  void remove() noexcept;

  const std::string& path() const noexcept { return path_; }

 private:
  bool bind(int socket, const std::string& path, std::string& error);
  std::string path_;
  dev_t device_ = 0;
  ino_t inode_ = 0;
};

// Who holds the other end of a connected Unix socket. False when the system does not tell.
bool peer_of(int socket, uid_t& user, pid_t& process) noexcept;

}  // namespace orv::server
