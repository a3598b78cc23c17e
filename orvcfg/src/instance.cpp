#include "instance.h"

#include <fcntl.h>
#include <grp.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <memory>
#include <vector>

#include "cfg/secret.h"
#include "cfg/text.h"
#include "config/default_config.h"
#include "new_file.h"
#include "password.h"
#include "self_signed.h"
#include "template.h"

namespace orv::orvcfg {

namespace {

constexpr cfg::SecretPlace kAdminPasswordPlace{"orv-slapdAdminPW", "CN=CONFIGURATION"};

// Works as another user for as long as it lives; the groups of the process stay behind.
class ActingAs {
 public:
  ActingAs() = default;
  ActingAs(const ActingAs&) = delete;
  ActingAs& operator=(const ActingAs&) = delete;
  ~ActingAs() {
    if (!active_) return;
    // Whoever cannot be root again must not go on.
    if (::seteuid(0) != 0 || ::setegid(0) != 0) std::abort();
  }

  bool become(const Account& account) {
    const bool groups = account.name.empty()
                            ? ::setgroups(0, nullptr) == 0
                            : ::initgroups(account.name.c_str(), account.group) == 0;
    active_ = groups && ::setegid(account.group) == 0 && ::seteuid(account.user) == 0;
    return active_;
  }

 private:
  bool active_ = false;
};

// Removes what was made, the latest first, unless everything succeeded.
class Undo {
 public:
  Undo() = default;
  Undo(const Undo&) = delete;
  Undo& operator=(const Undo&) = delete;
  ~Undo() {
    for (auto made = made_.rbegin(); made != made_.rend(); ++made) {
      made->is_directory ? ::rmdir(made->path.c_str()) : ::unlink(made->path.c_str());
    }
  }
  void file(std::string path) { made_.push_back({std::move(path), false}); }
  void directory(std::string path) { made_.push_back({std::move(path), true}); }
  void keep_all() noexcept { made_.clear(); }
  [[nodiscard]] bool empty() const noexcept { return made_.empty(); }

 private:
  struct Made {
    std::string path;
    bool is_directory;
  };
  std::vector<Made> made_;
};

// Wipes a clear password when it goes out of scope.
struct ClearText : std::string {
  ClearText() = default;
  ClearText(const ClearText&) = delete;
  ClearText& operator=(const ClearText&) = delete;
  ~ClearText() { cfg::wipe(*this); }
};

bool exists(const std::string& path) {
  struct stat status {};
  return ::lstat(path.c_str(), &status) == 0;
}

bool refuse_if_others_may_write(const std::string& path, std::string& why) {
  struct stat status {};
  if (::stat(path.c_str(), &status) != 0) {
    why = system_failure("cannot examine", path);
    return false;
  }
  if (!S_ISDIR(status.st_mode)) {
    why = path + " is not a directory; name another one";
    return false;
  }
  if ((status.st_mode & (S_IWGRP | S_IWOTH)) != 0) {
    why = "others may write in " + path + "; take that right away first (chmod go-w)";
    return false;
  }
  return true;
}

bool make_directory(const std::string& path, Undo& undo, std::string& why) {
  if (::mkdir(path.c_str(), 0700) == 0) {
    undo.directory(path);
    if (::chmod(path.c_str(), 0700) == 0) return true;
  } else if (errno == EEXIST) {
    return refuse_if_others_may_write(path, why);
  }
  why = system_failure("cannot make the directory", path);
  return false;
}

bool resolve(const std::string& path, std::string& absolute, std::string& why) {
  const std::unique_ptr<char, decltype(&std::free)> real(::realpath(path.c_str(), nullptr),
                                                         &std::free);
  if (!real) {
    why = system_failure("cannot resolve", path);
    return false;
  }
  absolute = real.get();
  if (cfg::is_valid_utf8(absolute)) return true;
  why = "the path " + absolute + " is not valid UTF-8, which the configuration file needs";
  return false;
}

// Two runs in the same directory would remove each other's temporary files.
bool lock_directory(const Descriptor& directory, const std::string& path, std::string& why) {
  if (directory.valid() && ::flock(directory.get(), LOCK_EX | LOCK_NB) == 0) return true;
  why = errno == EWOULDBLOCK ? "another orvcfg init is at work in " + path
                             : system_failure("cannot lock", path);
  return false;
}

bool provide_key(const Instance& instance, Undo& undo, cfg::KeyPtr& key, std::string& why) {
  const std::string path = instance.key_stash();
  if (!exists(path)) {
    if (cfg::create_key_stash(path.c_str(), why) != 0) return false;
    undo.file(path);
  }
  return cfg::load_key_stash(path.c_str(), key, why) == 0;
}

bool provide_password(const Instance& instance, Undo& undo, ClearText& password, std::string& why) {
  const std::string path = instance.admin_password();
  if (exists(path)) {
    if (!read_private_file(path, 1024, password, why)) return false;
    if (!password.empty()) return true;
    why = path + " is empty; remove it and try again";
    return false;
  }
  if (!generate_password(password, why) || !write_new_file(path, password, why)) return false;
  undo.file(path);
  return true;
}

bool provide_certificate(const Instance& instance, Undo& undo, std::string& why) {
  if (exists(instance.certificate()) && exists(instance.certificate_key())) return true;
  // Half a pair is of no use, and may be somebody's.
  for (const std::string& path : {instance.certificate(), instance.certificate_key()})
    if (exists(path)) {
      why = path + " stands without the other of tls.crt and tls.key; remove it and try again";
      return false;
    }
  SelfSigned made;
  if (!make_self_signed(made, why)) return false;
  const bool has_key = write_new_file(instance.certificate_key(), made.key, why);
  if (has_key) undo.file(instance.certificate_key());
  cfg::wipe(made.key);
  if (!has_key || !write_new_file(instance.certificate(), made.certificate, why)) return false;
  undo.file(instance.certificate());
  return true;
}

bool write_config(const Instance& instance, const cfg::Key& key, const ClearText& password,
                  Undo& undo, std::string& why) {
  std::string sealed;
  std::string text;
  if (cfg::seal_secret(key, kAdminPasswordPlace, password, sealed) != 0 ||
      !fill_template(kDefaultConfigText, {instance.directory, sealed}, text)) {
    why = "not enough memory for the configuration of " + instance.directory;
    return false;
  }
  // The other files must have survived a power failure before this one says that they are there.
  if (!flush_directory(instance.directory, why) || !write_new_file(instance.config(), text, why)) {
    return false;
  }
  undo.file(instance.config());
  return flush_directory(instance.directory, why);
}

bool refuse_if_made(const Instance& instance, std::string& why) {
  if (!exists(instance.config())) return true;
  why = instance.config() + " exists already; remove it, or name another directory";
  return false;
}

// The rest is made as the owner of the directory, which is made sure of without following a link.
bool give_to(const std::string& directory, const Account& owner, bool is_new, ActingAs& acting,
             std::string& why) {
  if (::geteuid() == owner.user) return true;
  if (::geteuid() != 0) {
    why = "only root can make an instance for another user";
    return false;
  }
  const Descriptor opened(
      ::open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  struct stat status {};
  if (!opened.valid() || ::fstat(opened.get(), &status) != 0) {
    why = system_failure("cannot examine", directory);
    return false;
  }
  const std::string user = user_name(owner.user);
  if (!is_new && status.st_uid != owner.user) {
    why = directory + " belongs to " + user_name(status.st_uid) + "; give it to " + user +
          " (chown), or name another one";
    return false;
  }
  if (::fchown(opened.get(), owner.user, owner.group) == 0 && acting.become(owner)) return true;
  why = system_failure("cannot make an instance for the user " + user, directory);
  return false;
}

}  // namespace

bool create_instance(const std::string& directory, const std::optional<Account>& owner,
                     Instance& instance, std::string& why) {
  Undo of_directory;
  ActingAs acting;
  Undo undo;  // as the owner
  if (!make_directory(directory, of_directory, why) ||
      (owner && !give_to(directory, *owner, !of_directory.empty(), acting, why)) ||
      !resolve(directory, instance.directory, why)) {
    return false;
  }
  const Descriptor lock(::open(instance.directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  cfg::KeyPtr key;
  ClearText password;
  if (!lock_directory(lock, instance.directory, why) || !refuse_if_made(instance, why) ||
      !make_directory(instance.log_directory(), undo, why) ||
      !provide_key(instance, undo, key, why) || !provide_password(instance, undo, password, why) ||
      !provide_certificate(instance, undo, why) ||
      !write_config(instance, *key, password, undo, why)) {
    return false;
  }
  undo.keep_all();
  of_directory.keep_all();
  return true;
}

}  // namespace orv::orvcfg
