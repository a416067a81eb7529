// SPDX-License-Identifier: Apache-2.0
// Registration, check and deregistration against Debian's Open-iSNS server.
#include <gtest/gtest.h>

#include "tests/isns/isns_test_util.h"

using namespace isns_test;

namespace {

constexpr const char *kT1 = "iqn.2026-01.test:nas1.t1";
constexpr const char *kT2 = "iqn.2026-01.test:nas1.t2";

// Registers the entity with kT1, then kT2, both on the same two portals.
void register_two_targets()
{
    isns_iscsi_node *t1 = make_node(kT1, 1, {"192.168.1.10", "2001:db8::10"});
    isns_iscsi_node *t2 = make_node(kT2, 1, {"192.168.1.10", "2001:db8::10"});
    EXPECT_EQ(register_entity(t1), 0) << "status " << isns_last_status;
    EXPECT_EQ(register_node(t2), 0) << "status " << isns_last_status;
    isns_iscsi_node_free(t1);
    isns_iscsi_node_free(t2);
}

}  // namespace

TEST(IsnsOpenIsns, RegistrationLifecycle)
{
    START_ISNSD(srv, "127.10.4.1", AF_INET, kT1);
    register_two_targets();

    for (auto [list, want] : {std::pair{"entities", "nas1"}, {"nodes", kT1}, {"nodes", kT2},
                              {"portals", "192.168.1.10"}, {"portals", "2001:db8::10"}, {"portals", "3260"}}) {
        const std::string held = srv.adm(std::string("--list ") + list);
        EXPECT_NE(held.find(want), std::string::npos) << want << " not in:\n" << held;
    }
    const std::string groups = srv.adm("--list portal-groups");
    for (const char *t : {kT1, kT2}) {
        size_t n = 0;
        for (size_t at = groups.find(t); at != std::string::npos; at = groups.find(t, at + 1))
            n++;
        EXPECT_EQ(n, 2u) << t << " should name both portals:\n" << groups;
    }
    EXPECT_NE(groups.find("Portal group tag = 1"), std::string::npos) << groups;

    EXPECT_EQ(isns_check_registration(kT1), 1);
    EXPECT_EQ(isns_check_registration(kT2), 1);

    EXPECT_EQ(deregister_entity(kT1), 0);
    EXPECT_EQ(srv.adm("--list nodes").find(kT1), std::string::npos);
    EXPECT_EQ(isns_check_registration(kT1), 0);

    register_two_targets();
    EXPECT_EQ(isns_check_registration(kT1), 1);
    ASSERT_TRUE(srv.restart()) << srv.error();
    EXPECT_EQ(isns_check_registration(kT1), 0);

    // On the emptied server: a further node may name only the entity's portals.
    isns_iscsi_node *t1 = make_node(kT1, 1, {"192.168.1.10"});
    isns_iscsi_node *t2 = make_node(kT2, 2, {"192.168.1.20"});
    ASSERT_EQ(register_entity(t1), 0);
    EXPECT_EQ(register_node(t2), -1);
    EXPECT_EQ(isns_last_status, 3);
    EXPECT_EQ(srv.adm("--list nodes").find(kT2), std::string::npos);
    EXPECT_EQ(isns_check_registration(kT2), 0);
    isns_iscsi_node_free(t1);
    isns_iscsi_node_free(t2);

    srv.stop();
    EXPECT_EQ(isns_check_registration(kT1), -1);
}
