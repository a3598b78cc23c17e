#include "slapi/globals.h"

namespace orv {

std::atomic<int> g_srvType{0};
std::atomic<int> g_safe_mode{0};
std::atomic<int> default_autolock{1};
std::atomic<int> al_configfile_counter{0};
std::atomic<int> configfile_read{1};

}  // namespace orv
