#include "process/call_filter.h"

#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)

namespace orv::server {

CallFilter restrict_calls(std::string& why) {
  why = "a sanitizer is built in";
  return CallFilter::unusable;
}

}  // namespace orv::server

#else

#include <sched.h>
#include <seccomp.h>
#include <sys/ioctl.h>
#include <sys/mman.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <termios.h>

#include <array>
#include <cerrno>
#include <cstdint>
#include <cstring>
#include <memory>

namespace orv::server {
namespace {

// What is neither allowed nor deadly is not there, as on an older kernel: libraries know that
// answer and have another way, or an error to report.
constexpr std::uint32_t kOtherwise = SCMP_ACT_ERRNO(ENOSYS);

constexpr const char* kAllowed[] = {
    // files: the configuration and what a change leaves beside it, logs, certificates, libraries
    "read", "write", "readv", "writev", "pread64", "pwrite64", "preadv", "pwritev", "open",
    "openat", "openat2", "close", "close_range", "fstat", "stat", "lstat", "newfstatat", "statx",
    "fstatfs", "statfs", "lseek", "access", "faccessat", "faccessat2", "readlink", "readlinkat",
    "getdents64", "getcwd", "rename", "renameat", "renameat2", "link", "linkat", "unlink",
    "unlinkat", "ftruncate", "fallocate", "fadvise64", "fsync", "fdatasync", "sync_file_range",
    "flock", "fcntl", "fchmod", "chmod", "fchmodat", "fchown", "fgetxattr", "fsetxattr",
    "fremovexattr", "umask", "dup", "dup2", "dup3", "pipe2", "copy_file_range", "sendfile",
    // memory
    "brk", "munmap", "mremap", "madvise", "mlock", "mlock2", "munlock", "mincore", "membarrier",
    // threads and signals
    "futex", "set_robust_list", "get_robust_list", "rseq", "exit", "exit_group", "set_tid_address",
    "sched_yield", "sched_getaffinity", "sched_getparam", "sched_getscheduler", "getcpu", "gettid",
    "getpid", "getppid", "tgkill", "rt_sigaction", "rt_sigprocmask", "rt_sigreturn",
    "rt_sigtimedwait", "rt_sigpending", "rt_sigsuspend", "sigaltstack", "restart_syscall",
    // time
    "clock_gettime", "clock_getres", "clock_nanosleep", "nanosleep", "gettimeofday", "time",
    "timerfd_create", "timerfd_settime", "timerfd_gettime", "times", "getrusage",
    // waiting
    "epoll_create1", "epoll_ctl", "epoll_wait", "epoll_pwait", "epoll_pwait2", "poll", "ppoll",
    "select", "pselect6", "eventfd2",
    // connections that clients make
    "accept", "accept4", "recvfrom", "recvmsg", "recvmmsg", "getsockname", "getpeername",
    "getsockopt", "setsockopt", "shutdown", "bind",
    // the rest
    "getrandom", "uname", "sysinfo", "getuid", "geteuid", "getgid", "getegid", "getresuid",
    "getresgid", "getgroups", "getrlimit", "capget"};

// Nobody who serves directories ever calls these: the process ends, and the kernel's log says why.
constexpr const char* kDeadly[] = {"execve",
                                   "execveat",
                                   "fork",
                                   "vfork",
                                   "ptrace",
                                   "process_vm_readv",
                                   "process_vm_writev",
                                   "init_module",
                                   "finit_module",
                                   "delete_module",
                                   "kexec_load",
                                   "kexec_file_load",
                                   "bpf",
                                   "userfaultfd",
                                   "perf_event_open",
                                   "mount",
                                   "umount2",
                                   "pivot_root",
                                   "chroot",
                                   "setns",
                                   "unshare",
                                   "open_by_handle_at",
                                   "setuid",
                                   "setgid",
                                   "setreuid",
                                   "setregid",
                                   "setresuid",
                                   "setresgid",
                                   "setgroups",
                                   "setfsuid",
                                   "setfsgid",
                                   "personality",
                                   "reboot",
                                   "swapon",
                                   "iopl",
                                   "ioperm",
                                   "modify_ldt",
                                   "listen"};

struct Release {
  void operator()(void* filter) const noexcept { seccomp_release(filter); }
};
using Filter = std::unique_ptr<void, Release>;

// Collects the first failure.
class Rules {
 public:
  explicit Rules(scmp_filter_ctx filter) : filter_(filter) {}

  // A call that this machine does not have needs no rule.
  template <typename... Conditions>
  void add(std::uint32_t action, const char* name, Conditions... conditions) {
    const int number = seccomp_syscall_resolve_name(name);
    if (number == __NR_SCMP_ERROR || code_ != 0) return;
    const std::array<scmp_arg_cmp, sizeof...(conditions)> all{conditions...};
    code_ = seccomp_rule_add_array(filter_, action, number, all.size(), all.data());
  }

  template <typename... Conditions>
  void allow(const char* name, Conditions... conditions) {
    add(SCMP_ACT_ALLOW, name, conditions...);
  }

  void set(scmp_filter_attr attribute, std::uint32_t value) {
    if (code_ == 0) code_ = seccomp_attr_set(filter_, attribute, value);
  }

  int code() const noexcept { return code_; }

 private:
  scmp_filter_ctx filter_;
  int code_ = 0;
};

scmp_arg_cmp bits(unsigned argument, std::uint64_t of, std::uint64_t are) noexcept {
  return {argument, SCMP_CMP_MASKED_EQ, of, are};
}

scmp_arg_cmp equals(unsigned argument, std::uint64_t value) noexcept {
  return {argument, SCMP_CMP_EQ, value, 0};
}

// Memory is written or executed. Libraries are loaded from their files, in pieces that are either;
// which file it is, the filter does not see.
void allow_memory(Rules& rules) {
  constexpr unsigned kProtection = 2;
  rules.allow("mmap", bits(kProtection, PROT_EXEC, 0));
  rules.allow("mmap", bits(kProtection, PROT_EXEC | PROT_WRITE, PROT_EXEC));
  rules.allow("mprotect", bits(kProtection, PROT_EXEC, 0));
}

// Threads, but no processes. The newer call keeps its flags where no filter can look.
void allow_threads(Rules& rules) {
  rules.allow("clone", bits(0, CLONE_THREAD, CLONE_THREAD));
  for (const int option : {PR_SET_NAME, PR_GET_NAME, PR_GET_DUMPABLE, PR_GET_NO_NEW_PRIVS,
                           PR_CAPBSET_READ, 0x53564d41 /* names of mappings */})
    rules.allow("prctl", equals(0, static_cast<std::uint64_t>(option)));
  rules.allow("prlimit64", equals(2, 0));  // asking, not setting
}

// Connections come in, and none goes out: not from a new socket, nor from that of a client, whose
// connection could be dissolved and made anew to somebody else. Where an address points to is in
// memory, at which no filter can look, so it is the calls themselves that are left out. A socket is
// made for the list of the host's addresses only.
void allow_sockets(Rules& rules) {
  constexpr std::uint64_t kRoutes = 0;  // NETLINK_ROUTE
  rules.allow("socket", equals(0, AF_NETLINK), equals(2, kRoutes));
  rules.allow("socketpair", equals(0, AF_UNIX));
  struct Sending {
    const char* name;
    unsigned flags;
  };
  // The flag would connect on the way.
  for (const Sending& call : {Sending{"sendto", 3}, Sending{"sendmsg", 2}, Sending{"sendmmsg", 3}})
    rules.allow(call.name, bits(call.flags, MSG_FASTOPEN, 0));
}

// What a terminal or a device can be told is more than is needed.
void allow_controls(Rules& rules) {
  for (const int request : {FIONBIO, FIONREAD, FIOCLEX, TCGETS})
    rules.allow("ioctl", bits(1, 0xFFFFFFFF, static_cast<std::uint64_t>(request)));
}

void add_all(Rules& rules) {
  // All threads, those of the logs and of standard error too.
  rules.set(SCMP_FLTATR_CTL_TSYNC, 1);
  rules.set(SCMP_FLTATR_CTL_OPTIMIZE, 2);  // found by halving, not one after the other
  rules.set(SCMP_FLTATR_ACT_BADARCH, SCMP_ACT_KILL_PROCESS);
  for (const char* const name : kAllowed) rules.allow(name);
  for (const char* const name : kDeadly) rules.add(SCMP_ACT_KILL_PROCESS, name);
  allow_memory(rules);
  allow_threads(rules);
  allow_sockets(rules);
  allow_controls(rules);
}

}  // namespace

CallFilter restrict_calls(std::string& why) {
  const Filter filter(seccomp_init(kOtherwise));
  if (!filter) {
    why = "out of memory";
    return CallFilter::refused;
  }
  Rules rules(filter.get());
  add_all(rules);
  const int code = rules.code() != 0 ? rules.code() : seccomp_load(filter.get());
  if (code == 0) return CallFilter::on;
  why = std::strerror(-code);
  return CallFilter::refused;
}

}  // namespace orv::server

#endif
