#include "process/surroundings.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <charconv>
#include <climits>
#include <csignal>
#include <cstddef>
#include <cstdlib>
#include <cstring>
#include <string_view>

#include "cfg/secret.h"

namespace orv::server {
namespace {

// Names, and beginnings of names that end with '*'.
constexpr std::string_view kKept[] = {
    "LANG", "LANGUAGE", "LC_*", "LOCPATH", "NLSPATH", "CHARSET", "OUTPUT_CHARSET", "GCONV_PATH",
    "TZ", "TZDIR", "TMPDIR", "OPENSSL_*", "SSL_CERT_*", "KRB5*",
    "AUTOLOCKTYPE",  // how plug-ins wait for their locks
    // of sanitizers, coverage and the allocator
    "ASAN_*", "LSAN_*", "TSAN_*", "UBSAN_*", "GCOV_*", "MALLOC_*", "GLIBC_TUNABLES"};

bool is_kept(std::string_view variable) noexcept {
  const std::string_view name = variable.substr(0, variable.find('='));
  return std::any_of(std::begin(kKept), std::end(kKept), [name](std::string_view kept) {
    return kept.ends_with('*') ? name.starts_with(kept.substr(0, kept.size() - 1)) : name == kept;
  });
}

sigset_t hangup() noexcept {
  sigset_t set{};
  ::sigemptyset(&set);
  ::sigaddset(&set, SIGHUP);
  return set;
}

void reset_signals() noexcept {
  sigset_t none{};
  ::sigemptyset(&none);
  for (const int number : {SIGHUP, SIGINT, SIGTERM, SIGQUIT, SIGCHLD, SIGALRM, SIGUSR1, SIGUSR2})
    std::signal(number, SIG_DFL);
  std::signal(SIGPIPE, SIG_IGN);
  const sigset_t waits = hangup();
  ::sigprocmask(SIG_SETMASK, &none, nullptr);
  ::sigprocmask(SIG_BLOCK, &waits, nullptr);
}

// Each connection needs a descriptor.
void raise_descriptor_limit() noexcept {
  rlimit files{};
  if (::getrlimit(RLIMIT_NOFILE, &files) != 0 || files.rlim_cur >= files.rlim_max) return;
  files.rlim_cur = files.rlim_max;
  ::setrlimit(RLIMIT_NOFILE, &files);
}

// Closes what the process has open from this descriptor on, one after the other.
void close_each_from(int first) noexcept {
  DIR* const open = ::opendir("/proc/self/fd");
  if (!open) return;
  while (const dirent* const entry = ::readdir(open)) {
    const std::string_view name = entry->d_name;
    int number = -1;
    std::from_chars(name.data(), name.data() + name.size(), number);
    if (number >= first && number != ::dirfd(open)) ::close(number);
  }
  ::closedir(open);
}

}  // namespace

void settle_standard_streams() noexcept {
  int opened = 0;
  do opened = ::open("/dev/null", O_RDWR | O_CLOEXEC);
  while (opened >= 0 && opened <= STDERR_FILENO);
  if (opened < 0) return;
  ::dup2(opened, STDIN_FILENO);
  ::close(opened);
}

void close_inherited_descriptors(int kept) noexcept {
  const int first = STDERR_FILENO + 1 + kept;
  // Older kernels do not have it, and filters of containers do not let it through.
  if (::close_range(static_cast<unsigned>(first), UINT_MAX, 0) != 0) close_each_from(first);
}

void clean_environment() noexcept {
  char** to = environ;
  for (char** from = environ; from && *from; ++from) {
    if (is_kept(*from))
      *to++ = *from;
    else
      cfg::wipe(*from, std::strlen(*from));
  }
  if (to) *to = nullptr;
  // The library that decodes messages would read files of whoever runs a client.
  ::setenv("LDAPNOINIT", "1", 1);
}

void settle_process() noexcept {
  reset_signals();
  ::umask(S_IRWXG | S_IRWXO);
  raise_descriptor_limit();
  [[maybe_unused]] const int moved = ::chdir("/");  // nothing depends on it
}

void accept_hangup() noexcept {
  const sigset_t waits = hangup();
  ::sigprocmask(SIG_UNBLOCK, &waits, nullptr);
}

}  // namespace orv::server
