// A disk that does not answer: whoever writes to a file hangs in that call.
#pragma once

#include <gtest/gtest.h>
#include <sys/resource.h>
#include <unistd.h>

#include <chrono>
#include <csignal>
#include <filesystem>
#include <fstream>
#include <string>
#include <thread>

namespace orv::server::test {

// The system sends a signal to a thread that writes beyond the limit on the size of files, within
// its call; the handler waits. So the file gets a hole that reaches up to a limit which nothing
// else that tests write comes near. One object at a time in a process.
class HungDisk {
 public:
  static constexpr off_t kHole = off_t{8} << 20;

  explicit HungDisk(const std::string& path) {
    EXPECT_EQ(pipe(ends()), 0);
    EXPECT_EQ(truncate(path.c_str(), kHole), 0);
    EXPECT_NE(std::signal(SIGXFSZ, hang), SIG_ERR);
    EXPECT_EQ(getrlimit(RLIMIT_FSIZE, &before_), 0);
    const rlimit small{static_cast<rlim_t>(kHole), before_.rlim_max};
    EXPECT_EQ(setrlimit(RLIMIT_FSIZE, &small), 0);
  }
  ~HungDisk() { release(); }
  HungDisk(const HungDisk&) = delete;
  HungDisk& operator=(const HungDisk&) = delete;

  // The call that hangs fails, the next ones succeed.
  void release() {
    if (released_) return;
    released_ = true;
    EXPECT_EQ(setrlimit(RLIMIT_FSIZE, &before_), 0);
    close(ends()[1]);
  }

  // The same, and waits until the threads of that name (pthread_setname_np) have ended.
  void release_and_join(const std::string& name) {
    release();
    const auto end = std::chrono::steady_clock::now() + std::chrono::seconds(10);
    while (is_there(name) && std::chrono::steady_clock::now() < end) std::this_thread::yield();
    EXPECT_FALSE(is_there(name));
  }

  // What was written to the file behind the hole.
  static std::string written(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    in.seekg(kHole);
    return {std::istreambuf_iterator<char>(in), {}};
  }

 private:
  static int* ends() {
    static int pair[2];
    return pair;
  }
  static void hang(int) {
    char byte = 0;
    [[maybe_unused]] const ssize_t done = read(ends()[0], &byte, 1);
  }
  static bool is_there(const std::string& name) {
    for (const auto& entry : std::filesystem::directory_iterator("/proc/self/task")) {
      std::string comm;
      std::ifstream in(entry.path() / "comm");
      std::getline(in, comm);
      if (comm == name) return true;
    }
    return false;
  }

  rlimit before_{};
  bool released_ = false;
};

}  // namespace orv::server::test
