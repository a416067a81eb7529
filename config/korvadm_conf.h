// SPDX-License-Identifier: Apache-2.0
/* Configuration records, the configuration operations table type and the
 * configuration context.
 *
 * The store hands configuration out as heap records of fixed layout that
 * embed a list node, so a whole set travels as one list_t. Each kind has
 * *_new (NULL on no memory, logged), *_free (NULL ignored; unlinks first) and
 * *_free_list (frees every record; the header stays usable). Text fields are
 * NUL-terminated and cut to their size; integers the database may lack start
 * at -1 ("unknown"); dbidx is the entry number in the database list, 0 while
 * not stored.
 *
 * Every user reaches the store through an iscsi_conf_ops_t: a leading integer
 * (1) and 119 operation slots in fixed order. Empty slots are NULL; callers
 * test slots they are not sure of. The context filled by iscsi_conf_init
 * carries the host name in IQN form and the table. */
#ifndef CONFIG_KORVADM_CONF_H
#define CONFIG_KORVADM_CONF_H

#include <stddef.h>
#include <stdint.h>

#include "common/korvadm_list.h"

#ifdef __cplusplus
extern "C" {
#endif

#define CONF_NAME_LEN     128
#define CONF_IQN_LEN      256
#define CONF_IMG_FILE_LEN 4096
/* Room for a generated IQN, and for the stored prefix. */
#define CONF_GEN_IQN_LEN  224
#define CONF_HOST_NAME_LEN 128

/* Capacities of the database lists. */
#define CONF_MAX_TARGETS 64
#define CONF_MAX_LUNS    128
#define CONF_MAX_ACLS    129
#define CONF_MAX_MAP_LUNS 128

typedef struct target_conf_s {
    int32_t dbidx;
    char name[CONF_NAME_LEN];      /* the key; also called the target suffix */
    char iqn[CONF_IQN_LEN];        /* readers fill it before use */
    int32_t tpgt;
    int32_t state;
    int32_t chap_enable;           /* 0/1 */
    int32_t hba_id;                /* kernel back-end number */
    char chap_name[CONF_NAME_LEN];
    char chap_pwd[CONF_NAME_LEN];
    char status[CONF_NAME_LEN];
    list_node_t node;
} target_conf_t;

typedef struct lun_conf_s {
    int32_t dbidx;
    char name[CONF_NAME_LEN];
    char uuid[CONF_NAME_LEN];      /* of the backing volume */
    char serial[CONF_NAME_LEN];
    int32_t reserved_int1;         /* for the management logic; -1 */
    int32_t reserved_int2;         /* for the management logic; -1 */
    int32_t devid;
    void *priv;                    /* heap buffer owned by the record; freed by lun_conf_free */
    uint64_t size;                 /* bytes */
    uint64_t alloc_size;
    int32_t vol_state;
    int32_t prealloc;              /* 0/1 */
    int32_t prealloc_state;
    int32_t connected;
    char target_name[CONF_NAME_LEN]; /* "" when not mapped */
    int32_t lun_num;
    char reserved_text[CONF_NAME_LEN]; /* for the management logic */
    char img_file[CONF_IMG_FILE_LEN];  /* readers fill it before use */
    list_node_t node;
} lun_conf_t;

typedef struct target_map_lun_conf_s {
    int32_t dbidx;
    char target_name[CONF_NAME_LEN];
    char lun_name[CONF_NAME_LEN];
    int32_t lun_num;
    list_node_t node;
} target_map_lun_conf_t;

typedef struct acl_initiator_conf_s {
    int32_t dbidx;
    char alias[CONF_NAME_LEN];
    char initiator[CONF_IQN_LEN];
    list_node_t node;
} acl_initiator_conf_t;

typedef struct lun_acl_conf_s {
    int32_t dbidx;
    char alias[CONF_NAME_LEN];
    char initiator[CONF_IQN_LEN];
    int32_t access_right;          /* 0 deny, 1 read-only, 2 read-write */
    list_node_t node;
} lun_acl_conf_t;

target_conf_t *target_conf_new(void);
void target_conf_free(target_conf_t *conf);
void target_conf_free_list(list_t *list);
lun_conf_t *lun_conf_new(void);
void lun_conf_free(lun_conf_t *conf);
void lun_conf_free_list(list_t *list);
target_map_lun_conf_t *target_map_lun_conf_new(void);
void target_map_lun_conf_free(target_map_lun_conf_t *conf);
void target_map_lun_conf_free_list(list_t *list);
acl_initiator_conf_t *acl_initiator_conf_new(void);
void acl_initiator_conf_free(acl_initiator_conf_t *conf);
void acl_initiator_conf_free_list(list_t *list);
lun_acl_conf_t *lun_acl_conf_new(void);
void lun_acl_conf_free(lun_acl_conf_t *conf);
void lun_acl_conf_free_list(list_t *list);

/* "DENY" 0, "RO" 1, "RW" 2, matched case-insensitively on the text's start
 * (so "Rox" and "ROOT" are 1). -1 for NULL, "", more than 10 characters, or
 * no match. A 10-character text is matched on its first 9. */
int iscsi_conf_parse_access_right(const char *text);

/* The empty slots of the table; never called. */
typedef void (*conf_empty_slot_t)(void);

typedef struct iscsi_conf_ops_s {
    int32_t conf_type;             /* 1: the configuration database */
    /* service settings */
    int (*xmldb_get_service_enable)(int *enable);                          /* 1 */
    int (*xmldb_set_service_enable)(int enable);
    int (*xmldb_get_korvadm_ver)(int *ver);
    int (*xmldb_set_korvadm_ver)(int ver);
    int (*xmldb_get_service_progress)(int *progress);                      /* 5 */
    int (*xmldb_set_service_progress)(int progress);
    int (*xmldb_get_saved_host_name)(char *buf, size_t size);
    int (*xmldb_set_saved_host_name)(const char *host_name);
    int (*xmldb_get_iqn_prefix)(char *buf, size_t size);
    int (*xmldb_set_iqn_prefix)(const char *prefix);                       /* 10 */
    int (*xmldb_get_saved_ipv4_addr)(char *buf, const char *dev_name);
    int (*xmldb_set_saved_ipv4_addr)(const char *addr, const char *dev_name);
    int (*xmldb_get_saved_ipv6_addr)(char *buf, const char *dev_name);
    int (*xmldb_set_saved_ipv6_addr)(const char *addr, const char *dev_name);
    int (*xmldb_clean_saved_ip_addr)(void);                                /* 15 */
    int (*xmldb_get_debug_level)(int *level);
    int (*xmldb_set_debug_level)(int level);
    conf_empty_slot_t empty_18;
    conf_empty_slot_t empty_19;
    conf_empty_slot_t empty_20;
    /* targets */
    int (*xmldb_add_new_target)(target_conf_t *conf);                      /* 21 */
    int (*xmldb_del_target_by_name)(const char *name);
    int (*xmldb_check_target_exist)(const char *name);
    int (*xmldb_check_add_target)(const char *name);
    int (*xmldb_get_target_state)(int *state, const char *name);           /* 25 */
    int (*xmldb_set_target_state)(int state, const char *name);
    int (*xmldb_get_target_tpgt)(int *tpgt, const char *name);
    conf_empty_slot_t empty_28;
    int (*xmldb_get_target_hba_id)(int *hba_id, const char *name);
    int (*xmldb_set_target_hba_id)(int hba_id, const char *name);          /* 30 */
    int (*xmldb_get_free_target_hba_id)(int *hba_id);
    conf_empty_slot_t empty_32;
    conf_empty_slot_t empty_33;
    conf_empty_slot_t empty_34;
    conf_empty_slot_t empty_35;
    conf_empty_slot_t empty_36;
    conf_empty_slot_t empty_37;
    int (*xmldb_get_target_iqn)(char *buf, size_t size, const char *name);
    int (*xmldb_set_target_iqn)(const char *iqn, const char *name);
    int (*xmldb_set_target_chap)(int chap_enable, const char *chap_name,   /* 40 */
                                 const char *chap_pwd, const char *name);
    conf_empty_slot_t empty_41;
    conf_empty_slot_t empty_42;
    conf_empty_slot_t empty_43;
    int (*xmldb_update_current_targetcnt)(void);
    int (*xmldb_get_target_status)(char *buf, size_t size, const char *name); /* 45 */
    int (*xmldb_set_target_status)(const char *status, const char *name);
    int (*xmldb_get_target_conf_by_name)(target_conf_t *conf, const char *name);
    int (*xmldb_get_all_target_conf_lite)(list_t *list);
    int (*xmldb_get_all_target_conf)(list_t *list);
    int (*xmldb_get_target_map_lun_conf)(const char *target_name, list_t *list); /* 50 */
    conf_empty_slot_t empty_51;
    int (*xmldb_clean_target_conf)(void);
    /* LUNs */
    int (*xmldb_add_new_lun)(lun_conf_t *conf);
    int (*xmldb_del_lun_by_name)(const char *name);
    int (*xmldb_check_lun_exist)(const char *name);                        /* 55 */
    int (*xmldb_check_add_lun)(const char *name);
    int (*xmldb_get_lun_uuid)(char *buf, size_t size, const char *name);
    conf_empty_slot_t empty_58;
    int (*xmldb_get_lun_img_file)(char *buf, size_t size, const char *name);
    int (*xmldb_get_lun_serial)(char *buf, size_t size, const char *name); /* 60 */
    int (*xmldb_set_lun_serial)(const char *serial, const char *name);
    int (*xmldb_get_lun_vol_state)(int *vol_state, const char *name);
    int (*xmldb_set_lun_vol_state)(int vol_state, const char *name);
    int (*xmldb_get_lun_size)(uint64_t *size, const char *name);
    int (*xmldb_set_lun_size)(uint64_t size, const char *name);            /* 65 */
    int (*xmldb_get_lun_alloc_size)(uint64_t *size, const char *name);
    int (*xmldb_set_lun_alloc_size)(uint64_t size, const char *name);
    int (*xmldb_get_lun_connect_state)(int *connected, const char *name);
    int (*xmldb_set_lun_connect_state)(int connected, const char *name);
    int (*xmldb_get_free_lun_devid)(int *devid);                           /* 70 */
    conf_empty_slot_t empty_71;
    conf_empty_slot_t empty_72;
    int (*xmldb_get_lun_prealloc)(int *prealloc, const char *name);
    conf_empty_slot_t empty_74;
    int (*xmldb_get_lun_prealloc_state)(int *state, const char *name);     /* 75 */
    int (*xmldb_set_lun_prealloc_state)(int state, const char *name);
    int (*xmldb_set_lun_prealloc_progress)(int progress, const char *name);
    int (*xmldb_get_lun_status)(char *buf, size_t size, const char *name);
    int (*xmldb_set_lun_status)(const char *status, const char *name);
    int (*xmldb_get_all_lun_conf)(list_t *list);                           /* 80 */
    int (*xmldb_get_all_lun_conf_lite)(list_t *list);
    int (*xmldb_get_lun_conf_by_uuid)(lun_conf_t *conf, const char *uuid);
    int (*xmldb_get_lun_conf_by_name)(lun_conf_t *conf, const char *name);
    int (*xmldb_update_lun_current_count)(void);
    int (*xmldb_get_all_lun_conf_in_crash_conf)(list_t *list);             /* 85 */
    /* ACLs */
    int (*xmldb_check_acl_initiaor_exist)(const char *initiator);
    int (*xmldb_check_acl_alias_exist)(const char *alias);
    int (*xmldb_check_add_acl_initiator)(const char *initiator, const char *alias);
    int (*xmldb_add_acl_initiator)(const char *initiator, const char *alias);
    int (*xmldb_del_acl_initiator)(const char *initiator);                 /* 90 */
    int (*xmldb_get_all_acl_initiator_conf_lite)(list_t *list);
    int (*xmldb_set_lun_acl)(const char *initiator, const char *alias,
                             const char *lun_name, int access_right);
    conf_empty_slot_t empty_93;
    int (*xmldb_get_all_lun_acl_conf_from_lun)(const char *lun_name, list_t *list);
    int (*xmldb_remove_lun_from_all_acl)(const char *lun_name);            /* 95 */
    int (*xmldb_update_current_aclcnt)(void);
    int (*xmldb_get_initiator_name_from_alias)(char *buf, size_t size, const char *alias);
    int (*xmldb_clean_acl_conf)(void);
    /* target-LUN mapping */
    int (*xmldb_add_target_lun_map)(const char *target_name, const char *lun_name, int lun_num);
    conf_empty_slot_t empty_100;                                           /* 100 */
    int (*xmldb_del_target_lun_map)(const char *target_name, const char *lun_name);
    int (*xmldb_get_free_lun_num)(int *lun_num, const char *target_name);
    int (*xmldb_get_mapping_target)(char *target_name, size_t size, int *lun_num,
                                    const char *lun_name);
    conf_empty_slot_t empty_104;
    /* volume totals, daemon settings, sessions, whole store */
    int (*xmldb_update_total_vol_size_info)(list_t *volumes);              /* 105 */
    int (*xmldb_get_nesrad_pid)(int *pid);
    int (*xmldb_set_nesrad_pid)(int pid);
    int (*xmldb_get_nesrad_enable)(int *enable);
    int (*xmldb_set_nesrad_enable)(int enable);
    int (*xmldb_get_nesrad_ip)(char *buf, size_t size);                    /* 110 */
    int (*xmldb_set_nesrad_ip)(const char *ip);
    int (*xmldb_clean_nesrad_conf)(void);
    int (*xmldb_clean_sess_conf)(void);
    int (*xmldb_update_sess_acl_lun_access_status)(const char *initiator,
                                                   const char *lun_name, unsigned status);
    int (*xmldb_save_conf)(void);                                          /* 115 */
    int (*xmldb_clean_conf)(void);
    int (*xmldb_set_temp_return_code)(int code);
    int (*xmldb_del_target_conn_info)(const char *name);
    int (*xmldb_set_target_conn_info)(const char *name, int conn, const char *ip,
                                      const char *iqn);                    /* 119 */
} iscsi_conf_ops_t;

/* The configuration context: what the daemon and the tool hold. */
typedef struct iscsi_conf_ctx_s {
    char host_name[CONF_HOST_NAME_LEN]; /* host name in IQN form */
    const iscsi_conf_ops_t *ops;
} iscsi_conf_ctx_t;

/* Points ctx at iscsi_conf_ops and fills its host name (refreshed, IQN form).
 * -9989 for NULL; -9981 after printing "get host name failed" when the host
 * name cannot be had; else 0. */
int iscsi_conf_init(iscsi_conf_ctx_t *ctx);

/* Writes prefix + first + ":" + second into out (cut to 224 bytes), the prefix
 * being the stored IQN prefix ("" when unset). Returns the length the
 * formatting produced (may exceed 223 when cut), or -9989 for a NULL argument.
 * REQUIRES: out holds CONF_GEN_IQN_LEN bytes. */
int iscsi_conf_generate_iqn(char *out, const char *first, const char *second);

#ifdef __cplusplus
}
#endif

#endif
