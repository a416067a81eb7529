// SPDX-License-Identifier: Apache-2.0
// Address entries, the portal address list from the network settings and
// the link state, the host name and the MAC address.
#include <cstring>
#include <fstream>
#include <string>
#include <utility>
#include <vector>

#include <gtest/gtest.h>

#include "common/korvadm_err.h"
#include "common/korvadm_sys.h"
#include "platform/xmldbc.h"
#include "tests/support/process.h"
#include "tests/support/xmldbd_fixture.h"

using korv_test::quiet;
using korv_test::SysRoot;

TEST(AddressEntries, SearchCompareAndFree)
{
    korv::list_owner list(iscsi_ip_free_list);
    iscsi_ip_t *a = iscsi_ip_new(), *b = iscsi_ip_new(), *c = iscsi_ip_new();
    ASSERT_TRUE(a && b && c);
    EXPECT_EQ(a->tag1 + a->tag2 + a->port, -3);  // unknown until set
    std::strcpy(a->ipv4, "192.0.2.1");
    std::strcpy(b->ipv6, "2001:db8::2");
    std::strcpy(c->ipv4, "192.0.2.1");
    std::strcpy(c->ipv6, "2001:db8::9");
    list_append(&a->node, list.get());
    list_append(&b->node, list.get());
    EXPECT_EQ(iscsi_ip_search_list_by_IPv4(list.get(), "192.0.2.1"), a);
    EXPECT_EQ(iscsi_ip_search_list_by_IPv6(list.get(), "2001:db8::2"), b);
    EXPECT_EQ(iscsi_ip_search_list_by_IPv4(list.get(), ""), nullptr);  // b has no IPv4: "" must not find it
    EXPECT_EQ(quiet([&] { return iscsi_ip_search_list_by_IPv6(list.get(), nullptr); }), nullptr);
    // Equal IPv4 plus differing IPv6: not an equality test.
    EXPECT_EQ(iscsi_ip_cmp_ip(a, a), 1);
    EXPECT_EQ(iscsi_ip_cmp_ip(a, b), 1);
    EXPECT_EQ(iscsi_ip_cmp_ip(a, c), 2);
    EXPECT_EQ(quiet([&] { return iscsi_ip_cmp_ip(a, nullptr); }), -1);
    iscsi_ip_free(c);
    iscsi_ip_free(a);  // unlinks itself
    EXPECT_TRUE(list.get()->count == 1 && list.get()->head == &b->node);
}

namespace {

struct NetCase {
    std::string heading;  // "[<LAN 1 link> <LAN 2 link>] what"
    std::vector<std::pair<std::string, std::string>> settings;  // under "/network_mgr/"
    std::vector<std::string> want;  // "<device> <IPv4> <IPv6>", "-" for none
};

// The cases of data/net_cases.txt, the [stored] settings first.
std::vector<NetCase> net_cases()
{
    std::ifstream in(KORV_TEST_DATA "/net_cases.txt");
    std::vector<NetCase> out;
    for (std::string l; std::getline(in, l);) {
        if (l.starts_with('['))
            out.push_back({l, {}, {}});
        else if (l.starts_with("=> "))
            out.back().want.push_back(l.substr(3));
        else if (size_t eq = l.find(" ="); eq != std::string::npos && !l.starts_with('#'))
            out.back().settings.emplace_back(l.substr(0, eq), l.substr(std::min(eq + 3, l.size())));
    }
    EXPECT_GT(out.size(), 1u);
    return out;
}

}  // namespace

TEST(NetList, LinkStateBondingAndIpv6ModesChooseTheEntriesAppendedToTheList)
{
    korv_test::XmldbService db;
    EXPECT_EQ(quiet([&] { return sys_net_get_ip_list(nullptr); }), ERR_PARAM);
    const std::vector<NetCase> cases = net_cases();
    for (const char *dev : {"egiga0", "egiga1"})  // a speed counts only on a link that is up
        SysRoot::write("/sys/class/net/" + std::string(dev) + "/speed", "1000\n");
    for (const NetCase &c : std::vector(cases.begin() + 1, cases.end())) {
        xmldbc_del(XMLDB_SOCK_ISCSI, 0, "/network_mgr");
        for (const auto *s : {&cases[0].settings, &c.settings})
            for (const auto &[key, value] : *s)
                ASSERT_EQ(xmldbc_set(XMLDB_SOCK_ISCSI, 0, ("/network_mgr/" + key).c_str(), value.c_str()), 0);
        SysRoot::write("/sys/class/net/egiga0/operstate", c.heading.starts_with("[up") ? "up" : "down");
        SysRoot::write("/sys/class/net/egiga1/operstate", c.heading.find(" up]") != std::string::npos ? "up" : "down");
        korv::list_owner list(iscsi_ip_free_list);
        iscsi_ip_t *mine = iscsi_ip_new();  // the caller's entries stay first
        list_append(&mine->node, list.get());
        EXPECT_EQ(quiet([&] { return sys_net_get_ip_list(list.get()); }), KORV_OK) << c.heading;
        EXPECT_EQ(list.get()->head, &mine->node) << c.heading;
        std::vector<std::string> got;
        for (iscsi_ip_t *ip : korv::list_records<iscsi_ip_t>(list.get()))
            if (ip != mine)
                got.push_back(std::string(ip->dev_name) + " " + (*ip->ipv4 ? ip->ipv4 : "-") + " " +
                              (*ip->ipv6 ? ip->ipv6 : "-"));
        EXPECT_EQ(got, c.want) << c.heading;
    }
}

TEST(HostName, ConvertedForIqnsAndCachedUntilRefreshed)
{
    char s[] = "My_Host01.Example_NET-x\xC3\x84";  // bytes outside A-Z stay as they are
    EXPECT_EQ(conv_hostname_to_iqn_str(s), 0);
    EXPECT_STREQ(s, "my-host01.example-net-x\xC3\x84");
    EXPECT_EQ(conv_hostname_to_iqn_str(nullptr), -1);

    // "<result>/<name>" of one of the two getters into a buffer of `size`.
    auto get = [](auto getter, size_t size, int refresh) {
        char buf[128] = "";
        const int rc = getter(buf, size, refresh);
        return std::to_string(rc) + "/" + buf;
    };
    SysRoot::write("/proc/sys/kernel/hostname", "My_Host01\n");
    EXPECT_EQ(get(sys_net_get_host_name, 128, 1), "0/My_Host01");
    SysRoot::write("/proc/sys/kernel/hostname", "Other\n");
    EXPECT_EQ(get(sys_net_get_host_name_in_iqn_spec, 128, 0), "0/my-host01");
    EXPECT_EQ(get(sys_net_get_host_name, 128, 1), "0/Other");
    EXPECT_EQ(get(sys_net_get_host_name, 4, 0), "0/Oth");
    EXPECT_EQ(get(sys_net_get_host_name, 128, 2), std::to_string(ERR_PARAM) + "/");
    EXPECT_EQ(get(sys_net_get_host_name, 0, 0), std::to_string(ERR_PARAM) + "/");

    SysRoot::remove("/proc/sys/kernel/hostname");
    EXPECT_EQ(get(sys_net_get_host_name, 128, 1), std::to_string(ERR_NOT_FOUND) + "/");
    SysRoot::write("/proc/sys/kernel/hostname", "\n");
    EXPECT_EQ(get(sys_net_get_host_name_in_iqn_spec, 128, 1), std::to_string(ERR_NOT_FOUND) + "/");
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
