// SPDX-License-Identifier: Apache-2.0
// Driver records for the real-kernel suites: a target with its wanted
// portals, and the automatic link-local address the kernel gives an
// interface. Header-only; both VM test programs include it.
#pragma once

#include <arpa/inet.h>

#include <cstdio>
#include <fstream>
#include <memory>
#include <string>

#include "kernel/korvadm_mod.h"

namespace vm {

struct TargetFree {
    void operator()(iscsi_target_t *t) const { iscsi_target_free(t); }
};
using Target = std::unique_ptr<iscsi_target_t, TargetFree>;

// A target record with IQN, alias and tag (NULL only when out of memory).
inline Target make_target(const std::string &iqn, int tpgt, const std::string &alias = "vm alias")
{
    Target t(iscsi_target_new());
    if (t) {
        std::snprintf(t->iqn, sizeof t->iqn, "%s", iqn.c_str());
        std::snprintf(t->alias, sizeof t->alias, "%s", alias.c_str());
        t->tpgt = tpgt;
    }
    return t;
}

// Appends one wanted portal to the target's list; false when out of memory.
inline bool want_portal(iscsi_target_t *t, const std::string &ipv4, const std::string &ipv6, int port,
                        const std::string &dev = "")
{
    iscsi_ip_t *ip = iscsi_ip_new();
    if (!ip)
        return false;
    std::snprintf(ip->ipv4, sizeof ip->ipv4, "%s", ipv4.c_str());
    std::snprintf(ip->ipv6, sizeof ip->ipv6, "%s", ipv6.c_str());
    std::snprintf(ip->dev_name, sizeof ip->dev_name, "%s", dev.c_str());
    ip->port = port;
    list_append(&ip->node, &t->ip_list);
    return true;
}

// The automatic fe80:: address of an interface, from /proc/net/if_inet6;
// "" when it has none.
inline std::string link_local_of(const std::string &ifname)
{
    std::ifstream in("/proc/net/if_inet6");
    std::string hex, index, plen, scope, flags, name;
    while (in >> hex >> index >> plen >> scope >> flags >> name) {
        if (name != ifname || hex.compare(0, 4, "fe80") != 0 || hex.size() != 32)
            continue;
        unsigned char bytes[16];
        for (int i = 0; i < 16; i++)
            bytes[i] = static_cast<unsigned char>(std::stoi(hex.substr(2 * i, 2), nullptr, 16));
        char text[INET6_ADDRSTRLEN];
        if (inet_ntop(AF_INET6, bytes, text, sizeof text))
            return text;
    }
    return "";
}

}  // namespace vm
