// SPDX-License-Identifier: Apache-2.0
// The operations table iscsi_conf_ops: each slot names the operation, and
// the file beside this one that holds it.
#include <cstddef>

#include "config/korvadm_xmldb_conf.h"

/* ---------------------------------------------------------------------------
 * The operations table. Designated initialisers follow the slot order, so a
 * slot in the wrong place does not compile. An operation still to come has
 * its slot set to nullptr; an empty slot of the layout is an empty_N member.
 * ------------------------------------------------------------------------- */

const iscsi_conf_ops_t iscsi_conf_ops = {
    .conf_type = 1,
    .xmldb_get_service_enable = xmldb_get_service_enable, /* 1 */
    .xmldb_set_service_enable = xmldb_set_service_enable,
    .xmldb_get_korvadm_ver = xmldb_get_korvadm_ver,
    .xmldb_set_korvadm_ver = xmldb_set_korvadm_ver,
    .xmldb_get_service_progress = xmldb_get_service_progress, /* 5 */
    .xmldb_set_service_progress = xmldb_set_service_progress,
    .xmldb_get_saved_host_name = xmldb_get_saved_host_name,
    .xmldb_set_saved_host_name = xmldb_set_saved_host_name,
    .xmldb_get_iqn_prefix = xmldb_get_iqn_prefix,
    .xmldb_set_iqn_prefix = xmldb_set_iqn_prefix, /* 10 */
    .xmldb_get_saved_ipv4_addr = xmldb_get_saved_ipv4_addr,
    .xmldb_set_saved_ipv4_addr = xmldb_set_saved_ipv4_addr,
    .xmldb_get_saved_ipv6_addr = xmldb_get_saved_ipv6_addr,
    .xmldb_set_saved_ipv6_addr = xmldb_set_saved_ipv6_addr,
    .xmldb_clean_saved_ip_addr = xmldb_clean_saved_ip_addr, /* 15 */
    .xmldb_get_debug_level = xmldb_get_debug_level,
    .xmldb_set_debug_level = xmldb_set_debug_level,
    .empty_18 = nullptr,
    .empty_19 = nullptr,
    .empty_20 = nullptr, /* 20 */
    .xmldb_add_new_target = xmldb_add_new_target,
    .xmldb_del_target_by_name = xmldb_del_target_by_name,
    .xmldb_check_target_exist = xmldb_check_target_exist,
    .xmldb_check_add_target = xmldb_check_add_target,
    .xmldb_get_target_state = xmldb_get_target_state, /* 25 */
    .xmldb_set_target_state = xmldb_set_target_state,
    .xmldb_get_target_tpgt = xmldb_get_target_tpgt,
    .empty_28 = nullptr,
    .xmldb_get_target_hba_id = xmldb_get_target_hba_id,
    .xmldb_set_target_hba_id = xmldb_set_target_hba_id, /* 30 */
    .xmldb_get_free_target_hba_id = xmldb_get_free_target_hba_id,
    .empty_32 = nullptr,
    .empty_33 = nullptr,
    .empty_34 = nullptr,
    .empty_35 = nullptr, /* 35 */
    .empty_36 = nullptr,
    .empty_37 = nullptr,
    .xmldb_get_target_iqn = xmldb_get_target_iqn,
    .xmldb_set_target_iqn = xmldb_set_target_iqn,
    .xmldb_set_target_chap = xmldb_set_target_chap, /* 40 */
    .empty_41 = nullptr,
    .empty_42 = nullptr,
    .empty_43 = nullptr,
    .xmldb_update_current_targetcnt = xmldb_update_current_targetcnt,
    .xmldb_get_target_status = xmldb_get_target_status, /* 45 */
    .xmldb_set_target_status = xmldb_set_target_status,
    .xmldb_get_target_conf_by_name = xmldb_get_target_conf_by_name,
    .xmldb_get_all_target_conf_lite = xmldb_get_all_target_conf_lite,
    .xmldb_get_all_target_conf = xmldb_get_all_target_conf,
    .xmldb_get_target_map_lun_conf = xmldb_get_target_map_lun_conf, /* 50 */
    .empty_51 = nullptr,
    .xmldb_clean_target_conf = xmldb_clean_target_conf,
    .xmldb_add_new_lun = xmldb_add_new_lun,
    .xmldb_del_lun_by_name = xmldb_del_lun_by_name,
    .xmldb_check_lun_exist = xmldb_check_lun_exist, /* 55 */
    .xmldb_check_add_lun = xmldb_check_add_lun,
    .xmldb_get_lun_uuid = xmldb_get_lun_uuid,
    .empty_58 = nullptr,
    .xmldb_get_lun_img_file = xmldb_get_lun_img_file,
    .xmldb_get_lun_serial = xmldb_get_lun_serial, /* 60 */
    .xmldb_set_lun_serial = xmldb_set_lun_serial,
    .xmldb_get_lun_vol_state = xmldb_get_lun_vol_state,
    .xmldb_set_lun_vol_state = xmldb_set_lun_vol_state,
    .xmldb_get_lun_size = xmldb_get_lun_size,
    .xmldb_set_lun_size = xmldb_set_lun_size, /* 65 */
    .xmldb_get_lun_alloc_size = xmldb_get_lun_alloc_size,
    .xmldb_set_lun_alloc_size = xmldb_set_lun_alloc_size,
    .xmldb_get_lun_connect_state = xmldb_get_lun_connect_state,
    .xmldb_set_lun_connect_state = xmldb_set_lun_connect_state,
    .xmldb_get_free_lun_devid = xmldb_get_free_lun_devid, /* 70 */
    .empty_71 = nullptr,
    .empty_72 = nullptr,
    .xmldb_get_lun_prealloc = xmldb_get_lun_prealloc,
    .empty_74 = nullptr,
    .xmldb_get_lun_prealloc_state = xmldb_get_lun_prealloc_state, /* 75 */
    .xmldb_set_lun_prealloc_state = xmldb_set_lun_prealloc_state,
    .xmldb_set_lun_prealloc_progress = xmldb_set_lun_prealloc_progress,
    .xmldb_get_lun_status = xmldb_get_lun_status,
    .xmldb_set_lun_status = xmldb_set_lun_status,
    .xmldb_get_all_lun_conf = xmldb_get_all_lun_conf, /* 80 */
    .xmldb_get_all_lun_conf_lite = xmldb_get_all_lun_conf_lite,
    .xmldb_get_lun_conf_by_uuid = xmldb_get_lun_conf_by_uuid,
    .xmldb_get_lun_conf_by_name = xmldb_get_lun_conf_by_name,
    .xmldb_update_lun_current_count = xmldb_update_lun_current_count,
    .xmldb_get_all_lun_conf_in_crash_conf = xmldb_get_all_lun_conf_in_crash_conf, /* 85 */
    .xmldb_check_acl_initiaor_exist = xmldb_check_acl_initiaor_exist,
    .xmldb_check_acl_alias_exist = xmldb_check_acl_alias_exist,
    .xmldb_check_add_acl_initiator = xmldb_check_add_acl_initiator,
    .xmldb_add_acl_initiator = xmldb_add_acl_initiator,
    .xmldb_del_acl_initiator = xmldb_del_acl_initiator, /* 90 */
    .xmldb_get_all_acl_initiator_conf_lite = xmldb_get_all_acl_initiator_conf_lite,
    .xmldb_set_lun_acl = xmldb_set_lun_acl,
    .empty_93 = nullptr,
    .xmldb_get_all_lun_acl_conf_from_lun = xmldb_get_all_lun_acl_conf_from_lun,
    .xmldb_remove_lun_from_all_acl = xmldb_remove_lun_from_all_acl, /* 95 */
    .xmldb_update_current_aclcnt = xmldb_update_current_aclcnt,
    .xmldb_get_initiator_name_from_alias = xmldb_get_initiator_name_from_alias,
    .xmldb_clean_acl_conf = xmldb_clean_acl_conf,
    .xmldb_add_target_lun_map = xmldb_add_target_lun_map,
    .empty_100 = nullptr, /* 100 */
    .xmldb_del_target_lun_map = xmldb_del_target_lun_map,
    .xmldb_get_free_lun_num = xmldb_get_free_lun_num,
    .xmldb_get_mapping_target = xmldb_get_mapping_target,
    .empty_104 = nullptr,
    .xmldb_update_total_vol_size_info = xmldb_update_total_vol_size_info, /* 105 */
    .xmldb_get_nesrad_pid = xmldb_get_nesrad_pid,
    .xmldb_set_nesrad_pid = xmldb_set_nesrad_pid,
    .xmldb_get_nesrad_enable = xmldb_get_nesrad_enable,
    .xmldb_set_nesrad_enable = xmldb_set_nesrad_enable,
    .xmldb_get_nesrad_ip = xmldb_get_nesrad_ip, /* 110 */
    .xmldb_set_nesrad_ip = xmldb_set_nesrad_ip,
    .xmldb_clean_nesrad_conf = xmldb_clean_nesrad_conf,
    .xmldb_clean_sess_conf = xmldb_clean_sess_conf,
    .xmldb_update_sess_acl_lun_access_status = xmldb_update_sess_acl_lun_access_status,
    .xmldb_save_conf = xmldb_save_conf, /* 115 */
    .xmldb_clean_conf = xmldb_clean_conf,
    .xmldb_set_temp_return_code = xmldb_set_temp_return_code,
    .xmldb_del_target_conn_info = xmldb_del_target_conn_info,
    .xmldb_set_target_conn_info = xmldb_set_target_conn_info,
};

// The table's shape is an interface: 119 pointer slots after the leading integer.
static_assert(offsetof(iscsi_conf_ops_t, xmldb_set_target_conn_info) ==
              offsetof(iscsi_conf_ops_t, xmldb_get_service_enable) + 118 * sizeof(void *));
static_assert(offsetof(iscsi_conf_ops_t, xmldb_add_new_target) ==
              offsetof(iscsi_conf_ops_t, xmldb_get_service_enable) + 20 * sizeof(void *));
static_assert(offsetof(iscsi_conf_ops_t, xmldb_update_total_vol_size_info) ==
              offsetof(iscsi_conf_ops_t, xmldb_get_service_enable) + 104 * sizeof(void *));
