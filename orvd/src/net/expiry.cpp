#include "net/expiry.h"

namespace orv::server {

ExpiryReminder::Due ExpiryReminder::due(std::string_view thing, std::time_t end, std::time_t now) {
  const Due state = now > end ? Due::has_ended : end - now > ahead_ ? Due::nothing : Due::ends_soon;
  // A clock that was set back begins a day anew.
  const bool told_today = now >= told_at_ && now - told_at_ < kDay;
  if (state == told_ && thing == thing_ && (state == Due::nothing || told_today))
    return Due::nothing;
  thing_ = thing;
  told_ = state;
  told_at_ = now;
  return state;
}

}  // namespace orv::server
