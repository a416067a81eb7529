// SPDX-License-Identifier: Apache-2.0
// The LIO operations table, and so the map from each slot to its file.
#include <cstddef>

#include "kernel/korvadm_mod_lio4_internal.h"

// Slot number and field, in table order; slot F is filled by lio3_F. One
// list makes both the table and the checks that pin each field to its slot.
#define LIO3_SLOTS(X)                                                        \
    X(0, start_module)                    /* _module.cpp */                  \
    X(1, stop_module)                                                        \
    X(2, get_module_state)                                                   \
    X(3, add_target)                      /* _target.cpp */                  \
    X(4, del_target)                                                         \
    X(5, enable_target)                                                      \
    X(6, disable_target)                                                     \
    X(7, set_target_chap)                 /* _auth.cpp */                    \
    X(8, set_target_ip)                   /* _portal.cpp */                  \
    X(9, set_target_attr_dataout_timeout) /* _target.cpp */                  \
    X(10, get_target_existing_ip_list)    /* _portal.cpp */                  \
    X(11, add_backstore)                  /* _storage.cpp */                 \
    X(12, del_backstore)                                                     \
    X(13, shutdown_backstore)                                                \
    X(14, change_backstore_size)                                             \
    X(15, add_lun_mapping)                /* _lun.cpp */                     \
    X(16, del_lun_mapping)                                                   \
    X(17, add_acl_initiator)              /* _acl.cpp */                     \
    X(18, del_acl_initiator)                                                 \
    X(19, add_lun_acl)                                                       \
    X(20, del_lun_acl)                                                       \
    X(21, get_target_session)             /* _sessions.cpp */

#define FILL(n, field) .field = lio3_##field,
const iscsi_mod_ops_t lio3_mod_ops = {LIO3_SLOTS(FILL)};
#undef FILL

// The slot numbers are the table's contract: a field moved in the struct
// must not compile.
#define PIN(n, field) static_assert(offsetof(iscsi_mod_ops_t, field) == (n) * sizeof(void *), #field);
LIO3_SLOTS(PIN)
#undef PIN
static_assert(sizeof(iscsi_mod_ops_t) == 22 * sizeof(void *), "the driver table has 22 slots");
