// Tells the operator why operations fail: what is wrong with a configuration file that somebody
// damaged while the server runs.
//
// The backend says only that it could not open its session. So a thread of its own opens one too,
// beside the operations, and logs what it finds: file, line, column and cause, once for each state
// of the file (and of the key stash).
//
// Threads: note_failure() from any thread.
#pragma once

#include <condition_variable>
#include <mutex>
#include <string>
#include <thread>

#include "auth/file_state.h"
#include "logs.h"

namespace orv::server {

class BrokenFileReporter {
 public:
  // `logs` must outlive the object.
  BrokenFileReporter(std::string config_file, std::string key_stash_file, Logs& logs);
  ~BrokenFileReporter();
  BrokenFileReporter(const BrokenFileReporter&) = delete;
  BrokenFileReporter& operator=(const BrokenFileReporter&) = delete;

  // An operation failed in a way that a damaged file explains. Returns at once.
  void note_failure() noexcept;

 private:
  void run();
  void examine();

  const std::string config_file_;
  const std::string key_stash_file_;
  Logs& logs_;
  std::mutex mutex_;
  std::condition_variable changed_;
  bool noted_ = false;
  bool ending_ = false;
  ConfigurationState reported_;  // of the thread alone
  std::thread thread_;
};

}  // namespace orv::server
