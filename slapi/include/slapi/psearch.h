// The persistent-search monitor: how many persistent searches are running.
#pragma once

#include <pthread.h>

namespace orv {

class PSearchMonitor {
 public:
  PSearchMonitor() = default;
  PSearchMonitor(const PSearchMonitor&) = delete;
  PSearchMonitor& operator=(const PSearchMonitor&) = delete;

  // The number of persistent searches running, read under the monitor's mutex; 0 when the mutex
  // cannot be taken. Thread-safe. Declared for those who write against this interface; a program
  // that calls it does not link yet.
  int get_num_current_psearches();

 private:
  pthread_mutex_t mutex_ = PTHREAD_MUTEX_INITIALIZER;
  int current_ = 0;
};

}  // namespace orv
