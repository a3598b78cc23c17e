// The scene of the authority matrix: who calls, which entries there are and which nearly have their
// names, and files that hold them.
#pragma once

#include <map>
#include <memory>
#include <string>
#include <vector>

#include "authority_model.h"
#include "platform/platform.h"

namespace orv::scene {

// ---- Callers

struct Caller {
  std::string name;  // for those who read of a difference
  model::Caller caller;
};

// Every identity, and every word of authority flags below 0x40; a member with every set of role
// bits, also with bits that are no roles of the configuration.
const std::vector<Caller>& everybody();
// One for each way through the rules.
const std::vector<Caller>& some();
// Who reads: members under their own name, under that of another, under that of nobody.
const std::vector<Caller>& readers();

// ---- Names

// Entries that rules name, entries below and above them, names that hold a protected name as a part
// or nearly are one, the same in small letters, and an entry that is missing.
const std::vector<std::string>& names();

// ---- Files

// A configuration file for the scripted platform, which evaluates the backend's searches: scopes,
// lists of attributes, and the filters that the backend uses.
class File {
 public:
  explicit File(std::vector<model::Entry> entries) : entries_(std::move(entries)) {}

  [[nodiscard]] const model::File& entries() const { return entries_; }
  const scripted::Answer& search(const char* base, int scope, const char* filter, char** attributes,
                                 int types_only);

 private:
  [[nodiscard]] scripted::Answer evaluated(const std::string& base, int scope,
                                           const std::string& filter, char** attributes,
                                           bool types_only) const;

  model::File entries_;
  std::map<std::string, std::unique_ptr<scripted::Answer>> answers_;
};

struct NamedFile {
  const char* name;
  File file;
};

// Files in which every name exists: as one would find them; each entry a supplier's; without an
// identity of the primary administrator, and with a member that has only a password.
std::vector<NamedFile>& full_files();
// Files to add to: with the group of administrators, without it, and without an identity of the
// primary administrator.
std::vector<NamedFile>& sparse_files();

}  // namespace orv::scene
