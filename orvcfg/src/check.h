// The command "check": what is wrong with a configuration file.
#pragma once

#include <ostream>
#include <string>

namespace orv::orvcfg {

// Reads `file` and writes one line to `out` for each thing that is wrong with it, and a closing
// line. With a key stash (its path, or "" for none) sealed passwords are opened as well. Returns
// whether nothing was wrong. Never writes a value of a secret attribute.
bool check_file(const std::string& file, const std::string& key_stash, std::ostream& out);

}  // namespace orv::orvcfg
