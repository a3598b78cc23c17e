// Which literals name an address of the host.

#include "host_addresses.h"

#include <arpa/inet.h>
#include <gtest/gtest.h>
#include <netinet/in.h>

#include <list>
#include <string>

#include "slapi/services.h"

namespace orv {
namespace {

// Interfaces of a test's own, in the system's form.
class Interfaces {
 public:
  void add(const char* name, const char* address, unsigned scope = 0) {
    Interface& made = interfaces_.emplace_back();
    made.name = name;
    made.entry.ifa_name = made.name.data();
    if (address == nullptr) {
      made.entry.ifa_addr = nullptr;  // as for a tunnel without an address
    } else if (inet_pton(AF_INET, address, &made.v4.sin_addr) == 1) {
      made.v4.sin_family = AF_INET;
      made.entry.ifa_addr = reinterpret_cast<sockaddr*>(&made.v4);
    } else {
      ASSERT_EQ(inet_pton(AF_INET6, address, &made.v6.sin6_addr), 1) << address;
      made.v6.sin6_family = AF_INET6;
      made.v6.sin6_scope_id = scope;
      made.entry.ifa_addr = reinterpret_cast<sockaddr*>(&made.v6);
    }
    made.entry.ifa_next = first_;
    first_ = &made.entry;
  }
  void add_other_family(const char* name) {
    add(name, "192.0.2.200");
    interfaces_.back().entry.ifa_addr->sa_family = AF_UNIX;
  }

  bool have(const std::string& address) const {
    return slapi::is_address_in(address.c_str(), first_);
  }

 private:
  struct Interface {
    std::string name;
    ifaddrs entry{};
    sockaddr_in v4{};
    sockaddr_in6 v6{};
  };
  std::list<Interface> interfaces_;
  ifaddrs* first_ = nullptr;
};

class HostAddresses : public testing::Test {
 protected:
  void SetUp() override {
    host_.add("lo", "127.0.0.1");
    host_.add("lo", "::1");
    host_.add("eth0", "192.0.2.7");
    host_.add("eth0", "2001:db8::7");
    host_.add("eth0", "fe80::7", 2);
    host_.add("eth1", "fe80::8", 3);
    host_.add("tun0", nullptr);
    host_.add_other_family("eth0");
  }
  Interfaces host_;
};

TEST_F(HostAddresses, AreFoundInEachSpelling) {
  for (const char* own : {"127.0.0.1", "192.0.2.7", "::1", "2001:db8::7", "2001:DB8:0:0::7",
                          "2001:0db8:0000:0000:0000:0000:0000:0007", "0:0:0:0:0:0:0:1"})
    EXPECT_TRUE(host_.have(own)) << own;
}

TEST_F(HostAddresses, AreNoOthers) {
  for (const char* other : {"127.0.0.2", "192.0.2.8", "192.0.2.200", "::2", "2001:db8::8", "::7"})
    EXPECT_FALSE(host_.have(other)) << other;
  EXPECT_FALSE(slapi::is_address_in("127.0.0.1", nullptr));
}

TEST_F(HostAddresses, IncludeMappedOnes) {
  EXPECT_TRUE(host_.have("::ffff:192.0.2.7"));
  EXPECT_TRUE(host_.have("::FFFF:c000:207"));
  EXPECT_FALSE(host_.have("::ffff:192.0.2.8"));
  EXPECT_FALSE(host_.have("::192.0.2.7")) << "the compatible form is another address";
}

TEST_F(HostAddresses, AreNoWildcards) {
  host_.add("odd0", "0.0.0.0");
  host_.add("odd0", "::");
  for (const char* any : {"0.0.0.0", "::", "0:0:0:0:0:0:0:0", "::ffff:0.0.0.0"})
    EXPECT_FALSE(host_.have(any)) << any;
}

TEST_F(HostAddresses, OfOneLinkNeedTheirZone) {
  for (const char* own : {"fe80::7%eth0", "fe80::7%2", "FE80::8%eth1", "fe80::8%3"})
    EXPECT_TRUE(host_.have(own)) << own;
  for (const char* other : {"fe80::7", "fe80::7%", "fe80::7%eth1", "fe80::7%3", "fe80::8%eth0",
                            "fe80::7%ETH0", "fe80::7%eth", "fe80::7%eth00", "fe80::7%0",
                            "fe80::7%2x", "fe80::7%-2", "fe80::7%eth0%eth0", "fe80::9%eth0"})
    EXPECT_FALSE(host_.have(other)) << other;
}

TEST_F(HostAddresses, OfOneLinkHaveNoZoneZero) {
  host_.add("eth2", "fe80::a", 0);  // the number is not known
  EXPECT_FALSE(host_.have("fe80::a%0"));
  EXPECT_TRUE(host_.have("fe80::a%eth2"));
}

TEST_F(HostAddresses, OfWiderReachHaveNoZone) {
  for (const char* zoned :
       {"127.0.0.1%lo", "::1%lo", "2001:db8::7%eth0", "2001:db8::7%", "::ffff:192.0.2.7%eth0"})
    EXPECT_FALSE(host_.have(zoned)) << zoned;
}

TEST_F(HostAddresses, AreLiteralsOnly) {
  for (const char* text :
       {"", " ", "localhost", "lo", "127.1", "127.0.0.1 ", " 127.0.0.1", "127.0.0.1:389", "[::1]",
        "0x7f.0.0.1", "127.0.0.1\n", "%lo", "1", "2130706433", "::1/128"})
    EXPECT_FALSE(host_.have(text)) << text;
}

TEST_F(HostAddresses, HaveABoundedLength) {
  host_.add("an-interface-with-a-name-that-is-longer-than-any-of-them", "fe80::9", 9);
  EXPECT_TRUE(host_.have("fe80::9%an-interface-with-a-name-that-is-longer-than-any-of-them"));
  const std::string name(57, 'x');
  host_.add(name.c_str(), "fe80::9", 10);
  EXPECT_FALSE(host_.have("fe80::9%" + name)) << "65 bytes";
  EXPECT_FALSE(host_.have(std::string(61, '0') + "::1"));
  EXPECT_FALSE(host_.have("127.0.0.1" + std::string(1 << 20, ' ')));
}

TEST(SystemAddresses, IncludeTheLoopback) {
  EXPECT_TRUE(isValidIPAddressOnSystem("127.0.0.1"));
  EXPECT_TRUE(isValidIPAddressOnSystem("::ffff:127.0.0.1"));
}

TEST(SystemAddresses, AreNotThoseOfDocumentation) {
  for (const char* other : {"192.0.2.1", "2001:db8::1", "localhost", "0.0.0.0", "::", ""})
    EXPECT_FALSE(isValidIPAddressOnSystem(other)) << other;
  EXPECT_FALSE(isValidIPAddressOnSystem(nullptr));
}

}  // namespace
}  // namespace orv
