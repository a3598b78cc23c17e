// Settings of the process that the server shares with its plug-ins. Atomics, to be read and written
// relaxed: nobody orders other memory by them.
#pragma once

#include <atomic>

namespace orv {

extern std::atomic<int> g_srvType;  // kind of server: 0 ordinary; 1 and 3 change rules named there
extern std::atomic<int> g_safe_mode;  // 1: started in safe mode

// Lock policy of AutoLock: 1 timed try-lock, 0 plain blocking lock.
extern std::atomic<int> default_autolock;
// Value of configfile_read when the lock policy was last read.
extern std::atomic<int> al_configfile_counter;
// How many times the server has read its configuration file; 1 after the start.
extern std::atomic<int> configfile_read;

}  // namespace orv
