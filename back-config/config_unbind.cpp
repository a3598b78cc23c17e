#include <pthread.h>

#include "cfg/result_codes.h"
#include "config_session.h"
#include "function_ids.h"
#include "handlers.h"
#include "slapi/trace.h"

namespace orv {
namespace {

constexpr const char* kNotLocked = "Could not lock configMutex\n";

}  // namespace

int config_back_unbind(pblock* pb) {
  ldtr_function_local trace(function_id::config_back_unbind);

  // 1. The parties.
  Backend* backend = nullptr;
  Connection* connection = nullptr;
  slapi_pblock_get(pb, parameter::backend, &backend);
  slapi_pblock_get(pb, parameter::connection, &connection);

  // 2. Most connections never used the backend: those take no lock.
  if (connection->config_session == nullptr) return trace.exit(result::success);

  // 3. The lock, as for every work on a session.
  auto* state = static_cast<ConfigBackendPrivate*>(backend->private_data);
  if (pthread_mutex_lock(&state->configMutex) != 0) {
    trace.debug(trace::info, kNotLocked);
    return trace.exit(result::other);
  }

  // 4. The slot keeps the dead handle: the connection ends here and nobody looks at it again.
  const int rc = cfg_unbind(connection->config_session);
  config_end(state);
  return trace.exit(rc);
}

}  // namespace orv
