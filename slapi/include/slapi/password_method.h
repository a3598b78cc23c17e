// How passwords that are given in clear are stored: the method of the whole server.
//
// Names of methods, as orv-slapdPwEncryption of CN=CONFIGURATION has one of them (ASCII letter case
// does not matter, nothing else may stand there):
//   none           as they are given
//   AES256         sealed with the key of the stash file; the server can open it again
//   SSHA256, SSHA384, SSHA512
//                  salted SHA-2; can only be verified, as all that follow
//   PBKDF2-SHA256, PBKDF2-SHA512
//   crypt          by crypt(3), where the platform has it; elsewhere the name is unknown
//
// The configuration forbids AES256 while there is no key stash, and every method that
// orv-slapdPwEncryptionAllowed of CN=ADMINGROUP,CN=CONFIGURATION leaves out. Without that setting
// it forbids none, and allows the others.
// That entry is changed by the primary administrator alone, so that nobody else can allow himself a
// weak method.
//
// A change of the method goes two steps: the directory backend checks and stages it while the rules
// look at the change; it is in force when the server has read it from the file after the write, by
// `load_password_methods`. A write that failed leaves the method before. Passwords that are stored
// already are not rewritten.
//
// Threads: thread-safe. Nothing throws but std::bad_alloc, and that only `password_method_problem`.
#pragma once

#include <string>
#include <string_view>

#include "cfg/session.h"

namespace orv {

// Numbers of the methods; 16 stands for none of them.
namespace password_method {
inline constexpr int none = 1;
inline constexpr int ssha256 = 2;
inline constexpr int ssha384 = 3;
inline constexpr int ssha512 = 4;
inline constexpr int pbkdf2_sha256 = 5;
inline constexpr int pbkdf2_sha512 = 6;
inline constexpr int crypt = 7;
inline constexpr int aes256 = 8;
inline constexpr int none_converted = 16;
}  // namespace password_method

// What is wrong with a value of these two settings, in words that follow the setting's name and
// list the methods that this host can make; "" for one of them, allowed or not.
std::string password_method_problem(std::string_view name);

// Reads method and restrictions with a bound session and puts them in force, for this interface and
// for the library that writes (cfg/secret.h). Without the attribute the method is AES256, which
// without a key stash means that passwords are hashed. 0; 21 an unknown name; 53 the method is
// forbidden; 90; else the session's code. After anything but 0 what was in force stays so, and
// message 9 of set 10 tells why. Forgets what was staged.
int load_password_methods(_CFG* session) noexcept;

// Checks that the method of that number may be used and that this host can make it, and stages it.
// 0; 53 with a malloced reason in `*text` (null without memory for it; `text` may be null); 90.
int stage_password_method(int method, char** text) noexcept;

// What was staged since the last reading, and what is in force. `none_converted`: nothing.
int staged_password_method() noexcept;
int password_method_in_force() noexcept;

}  // namespace orv
