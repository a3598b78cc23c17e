#include <atomic>
#include <cstdint>
#include <utility>

#include "auth/file_state.h"
#include "auth/identities.h"

namespace orv::server {

struct IdentityStore::State {
  std::string config_file;
  std::string key_stash_file;
  IdentityReport report;
  std::atomic<std::uint64_t> generation{0};

  std::mutex pointer_mutex;  // for moments: guards the pointer only
  std::shared_ptr<const Identities> identities;

  std::mutex mutex;  // lets one thread read the files, and guards what follows
  ConfigurationState
      tried;  // of the last attempt, good or not: a broken file is not read for every bind

  ConfigurationState now() const noexcept { return {config_file, key_stash_file}; }

  // The state is taken first: a change during the reading shows as a difference later.
  bool read(const ConfigurationState& state, std::string& error,
            std::vector<std::string>& warnings) noexcept {
    auto fresh = Identities::read(config_file.c_str(), key_stash_file.c_str(), error, warnings);
    tried = state;
    if (!fresh) return false;
    {
      const std::lock_guard lock(pointer_mutex);
      identities = std::move(fresh);
    }
    generation.fetch_add(1, std::memory_order_release);
    return true;
  }

  std::shared_ptr<const Identities> latest() noexcept {
    const std::lock_guard lock(pointer_mutex);
    return identities;
  }
};

IdentityStore::IdentityStore(std::string config_file, std::string key_stash_file,
                             IdentityReport report)
    : state_(std::make_unique<State>()) {
  state_->config_file = std::move(config_file);
  state_->key_stash_file = std::move(key_stash_file);
  state_->report = std::move(report);
}

IdentityStore::~IdentityStore() = default;

bool IdentityStore::reload(std::string& error, std::vector<std::string>& warnings) noexcept {
  const std::lock_guard lock(state_->mutex);
  return state_->read(state_->now(), error, warnings);
}

std::shared_ptr<const Identities> IdentityStore::current() noexcept {
  std::string error;
  std::vector<std::string> warnings;
  {
    const std::lock_guard lock(state_->mutex);
    const ConfigurationState now = state_->now();
    if (!(now == state_->tried)) state_->read(now, error, warnings);
  }
  if (state_->report && (!error.empty() || !warnings.empty())) state_->report(error, warnings);
  return state_->latest();
}

std::shared_ptr<const Identities> IdentityStore::latest() const noexcept {
  return state_->latest();
}

std::uint64_t IdentityStore::generation() const noexcept {
  return state_->generation.load(std::memory_order_acquire);
}

}  // namespace orv::server
