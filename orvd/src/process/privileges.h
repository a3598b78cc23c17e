// What the process may do on its host: the user it runs as, and the rights it gives up.
//
//   forbid_new_privileges()   before there are further threads
//   become(account)           reads and writes everything as that user from here on
//   (listening sockets)       root's right to low ports is still there
//   give_up_capabilities()    nothing is left, and nothing comes back
//
// Threads: one, before there are others that use rights; later threads inherit what is left.
#pragma once

#include <string>

#include "slapi/account.h"

namespace orv::server {

// No program that this process could start would have more rights than it. A kernel that cannot is
// told of by false.
bool forbid_new_privileges() noexcept;

// Becomes the user for good: its groups, its group, and itself, real, effective and saved. Started
// as root the process keeps one right, that to open ports below 1024; started as that user already
// it changes nothing. Makes sure that there is no way back. False with the cause: not started as
// root, the account is root's, the system refuses, or a way back was left.
bool become(const Account& account, std::string& error);

// Gives up every capability of the calling thread. False with the cause when one is left. For root
// nothing is given up: its files are everybody's.
bool give_up_capabilities(std::string& error);

// Core dumps of this process are neither written nor handed to anybody, and its memory is closed to
// other processes of its user. A change of the user undoes it.
void forbid_core_dumps() noexcept;

}  // namespace orv::server
