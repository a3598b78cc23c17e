#include "process/surroundings.h"

#include <fcntl.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
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
    "TZ", "TZDIR", "PATH", "TMPDIR", "OPENSSL_*", "SSL_CERT_*", "KRB5*", "SASL_*",
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
  ::close_range(static_cast<unsigned>(STDERR_FILENO + 1 + kept), UINT_MAX, 0);
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
