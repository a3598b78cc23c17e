#include <sys/stat.h>

#include <ctime>
#include <utility>

#include "auth/identities.h"

namespace orv::server {
namespace {

// What tells one state of a file from another.
struct FileSignature {
  bool there = false;
  dev_t device = 0;
  ino_t inode = 0;
  off_t size = 0;
  std::timespec modified{};
  std::timespec changed{};

  bool operator==(const FileSignature& other) const noexcept {
    return there == other.there && device == other.device && inode == other.inode &&
           size == other.size && same(modified, other.modified) && same(changed, other.changed);
  }

 private:
  static bool same(const std::timespec& a, const std::timespec& b) noexcept {
    return a.tv_sec == b.tv_sec && a.tv_nsec == b.tv_nsec;
  }
};

FileSignature signature_of(const std::string& path) noexcept {
  struct stat status {};
  if (path.empty() || stat(path.c_str(), &status) != 0) return {};
  return {true, status.st_dev, status.st_ino, status.st_size, status.st_mtim, status.st_ctim};
}

// A password that was resealed lies in the configuration file, the key to it in the stash: both
// decide what a bind proves.
struct Signature {
  FileSignature config;
  FileSignature stash;
  bool operator==(const Signature&) const noexcept = default;
};

}  // namespace

struct IdentityStore::State {
  std::string config_file;
  std::string key_stash_file;
  std::mutex mutex;  // guards what follows, and lets one thread read the files
  std::shared_ptr<const Identities> identities;
  Signature tried;  // of the last attempt, good or not: a broken file is not read for every bind

  Signature signature() const noexcept {
    return {signature_of(config_file), signature_of(key_stash_file)};
  }

  // The signature is taken first: a change during the reading shows as a difference later.
  bool read(const Signature& now, std::string& error, std::vector<std::string>& warnings) noexcept {
    auto fresh = Identities::read(config_file.c_str(), key_stash_file.c_str(), error, warnings);
    tried = now;
    if (!fresh) return false;
    identities = std::move(fresh);
    return true;
  }
};

IdentityStore::IdentityStore(std::string config_file, std::string key_stash_file)
    : state_(std::make_unique<State>()) {
  state_->config_file = std::move(config_file);
  state_->key_stash_file = std::move(key_stash_file);
}

IdentityStore::~IdentityStore() = default;

bool IdentityStore::reload(std::string& error, std::vector<std::string>& warnings) noexcept {
  const std::lock_guard lock(state_->mutex);
  return state_->read(state_->signature(), error, warnings);
}

std::shared_ptr<const Identities> IdentityStore::current() noexcept {
  const std::lock_guard lock(state_->mutex);
  const Signature now = state_->signature();
  if (!(now == state_->tried)) {
    std::string error;
    std::vector<std::string> warnings;
    state_->read(now, error, warnings);
  }
  return state_->identities;
}

}  // namespace orv::server
