// What the server calls: the entry point of the plug-in and the handlers that it registers.
//
// Handlers are called from the server's worker threads, one call for each client operation. Each
// reads its arguments from the parameter block, sends its own result to the client, and returns the
// LDAP code of the operation. All but bind and the instance handlers work under `configMutex`.
#pragma once

#include "slapi/pblock.h"

// Stores the handlers in `pb` and announces the ManageDsaIT control. 0, or the result of the store
// that failed: the stores after it are then not made, and the control is announced nevertheless
// (except on a server of kind 3, which never gets it).
extern "C" [[gnu::visibility("default")]] int config_backend_init(orv::pblock* pb);

namespace orv {

// Starts the instance: replaces the `BackendStartup` in `backend->private_data` by a
// `ConfigBackendPrivate`. Takes the backend's record, not a parameter block.
//   0   started; the start-up record has been released
//   1   the path of the configuration file does not fit
//   80  the path cannot be looked at
//   90  no memory
//   or the result of `initIconvHandle`; the instance state is then in place nevertheless.
// On failure the process cannot serve this backend. The start-up record is still there after 1, 80
// and 90, except when not even the instance state could be allocated.
int config_back_init(Backend* backend);

// Ends the instance: destroys `configMutex`. No operation may be running or come later. The
// instance state itself stays. 0; 17 no backend, or one that was never started; -1 `pb` has no
// backend.
int config_back_close(pblock* pb);

// Refuses: nobody binds to the configuration. Always 49; takes no lock.
int config_back_bind(pblock* pb);

// Drops a session that an operation left on the connection. To be called once for each connection:
// the slot keeps its (dead) handle. 0 nothing to drop; 80 the lock cannot be taken; otherwise the
// result of `cfg_unbind`.
int config_back_unbind(pblock* pb);

// Answers a search from the configuration file (see config_search.h). Releases `configMutex` on
// every path but that of a client who is gone, even when it was never taken.
int config_back_search(pblock* pb);

// Not offered: these answer 53 (unwilling to perform).
int config_back_add(pblock* pb);
int config_back_modify(pblock* pb);
int config_back_delete(pblock* pb);

}  // namespace orv
