// A backend that does what a test says: handlers stored in a parameter block as a plug-in would.
#pragma once

#include <atomic>
#include <condition_variable>
#include <functional>
#include <mutex>
#include <string>
#include <vector>

#include "ops/gate.h"
#include "slapi/owners.h"
#include "slapi/pblock.h"

namespace orv::server::test {

// One at a time in a process: handlers are plain functions.
class FakeBackend {
 public:
  FakeBackend();
  ~FakeBackend();

  Backend& record() { return record_; }

  // What the handlers do; each returns the handler's result. Called on the handler's thread. Unless
  // a test says otherwise a search finds nothing, a change is refused with 53 and a bind with 49.
  std::function<int(pblock*)> on_search;
  std::function<int(pblock*)> on_change;  // add, delete and modify
  std::function<int(pblock*)> on_bind;
  std::function<int(pblock*)> on_unbind;

  // How often each handler was called, by its number.
  int calls(int handler) const;
  int closed() const { return closes_.load(); }
  // The most calls that were inside search, add, delete, modify or close at one time.
  int most_inside() const { return most_inside_.load(); }

 private:
  template <int number>
  static int handle(pblock* parameters);
  int run(int number, pblock* parameters);

  const char* suffixes_[2] = {"CN=CONFIGURATION", nullptr};
  PblockPtr handlers_;
  Backend record_;
  mutable std::mutex mutex_;
  std::vector<int> calls_;
  std::atomic<int> closes_{0};
  std::atomic<int> inside_{0};
  std::atomic<int> most_inside_{0};
};

// The operation's arguments, for handlers.
Connection* connection_of(pblock* parameters);
Operation* operation_of(pblock* parameters);
std::string target_of(pblock* parameters);

// An entry with a DN and a few values of cn.
EntryPtr make_test_entry(const std::string& dn, std::size_t value_bytes = 8);

// Sends one entry as a search handler does.
int send_test_entry(pblock* parameters, entry& e);
// Sends the final result of a search, or of another operation; the code.
int finish_search(pblock* parameters, int code, int entries);
int finish_change(pblock* parameters, int code);

// At the gate in front of the backend, somebody who would not wait; and whether he would get in.
Gate::Entry enter_at_once(Gate& gate);
bool is_open(Gate& gate);

// Something that happens once, and that others wait for.
class Event {
 public:
  void happen();
  bool wait();  // false after ten seconds
 private:
  std::mutex mutex_;
  std::condition_variable changed_;
  bool happened_ = false;
};

}  // namespace orv::server::test
