#include "options.h"

#include <stdlib.h>
#include <unistd.h>

#include <CLI/CLI.hpp>
#include <cerrno>
#include <charconv>
#include <cstdio>
#include <cstring>
#include <memory>

namespace orv::server {
namespace {

constexpr const char* kVersion = "orvd " ORV_VERSION;

// Whether `path` could be resolved; what is not there stays as it was written.
bool resolve(std::string& path) {
  const std::unique_ptr<char, decltype(&free)> resolved(realpath(path.c_str(), nullptr), &free);
  if (!resolved) return false;
  path = resolved.get();
  return true;
}

// What does not depend on the working directory, which is left.
void make_absolute(std::string& path) {
  if (path.empty() || path.front() == '/') return;
  const std::unique_ptr<char, decltype(&free)> here(::getcwd(nullptr, 0), &free);
  if (here) path = std::string(here.get()) + "/" + path;
}

bool parse_mask(std::string_view text, std::uint32_t& mask) {
  if (text.starts_with("0x") || text.starts_with("0X")) text.remove_prefix(2);
  const auto [end, status] = std::from_chars(text.data(), text.data() + text.size(), mask, 16);
  return status == std::errc() && end == text.data() + text.size();
}

std::string check_mask(const std::string& text) {
  std::uint32_t mask = 0;
  return parse_mask(text, mask) ? "" : text + " is not a hexadecimal mask";
}

}  // namespace

std::string executable_directory() {
  std::string path = "/proc/self/exe";
  if (!resolve(path)) return "";
  return path.substr(0, path.rfind('/') + 1);
}

Parsed parse_options(int argc, char** argv, Options& options, int& status) {
  CLI::App app("Directory server that serves its own configuration over LDAP.", "orvd");
  app.set_version_flag("--version", kVersion);
  std::string mask;
  app.add_option("--config", options.config_file, "Configuration file")
      ->required()
      ->type_name("FILE");
  app.add_option("--key-stash", options.key_stash_file, "File with the key of sealed values")
      ->type_name("FILE");
  app.add_option("--plugin", options.plugin_file, "Backend plug-in to load")->type_name("FILE");
  app.add_option("--address", options.addresses, "Address to listen on, instead of the configured")
      ->type_name("ADDRESS");
  app.add_option("--port", options.port, "Port to listen on, instead of the configured; 0: any")
      ->type_name("N");
  app.add_option("--secure-port", options.secure_port,
                 "Port for TLS, instead of the configured; 0: any; also with --port")
      ->type_name("N");
  app.add_option("--local-socket", options.local_socket,
                 "Unix socket to listen at, instead of the configured; \"\": none")
      ->type_name("FILE");
  CLI::Option* const user =
      app.add_option("--user", options.user, "User to become, when started as root")
          ->type_name("NAME");
  app.add_option("--group", options.group, "Its group, instead of the user's own")
      ->type_name("NAME")
      ->needs(user);
  app.add_option("--server-type", options.server_type, "Kind of server")->type_name("N");
  app.add_flag("--safe-mode", options.safe_mode, "Start in safe mode");
  app.add_option("--code-page", options.code_page, "Code page of the configuration file")
      ->type_name("NAME");
  app.add_option("--trace-mask", mask, "What to trace")->type_name("HEX")->check(check_mask);
  app.add_option("--trace-file", options.trace_file, "Where to trace to")->type_name("FILE");
  app.add_flag("--debug", options.debug, "Write debug output");
  app.add_flag("!--without-guards", options.guards,
               "Leave out the server's own guards, to test the backend's rules");
  app.add_flag("!--without-call-filter", options.call_filter,
               "Do not restrict the system calls of the serving process, to debug it");
  app.add_flag("--check", options.check, "Read the configuration, report, and exit");
  try {
    app.parse(argc, argv);
  } catch (const CLI::ParseError& error) {
    status = app.exit(error) == 0 ? 0 : 1;
    return Parsed::exit;
  }
  if (!mask.empty()) parse_mask(mask, options.trace_mask.emplace());
  if (options.plugin_file.empty())
    options.plugin_file = executable_directory() + "../lib/libback-config.so";
  for (std::string* const path :
       {&options.config_file, &options.key_stash_file, &options.plugin_file, &options.trace_file})
    make_absolute(*path);
  if (options.local_socket) make_absolute(*options.local_socket);
  options.named_config_file = options.config_file;
  options.named_key_stash = options.key_stash_file;
  if (!resolve(options.config_file)) {
    std::fprintf(stderr, "orvd: %s: %s\n", options.config_file.c_str(), std::strerror(errno));
    status = 1;
    return Parsed::exit;
  }
  if (!options.key_stash_file.empty()) resolve(options.key_stash_file);
  return Parsed::run;
}

}  // namespace orv::server
