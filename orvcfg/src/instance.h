// Makes the files of a new instance.
#pragma once

#include <optional>
#include <string>

#include "slapi/account.h"

namespace orv::orvcfg {

struct Instance {
  std::string directory;  // absolute, links resolved
  [[nodiscard]] std::string config() const { return directory + "/config.ldif"; }
  [[nodiscard]] std::string key_stash() const { return directory + "/key.stash"; }
  [[nodiscard]] std::string admin_password() const { return directory + "/admin.pw"; }
  [[nodiscard]] std::string certificate() const { return directory + "/tls.crt"; }
  [[nodiscard]] std::string certificate_key() const { return directory + "/tls.key"; }
  [[nodiscard]] std::string log_directory() const { return directory + "/log"; }
};

// Makes DIR and DIR/log (0700) where they are missing, and DIR/key.stash, DIR/admin.pw,
// DIR/tls.key, DIR/tls.crt and DIR/config.ldif (0600) in this order: an instance exists when its
// config.ldif does.
//
// With an owner, root makes DIR for it, and all the rest is made as that user: nothing that it put
// there before could lead root astray. An existing DIR must be the owner's already.
//
// Nothing is overwritten; an existing config.ldif is a failure. What an interrupted run left of the
// others is used again. After a failure everything that this call made is gone. False with what
// went wrong, where, and what to do about it in `why`.
bool create_instance(const std::string& directory, const std::optional<Account>& owner,
                     Instance& instance, std::string& why);

}  // namespace orv::orvcfg
