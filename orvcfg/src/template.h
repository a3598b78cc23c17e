// Turns the default configuration into that of one instance.
#pragma once

#include <string>
#include <string_view>

namespace orv::orvcfg {

struct TemplateValues {
  std::string_view directory;       // for @DIR@: absolute path of the instance, UTF-8
  std::string_view admin_password;  // for @ADMINPW@: the stored form
};

// Replaces the two words in the values of `text`; comments stay as they are, and a value that LDIF
// cannot hold as it is becomes base64. False without memory.
bool fill_template(std::string_view text, const TemplateValues& values, std::string& filled);

}  // namespace orv::orvcfg
