// What tells one state of the configuration from another, without reading it.
//
// Threads: values.
#pragma once

#include <sys/types.h>

#include <ctime>
#include <string>

namespace orv::server {

// One file. When it is not there, the folder stands in: somebody who takes a file away changes
// that.
class FileState {
 public:
  FileState() = default;
  explicit FileState(const std::string& path) noexcept;  // "" is a state of its own
  bool operator==(const FileState& other) const noexcept;

 private:
  bool there_ = false;
  dev_t device_ = 0;
  ino_t inode_ = 0;
  off_t size_ = 0;
  std::timespec modified_{};
  std::timespec changed_{};
};

// A password that was sealed anew lies in the configuration file, the key to it in the stash: both
// decide what a bind proves and whether a session opens.
class ConfigurationState {
 public:
  ConfigurationState() = default;
  ConfigurationState(const std::string& config_file, const std::string& key_stash_file) noexcept
      : config_(config_file), stash_(key_stash_file) {}
  bool operator==(const ConfigurationState&) const noexcept = default;

 private:
  FileState config_;
  FileState stash_;
};

}  // namespace orv::server
