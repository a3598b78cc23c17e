// The backends of the server and the functions that they offer to one another.
//
// The server registers its backends, and what they offer, before its listeners open, and takes them
// out after the last operation; lookups from handlers are in services.h (`select_backend_opt`,
// `getAllPluginFuncs`). Nothing here is owned: a backend outlives its registration.
//
// Threads: thread-safe; nothing blocks for longer than a lookup takes. Nothing throws.
#pragma once

#include "slapi/services.h"

namespace orv {

// Makes a backend known under its suffixes, which are in normal form. 0; 80 null, without suffixes,
// or one of them is another backend's; 90.
int register_backend(Backend* backend) noexcept;

// Forgets a backend and what it offers; lists that were handed out are gone then. Unknown: a no-op.
void unregister_backend(Backend* backend) noexcept;

// Adds to what a registered backend offers under `number`, behind what it offers there already.
// 0; 80 an unknown backend or a null function; 90.
int register_plugin_function(Backend* backend, int number, PluginFunction function) noexcept;

}  // namespace orv
