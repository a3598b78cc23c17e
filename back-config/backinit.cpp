#include <array>
#include <variant>

#include "function_ids.h"
#include "handlers.h"
#include "slapi/control.h"
#include "slapi/globals.h"
#include "slapi/trace.h"

namespace orv {
namespace {

constexpr const char* kManageDsaIt = "2.16.840.1.113730.3.4.2";
constexpr int kEveryOperation = -1;
constexpr int kServerWithoutControls = 3;

constexpr const char* kStoreFailed = "config backend initialization error. Function number=%d\n";

struct Slot {
  int parameter;
  std::variant<std::nullptr_t, Handler, InstanceStart> function;
};

// In the order in which they are stored. Null slots are stored too: what the backend does not offer
// must not stay at whatever the server had there.
constexpr std::array<Slot, 14> kSlots = {{
    {parameter::bind_function, &config_back_bind},
    {parameter::unbind_function, &config_back_unbind},
    {parameter::search_function, &config_back_search},
    {parameter::compare_function, nullptr},
    {parameter::modify_function, &config_back_modify},
    {parameter::modify_rdn_function, nullptr},
    {parameter::add_function, &config_back_add},
    {parameter::delete_function, &config_back_delete},
    {parameter::instance_start_function, &config_back_init},  // takes a Backend*, not a block
    {parameter::configuration_function, nullptr},
    {parameter::close_function, &config_back_close},
    {parameter::abandon_function, nullptr},
    {parameter::server_function_15, nullptr},
    {parameter::server_function_16, nullptr},
}};

int store(pblock* pb, const Slot& slot) {
  return std::visit([&](auto function) { return slapi_pblock_set(pb, slot.parameter, function); },
                    slot.function);
}

// Stores the slots up to the first that fails; its number is then in `failed`.
int store_handlers(pblock* pb, int& failed) {
  for (const Slot& slot : kSlots) {
    const int rc = store(pb, slot);
    if (rc == 0) continue;
    failed = slot.parameter;
    return rc;
  }
  return 0;
}

}  // namespace
}  // namespace orv

int config_backend_init(orv::pblock* pb) {
  using namespace orv;
  ldtr_function_local trace(function_id::config_backend_init, "pb=0x%p", static_cast<void*>(pb));

  int failed = 0;
  const int rc = store_handlers(pb, failed);
  if (rc != 0) trace.debug(trace::error, kStoreFailed, failed);

  // Also after a failure: only the storing of handlers ends there.
  if (g_srvType.load(std::memory_order_relaxed) != kServerWithoutControls) {
    slapi_register_supported_control(kManageDsaIt, kEveryOperation);
  }
  return trace.exit(rc);
}
