// orvcfg: makes instances, and checks and shows configuration files. See orvcfg(1).
#include <sys/stat.h>
#include <unistd.h>

#include <CLI/CLI.hpp>
#include <cstdlib>
#include <exception>
#include <iostream>
#include <optional>
#include <string>
#include <string_view>

#include "check.h"
#include "config/default_config.h"
#include "config/local_url.h"
#include "instance.h"
#include "show.h"
#include "slapi/account.h"
#include "slapi/file_trust.h"

namespace {

using orv::orvcfg::Instance;

constexpr int kUsageError = 2;

struct Arguments {
  std::string directory;
  int port = 3389;
  std::string user;
  std::string group;
  std::string file;
  std::string key_stash;
  std::string base = "CN=CONFIGURATION";
};

int fail(const std::string& why) {
  std::cerr << "orvcfg: " << why << "\n";
  return EXIT_FAILURE;
}

// What was written counts as written only when it has left the buffer.
int finish_output() {
  std::cout.flush();
  return std::cout ? EXIT_SUCCESS : fail("cannot write to standard output");
}

// In single quotes where a shell would read a character of it as its own.
std::string shell_word(const std::string& text) {
  constexpr const char* kPlain =
      "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789%+,-./:=@_";
  if (!text.empty() && text.find_first_not_of(kPlain) == std::string::npos) return text;
  std::string quoted = "'";
  for (const char c : text) quoted += c == '\'' ? std::string("'\\''") : std::string(1, c);
  return quoted + "'";
}

void print_welcome(const Instance& instance, const Arguments& arguments) {
  const std::string port = arguments.port == 0 ? "PORT" : std::to_string(arguments.port);
  std::cout << "A new instance was made in " << instance.directory << ":\n"
            << "  config.ldif  its configuration\n"
            << "  key.stash    the key that opens the passwords in it\n"
            << "  admin.pw     the password of the primary administrator, cn=root\n"
            << "  tls.crt      a certificate for TLS that the instance has signed itself\n"
            << "  tls.key      its private key\n"
            << "Read the configuration of the running server with\n"
            << "  ldapsearch -x -H ldap://127.0.0.1:" << port << " -D cn=root -y "
            << shell_word(arguments.directory + "/admin.pw") << " -b cn=configuration\n"
            << "with TLS\n"
            << "  LDAPTLS_CACERT=" << shell_word(instance.certificate())
            << " ldapsearch -x -ZZ -H ldap://127.0.0.1:" << port << " -D cn=root -y "
            << shell_word(arguments.directory + "/admin.pw") << " -b cn=configuration\n"
            << "and as root or the user of the server without a password\n"
            << "  ldapsearch -Q -Y EXTERNAL -H "
            << shell_word(orv::local_url(instance.directory + "/ldapi"))
            << " -b cn=configuration\n";
}

int run_init(const Arguments& arguments) {
  Instance instance;
  std::string why;
  std::optional<orv::Account> owner;
  if (!arguments.user.empty() &&
      !orv::find_account(arguments.user, arguments.group, owner.emplace(), why))
    return fail(why);
  if (!orv::orvcfg::create_instance(arguments.directory, owner, instance, why)) return fail(why);
  // The server would not start.
  for (const std::string& problem : orv::distrusted_files(instance.config(), instance.key_stash(),
                                                          owner ? owner->user : ::geteuid()))
    std::cerr << "orvcfg: warning: the server will refuse this: " << problem << "\n";
  print_welcome(instance, arguments);
  return finish_output();
}

int run_check(const Arguments& arguments) {
  const bool good = orv::orvcfg::check_file(arguments.file, arguments.key_stash, std::cout);
  const int written = finish_output();
  return good ? written : EXIT_FAILURE;
}

int run_show(const Arguments& arguments) {
  std::string why;
  if (!orv::orvcfg::show_entries(arguments.file, arguments.base, std::cout, why)) return fail(why);
  return finish_output();
}

int run_default() {
  std::cout << orv::kDefaultConfigText;
  return finish_output();
}

// Declares the commands; the one that was given runs inside CLI::App::parse.
void declare_commands(CLI::App& app, Arguments& arguments, int& status) {
  app.require_subcommand(1);
  CLI::App* init = app.add_subcommand("init", "make the files of a new instance");
  init->add_option("--dir", arguments.directory, "directory of the instance")
      ->required()
      ->type_name("DIR");
  init->add_option("--port", arguments.port, "port to name in the instructions that are printed")
      ->check(CLI::Range(0, 65535))
      ->type_name("N");
  CLI::Option* const user =
      init->add_option("--user", arguments.user, "user to make it for, when run as root")
          ->type_name("NAME");
  init->add_option("--group", arguments.group, "its group, instead of the user's own")
      ->type_name("NAME")
      ->needs(user);
  init->callback([&] { status = run_init(arguments); });

  CLI::App* check = app.add_subcommand("check", "say what is wrong with a configuration file");
  check->add_option("FILE", arguments.file, "the configuration file")->required();
  check->add_option("--key-stash", arguments.key_stash, "open sealed passwords with this key")
      ->type_name("FILE");
  check->callback([&] { status = run_check(arguments); });

  CLI::App* show = app.add_subcommand("show", "print entries as LDIF, passwords left out");
  show->add_option("FILE", arguments.file, "the configuration file")->required();
  show->add_option("DN", arguments.base, "print this entry and those below it only");
  show->callback([&] { status = run_show(arguments); });

  app.add_subcommand("default", "print the default configuration")->callback([&] {
    status = run_default();
  });
}

}  // namespace

int main(int argc, char** argv) {
  // Whatever is made here is the owner's alone.
  ::umask(S_IRWXG | S_IRWXO);
  try {
    CLI::App app("Makes instances of orvd, and checks and shows their configuration files.",
                 "orvcfg");
    Arguments arguments;
    int status = EXIT_SUCCESS;
    declare_commands(app, arguments, status);
    try {
      app.parse(argc, argv);
    } catch (const CLI::ParseError& error) {
      return app.exit(error) == 0 ? EXIT_SUCCESS : kUsageError;
    }
    return status;
  } catch (const std::exception& error) {
    return fail(error.what());
  }
}
