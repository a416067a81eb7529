// SPDX-License-Identifier: Apache-2.0
/* The LIO back end of the kernel target driver: configfs primitives, the
 * three kernel modules, the target-side operations, backstores, LUN mapping
 * and ACLs.
 *
 * configfs tree driven here (all under the system root):
 *
 *   /sys/kernel/config/target/
 *     iscsi/<iqn>/tpgt_<n>/        T, the portal group of a target
 *       enable, attrib/, param/      switches and parameters
 *       np/<addr>:<port>             network portals ("[v6]:port", "[v6%if]:port")
 *       acls/<initiator>/            per-initiator auth/, attrib/,
 *         lun_<m>/lun_<m>              link to lun/lun_<m>; write_protect
 *       lun/lun_<m>/<lun name>       link to the backstore
 *     core/fileio_<hba>/<lun name>/  backstores: control, enable, wwn/
 *   /var/target/alua/tpgs_<serial>   ALUA state of a backstore
 *   /var/target/{pr,alua}            kernel state directories
 *
 * Attributes are written through the shell (values and paths escaped, never
 * run) and read with stdio; "verified" writes read the value back. Callers
 * serialise driver operations. Every function returns 0 or a negative code of
 * common/korvadm_err.h. Paths taken as arguments are already mapped through
 * the system root; the fixed paths of this file are mapped inside. */
#ifndef KORVADM_MOD_LIO4_H
#define KORVADM_MOD_LIO4_H

#include <stddef.h>

#include "kernel/korvadm_mod.h"

#ifdef __cplusplus
extern "C" {
#endif

#define IP_TYPE_V4 1
#define IP_TYPE_V6 2

/* The LIO table (type 2): slots 0..20 filled, 21 empty. */
extern const iscsi_mod_ops_t lio3_mod_ops;

/* ---- configfs primitives ---- */

/* Creates path and missing parents (0700). -9989 for NULL; a failed mkdir is
 * logged but still answers 0: callers that must know check the path. */
int configfs_mkdir(const char *path);
/* rmdir of one empty directory. -9989 NULL; -9988 failure. */
int configfs_rmdir(const char *path);
/* Removes a tree ("rm -rf"). -9989 NULL; -9988 failure. */
int configfs_rmdir_recursive(const char *path);
/* 0 when path exists, else -1. */
int configfs_path_exist(const char *path);
/* -1 when nothing is mounted at the configfs mount point, else whether it
 * exists (0 / -1). */
int configfs_is_mounted(void);
/* "mount -t configfs configfs <mount point>". 0 / -9988. */
int configfs_mount(void);
/* Reads the attribute into buf (size bytes; the text is cut to size-1 and
 * always terminated) and strips one line end found among its last ten
 * characters (never the first character). -9989 for NULL or size 0; -9973
 * when it cannot be opened. */
int configfs_read_attr_str(const char *path, char *buf, size_t size);
/* Raw read: up to size bytes into buf, count in *out_len, no termination.
 * -9989 / -9973 as above. */
int configfs_read_attr_buf(const char *path, char *buf, size_t size, size_t *out_len);
/* Reads a decimal attribute. -9971 when it is empty; a text that is not a
 * number answers 0 and leaves *out unchanged. */
int configfs_read_attr_int(const char *path, int *out);
/* Writes value exactly (retrying once with a line end when the kernel refuses
 * it without). With verify, reads it back: -9972 when it differs, -9973 when
 * it cannot be read. -9989 NULL; -9973 both writes failed; -9987 no memory. */
int configfs_write_attr_str(const char *path, const char *value, int verify);
/* configfs_write_attr_str of "%d". */
int configfs_write_attr_int(const char *path, int value, int verify);

/* ---- kernel modules ---- */

/* Slot 0: mounts configfs if needed, inserts the modules, creates the iSCSI
 * fabric directory and /var/target/{pr,alua}. Judged by /proc/modules; on a
 * failure from target_core_file onwards all three modules are removed and
 * -9976 returned. */
int lio3_start_module(void);
/* Slot 1: from running, removes every target, the fabric directory and every
 * backstore, then the modules; from half started, only the modules. 0, or
 * -9975 when iscsi_target_mod or target_core_file cannot be removed. */
int lio3_stop_module(void);
/* Slot 2: 1 stopped, 0 running, -9974 module in but fabric directory missing. */
int lio3_get_module_state(void);

/* ---- targets (slots 3..10) ----
 * Each checks the target first: NULL, empty IQN (or one that is not a single
 * path component) or tpgt outside 0..63 answer -9989. */

/* Creates the portal group with its default attributes; an existing one is
 * left untouched (0). -9973 when the group or its state directory cannot be
 * made; the call then removes what it made and nothing else (its group, a
 * new state directory, the IQN directory only when it made it and no other
 * group holds it). */
int lio3_add_target(iscsi_target_t *target);
/* Disables, removes portals, ACLs and LUNs, then the group and the IQN
 * directory. An absent target answers 0; any failed step -9973. */
int lio3_del_target(iscsi_target_t *target);
/* An unreadable enable switch counts as enabled. -9973 on failure. */
int lio3_enable_target(iscsi_target_t *target);
int lio3_disable_target(iscsi_target_t *target);
/* Sets the authentication switch from target->chap and, with CHAP on, pushes
 * the credentials to every ACL. -9989 for invalid CHAP settings. */
int lio3_set_target_chap(iscsi_target_t *target);
/* Replaces every portal with the wanted ones (IPv4 first, then IPv6);
 * creation failures are logged only. -9989, with nothing changed, when a
 * wanted address or interface name would not stay inside one portal name
 * ('/', or an interface "." or ".."); the same holds for _v2. */
int lio3_set_target_ip(iscsi_target_t *target);
/* Creates the wanted portals whose address is missing and removes those no
 * longer wanted, by address (ports are not compared). */
int lio3_set_target_ip_v2(iscsi_target_t *target);
/* Writes timeout to every ACL's attrib/dataout_timeout. -9968 when the
 * target is not in the kernel; -9973 when its ACLs cannot be listed. */
int lio3_set_target_attr_dataout_timeout(int timeout, iscsi_target_t *target);
/* Appends the target's portals to ip_list, in directory order; names that
 * do not parse are dropped. -9973 when the np directory cannot be read. */
int lio3_get_target_existing_ip_list(list_t *ip_list, iscsi_target_t *target);

/* ---- backstores and LUN mapping (slots 11..16) ----
 * LUN checks, each -9989: NULL, a name that is empty or not one path
 * component, an empty backing path ("lun device path is empty") or one with
 * ',' or a line end ("lun device path error"), size 0, a negative HBA id, a
 * serial that is not one path component. B below is the backstore directory
 * core/fileio_<hba_id>/<name>. */

/* Creates the backing file when absent, then B with its control
 * "fd_dev_name=<path>,fd_dev_size=<size>,fd_buffered_io=1", the serial and
 * the enable switch. An existing B is left untouched (0). -9973 on a failed
 * step, after taking away what the call made (B, the HBA directory, the
 * file). */
int lio3_add_backstore(iscsi_lun_t *lun);
/* Slot 13: removes the LUN's fileio backstore (and its ALUA state). An
 * absent one answers 0; -9989 on bad LUN fields or failure. */
int lio3_shutdown_backstore(iscsi_lun_t *lun);
/* Slot 13's removal; then deletes the backing file only when its real path
 * lies under "/.systemfile/iscsi_target/fileio/" (a failure there is only
 * logged). */
int lio3_del_backstore(iscsi_lun_t *lun);
/* Writes "fd_dev_size=<size>" to B's control. -9969 when B is absent. */
int lio3_change_backstore_size(iscsi_lun_t *lun);
/* Maps the LUN's backstore as lun_<lun_number> (0..255) of the target's
 * portal group. A LUN record without a number takes lun_number; one with a
 * different number is refused. -9989 bad arguments, a missing backstore or
 * portal group; -9986 no backing file; -9970 the number is taken; -9973 the
 * kernel refused (nothing is left behind). */
int lio3_add_lun_mapping(iscsi_lun_t *lun, iscsi_target_t *target, int lun_number);
/* Unmaps lun->lun_num of the target. An absent mapping answers 0; -9969 when
 * the LUN's backstore is gone; -9973 when the kernel refuses (an ACL still
 * maps the LUN). */
int lio3_del_lun_mapping(iscsi_lun_t *lun, iscsi_target_t *target);

/* ---- ACL nodes and rights (slots 17..20) ---- */

/* Creates the initiator's ACL node (a name that is not one path component:
 * -9989), then pushes the target's CHAP credentials and data-out time-out
 * to it (results ignored). "default_policy" is never created and answers 0.
 * -9968 when the portal group is not in the kernel; -9973 when the node
 * cannot be made. */
int lio3_add_acl_initiator(const char *initiator_name, iscsi_target_t *target);
/* Removes the node with its mapped LUNs. An absent node or target, and
 * "default_policy", answer 0; -9973 when it cannot be removed. */
int lio3_del_acl_initiator(const char *initiator_name, iscsi_target_t *target);
/* Applies lun_acl->access_right (0 deny, 1 read-only, 2 read-write) for its
 * initiator to its mapped LUN. Deny unmaps it, with an enabled target
 * switched off around the change and on again; the other rights map it
 * with write_protect 1 or 0 (verified). -9989 bad record; -9973 failure,
 * leaving no new link behind. */
int lio3_add_lun_acl(iscsi_lun_acl_t *lun_acl);
/* Sets the record's right to deny and applies it. */
int lio3_del_lun_acl(iscsi_lun_acl_t *lun_acl);


/* ---- sessions (slot 21; records in kernel/korvadm_sess.h) ---- */

/* Appends the portal group's live sessions to sess_list and links each into
 * its target's and initiator's session lists; initiators are found in, or
 * added to, initiator_list by name. The kernel's text comes from the group's
 * "sessions" file or, on kernels without one, from every ACL's "info" file
 * (32768 bytes at most in all). Neither present: 0, nothing added. -9989 bad
 * arguments; -9987 no memory; -9973 the text cannot be read. */
int lio3_get_target_session(list_t *sess_list, list_t *initiator_list, iscsi_target_t *target);

#ifdef __cplusplus
}
#endif

#endif
