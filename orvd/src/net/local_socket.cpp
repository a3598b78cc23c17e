#include "net/local_socket.h"

#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>

#include <cerrno>
#include <cstddef>
#include <cstring>

namespace orv::server {
namespace {

constexpr int kQueue = 128;

bool make_address(const std::string& path, sockaddr_un& address) {
  if (path.size() >= sizeof address.sun_path) return false;
  address.sun_family = AF_UNIX;
  std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
  return true;
}

Descriptor make_socket() {
  return Descriptor(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
}

const sockaddr* plain(const sockaddr_un& address) {
  return reinterpret_cast<const sockaddr*>(&address);
}

std::string failure(const std::string& path, const char* why) {
  return "cannot listen at " + path + ": " + why;
}

// Whether a socket is there that nobody listens at.
bool is_left_behind(const sockaddr_un& address) {
  struct stat status {};
  if (::lstat(address.sun_path, &status) != 0 || !S_ISSOCK(status.st_mode)) return false;
  const Descriptor probe = make_socket();
  return probe && ::connect(probe.number(), plain(address), sizeof address) != 0 &&
         errno == ECONNREFUSED;
}

}  // namespace

bool LocalSocket::bind(int socket, const std::string& path, std::string& error) {
  sockaddr_un address{};
  if (!make_address(path, address)) {
    error = failure(path, "the path is too long for a socket");
    return false;
  }
  if (is_left_behind(address)) ::unlink(path.c_str());
  // The name has the rights that the socket has when it is given one: there is no moment in which
  // it has others, and no file of somebody else's that could get them.
  if (::fchmod(socket, S_IRUSR | S_IWUSR) == 0 &&
      ::bind(socket, plain(address), sizeof address) == 0)
    return true;
  error = failure(path, std::strerror(errno));
  return false;
}

Descriptor LocalSocket::listen(const std::string& path, std::string& error) {
  Descriptor socket = make_socket();
  if (!socket) error = failure(path, std::strerror(errno));
  if (!socket || !bind(socket.number(), path, error)) return Descriptor();
  path_ = path;
  struct stat status {};
  if (::lstat(path.c_str(), &status) == 0) {
    device_ = status.st_dev;
    inode_ = status.st_ino;
  }
  if (::listen(socket.number(), kQueue) == 0) return socket;
  error = failure(path, std::strerror(errno));
  return Descriptor();
}

void LocalSocket::remove() noexcept {
  struct stat status {};
  if (!path_.empty() && ::lstat(path_.c_str(), &status) == 0 && S_ISSOCK(status.st_mode) &&
      status.st_dev == device_ && status.st_ino == inode_)
    ::unlink(path_.c_str());
  path_.clear();
}

bool peer_of(int socket, uid_t& user, pid_t& process) noexcept {
  ucred peer{};
  socklen_t size = sizeof peer;
  if (::getsockopt(socket, SOL_SOCKET, SO_PEERCRED, &peer, &size) != 0 || size != sizeof peer)
    return false;
  user = peer.uid;
  process = peer.pid;
  return true;
}

}  // namespace orv::server
