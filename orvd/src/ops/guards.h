// The server's own guards: changes that it refuses in front of the backend, beyond the backend's
// rules. The table is documented in docs/guards.md.
//
// A guard only ever forbids more. All functions are thread-safe and do not throw but for want of
// memory.
#pragma once

#include <functional>
#include <span>
#include <string_view>

#include "ops/canonical.h"
#include "settings.h"
#include "slapi/entry.h"

namespace orv::server {

enum class GuardedChange { add, remove };

struct Guard {
  GuardedChange change;
  std::string_view dn;  // normal form
  bool primary_may;     // the primary administrator is let through
  int code;
  std::string_view text;  // for the client
};

// The guards of single entries, in the order of the documentation.
std::span<const Guard> entry_guards() noexcept;

// The refusal of adding or deleting an entry by somebody with these authority flags; none when no
// guard stands in the way. `added` is the entry to add, null for a delete. 50 or 53 by the table;
// 53 an object class out of its place; 19 a value with which the server would not start, nor take
// over any settings while it runs (an integer setting out of its bounds, or another whose value
// is none of the words that it may be), a map of certificates that maps nothing, or a name to bind
// with that lies inside the configuration, where nobody is found; 21 a method of storing passwords
// to allow that is none.
Refusal guarded(GuardedChange change, std::string_view normal_dn, unsigned authority,
                const entry* added);

// The same for what a modification puts in.
Refusal guarded_modification(std::string_view normal_dn, const ldapmod* first);

// 19 when the settings that a folded list of modifications leaves at CN=PWDPOLICY ADMIN could not
// be put in force: it would succeed, and the policy before would go on to hold. Switched off, too:
// it would be switched on later. `read_policy` reads what the file says now, so this belongs inside
// the gate; where it is empty or fails nothing is refused, to others than the primary administrator
// neither, and not for what the schema refuses.
Refusal guarded_policy(const Schema& schema, std::string_view normal_dn, const ldapmod* first,
                       unsigned authority,
                       const std::function<bool(AdminPolicySettings&)>& read_policy);

// The same for that entry as it is to be added.
Refusal guarded_policy(const Schema& schema, std::string_view normal_dn, const entry& added,
                       unsigned authority);

// 53 when the files of TLS that a folded list of modifications leaves at CN=ADMINGROUP cannot be
// used, with which the server would not start: they are loaded to see. `read_settings` reads what
// the file says now; where it is empty or fails nothing is refused, and to others than the primary
// administrator neither: the rules refuse them anyway, and they must not learn what files there
// are.
Refusal guarded_tls_files(std::string_view normal_dn, const ldapmod* first, unsigned authority,
                          const std::function<bool(Settings&)>& read_settings);

// The same for that entry as it is to be added: none of those files is in use then.
Refusal guarded_tls_files(std::string_view normal_dn, const entry& added, unsigned authority);

}  // namespace orv::server
