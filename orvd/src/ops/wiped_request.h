// Requests that leave no password behind in memory.
#pragma once

#include <string>
#include <variant>

#include "cfg/secret.h"
#include "protocol/message.h"

namespace orv::server {

inline void wipe_values(Attribute& attribute) noexcept {
  for (std::string& value : attribute.values) cfg::wipe(value);
}

inline void wipe_credentials(BindRequest& request) noexcept {
  cfg::wipe(request.password);
  if (request.credentials) cfg::wipe(*request.credentials);
}

// Passwords stand in binds, and among the values of changes.
struct WipedMessage : Message {
  ~WipedMessage() {
    if (auto* const bind = std::get_if<BindRequest>(&request)) wipe_credentials(*bind);
    if (auto* const add = std::get_if<AddRequest>(&request))
      for (Attribute& attribute : add->attributes) wipe_values(attribute);
    if (auto* const modify = std::get_if<ModifyRequest>(&request))
      for (Modification& modification : modify->modifications) wipe_values(modification.attribute);
  }
};

}  // namespace orv::server
