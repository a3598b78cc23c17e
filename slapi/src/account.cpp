#include "slapi/account.h"

#include <grp.h>
#include <pwd.h>

#include <array>
#include <charconv>
#include <system_error>

namespace orv {
namespace {

// The largest number means "leave it as it is" to the system.
bool read_number(const std::string& text, id_t& number) {
  const auto [end, status] = std::from_chars(text.data(), text.data() + text.size(), number);
  return status == std::errc() && end == text.data() + text.size() &&
         number != static_cast<id_t>(-1);
}

bool find_group(const std::string& group, gid_t& number, std::string& error) {
  if (const struct group* const found = ::getgrnam(group.c_str())) {
    number = found->gr_gid;
    return true;
  }
  id_t given = 0;
  if (read_number(group, given)) {
    number = given;
    return true;
  }
  error = "there is no group " + group + " on this host; make it (groupadd), or name another one";
  return false;
}

}  // namespace

bool find_account(const std::string& user, const std::string& group, Account& account,
                  std::string& error) {
  const passwd* found = ::getpwnam(user.c_str());
  id_t number = 0;
  const bool by_number = !found && read_number(user, number);
  if (by_number) found = ::getpwuid(number);
  if (!found && !by_number) {
    error = "there is no user " + user + " on this host; make it (useradd), or name another one";
    return false;
  }
  if (!found && group.empty()) {
    error = "the host knows no group of the user " + user + "; name one as well (--group)";
    return false;
  }
  account = found ? Account{found->pw_uid, found->pw_gid, found->pw_name} : Account{number, 0, ""};
  return group.empty() || find_group(group, account.group, error);
}

std::string user_name(uid_t user) {
  std::array<char, 8192> room{};
  passwd record{};
  passwd* found = nullptr;
  const int failure = ::getpwuid_r(user, &record, room.data(), room.size(), &found);
  return failure == 0 && found ? found->pw_name : std::to_string(user);
}

}  // namespace orv
