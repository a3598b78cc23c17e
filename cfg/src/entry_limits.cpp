#include "cfg/entry_limits.h"

#include <atomic>

#include "entry_size.h"

namespace orv::cfg {
namespace {

std::atomic<std::size_t> most_attributes{EntryLimits().attributes};
std::atomic<std::size_t> most_values{EntryLimits().values};

Outcome refused(const char* what, std::size_t limit) {
  return {result::admin_limit_exceeded,
          "the entry would have more than " + std::to_string(limit) + " " + what};
}

}  // namespace

void set_entry_limits(EntryLimits limits) noexcept {
  most_attributes.store(limits.attributes, std::memory_order_relaxed);
  most_values.store(limits.values, std::memory_order_relaxed);
}

EntryLimits entry_limits() noexcept {
  return {most_attributes.load(std::memory_order_relaxed),
          most_values.load(std::memory_order_relaxed)};
}

Outcome check_growth(EntrySize before, EntrySize after) {
  const EntryLimits limits = entry_limits();
  if (after.attributes > limits.attributes && after.attributes > before.attributes)
    return refused("attributes", limits.attributes);
  if (after.values > limits.values && after.values > before.values)
    return refused("values", limits.values);
  return {};
}

}  // namespace orv::cfg
