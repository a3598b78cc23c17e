#include <pthread.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <memory>

#include "cfg/result_codes.h"
#include "config_private.h"
#include "function_ids.h"
#include "handlers.h"
#include "slapi/codepage.h"
#include "slapi/owners.h"
#include "slapi/strings.h"
#include "slapi/trace.h"
#include "source_name.h"

namespace orv {
namespace {

constexpr std::size_t kPathBuffer = 4096;
constexpr std::size_t kLongestLink = 4086;  // of a longer link only that much is read
constexpr const char* kSaveSuffix = ".save";
constexpr std::size_t kSaveSuffixRoom = 6;  // with the NUL

// Where the trace says that a bounded copy overflowed. Fixed numbers, by which operators know the
// three places; they do not follow the source.
constexpr int kCopyOfPath = 137;
constexpr int kCopyOfSaveName = 165;
constexpr int kAppendOfSuffix = 175;

constexpr const char* kReadlinkDone = "Readlink rc: %i\nPath:%s\n";
constexpr const char* kNotALink = "File not a link.\n";
constexpr const char* kTextOverflow = "kelstr error near %s:%d\n";
constexpr const char* kReadlinkFailed = "config_back_init: Readlink error rc= %d\n";
constexpr const char* kSaveFile = "Save file name: %s\n";

using StatePtr = std::unique_ptr<ConfigBackendPrivate, FreeDeleter>;

// A start that fails releases the state without destroying its mutex: nobody has locked it, and
// such a mutex holds nothing.
StatePtr make_state(const BackendStartup& startup) {
  StatePtr state(static_cast<ConfigBackendPrivate*>(std::calloc(1, sizeof(ConfigBackendPrivate))));
  if (state == nullptr) return state;
  pthread_mutex_init(&state->configMutex, nullptr);
  state->config_file = startup.config_file;  // borrowed until the resolved path takes its place
  return state;
}

MallocText zeroed_text(std::size_t size) {
  return MallocText(static_cast<char*>(std::calloc(size, 1)));
}

int overflow(const ldtr_function_local& trace, int place) {
  trace.debug(trace::info, kTextOverflow, source_name(__FILE__), place);
  return result::operations_error;
}

// Puts the file that `configured` names into `path`: the target when it is a link (one level, as it
// is written in the link), else itself. `length` receives the length.
int resolve_link(const ldtr_function_local& trace, const char* configured, char* path,
                 std::size_t& length) {
  const ssize_t read = readlink(configured, path, kLongestLink);
  const int error = errno;  // before anything else can change it
  int shown = static_cast<int>(read);
  trace.debug(trace::detail, kReadlinkDone, shown, path);

  if (error == EINVAL && shown < 1) {
    trace.debug(trace::detail, kNotALink);
    const std::size_t copied = kel_strlcpy(path, configured, kPathBuffer);
    if (copied >= kPathBuffer) return overflow(trace, kCopyOfPath);
    shown = static_cast<int>(copied);
  }
  if (shown < 1) {
    trace.debug(trace::info, kReadlinkFailed, shown);
    return result::other;
  }
  length = static_cast<std::size_t>(shown);
  return result::success;
}

// Makes the name of the save file in `save`.
int derive_save_name(const ldtr_function_local& trace, const char* path, std::size_t length,
                     MallocText& save) {
  const std::size_t size = length + kSaveSuffixRoom;
  save = zeroed_text(size);
  if (save == nullptr) return result::no_memory;
  if (kel_strlcpy(save.get(), path, size) >= size) return overflow(trace, kCopyOfSaveName);
  if (kel_strlcat(save.get(), kSaveSuffix, size) >= size) return overflow(trace, kAppendOfSuffix);
  trace.debug(trace::detail, kSaveFile, save.get());
  return result::success;
}

}  // namespace

int config_back_init(Backend* backend) {
  ldtr_function_local trace(function_id::config_back_init);

  // 1. What the server left for the start.
  auto* startup = static_cast<BackendStartup*>(backend->private_data);

  // 2. The state, with its lock. A start that fails releases the path, the state and the name of
  // the save file: the reverse of the order in which they are declared.
  MallocText save;
  StatePtr state = make_state(*startup);
  if (state == nullptr) {
    // The one failure without a state after which the start-up record is gone.
    std::free(startup);
    return trace.exit(result::no_memory);
  }

  // 3. The file. Failures here and in 4. leave the start-up record where it is: it still says what
  // to start.
  MallocText path = zeroed_text(kPathBuffer);
  if (path == nullptr) return trace.exit(result::no_memory);
  std::size_t length = 0;
  int rc = resolve_link(trace, startup->config_file, path.get(), length);
  if (rc == result::other) state.reset();  // no file: here alone the state goes before the path
  if (rc != 0) return trace.exit(rc);

  // 4. The save file beside it.
  rc = derive_save_name(trace, path.get(), length, save);
  if (rc != 0) return trace.exit(rc);

  // 5. The state takes the place of the start-up record.
  state->config_file = path.release();
  state->save_file = save.release();
  state->key_stash_file = startup->key_stash_file;
  backend->private_data = state.release();

  // 6. The code page. Its failure is the result, but the instance is there.
  rc = initIconvHandle();

  // 7. The start-up record was the server's gift.
  std::free(startup);
  return trace.exit(rc);
}

}  // namespace orv
