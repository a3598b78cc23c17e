#include "slapi/reserves.h"

#include "cfg/ldapmod.h"
#include "reserves.h"

namespace orv {
namespace {

// NOLINTBEGIN(cert-err58-cpp) filled when the library is loaded, and throw nothing
slapi::Reserve g_text(slapi::kReservedText);
slapi::Reserve g_list(2 * sizeof(ldapmod*));
// NOLINTEND(cert-err58-cpp)

}  // namespace

slapi::Reserve& slapi::text_reserve() noexcept {
  return g_text;
}

slapi::Reserve& slapi::list_reserve() noexcept {
  return g_list;
}

bool fill_reserves() noexcept {
  const bool text = g_text.fill();
  return g_list.fill() && text;
}

}  // namespace orv
