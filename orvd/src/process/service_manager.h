// The two conversations with a service manager, of which both sides are environment variables, a
// socket for notices and listening sockets that are open already (sd_notify(3), sd_listen_fds(3)).
// The protocol is stable and a few lines long; the library that also speaks it would bring much
// more into the process.
#pragma once

#include <chrono>
#include <string>
#include <string_view>
#include <vector>

#include "descriptor.h"
#include "net/listening_socket.h"

namespace orv::server {

// Tells the manager how the server is. Without a manager everything is silent.
//
// Threads: any, once it is made; notices are single datagrams.
class ServiceManager {
 public:
  // Nobody to tell.
  ServiceManager() = default;

  // Connects to the socket that NOTIFY_SOCKET names, and takes that variable and those of the
  // watchdog out of the environment. While the process still has the rights it was started with.
  // False, with the cause, when there is a socket that cannot be used.
  bool connect(std::string& error);

  // What a manager distinguishes. `status` is a line for people.
  void ready(std::string_view status) const noexcept;
  void reloading() const noexcept;  // followed by ready()
  void stopping() const noexcept;
  void alive() const noexcept;

  // How often alive() is expected, halved to be in time; zero: not at all.
  std::chrono::microseconds watchdog_interval() const noexcept { return interval_; }

 private:
  void tell(std::string_view notice) const noexcept;
  Descriptor socket_;
  std::chrono::microseconds interval_{0};
};

// How many descriptors a service manager says to have handed over, from 3 on; 0 when the variables
// are absent or meant for another process. Of more than can be taken over, one more than that.
int inherited_count() noexcept;

// Takes over those sockets, marked to be closed in programs that are started, and takes the
// variables out of the environment. Each is named (FileDescriptorName=) by what it is for: ldap,
// ldaps or ldapi. False, with the cause and what to do, when one has another name, is no listening
// stream socket, or not of the family of its name, when every user of the host may connect to one
// of ldapi, and when there are more than 64.
bool inherit_sockets(std::vector<ListeningSocket>& sockets, std::string& error);

}  // namespace orv::server
