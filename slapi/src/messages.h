// The numbers of the server's own messages in the catalogue (config/messages.msg). What their
// arguments are stands there.
#pragma once

#include "slapi/log.h"

namespace orv::message {

// Why an entry does not fit the schema. The first argument is the entry's DN.
inline constexpr int schema_set = 9;
inline constexpr int no_object_class = 1;
inline constexpr int unknown_object_class = 2;
inline constexpr int unknown_type = 3;
inline constexpr int too_many_values = 4;
inline constexpr int bad_value = 5;
inline constexpr int not_allowed = 6;
inline constexpr int no_structural_class = 7;
inline constexpr int two_structural_classes = 8;
inline constexpr int missing_attribute = 9;
inline constexpr int secret_in_name = 10;
inline constexpr int name_not_in_entry = 11;

// Why a new password does not comply with the policy. The first argument is who wants to set it.
inline constexpr int password_set = 10;
inline constexpr int password_is_empty = 1;
inline constexpr int password_is_short = 2;
inline constexpr int too_few_letters = 3;
inline constexpr int too_few_others = 4;
inline constexpr int too_many_repeats = 5;
inline constexpr int too_few_new = 6;
inline constexpr int password_is_old = 7;
// The policy that stands in the file is not put in force. The argument is the reason.
inline constexpr int policy_refused = 8;
// The password method that stands in the file is not put in force. The argument is the reason.
inline constexpr int method_refused = 9;
// An identity is locked out. The second argument is the number of failed binds.
inline constexpr int locked_out = 10;

}  // namespace orv::message
