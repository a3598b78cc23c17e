// The buffer for what clients send: what it keeps, and what a core dump would show of it.
#include <gtest/gtest.h>

#include <cstdint>
#include <cstring>
#include <fstream>
#include <sstream>
#include <string>

#include "net/receive_buffer.h"

namespace orv::server {
namespace {

// Whether the kernel leaves the memory at `place` out of core dumps, as it tells in
// /proc/self/smaps: a line with the bounds of a mapping, and among those after it its flags.
bool is_left_out_of_dumps(const void* place) {
  const auto wanted = reinterpret_cast<std::uintptr_t>(place);
  std::ifstream file("/proc/self/smaps");
  bool here = false;
  for (std::string line; std::getline(file, line);) {
    std::uintptr_t begin = 0;
    std::uintptr_t end = 0;
    char dash = 0;
    std::istringstream bounds(line);
    if (bounds >> std::hex >> begin >> dash >> end && dash == '-')
      here = begin <= wanted && wanted < end;
    if (here && line.starts_with("VmFlags:")) return (line + " ").find(" dd ") != std::string::npos;
  }
  return false;
}

TEST(ReceiveBuffer, IsLeftOutOfCoreDumps) {
  ReceiveBuffer buffer(4096);
  std::memset(buffer.data(), 'x', buffer.size());
  EXPECT_TRUE(is_left_out_of_dumps(buffer.data()));
  EXPECT_TRUE(is_left_out_of_dumps(buffer.data() + buffer.size() - 1));
  buffer.resize(1 << 20, 4096);
  std::memset(buffer.data(), 'x', buffer.size());
  EXPECT_TRUE(is_left_out_of_dumps(buffer.data()));
  EXPECT_TRUE(is_left_out_of_dumps(buffer.data() + buffer.size() - 1));
  const std::string ordinary(4096, 'x');
  EXPECT_FALSE(is_left_out_of_dumps(ordinary.data()));
}

TEST(ReceiveBuffer, KeepsWhatItIsToldToWhenItGrowsAndShrinks) {
  ReceiveBuffer buffer(10);
  std::memcpy(buffer.data(), "0123456789", 10);
  buffer.resize(100000, 10);
  EXPECT_EQ(buffer.size(), 100000U);
  EXPECT_EQ(std::string(buffer.data(), 12), std::string("0123456789\0\0", 12));
  buffer.resize(5, 3);
  EXPECT_EQ(buffer.size(), 5U);
  EXPECT_EQ(std::string(buffer.data(), 5), std::string("012\0\0", 5));
}

}  // namespace
}  // namespace orv::server
