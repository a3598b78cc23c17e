// A library that needs a function nobody has.
#include "slapi/pblock.h"

extern "C" int orv_test_function_that_nobody_defines();

extern "C" int test_plugin_init(orv::pblock*) {
  return orv_test_function_that_nobody_defines();
}
