#include <pthread.h>

#include <cstdio>

#include "cfg/result_codes.h"
#include "config_session.h"
#include "function_ids.h"
#include "handlers.h"
#include "slapi/trace.h"

namespace orv {
namespace {

constexpr const char* kNotLocked = "Could not lock configMutex\n";
constexpr const char* kNotUnlocked = "Could not unlock config mutex\n";
constexpr const char* kMakingHandle = "Initing config32 handle \n";
constexpr const char* kLibraryThrew = "CFG32 Threw an exception binding to the config file!\n";
constexpr const char* kNoHandle = "unable to init ! \n";
constexpr const char* kFileName = "Setting cfg file name to %s\n";
constexpr const char* kKeyStash = "Setting in-memory config key stash file\n";
constexpr const char* kBinding = "Binding to cfg32 \n";
constexpr const char* kNotBound = "unable to bind! \n";
constexpr const char* kReason = "%s\n";
constexpr const char* kReasonFile = "Error using filename : %s\n";
constexpr const char* kEntering = "entering config_back_bind...\n";
// On standard error, for the operator who has no trace.
constexpr const char* kBindFailed = "Binding to config failed! rc = %d \n";
constexpr const char* kBindFailedHint = "Turn on ldtrc for detail errors\n";

constexpr int kBindFlags = 128;

void set_file_option(const ldtr_function_local& trace, _CFG* handle, int option, const char* path) {
  if (path == nullptr) return;
  trace.debug(trace::detail, kFileName, path);
  cfg_set_option(handle, option, path);
}

void name_files(const ldtr_function_local& trace, _CFG* handle, const ConfigBackendPrivate& state) {
  set_file_option(trace, handle, kCfgOptConfigFile, state.config_file);
  // Under the text of the configuration file's name, and twice with the same value: the library and
  // readers of the trace see it so.
  set_file_option(trace, handle, kCfgOptSaveFile, state.save_file);
  set_file_option(trace, handle, kCfgOptSaveFile, state.save_file);
  if (state.key_stash_file != nullptr) {
    trace.debug(trace::detail, kKeyStash);  // without the name: where the key lies is not told
    cfg_set_option(handle, kCfgOptKeyStashFile, state.key_stash_file);
  }
}

void report_failed_bind(const ldtr_function_local& trace, _CFG* handle, int rc) {
  std::fprintf(stderr, kBindFailed, rc);
  std::fprintf(stderr, "%s", kBindFailedHint);
  trace.debug(trace::detail, kNotBound);

  cfg_set_option(handle, kCfgOptDiagnostics, 1);
  cfg_set_option(handle, kCfgOptDiagnosticsFile, 1);
  const char* file_name = nullptr;
  cfg_get_option(handle, kCfgOptConfigFile, &file_name);
  if (!ldtr_function_local::debugging()) return;
  trace.debug(trace::detail, kReason, cfg_dump_exception(handle));
  trace.debug(trace::detail, kReasonFile, file_name != nullptr ? file_name : "(null)");
}

}  // namespace

int init_cfg_ld(Connection* connection, ConfigBackendPrivate* state) {
  ldtr_function_local trace(function_id::init_cfg_ld);

  // 1. The lock: from here on the file belongs to this operation.
  if (pthread_mutex_lock(&state->configMutex) != 0) {
    trace.debug(trace::info, kNotLocked);
    return trace.exit(result::other);
  }

  // 2. A handle that an earlier operation left is used as it is, even one that was never bound.
  if (connection->config_session != nullptr) return trace.exit(result::success);

  // 3. A handle. Other implementations of the library throw here, or give null.
  trace.debug(trace::detail, kMakingHandle);
  try {
    connection->config_session = cfg_init(nullptr, 0);
  } catch (...) {
    // Unlocked without `config_end`: no record is left, and a failure is not told.
    trace.debug(trace::error, kLibraryThrew);
    pthread_mutex_unlock(&state->configMutex);
    return trace.exit(result::operations_error);
  }
  _CFG* const handle = connection->config_session;
  if (handle == nullptr) {
    trace.debug(trace::detail, kNoHandle);
    return trace.exit(result::no_memory);  // still locked
  }

  // 4. The files; only an unbound handle takes them.
  name_files(trace, handle, *state);

  // 5. The file is read and checked.
  trace.debug(trace::detail, kBinding);
  const int rc = cfg_bind_s(handle, nullptr, nullptr, kBindFlags);
  if (rc != 0) {
    report_failed_bind(trace, handle, rc);
    return trace.exit(result::operations_error);  // still locked, the handle stays in the slot
  }
  return trace.exit(result::success);
}

void config_end(ConfigBackendPrivate* state) {
  const ldtr_function_local trace(function_id::config_end);
  if (pthread_mutex_unlock(&state->configMutex) != 0) trace.debug(trace::info, kNotUnlocked);
}

void OperationSession::close() {
  cfg_unbind(connection_->config_session);
  connection_->config_session = nullptr;
  config_end(state_);
}

int config_back_bind(pblock* pb) {
  ldtr_function_local trace(function_id::config_back_bind);

  // 1. The parties.
  Backend* backend = nullptr;
  Connection* connection = nullptr;
  Operation* operation = nullptr;
  slapi_pblock_get(pb, parameter::backend, &backend);
  slapi_pblock_get(pb, parameter::connection, &connection);
  slapi_pblock_get(pb, parameter::operation, &operation);

  // 2. Nobody binds here, whatever the name and the credentials.
  trace.debug(trace::info, kEntering);
  send_ldap_result(connection, operation, result::invalid_credentials, nullptr, nullptr);
  return trace.exit(result::invalid_credentials);
}

}  // namespace orv
