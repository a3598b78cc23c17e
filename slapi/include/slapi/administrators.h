// What the server knows about those who administer and feed it, besides their rights: who is a
// supplier of which suffix, and how often somebody failed to prove an identity.
//
// Identities are read from the configuration file by `load_administrators`: at the start, when the
// server is told to read its settings again, and after each change that defines identities.
// Failures are counted in memory and live as long as the process: a stranger must not be able to
// write to the file by failing, and who restarts the server may also edit the file. The record of
// an identity is never released; one whose identity has gone counts nothing and is found again when
// it comes back.
//
// Threads: thread-safe, except `changed` of a record, which belongs to whoever is inside the gate.
// Nothing throws, nothing blocks for longer than a lookup takes.
#pragma once

#include <chrono>
#include <string_view>

#include "cfg/session.h"

namespace orv {

using LockoutTime = std::chrono::steady_clock::time_point;

// Reads with a bound session: the primary administrator, the members of the group, the supplier of
// the whole server and those of single suffixes. Only first values of names and passwords count;
// identities without a name, or with one inside the configuration, are left out. Failures of an
// identity whose stored password is another than before are forgotten. 0; 32 the file has no
// CN=CONFIGURATION; 34 a DN of an entry that is none; 90; else the session's code. After anything
// but 0 everything is as before.
int load_administrators(_CFG* session) noexcept;

// Decides about a bind whose password was verified, and counts. `dn` is the name in any spelling,
// `proved` whether the password was right. True when the bind stands: proved, and not locked out.
// While pwdLockout is on, failures are counted; those of which the last is pwdFailureCountInterval
// seconds old are forgotten (0: only a success forgets them). The failure number pwdMaxFailure
// locks the identity out for pwdLockoutDuration seconds (0: until its password is set anew),
// message 10 of set 10 says so, and until then no bind stands, proved or not, nor counts. Names of
// nobody are not counted. Without memory no bind stands.
bool settle_administrator_bind(std::string_view dn, bool proved, LockoutTime now) noexcept;

// Whether an identity is locked out. False for nobody's name.
bool is_administrator_locked_out(std::string_view dn, LockoutTime now) noexcept;

// Ends the marks of accepted password changes (`AdminPasswordRecord::changed`): those who have one
// lose their failures and lockout when the change was `written`. Between two calls of handlers,
// from inside the gate.
void settle_password_changes(bool written) noexcept;

}  // namespace orv
