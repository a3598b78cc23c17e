// Users and groups of the host, by name or number: for the server, which can become one of them,
// and for the tools that make files for it.
//
// Threads: find_account() is not thread-safe, it reads the databases of the host; user_name() is.
#pragma once

#include <sys/types.h>

#include <string>

namespace orv {

struct Account {
  uid_t user = 0;
  gid_t group = 0;
  std::string name;  // "" when the host has no name for the user: it is in no further groups
};

// Looks up a user, and the group to go with it: `group`, or the user's own when that is "". Both
// are names or numbers; a number that the host has no user for needs a group. False with the cause,
// and what to do about it, in `error`.
bool find_account(const std::string& user, const std::string& group, Account& account,
                  std::string& error);

// The name of a user for messages; its number when the host has no name for it.
std::string user_name(uid_t user);

}  // namespace orv
