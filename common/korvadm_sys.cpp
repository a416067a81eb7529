// SPDX-License-Identifier: Apache-2.0
// System information, network half: portal address entries, the addresses of
// the links that are up, and the host name in the form an IQN accepts.
#include "common/korvadm_sys.h"

#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "common/korvadm_err.h"
#include "common/korvadm_log.h"
#include "common/korvadm_str.h"
#include "platform/platform_util.h"

/* ---------------------------------------------------------------------------
 * Address entries
 * ------------------------------------------------------------------------- */

iscsi_ip_t *iscsi_ip_new(void)
{
    iscsi_ip_t *ip = korv::list_record_new(&iscsi_ip_t::node);
    if (!ip) {
        DBG(0, "malloc iscsi_ip_t failed");
        return nullptr;
    }
    ip->tag1 = -1;
    ip->tag2 = -1;
    ip->port = -1;
    return ip;
}

void iscsi_ip_free(iscsi_ip_t *ip)
{
    korv::list_record_free(ip, &iscsi_ip_t::node);
}

void iscsi_ip_free_list(list_t *list)
{
    list_release(list, [](void *rec) { iscsi_ip_free(static_cast<iscsi_ip_t *>(rec)); });
}

namespace {
// An entry without an address of one family carries "" there, so an empty
// text must match nothing rather than every such entry.
template <class Field>
iscsi_ip_t *search_by(list_t *list, const char *text, Field field)
{
    if (!list || !text) {
        DBG(0, "parameter error");
        return nullptr;
    }
    if (!text[0])
        return nullptr;
    return korv::list_find<iscsi_ip_t>(list, [&](iscsi_ip_t *ip) { return std::strcmp(field(ip), text) == 0; });
}
}  // namespace

iscsi_ip_t *iscsi_ip_search_list_by_IPv4(list_t *list, const char *ipv4)
{
    return search_by(list, ipv4, [](const iscsi_ip_t *ip) { return ip->ipv4; });
}

iscsi_ip_t *iscsi_ip_search_list_by_IPv6(list_t *list, const char *ipv6)
{
    return search_by(list, ipv6, [](const iscsi_ip_t *ip) { return ip->ipv6; });
}

int iscsi_ip_cmp_ip(const iscsi_ip_t *a, const iscsi_ip_t *b)
{
    if (!a || !b) {
        DBG(0, "parameter error");
        return -1;
    }
    // Counts equal IPv4 plus differing IPv6: callers rely on this exact sum,
    // which is not an equality test.
    int n = 0;
    if (std::strcmp(a->ipv4, b->ipv4) == 0)
        n++;
    if (std::strcmp(a->ipv6, b->ipv6) != 0)
        n++;
    return n;
}

/* ---------------------------------------------------------------------------
 * Host name
 * ------------------------------------------------------------------------- */

int conv_iqn_str(char *text, int log_level)
{
    if (!text)
        return -1;
    DBG(log_level, "str=%s", text);
    for (char *p = text; *p; ++p) {
        if (*p >= 'A' && *p <= 'Z')
            *p = static_cast<char>(*p - 'A' + 'a');
        else if (*p == '_')
            *p = '-';
    }
    DBG(log_level, "after str=%s", text);
    return 0;
}

int conv_hostname_to_iqn_str(char *text)
{
    return conv_iqn_str(text, 2);
}

/* ---------------------------------------------------------------------------
 * Addresses of the LAN ports, from the network settings
 * ------------------------------------------------------------------------- */

namespace {
constexpr const char *kLan1Dev = "egiga0";
constexpr const char *kLan2Dev = "egiga1";
constexpr size_t kModeLen = 16;

int copy_dev_name(const char *func, char *dev_name, const char *dev)
{
    if (!dev_name) {
        DBG_AS(func, 0, "dev_name is NULL");
        return ERR_PARAM;
    }
    korv::copy_bounded(dev_name, ISCSI_IP_DEV_LEN, dev);
    return KORV_OK;
}

int _get_lan1_dev_name(char *dev_name) { return copy_dev_name(__func__, dev_name, kLan1Dev); }
int _get_lan2_dev_name(char *dev_name) { return copy_dev_name(__func__, dev_name, kLan2Dev); }

int read_ipv4(char *addr, const char *path, const char *fail)
{
    PARAM_GUARD(!addr, "addr is NULL");
    addr[0] = '\0';
    dbGetStr(addr, ISCSI_IP_IPV4_LEN, path);
    if (!addr[0]) {
        DBG(0, "%s", fail);
        return ERR_DB_WRITE;
    }
    return KORV_OK;
}

int _xmldb_get_lan1_ipv4_address(char *addr)
{
    return read_ipv4(addr, "/network_mgr/lan0/ip", "get LAN 1 IPv4 failed");
}

int _xmldb_get_lan2_ipv4_address(char *addr)
{
    return read_ipv4(addr, "/network_mgr/lan1/ip", "get LAN 2 IPv4 failed");
}

void read_ipv6_mode(char (&mode)[kModeLen], int lan)
{
    char path[128];
    std::snprintf(path, sizeof path, "/network_mgr/lan%d/ipv6/mode", lan);
    mode[0] = '\0';
    dbGetStr(mode, sizeof mode, path);
}

// The address the LAN's IPv6 mode selects; "off" is an empty address, not an error.
int _xmldb_get_nth_lan_ipv6_address(char *addr, int lan)
{
    PARAM_GUARD(!addr, "addr is NULL");
    std::memset(addr, 0, ISCSI_IP_IPV6_LEN);
    char mode[kModeLen];
    read_ipv6_mode(mode, lan);
    if (std::strcmp(mode, "off") == 0)
        return KORV_OK;

    char path[128];
    auto read = [&](const char *leaf) {
        std::snprintf(path, sizeof path, "/network_mgr/lan%d/ipv6/%s", lan, leaf);
        dbGetStr(addr, ISCSI_IP_IPV6_LEN, path);
    };
    if (std::strcmp(mode, "dhcp") == 0) {
        read("dhcp_ipv6address");
    } else {
        read("item:1/ipv6address");
        // Automatic mode without a global address still has its link-local one.
        if (!addr[0] && std::strcmp(mode, "static") != 0)
            read("local_ipv6address");
    }
    if (!addr[0]) {
        DBG(2, "get LAN %d IPv6 empty", lan + 1);
        return ERR_NOT_FOUND;
    }
    return KORV_OK;
}

int lan_ipv6(char *addr, int lan)
{
    int rc = _xmldb_get_nth_lan_ipv6_address(addr, lan);
    if (rc == ERR_NOT_FOUND)
        return rc;  // already logged as empty
    if (rc != KORV_OK) {
        DBG(0, "get LAN %d IPv6 failed", lan + 1);
        return ERR_DB_WRITE;
    }
    return KORV_OK;
}

int _xmldb_get_lan1_ipv6_address(char *addr) { return lan_ipv6(addr, 0); }
int _xmldb_get_lan2_ipv6_address(char *addr) { return lan_ipv6(addr, 1); }

// 1 when either LAN has IPv6 on, 0 when both are off, -1 when unreadable.
int _xmldb_get_ipv6_state(void)
{
    char mode1[kModeLen];
    char mode2[kModeLen];
    read_ipv6_mode(mode1, 0);
    read_ipv6_mode(mode2, 1);
    if (!mode1[0] || !mode2[0]) {
        DBG(0, "get ipv6_on_off failed");
        return -1;
    }
    return std::strcmp(mode1, "off") != 0 || std::strcmp(mode2, "off") != 0;
}

struct PortSource {
    const char *label;                 /* "bonding", "LAN 1", "LAN 2" in messages */
    const char *dev_fail;              /* message when the device name cannot be had */
    int (*dev_name)(char *);
    int (*ipv4)(char *);
    int (*ipv6)(char *);
};

// Builds one entry and appends it when it carries at least one address.
int append_port(list_t *list, const PortSource &src, bool with_ipv6)
{
    iscsi_ip_t *ip = iscsi_ip_new();
    if (!ip) {
        DBG(0, "new a iscsi_ip_t failed, return failed");
        return ERR_NO_MEMORY;
    }
    if (int rc = src.dev_name(ip->dev_name); rc != KORV_OK) {
        DBG(0, src.dev_fail, rc);
        iscsi_ip_free(ip);
        return ERR_DB_WRITE;
    }
    if (src.ipv4(ip->ipv4) != KORV_OK) {
        ip->ipv4[0] = '\0';
        DBG(1, "get %s ipv4 address failed", src.label);
    }
    if (with_ipv6 && src.ipv6(ip->ipv6) != KORV_OK) {
        ip->ipv6[0] = '\0';
        DBG(1, "get %s ipv6 address failed", src.label);
    }
    if (!ip->ipv4[0] && !ip->ipv6[0]) {
        DBG(1, "get %s IP address failed", src.label);
        iscsi_ip_free(ip);
        return KORV_OK;
    }
    list_append(&ip->node, list);
    return KORV_OK;
}
}  // namespace

int sys_net_get_ip_list(list_t *list)
{
    PARAM_GUARD(!list, "parameter error: ip_list is NULL");
    const bool lan1_up = LIB_Get_Lan_Link_Speed(0) != 0;
    const bool lan2_up = LIB_Get_Lan_Link_Speed(1) != 0;
    const bool ipv6 = _xmldb_get_ipv6_state() == 1;

    if (dbGetLL("/network_mgr/bonding/enable") == 1 && (lan1_up || lan2_up)) {
        // The bonded pair answers on LAN 1's addresses, whichever link carries it.
        static constexpr PortSource bond = {"bonding", "_get_bond0_dev_name failed, rc = %d", _get_lan1_dev_name,
                                            _xmldb_get_lan1_ipv4_address, _xmldb_get_lan1_ipv6_address};
        return append_port(list, bond, ipv6);
    }
    static constexpr PortSource lan1 = {"LAN 1", "_get_lan1_dev_name failed, rc = %d", _get_lan1_dev_name,
                                        _xmldb_get_lan1_ipv4_address, _xmldb_get_lan1_ipv6_address};
    static constexpr PortSource lan2 = {"LAN 2", "_get_lan2_dev_name failed, rc = %d", _get_lan2_dev_name,
                                        _xmldb_get_lan2_ipv4_address, _xmldb_get_lan2_ipv6_address};
    if (lan1_up)
        if (int rc = append_port(list, lan1, ipv6); rc != KORV_OK)
            return rc;
    if (lan2_up)
        if (int rc = append_port(list, lan2, ipv6); rc != KORV_OK)
            return rc;
    return KORV_OK;
}

/* ---------------------------------------------------------------------------
 * Host name (cached) and MAC address
 * ------------------------------------------------------------------------- */

namespace {
char g_host_name[128];
}  // namespace

int sys_net_get_host_name(char *out, size_t size, int refresh)
{
    if (!out || size == 0 || (refresh != 0 && refresh != 1))
        return ERR_PARAM;
    if (refresh == 1 || !g_host_name[0]) {
        if (sys_hostname(g_host_name, sizeof g_host_name) != 0 || !g_host_name[0]) {
            g_host_name[0] = '\0';
            return ERR_NOT_FOUND;
        }
    }
    // Bounded by the caller's size too: a short buffer gets a cut name, never an overrun.
    korv::copy_bounded(out, size, g_host_name);
    return KORV_OK;
}

int sys_net_get_host_name_in_iqn_spec(char *out, size_t size, int refresh)
{
    int rc = sys_net_get_host_name(out, size, refresh);
    if (rc != KORV_OK)
        return rc;
    if (conv_hostname_to_iqn_str(out) != 0) {
        DBG(0, "convert host name to iqn spec failed");
        return ERR_PARAM;
    }
    return KORV_OK;
}

int sys_net_get_lan1_mac_str(char *out)
{
    PARAM_GUARD(!out);
    const unsigned char *mac = sys_get_mac_addr(kLan1Dev);
    if (!mac) {
        DBG(0, "get mac address of %s failed", kLan1Dev);
        return ERR_DB_WRITE;
    }
    std::snprintf(out, 18, "%02x:%02x:%02x:%02x:%02x:%02x", mac[0], mac[1], mac[2], mac[3], mac[4], mac[5]);
    return KORV_OK;
}
