#include "slapi/file_trust.h"

#include <limits.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <cstddef>
#include <optional>

#include "slapi/account.h"

namespace orv {
namespace {

constexpr int kMostLinks = 40;  // as the kernel

// What others must not be able to do with a file, and how that is taken away.
struct Rule {
  const char* what;
  mode_t forbidden;
  const char* said;
  const char* mend;
};
constexpr Rule kConfiguration{"the configuration file", S_IRWXO | S_IWGRP,
                              "can be read or changed by others", "chmod g-w,o= "};
constexpr Rule kKeyStash{"the key stash", S_IRWXG | S_IRWXO, "is open to others than its owner",
                         "chmod 600 "};

constexpr Rule kAuthority{"what says whom the server believes", S_IWGRP | S_IWOTH,
                          "can be changed by others", "chmod go-w "};

using Problem = std::optional<std::string>;

std::string folder_of(const std::string& path) {
  const std::size_t slash = path.rfind('/');
  if (slash == std::string::npos) return ".";
  return slash == 0 ? "/" : path.substr(0, slash);
}

bool is_foreign(const struct stat& status, uid_t user) {
  return status.st_uid != user && status.st_uid != 0;
}

std::string owned_by_another(const std::string& what, const struct stat& status, uid_t user) {
  return what + " belongs to " + user_name(status.st_uid) +
         ", who could put anything there; it must be " +
         (user == 0 ? "root's" : user_name(user) + "'s or root's") + " (chown)";
}

Problem problem_of_folder(const std::string& folder, uid_t user) {
  struct stat status {};
  if (::stat(folder.c_str(), &status) != 0) return std::nullopt;
  const std::string what = folder + ": this folder";
  if (is_foreign(status, user)) return owned_by_another(what, status, user);
  if ((status.st_mode & (S_IWGRP | S_IWOTH)) == 0 || (status.st_mode & S_ISVTX) != 0)
    return std::nullopt;
  return what + " can be written by others, who could put another file in place; chmod go-w " +
         folder;
}

Problem problem_of_file(const std::string& path, const struct stat& status, const Rule& rule,
                        uid_t user) {
  const std::string what = path + ": " + rule.what;
  if (!S_ISREG(status.st_mode)) return what + " is not a regular file";
  if (is_foreign(status, user)) return owned_by_another(what, status, user);
  if ((status.st_mode & rule.forbidden) == 0) return std::nullopt;
  return what + " " + rule.said + "; " + rule.mend + path;
}

// Where a link leads; "" when that cannot be told.
std::string target_of(const std::string& link) {
  std::array<char, PATH_MAX> text{};
  const ssize_t length = ::readlink(link.c_str(), text.data(), text.size());
  if (length <= 0) return "";
  const std::string target(text.data(), static_cast<std::size_t>(length));
  return target.front() == '/' ? target : folder_of(link) + "/" + target;
}

// Every name on the way to the file, and then the file.
Problem problem_at(std::string path, const Rule& rule, uid_t user) {
  struct stat status {};
  for (int links = 0; links < kMostLinks; ++links) {
    if (::lstat(path.c_str(), &status) != 0) return std::nullopt;
    if (Problem problem = problem_of_folder(folder_of(path), user)) return problem;
    if (!S_ISLNK(status.st_mode)) return problem_of_file(path, status, rule, user);
    if (is_foreign(status, user)) return owned_by_another(path + ": this link", status, user);
    path = target_of(path);
  }
  return std::nullopt;
}

}  // namespace

std::vector<std::string> distrusted_files(const std::string& config_file,
                                          const std::string& key_stash, uid_t user) {
  std::vector<std::string> problems;
  if (Problem problem = problem_at(config_file, kConfiguration, user))
    problems.push_back(*std::move(problem));
  Problem of_stash = key_stash.empty() ? std::nullopt : problem_at(key_stash, kKeyStash, user);
  if (of_stash && (problems.empty() || problems.front() != *of_stash))
    problems.push_back(*std::move(of_stash));
  return problems;
}

std::string distrust_of_authority(const std::string& file, uid_t user) {
  return problem_at(file, kAuthority, user).value_or("");
}

uid_t owner_of(const std::string& file, uid_t otherwise) noexcept {
  struct stat status {};
  return ::stat(file.c_str(), &status) == 0 ? status.st_uid : otherwise;
}

}  // namespace orv
