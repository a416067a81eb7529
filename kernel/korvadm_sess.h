// SPDX-License-Identifier: Apache-2.0
/* A target's live iSCSI sessions and their connections, as the kernel lists
 * them (lio3_get_target_session fills them; korvadm_mod_lio4.h).
 *
 * Ownership: a session belongs to the caller's session list and owns its
 * connections. It also sits, unowned, in its target's and its initiator's
 * session lists (`sess_list` of iscsi_target_t / iscsi_initiator_t), and
 * points at both without owning them. iscsi_sess_free unlinks it from all
 * three lists and frees its connections; freeing a target or an initiator
 * first detaches the sessions that still point at it. A list of sessions,
 * whichever of the three it is, is released with iscsi_sess_free_list.
 *
 * Comparisons answer 1 equal / 0 different, and -9989 when an argument is
 * missing (logged "ERR_PARAM_ERROR"). */
#ifndef KORVADM_SESS_H
#define KORVADM_SESS_H

#include <stdint.h>

#include "common/korvadm_list.h"
#include "kernel/korvadm_mod.h"

#ifdef __cplusplus
extern "C" {
#endif

#define ISCSI_ISID_LEN 6

/* One connection of a session. Texts are heap copies, NULL when absent. */
typedef struct iscsi_conn_s {
    int cid;                    /* connection id, >= 0 */
    char *address;              /* the initiator's address text */
    char *local_address;        /* never filled by the kernel's listing */
    char *initiator_name;
    list_node_t node;           /* in the session's conn_list */
} iscsi_conn_t;

/* One session of a target with one initiator. */
typedef struct iscsi_sess_s {
    iscsi_target_t *target;             /* not owned */
    iscsi_initiator_t *initiator;       /* not owned */
    uint64_t sid;                       /* the kernel's session id */
    int32_t tsih;                       /* -1 when unknown */
    uint8_t isid[ISCSI_ISID_LEN];
    list_node_t node;                   /* in the caller's session list */
    list_node_t initiator_node;         /* in initiator->sess_list */
    list_node_t target_node;            /* in target->sess_list */
    list_t conn_list;                   /* iscsi_conn_t, owned */
} iscsi_sess_t;

/* Zeroed session (tsih -1, no target or initiator, no connection); NULL
 * when memory is short ("malloc iscsi_sess_t failed"). */
iscsi_sess_t *iscsi_sess_new(void);
/* Frees the connections, unlinks the session from all three lists and frees
 * it. NULL logs "ERR_PARAM_ERROR". */
void iscsi_sess_free(iscsi_sess_t *sess);
/* Frees every session of the list, from the head, until it is empty. The
 * list may be any of the three a session sits in. NULL: nothing happens. */
void iscsi_sess_free_list(list_t *list);
/* Detaches every session of a target's or initiator's sess_list from it
 * (unlinks that node, clears that pointer) without freeing any. */
void iscsi_sess_detach_list(list_t *list);

/* Same sid, targets equal (iscsi_target_cmp), initiators the same record or
 * equal by name (iscsi_initiator_cmp). */
int _iscsi_sess_cmp(const iscsi_sess_t *lhs, const iscsi_sess_t *rhs);
/* Appends sess to list by its caller's-list node; NULL logs "ERR_PARAM_ERROR". */
void _iscsi_sess_list_add(list_t *list, iscsi_sess_t *sess);
/* The first listed session equal to (sid, target, initiator), or NULL. */
iscsi_sess_t *iscsi_sess_list_search(list_t *list, uint64_t sid, iscsi_target_t *target,
                                     iscsi_initiator_t *initiator);
iscsi_sess_t *iscsi_sess_list_search_node(list_t *list, const iscsi_sess_t *sess);
/* The listed session equal to (sid, target, initiator), unchanged (its isid
 * and tsih are not updated); else a new one filled from the arguments and
 * appended. NULL for a missing argument or when memory is short. */
iscsi_sess_t *iscsi_sess_list_add(list_t *list, uint64_t sid, const uint8_t isid[ISCSI_ISID_LEN],
                                  int32_t tsih, iscsi_target_t *target, iscsi_initiator_t *initiator);
/* -1 when sess itself is listed, -2 when an equal one is, else appends it
 * and answers 0. -9989 for NULL. */
int iscsi_sess_list_add_node(list_t *list, iscsi_sess_t *sess);

/* Zeroed connection (cid -1, no texts); NULL when memory is short. */
iscsi_conn_t *iscsi_conn_new(void);
/* Unlinks the connection and frees it with its texts; NULL is ignored. */
void iscsi_conn_free(iscsi_conn_t *conn);
/* Both cids non-negative and equal, addresses of the same length and bytes
 * (two absent addresses are equal). local_address takes no part. */
int _iscsi_conn_cmp(const iscsi_conn_t *lhs, const iscsi_conn_t *rhs);
void _iscsi_conn_list_add(list_t *list, iscsi_conn_t *conn);
/* The first connection equal to (cid, address); local is accepted and
 * ignored. NULL for a negative cid or a NULL address. */
iscsi_conn_t *iscsi_conn_list_search(list_t *list, int cid, const char *local, const char *address);
iscsi_conn_t *iscsi_conn_list_search_node(list_t *list, const iscsi_conn_t *conn);
/* The listed equal connection, or a new one appended with copies of the
 * non-empty texts (an empty text leaves its field NULL). NULL for a negative
 * cid, a NULL address or when memory is short. */
iscsi_conn_t *iscsi_conn_list_add(list_t *list, int cid, const char *local, const char *address,
                                  const char *initiator_name);
int iscsi_conn_list_add_node(list_t *list, iscsi_conn_t *conn);

/* The target's live sessions appended to sess_list (through the selected
 * driver table, iscsi_mod_get_target_session); initiators met are looked up
 * in, or added to, initiator_list. */
int iscsi_sess_get_target_session(list_t *sess_list, list_t *initiator_list, iscsi_target_t *target);

#ifdef __cplusplus
}
#endif

#endif
