// SPDX-License-Identifier: Apache-2.0
/* What only the files of the LIO back end (kernel/korvadm_mod_lio4_*.cpp)
 * share: fixed paths and the path builders, the target check, configfs tree
 * helpers, and the unit's private operations. Tests reach the private
 * operations through this header; nothing outside kernel/ includes it. */
#ifndef KORVADM_MOD_LIO4_INTERNAL_H
#define KORVADM_MOD_LIO4_INTERNAL_H

// Every file of the unit logs as the unit.
#undef KORV_LOG_UNIT
#define KORV_LOG_UNIT "korvadm_mod_lio4"

#include <dirent.h>

#include <cstdint>
#include <cstring>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "common/korvadm_err.h"
#include "common/korvadm_list.h"
#include "common/korvadm_log.h"
#include "common/korvadm_str.h"
#include "common/korvadm_sysroot.h"
#include "kernel/korvadm_mod_lio4.h"

namespace lio4 {

constexpr const char *CONFIGFS_MOUNT = "/sys/kernel/config";
constexpr const char *FABRIC_ROOT = "/sys/kernel/config/target/iscsi";
constexpr const char *CORE_ROOT = "/sys/kernel/config/target/core";
constexpr const char *VAR_PR_DIR = "/var/target/pr";
constexpr const char *VAR_ALUA_DIR = "/var/target/alua";

struct dir_closer {
    void operator()(DIR *d) const { closedir(d); }
};
using dir_ptr = std::unique_ptr<DIR, dir_closer>;

struct target_deleter {
    void operator()(iscsi_target_t *t) const { iscsi_target_free(t); }
};
using target_ptr = std::unique_ptr<iscsi_target_t, target_deleter>;

using korv::field_str;

// Names from records become one path component: no '/', not "." or "..".
inline bool is_component(std::string_view name)
{
    return !name.empty() && name != "." && name != ".." && name.find('/') == std::string_view::npos;
}

inline bool tpgt_ok(int tpgt)
{
    return tpgt >= 0 && tpgt <= ISCSI_TPGT_MAX;
}

/* Paths: every path the unit uses is built here, mapped through the system
 * root once (the unit's only calls of sysroot_path). Names from records are
 * checked to be one component before they get here. */
inline std::string fixed_path(const char *path)  // one of the constants above, or a module file
{
    return sysroot_path(path);
}

inline std::string iqn_dir(std::string_view iqn)
{
    return fixed_path(FABRIC_ROOT) + "/" + std::string(iqn);
}

inline std::string tpg_dir(std::string_view iqn, int tpgt)
{
    return iqn_dir(iqn) + "/tpgt_" + std::to_string(tpgt);
}

inline std::string fileio_dir(int hba_id, std::string_view lun_name)
{
    return fixed_path(CORE_ROOT) + "/fileio_" + std::to_string(hba_id) + "/" + std::string(lun_name);
}

// ALUA state of a portal group and of a backstore's unit serial.
inline std::string alua_tpg_dir(std::string_view iqn, int tpgt)
{
    return fixed_path(VAR_ALUA_DIR) + "/iSCSI/" + std::string(iqn) + "+" + std::to_string(tpgt);
}

inline std::string alua_serial_dir(std::string_view serial)
{
    return fixed_path(VAR_ALUA_DIR) + "/tpgs_" + std::string(serial);
}

enum class tcheck { ok, null, iqn, bad_iqn, tpgt };
tcheck check_target(const iscsi_target_t *t);

/* korvadm_mod_lio4_configfs.cpp: the tree */

// Names of the sub-directories of path (not "." or ".."), read in full
// before the caller changes anything. False when path cannot be opened.
bool list_subdirs(const std::string &path, std::vector<std::string> &names);
// The decimal number at the start of text, when there is one that fits.
bool leading_number(std::string_view text, int &out);
// list_subdirs, logging "can not open directory" under `func` when path
// cannot be opened.
bool list_subdirs_or_log(const char *func, const std::string &path, std::vector<std::string> &names);
// Removes a configfs group with everything in it; -9973 when it remains.
int remove_configfs_group(const std::string &path, int depth = 0);
// Removes every sub-directory of dir, ignoring single failures; -9989 when
// dir cannot be opened.
int remove_all_subdirs(const char *func, const std::string &dir);

/* korvadm_mod_lio4_target.cpp: portal-group attributes */

// Writes value to the portal group's attribute `rel` and verifies it; the
// log shows the value as `shown`, under `func`.
int write_tpg_attr(const char *func, const char *iqn, int tpgt, const char *rel, const std::string &value,
                   const char *shown);
int write_tpg_attr(const char *func, const char *iqn, int tpgt, const char *rel, int value);
// Writes a switch of the portal group, then AuthMethod "CHAP,None".
int write_switch_and_auth_method(const char *func, const char *iqn, int tpgt, const char *rel, int value);

/* korvadm_mod_lio4_auth.cpp */

// Writes the credentials the target's settings switch on to one ACL.
int push_chap(const char *func, const iscsi_target_t *target, const char *initiator);

/* korvadm_mod_lio4_storage.cpp: LUN records and trees */

// What a slot needs of a LUN record beyond its name, HBA id and serial.
enum lun_needs { NAME_HBA = 0, PATH = 1, SIZE = 2 };
// The LUN checks the slots share, each failure logged under `func` with
// -9989. The backing path becomes "fd_dev_name=<path>,..." of the control
// attribute, where a ',' or a line end would add keys of its own.
int check_lun(const char *func, const iscsi_lun_t *lun, int needs);
// lstat: a link counts, dangling or not.
bool entry_exists(const std::string &path);
// Removes a configfs group the kernel's way, then with "rm -rf" whatever is
// left (plain directories); 0 once path is gone, else -9973.
int remove_tree(const std::string &path);

}  // namespace lio4

// Logs and returns -9989 from the calling operation when the target is
// unusable; the trailing arguments are the tpgt message and its values.
#define CHECK_TARGET(t, null_msg, iqn_msg, ...)                                             \
    do {                                                                                    \
        switch (lio4::check_target(t)) {                                                    \
        case lio4::tcheck::null: DBG(0, null_msg); return ERR_PARAM;                        \
        case lio4::tcheck::iqn: DBG(0, iqn_msg); return ERR_PARAM;                          \
        case lio4::tcheck::bad_iqn: DBG(0, "target IQN is not a usable name"); return ERR_PARAM; \
        case lio4::tcheck::tpgt: DBG(0, __VA_ARGS__); return ERR_PARAM;                     \
        case lio4::tcheck::ok: break;                                                       \
        }                                                                                   \
    } while (0)

extern "C" {

/* korvadm_mod_lio4_module.cpp */

/* "insmod <mod_path>". -9989 NULL; -9988 when the command fails. */
int _insert_mod(const char *mod_path);
/* "rmmod <name>"; with check_inserted 1 an absent module answers 0 at once.
 * -9989 NULL; -9988 when the command fails. */
int _remove_mod(const char *mod_proc_name, int check_inserted);
/* Last resort: rm -rf the iscsi and core trees, rmmod all three modules.
 * -9988 when the last rmmod fails. No operation calls it. */
int _brute_force_remove_mod(void);
/* Runs cmd up to max_retry+1 times (see process_system_cmd_mt). */
int _process_system_cmd_mt(const char *cmd, int max_retry, int max_sleep_us);

/* korvadm_mod_lio4_target.cpp */

/* Generate-node-ACLs, MaxConnections 8, the alias, cmdsn depth 64: each
 * tried even after a failure; -9973 if any failed. */
int _set_target_default_attributes(const iscsi_target_t *target);
/* 1 enabled, 0 disabled; an unreadable switch counts as enabled. */
int _lio3_read_target_enable(const iscsi_target_t *target);
/* Sets the enable switch (0/1) unless it already holds flag. */
int _lio3_set_target_enable(const iscsi_target_t *target, int flag);
int _lio3_set_target_acl_dataout_timeout(int timeout, const char *iqn, int tpgt, const char *initiator);
/* Remove every ACL / LUN directory of the portal group; -9989 when the
 * group's acls/ or lun/ directory cannot be opened. */
int _lio3_remove_all_acl(iscsi_target_t *target);
int _lio3_remove_all_lun(iscsi_target_t *target);
/* Deletes every portal group (tpgt_<n>, whatever n) of target->iqn. -9973
 * when one could not be deleted and the IQN directory remains. */
int _lio3_remove_all_tpgt(iscsi_target_t *target);
/* Deletes every target of the iSCSI fabric. -9973 on the first failure. */
int _lio3_remove_all_iscsi_target(void);

/* korvadm_mod_lio4_portal.cpp */

/* IP_TYPE_V4 when name holds fewer than two ':', else IP_TYPE_V6. */
int _check_np_ip_type(const char *name);
/* Splits a portal directory name ("a.b.c.d:port", "[v6]:port",
 * "[v6%if]:port") into its parts. The port text must be under 6 characters;
 * address and interface must fit addr_size / if_size. -9989 on a malformed
 * name, -9971 on "". iface is "" when the name has no '%'. */
int _parse_lio_np_entry(char *addr, size_t addr_size, int *port, char *iface, size_t if_size,
                        const char *name);
int _lio3_create_network_portal(const char *iqn, int tpgt, const char *interface, const char *address, int port,
                                int type);
int _lio3_remove_network_portal(const char *iqn, int tpgt, const char *interface, const char *address, int port,
                                int type);
/* The kernel's portals of target, appended to list in directory order only
 * when all of them could be read. -9989 when np/ cannot be opened. */
int _get_exist_ip_list(const iscsi_target_t *target, list_t *list);
/* Removes every portal; -9973 at the first that stays. */
int _lio3_remove_all_np(const iscsi_target_t *target);

/* korvadm_mod_lio4_auth.cpp */

/* 1 when the CHAP settings are usable: CHAP off, or name and a 12..16
 * character password (and the same for mutual CHAP when it is on); else 0. */
int _lio3_validate_target_chap_settings(const iscsi_target_t *target);
/* Pushes the target's CHAP (and mutual CHAP) credentials to one ACL. */
int _lio3_set_target_chap_to_acl(const char *initiator_iqn, iscsi_target_t *target);
int _lio3_set_target_auth_ability(const char *iqn, int tpgt, int chap_flag);
int _lio3_set_target_chap_all_acl(const iscsi_target_t *target);

/* korvadm_mod_lio4_storage.cpp */

/* Removes the LUN's fileio backstore, its own ALUA port groups and ALUA
 * state; an absent one answers 0; -9973 when it stays. */
int _lio3_remove_fileio_device(iscsi_lun_t *lun);
/* Shuts down every fileio backstore and removes every HBA directory. */
int _lio3_shutdown_all_hba(void);
/* B with its control, serial and ALUA state directory; on a failed write B
 * is removed again. */
int _lio3_create_fileio_device(iscsi_lun_t *lun);
/* Removes B whatever it holds; -9973 when it stays. */
int _lio3_remove_fileio_device_brute_force(iscsi_lun_t *lun);

/* korvadm_mod_lio4_lun.cpp (lun->lun_num is the LUN number) */

/* lun/lun_<n> with its link to B and alua_tg_pt_write_md; the group goes
 * again when the link cannot be made. */
int _lio3_add_lun_to_target(iscsi_lun_t *lun, iscsi_target_t *target);
/* Unlinks lun/lun_<n>'s entries but the ALUA attributes, removes the group
 * and its ALUA state directory. */
int _lio3_del_lun_from_target(iscsi_lun_t *lun, iscsi_target_t *target);
int _lio3_del_all_port_in_target_lun(iscsi_lun_t *lun, iscsi_target_t *target);
/* Unlinks lun_<n>/<name> and removes lun_<n>; no operation calls it. */
int _lio3_remove_lun(iscsi_lun_t *lun, iscsi_target_t *target);

/* korvadm_mod_lio4_acl.cpp */

/* acls/<name> ("default_policy" is never made; 0). */
int _lio3_add_acl_initiator(const char *initiator_name, iscsi_target_t *target);
/* Removes acls/<name> with its mapped LUNs; an absent node answers 0. */
int _lio3_del_acl_initiator(const char *initiator_name, iscsi_target_t *target);
int _lio3_set_lun_acl_read_only(iscsi_lun_acl_t *lun_acl);
int _lio3_set_lun_acl_read_write(iscsi_lun_acl_t *lun_acl);
int _lio3_set_lun_acl_deny(iscsi_lun_acl_t *lun_acl);

/* korvadm_mod_lio4_sessions.cpp */

/* Parses len bytes of the kernel's sessions text (not necessarily
 * terminated) into sessions; single bad lines are logged and skipped. 0, or
 * -9989 for a NULL list, target or buffer. */
int _lio3_parse_sessions(list_t *sess_list, list_t *initiator_list, iscsi_target_t *target, const char *buf,
                         size_t len);
/* Copies the line at pos (up to the next newline before end, cut to max
 * characters) into line_out (max+1 bytes, terminated); *next_out is set past
 * the newline. No newline left: 0 and *next_out NULL. Returns the length. */
size_t _lio3_get_session_line(char *line_out, size_t max, const char *pos, const char *end, const char **next_out);
/* The line parsers: 0, or -1 when the line lacks its number (a bad ISID or
 * TSIH does not fail the session line; the TSIH is then -1). */
int _parse_LIO3_SID_line(const char *line, uint64_t *sid, int32_t *tsih, uint8_t isid[6]);
int _parse_LIO3_sess_CID_line(const char *line, int *cid);
/* Copies the address after "Address " up to the next blank, cut to 31
 * characters, into out (32 bytes). */
int _parse_LIO3_sess_ADDR_line(const char *line, char out[32]);
}

#endif
