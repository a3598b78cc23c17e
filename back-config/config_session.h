// The session on the configuration file: one for each operation, one operation at a time.
//
// `init_cfg_ld` takes `configMutex` and puts a bound session handle into the connection's slot; the
// operation works with it; at its end the handle is unbound, the slot cleared and the lock released
// with `config_end`.
#pragma once

#include "config_private.h"
#include "slapi/connection.h"

namespace orv {

// Takes `configMutex` (blocking) and makes sure that the connection holds a session.
//   0   locked; the slot holds a bound handle, or one that an earlier operation left there
//   80  the lock cannot be taken; not locked
//   1   the library threw: not locked, slot empty; or the file cannot be bound: **locked**, and the
//       unbound handle is in the slot
//   90  no handle: **locked**, slot empty
// The file that cannot be bound is told on standard error, whatever the trace settings.
int init_cfg_ld(Connection* connection, ConfigBackendPrivate* state);

// Releases `configMutex`.
void config_end(ConfigBackendPrivate* state);

// The session of one operation, as verbs. It does nothing by itself when it goes out of scope: when
// a handler gives the lock back, and when it does not, is part of what the handler does.
class OperationSession {
 public:
  OperationSession(Connection* connection, ConfigBackendPrivate* state) noexcept
      : connection_(connection), state_(state) {}
  OperationSession(const OperationSession&) = delete;
  OperationSession& operator=(const OperationSession&) = delete;

  // `init_cfg_ld`, with its results.
  int open() { return init_cfg_ld(connection_, state_); }

  // The handle in the connection's slot; null before `open`.
  [[nodiscard]] _CFG* handle() const noexcept { return connection_->config_session; }

  // Unbinds the handle, empties the slot and unlocks. After an `open` that gave 0.
  void close();

  // The same, also when `open` failed or was never called. A caller that holds no lock so releases
  // the lock of whoever does: the server therefore admits one operation at a time. In return what a
  // failed operation left behind is cleaned away by a search that is refused: the lock by any, the
  // handle by one on its connection. One that is let in would wait for that lock for ever.
  void release_without_taking() { close(); }

 private:
  Connection* connection_;
  ConfigBackendPrivate* state_;
};

}  // namespace orv
