// The filter of system calls, each time in a process of its own: there is no way back from it.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <ifaddrs.h>
#include <netinet/in.h>
#include <signal.h>
#include <sys/ioctl.h>
#include <sys/mman.h>
#include <sys/prctl.h>
#include <sys/ptrace.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <csignal>
#include <cstdlib>
#include <functional>
#include <string>
#include <thread>

#include "descriptor.h"
#include "process/call_filter.h"

namespace orv::server {
namespace {

#if !defined(__SANITIZE_ADDRESS__) && !defined(__SANITIZE_THREAD__)

constexpr int kNotRestricted = 99;

// How a process ends that is restricted and then does this: its exit status, or minus the signal.
int end_of(const std::function<int()>& what) {
  const pid_t child = fork();
  if (child == 0) {
    std::string why;
    prctl(PR_SET_DUMPABLE, 0);
    _exit(restrict_calls(why) == CallFilter::on ? what() : kNotRestricted);
  }
  int status = 0;
  if (child < 0 || waitpid(child, &status, 0) != child) return kNotRestricted;
  return WIFSIGNALED(status) ? -WTERMSIG(status) : WEXITSTATUS(status);
}

// 0 when the call fails as if the kernel did not have it.
int is_missing(long result) {
  return result == -1 && errno == ENOSYS ? 0 : 1;
}

int is_refused(void* mapped) {
  return is_missing(mapped == MAP_FAILED ? -1 : 0);
}

TEST(CallFilterTest, StartingAProgramEndsTheProcess) {
  EXPECT_EQ(end_of([] { return execl("/bin/true", "true", nullptr); }), -SIGSYS);
}

TEST(CallFilterTest, LookingIntoOtherProcessesEndsTheProcess) {
  EXPECT_EQ(end_of([] { return static_cast<int>(ptrace(PTRACE_ATTACH, getppid(), 0, 0)); }),
            -SIGSYS);
  EXPECT_EQ(end_of([] { return static_cast<int>(syscall(SYS_process_vm_readv, getppid(), 0, 0)); }),
            -SIGSYS);
}

TEST(CallFilterTest, BecomingAnotherUserEndsTheProcess) {
  EXPECT_EQ(end_of([] { return setresuid(1, 1, 1); }), -SIGSYS);
  EXPECT_EQ(end_of([] { return setgid(1); }), -SIGSYS);
}

TEST(CallFilterTest, RightsAreNotSetAndTheProcessGoesOn) {
  EXPECT_EQ(end_of([] { return is_missing(syscall(SYS_capset, nullptr, nullptr)); }), 0);
}

TEST(CallFilterTest, ThreadsCanBeMadeAndProcessesCannot) {
  EXPECT_EQ(end_of([] {
              std::atomic<int> result{1};
              std::thread([&result] { result = 0; }).join();
              return result.load();
            }),
            0);
  EXPECT_EQ(end_of([] { return is_missing(fork()); }), 0);
}

TEST(CallFilterTest, HoldsForThreadsThatWereThereBefore) {
  const pid_t child = fork();
  if (child == 0) {
    std::atomic<bool> restricted{false};
    std::thread before([&restricted] {
      while (!restricted) std::this_thread::yield();
      execl("/bin/true", "true", nullptr);
      _exit(1);
    });
    std::string why;
    if (restrict_calls(why) != CallFilter::on) _exit(kNotRestricted);
    restricted = true;
    before.join();
    _exit(0);
  }
  int status = 0;
  ASSERT_EQ(waitpid(child, &status, 0), child);
  EXPECT_TRUE(WIFSIGNALED(status) && WTERMSIG(status) == SIGSYS) << status;
}

TEST(CallFilterTest, MemoryIsWrittenOrExecuted) {
  constexpr int kOwn = MAP_PRIVATE | MAP_ANONYMOUS;
  EXPECT_EQ(
      end_of([] {
        return is_refused(mmap(nullptr, 4096, PROT_READ | PROT_WRITE | PROT_EXEC, kOwn, -1, 0));
      }),
      0);
  EXPECT_EQ(end_of([] {
              void* const page = mmap(nullptr, 4096, PROT_READ | PROT_WRITE, kOwn, -1, 0);
              return page == MAP_FAILED ? 2
                                        : is_missing(mprotect(page, 4096, PROT_READ | PROT_EXEC));
            }),
            0);
}

TEST(CallFilterTest, NoSocketIsMadeButForTheListOfTheHostsAddresses) {
  for (const int family : {AF_INET, AF_INET6, AF_UNIX, AF_PACKET})
    for (const int type : {SOCK_STREAM, SOCK_DGRAM, SOCK_RAW, SOCK_SEQPACKET})
      for (const int flags : {0, SOCK_CLOEXEC | SOCK_NONBLOCK})
        EXPECT_EQ(end_of([=] { return is_missing(socket(family, type | flags, 0)); }), 0)
            << family << ' ' << type;
  EXPECT_EQ(end_of([] {
              ifaddrs* found = nullptr;
              return getifaddrs(&found) == 0 && found != nullptr ? 0 : 1;
            }),
            0);
}

// A connection that a client has made, and the address at which it was accepted.
class CallFilterAtAConnection : public testing::Test {
 protected:
  void SetUp() override {
    ASSERT_EQ(bind(listener.number(), plain(), size), 0);
    ASSERT_EQ(listen(listener.number(), 4), 0);
    ASSERT_EQ(getsockname(listener.number(), plain(), &size), 0);
    ASSERT_EQ(connect(client.number(), plain(), size), 0);
    served = Descriptor(accept(listener.number(), nullptr, nullptr));
    ASSERT_TRUE(served);
  }
  sockaddr* plain() { return reinterpret_cast<sockaddr*>(&address); }

  sockaddr_in address{
      .sin_family = AF_INET, .sin_port = 0, .sin_addr = {htonl(INADDR_LOOPBACK)}, .sin_zero = {}};
  socklen_t size = sizeof address;
  Descriptor listener{socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0)};
  Descriptor client{socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0)};
  Descriptor served;
};

TEST_F(CallFilterAtAConnection, ItBecomesNoneToSomebodyElse) {
  EXPECT_EQ(end_of([this] {
              address.sin_family = AF_UNSPEC;
              return is_missing(connect(served.number(), plain(), size));
            }),
            0);
  EXPECT_EQ(end_of([this] { return is_missing(connect(served.number(), plain(), size)); }), 0);
}

TEST_F(CallFilterAtAConnection, NothingIsSentThatConnectsOnTheWay) {
  const Descriptor unused(socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
  const int to = unused.number();
  char text[] = "x";
  iovec part{text, 1};
  mmsghdr several{};
  several.msg_hdr.msg_name = &address;
  several.msg_hdr.msg_namelen = size;
  several.msg_hdr.msg_iov = &part;
  several.msg_hdr.msg_iovlen = 1;
  EXPECT_EQ(end_of([&] { return is_missing(sendto(to, text, 1, MSG_FASTOPEN, plain(), size)); }),
            0);
  EXPECT_EQ(end_of([&] { return is_missing(sendmsg(to, &several.msg_hdr, MSG_FASTOPEN)); }), 0);
  EXPECT_EQ(end_of([&] { return is_missing(sendmmsg(to, &several, 1, MSG_FASTOPEN)); }), 0);
}

TEST_F(CallFilterAtAConnection, ItIsAnswered) {
  EXPECT_EQ(end_of([this] {
              const int to = served.number();
              return send(to, "a", 1, MSG_NOSIGNAL) == 1 && write(to, "b", 1) == 1 ? 0 : 1;
            }),
            0);
  char text[3] = {};
  EXPECT_EQ(recv(client.number(), text, 2, MSG_WAITALL), 2);
  EXPECT_STREQ(text, "ab");
}

TEST(CallFilterTest, NothingNewIsListenedAt) {
  const Descriptor made(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  EXPECT_EQ(end_of([&made] { return listen(made.number(), 1); }), -SIGSYS);
}

TEST(CallFilterTest, TerminalsAreNotWrittenInto) {
  EXPECT_EQ(end_of([] {
              char c = 'x';
              return is_missing(ioctl(STDIN_FILENO, TIOCSTI, &c));
            }),
            0);
}

TEST(CallFilterTest, FilesAreReadWrittenAndReplaced) {
  EXPECT_EQ(end_of([] {
              char name[] = "/tmp/orv-call-filter-XXXXXX";
              const int file = mkostemp(name, O_CLOEXEC);
              const std::string other = std::string(name) + ".new";
              const bool good = file >= 0 && write(file, "x", 1) == 1 && fsync(file) == 0 &&
                                fchmod(file, 0600) == 0 && rename(name, other.c_str()) == 0 &&
                                unlink(other.c_str()) == 0 && close(file) == 0;
              return good ? 0 : 1;
            }),
            0);
}

#else

TEST(CallFilterTest, IsNotPutInForceUnderASanitizer) {
  std::string why;
  EXPECT_EQ(restrict_calls(why), CallFilter::unusable);
  EXPECT_FALSE(why.empty());
}

#endif

}  // namespace
}  // namespace orv::server
