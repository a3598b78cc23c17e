// The configuration backend as the server runs it: its handlers, the gate in front of them, and the
// way back to rest after a call that ended in mid-session.
//
// A backend handler that could not open its session keeps the backend's lock and leaves the session
// in the connection's slot; nobody else could enter after that. Such a handle is moved to a
// connection of the server's own, and a search by a caller without access is run there: its refusal
// ends the session, empties the slot and releases the lock. It must happen on the thread that ran
// the handler, before the gate opens.
//
// A handler that throws has left the backend in a state nobody knows, perhaps with its lock held.
// No handler is called after that and the process is to end.
//
// Threads: what says "gate" only by the holder of the gate; the rest from any thread.
#pragma once

#include <atomic>
#include <chrono>
#include <functional>
#include <string>
#include <string_view>

#include "ops/gate.h"
#include "slapi/owners.h"
#include "slapi/pblock.h"

namespace orv::server {

class BackendHost {
 public:
  // `backend` (its `handlers` filled by the plug-in) must outlive the host. `on_failure` is told
  // why when a handler threw; it must not throw. Throws std::bad_alloc.
  BackendHost(Backend& backend, std::function<void(std::string_view)> on_failure);

  Gate& gate() noexcept { return gate_; }
  Backend& backend() noexcept { return backend_; }
  bool has(int handler) const noexcept { return handler_of(handler) != nullptr; }

  // Runs a handler on a block for the connection in it, and brings the backend to rest.
  // `leaves_slot` tells that the handler may end with the session slot filled (add, delete,
  // modify). The gate is left open or passed on. Returns the handler's code; 52 when it threw.
  int call_inside_gate(int handler, pblock* parameters, Connection& connection, bool leaves_slot);

  // The two halves of it, for a caller with something to do before others get in.
  int call_keeping_gate(int handler, pblock* parameters, Connection& connection,
                        bool leaves_slot) noexcept;
  // Whether the handler called last could not open its session, and so did nothing. For who holds
  // the gate.
  bool could_not_open() const noexcept { return left_slot_; }
  void leave_gate() noexcept;

  // Runs a handler that needs no gate: bind and unbind. 52 without a call when a handler threw.
  int call(int handler, pblock* parameters) noexcept;

  // Whether everybody who is in `call` has left it within `patience`. Somebody may wait there for a
  // lock that a handler which threw holds for ever.
  bool calls_ended(std::chrono::milliseconds patience) noexcept;

  // Closes the gate, waits for the holder, and runs the close handler. False when the holder has
  // not left within `patience`; the close handler is then not called.
  bool close(std::chrono::milliseconds patience);

  // A handler threw.
  bool failed() const noexcept { return failed_.load(std::memory_order_acquire); }

 private:
  Handler handler_of(int number) const noexcept;
  int guarded(int number, pblock* parameters) noexcept;
  void return_to_rest(Connection& connection) noexcept;

  Backend& backend_;
  Gate gate_;
  std::function<void(std::string_view)> on_failure_;
  std::atomic<bool> failed_{false};
  std::atomic<int> in_call_{0};
  bool left_slot_ = false;  // by the handler called last; belongs to who holds the gate

  // Made beforehand, so that the way back to rest needs no memory.
  Connection rest_connection_;
  Operation rest_operation_;
  PblockPtr rest_parameters_;
};

// A block with backend, connection and operation set; null without memory.
PblockPtr make_parameters(Backend& backend, Connection& connection, Operation& operation);

}  // namespace orv::server
