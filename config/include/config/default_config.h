// The default configuration: the text of config/default.ldif.
#pragma once

namespace orv {

// LDIF content records with comments, ASCII, terminated by NUL. Two words are to be replaced before
// a server can use it: "@DIR@" by the absolute path of the instance, "@ADMINPW@" by the primary
// administrator's stored password.
extern const char* const kDefaultConfigText;

}  // namespace orv
