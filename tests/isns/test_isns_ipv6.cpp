// The client over IPv6 loopback. [::1]:3205 is the one IPv6 address loopback
// has, so these tests hold the "isns_ipv6" lock and skip when another server
// already listens there.
#include <gtest/gtest.h>

#include "tests/isns/isns_test_util.h"
#include "tests/support/isns_isnsd.h"

using namespace isns_test;

namespace {
constexpr const char *kT1 = "iqn.2026-01.test:nas1.t1";

bool v6_port_free()
{
    return !korv_test::tcp_port_open("::1", 3205);
}
}  // namespace

TEST(IsnsIpv6, OpenIsnsOverIpv6)
{
    if (!korv_test::isnsd_available())
        GTEST_SKIP() << "isnsd/isnsadm not installed";
    if (!v6_port_free())
        GTEST_SKIP() << "[::1]:3205 is held by a server this test did not start";
    korv_test::isnsd_server srv("::1");
    ASSERT_TRUE(srv.start()) << srv.error();
    reset_client("::1", AF_INET6);
    std::snprintf(isns_entity_name, sizeof isns_entity_name, "%s", kT1);
    isns_iscsi_node *t1 = make_node(kT1, 1, {"fe80::1", "10.0.0.1"});
    EXPECT_EQ(register_entity(t1), 0);
    EXPECT_EQ(isns_check_registration(kT1), 1);
    EXPECT_EQ(deregister_entity(kT1), 0);
    EXPECT_EQ(isns_check_registration(kT1), 0);
    isns_iscsi_node_free(t1);
}
