// A library whose entry point has C++ linkage, so that its name in the file is another one.
#include "slapi/pblock.h"

int test_plugin_init(orv::pblock* pb);
int test_plugin_init(orv::pblock*) {
  return 0;
}
