// What the server does where its host forbids a system call, as filters of containers do: each time
// in a process of its own.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <linux/filter.h>
#include <linux/seccomp.h>
#include <sys/prctl.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstddef>
#include <functional>
#include <string>

#include "process/privileges.h"
#include "process/surroundings.h"

namespace orv::server {
namespace {

constexpr int kNotForbidden = 99;

// From here on the call fails with that error.
bool forbid(unsigned call, unsigned error) {
  sock_filter program[] = {
      BPF_STMT(BPF_LD | BPF_W | BPF_ABS, offsetof(seccomp_data, nr)),
      BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, call, 0, 1),
      BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ERRNO | error),
      BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ALLOW),
  };
  const sock_fprog filter{4, program};
  return prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) == 0 &&
         prctl(PR_SET_SECCOMP, SECCOMP_MODE_FILTER, &filter) == 0;
}

// The exit status of a process that does this where the call is forbidden.
int status_without(unsigned call, unsigned error, const std::function<int()>& what) {
  const pid_t child = fork();
  if (child == 0) _exit(forbid(call, error) ? what() : kNotForbidden);
  int status = 0;
  if (child < 0 || waitpid(child, &status, 0) != child || !WIFEXITED(status)) return kNotForbidden;
  return WEXITSTATUS(status);
}

bool is_open(int descriptor) {
  return fcntl(descriptor, F_GETFD) >= 0;
}

TEST(RefusedCalls, InheritedDescriptorsAreClosedOneByOneWhereNoRangeCanBe) {
  EXPECT_EQ(status_without(SYS_close_range, ENOSYS,
                           [] {
                             const int kept = dup2(0, 3);
                             for (const int number : {4, 57, 800}) dup2(0, number);
                             close_inherited_descriptors(1);
                             const bool closed = !is_open(4) && !is_open(57) && !is_open(800);
                             return kept == 3 && closed && is_open(3) && is_open(2) ? 0 : 1;
                           }),
            0);
}

// Root keeps its rights by design.
int give_up_as_somebody() {
  constexpr uid_t kSomebody = 48231;
  if (geteuid() == 0 && setresuid(kSomebody, kSomebody, kSomebody) != 0) return kNotForbidden;
  std::string error;
  return give_up_capabilities(error) ? 0 : 1;
}

TEST(RefusedCalls, NothingLeftToGiveUpNeedsNoLeave) {
  EXPECT_EQ(status_without(SYS_capset, EPERM, give_up_as_somebody), 0);
}

int give_up_with_something_left() {
  prctl(PR_SET_KEEPCAPS, 1, 0, 0, 0);
  return give_up_as_somebody();
}

TEST(RefusedCalls, RightThatCannotBeGivenUpIsToldOf) {
  if (geteuid() != 0) GTEST_SKIP() << "only root has rights to give up";
  EXPECT_EQ(status_without(SYS_capset, EPERM, give_up_with_something_left), 1);
}

}  // namespace
}  // namespace orv::server
