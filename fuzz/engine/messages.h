// Messages of LDAP made of decisions: valid ones, ones that are valid but ask for nonsense, and
// damaged ones.
#pragma once

#include <cstdint>
#include <string>

#include "choices.h"

namespace orv::fuzz {

// One message with this id, or what is left of one. `cookie`: one of paged results that somebody
// may go on with, or "".
std::string make_message(Choices& choices, std::int32_t id, const std::string& cookie);

}  // namespace orv::fuzz
