#include "auth/sasl_library.h"

#include <sasl/sasl.h>
#include <sasl/saslplug.h>

#include <algorithm>
#include <array>
#include <cstring>
#include <memory>
#include <mutex>
#include <new>
#include <utility>

#include "auth/sasl_callbacks.h"
#include "auth/sasl_memory.h"

namespace orv::server {
namespace {

// ---- Mutexes

void* make_mutex() {
  void* const memory = allocate_for_sasl(sizeof(std::mutex));
  return memory == nullptr ? nullptr : new (memory) std::mutex;
}

int lock_mutex(void* mutex) {
  static_cast<std::mutex*>(mutex)->lock();
  return SASL_OK;
}

int unlock_mutex(void* mutex) {
  static_cast<std::mutex*>(mutex)->unlock();
  return SASL_OK;
}

void free_mutex(void* mutex) {
  if (mutex == nullptr) return;
  std::destroy_at(static_cast<std::mutex*>(mutex));
  release_of_sasl(mutex);
}

// ---- Options, instead of a configuration file

struct Option {
  std::string_view name;
  const char* value;
};

constexpr Option kOptions[] = {
    {"auxprop_plugin", kPasswordSource},
    {"pwcheck_method", "auxprop"},
    {"mech_list", "GSSAPI SCRAM-SHA-256 DIGEST-MD5"},
    // What a client proved once does not spare it a proof next time.
    {"reauth_timeout", "0"},
    // RFC 7677, 4 asks for at least 4096, and for more where that can be afforded.
    {"scram_iteration_counter", "15000"},
};

int get_option(void*, const char*, const char* option, const char** value, unsigned* length) {
  for (const Option& known : kOptions) {
    if (known.name != option) continue;
    *value = known.value;
    if (length != nullptr) *length = static_cast<unsigned>(std::strlen(known.value));
    return SASL_OK;
  }
  return SASL_FAIL;
}

int get_plugin_folder(void*, const char** path) {
  *path = ORV_SASL_PLUGINS;
  return SASL_OK;
}

int get_configuration_folder(void*, char** path) {
  *path = static_cast<char*>(allocate_zeroed_for_sasl(1, 1));
  return *path == nullptr ? SASL_NOMEM : SASL_OK;
}

constexpr std::string_view kPlugins[] = {"libdigestmd5.", "libscram.", "libgssapiv2."};

int check_file(void*, const char* file, sasl_verify_type_t type) {
  if (type != SASL_VRFY_PLUGIN) return SASL_CONTINUE;
  std::string_view name(file);
  name.remove_prefix(name.rfind('/') + 1);
  const bool wanted =
      std::any_of(std::begin(kPlugins), std::end(kPlugins),
                  [name](std::string_view plugin) { return name.starts_with(plugin); });
  return wanted ? SASL_OK : SASL_CONTINUE;
}

// Strangers cause most of what the library would log; what a step failed for is asked of it.
int ignore_message(void*, int, const char*) {
  return SASL_OK;
}

const sasl_callback_t* callbacks() {
  static const std::array<sasl_callback_t, 6> list = {
      sasl_callback_of(SASL_CB_GETOPT, get_option, nullptr),
      sasl_callback_of(SASL_CB_GETPATH, get_plugin_folder, nullptr),
      sasl_callback_of(SASL_CB_GETCONFPATH, get_configuration_folder, nullptr),
      sasl_callback_of(SASL_CB_VERIFYFILE, check_file, nullptr),
      sasl_callback_of(SASL_CB_LOG, ignore_message, nullptr),
      {SASL_CB_LIST_END, nullptr, nullptr},
  };
  return list.data();
}

}  // namespace

std::unique_ptr<SaslLibrary> SaslLibrary::open(std::string& error) {
  sasl_set_alloc(allocate_for_sasl, allocate_zeroed_for_sasl, reallocate_for_sasl, release_of_sasl);
  sasl_set_mutex(make_mutex, lock_mutex, unlock_mutex, free_mutex);
  int code = sasl_server_init(callbacks(), nullptr);
  // From here on its destructor ends what was begun.
  std::unique_ptr<SaslLibrary> library(code == SASL_OK ? new SaslLibrary : nullptr);
  if (code == SASL_OK) code = sasl_auxprop_add_plugin(kPasswordSource, init_password_source);
  if (code == SASL_NOMEM) throw std::bad_alloc();
  if (code != SASL_OK) {
    error =
        std::string("the SASL library cannot be used: ") + sasl_errstring(code, nullptr, nullptr);
    return nullptr;
  }
  for (const char** name = sasl_global_listmech(); name != nullptr && *name != nullptr; ++name)
    library->mechanisms_.emplace_back(*name);
  return library;
}

SaslLibrary::~SaslLibrary() {
  sasl_server_done();
}

bool SaslLibrary::has(std::string_view mechanism) const noexcept {
  return std::find(mechanisms_.begin(), mechanisms_.end(), mechanism) != mechanisms_.end();
}

}  // namespace orv::server
