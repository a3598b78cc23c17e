// The library's side of cfg/interrupt.h.
#pragma once

namespace orv::cfg {

// Whether the check installed for this thread, if any, wants the search to end.
bool interrupted() noexcept;

}  // namespace orv::cfg
