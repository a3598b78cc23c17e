// The identifiers under which the backend's functions appear in the trace: 0x01000000, plus the
// number of the source file shifted left by 16, plus the number of the function in it shifted left
// by 8.
//
// The numbers are what a reader of an old trace looks up: a function keeps its number for good, a
// new one takes the next that is free.
#pragma once

#include <cstdint>

namespace orv::function_id {

// Groups of source files. Frame: backinit, config_init, config_close, config_bind, config_unbind,
// and the delete handler.
enum class File : std::uint32_t { frame = 1, add = 2, modify = 3, search = 4, code_page = 5 };

constexpr std::uint32_t make(File file, std::uint32_t function) {
  return 0x01000000U + (static_cast<std::uint32_t>(file) << 16U) + (function << 8U);
}

inline constexpr std::uint32_t config_backend_init = make(File::frame, 1);
inline constexpr std::uint32_t config_back_init = make(File::frame, 2);
inline constexpr std::uint32_t config_back_close = make(File::frame, 3);
inline constexpr std::uint32_t init_cfg_ld = make(File::frame, 4);
inline constexpr std::uint32_t config_end = make(File::frame, 5);
inline constexpr std::uint32_t config_back_bind = make(File::frame, 6);
inline constexpr std::uint32_t config_back_unbind = make(File::frame, 7);
inline constexpr std::uint32_t config_back_delete = make(File::frame, 8);

inline constexpr std::uint32_t config_back_add = make(File::add, 1);
inline constexpr std::uint32_t get_admin_dn = make(File::add, 2);
inline constexpr std::uint32_t get_admin_kerberos_id = make(File::add, 3);
inline constexpr std::uint32_t get_admin_digest_user_name = make(File::add, 4);
inline constexpr std::uint32_t get_admin_group_member_dn = make(File::add, 5);

inline constexpr std::uint32_t config_back_modify = make(File::modify, 1);

inline constexpr std::uint32_t config_back_search = make(File::search, 1);
inline constexpr std::uint32_t has_search_authority = make(File::search, 2);
inline constexpr std::uint32_t send_search_results = make(File::search, 3);
inline constexpr std::uint32_t auto_lock_take = make(File::search, 4);
inline constexpr std::uint32_t auto_lock_release = make(File::search, 5);
inline constexpr std::uint32_t auto_lock_policy = make(File::search, 6);
inline constexpr std::uint32_t auto_free_make = make(File::search, 7);
inline constexpr std::uint32_t auto_free_get = make(File::search, 8);
inline constexpr std::uint32_t auto_free_release = make(File::search, 9);

inline constexpr std::uint32_t local_to_utf8 = make(File::code_page, 1);
inline constexpr std::uint32_t utf8_to_local = make(File::code_page, 2);
inline constexpr std::uint32_t read_entry = make(File::code_page, 3);
inline constexpr std::uint32_t message_to_entry = make(File::code_page, 4);
inline constexpr std::uint32_t retrieve_entry = make(File::code_page, 5);
inline constexpr std::uint32_t value_find = make(File::code_page, 6);

}  // namespace orv::function_id
