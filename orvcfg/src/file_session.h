// A session on one configuration file for the commands that read it.
#pragma once

#include <string>
#include <string_view>
#include <vector>

#include "cfg/owners.h"

namespace orv::orvcfg {

// One attribute of an entry, as the file holds it.
struct FileAttribute {
  std::string name;
  std::vector<std::string> values;
};

struct FileEntry {
  std::string dn;
  std::vector<FileAttribute> attributes;

  // The values of an attribute; empty when the entry lacks it.
  [[nodiscard]] const std::vector<std::string>& values(std::string_view name) const;
};

// Opens a file with the built-in schema registered. `key_stash` may be empty. Null with file, line,
// column and cause in `why` when the file or the key stash cannot be read.
CfgSession open_file(const std::string& file, const std::string& key_stash, std::string& why);

// Reads the entries at and below `base`, in the order of the file. False with the cause in `why`.
bool read_entries(_CFG* session, const std::string& base, std::vector<FileEntry>& entries,
                  std::string& why);

}  // namespace orv::orvcfg
