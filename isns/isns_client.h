/* iSNS operations of a target-only client: register an entity with its first
 * iSCSI target node, register further nodes, deregister the entity, and check
 * that the server still holds the first node.
 *
 * Each operation builds one request in the PDU buffer (isns_pdu.h) and
 * exchanges it with send_and_recv() (isns_transport.h). Every request's
 * source is isns_entity_name; the entity is keyed by isns_entity_id. Nothing
 * is retried here: the daemon's periodic check is the retry. */
#ifndef ISNS_CLIENT_H
#define ISNS_CLIENT_H

#include <stdint.h>

#include "common/korvadm_list.h"

#ifdef __cplusplus
extern "C" {
#endif

/* Entity identifier (attribute 1): the host name, lower-cased, '_' -> '-'.
 * The daemon fills it. */
extern char isns_entity_id[128];

/* iSCSI name of the first registered node: the source of every request and
 * the key of the check. The daemon sets it before registering the entity and
 * clears it (all zero) after deregistering. */
extern char isns_entity_name[256];

/* One portal of a node. */
typedef struct isns_ip_portal {
    unsigned char address[16]; /* IPv6, or IPv4 in mapped form ::ffff:a.b.c.d */
    uint32_t port;             /* TCP port, host order */
    list_node_t link;          /* in the node's portal list */
} isns_ip_portal;

/* One iSCSI target node and its portals. */
typedef struct isns_iscsi_node {
    char name[256];   /* iSCSI name (IQN) */
    uint32_t pg_tag;  /* portal group tag */
    list_t portals;   /* isns_ip_portal, in the order found */
    list_node_t link; /* for a list of nodes */
} isns_iscsi_node;

/* Zeroed records with their list and node initialised; NULL only when memory
 * is exhausted. */
isns_ip_portal *isns_ip_portal_new(void);
isns_iscsi_node *isns_iscsi_node_new(void);
/* Unlinks the portal from its list, then frees it. NULL: nothing. */
void isns_ip_portal_free(isns_ip_portal *portal);
/* Frees every portal, unlinks the node, frees it. NULL: nothing. */
void isns_iscsi_node_free(isns_iscsi_node *node);

/* Appends an unlinked portal to the node's portal list. 0, or ERR_PARAM for a
 * NULL argument or a portal already in a list. */
int isns_iscsi_node_add_portal(isns_iscsi_node *node, isns_ip_portal *portal);
/* Appends an unlinked node to a list of nodes. 0, or ERR_PARAM. */
int isns_iscsi_node_list_add(list_t *list, isns_iscsi_node *node);
/* Frees every node of the list; the header stays usable. */
void isns_iscsi_node_list_release(list_t *list);

/* DevAttrReg of the entity with this first node, its portals and portal
 * groups. REQUIRES: isns_entity_name already holds node->name.
 * 0, or the negative result of send_and_recv(); -1 for a NULL node. */
int register_entity(isns_iscsi_node *node);

/* DevAttrReg of a further node of the entity (its portal groups may name only
 * portals the entity already has). 0; -1 for a NULL node or a failure. */
int register_node(isns_iscsi_node *node);

/* DevDereg of the whole entity, with `name` as the source (NULL is sent as
 * ""). 0 on success, -1 on any failure. */
int deregister_entity(const char *name);

/* DevAttrQry for node `name` (type Target). Payload bytes (>= 4) on success;
 * -2 when the server answered with a non-zero status (see isns_last_status);
 * -1 when no valid response came (including a malformed one). */
int query_entity(const char *name);

/* 1: the server holds node `name`; 0: it does not (status 6 or 7, another
 * kind of response, or no such name in the answer); -1: a failed server, a
 * malformed answer or a NULL name. */
int isns_check_registration(const char *name);

#ifdef __cplusplus
}
#endif

#endif
