// What the backend keeps between operations: where the configuration file is, and the lock that
// serialises all work on it. Beside it only a mark outlives a call: that this process has reviewed
// the pass-through entries of the file (`verifyPassthroughServerEntry`).
#pragma once

#include <pthread.h>

namespace orv {

// Made by `config_back_init` (zero-filled, from calloc) and found in `Backend::private_data` from
// then on. It is never released: the texts are read by every session until the process ends.
struct ConfigBackendPrivate {
  const char* config_file;      // the path given at start or, of a link, its target; option 1005
  const char* save_file;        // the same path followed by ".save"; option 1006
  const char* key_stash_file;   // the server's text, or null; option 1007
  pthread_mutex_t configMutex;  // held from `init_cfg_ld` to `config_end`; default attributes
};

}  // namespace orv
