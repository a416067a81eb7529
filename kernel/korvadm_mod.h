// SPDX-License-Identifier: Apache-2.0
/* The kernel target driver's interface: its records, the operations table
 * `iscsi_mod_ops` and the `iscsi_mod_` wrappers every caller goes through.
 *
 * One process-wide pointer holds the selected table (iscsi_mod_select); the
 * only back end is the LIO configfs driver (korvadm_mod_lio4.h, type 2). Each
 * wrapper checks its pointer arguments, then that a table is selected, then
 * that the slot is filled, and returns the slot's result unchanged. Codes come
 * from common/korvadm_err.h: ERR_PARAM (-9989) for a missing argument or no
 * table, ERR_OP_NOT_PROVIDED (-9967) for an empty slot. */
#ifndef KORVADM_MOD_H
#define KORVADM_MOD_H

#include <stdint.h>

#include "common/korvadm_list.h"
#include "common/korvadm_sys.h"

#ifdef __cplusplus
extern "C" {
#endif

#define ISCSI_TARGET_IQN_LEN   224 /* IQN of up to 223 characters */
#define ISCSI_NAME_LEN         128 /* aliases, CHAP names and passwords, LUN names */
#define ISCSI_INITIATOR_LEN    256
#define ISCSI_LUN_PATH_LEN     512
#define ISCSI_TPGT_MAX         63  /* portal group tags are 0..63 */
#define ISCSI_LUN_NUM_MAX      255 /* LUN numbers are 0..255 */

/* A target as target management holds it. The driver reads the fields
 * below; the wanted portals are owned by the record. */
typedef struct iscsi_target_s {
    char iqn[ISCSI_TARGET_IQN_LEN];       /* "" until set */
    char alias[ISCSI_NAME_LEN];
    int tpgt;                             /* -1 until set; valid 0..63 */
    int dataout_timeout;                  /* seconds, written to every ACL */
    int chap;                             /* 1: one-way CHAP on */
    char chap_user[ISCSI_NAME_LEN];
    char chap_pass[ISCSI_NAME_LEN];       /* 12..16 characters when CHAP is on */
    int mutual_chap;                      /* 1: mutual CHAP on (only with CHAP) */
    char mutual_user[ISCSI_NAME_LEN];
    char mutual_pass[ISCSI_NAME_LEN];
    list_t ip_list;                       /* wanted portals, iscsi_ip_t */
    list_t sess_list;                     /* its sessions, iscsi_sess_t (not owned) */
    list_node_t node;                     /* owner is the target */
} iscsi_target_t;

/* A LUN as target management holds it (the fields the driver reads). */
typedef struct iscsi_lun_s {
    char name[ISCSI_NAME_LEN];            /* names the backstore directory */
    int lun_num;                          /* -1 until assigned */
    char serial[ISCSI_NAME_LEN];          /* may be "" */
    char path[ISCSI_LUN_PATH_LEN];        /* backing file */
    int hba_id;                           /* fileio_<id>; -1 until set */
    uint64_t size;                        /* bytes */
    list_node_t node;
} iscsi_lun_t;

/* An initiator named by an ACL. */
typedef struct iscsi_initiator_s {
    char name[ISCSI_INITIATOR_LEN];
    list_t sess_list;                     /* its sessions, iscsi_sess_t (not owned) */
    list_node_t node;
} iscsi_initiator_t;

/* A LUN mapped into a target under a LUN number; target and lun are
 * references, not owned. */
typedef struct iscsi_map_lun_s {
    int lun_num;                          /* 0..255; -1 until assigned */
    iscsi_target_t *target;
    iscsi_lun_t *lun;
    list_node_t node;
} iscsi_map_lun_t;

/* One initiator's access right to one mapped LUN; map_lun and initiator are
 * references, not owned. */
typedef struct iscsi_lun_acl_s {
    iscsi_map_lun_t *map_lun;
    iscsi_initiator_t *initiator;
    int access_right;                     /* 0 deny, 1 read-only, 2 read-write */
    list_node_t node;
} iscsi_lun_acl_t;

/* Zeroed record: iqn/alias "", tpgt -1, CHAP off, empty portal list.
 * NULL when memory is short. */
iscsi_target_t *iscsi_target_new(void);
/* Detaches its sessions (korvadm_sess.h), unlinks the record, frees its
 * portal list and itself; NULL is ignored. */
void iscsi_target_free(iscsi_target_t *target);
/* 1 when both targets are given and carry the same non-empty IQN, else 0
 * (a missing one logs "lhs or rhs is NULL"). */
int iscsi_target_cmp(const iscsi_target_t *lhs, const iscsi_target_t *rhs);
/* Zeroed record: lun_num -1, hba_id -1. NULL when memory is short. */
iscsi_lun_t *iscsi_lun_new(void);
/* Unlinks and frees; NULL is ignored. */
void iscsi_lun_free(iscsi_lun_t *lun);
/* Zeroed records (a mapping's lun_num -1, a LUN ACL's right deny, no
 * references); NULL when memory is short. Each free unlinks the record and
 * frees it alone, never what it refers to; NULL is ignored. */
iscsi_initiator_t *iscsi_initiator_new(void);
void iscsi_initiator_free(iscsi_initiator_t *initiator);  /* detaches its sessions first */
iscsi_map_lun_t *iscsi_map_lun_new(void);
void iscsi_map_lun_free(iscsi_map_lun_t *map_lun);
iscsi_lun_acl_t *iscsi_lun_acl_new(void);
void iscsi_lun_acl_free(iscsi_lun_acl_t *lun_acl);

/* Initiator lists, by exact name: free a whole list; 1 when both names are
 * non-empty and byte for byte equal, else 0; the listed initiator of that
 * name or NULL; that one, else a new one appended (NULL for a missing list,
 * an empty name or one that does not fit, or no memory). */
void iscsi_initiator_free_list(list_t *list);
int iscsi_initiator_cmp(const char *lhs, const char *rhs);
iscsi_initiator_t *iscsi_initiator_list_search(list_t *list, const char *name);
iscsi_initiator_t *iscsi_initiator_list_add(list_t *list, const char *name);

/* The operations table: 22 slots in this fixed order. */
typedef struct iscsi_mod_ops_s {
    int (*start_module)(void);                                         /* 0 */
    int (*stop_module)(void);                                          /* 1 */
    int (*get_module_state)(void);                                     /* 2: 1 stopped, 0 running, -9974 half */
    int (*add_target)(iscsi_target_t *target);                         /* 3 */
    int (*del_target)(iscsi_target_t *target);                         /* 4 */
    int (*enable_target)(iscsi_target_t *target);                      /* 5 */
    int (*disable_target)(iscsi_target_t *target);                     /* 6 */
    int (*set_target_chap)(iscsi_target_t *target);                    /* 7 */
    int (*set_target_ip)(iscsi_target_t *target);                      /* 8 */
    int (*set_target_attr_dataout_timeout)(int timeout, iscsi_target_t *target); /* 9 */
    int (*get_target_existing_ip_list)(list_t *ip_list, iscsi_target_t *target); /* 10 */
    int (*add_backstore)(iscsi_lun_t *lun);                            /* 11 */
    int (*del_backstore)(iscsi_lun_t *lun);                            /* 12 */
    int (*shutdown_backstore)(iscsi_lun_t *lun);                       /* 13 */
    int (*change_backstore_size)(iscsi_lun_t *lun);                    /* 14 */
    int (*add_lun_mapping)(iscsi_lun_t *lun, iscsi_target_t *target, int lun_number); /* 15 */
    int (*del_lun_mapping)(iscsi_lun_t *lun, iscsi_target_t *target);  /* 16 */
    int (*add_acl_initiator)(const char *initiator_name, iscsi_target_t *target); /* 17 */
    int (*del_acl_initiator)(const char *initiator_name, iscsi_target_t *target); /* 18 */
    int (*add_lun_acl)(iscsi_lun_acl_t *lun_acl);                      /* 19 */
    int (*del_lun_acl)(iscsi_lun_acl_t *lun_acl);                      /* 20 */
    int (*get_target_session)(list_t *sess_list, list_t *initiator_list, iscsi_target_t *target); /* 21 */
} iscsi_mod_ops_t;

#define ISCSI_MOD_TYPE_LIO 2

/* The selected table; NULL until iscsi_mod_select succeeds. Tests may point
 * it at a table of their own. */
extern const iscsi_mod_ops_t *iscsi_mod_ops;

/* Selects the back end: 2 (LIO) selects it and returns 0; a negative type
 * -9989; any other -9977 (the selection is then unchanged). */
int iscsi_mod_select(int type);

/* Slots 0..2. With no table: start/stop -9976, get_state 1 (stopped). */
int iscsi_mod_start(void);
int iscsi_mod_stop(void);
int iscsi_mod_get_state(void);

/* Slots 3..10; target (and list) must be non-NULL, timeout >= 0. */
int iscsi_mod_add_target(iscsi_target_t *target);
int iscsi_mod_del_target(iscsi_target_t *target);
int iscsi_mod_enable_target(iscsi_target_t *target);
int iscsi_mod_disable_target(iscsi_target_t *target);
int iscsi_mod_set_target_chap(iscsi_target_t *target);
int iscsi_mod_set_target_ip(iscsi_target_t *target);
int iscsi_mod_set_dataout_timeout(int timeout, iscsi_target_t *target);
/* Appends the target's portals in the kernel to ip_list (iscsi_ip_t). */
int iscsi_mod_get_target_ip_list(list_t *ip_list, iscsi_target_t *target);

/* Slots 11..21. del_backstore with no table answers -9976. */
int iscsi_mod_add_backstore(iscsi_lun_t *lun);
int iscsi_mod_del_backstore(iscsi_lun_t *lun);
int iscsi_mod_shutdown_backstore(iscsi_lun_t *lun);
int iscsi_mod_change_backstore_size(iscsi_lun_t *lun);
int iscsi_mod_add_lun_mapping(iscsi_lun_t *lun, iscsi_target_t *target, int lun_number);
int iscsi_mod_del_lun_mapping(iscsi_lun_t *lun, iscsi_target_t *target);
int iscsi_mod_add_acl_initiator(const char *initiator_name, iscsi_target_t *target);
int iscsi_mod_del_acl_initiator(const char *initiator_name, iscsi_target_t *target);
/* lun_acl, its map_lun and its initiator must all be non-NULL. */
int iscsi_mod_add_lun_acl(iscsi_lun_acl_t *lun_acl);
int iscsi_mod_del_lun_acl(iscsi_lun_acl_t *lun_acl);
int iscsi_mod_get_target_session(list_t *sess_list, list_t *initiator_list, iscsi_target_t *target);

/* The portals the kernel holds for target (target_iqn, tpgt), appended to
 * ip_list as iscsi_ip_t records (ipv4 or ipv6 text, port, interface of a
 * link-local address); the caller frees them. -9989 for a NULL pointer, an
 * empty IQN, a negative tpgt or no table; -9987 when memory is short; -9973
 * when the kernel's portal list cannot be read (ip_list then unchanged). */
int iscsi_mod_get_target_ip_list_in_target_parm(list_t *ip_list, const char *target_iqn, int tpgt);

#ifdef __cplusplus
}
#endif

#endif
