// The first password of an instance.
#pragma once

#include <string>

namespace orv::orvcfg {

inline constexpr std::size_t kPasswordLength = 28;

// Makes a password of kPasswordLength characters from A-Z, a-z, 0-9, "-" and "_", every one that
// passes equally likely: it has at least two capitals, two small letters and two other characters,
// and none more than twice, so that it meets the default policy and the usual ones. Some 160 bits.
// False with the cause in `why` when the system has no random numbers.
bool generate_password(std::string& password, std::string& why);

}  // namespace orv::orvcfg
