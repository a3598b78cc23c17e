// Cyrus SASL as this server uses it: set up once, with nothing of the environment.
//
// No configuration file of the library is read, and only the plug-ins of the mechanisms that the
// server knows are loaded, from the folder of the distribution: SASL_PATH and SASL_CONF_PATH have
// no effect. What the library allocates is wiped when it is released, since passwords and keys pass
// through it.
//
// Threads: open and close while there is one thread that uses SASL; `has` always.
#pragma once

#include <memory>
#include <string>
#include <string_view>
#include <vector>

namespace orv::server {

class SaslLibrary {
 public:
  // Sets the library up. One at a time in a process. Null, with the cause in `error`, when that
  // failed. A plug-in that is not installed is no failure: its mechanism is not there.
  static std::unique_ptr<SaslLibrary> open(std::string& error);
  // After the last exchange and the last security layer have gone.
  ~SaslLibrary();
  SaslLibrary(const SaslLibrary&) = delete;
  SaslLibrary& operator=(const SaslLibrary&) = delete;

  // Whether the mechanism of this name (in upper case) is installed.
  bool has(std::string_view mechanism) const noexcept;

 private:
  SaslLibrary() = default;
  std::vector<std::string> mechanisms_;
};

}  // namespace orv::server
