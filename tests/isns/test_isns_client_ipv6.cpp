// SPDX-License-Identifier: Apache-2.0
// The client over IPv6 loopback. [::1]:3205 is the one IPv6 address loopback
// has, so these tests hold the "isns_ipv6" lock and skip when another server
// already listens there.
#include <gtest/gtest.h>

#include "tests/isns/isns_test_util.h"

using namespace isns_test;

TEST(IsnsIpv6, OpenIsnsOverIpv6)
{
    if (tcp_port_open("::1", 3205))
        GTEST_SKIP() << "[::1]:3205 is held by a server this test did not start";
    const char *t1 = "iqn.2026-01.test:nas1.t1";
    START_ISNSD(srv, "::1", AF_INET6, t1);
    isns_iscsi_node *n = make_node(t1, 1, {"fe80::1", "10.0.0.1"});
    EXPECT_EQ(register_entity(n), 0);
    EXPECT_EQ(isns_check_registration(t1), 1);  // both ways over IPv6
    isns_iscsi_node_free(n);
}
