// SPDX-License-Identifier: Apache-2.0
/* The configuration store on the configuration database: the numbered-entry
 * scanner and counters the schema's lists rest on, the target schema, the
 * service settings, and the table iscsi_conf_ops that exposes them.
 *
 * Lists are numbered children "<root>/id:N/<field>" from 1, dense: a reader
 * stops at the first N whose key is empty, so entry N is visible only when
 * 1..N-1 all hold a key. Results: 0 success, -9989 parameter error, -9981
 * failure (also the generic one), -9980 not found, -9979 no room, -9990 /
 * -9992 passed up from the typed wrappers (config/korvadm_utils_db.h).
 *
 * Values under "/system_mgr" go through the platform's db* shortcuts, whose
 * results are ignored: they cannot fail here. Everything else goes through
 * the typed wrappers, whose failures are reported. */
#ifndef CONFIG_KORVADM_XMLDB_CONF_H
#define CONFIG_KORVADM_XMLDB_CONF_H

#include <stddef.h>
#include <stdint.h>

#include "config/korvadm_conf.h"

#ifdef __cplusplus
extern "C" {
#endif

/* The store's operations table (korvadm_xmldb_conf_ops.cpp). */
extern const iscsi_conf_ops_t iscsi_conf_ops;

/* Recounts the ACL initiators (1..129) into "/iscsi/acl/count". 0 / -9981. */
int xmldb_update_current_aclcnt(void);

/* ---- targets: at most 64 under "/iscsi/target", keyed by "name" ---- */

/* Validates conf (name shorter than CONF_NAME_LEN, iqn, tpgt >= 0,
 * chap_enable 0/1, hba_id >= 0, CHAP name and secret when CHAP is on; -9989
 * before any write), takes the free
 * entry (-9979 when 64 exist), sets conf->dbidx, writes the fields and bumps
 * the count. A failed write gives -9981 and leaves what was written. */
int xmldb_add_new_target(target_conf_t *conf);
/* Deletes the entry and its subtree; later entries are not renumbered. */
int xmldb_del_target_by_name(const char *name);
/* 1 when a target of that name exists, else 0 ("" included); -9989 for NULL. */
int xmldb_check_target_exist(const char *name);
/* 1 when the name exists, -9979 when 64 others exist, 0 when it can be added. */
int xmldb_check_add_target(const char *name);
int xmldb_get_target_state(int *state, const char *name);
int xmldb_set_target_state(int state, const char *name);
int xmldb_get_target_tpgt(int *tpgt, const char *name);
int xmldb_get_target_hba_id(int *hba_id, const char *name);
int xmldb_set_target_hba_id(int hba_id, const char *name);
/* Lowest back-end number 0..63 no target uses; -9979 (*hba_id = -1) if none. */
int xmldb_get_free_target_hba_id(int *hba_id);
/* size must be at least CONF_IQN_LEN. */
int xmldb_get_target_iqn(char *buf, size_t size, const char *name);
int xmldb_set_target_iqn(const char *iqn, const char *name);
/* chap_enable 0 clears the name and secret; anything but 0/1 is -9989. */
int xmldb_set_target_chap(int chap_enable, const char *chap_name, const char *chap_pwd, const char *name);
/* Recounts targets and running targets over 1..64 (gaps included), then
 * deletes entry count + 1 when it holds a status but no name (a ghost of an
 * interrupted delete); an entry with a name is never deleted. */
int xmldb_update_current_targetcnt(void);
/* size must be at least CONF_NAME_LEN. */
int xmldb_get_target_status(char *buf, size_t size, const char *name);
int xmldb_set_target_status(const char *status, const char *name);
/* Fills conf (a record from target_conf_new) with every field of the target. */
int xmldb_get_target_conf_by_name(target_conf_t *conf, const char *name);
/* Appends one record per target (1..64, up to the first empty name) with name
 * and tpgt only. A record that cannot be filled (an unreadable tpgt, a name
 * too long for the record) is skipped with a logged error. Fails as a whole,
 * appending nothing, only with -9992 when the service does not answer (the
 * caller may retry) or -9987 with no memory. */
int xmldb_get_all_target_conf_lite(list_t *list);
/* As the lite form, every field filled; CHAP name and secret only when CHAP is on. */
int xmldb_get_all_target_conf(list_t *list);
/* Deletes "/iscsi/target"; always 0. */
int xmldb_clean_target_conf(void);
/* 0 when the target's "conn_info" was deleted, 6 when there is no such target. */
int xmldb_del_target_conn_info(const char *name);
/* Writes connection conn's ip and iqn: 0, -9981 on a failed write, 6 when
 * there is no such target. */
int xmldb_set_target_conn_info(const char *name, int conn, const char *ip, const char *iqn);

/* ---- LUNs: at most 128 under "/iscsi/lun", keyed by "name" ---- */

/* Validates conf (name shorter than CONF_NAME_LEN, uuid, serial, size > 0,
 * prealloc 0/1; -9989 before any write), sets conf->vol_state = 1, takes the
 * free entry (-9979 when 128 exist) and writes name, uuid, serial, size,
 * sector 512, devid, prealloc, img_file, vol_state, then bumps the count. */
int xmldb_add_new_lun(lun_conf_t *conf);
/* Deletes the entry and its subtree; later entries are not renumbered. */
int xmldb_del_lun_by_name(const char *name);
int xmldb_check_lun_exist(const char *name);
/* 1 when the name exists, -9979 when 128 others exist, 0 when it can be added. */
int xmldb_check_add_lun(const char *name);
/* Field operations by LUN name: "" or NULL name -9989, unknown -9980. Text
 * readers cut to size. Setters refuse (-9989, nothing written) a negative
 * vol_state, prealloc_state or connect state, a progress outside 0..100 and
 * a NULL serial or status ("" clears the status). */
int xmldb_get_lun_uuid(char *buf, size_t size, const char *name);
int xmldb_get_lun_img_file(char *buf, size_t size, const char *name);
int xmldb_get_lun_serial(char *buf, size_t size, const char *name);
int xmldb_set_lun_serial(const char *serial, const char *name);
int xmldb_get_lun_vol_state(int *state, const char *name);
int xmldb_set_lun_vol_state(int state, const char *name);
int xmldb_get_lun_size(uint64_t *size, const char *name);
int xmldb_set_lun_size(uint64_t size, const char *name);
int xmldb_get_lun_alloc_size(uint64_t *size, const char *name);
int xmldb_set_lun_alloc_size(uint64_t size, const char *name);
int xmldb_get_lun_connect_state(int *state, const char *name);
int xmldb_set_lun_connect_state(int state, const char *name);
int xmldb_get_lun_prealloc(int *prealloc, const char *name);
int xmldb_get_lun_prealloc_state(int *state, const char *name);
int xmldb_set_lun_prealloc_state(int state, const char *name);
int xmldb_set_lun_prealloc_progress(int progress, const char *name);
int xmldb_get_lun_status(char *buf, size_t size, const char *name);
int xmldb_set_lun_status(const char *status, const char *name);
/* Lowest device number 0..127 no LUN uses; -9979 (*devid = -1) if none. */
int xmldb_get_free_lun_devid(int *devid);
/* Record readers. A missing number keeps its unknown value (devid,
 * vol_state, prealloc_state, connected, lun_num -1; prealloc, sizes 0). The
 * list readers skip a record that cannot be filled (a name too long for the
 * record among them) and fail whole, appending nothing, only with -9992 when
 * the service does not answer, or -9987. The crash reader reads as the full
 * one does. By UUID: the first LUN on that volume. */
int xmldb_get_all_lun_conf(list_t *list);
int xmldb_get_all_lun_conf_lite(list_t *list);
int xmldb_get_all_lun_conf_in_crash_conf(list_t *list);
int xmldb_get_lun_conf_by_name(lun_conf_t *conf, const char *name);
int xmldb_get_lun_conf_by_uuid(lun_conf_t *conf, const char *uuid);
/* Recounts LUNs over 1..128 (gaps included) into "/iscsi/lun/count", then
 * deletes entry count + 1 when it holds a status but no name. */
int xmldb_update_lun_current_count(void);

/* ---- target-LUN mapping: "/iscsi/target/id:N/map_lun", at most 128 ---- */

/* Writes the map entry (lun_name, lun_num), then the LUN's target_name and
 * lun_num, then bumps the map count; when a write fails the map entry is
 * deleted and the LUN's target_name emptied again (-9981). */
int xmldb_add_target_lun_map(const char *target_name, const char *lun_name, int lun_num);
/* Deletes the map entry, empties the LUN's target_name, lowers the count. */
int xmldb_del_target_lun_map(const char *target_name, const char *lun_name);
/* Lowest LUN number 0..127 the target's map does not use; -9979 if none. */
int xmldb_get_free_lun_num(int *lun_num, const char *target_name);
/* The LUN's target ("" when not mapped) and LUN number. */
int xmldb_get_mapping_target(char *target_name, size_t size, int *lun_num, const char *lun_name);
/* Appends one record per map entry of the target. */
int xmldb_get_target_map_lun_conf(const char *target_name, list_t *list);

/* ---- ACLs: initiators (at most 129 under "/iscsi/acl") and their rights,
 * each right kept on both sides: the initiator's "mapped_lun" list and the
 * LUN's "acl" list. Rights are written "DENY", "RO", "RW". ---- */

/* 1 when an initiator (alias) is known, else 0. */
int xmldb_check_acl_initiaor_exist(const char *initiator);
int xmldb_check_acl_alias_exist(const char *alias);
/* 0 when neither the initiator nor the alias is known; 1 when either is. */
int xmldb_check_add_acl_initiator(const char *initiator, const char *alias);
/* -9979 when 129 initiators exist; -9989 for an initiator too long. */
int xmldb_add_acl_initiator(const char *initiator, const char *alias);
/* Removes the initiator's entry under each LUN it has a right on, then the
 * initiator; a missing other side is logged and passed. */
int xmldb_del_acl_initiator(const char *initiator);
int xmldb_get_all_acl_initiator_conf_lite(list_t *list);
/* Grants access_right (0 deny, 1 read-only, 2 read-write) on the LUN, adding
 * an unknown initiator first; both sides are written, then recounted. */
int xmldb_set_lun_acl(const char *initiator, const char *alias, const char *lun_name, int access_right);
int xmldb_get_all_lun_acl_conf_from_lun(const char *lun_name, list_t *list);
/* Removes the LUN from every initiator that has a right on it. */
int xmldb_remove_lun_from_all_acl(const char *lun_name);
/* The initiator whose alias this is ("" when none, or when it does not fit size). */
int xmldb_get_initiator_name_from_alias(char *buf, size_t size, const char *alias);
/* Deletes "/iscsi/acl"; always 0. */
int xmldb_clean_acl_conf(void);
/* Records the result of the initiator's access to the LUN. */
int xmldb_update_sess_acl_lun_access_status(const char *initiator, const char *lun_name, unsigned status);

/* ---- service settings ---- */

int xmldb_get_service_enable(int *enable);
int xmldb_set_service_enable(int enable);
/* Settings-layout version; with none stored: 1 when "/iscsi/acl/count" holds
 * a value (the first layout), 0 on a fresh store. -9981 on a failed read. */
int xmldb_get_korvadm_ver(int *ver);
int xmldb_set_korvadm_ver(int ver);
int xmldb_get_service_progress(int *progress);
int xmldb_set_service_progress(int progress);
/* size must be at least 128; "" means none saved. */
int xmldb_get_saved_host_name(char *buf, size_t size);
int xmldb_set_saved_host_name(const char *host_name);
/* size must be at least CONF_GEN_IQN_LEN; "" when unset. */
int xmldb_get_iqn_prefix(char *buf, size_t size);
int xmldb_set_iqn_prefix(const char *prefix);
/* dev_name "bond0"/"egiga0" is the first port's slot, "egiga1" the second's;
 * any other -9980. Readers: buf holds 16 (IPv4) / 40 (IPv6) bytes; -9980
 * when nothing is saved. */
int xmldb_get_saved_ipv4_addr(char *buf, const char *dev_name);
int xmldb_set_saved_ipv4_addr(const char *addr, const char *dev_name);
int xmldb_get_saved_ipv6_addr(char *buf, const char *dev_name);
int xmldb_set_saved_ipv6_addr(const char *addr, const char *dev_name);
/* Empties both saved IPv4 addresses; the IPv6 ones stay. */
int xmldb_clean_saved_ip_addr(void);
/* *level = 0 and the wrapper's code on a failed or empty read. */
int xmldb_get_debug_level(int *level);
int xmldb_set_debug_level(int level);
int xmldb_get_nesrad_pid(int *pid);
/* pid 0 means no daemon runs; a negative pid is -9989. */
int xmldb_set_nesrad_pid(int pid);
int xmldb_get_nesrad_enable(int *enable);
int xmldb_set_nesrad_enable(int enable);
int xmldb_get_nesrad_ip(char *buf, size_t size);
int xmldb_set_nesrad_ip(const char *ip);
int xmldb_clean_nesrad_conf(void);
/* Deletes "/iscsi/sess/initiator"; always 0. */
int xmldb_clean_sess_conf(void);
int xmldb_save_conf(void);
/* Removes the iSNS settings and the target, LUN, ACL and session subtrees;
 * always 0. */
int xmldb_clean_conf(void);
int xmldb_set_temp_return_code(int code);

/* ---- volume summaries under "/iscsi/lun/total_size" ---- */

/* Number (>= 1) of the summary of the volume with that UUID; -1 when none
 * has it, -9981 when the count or a listed entry cannot be read, -9989 for
 * NULL. */
int xmldb_get_vol_lun_info_idx_by_uuid(const char *uuid);
/* Rewrites the summaries from a list of vol_info_t (common/korvadm_sys.h):
 * each volume without keep_figures takes the non-zero allocation of its old
 * summary, and its claimed-free figure from its free figure; then the
 * summaries are replaced, numbered from 1 in list order, with the count and
 * both totals. Deletes and writes are tried 3 times; -9981 when they keep
 * failing (what was written stays). 0 on success. */
int xmldb_update_total_vol_size_info(list_t *volumes);
/* "/iscsi/lun/total_size/total_alloc_size" and ".../total_size". 0 / -9981. */
int xmldb_set_lun_total_alloc_size(uint64_t size);
int xmldb_set_lun_total_apparent_size(uint64_t size);

#ifdef __cplusplus
}
#endif

#endif
