// SPDX-License-Identifier: Apache-2.0
// Network portals: directory names, creation and removal, the kernel's
// portal list, and the replace-all and diffing setters.
#include "kernel/korvadm_mod_lio4_internal.h"

#include <cstdlib>
#include <cstring>
#include <string>
#include <string_view>
#include <vector>

#include "common/korvadm_err.h"
#include "common/korvadm_list.h"
#include "common/korvadm_utils.h"

using namespace lio4;

namespace {

// A portal's address and interface name end up inside one directory name.
bool portal_names_ok(const char *address, const char *interface)
{
    return address && !std::strchr(address, '/') && (!interface || !*interface || is_component(interface));
}

std::string np_name(const char *address, const char *interface, int port, int type)
{
    if (type != IP_TYPE_V4 && type != IP_TYPE_V6)
        type = _check_np_ip_type(address);
    std::string name;
    if (type == IP_TYPE_V4) {
        name = address;
    } else {
        name.append(1, '[').append(address);
        // An address that does not parse is scoped too: the kernel then
        // refuses it rather than binding an unintended address.
        if (is_ipv6_link_local(address) != 0)
            name.append(1, '%').append(interface ? interface : "");
        name.append(1, ']');
    }
    return name.append(1, ':').append(std::to_string(port));
}

// The np directory of a portal; false when the arguments cannot name one.
bool np_path(const char *iqn, int tpgt, const char *interface, const char *address, int port, int type,
             std::string &path)
{
    if (!iqn || !address || !*address || !portal_names_ok(address, interface) || !tpgt_ok(tpgt))
        return false;
    path = tpg_dir(iqn, tpgt) + "/np/" + np_name(address, interface, port, type);
    return true;
}

}  // namespace

int _lio3_create_network_portal(const char *iqn, int tpgt, const char *interface, const char *address,
                                int port, int type)
{
    std::string path;
    PARAM_GUARD(!np_path(iqn, tpgt, interface, address, port, type, path));
    return make_dir(path.c_str(), 0700) == 0 ? KORV_OK : ERR_CONFIGFS;
}

int _lio3_remove_network_portal(const char *iqn, int tpgt, const char *interface, const char *address,
                                int port, int type)
{
    std::string path;
    PARAM_GUARD(!np_path(iqn, tpgt, interface, address, port, type, path));
    return configfs_rmdir(path.c_str()) == 0 ? KORV_OK : ERR_CONFIGFS;
}

namespace {

const char *ip_address(const iscsi_ip_t *ip, int type)
{
    return type == IP_TYPE_V4 ? ip->ipv4 : ip->ipv6;
}

const char *ip_type_name(int type)
{
    return type == IP_TYPE_V4 ? "IP_TYPE_V4" : "IP_TYPE_V6";
}

bool list_has_address(list_t *list, const iscsi_ip_t *ip, int type)
{
    return type == IP_TYPE_V4 ? iscsi_ip_search_list_by_IPv4(list, ip->ipv4) != nullptr
                              : iscsi_ip_search_list_by_IPv6(list, ip->ipv6) != nullptr;
}

// Creates the wanted portals of target, every IPv4 one first, leaving out
// addresses `existing` already holds when it is given. Failures are logged.
void create_portals(const char *func, iscsi_target_t *target, list_t *existing)
{
    for (int type : {IP_TYPE_V4, IP_TYPE_V6}) {
        for (iscsi_ip_t *ip : korv::list_records<iscsi_ip_t>(&target->ip_list)) {
            const char *address = ip_address(ip, type);
            if (!address[0] || (existing && list_has_address(existing, ip, type)))
                continue;
            if (_lio3_create_network_portal(target->iqn, target->tpgt, ip->dev_name, address, ip->port, type) != 0)
                DBG_AS(func, 0, "_lio3_create_network_portal( %s , %d , %s , %s , %d, %s ) return error", target->iqn,
                    target->tpgt, ip->dev_name, address, ip->port, ip_type_name(type));
        }
    }
}

// A wanted list is refused whole, before anything changes, when one of its
// names could leave the portal's directory.
bool wanted_portals_ok(const char *func, const iscsi_target_t *target)
{
    for (const iscsi_ip_t *ip : korv::list_records<iscsi_ip_t>(&target->ip_list)) {
        if (!portal_names_ok(ip->ipv4, ip->dev_name) || !portal_names_ok(ip->ipv6, ip->dev_name)) {
            DBG_AS(func, 0, "portal %s%s on interface %s is not a usable name", ip->ipv4, ip->ipv6, ip->dev_name);
            return false;
        }
    }
    return true;
}

}  // namespace

int _get_exist_ip_list(const iscsi_target_t *target, list_t *list)
{
    std::string np = tpg_dir(target->iqn, target->tpgt) + "/np";
    std::vector<std::string> names;
    if (!list_subdirs_or_log(__func__, np, names))
        return ERR_PARAM;
    korv::list_owner found(iscsi_ip_free_list);
    for (const std::string &name : names) {
        DBG(2, "get one existing np : %s", name.c_str());
        iscsi_ip_t *ip = iscsi_ip_new();
        if (!ip) {
            DBG(0, "malloc iscsi_ip_t failed");
            return ERR_CONFIGFS;
        }
        int port = 0;
        int rc;
        if (_check_np_ip_type(name.c_str()) == IP_TYPE_V4)
            rc = _parse_lio_np_entry(ip->ipv4, sizeof ip->ipv4, &port, ip->dev_name, sizeof ip->dev_name,
                                     name.c_str());
        else
            rc = _parse_lio_np_entry(ip->ipv6, sizeof ip->ipv6, &port, ip->dev_name, sizeof ip->dev_name,
                                     name.c_str());
        if (rc != 0) {
            DBG(0, "parse %s failed", name.c_str());
            iscsi_ip_free(ip);
            continue;
        }
        ip->port = port;
        list_append(&ip->node, found.get());
    }
    found.hand_over(list);
    return KORV_OK;
}

int _lio3_remove_all_np(const iscsi_target_t *target)
{
    std::string np = tpg_dir(target->iqn, target->tpgt) + "/np";
    std::vector<std::string> names;
    if (!list_subdirs_or_log(__func__, np, names))
        return ERR_PARAM;
    for (const std::string &name : names) {
        std::string path = np + "/" + name;
        if (remove_dir(path.c_str()) != 0) {
            DBG(0, "can not remove network portal : %s", path.c_str());
            return ERR_CONFIGFS;
        }
    }
    return KORV_OK;
}

int lio3_set_target_ip(iscsi_target_t *target)
{
    CHECK_TARGET(target, "target is NULL", "target IQN is empty", "target TPGT out of limitation");
    if (!wanted_portals_ok(__func__, target))  // logged there
        return ERR_PARAM;
    if (_lio3_remove_all_np(target) != 0)
        DBG(0, "_lio3_remove_all_np error");
    create_portals(__func__, target, nullptr);
    return KORV_OK;
}

int lio3_set_target_ip_v2(iscsi_target_t *target)
{
    CHECK_TARGET(target, "target is NULL", "target IQN is empty", "target TPGT out of limitation");
    if (!wanted_portals_ok(__func__, target))  // logged there
        return ERR_PARAM;
    korv::list_owner existing(iscsi_ip_free_list);
    if (_get_exist_ip_list(target, existing.get()) != 0)
        DBG(0, "_get_exist_ip_list error");
    create_portals(__func__, target, existing.get());
    for (iscsi_ip_t *ip : korv::list_records<iscsi_ip_t>(existing.get())) {
        for (int type : {IP_TYPE_V4, IP_TYPE_V6}) {
            const char *address = ip_address(ip, type);
            if (!address[0] || list_has_address(&target->ip_list, ip, type))
                continue;
            if (_lio3_remove_network_portal(target->iqn, target->tpgt, ip->dev_name, address, ip->port, type) != 0)
                DBG(0, "_lio3_remove_network_portal( %s , %d , %s , %s , %d , %s) return error", target->iqn,
                    target->tpgt, ip->dev_name, address, ip->port, ip_type_name(type));
        }
    }
    return KORV_OK;
}

int lio3_get_target_existing_ip_list(list_t *ip_list, iscsi_target_t *target)
{
    PARAM_GUARD(!ip_list || !target, "ip_list or target is NULL");
    CHECK_TARGET(target, "target is NULL", "target IQN is empty", "target TPGT out of limitation");
    if (_get_exist_ip_list(target, ip_list) != 0) {
        DBG(0, "_get_exist_ip_list error");
        return ERR_CONFIGFS;
    }
    return KORV_OK;
}

/* ================================================================ np names */

int _check_np_ip_type(const char *name)
{
    int colons = 0;
    for (const char *p = name; p && *p; ++p)
        colons += *p == ':';
    return colons < 2 ? IP_TYPE_V4 : IP_TYPE_V6;
}

int _parse_lio_np_entry(char *addr, size_t addr_size, int *port, char *iface, size_t if_size, const char *name)
{
    PARAM_GUARD(!addr || !port || !iface || !name || addr_size == 0 || if_size == 0, "parameter error");
    if (!*name) {
        DBG(0, "np_ent_name is empty");
        return ERR_ATTR_EMPTY;
    }
    std::string_view rest(name);
    if (rest.front() == '[')
        rest.remove_prefix(1);
    size_t colon = rest.rfind(':');
    PARAM_GUARD(colon == std::string_view::npos, "can not find port number in %s", name);
    std::string_view address = rest.substr(0, colon);
    if (!address.empty() && address.back() == ']')
        address.remove_suffix(1);
    std::string_view port_text = rest.substr(colon + 1);
    PARAM_GUARD(port_text.size() >= 6, "can not find port number in %s", name);
    std::string_view scope;
    if (size_t pct = address.rfind('%'); pct != std::string_view::npos) {
        scope = address.substr(pct + 1);
        address = address.substr(0, pct);
    }
    PARAM_GUARD(address.size() >= addr_size || scope.size() >= if_size, "address or interface of %s too long", name);
    address.copy(addr, address.size());
    addr[address.size()] = '\0';
    scope.copy(iface, scope.size());
    iface[scope.size()] = '\0';
    *port = std::atoi(std::string(port_text).c_str());
    return KORV_OK;
}
