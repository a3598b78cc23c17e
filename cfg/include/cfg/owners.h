// RAII owners for what sessions hand out.
#pragma once

#include <memory>

#include "cfg/session.h"

namespace orv {

struct CfgResultDeleter {
  void operator()(_CFGMessage* chain) const noexcept { cfg_msgfree(chain); }
};
struct CfgTextDeleter {
  void operator()(char* text) const noexcept { cfg_memfree(text); }
};
struct CfgValuesDeleter {
  void operator()(char** values) const noexcept { cfg_value_free(values); }
};
struct CfgCursorDeleter {
  void operator()(_CFGBer* cursor) const noexcept { cfg_ber_free(cursor); }
};
struct CfgSessionDeleter {
  void operator()(_CFG* session) const noexcept { cfg_unbind(session); }
};

using CfgResult = std::unique_ptr<_CFGMessage, CfgResultDeleter>;  // a result chain
using CfgText = std::unique_ptr<char, CfgTextDeleter>;             // a DN or an attribute name
using CfgValues = std::unique_ptr<char*, CfgValuesDeleter>;        // a value list
using CfgCursor = std::unique_ptr<_CFGBer, CfgCursorDeleter>;      // an attribute walk
using CfgSession = std::unique_ptr<_CFG, CfgSessionDeleter>;       // a session of one's own

}  // namespace orv
