// SPDX-License-Identifier: Apache-2.0
// The daemon's node list, address conversion and check interval, in-process
// (configuration service in the test's root). Portals and what goes on the
// wire are judged by a real server in nesrad_daemon_test.
#include <gtest/gtest.h>

#include "daemon/nesrad.h"
#include "tests/daemon/daemon_harness.h"
#include "tests/support/xmldbd_fixture.h"

using namespace korv_test;

namespace {

// The list as "iqn/tpgt" entries.
std::vector<std::string> listed()
{
    std::vector<std::string> out;
    nesrad_node_t *rec = nullptr;
    for (_iqn_next(nullptr, &rec); rec; rec = rec->next)
        out.push_back(std::string(rec->iqn) + "/" + std::to_string(rec->tpgt));
    return out;
}

}  // namespace

TEST(NodeList, KeepsOrderAndDuplicatesAndDeletesTheFirstMatch)
{
    nesrad_node_t *rec = nullptr;
    EXPECT_EQ(-1, _iqn_next(nullptr, &rec)) << "empty list has no head";
    const std::string longest(255, 'q');
    for (auto [iqn, tpgt] : {std::pair{"iqn.a", 1}, {"iqn.b", 2}, {"iqn.a", 3}})
        _iqn_add(iqn, tpgt);
    _iqn_add((longest + "cut").c_str(), 7);
    EXPECT_EQ((std::vector<std::string>{"iqn.a/1", "iqn.b/2", "iqn.a/3", longest + "/7"}), listed());
    EXPECT_EQ(0, _iqn_query("iqn.b"));
    EXPECT_EQ(-1, _iqn_query("iqn.c"));
    EXPECT_EQ(-1, _iqn_query(nullptr));

    ASSERT_EQ(0, _iqn_next("iqn.b", &rec));
    EXPECT_EQ(3, rec->tpgt) << "successor of a record";
    EXPECT_EQ(0, _iqn_next(longest.c_str(), &rec));
    EXPECT_EQ(nullptr, rec) << "the last record has a NULL successor";
    EXPECT_EQ(-1, _iqn_next("iqn.c", &rec));

    for (const char *gone : {"iqn.a", "iqn.absent", static_cast<const char *>(nullptr)})
        _iqn_del(gone);
    EXPECT_EQ((std::vector<std::string>{"iqn.b/2", "iqn.a/3", longest + "/7"}), listed());
    EXPECT_EQ(0, _iqn_clear());
    EXPECT_TRUE(listed().empty());
    EXPECT_EQ(0, _iqn_clear());
}

TEST(AddressText, HostNameAndIpv4Conversions)
{
    // conv_str's case and '_': the entity ids of nesrad_daemon_test (NAS_Box1).
    EXPECT_EQ(-1, conv_str(nullptr));

    // An IPv4-mapped IPv6 address, ::ffff:192.0.2.10.
    unsigned char b[16];
    ASSERT_EQ(0, ipv4_text_to_bytes(b, "192.0.2.10"));
    EXPECT_EQ((std::vector<int>{0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 255, 255, 192, 0, 2, 10}), std::vector<int>(b, b + 16));
    for (const char *bad : {"1.2.3", "1.2.3.4.5", "", "1234", static_cast<const char *>(nullptr)})
        EXPECT_EQ(-1, ipv4_text_to_bytes(b, bad)) << (bad ? bad : "NULL");
    // Each part reads like atoi, kept to its low byte without overflowing.
    ASSERT_EQ(0, ipv4_text_to_bytes(b, "65537. +2.-1.4x"));
    EXPECT_EQ((std::vector<int>{1, 2, 255, 4}), std::vector<int>(b + 12, b + 16));
}

TEST(CheckInterval, AShortRegistrationPeriodIsCheckedAtTwoThirdsOfIt)
{
    struct {
        unsigned period, ms;
    } cases[] = {{0, 60000}, {3600, 60000}, {120, 60000}, {119, 79333}, {20, 13333}, {7, 5000}, {1, 5000}};
    for (auto c : cases)
        EXPECT_EQ(c.ms, nesrad_check_interval_ms(60, c.period)) << c.period;
}

TEST(NodeList, FollowsTheStoreAndKeepsTheIdentifierWithoutAHostName)
{
    set_host_name("NAS_Box1");
    XmldbService db;
    store_targets("nas-box1", {{"t1", 5}, {"t2", 2}});
    ASSERT_EQ(0, iscsi_conf_init(&g_nesrad_conf));
    EXPECT_EQ(2, init_iqn_list());
    EXPECT_EQ((std::vector<std::string>{target_iqn("nas-box1", "t1") + "/5", target_iqn("nas-box1", "t2") + "/2"}),
              listed());
    isns_iscsi_node *node = isns_iscsi_node_new();
    EXPECT_EQ(-1, get_iscsi_node_from_mod(node, "iqn.x", -1));
    EXPECT_EQ(-1, get_iscsi_node_from_mod(node, nullptr, 1));
    EXPECT_EQ(-1, get_iscsi_node_from_mod(nullptr, "iqn.x", 1));
    isns_iscsi_node_free(node);

    _iqn_clear();
    SysRoot::remove("/proc/sys/kernel/hostname");
    std::snprintf(isns_entity_id, sizeof isns_entity_id, "kept");
    store_targets("nas-box1", {{"t1", 1}});
    EXPECT_EQ(1, init_iqn_list());
    EXPECT_EQ((std::vector<std::string>{target_iqn("kept", "t1") + "/1"}), listed());
    _iqn_clear();
}
