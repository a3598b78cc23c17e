// The memory for keys, each time in a process of its own: it is set apart once for all.
#include <gtest/gtest.h>
#include <openssl/crypto.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdint>
#include <cstdlib>
#include <functional>
#include <limits>
#include <string>

#include "../temporary_directory.h"
#include "cfg/secret.h"
#include "net/limits.h"
#include "process/key_memory.h"

namespace orv::server {
namespace {

// Whether it holds in a process that has set memory for keys apart.
bool holds(const std::function<bool()>& what) {
  const pid_t child = fork();
  if (child == 0) {
    protect_keys();
    _exit(CRYPTO_secure_malloc_initialized() == 1 && what() ? 0 : 1);
  }
  int status = 0;
  return child > 0 && waitpid(child, &status, 0) == child && WIFEXITED(status) &&
         WEXITSTATUS(status) == 0;
}

// Takes as many pieces as there are, or as are asked for.
int take(std::size_t size, int most) {
  int taken = 0;
  while (taken < most && OPENSSL_secure_malloc(size)) ++taken;
  return taken;
}

TEST(KeyMemory, HoldsTheKeysOfAsManyConnectionsAsThereMayBe) {
  EXPECT_TRUE(holds([] {
    constexpr int kConnections = 65536;
    return take(64, kConnections) == kConnections &&
           connections_with_room_for_keys() <= kConnections;
  }));
}

TEST(KeyMemory, BoundsConnectionsWhereItIsSetApart) {
  EXPECT_TRUE(holds([] {
    const std::int64_t most = connections_with_room_for_keys();
    return most < std::numeric_limits<std::int32_t>::max() && connections_that_fit() <= most;
  }));
}

TEST(KeyMemory, IsNamedAsTheBoundWhereThereAreDescriptorsEnough) {
  EXPECT_TRUE(holds([] {
    rlimit files{};
    getrlimit(RLIMIT_NOFILE, &files);
    files.rlim_cur = files.rlim_max;
    setrlimit(RLIMIT_NOFILE, &files);
    const Room room = room_for_connections();
    const bool by_keys = room.connections == connections_with_room_for_keys();
    return (std::string(room.bound) == "the memory for keys") == by_keys;
  }));
}

TEST(KeyMemory, IsNotTheBoundWhereDescriptorsAre) {
  EXPECT_TRUE(holds([] {
    rlimit files{};
    getrlimit(RLIMIT_NOFILE, &files);
    files.rlim_cur = 256;
    setrlimit(RLIMIT_NOFILE, &files);
    return std::string(room_for_connections().bound) == "the limit of open files (RLIMIT_NOFILE)";
  }));
}

TEST(KeyMemory, ThatIsFullLeavesTheKeyOfTheStashToOrdinaryMemory) {
  const orv::test::TemporaryDirectory folder;
  const std::string path = folder.file("key.stash");
  std::string why;
  ASSERT_EQ(cfg::create_key_stash(path.c_str(), why), 0) << why;
  EXPECT_TRUE(holds([&] {
    take(32, std::numeric_limits<int>::max());
    cfg::KeyPtr key;
    return cfg::load_key_stash(path.c_str(), key, why) == 0 && key &&
           !CRYPTO_secure_allocated(key.get());
  }));
}

}  // namespace
}  // namespace orv::server
