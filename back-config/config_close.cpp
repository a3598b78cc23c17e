#include <pthread.h>

#include "cfg/result_codes.h"
#include "config_private.h"
#include "function_ids.h"
#include "handlers.h"
#include "slapi/trace.h"

namespace orv {
namespace {

constexpr const char* kClosing = "calling config_close...\n";
constexpr const char* kNoParameter = "config_close: Could not get backend\n";
constexpr const char* kNullBackend = "config_close: An invalid Backend (NULL) is encountered\n";
constexpr const char* kNeverStarted =
    "config_close: The Backend private pointer has not been initialized\n";

constexpr int kUnreadable = -1;
constexpr int kNothingToClose = 17;

}  // namespace

int config_back_close(pblock* pb) {
  ldtr_function_local trace(function_id::config_back_close);
  trace.debug(trace::info, kClosing);

  // 1. The backend, and the instance that was started on it.
  Backend* backend = nullptr;
  if (slapi_pblock_get(pb, parameter::backend, &backend) != 0) {
    trace.debug(trace::info, kNoParameter);
    return trace.exit(kUnreadable);
  }
  if (backend == nullptr) {
    trace.debug(trace::close, kNullBackend);
    return trace.exit(kNothingToClose);
  }
  if (backend->private_data == nullptr) {
    trace.debug(trace::close, kNeverStarted);
    return trace.exit(kNothingToClose);
  }

  // 2. The lock. The state and its texts stay: whoever still reads them reads something valid. That
  // the lock is busy is not looked at: nothing could be done about it, and no operation may come.
  pthread_mutex_destroy(&static_cast<ConfigBackendPrivate*>(backend->private_data)->configMutex);
  return trace.exit(result::success);
}

}  // namespace orv
