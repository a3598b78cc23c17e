#include "directory_backend.h"

#include <new>
#include <stdexcept>

#include "cfg/result_codes.h"
#include "slapi/backends.h"
#include "slapi/password_method.h"

namespace orv::server {
namespace {

int take_password_method(Backend* /*backend*/, int method, char** text) {
  return stage_password_method(method, text);
}

void demand(int code) {
  if (code == result::no_memory) throw std::bad_alloc();
  if (code != result::success)
    throw std::runtime_error("the directory backend cannot be registered");
}

}  // namespace

DirectoryBackend::DirectoryBackend() {
  backend_.suffixes = kSuffixes;
  demand(register_backend(&backend_));
  try {
    demand(register_plugin_function(&backend_, kTakePasswordMethod, take_password_method));
  } catch (...) {
    unregister_backend(&backend_);
    throw;
  }
}

DirectoryBackend::~DirectoryBackend() {
  unregister_backend(&backend_);
}

}  // namespace orv::server
