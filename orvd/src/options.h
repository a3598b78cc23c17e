// The command line of the server.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

namespace orv::server {

struct Options {
  std::string config_file;     // absolute, symbolic links resolved
  std::string key_stash_file;  // "" for none
  // The same as they were named, absolute.
  std::string named_config_file;
  std::string named_key_stash;
  std::string plugin_file;
  std::vector<std::string> addresses;        // not empty: instead of the configured ones
  std::optional<std::uint16_t> port;         // instead of the configured one
  std::optional<std::uint16_t> secure_port;  // instead of the configured one
  std::optional<std::string> local_socket;   // instead of the configured one; "": none
  int server_type = 0;
  bool safe_mode = false;
  std::string code_page;  // "": the environment's
  std::optional<std::uint32_t> trace_mask;
  std::string trace_file;  // "": standard error
  bool debug = false;
  std::string user;         // to become; "": stay
  std::string group;        // to go with it; "": the user's
  bool call_filter = true;  // the serving process is restricted to the system calls it needs
  bool guards = true;       // the server's own, in front of the backend
  bool check = false;       // read everything, report, do not serve
};

enum class Parsed { run, exit };

// Reads the command line; `exit` when there is nothing to run (help, version, a mistake: told on
// standard output or standard error), with the exit status in `status`.
Parsed parse_options(int argc, char** argv, Options& options, int& status);

// The directory of the running executable, with a slash at its end; "" when unknown.
std::string executable_directory();

}  // namespace orv::server
