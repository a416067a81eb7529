// SPDX-License-Identifier: Apache-2.0
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

#include "isns/isns_node.h"

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

/* Registration Period (RFC 4171, 6.2.6; seconds) that the server gave in its
 * answer to the last register_entity(); 0 when it gave none or did not
 * answer. The server drops the entity when neither a registration nor a query
 * from one of its nodes comes within the period. */
extern uint32_t isns_registration_period;

/* DevAttrReg of the entity with this first node, its portals and portal
 * groups; sets isns_registration_period from the answer.
 * REQUIRES: isns_entity_name already holds node->name.
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
