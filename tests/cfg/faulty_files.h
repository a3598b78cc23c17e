// File calls that fail on demand, or stop, or tell what was called.
#pragma once

#include <cerrno>
#include <functional>
#include <string>
#include <vector>

#include "file_calls.h"

namespace orv::cfg_test {

// Every call passes `before_call`, which may let it fail with an errno.
class ObservedFiles : public cfg::FileCalls {
 public:
  // 0 lets the call happen.
  virtual int before_call(const char* name, const std::string& subject) = 0;

  int resolve(const char* path, std::string& resolved) override {
    return refused("resolve", path) ? -1 : FileCalls::resolve(path, resolved);
  }
  int open(const char* path, int flags, mode_t mode) override {
    return refused("open", path) ? -1 : FileCalls::open(path, flags, mode);
  }
  ssize_t read(int file, void* to, std::size_t size) override {
    return refused("read") ? -1 : FileCalls::read(file, to, size);
  }
  ssize_t write(int file, const void* from, std::size_t size) override {
    return refused("write") ? -1 : FileCalls::write(file, from, size);
  }
  // What is not flushed is not lost unless the machine stops.
  int flush(int /*file*/) override { return refused("flush") ? -1 : 0; }
  int close(int file) override {
    const bool fails = refused("close");
    const int rc = FileCalls::close(file);  // the descriptor is gone in any case
    return fails ? -1 : rc;
  }
  int status(int file, struct stat& status) override {
    return refused("status") ? -1 : FileCalls::status(file, status);
  }
  int status_of(const char* path, struct stat& status) override {
    return refused("status_of", path) ? -1 : FileCalls::status_of(path, status);
  }
  int set_owner(int file, uid_t owner, gid_t group) override {
    return refused("set_owner") ? -1 : FileCalls::set_owner(file, owner, group);
  }
  int set_mode(int file, mode_t mode) override {
    return refused("set_mode") ? -1 : FileCalls::set_mode(file, mode);
  }
  int copy_access_list(int from, int to) override {
    return refused("copy_access_list") ? -1 : FileCalls::copy_access_list(from, to);
  }
  int link(const char* from, const char* to) override {
    return refused("link", to) ? -1 : FileCalls::link(from, to);
  }
  int rename(const char* from, const char* to) override {
    return refused("rename", to) ? -1 : FileCalls::rename(from, to);
  }
  int exchange(const char* a, const char* b) override {
    return refused("exchange", a) ? -1 : FileCalls::exchange(a, b);
  }
  int remove(const char* path) override {
    return refused("remove", path) ? -1 : FileCalls::remove(path);
  }
  int lock(int file) override { return refused("lock") ? -1 : FileCalls::lock(file); }
  void pause() override { refused("pause"); }
  int hold_writers_off(int file) override {
    return refused("hold_writers_off") ? -1 : FileCalls::hold_writers_off(file);
  }
  void let_writers_in(int file) override {
    refused("let_writers_in");
    FileCalls::let_writers_in(file);
  }
  void pause_for_writer() override { refused("pause_for_writer"); }

 private:
  bool refused(const char* name, const std::string& subject = {}) {
    const int error = before_call(name, subject);
    if (error != 0) errno = error;
    return error != 0;
  }
};

// What the file system of a test can do.
struct Abilities {
  bool exchange = true;
  bool link = true;
};

// Lets one call fail: the n-th of all, once, or with all of its kind, or with all that follow.
class FaultyFiles : public ObservedFiles {
 public:
  enum class Lasting { once, kind, all };
  struct Call {
    std::string name;
    std::string subject;
  };

  explicit FaultyFiles(Abilities abilities = {}) : abilities_(abilities) {}

  void fail_at(std::size_t call, int error, Lasting lasting) {
    at_ = call;
    error_ = error;
    lasting_ = lasting;
  }
  [[nodiscard]] const std::vector<Call>& calls() const { return calls_; }
  [[nodiscard]] bool has_failed() const { return has_failed_; }

  int before_call(const char* name, const std::string& subject) override {
    const std::size_t number = calls_.size();
    calls_.push_back({name, subject});
    if (fails(number, name)) {
      has_failed_ = true;
      return error_;
    }
    if (!abilities_.exchange && calls_.back().name == "exchange") return EINVAL;
    if (!abilities_.link && calls_.back().name == "link") return EPERM;
    return 0;
  }

 private:
  [[nodiscard]] bool fails(std::size_t number, const std::string& name) const {
    if (error_ == 0 || number < at_) return false;
    if (number == at_ || lasting_ == Lasting::all) return true;
    return lasting_ == Lasting::kind && name == calls_[at_].name;
  }

  Abilities abilities_;
  std::vector<Call> calls_;
  std::size_t at_ = 0;
  int error_ = 0;
  Lasting lasting_ = Lasting::once;
  bool has_failed_ = false;
};

// Lets all calls of one kind fail, or those of them that are about a certain name.
class RefusedCalls : public ObservedFiles {
 public:
  RefusedCalls(std::string name, int error, std::string part_of_subject = {})
      : name_(std::move(name)), error_(error), part_(std::move(part_of_subject)) {}

  int before_call(const char* name, const std::string& subject) override {
    return name == name_ && subject.find(part_) != std::string::npos ? error_ : 0;
  }

 private:
  std::string name_;
  int error_;
  std::string part_;
};

// Runs something of the test's own before the n-th call of one kind (counted from 0).
class InterposedFiles : public ObservedFiles {
 public:
  InterposedFiles(std::string name, int number, std::function<void()> action)
      : name_(std::move(name)), number_(number), action_(std::move(action)) {}

  int before_call(const char* name, const std::string& /*subject*/) override {
    if (name_ == name && number_-- == 0) action_();
    return 0;
  }

 private:
  std::string name_;
  int number_;
  std::function<void()> action_;
};

}  // namespace orv::cfg_test
