// SPDX-License-Identifier: Apache-2.0
// Portal directory names: parsing, and wanted portals whose names would
// leave the np directory. The kernel's list is read in test_mod.cpp.
#include "tests/kernel/lio4_test.h"
#include "tests/support/data_cases.h"

namespace {

using korv_test::Lio4Test;

// Names as the kernel lists them: also portals.tree, read in test_mod.cpp.
TEST_F(Lio4Test, PortalNamesParse)
{
    char addr[40], iface[16];
    for (const auto &[name, want] : data_cases("portal_names.txt")) {
        int port = -1;
        const int rc = _parse_lio_np_entry(addr, sizeof addr, &port, iface, sizeof iface, name.c_str());
        const std::string got = rc ? std::to_string(rc) : "0 " + std::string(addr) + " " + (*iface ? iface : "-");
        EXPECT_EQ(got + (rc ? "" : " " + std::to_string(port)), want) << name;
    }
}

TEST_F(Lio4Test, WantedPortalsThatWouldLeaveTheirDirectoryAreRefusedWhole)
{
    load_tree("portals.tree");
    const std::string kept = at(TPG) + "/np/[fe80::1%eth0]:3260";
    const char *hostile[][2] = {
        {"fe80::1", "eth0]:3260/../../../../../../../../../escaped"},  // up to the root
        {"fe80::1", "eth0]:3260/../../../../iqn.x:other"},
        {"fe80::1", ".."},
        {"2001:db8::9/../../x", ""},
    };
    for (auto *set : {lio3_set_target_ip, lio3_set_target_ip_v2}) {
        for (auto &h : hostile) {
            iscsi_ip_free_list(&target.ip_list);
            iscsi_ip_t *ip = iscsi_ip_new();
            std::strcpy(ip->ipv6, h[0]);
            std::strcpy(ip->dev_name, h[1]);
            ip->port = 3261;
            list_append(&ip->node, &target.ip_list);
            EXPECT_EQ(set(&target), ERR_PARAM) << h[0] << " " << h[1];
            EXPECT_TRUE(exists(kept)) << "a portal went before the list was refused";
        }
    }
    EXPECT_FALSE(exists(at("/escaped]:3261")));
    EXPECT_FALSE(exists(at("/sys/kernel/config/target/iscsi/iqn.x:other]:3261")));
    EXPECT_EQ(_lio3_create_network_portal(IQN, 1, "a/b", "fe80::2", 3260, IP_TYPE_V6), ERR_PARAM);
}

}  // namespace
