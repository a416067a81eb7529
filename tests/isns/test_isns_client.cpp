// SPDX-License-Identifier: Apache-2.0
// Registration, check and deregistration against Debian's Open-iSNS server.
#include <gtest/gtest.h>

#include "tests/isns/isns_test_util.h"

using namespace isns_test;

namespace {

constexpr const char *kT1 = "iqn.2026-01.test:nas1.t1";
constexpr const char *kT2 = "iqn.2026-01.test:nas1.t2";

// Registers the entity with a node named t1, then t2 (tags and portals given).
int register_two(uint32_t tag2, const std::vector<std::string> &portals1, const std::vector<std::string> &portals2)
{
    isns_iscsi_node *t1 = make_node(kT1, 1, portals1), *t2 = make_node(kT2, tag2, portals2);
    EXPECT_EQ(register_entity(t1), 0) << "status " << isns_last_status;
    const int rc = register_node(t2);
    isns_iscsi_node_free(t1);
    isns_iscsi_node_free(t2);
    return rc;
}

}  // namespace

TEST(IsnsOpenIsns, RegistrationLifecycle)
{
    START_ISNSD(srv, "127.10.4.1", AF_INET, kT1);
    const std::vector<std::string> both = {"192.168.1.10", "2001:db8::10"};
    EXPECT_EQ(register_two(1, both, both), 0) << "status " << isns_last_status;
    for (auto [list, want] : {std::pair{"entities", "nas1"}, {"nodes", kT1}, {"nodes", kT2},
                              {"portals", "192.168.1.10"}, {"portals", "2001:db8::10"}, {"portals", "3260"},
                              {"portal-groups", "Portal group tag = 1"}})
        EXPECT_NE(srv.adm(std::string("--list ") + list).find(want), std::string::npos) << want;
    EXPECT_EQ(isns_check_registration(kT1), 1);

    EXPECT_EQ(deregister_entity(kT1), 0);
    EXPECT_EQ(isns_check_registration(kT1), 0);

    // A further node may name only the entity's portals. (A restarted server
    // knows the source no more than after the deregistration: one check.)
    EXPECT_EQ(register_two(2, {"192.168.1.10"}, {"192.168.1.20"}), -1);
    EXPECT_EQ(isns_last_status, 3);
}
