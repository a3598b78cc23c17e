// What is doubtful about a configuration file that somebody may have edited by hand.
//
// The server takes such a file, since a slip of an editor must not stop it, but rules that compare
// bytes or look at first values may not see everything that stands there. So it says so at the
// start. Doubts about who may bind are told where identities are read.
#pragma once

#include <string>
#include <vector>

namespace orv::server {

// One line for each doubt, without values of secrets: attribute types under their numbers, listen
// addresses that are none of this host's. What breaks the schema (unknown classes, second values,
// pass-through entries without subtrees) is told as messages of the schema check. A file that
// cannot be read gives its cause. Throws std::bad_alloc.
std::vector<std::string> doubts_about_file(const std::string& config_file,
                                           const std::string& key_stash_file);

}  // namespace orv::server
