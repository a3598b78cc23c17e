// Whether the user of the server may read and write what it will have to.
//
// Threads: any. Throws std::bad_alloc.
#pragma once

#include <string>
#include <vector>

#include "settings.h"

namespace orv::server {

// Which of the files ("" for none) the user that this process runs as has no right to read, one
// line each with what to do about it.
std::vector<std::string> missing_read_access(const std::vector<std::string>& files);

// What that user has no right to write, one line each with what to do
// about it: the folder of the configuration file and what a change leaves there, the logs, the
// folder of the local socket ("" for none). Only rights are looked at: a disk that is read-only or
// full is another matter, and may be mended while the server runs. Root may write everything.
std::vector<std::string> missing_write_access(const std::string& config_file,
                                              const Settings& settings,
                                              const std::string& local_socket);

}  // namespace orv::server
