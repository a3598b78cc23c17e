#include "slapi/backends.h"

#include <algorithm>
#include <list>
#include <mutex>
#include <new>
#include <string>
#include <string_view>
#include <vector>

#include "cfg/dn.h"
#include "cfg/result_codes.h"

namespace orv {
namespace {

// Functions under one number, with the null that ends the list.
struct Offer {
  int number;
  std::vector<PluginFunction> functions;
};

struct Registration {
  Backend* backend;
  // A longer list stands in front of the shorter one, which somebody may still be walking.
  std::list<Offer> offers;
};

struct Registry {
  std::mutex mutex;
  std::list<Registration> backends;

  Registration* find(const Backend* backend) noexcept {
    const auto found =
        std::find_if(backends.begin(), backends.end(),
                     [&](const Registration& known) { return known.backend == backend; });
    return found == backends.end() ? nullptr : &*found;
  }
};

Registry& registry() noexcept {
  static Registry all;
  return all;
}

Offer* find_offer(Registration& registration, int number) noexcept {
  auto& offers = registration.offers;
  const auto found = std::find_if(offers.begin(), offers.end(),
                                  [&](const Offer& offer) { return offer.number == number; });
  return found == offers.end() ? nullptr : &*found;
}

bool serves(const Backend& backend, std::string_view suffix) noexcept {
  for (const char* const* own = backend.suffixes; *own != nullptr; ++own)
    if (suffix == *own) return true;
  return false;
}

bool is_taken(const Registry& all, const Backend& backend) noexcept {
  for (const char* const* suffix = backend.suffixes; *suffix != nullptr; ++suffix)
    for (const Registration& known : all.backends)
      if (serves(*known.backend, *suffix)) return true;
  return false;
}

// The longest suffix of a backend at or above a DN; -1 for none.
std::ptrdiff_t depth_of(const Backend& backend, std::string_view dn) noexcept {
  std::ptrdiff_t longest = -1;
  for (const char* const* own = backend.suffixes; *own != nullptr; ++own) {
    const std::string_view suffix(*own);
    if (cfg::normal_dn_is_at_or_below(dn, suffix))
      longest = std::max(longest, static_cast<std::ptrdiff_t>(suffix.size()));
  }
  return longest;
}

Backend* select(std::string_view dn) noexcept {
  Registry& all = registry();
  const std::lock_guard lock(all.mutex);
  Backend* selected = nullptr;
  std::ptrdiff_t deepest = -1;
  for (const Registration& known : all.backends) {
    const std::ptrdiff_t depth = depth_of(*known.backend, dn);
    if (depth <= deepest) continue;
    deepest = depth;
    selected = known.backend;
  }
  return selected;
}

}  // namespace

int register_backend(Backend* backend) noexcept try {
  if (backend == nullptr || backend->suffixes == nullptr || *backend->suffixes == nullptr)
    return result::other;
  Registry& all = registry();
  const std::lock_guard lock(all.mutex);
  if (is_taken(all, *backend)) return result::other;
  all.backends.push_back({backend, {}});
  return result::success;
} catch (const std::bad_alloc&) {
  return result::no_memory;
}

void unregister_backend(Backend* backend) noexcept {
  Registry& all = registry();
  const std::lock_guard lock(all.mutex);
  all.backends.remove_if([&](const Registration& known) { return known.backend == backend; });
}

int register_plugin_function(Backend* backend, int number, PluginFunction function) noexcept try {
  Registry& all = registry();
  const std::lock_guard lock(all.mutex);
  Registration* const registration = all.find(backend);
  if (registration == nullptr || function == nullptr) return result::other;
  Offer longer{number, {}};
  if (const Offer* const before = find_offer(*registration, number); before != nullptr)
    longer.functions.assign(before->functions.begin(), before->functions.end() - 1);
  longer.functions.push_back(function);
  longer.functions.push_back(nullptr);
  registration->offers.push_front(std::move(longer));
  return result::success;
} catch (const std::bad_alloc&) {
  return result::no_memory;
}

Backend* select_backend_opt(const char* dn) {
  if (dn == nullptr) return nullptr;
  std::string normal;
  return cfg::normalize_dn(dn, normal) == result::success ? select(normal) : nullptr;
}

int getAllPluginFuncs(Backend* backend, int number, PluginFunction** list) {
  if (list == nullptr) return result::other;
  *list = nullptr;
  Registry& all = registry();
  const std::lock_guard lock(all.mutex);
  Registration* const registration = all.find(backend);
  Offer* const offer = registration == nullptr ? nullptr : find_offer(*registration, number);
  if (offer == nullptr) return result::other;
  *list = offer->functions.data();
  return result::success;
}

}  // namespace orv
