// SPDX-License-Identifier: Apache-2.0
// The node and portal records the registrations are built from.
#include "isns/isns_node.h"

#include "common/korvadm_err.h"

isns_ip_portal *isns_ip_portal_new(void)
{
    return korv::list_record_new(&isns_ip_portal::link);
}

isns_iscsi_node *isns_iscsi_node_new(void)
{
    isns_iscsi_node *n = korv::list_record_new(&isns_iscsi_node::link);
    if (n)
        list_init(&n->portals);
    return n;
}

void isns_ip_portal_free(isns_ip_portal *portal)
{
    korv::list_record_free(portal, &isns_ip_portal::link);
}

void isns_iscsi_node_free(isns_iscsi_node *node)
{
    if (node)
        list_release(&node->portals, [](void *p) { isns_ip_portal_free(static_cast<isns_ip_portal *>(p)); });
    korv::list_record_free(node, &isns_iscsi_node::link);
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
