// System information, network half: portal address entries, the addresses of
// the links that are up, and the host name in the form an IQN accepts.
#include "common/korvadm_sys.h"

#include <cstdlib>
#include <cstring>

#include "common/korvadm_err.h"
#include "common/korvadm_log.h"

/* ---------------------------------------------------------------------------
 * Address entries
 * ------------------------------------------------------------------------- */

iscsi_ip_t *iscsi_ip_new(void)
{
    auto *ip = static_cast<iscsi_ip_t *>(std::calloc(1, sizeof(iscsi_ip_t)));
    if (!ip) {
        DBG(0, "malloc iscsi_ip_t failed");
        return nullptr;
    }
    ip->tag1 = -1;
    ip->tag2 = -1;
    ip->port = -1;
    list_node_init(&ip->node, ip);
    return ip;
}

void iscsi_ip_free(iscsi_ip_t *ip)
{
    if (!ip)
        return;
    list_remove(&ip->node);
    std::free(ip);
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
