// Address entries, the portal address list from the network settings and
// the link state, the host name and the MAC address.
#include <cstring>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "common/korvadm_err.h"
#include "common/korvadm_sys.h"
#include "tests/config/store_fixture.h"
#include "tests/support/capture.h"

using korv_test::quiet;
using korv_test::StoreTest;
using korv_test::SysRoot;

TEST(AddressEntries, SearchCompareAndFree)
{
    list_t list;
    list_init(&list);
    iscsi_ip_t *a = iscsi_ip_new();
    iscsi_ip_t *b = iscsi_ip_new();
    ASSERT_TRUE(a && b);
    EXPECT_EQ(a->tag1, -1);
    EXPECT_EQ(a->tag2, -1);
    EXPECT_EQ(a->port, -1);
    EXPECT_STREQ(a->ipv4, "");
    std::strcpy(a->ipv4, "192.0.2.1");
    std::strcpy(b->ipv6, "2001:db8::2");
    list_append(&a->node, &list);
    list_append(&b->node, &list);

    EXPECT_EQ(iscsi_ip_search_list_by_IPv4(&list, "192.0.2.1"), a);
    EXPECT_EQ(iscsi_ip_search_list_by_IPv4(&list, "192.0.2.10"), nullptr);
    EXPECT_EQ(iscsi_ip_search_list_by_IPv6(&list, "2001:db8::2"), b);
    // b has no IPv4: "" must not find it.
    EXPECT_EQ(iscsi_ip_search_list_by_IPv4(&list, ""), nullptr);
    EXPECT_EQ(quiet([&] { return iscsi_ip_search_list_by_IPv6(&list, nullptr); }), nullptr);

    EXPECT_EQ(iscsi_ip_cmp_ip(a, a), 1);  // same IPv4, same IPv6
    EXPECT_EQ(iscsi_ip_cmp_ip(a, b), 1);  // both differ
    iscsi_ip_t *c = iscsi_ip_new();
    std::strcpy(c->ipv4, "192.0.2.1");
    std::strcpy(c->ipv6, "2001:db8::9");
    EXPECT_EQ(iscsi_ip_cmp_ip(a, c), 2);
    EXPECT_EQ(quiet([&] { return iscsi_ip_cmp_ip(a, nullptr); }), -1);
    iscsi_ip_free(c);

    iscsi_ip_free(a);
    EXPECT_EQ(list.count, 1);
    EXPECT_EQ(list.head, &b->node);
    iscsi_ip_free_list(&list);
    EXPECT_TRUE(list_is_empty(&list));
    iscsi_ip_free(nullptr);
}

TEST(IqnText, LowerCasesAndTurnsUnderscoresIntoHyphens)
{
    char s[] = "My_Host01.Example_NET-x";
    EXPECT_EQ(conv_hostname_to_iqn_str(s), 0);
    EXPECT_STREQ(s, "my-host01.example-net-x");
    EXPECT_EQ(conv_hostname_to_iqn_str(nullptr), -1);
    char t[] = "\xC3\x84Z";  // bytes outside A-Z stay as they are
    EXPECT_EQ(conv_iqn_str(t, 1), 0);
    EXPECT_STREQ(t, "\xC3\x84z");
}

namespace {

struct Entry {
    std::string dev, v4, v6;
    bool operator==(const Entry &) const = default;
};

std::ostream &operator<<(std::ostream &os, const Entry &e)
{
    return os << "{" << e.dev << "," << e.v4 << "," << e.v6 << "}";
}

class NetList : public StoreTest {
protected:
    void SetUp() override
    {
        StoreTest::SetUp();
        link(0, false);
        link(1, false);
    }
    static void link(int port, bool up)
    {
        std::string dev = port ? "/sys/class/net/egiga1" : "/sys/class/net/egiga0";
        SysRoot::write(dev + "/operstate", up ? "up\n" : "down\n");
        SysRoot::write(dev + "/speed", up ? "1000\n" : "-1\n");
    }
    static void ipv6_mode(int lan, const std::string &mode)
    {
        put("/network_mgr/lan" + std::to_string(lan) + "/ipv6/mode", mode);
    }
    static std::vector<Entry> entries(int expect_rc = KORV_OK)
    {
        list_t list;
        list_init(&list);
        EXPECT_EQ(quiet([&] { return sys_net_get_ip_list(&list); }), expect_rc);
        std::vector<Entry> out;
        for (iscsi_ip_t *ip : korv::list_records<iscsi_ip_t>(&list))
            out.push_back({ip->dev_name, ip->ipv4, ip->ipv6});
        iscsi_ip_free_list(&list);
        return out;
    }
};

}  // namespace

TEST_F(NetList, BondedWithBothLinksDownGivesNothing)
{
    put("/network_mgr/bonding/enable", "1");
    put("/network_mgr/lan0/ip", "192.0.2.1");
    put("/network_mgr/lan1/ip", "192.0.2.2");
    ipv6_mode(0, "off");
    ipv6_mode(1, "off");
    EXPECT_TRUE(entries().empty());
}

TEST_F(NetList, BondedWithOneLinkUpIsOneEntryOnLan1Addresses)
{
    put("/network_mgr/bonding/enable", "1");
    put("/network_mgr/lan0/ip", "192.0.2.1");
    put("/network_mgr/lan1/ip", "192.0.2.2");
    ipv6_mode(0, "static");
    ipv6_mode(1, "off");
    put("/network_mgr/lan0/ipv6/item:1/ipv6address", "2001:db8::1");
    link(1, true);
    EXPECT_EQ(entries(), (std::vector<Entry>{{"egiga0", "192.0.2.1", "2001:db8::1"}}));
}

TEST_F(NetList, OnlyLan2UpWithIpv6Off)
{
    put("/network_mgr/bonding/enable", "0");
    put("/network_mgr/lan0/ip", "192.0.2.1");
    put("/network_mgr/lan1/ip", "192.0.2.2");
    ipv6_mode(0, "off");
    ipv6_mode(1, "off");
    link(1, true);
    EXPECT_EQ(entries(), (std::vector<Entry>{{"egiga1", "192.0.2.2", ""}}));
}

TEST_F(NetList, Ipv6OffIgnoresStoredAddresses)
{
    put("/network_mgr/lan0/ip", "192.0.2.1");
    ipv6_mode(0, "off");
    ipv6_mode(1, "off");
    put("/network_mgr/lan0/ipv6/item:1/ipv6address", "2001:db8::1");
    put("/network_mgr/lan0/ipv6/dhcp_ipv6address", "2001:db8::d");
    put("/network_mgr/lan1/ipv6/item:1/ipv6address", "2001:db8::2");
    link(0, true);
    link(1, true);
    // LAN 2 has neither an IPv4 nor (IPv6 off) an IPv6 address: no entry.
    EXPECT_EQ(entries(), (std::vector<Entry>{{"egiga0", "192.0.2.1", ""}}));
}

TEST_F(NetList, Ipv6ModesChooseTheirAddress)
{
    link(0, true);
    link(1, true);
    ipv6_mode(0, "dhcp");
    put("/network_mgr/lan0/ipv6/item:1/ipv6address", "2001:db8::1");
    put("/network_mgr/lan0/ipv6/dhcp_ipv6address", "2001:db8::d");
    ipv6_mode(1, "auto");
    put("/network_mgr/lan1/ipv6/local_ipv6address", "fe80::2");
    EXPECT_EQ(entries(), (std::vector<Entry>{{"egiga0", "", "2001:db8::d"}, {"egiga1", "", "fe80::2"}}));

    // Static mode has no link-local fallback.
    ipv6_mode(1, "static");
    put("/network_mgr/lan1/ip", "192.0.2.2");
    EXPECT_EQ(entries(), (std::vector<Entry>{{"egiga0", "", "2001:db8::d"}, {"egiga1", "192.0.2.2", ""}}));
}

TEST_F(NetList, AppendsWithoutClearingAndRefusesNull)
{
    put("/network_mgr/lan0/ip", "192.0.2.1");
    link(0, true);
    list_t list;
    list_init(&list);
    iscsi_ip_t *mine = iscsi_ip_new();
    list_append(&mine->node, &list);
    EXPECT_EQ(quiet([&] { return sys_net_get_ip_list(&list); }), KORV_OK);
    EXPECT_EQ(list.count, 2);
    EXPECT_EQ(list.head, &mine->node);
    iscsi_ip_free_list(&list);
    EXPECT_EQ(quiet([&] { return sys_net_get_ip_list(nullptr); }), ERR_PARAM);
}

TEST_F(NetList, OverlongStoredAddressesAreCut)
{
    put("/network_mgr/lan0/ip", std::string(100, '1'));
    ipv6_mode(0, "static");
    ipv6_mode(1, "off");
    put("/network_mgr/lan0/ipv6/item:1/ipv6address", std::string(100, 'f'));
    link(0, true);
    auto got = entries();
    ASSERT_EQ(got.size(), 1u);
    EXPECT_EQ(got[0].v4.size(), ISCSI_IP_IPV4_LEN - 1u);
    EXPECT_EQ(got[0].v6.size(), ISCSI_IP_IPV6_LEN - 1u);
}

TEST(HostName, CachedUntilRefreshed)
{
    SysRoot::write("/proc/sys/kernel/hostname", "My_Host01\n");
    char buf[128];
    ASSERT_EQ(sys_net_get_host_name(buf, sizeof buf, 1), KORV_OK);
    EXPECT_STREQ(buf, "My_Host01");
    SysRoot::write("/proc/sys/kernel/hostname", "Other\n");
    ASSERT_EQ(sys_net_get_host_name_in_iqn_spec(buf, sizeof buf, 0), KORV_OK);
    EXPECT_STREQ(buf, "my-host01");
    ASSERT_EQ(sys_net_get_host_name(buf, sizeof buf, 1), KORV_OK);
    EXPECT_STREQ(buf, "Other");

    char small[4];
    ASSERT_EQ(sys_net_get_host_name(small, sizeof small, 0), KORV_OK);
    EXPECT_STREQ(small, "Oth");

    EXPECT_EQ(sys_net_get_host_name(buf, sizeof buf, 2), ERR_PARAM);
    EXPECT_EQ(sys_net_get_host_name(buf, 0, 0), ERR_PARAM);
    EXPECT_EQ(sys_net_get_host_name(nullptr, 8, 0), ERR_PARAM);

    SysRoot::remove("/proc/sys/kernel/hostname");
    EXPECT_EQ(sys_net_get_host_name(buf, sizeof buf, 1), ERR_NOT_FOUND);
    SysRoot::write("/proc/sys/kernel/hostname", "\n");
    EXPECT_EQ(sys_net_get_host_name_in_iqn_spec(buf, sizeof buf, 1), ERR_NOT_FOUND);
}

TEST(MacAddress, Lan1InLowerCaseColonForm)
{
    SysRoot::write("/sys/class/net/egiga0/address", "00:1A:2b:3C:4d:5E\n");
    char mac[18];
    ASSERT_EQ(sys_net_get_lan1_mac_str(mac), KORV_OK);
    EXPECT_STREQ(mac, "00:1a:2b:3c:4d:5e");
    SysRoot::write("/sys/class/net/egiga0/address", "garbage\n");
    EXPECT_EQ(quiet([&] { return sys_net_get_lan1_mac_str(mac); }), ERR_DB_WRITE);
}
