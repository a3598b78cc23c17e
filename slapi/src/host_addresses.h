// Which addresses are this host's.
#pragma once

#include <ifaddrs.h>

namespace orv::slapi {

// Whether `address` is one of those in a list of interfaces, as isValidIPAddressOnSystem
// understands it. Null arguments: false. Allocates nothing.
bool is_address_in(const char* address, const ifaddrs* interfaces) noexcept;

}  // namespace orv::slapi
