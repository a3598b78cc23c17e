// The command "show": entries of a configuration file as LDIF.
#pragma once

#include <ostream>
#include <string>

namespace orv::orvcfg {

// Writes the entries at and below `base`, in the order of the file. Of secret attributes only a
// comment is written, so that the output can be shown around and fed to a client without setting a
// password. False with the cause in `why`.
bool show_entries(const std::string& file, const std::string& base, std::ostream& out,
                  std::string& why);

}  // namespace orv::orvcfg
