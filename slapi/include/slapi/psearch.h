// The persistent-search monitor: how many persistent searches are running.
//
// The server makes one and stores it in the global parameter block (parameter -146, beside the
// switch -141, which is 1 while persistent searches are allowed). It counts what it runs; a backend
// that is about to delete an entry asks whether anybody has to be told.
//
// Threads: everything here may be called from any thread; nothing else is done under the mutex.
#pragma once

#include <pthread.h>

namespace orv {

class PSearchMonitor {
 public:
  PSearchMonitor() = default;
  PSearchMonitor(const PSearchMonitor&) = delete;
  PSearchMonitor& operator=(const PSearchMonitor&) = delete;
  ~PSearchMonitor() { pthread_mutex_destroy(&mutex_); }

  // Counts one more search. False, without counting it, when `most` are running already or the
  // mutex cannot be taken.
  bool begin(int most) noexcept;

  // Counts one less; each `begin` that said true has one.
  void end() noexcept;

  // The number of persistent searches running, read under the monitor's mutex; 0 when the mutex
  // cannot be taken. Defined by the backend that asks, with its trace: in back-config/.
  int get_num_current_psearches();

 private:
  pthread_mutex_t mutex_ = PTHREAD_MUTEX_INITIALIZER;
  int current_ = 0;
};

}  // namespace orv
