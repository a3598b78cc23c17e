#include <algorithm>
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
  std::function<bool()> follow;
  std::atomic<std::uint64_t> generation{0};

  std::mutex pointer_mutex;  // for moments: guards the pointer only
  std::shared_ptr<const Identities> identities;

  std::mutex mutex;           // lets one thread read the files, and guards what follows
  ConfigurationState tried;   // of the last attempt, good or not
  bool failed = false;        // so did it
  std::string told;           // its cause
  Clock::time_point again{};  // when to try again then
  std::chrono::seconds pause = kFirstPause;

  ConfigurationState now() const noexcept { return {config_file, key_stash_file}; }

  // The state is taken first: a change during the reading shows as a difference later.
  bool read(const ConfigurationState& state, Clock::time_point when, std::string& error,
            std::vector<std::string>& warnings) noexcept {
    if (!(state == tried)) pause = kFirstPause;
    tried = state;
    const bool good = read_files(error, warnings);
    failed = !good || !follows();
    if (!failed) {
      pause = kFirstPause;
      told.clear();
      return true;
    }
    again = when + pause;
    pause = std::min(2 * pause, kLongestPause);
    return good;
  }

  bool read_files(std::string& error, std::vector<std::string>& warnings) noexcept {
    auto fresh = Identities::read(config_file.c_str(), key_stash_file.c_str(), error, warnings);
    if (!fresh) return false;
    {
      const std::lock_guard lock(pointer_mutex);
      identities = std::move(fresh);
    }
    generation.fetch_add(1, std::memory_order_release);
    return true;
  }

  bool follows() noexcept { return !follow || follow(); }

  // Reads when there is something new, or the time has come to try again.
  void look(Clock::time_point when, std::string& error,
            std::vector<std::string>& warnings) noexcept {
    const ConfigurationState found = now();
    const bool fresh = !(found == tried);
    if (!fresh && (!failed || when < again)) return;
    read(found, when, error, warnings);
    // What was told of the same files is not told again.
    if (!fresh && error == told) error.clear();
    if (!fresh && failed) warnings.clear();
    if (!error.empty()) remember(error);
  }

  void remember(const std::string& error) noexcept {
    try {
      told = error;
    } catch (...) {
      told.clear();  // told once more, then
    }
  }

  std::shared_ptr<const Identities> latest() noexcept {
    const std::lock_guard lock(pointer_mutex);
    return identities;
  }
};

IdentityStore::IdentityStore(std::string config_file, std::string key_stash_file,
                             IdentityReport report, std::function<bool()> follow)
    : state_(std::make_unique<State>()) {
  state_->config_file = std::move(config_file);
  state_->key_stash_file = std::move(key_stash_file);
  state_->report = std::move(report);
  state_->follow = std::move(follow);
}

IdentityStore::~IdentityStore() = default;

bool IdentityStore::reload(std::string& error, std::vector<std::string>& warnings) noexcept {
  const std::lock_guard lock(state_->mutex);
  const bool good = state_->read(state_->now(), Clock::now(), error, warnings);
  if (!good) state_->remember(error);
  return good;
}

std::shared_ptr<const Identities> IdentityStore::current(Clock::time_point now) noexcept {
  std::string error;
  std::vector<std::string> warnings;
  {
    const std::lock_guard lock(state_->mutex);
    state_->look(now, error, warnings);
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
