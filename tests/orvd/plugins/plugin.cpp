// A plug-in that registers everything, less the one fault that its build names.
#include <stdexcept>

#include "slapi/pblock.h"

#ifndef FAULT_WITHOUT
#define FAULT_WITHOUT 0
#endif

namespace {

int handle(orv::pblock*) {
  return 0;
}
int start(orv::Backend*) {
  return 0;
}

}  // namespace

extern "C" int test_plugin_init(orv::pblock* pb) {
  using orv::slapi_pblock_set;
  for (const int number : {200, 201, 202, 204, 206, 207, 210}) {
    if (number == FAULT_WITHOUT) continue;
    if (const int code = slapi_pblock_set(pb, number, &handle); code != 0) return code;
  }
  if (FAULT_WITHOUT != -19) slapi_pblock_set(pb, -19, &start);
#ifdef FAULT_RETURNS_FAILURE
  return 17;
#elif defined FAULT_THROWS_EXCEPTION
  throw std::runtime_error("nothing works here");
#elif defined FAULT_THROWS_NUMBER
  throw 42;
#else
  return 0;
#endif
}
