// SPDX-License-Identifier: Apache-2.0
/* The records a registration is built from: one iSCSI target node and its
 * portals. The encoder (isns_pdu.h) reads them, the operations
 * (isns_client.h) send them, the daemon fills them. */
#ifndef ISNS_NODE_H
#define ISNS_NODE_H

#include <stdint.h>

#include "common/korvadm_list.h"

#ifdef __cplusplus
extern "C" {
#endif

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

#ifdef __cplusplus
}
#endif

#endif
