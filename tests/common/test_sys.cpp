// SPDX-License-Identifier: Apache-2.0
// Address entries, the portal address list from the network settings and
// the link state, the host name and the MAC address.
#include <cstring>
#include <string>
#include <utility>
#include <vector>

#include <gtest/gtest.h>

#include "common/korvadm_err.h"
#include "common/korvadm_sys.h"
#include "platform/xmldbc.h"
#include "tests/support/capture.h"
#include "tests/support/xmldbd_fixture.h"

using korv_test::quiet;
using korv_test::SysRoot;

TEST(AddressEntries, SearchCompareAndFree)
{
    list_t list;
    list_init(&list);
    iscsi_ip_t *a = iscsi_ip_new(), *b = iscsi_ip_new(), *c = iscsi_ip_new();
    ASSERT_TRUE(a && b && c);
    EXPECT_EQ(a->tag1 + a->tag2 + a->port, -3);  // unknown until set
    std::strcpy(a->ipv4, "192.0.2.1");
    std::strcpy(b->ipv6, "2001:db8::2");
    std::strcpy(c->ipv4, "192.0.2.1");
    std::strcpy(c->ipv6, "2001:db8::9");
    list_append(&a->node, &list);
    list_append(&b->node, &list);

    EXPECT_EQ(iscsi_ip_search_list_by_IPv4(&list, "192.0.2.1"), a);
    EXPECT_EQ(iscsi_ip_search_list_by_IPv6(&list, "2001:db8::2"), b);
    // b has no IPv4: "" must not find it.
    EXPECT_EQ(iscsi_ip_search_list_by_IPv4(&list, ""), nullptr);
    EXPECT_EQ(quiet([&] { return iscsi_ip_search_list_by_IPv6(&list, nullptr); }), nullptr);

    // Equal IPv4 plus differing IPv6: not an equality test.
    EXPECT_EQ(iscsi_ip_cmp_ip(a, a), 1);
    EXPECT_EQ(iscsi_ip_cmp_ip(a, b), 1);
    EXPECT_EQ(iscsi_ip_cmp_ip(a, c), 2);
    EXPECT_EQ(quiet([&] { return iscsi_ip_cmp_ip(a, nullptr); }), -1);
    iscsi_ip_free(c);

    iscsi_ip_free(a);
    EXPECT_EQ(list.count, 1);
    EXPECT_EQ(list.head, &b->node);
    iscsi_ip_free_list(&list);
    EXPECT_TRUE(list_is_empty(&list));
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

using Settings = std::vector<std::pair<std::string, std::string>>;

// Addresses stored in every case; the settings, IPv6 modes and links decide what shows.
const Settings kStored = {{"lan0/ip", "192.0.2.1"},
                          {"lan1/ip", "192.0.2.2"},
                          {"lan0/ipv6/item:1/ipv6address", "2001:db8::1"},
                          {"lan0/ipv6/dhcp_ipv6address", "2001:db8::d"},
                          {"lan1/ipv6/local_ipv6address", "fe80::2"}};
const Settings kBondStatic = {{"bonding/enable", "1"}, {"lan0/ipv6/mode", "static"}, {"lan1/ipv6/mode", "off"}};
const Settings kBothOff = {{"lan0/ipv6/mode", "off"}, {"lan1/ipv6/mode", "off"}};

const struct NetCase {
    const char *what;
    Settings settings;  // under "/network_mgr/", after kStored
    bool up0, up1;
    std::vector<Entry> want;
} kNetCases[] = {
    {"bonded, both links down", kBondStatic, false, false, {}},
    {"bonded, LAN 2 up: LAN 1's addresses", kBondStatic, false, true, {{"egiga0", "192.0.2.1", "2001:db8::1"}}},
    {"only LAN 2 up, IPv6 off", kBothOff, false, true, {{"egiga1", "192.0.2.2", ""}}},
    {"IPv6 off ignores stored addresses", {{"lan0/ipv6/mode", "off"}, {"lan1/ipv6/mode", "off"}, {"lan1/ip", ""}},
     true, true, {{"egiga0", "192.0.2.1", ""}}},
    {"dhcp and automatic modes",
     {{"lan0/ipv6/mode", "dhcp"}, {"lan1/ipv6/mode", "auto"}, {"lan0/ip", ""}, {"lan1/ip", ""}}, true, true,
     {{"egiga0", "", "2001:db8::d"}, {"egiga1", "", "fe80::2"}}},
    {"one IPv6 mode unset: no IPv6 at all", {{"lan1/ipv6/mode", "auto"}}, true, false, {{"egiga0", "192.0.2.1", ""}}},
    {"static mode has no link-local fallback", {{"lan0/ipv6/mode", "off"}, {"lan1/ipv6/mode", "static"}}, false, true,
     {{"egiga1", "192.0.2.2", ""}}},
    {"overlong addresses are cut",
     {{"lan0/ip", std::string(100, '1')}, {"lan0/ipv6/item:1/ipv6address", std::string(100, 'f')},
      {"lan0/ipv6/mode", "static"}, {"lan1/ipv6/mode", "off"}},
     true, false, {{"egiga0", std::string(ISCSI_IP_IPV4_LEN - 1, '1'), std::string(ISCSI_IP_IPV6_LEN - 1, 'f')}}},
};

void link(int port, bool up)
{
    std::string dev = port ? "/sys/class/net/egiga1" : "/sys/class/net/egiga0";
    SysRoot::write(dev + "/operstate", up ? "up\n" : "down\n");
    SysRoot::write(dev + "/speed", up ? "1000\n" : "-1\n");
}

}  // namespace

TEST(NetList, LinkStateBondingAndIpv6ModesChooseTheEntriesAppendedToTheList)
{
    korv_test::XmldbService db;
    EXPECT_EQ(quiet([&] { return sys_net_get_ip_list(nullptr); }), ERR_PARAM);
    for (const NetCase &c : kNetCases) {
        xmldbc_del(XMLDB_SOCK_ISCSI, 0, "/network_mgr");
        for (const Settings *s : {&kStored, &c.settings})
            for (const auto &[key, value] : *s)
                ASSERT_EQ(xmldbc_set(XMLDB_SOCK_ISCSI, 0, ("/network_mgr/" + key).c_str(), value.c_str()), 0);
        link(0, c.up0);
        link(1, c.up1);
        list_t list;
        list_init(&list);
        iscsi_ip_t *mine = iscsi_ip_new();  // the caller's entries stay first
        list_append(&mine->node, &list);
        EXPECT_EQ(quiet([&] { return sys_net_get_ip_list(&list); }), KORV_OK) << c.what;
        std::vector<Entry> got;
        for (iscsi_ip_t *ip : korv::list_records<iscsi_ip_t>(&list))
            got.push_back({ip->dev_name, ip->ipv4, ip->ipv6});
        EXPECT_EQ(list.head, &mine->node) << c.what;
        if (!got.empty())
            got.erase(got.begin());
        iscsi_ip_free_list(&list);
        EXPECT_EQ(got, c.want) << c.what;
    }
}

TEST(HostName, ConvertedForIqnsAndCachedUntilRefreshed)
{
    char s[] = "My_Host01.Example_NET-x\xC3\x84";  // bytes outside A-Z stay as they are
    EXPECT_EQ(conv_hostname_to_iqn_str(s), 0);
    EXPECT_STREQ(s, "my-host01.example-net-x\xC3\x84");
    EXPECT_EQ(conv_hostname_to_iqn_str(nullptr), -1);

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
