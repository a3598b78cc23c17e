#include "cfg/interrupt.h"

#include "interrupt_poll.h"

namespace orv::cfg {

namespace {

thread_local InterruptCheck current_check = nullptr;
thread_local void* current_context = nullptr;

}  // namespace

InterruptScope::InterruptScope(InterruptCheck check, void* context) noexcept
    : previous_check_(current_check), previous_context_(current_context) {
  current_check = check;
  current_context = context;
}

InterruptScope::~InterruptScope() {
  current_check = previous_check_;
  current_context = previous_context_;
}

bool interrupted() noexcept {
  return current_check != nullptr && current_check(current_context);
}

}  // namespace orv::cfg
