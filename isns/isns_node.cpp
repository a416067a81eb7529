// SPDX-License-Identifier: Apache-2.0
// The node and portal records the registrations are built from.
#include "isns/isns_node.h"

#include <cstdlib>

#include "common/korvadm_err.h"

isns_ip_portal *isns_ip_portal_new(void)
{
    auto *p = static_cast<isns_ip_portal *>(calloc(1, sizeof(isns_ip_portal)));
    if (p)
        list_node_init(&p->link, p);
    return p;
}

isns_iscsi_node *isns_iscsi_node_new(void)
{
    auto *n = static_cast<isns_iscsi_node *>(calloc(1, sizeof(isns_iscsi_node)));
    if (n) {
        list_init(&n->portals);
        list_node_init(&n->link, n);
    }
    return n;
}

void isns_ip_portal_free(isns_ip_portal *portal)
{
    if (!portal)
        return;
    list_remove(&portal->link);
    free(portal);
}

void isns_iscsi_node_free(isns_iscsi_node *node)
{
    if (!node)
        return;
    list_release(&node->portals, [](void *p) { isns_ip_portal_free(static_cast<isns_ip_portal *>(p)); });
    list_remove(&node->link);
    free(node);
}

int isns_iscsi_node_add_portal(isns_iscsi_node *node, isns_ip_portal *portal)
{
    PARAM_GUARD(!node || !portal || portal->link.list, "ERR_PARAM_ERROR");
    list_append(&portal->link, &node->portals);
    return 0;
}

int isns_iscsi_node_list_add(list_t *list, isns_iscsi_node *node)
{
    PARAM_GUARD(!list || !node || node->link.list, "ERR_PARAM_ERROR");
    list_append(&node->link, list);
    return 0;
}

void isns_iscsi_node_list_release(list_t *list)
{
    list_release(list, [](void *n) { isns_iscsi_node_free(static_cast<isns_iscsi_node *>(n)); });
}
