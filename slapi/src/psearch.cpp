#include "slapi/psearch.h"

namespace orv {

bool PSearchMonitor::begin(int most) noexcept {
  if (pthread_mutex_lock(&mutex_) != 0) return false;
  const bool counted = current_ < most;
  if (counted) ++current_;
  pthread_mutex_unlock(&mutex_);
  return counted;
}

void PSearchMonitor::end() noexcept {
  if (pthread_mutex_lock(&mutex_) != 0) return;
  --current_;
  pthread_mutex_unlock(&mutex_);
}

}  // namespace orv
