// SPDX-License-Identifier: Apache-2.0
// The LIO operations table, and so the map from each slot to its file.
#include <cstddef>

#include "kernel/korvadm_mod_lio4_internal.h"

const iscsi_mod_ops_t lio3_mod_ops = {
    .start_module = lio3_start_module,                                       // _module.cpp
    .stop_module = lio3_stop_module,
    .get_module_state = lio3_get_module_state,
    .add_target = lio3_add_target,                                           // _target.cpp
    .del_target = lio3_del_target,
    .enable_target = lio3_enable_target,
    .disable_target = lio3_disable_target,
    .set_target_chap = lio3_set_target_chap,                                 // _auth.cpp
    .set_target_ip = lio3_set_target_ip,                                     // _portal.cpp
    .set_target_attr_dataout_timeout = lio3_set_target_attr_dataout_timeout, // _target.cpp
    .get_target_existing_ip_list = lio3_get_target_existing_ip_list,         // _portal.cpp
    .add_backstore = lio3_add_backstore,                                     // _storage.cpp
    .del_backstore = lio3_del_backstore,
    .shutdown_backstore = lio3_shutdown_backstore,
    .change_backstore_size = lio3_change_backstore_size,
    .add_lun_mapping = lio3_add_lun_mapping,                                 // _lun.cpp
    .del_lun_mapping = lio3_del_lun_mapping,
    .add_acl_initiator = lio3_add_acl_initiator,                             // _acl.cpp
    .del_acl_initiator = lio3_del_acl_initiator,
    .add_lun_acl = lio3_add_lun_acl,
    .del_lun_acl = lio3_del_lun_acl,
    .get_target_session = lio3_get_target_session,                           // _sessions.cpp
};

// The slot numbers are the table's contract: a field moved in the struct
// must not compile.
#define SLOT(field, n) static_assert(offsetof(iscsi_mod_ops_t, field) == (n) * sizeof(void *), #field)
SLOT(start_module, 0);
SLOT(stop_module, 1);
SLOT(get_module_state, 2);
SLOT(add_target, 3);
SLOT(del_target, 4);
SLOT(enable_target, 5);
SLOT(disable_target, 6);
SLOT(set_target_chap, 7);
SLOT(set_target_ip, 8);
SLOT(set_target_attr_dataout_timeout, 9);
SLOT(get_target_existing_ip_list, 10);
SLOT(add_backstore, 11);
SLOT(del_backstore, 12);
SLOT(shutdown_backstore, 13);
SLOT(change_backstore_size, 14);
SLOT(add_lun_mapping, 15);
SLOT(del_lun_mapping, 16);
SLOT(add_acl_initiator, 17);
SLOT(del_acl_initiator, 18);
SLOT(add_lun_acl, 19);
SLOT(del_lun_acl, 20);
SLOT(get_target_session, 21);
#undef SLOT
static_assert(sizeof(iscsi_mod_ops_t) == 22 * sizeof(void *), "the driver table has 22 slots");
