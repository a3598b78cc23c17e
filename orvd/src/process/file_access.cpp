#include "process/file_access.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <utility>

#include "slapi/account.h"

namespace orv::server {
namespace {

std::string folder_of(const std::string& path) {
  const std::size_t slash = path.rfind('/');
  return slash == 0 ? "/" : path.substr(0, slash);
}

bool lacks(const std::string& path, int rights) noexcept {
  return ::faccessat(AT_FDCWD, path.c_str(), rights, AT_EACCESS) != 0 && errno == EACCES;
}

bool exists(const std::string& path) noexcept {
  return ::faccessat(AT_FDCWD, path.c_str(), F_OK, AT_EACCESS) == 0;
}

// Its owner can mend the mode; what belongs to another has to be given away.
std::string advice(const std::string& path, const std::string& user) {
  struct stat status {};
  if (::stat(path.c_str(), &status) == 0 && status.st_uid == ::geteuid())
    return "chmod u+rwX " + path;
  return "give it to that user (chown " + user + " " + path + "), its folder too";
}

std::string complaint(const std::string& path, const char* access, const std::string& purpose) {
  const std::string user = user_name(::geteuid());
  return path + ": the server runs as " + user + ", which may not " + access + " it" + purpose +
         " (" + std::strerror(EACCES) + "); " + advice(path, user);
}

class Findings {
 public:
  void folder(const std::string& path, const std::string& purpose) {
    if (lacks(path, W_OK | X_OK)) tell(path, purpose);
  }

  // A file that is written where it is, and made when it is missing.
  void file(const std::string& path, const std::string& purpose) {
    if (lacks(path, W_OK))
      tell(path, purpose);
    else if (!exists(path))
      folder(folder_of(path), purpose);
  }

  // A new version gets the owner of the old one, which only that owner can give it.
  void owned(const std::string& path, const std::string& purpose) {
    struct stat status {};
    if (::stat(path.c_str(), &status) == 0 && ::geteuid() != 0 && status.st_uid != ::geteuid())
      tell(path, purpose);
  }

  std::vector<std::string> take() { return std::move(found_); }

 private:
  void tell(const std::string& path, const std::string& purpose) {
    found_.push_back(complaint(path, "write", " for " + purpose));
  }

  std::vector<std::string> found_;
};

bool is_wanted(const std::string& path, const std::string& level) {
  return !path.empty() && level != "off";
}

}  // namespace

std::vector<std::string> missing_read_access(const std::vector<std::string>& files) {
  std::vector<std::string> found;
  for (const std::string& file : files)
    if (!file.empty() && lacks(file, R_OK)) found.push_back(complaint(file, "read", ""));
  return found;
}

std::vector<std::string> missing_write_access(const std::string& config_file,
                                              const Settings& settings,
                                              const std::string& local_socket) {
  Findings found;
  found.folder(folder_of(config_file), "changes of the configuration");
  found.owned(config_file, "changes of the configuration");
  found.file(config_file + ".lock", "changes of the configuration");
  if (is_wanted(settings.error_log, settings.error_log_level))
    found.file(settings.error_log, "the error log");
  if (is_wanted(settings.access_log, settings.access_log_level))
    found.file(settings.access_log, "the access log");
  if (!settings.audit_log.empty()) found.file(settings.audit_log, "the audit log");
  if (!local_socket.empty()) found.folder(folder_of(local_socket), "the local socket");
  return found.take();
}

}  // namespace orv::server
