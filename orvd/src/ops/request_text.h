// How requests look in logs: what is asked for, without values, and without passwords that somebody
// put into a name.
//
// Threads: functions without state. They throw std::bad_alloc.
#pragma once

#include <string>
#include <string_view>

#include "protocol/message.h"
#include "slapi/schema.h"

namespace orv::server {

// "SEARCH", by the tag of the answer; "REQUEST" for what has none.
std::string_view operation_name(int tag);

// NAME dn="...". `normal` is the normal form of the DN, if that is known.
std::string describe_dn(std::string_view name, std::string_view dn, std::string_view normal = {});

std::string describe_search(const Schema& schema, const SearchRequest& request,
                            std::string_view normal = {});

// Any request, as it stands for one that is answered on the spot.
std::string describe(const Schema& schema, const Request& request);

}  // namespace orv::server
