#include "process/service_manager.h"

#include <fcntl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/time.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <optional>
#include <utility>

namespace orv::server {
namespace {

constexpr int kFirstInherited = 3;
constexpr int kMostInherited = 64;

std::string take_variable(const char* name) {
  const char* const value = std::getenv(name);
  std::string taken = value ? value : "";
  ::unsetenv(name);
  return taken;
}

template <typename Number>
std::optional<Number> number_in(std::string_view text) noexcept {
  Number number = 0;
  const auto [end, status] = std::from_chars(text.data(), text.data() + text.size(), number);
  if (status != std::errc() || end != text.data() + text.size()) return std::nullopt;
  return number;
}

// ---- notices

// A name that begins with '@' is none of the file system.
bool make_address(const std::string& name, sockaddr_un& address, socklen_t& size) noexcept {
  if (name.size() >= sizeof address.sun_path || (name[0] != '/' && name[0] != '@')) return false;
  address.sun_family = AF_UNIX;
  std::memcpy(address.sun_path, name.data(), name.size());
  if (name[0] == '@') address.sun_path[0] = '\0';
  size = static_cast<socklen_t>(offsetof(sockaddr_un, sun_path) + name.size());
  return true;
}

Descriptor connect_to(const std::string& name) noexcept {
  constexpr timeval kPatience{1, 0};  // nobody waits for a manager that has stopped reading
  sockaddr_un address{};
  socklen_t size = 0;
  errno = EINVAL;
  if (!make_address(name, address, size)) return {};
  Descriptor made(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));
  if (!made) return made;
  ::setsockopt(made.number(), SOL_SOCKET, SO_SNDTIMEO, &kPatience, sizeof kPatience);
  if (::connect(made.number(), reinterpret_cast<const sockaddr*>(&address), size) == 0) return made;
  return {};
}

// ---- sockets

// Parts of a list with ':' between them.
std::vector<std::string> split(const std::string& text) {
  std::vector<std::string> parts;
  for (std::size_t begin = 0; begin <= text.size();) {
    const std::size_t end = std::min(text.find(':', begin), text.size());
    parts.push_back(text.substr(begin, end - begin));
    begin = end + 1;
  }
  return parts;
}

std::optional<ListenerKind> kind_of(const std::string& name) noexcept {
  if (name == "ldap") return ListenerKind::clear;
  if (name == "ldaps") return ListenerKind::secure;
  if (name == "ldapi") return ListenerKind::local;
  return std::nullopt;
}

bool option_of(int socket, int option, int& value) noexcept {
  socklen_t size = sizeof value;
  return ::getsockopt(socket, SOL_SOCKET, option, &value, &size) == 0;
}

// Whoever may write to a Unix socket may connect to it, and what comes over it counts as local: a
// proof of who somebody is, not bounded as strangers are. A name outside the file system has no
// rights at all.
std::string openness_of(int socket) {
  sockaddr_un address{};
  socklen_t size = sizeof address;
  if (::getsockname(socket, reinterpret_cast<sockaddr*>(&address), &size) != 0)
    return "has no name that can be told: " + std::string(std::strerror(errno));
  // A path that fills the address has no NUL behind it.
  const std::string path(address.sun_path, ::strnlen(address.sun_path, sizeof address.sun_path));
  struct stat status {};
  if (!path.empty() && ::stat(path.c_str(), &status) != 0)
    return "is at " + path + ", which cannot be examined: " + std::strerror(errno);
  if (!path.empty() && (status.st_mode & S_IWOTH) == 0) return "";
  return "lets every user of the host connect; set SocketMode=0600 and SocketUser= to the user of "
         "the server in its socket unit" +
         std::string(path.empty() ? ", and ListenStream= to a path" : "");
}

// Why it cannot be accepted from; "" when it can.
std::string defect_of(ListeningSocket& taken, const std::string& name) {
  const int socket = taken.socket.number();
  int type = 0;
  int listens = 0;
  if (!option_of(socket, SO_TYPE, type) || !option_of(socket, SO_DOMAIN, taken.family))
    return "is no socket";
  if (type != SOCK_STREAM) return "is no stream socket (ListenStream=)";
  if (!option_of(socket, SO_ACCEPTCONN, listens) || listens == 0)
    return "does not listen (Accept=no)";
  const bool local = taken.family == AF_UNIX;
  if (local != (taken.kind == ListenerKind::local) ||
      (!local && taken.family != AF_INET && taken.family != AF_INET6))
    return "is not of the family that its name says: ldap and ldaps are IPv4 or IPv6, ldapi is a "
           "Unix socket";
  if (local)
    if (std::string openness = openness_of(socket); !openness.empty()) return openness;
  const int flags = ::fcntl(socket, F_GETFL);
  if (flags < 0 || ::fcntl(socket, F_SETFL, flags | O_NONBLOCK) != 0 ||
      ::fcntl(socket, F_SETFD, FD_CLOEXEC) != 0)
    return "cannot be set up: " + std::string(std::strerror(errno));
  return name.empty() ? "has no name" : "";
}

std::string describe(int number, const std::string& name) {
  return "the inherited descriptor " + std::to_string(number) + " (\"" + name + "\") ";
}

}  // namespace

bool ServiceManager::connect(std::string& error) {
  const std::string name = take_variable("NOTIFY_SOCKET");
  const std::string process = take_variable("WATCHDOG_PID");
  const std::string interval = take_variable("WATCHDOG_USEC");
  if (name.empty()) return true;
  socket_ = connect_to(name);
  if (!socket_) {
    error =
        "cannot reach the service manager at NOTIFY_SOCKET=" + name + ": " + std::strerror(errno);
    return false;
  }
  if (process.empty() || number_in<pid_t>(process) == ::getpid())
    interval_ = std::chrono::microseconds(number_in<std::int64_t>(interval).value_or(0) / 2);
  return true;
}

void ServiceManager::tell(std::string_view notice) const noexcept {
  if (!socket_) return;
  while (::send(socket_.number(), notice.data(), notice.size(), MSG_NOSIGNAL) < 0 &&
         errno == EINTR) {
  }
}

void ServiceManager::ready(std::string_view status) const noexcept try {
  tell("READY=1\nSTATUS=" + std::string(status) + "\n");
} catch (...) {
  tell("READY=1\n");
}

// The manager compares the time with that of its request.
void ServiceManager::reloading() const noexcept {
  timespec now{};
  ::clock_gettime(CLOCK_MONOTONIC, &now);
  constexpr std::string_view kBegin =
      "RELOADING=1\nSTATUS=Reading the settings again\nMONOTONIC_USEC=";
  char text[kBegin.size() + 32];
  std::memcpy(text, kBegin.data(), kBegin.size());
  const std::int64_t time = std::int64_t{now.tv_sec} * 1'000'000 + now.tv_nsec / 1000;
  char* const end = std::to_chars(text + kBegin.size(), text + sizeof text, time).ptr;
  *end = '\n';
  tell({text, static_cast<std::size_t>(end + 1 - text)});
}

void ServiceManager::stopping() const noexcept {
  tell("STOPPING=1\nSTATUS=Stopping\n");
}

void ServiceManager::alive() const noexcept {
  tell("WATCHDOG=1\n");
}

int inherited_count() noexcept {
  const char* const process = std::getenv("LISTEN_PID");
  const char* const count = std::getenv("LISTEN_FDS");
  if (!process || !count || number_in<pid_t>(process) != ::getpid()) return 0;
  const int number = number_in<int>(count).value_or(0);
  return std::clamp(number, 0, kMostInherited + 1);
}

bool inherit_sockets(std::vector<ListeningSocket>& sockets, std::string& error) {
  const int count = inherited_count();
  take_variable("LISTEN_PID");
  take_variable("LISTEN_FDS");
  const std::vector<std::string> names = split(take_variable("LISTEN_FDNAMES"));
  if (count > kMostInherited) {
    error = "more than " + std::to_string(kMostInherited) +
            " sockets are handed over (LISTEN_FDS); list fewer in the socket units";
    return false;
  }
  for (int i = 0; i < count; ++i) {
    const int number = kFirstInherited + i;
    const auto place = static_cast<std::size_t>(i);
    const std::string name = place < names.size() ? names[place] : "";
    const std::optional<ListenerKind> kind = kind_of(name);
    if (!kind) {
      error = describe(number, name) + "is not named ldap, ldaps or ldapi (FileDescriptorName=)";
      return false;
    }
    ListeningSocket taken{Descriptor(number), *kind, 0};
    if (const std::string defect = defect_of(taken, name); !defect.empty()) {
      error = describe(number, name) + defect;
      return false;
    }
    sockets.push_back(std::move(taken));
  }
  return true;
}

}  // namespace orv::server
