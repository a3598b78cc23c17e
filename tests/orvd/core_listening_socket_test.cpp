// Ports at several addresses, of which another program may hold some.
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <sys/socket.h>

#include <cerrno>
#include <cstdint>
#include <string>
#include <vector>

#include "net/listening_socket.h"

#ifdef ORV_HOST_HAS_IPV6
namespace orv::server {
namespace {

// Listens at `::` as another program would, at a port of the kernel's choice and for IPv6 alone.
Descriptor impostor() {
  Descriptor made(::socket(AF_INET6, SOCK_STREAM | SOCK_CLOEXEC, 0));
  const int on = 1;
  sockaddr_in6 anywhere{};
  anywhere.sin6_family = AF_INET6;
  EXPECT_EQ(::setsockopt(made.number(), IPPROTO_IPV6, IPV6_V6ONLY, &on, sizeof on), 0);
  EXPECT_EQ(::setsockopt(made.number(), SOL_SOCKET, SO_REUSEADDR, &on, sizeof on), 0);
  EXPECT_EQ(::bind(made.number(), reinterpret_cast<sockaddr*>(&anywhere), sizeof anywhere), 0);
  EXPECT_EQ(::listen(made.number(), 1), 0);
  return made;
}

bool serves_both_at_one_port(const std::vector<ListeningSocket>& sockets) {
  return sockets.size() == 2 && sockets[0].family == AF_INET && sockets[1].family == AF_INET6 &&
         port_of(sockets[0].socket.number()) != 0 &&
         port_of(sockets[0].socket.number()) == port_of(sockets[1].socket.number());
}

// Clients that come over IPv6 would be the other program's, with their passwords.
TEST(ListeningSocket, PortThatAnotherProgramHasAtTheIpv6AddressesIsNamed) {
  std::string error;
  // Another program may have the port at the IPv4 addresses too, by chance.
  for (int i = 0; i < 20 && error.find(" :: ") == std::string::npos; ++i) {
    const Descriptor other = impostor();
    const std::uint16_t port = port_of(other.number());
    std::vector<ListeningSocket> sockets;
    error.clear();
    EXPECT_FALSE(open_tcp({}, port, false, sockets, error)) << port;
  }
  EXPECT_NE(error.find("cannot listen on :: port "), std::string::npos) << error;
  EXPECT_NE(error.find("Address already in use; another program has the port there"),
            std::string::npos)
      << error;
}

// With so many taken, a choice that looks at the first address alone would soon hit one.
TEST(ListeningSocket, PortOfTheKernelsChoiceIsFreeAtAllAddresses) {
  std::vector<Descriptor> others;
  for (int i = 0; i < 400; ++i) others.push_back(impostor());
  for (int i = 0; i < 200; ++i) {
    std::vector<ListeningSocket> every;
    std::vector<ListeningSocket> each;
    std::string error;
    ASSERT_TRUE(open_tcp({}, 0, false, every, error)) << error;
    ASSERT_TRUE(serves_both_at_one_port(every));
    ASSERT_TRUE(open_tcp({"127.0.0.1", "::1"}, 0, true, each, error)) << error;
    ASSERT_TRUE(serves_both_at_one_port(each));
  }
}

// What was opened before, for the other port, is not given up with a port that did not do.
TEST(ListeningSocket, SocketsThatWereThereBeforeStay) {
  std::vector<Descriptor> others;
  for (int i = 0; i < 400; ++i) others.push_back(impostor());
  std::vector<ListeningSocket> sockets;
  std::string error;
  ASSERT_TRUE(open_tcp({"127.0.0.1"}, 0, false, sockets, error)) << error;
  const int first = sockets[0].socket.number();
  for (std::size_t count = 1; count < 201; count += 2) {
    ASSERT_TRUE(open_tcp({}, 0, true, sockets, error)) << error;
    ASSERT_EQ(sockets.size(), count + 2);
    EXPECT_EQ(sockets[0].socket.number(), first);
  }
}

}  // namespace
}  // namespace orv::server
#endif
