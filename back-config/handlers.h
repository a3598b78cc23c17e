// What the server calls: the entry point of the plug-in and the handlers that it registers.
//
// Handlers are called from the server's worker threads: start and close once for each instance,
// unbind once for each connection, the others once for each operation. An operation's handler reads
// its arguments from the parameter block, sends its own result to the client, and returns the LDAP
// code of the operation; start, close and unbind send nothing, and where others send nothing is
// said below. Search, add, delete, modify and unbind take `configMutex` for as long as they work
// with a session, and keep it only where that is said below; the other handlers take no lock.
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
// On failure the process cannot serve this backend, and `backend->private_data` is not to be
// touched any more, not even to release it: the result does not tell whether it holds the start-up
// record (1, 80, most cases of 90), a start-up record that has been released (90 without memory for
// the state) or the state (the codes of `initIconvHandle`, which may be the same numbers).
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

// Answers a search from the configuration file (see config_search.h); to a client who is gone
// nothing is sent and the result is 0. Releases `configMutex` on every other path, even when it was
// never taken.
int config_back_search(pblock* pb);

// Adds the entry in `pb` to the configuration file (see config_add.h for the rules). Rewrites the
// entry: the roles of a member of the administrative group are settled in it. Always answers when
// connection and operation are known. When the session cannot be opened the slot and `configMutex`
// stay as `init_cfg_ld` left them: the server has to bring the backend back to rest.
int config_back_add(pblock* pb);

// Removes an entry from the configuration file (see config_delete.h for who may). While persistent
// searches run, the entry as it was is stored as parameter -157 in the operation's block, also when
// the delete then fails; it is the server's to release. When the session cannot be opened
// **nothing is sent**, and slot and lock stay as in `config_back_add`. Otherwise answers when
// connection and operation are known.
int config_back_delete(pblock* pb);

// Changes an entry of the configuration file (see config_modify.h for the rules). Takes the list of
// modifications over: it may be rewritten, is released here and its parameter set to null, unless
// it could not be read. Always answers when connection and operation are known, with a text where a
// rule has one. When the session cannot be opened, slot and lock stay as in `config_back_add`. What
// was made of the list for the file **is not released after a refusal or a failure**; it is made as
// soon as schema and authority flags let pass, before roles are asked: the server bounds what one
// caller can so take.
int config_back_modify(pblock* pb);

}  // namespace orv
