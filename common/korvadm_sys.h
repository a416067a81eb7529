/* System information: network addresses and the host name in IQN form
 * (network half); volumes and disks (storage half, later).
 *
 * Addresses come from the network settings under "/network_mgr" in the
 * configuration database, link state from the platform's
 * LIB_Get_Lan_Link_Speed, the host name from sys_hostname. */
#ifndef KORVADM_SYS_H
#define KORVADM_SYS_H

#include <stddef.h>

#include "common/korvadm_list.h"

#ifdef __cplusplus
extern "C" {
#endif

#define ISCSI_IP_DEV_LEN  64
#define ISCSI_IP_IPV4_LEN 16
#define ISCSI_IP_IPV6_LEN 40

/* One portal address. */
typedef struct iscsi_ip_s {
    int tag1;                          /* -1 on creation */
    char dev_name[ISCSI_IP_DEV_LEN];   /* "egiga0"/"egiga1"; interface of a link-local portal */
    char ipv4[ISCSI_IP_IPV4_LEN];      /* dotted IPv4, "" when none */
    char ipv6[ISCSI_IP_IPV6_LEN];      /* IPv6 text, "" when none */
    int port;                          /* portal TCP port, -1 until known */
    int tag2;                          /* -1 on creation */
    list_node_t node;                  /* owner is the entry */
} iscsi_ip_t;

/* A cleared entry: tags and port -1, texts "", node owned by the entry.
 * NULL (logged) when out of memory. */
iscsi_ip_t *iscsi_ip_new(void);
/* Unlinks and frees; NULL is ignored. */
void iscsi_ip_free(iscsi_ip_t *ip);
/* Frees every entry of the list; the header stays usable. */
void iscsi_ip_free_list(list_t *list);
/* First entry with exactly that address text; NULL when none, for "" and
 * (logged) for a NULL argument. */
iscsi_ip_t *iscsi_ip_search_list_by_IPv4(list_t *list, const char *ipv4);
iscsi_ip_t *iscsi_ip_search_list_by_IPv6(list_t *list, const char *ipv6);
/* (IPv4 texts equal) + (IPv6 texts differ): 1 both for "same" and "both
 * differ", so not an equality test. -1 for a NULL entry. */
int iscsi_ip_cmp_ip(const iscsi_ip_t *a, const iscsi_ip_t *b);

/* Appends the portal addresses of the links that are up; never clears the
 * list. With bonding on and a link up: one "egiga0" entry with LAN 1's
 * addresses. Otherwise "egiga0" (LAN 1) then "egiga1" (LAN 2), each only when
 * its link is up and it has an IPv4 or (IPv6 on) an IPv6 address.
 * 0; -9989 for NULL; -9987 when out of memory (entries appended stay). */
int sys_net_get_ip_list(list_t *list);
/* Lower-cases A-Z and turns '_' into '-' in place, logging the text before
 * and after at log_level (the daemon's node list logs at 1, the host-name
 * conversion at 2). 0, or -1 on NULL. */
int conv_iqn_str(char *text, int log_level);
/* conv_iqn_str at level 2. */
int conv_hostname_to_iqn_str(char *text);
/* The host name, asked of the system when refresh is 1 or nothing is cached
 * yet, else the cached one; cut to size (and to 127 characters). 0; -9989 for
 * NULL, size 0 or refresh not 0/1; -9980 when the system has no name. */
int sys_net_get_host_name(char *out, size_t size, int refresh);
/* As sys_net_get_host_name, then in IQN form (conv_hostname_to_iqn_str). */
int sys_net_get_host_name_in_iqn_spec(char *out, size_t size, int refresh);
/* LAN 1's MAC address as "xx:xx:xx:xx:xx:xx" (out holds 18 bytes). 0; -9981
 * when it cannot be read; -9989 for NULL. */
int sys_net_get_lan1_mac_str(char *out);

#ifdef __cplusplus
}
#endif

#endif
