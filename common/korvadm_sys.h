// SPDX-License-Identifier: Apache-2.0
/* System information: network addresses and the host name in IQN form
 * (network half, korvadm_sys.cpp); volumes and disks (storage half,
 * korvadm_sys_storage.cpp).
 *
 * Addresses come from the network settings under "/network_mgr" in the
 * configuration database, link state from the platform's
 * LIB_Get_Lan_Link_Speed, the host name from sys_hostname. Volumes, RAIDs and
 * disks come from the system-information database ("/var/run/xmldb_sock_sysinfo",
 * keys in docs/sysinfo.md); mount points are confirmed with sys_mount_point,
 * room is measured with "df", disk sleep is asked of "powermgmt -s". */
#ifndef KORVADM_SYS_H
#define KORVADM_SYS_H

#include <stddef.h>
#include <stdint.h>

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

/* ---- volumes and disks ---- */

#define VOL_MNT_PATH_LEN 256
#define VOL_UUID_LEN     128
/* Counts read from the system-information database are clamped to this. */
#define SYSINFO_MAX_ENTRIES 256

/* One volume as the configuration store's summaries see it. */
typedef struct vol_info_s {
    char mnt_path[VOL_MNT_PATH_LEN];
    char uuid[VOL_UUID_LEN];
    uint64_t vol_size;          /* bytes */
    uint64_t alloc_size;        /* space allocated to LUNs */
    uint64_t claim_alloc_size;  /* space claimed by LUNs (their apparent size) */
    uint64_t free_size;         /* free space as measured */
    uint64_t claim_free_size;   /* free space once claims are met */
    /* Set when the caller's figures are final: the summaries rewrite then
     * does not carry over the stored allocation. */
    int keep_figures;
    list_node_t node;           /* owner is the entry */
} vol_info_t;

/* A zeroed entry, node owned by it; NULL ("malloc vol_info_t failed") when
 * out of memory. */
vol_info_t *vol_info_new(void);
/* Unlinks and frees; NULL is ignored. */
void vol_info_free(vol_info_t *vol);
void vol_info_free_list(list_t *list);

/* One volume with its room figures, in a chain through `next`. */
typedef struct vol_lun_info_s {
    char vol_mnt_path[VOL_MNT_PATH_LEN];
    char uuid[VOL_UUID_LEN];
    /* The LUN code's three figures for this volume: space allocated, space
     * claimed, and one more it keeps here. */
    uint64_t lun_alloc_size;
    uint64_t lun_claim_size;
    uint64_t lun_extra_size;
    uint64_t vol_size;        /* total, as df shares it */
    uint64_t free_size;       /* current free figure */
    uint64_t init_free_size;  /* free figure when measured */
    int hibernation;          /* 1 when a member disk sleeps */
    struct vol_lun_info_s *next;
} vol_lun_info_t;

/* Number of disks ("/disks/disk#") / volumes ("/vols/vol#"), clamped to
 * 0..SYSINFO_MAX_ENTRIES; 0 when unreadable, negative or not a number. */
int xmldb_get_disk_cnt(void);
int xmldb_get_vol_cnt(void);
/* 1-based index of the RAID whose "dev" is md_dev / of the disk named name;
 * 0 when absent (logged). */
int xmldb_get_md_dbidx_by_md_dev(const char *md_dev);
int xmldb_get_disk_dbidx_by_name(const char *name);
/* The member list text of RAID raid_idx into out. 0; -9980 when empty or
 * unreadable; -9989 for bad arguments. */
int xmldb_get_md_raid_disks(int raid_idx, char *out, size_t size);

/* Mount path of the volume with that UUID, when it is mounted. Every volume
 * is looked at (the scan ends at the first empty name), so with duplicate
 * UUIDs the last mounted one wins. 5 found (out set); 6 not found (out "");
 * -9989 for NULL arguments or size 0. */
int sys_raid_get_mnt_path_by_uuid(char *out, size_t size, const char *uuid);
/* 10 when the first volume with that UUID is mounted (unlocked), 9 when it is
 * not, is absent, or uuid is ""; -9989 for NULL. */
int sys_raid_vol_is_unlocked_by_uuid(const char *uuid);

/* Asks "powermgmt -s" which disks sleep: *states gets a malloc'd array of
 * disk_cnt ints (1 asleep; the caller frees it) where disk i (from 0) sleeps
 * when bit i % 32 of the reported mask is set. A missing "result: " marker
 * means all awake. Returns the number of awake disks, or -1 when the command
 * cannot be run or fails, or for bad arguments. */
int powermgmt_get_hibernate_status(int **states, int disk_cnt);
/* 1 when a member disk of volume vol_idx's RAID sleeps (states as filled
 * above, disk_cnt entries), 0 when none does; -9981 when the volume's device
 * is unreadable, -9998 when its RAID or member list is not found, -9989 for
 * bad arguments. */
int xmldb_get_vol_hibernation(int vol_idx, int disk_cnt, const int *states);

/* Frees every record of the chain and sets *head NULL. */
void vol_lun_info_list_deinit(vol_lun_info_t **head);
/* The record with that UUID after adding the three increments to its figures
 * (a claim growing beyond the allocation lowers the free figure, never below
 * 0) and storing flag unless it is negative; a new record
 * (_vol_info_list_insert) when none has that UUID. NULL when it cannot be
 * added. */
vol_lun_info_t *vol_lun_info_update(vol_lun_info_t **head, const char *uuid, uint64_t alloc_inc,
                                    uint64_t claim_inc, uint64_t extra_inc, int flag);
/* Record n (from 0) of the chain, remembering n + 1; a negative n continues
 * from the remembered position. The position is process-wide: not
 * thread-safe, meant for one walk at a time. NULL past the end. */
vol_lun_info_t *vol_lun_info_list_get_nth(vol_lun_info_t *head, int n);
/* Adds a record for every mounted volume to the chain, each with its room
 * and hibernation flag (asking "powermgmt -s" when check is 1, else taking
 * every disk as asleep). 0; 1 when there are no disks; -1 or the failing
 * step's code otherwise. */
int init_root_vol_lun_info(vol_lun_info_t **head, int check);
/* Appends one vol_info_t (mount path and UUID, figures 0) per volume to an
 * empty list, all or none. 0; -9989 for NULL or a non-empty list; -9987
 * when out of memory. */
int get_vol_info_list(list_t *list);

#ifdef __cplusplus
}
#endif

#endif
