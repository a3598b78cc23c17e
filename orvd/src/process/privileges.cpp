#include "process/privileges.h"

#include <grp.h>
#include <linux/capability.h>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstdint>
#include <cstring>

namespace orv::server {
namespace {

// Permitted and effective capabilities, one bit each.
using Capabilities = std::uint64_t;
constexpr Capabilities kLowPorts = Capabilities{1} << CAP_NET_BIND_SERVICE;

using Words = std::array<__user_cap_data_struct, _LINUX_CAPABILITY_U32S_3>;

// Nothing that is started could inherit them.
bool keep_capabilities(Capabilities kept) noexcept {
  __user_cap_header_struct header{_LINUX_CAPABILITY_VERSION_3, 0};
  Words words{};
  for (std::size_t i = 0; i < words.size(); ++i) {
    const auto word = static_cast<std::uint32_t>(kept >> (32 * i));
    words[i] = {word, word, 0};
  }
  return ::syscall(SYS_capset, &header, words.data()) == 0;
}

bool has_capabilities() noexcept {
  __user_cap_header_struct header{_LINUX_CAPABILITY_VERSION_3, 0};
  Words words{};
  if (::syscall(SYS_capget, &header, words.data()) != 0) return true;
  for (const __user_cap_data_struct& word : words)
    if ((word.permitted | word.effective | word.inheritable) != 0) return true;
  return false;
}

// What a program that is started could be given. Refused where it is limited already: the first
// refusal ends it, and so does the last capability that the kernel knows.
void empty_bounding_set() noexcept {
  for (unsigned long capability = 0; ::prctl(PR_CAPBSET_READ, capability, 0, 0, 0) >= 0;
       ++capability)
    if (::prctl(PR_CAPBSET_DROP, capability, 0, 0, 0) != 0) return;
}

bool set_groups(const Account& account) noexcept {
  return account.name.empty() ? ::setgroups(0, nullptr) == 0
                              : ::initgroups(account.name.c_str(), account.group) == 0;
}

bool change_user(const Account& account) noexcept {
  empty_bounding_set();
  ::prctl(PR_SET_KEEPCAPS, 1, 0, 0, 0);
  if (!set_groups(account) || ::setresgid(account.group, account.group, account.group) != 0 ||
      ::setresuid(account.user, account.user, account.user) != 0)
    return false;
  ::prctl(PR_SET_KEEPCAPS, 0, 0, 0, 0);
  // A process that has been root in part only (a container) may lack the one that is kept.
  return keep_capabilities(kLowPorts) || keep_capabilities(0);
}

bool is_wholly(const Account& account) noexcept {
  std::array<uid_t, 3> users{};
  std::array<gid_t, 3> groups{};
  if (::getresuid(&users[0], &users[1], &users[2]) != 0 ||
      ::getresgid(&groups[0], &groups[1], &groups[2]) != 0)
    return false;
  for (std::size_t i = 0; i < users.size(); ++i)
    if (users[i] != account.user || groups[i] != account.group) return false;
  return true;
}

bool can_come_back() noexcept {
  return ::setresuid(0, 0, 0) == 0 || ::setresgid(0, 0, 0) == 0 || ::setgroups(0, nullptr) == 0;
}

std::string label(const Account& account) {
  return account.name.empty() ? std::to_string(account.user) : account.name;
}

}  // namespace

bool forbid_new_privileges() noexcept {
  return ::prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) == 0;
}

bool become(const Account& account, std::string& error) {
  const std::string user = label(account);
  if (account.user == 0 || account.group == 0) {
    error = "the user to become (--user " + user +
            ") is root, or in root's group; name one that has no rights of its own";
    return false;
  }
  if (::geteuid() != 0) {
    if (is_wholly(account)) return true;
    error = "only root can become another user (--user " + user + "); start as root, or as " +
            user + " and without the option";
    return false;
  }
  if (!change_user(account)) {
    error = "cannot become the user " + user + ": " + std::strerror(errno);
    return false;
  }
  forbid_core_dumps();
  if (is_wholly(account) && !can_come_back()) return true;
  error = "the system lets a process that became " + user + " be root again";
  return false;
}

bool give_up_capabilities(std::string& error) {
  if (::geteuid() == 0) return true;
  ::prctl(PR_CAP_AMBIENT, PR_CAP_AMBIENT_CLEAR_ALL, 0, 0, 0);
  // Where asking is forbidden (a filter of a container) there may be nothing left all the same.
  const int refusal = keep_capabilities(0) ? 0 : errno;
  if (!has_capabilities()) return true;
  error = std::string("cannot give up what is left of root's rights: ") + std::strerror(refusal);
  return false;
}

void forbid_core_dumps() noexcept {
  constexpr rlimit kNone{0, 0};
  ::setrlimit(RLIMIT_CORE, &kNone);
#if defined(__SANITIZE_ADDRESS__)
  constexpr int kDumpable = 1;  // the leak check attaches to its own process
#else
  constexpr int kDumpable = 0;
#endif
  ::prctl(PR_SET_DUMPABLE, kDumpable);
}

}  // namespace orv::server
