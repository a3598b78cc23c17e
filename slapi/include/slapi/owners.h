// RAII owners for what the server's interface hands out.
#pragma once

#include <cstdlib>
#include <memory>

#include "slapi/dn.h"
#include "slapi/entry.h"
#include "slapi/pblock.h"

namespace orv {

struct FreeDeleter {
  void operator()(void* memory) const noexcept { std::free(memory); }
};
struct EntryDeleter {
  void operator()(entry* e) const noexcept { entry_free(e); }
};
struct EscapedDnDeleter {
  void operator()(ldap_escDN* dn) const noexcept { free_ldap_escDN(dn); }
};
struct PblockDeleter {
  void operator()(pblock* pb) const noexcept { slapi_pblock_destroy(pb); }
};

using MallocText = std::unique_ptr<char, FreeDeleter>;  // released with free
using EntryPtr = std::unique_ptr<entry, EntryDeleter>;  // released with entry_free
using EscapedDn = std::unique_ptr<ldap_escDN, EscapedDnDeleter>;
using PblockPtr = std::unique_ptr<pblock, PblockDeleter>;

}  // namespace orv
