// Loads a plug-in the way the server does, and looks up its entry point.
#include <dlfcn.h>

#include <cstdio>

int main(int count, char** arguments) {
  if (count != 2) return 2;
  void* library = dlopen(arguments[1], RTLD_NOW | RTLD_LOCAL);
  if (library == nullptr) {
    std::fprintf(stderr, "%s\n", dlerror());
    return 1;
  }
  if (dlsym(library, "config_backend_init") == nullptr) {
    std::fprintf(stderr, "%s\n", dlerror());
    return 1;
  }
  return 0;
}
