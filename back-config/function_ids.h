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
inline constexpr std::uint32_t check_delete_authority = make(File::frame, 9);
inline constexpr std::uint32_t get_num_current_psearches = make(File::frame, 10);

inline constexpr std::uint32_t config_back_add = make(File::add, 1);
inline constexpr std::uint32_t get_admin_dn = make(File::add, 2);
inline constexpr std::uint32_t get_admin_kerberos_id = make(File::add, 3);
inline constexpr std::uint32_t get_admin_digest_user_name = make(File::add, 4);
inline constexpr std::uint32_t get_admin_group_member_dn = make(File::add, 5);
inline constexpr std::uint32_t does_admin_group_member_dn_exist = make(File::add, 6);
inline constexpr std::uint32_t does_replication_supplier_dn_exist = make(File::add, 7);
inline constexpr std::uint32_t does_kerberos_id_exist = make(File::add, 8);
inline constexpr std::uint32_t does_digest_user_name_exist = make(File::add, 9);
inline constexpr std::uint32_t does_proxy_split_name_exist = make(File::add, 10);
inline constexpr std::uint32_t check_if_admin_group_entry = make(File::add, 11);
inline constexpr std::uint32_t check_if_repl_supplier_entry = make(File::add, 12);
inline constexpr std::uint32_t check_if_kerberos_entry = make(File::add, 13);
inline constexpr std::uint32_t check_if_digest_entry = make(File::add, 14);
inline constexpr std::uint32_t check_if_proxy_split_container = make(File::add, 15);
inline constexpr std::uint32_t check_admin_policy_entry = make(File::add, 16);
inline constexpr std::uint32_t process_roles_if_admin_group_entry = make(File::add, 17);
inline constexpr std::uint32_t check_if_passthru_subtree_entry = make(File::add, 18);
inline constexpr std::uint32_t verify_passthrough_server_entry = make(File::add, 19);
inline constexpr std::uint32_t does_conflicting_pta_subtree_exist = make(File::add, 20);
inline constexpr std::uint32_t check_all_pta_entries = make(File::add, 21);
inline constexpr std::uint32_t check_add_authority = make(File::add, 22);
inline constexpr std::uint32_t check_if_exists = make(File::add, 23);
inline constexpr std::uint32_t check_for_parent = make(File::add, 24);
inline constexpr std::uint32_t check_for_rep = make(File::add, 25);
inline constexpr std::uint32_t xlate_attrs = make(File::add, 26);
inline constexpr std::uint32_t cleanup_attrs = make(File::add, 27);

inline constexpr std::uint32_t config_back_modify = make(File::modify, 1);
inline constexpr std::uint32_t check_ip_addrs = make(File::modify, 2);
inline constexpr std::uint32_t gen_check_ip_addrs_err = make(File::modify, 3);
inline constexpr std::uint32_t addmodifyop = make(File::modify, 4);
inline constexpr std::uint32_t mod_entry = make(File::modify, 5);
inline constexpr std::uint32_t mod_schema_check = make(File::modify, 6);
inline constexpr std::uint32_t check_if_admin_group_can_modify = make(File::modify, 7);
inline constexpr std::uint32_t check_root_admin_modify = make(File::modify, 8);
inline constexpr std::uint32_t check_kerberos_modify = make(File::modify, 9);
inline constexpr std::uint32_t check_digest_modify = make(File::modify, 10);
inline constexpr std::uint32_t check_repl_supplier_modify = make(File::modify, 11);
inline constexpr std::uint32_t check_proxy_name_modify = make(File::modify, 12);
inline constexpr std::uint32_t does_mod_attribute_exists = make(File::modify, 13);
inline constexpr std::uint32_t get_mod_attribute = make(File::modify, 14);
inline constexpr std::uint32_t resolve_path = make(File::modify, 15);
inline constexpr std::uint32_t get_audit_log_filename = make(File::modify, 16);
inline constexpr std::uint32_t check_audit_log = make(File::modify, 17);
inline constexpr std::uint32_t check_admin_policy_entry_modify = make(File::modify, 18);
inline constexpr std::uint32_t check_admin_policy_modify = make(File::modify, 19);
inline constexpr std::uint32_t check_pw_encryption_modify = make(File::modify, 20);

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
