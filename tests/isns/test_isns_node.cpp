// SPDX-License-Identifier: Apache-2.0
// The node and portal records: list membership and release.
#include <gtest/gtest.h>

#include "common/korvadm_err.h"
#include "tests/isns/isns_test_util.h"

TEST(IsnsRecords, ListsRefuseDoubleMembershipAndReleaseEverything)
{
    isns_iscsi_node *n = isns_test::make_node("iqn.x:t1", 1, {"10.0.0.1", "10.0.0.2", "::1"});
    auto *first = static_cast<isns_ip_portal *>(n->portals.head->owner);
    EXPECT_EQ(isns_iscsi_node_add_portal(n, first), ERR_PARAM);  // already listed
    EXPECT_EQ(isns_iscsi_node_add_portal(nullptr, first), ERR_PARAM);
    isns_ip_portal_free(first);  // unlinks itself
    EXPECT_EQ(static_cast<isns_ip_portal *>(n->portals.head->owner)->address[15], 2);
    list_t nodes;
    list_init(&nodes);
    EXPECT_EQ(isns_iscsi_node_list_add(&nodes, n), 0);
    EXPECT_EQ(isns_iscsi_node_list_add(&nodes, n), ERR_PARAM);
    EXPECT_EQ(isns_iscsi_node_list_add(&nodes, isns_test::make_node("iqn.x:t2", 1, {"10.0.0.3"})), 0);
    isns_iscsi_node_list_release(&nodes);  // frees nodes and portals (the sanitizer pass checks)
    EXPECT_TRUE(list_is_empty(&nodes));
}
