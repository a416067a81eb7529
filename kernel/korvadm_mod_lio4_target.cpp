// SPDX-License-Identifier: Apache-2.0
// Targets: the portal group's creation with its default attributes, the
// enable switch, deletion, the data-out time-out, and the removal of every
// target when the driver stops.
#include "kernel/korvadm_mod_lio4_internal.h"

#include <cstring>
#include <string>
#include <string_view>
#include <vector>

#include "common/korvadm_err.h"
#include "common/korvadm_utils.h"

using namespace lio4;

namespace {

constexpr int DEFAULT_MAX_CONNECTIONS = 8;
constexpr int DEFAULT_CMDSN_DEPTH = 64;
constexpr const char *AUTH_METHOD = "CHAP,None";

}  // namespace

namespace lio4 {

// Writes value to the portal group's attribute `rel` and verifies it; the
// log shows the value as `shown`, under `func`. Any tag the kernel shows is
// taken: the teardown disables groups the appliance would not have made.
int write_tpg_attr(const char *func, const char *iqn, int tpgt, const char *rel, const std::string &value,
                   const char *shown)
{
    PARAM_GUARD(!iqn || tpgt < 0);
    std::string path = tpg_dir(iqn, tpgt) + rel;
    if (configfs_write_attr_str(path.c_str(), value.c_str(), 1) != 0) {
        DBG_AS(func, 0, "set %s = %s failed", path.c_str(), shown);
        return ERR_CONFIGFS;
    }
    return KORV_OK;
}

int write_tpg_attr(const char *func, const char *iqn, int tpgt, const char *rel, int value)
{
    std::string text = std::to_string(value);
    return write_tpg_attr(func, iqn, tpgt, rel, text, text.c_str());
}

// Writes a switch of the portal group, then AuthMethod: it stays "CHAP,None"
// whichever way the switches go, the authentication switch alone decides.
int write_switch_and_auth_method(const char *func, const char *iqn, int tpgt, const char *rel, int value)
{
    if (write_tpg_attr(func, iqn, tpgt, rel, value) != 0)
        return ERR_CONFIGFS;
    return write_tpg_attr(func, iqn, tpgt, "/param/AuthMethod", AUTH_METHOD, AUTH_METHOD) == 0 ? KORV_OK
                                                                                            : ERR_CONFIGFS;
}

}  // namespace lio4

namespace {

int _lio3_set_enable_default_policy(const char *iqn, int tpgt, int enable)
{
    PARAM_GUARD(!tpgt_ok(tpgt));
    return write_tpg_attr(__func__, iqn, tpgt, "/attrib/generate_node_acls", enable ? "1" : "0",
                          enable ? "Enable" : "Disable");
}

int _lio3_set_mcs_max_connection(const char *iqn, int tpgt, int max_conn)
{
    return tpgt_ok(tpgt) ? write_tpg_attr(__func__, iqn, tpgt, "/param/MaxConnections", max_conn) : ERR_PARAM;
}

int _lio3_set_target_alias(const char *iqn, int tpgt, const char *alias)
{
    return alias && tpgt_ok(tpgt) ? write_tpg_attr(__func__, iqn, tpgt, "/param/TargetAlias", alias, alias) : ERR_PARAM;
}

int _lio3_set_target_default_cmdsn_depth(const char *iqn, int tpgt, int depth)
{
    return depth >= 0 && tpgt_ok(tpgt) ? write_tpg_attr(__func__, iqn, tpgt, "/attrib/default_cmdsn_depth", depth) : ERR_PARAM;
}

}  // namespace

// Every step is tried even after a failure, so one refused attribute does
// not leave the others at the kernel's defaults.
int _set_target_default_attributes(const iscsi_target_t *target)
{
    std::string alias = field_str(target->alias);
    int rc = KORV_OK;
    if (_lio3_set_enable_default_policy(target->iqn, target->tpgt, 1) != 0) {
        DBG(0, "Enable default policy failed");
        rc = ERR_CONFIGFS;
    }
    if (_lio3_set_mcs_max_connection(target->iqn, target->tpgt, DEFAULT_MAX_CONNECTIONS) != 0) {
        DBG(0, "set max connections to %d failed", DEFAULT_MAX_CONNECTIONS);
        rc = ERR_CONFIGFS;
    }
    if (_lio3_set_target_alias(target->iqn, target->tpgt, alias.c_str()) != 0) {
        DBG(0, "set alias to %s failed", alias.c_str());
        rc = ERR_CONFIGFS;
    }
    if (_lio3_set_target_default_cmdsn_depth(target->iqn, target->tpgt, DEFAULT_CMDSN_DEPTH) != 0) {
        DBG(0, "set default cmdsn_depth to %d failed", DEFAULT_CMDSN_DEPTH);
        rc = ERR_CONFIGFS;
    }
    return rc;
}

int _lio3_set_target_acl_dataout_timeout(int timeout, const char *iqn, int tpgt, const char *initiator)
{
    PARAM_GUARD(timeout < 0 || !iqn || !initiator || !tpgt_ok(tpgt));
    std::string path = tpg_dir(iqn, tpgt) + "/acls/" + initiator + "/attrib/dataout_timeout";
    if (configfs_write_attr_int(path.c_str(), timeout, 0) != 0) {
        DBG(0, "set %s = %d failed", path.c_str(), timeout);
        return ERR_CONFIGFS;
    }
    return KORV_OK;
}

/* ========================================================== enable switch */

// An unreadable switch counts as enabled: callers then skip enabling
// rather than flip a target they cannot see.
int _lio3_read_target_enable(const iscsi_target_t *target)
{
    std::string path = tpg_dir(target->iqn, target->tpgt) + "/enable";
    int value = 1;
    if (configfs_read_attr_int(path.c_str(), &value) != 0) {
        DBG(0, "get %s failed", path.c_str());
        return 1;
    }
    return value != 0 ? 1 : 0;
}

int _lio3_set_target_enable(const iscsi_target_t *target, int flag)
{
    PARAM_GUARD(flag != 0 && flag != 1, "parameter error");
    if (_lio3_read_target_enable(target) == flag)
        return KORV_OK;
    return write_switch_and_auth_method(__func__, target->iqn, target->tpgt, "/enable", flag);
}

/* ==================================================== target operations */

int lio3_add_target(iscsi_target_t *target)
{
    CHECK_TARGET(target, "target is null", "target iqn is not given", "target tpgt is wrong: %d", target->tpgt);
    std::string tpg = tpg_dir(target->iqn, target->tpgt);
    if (configfs_path_exist(tpg.c_str()) == 0) {
        DBG(2, "target : %s , already exist", tpg.c_str());
        return KORV_OK;
    }
    std::string iqn = iqn_dir(target->iqn);
    std::string alua = alua_tpg_dir(target->iqn, target->tpgt);
    bool iqn_existed = configfs_path_exist(iqn.c_str()) == 0;
    bool alua_existed = check_path_exist(alua.c_str()) == 0;
    int rc = configfs_mkdir(tpg.c_str());
    if (rc == 0 && configfs_path_exist(tpg.c_str()) != 0) {
        DBG(0, "create tpg node: %s failed", tpg.c_str());
        rc = ERR_CONFIGFS;
    }
    if (rc == 0 && make_dir_include_parent(alua.c_str(), 0700) != 0) {
        DBG(0, "create taget node: %s failed", alua.c_str());
        rc = ERR_CONFIGFS;
    }
    if (rc != 0) {
        // Only what this call made goes: its portal group, the IQN directory
        // when no other group holds it, a state directory that is new.
        DBG(0, "lio3_add_target failed, rc = %d", rc);
        if (configfs_path_exist(tpg.c_str()) == 0)
            remove_configfs_group(tpg);
        if (!iqn_existed && configfs_path_exist(iqn.c_str()) == 0)
            configfs_rmdir(iqn.c_str());
        if (!alua_existed)
            remove_dir_recurive(alua.c_str());
        return rc;
    }
    if (_set_target_default_attributes(target) != 0)
        DBG(0, "set default attributes failed");
    // Best effort: the kernel holds a default_policy node only when one was made.
    std::string dataout = tpg + "/acls/default_policy/attrib/dataout_timeout";
    if (configfs_path_exist(dataout.c_str()) == 0)
        configfs_write_attr_int(dataout.c_str(), target->dataout_timeout, 0);
    return KORV_OK;
}

namespace {

// Deletion once the target is checked; the teardown calls it for every tag
// the kernel shows, management operations only for 0..63.
int remove_tpg(const char *func, iscsi_target_t *target)
{
    std::string tpg = tpg_dir(target->iqn, target->tpgt);
    if (configfs_path_exist(tpg.c_str()) != 0) {
        DBG_AS(func, 2, "target : %s , already removed", tpg.c_str());
        return KORV_OK;
    }
    if (_lio3_set_target_enable(target, 0) != 0) {
        DBG_AS(func, 0, "disable target failed");
        return ERR_CONFIGFS;
    }
    if (_lio3_remove_all_np(target) != 0) {
        DBG_AS(func, 0, "remove network portal failed");
        return ERR_CONFIGFS;
    }
    if (_lio3_remove_all_acl(target) != 0) {
        DBG_AS(func, 0, "remove all acl node failed");
        return ERR_CONFIGFS;
    }
    if (_lio3_remove_all_lun(target) != 0) {
        DBG_AS(func, 0, "remove all lun node failed");
        return ERR_CONFIGFS;
    }
    if (configfs_rmdir(tpg.c_str()) != 0) {
        DBG_AS(func, 0, "remove tpg node failed: %s", tpg.c_str());
        return ERR_CONFIGFS;
    }
    std::string iqn = iqn_dir(target->iqn);
    if (configfs_rmdir(iqn.c_str()) != 0) {
        DBG_AS(func, 0, "remove iqn node failed: %s", iqn.c_str());
        return ERR_CONFIGFS;
    }
    return KORV_OK;
}

}  // namespace

int lio3_del_target(iscsi_target_t *target)
{
    CHECK_TARGET(target, "target is NULL", "target IQN is empty", "target tpgt is wrong: %d", target->tpgt);
    return remove_tpg(__func__, target);
}

int lio3_enable_target(iscsi_target_t *target)
{
    CHECK_TARGET(target, "target is NULL", "target's IQN is empty", "target tpgt is wrong: %d", target->tpgt);
    if (_lio3_read_target_enable(target) == 1) {
        DBG(1, "already enable target");
        return KORV_OK;
    }
    if (_lio3_set_target_enable(target, 1) != 0) {
        DBG(0, "enable target failed");
        return ERR_CONFIGFS;
    }
    return KORV_OK;
}

int lio3_disable_target(iscsi_target_t *target)
{
    PARAM_GUARD(target && !tpgt_ok(target->tpgt), "target tpgt is wrong: %d", target->tpgt);
    CHECK_TARGET(target, "target is NULL", "target's IQN is empty", "target tpgt is wrong: %d", target->tpgt);
    if (_lio3_read_target_enable(target) == 0)
        return KORV_OK;
    if (_lio3_set_target_enable(target, 0) != 0) {
        DBG(0, "disable target failed");
        return ERR_CONFIGFS;
    }
    return KORV_OK;
}

int lio3_set_target_attr_dataout_timeout(int timeout, iscsi_target_t *target)
{
    PARAM_GUARD(!target, "target is NULL");
    PARAM_GUARD(timeout < 0, "da_out_timeout has an invalid value");
    CHECK_TARGET(target, "target is NULL", "target IQN is empty", "target TPGT out of limitation");
    if (configfs_path_exist(iqn_dir(target->iqn).c_str()) != 0) {
        DBG(2, "target %s not in module", field_str(target->alias).c_str());
        return ERR_TARGET_NOT_IN_KERNEL;
    }
    std::string acls = tpg_dir(target->iqn, target->tpgt) + "/acls";
    std::vector<std::string> names;
    if (!list_subdirs_or_log(__func__, acls, names))
        return ERR_CONFIGFS;
    for (const std::string &name : names) {
        int rc = _lio3_set_target_acl_dataout_timeout(timeout, target->iqn, target->tpgt, name.c_str());
        if (rc != 0)
            DBG(1, "FUNC Fail ret = %d -> _lio3_set_target_acl_dataout_timeout(%d, %s, %d, %s)", rc, timeout,
                target->iqn, target->tpgt, name.c_str());
    }
    return KORV_OK;
}

namespace {
// The teardown's check: any tag the kernel shows.
bool teardown_ok(const iscsi_target_t *t)
{
    return t && is_component(field_str(t->iqn)) && t->tpgt >= 0;
}
}  // namespace

int _lio3_remove_all_acl(iscsi_target_t *target)
{
    PARAM_GUARD(!teardown_ok(target));
    return remove_all_subdirs(__func__, tpg_dir(target->iqn, target->tpgt) + "/acls");
}

int _lio3_remove_all_lun(iscsi_target_t *target)
{
    PARAM_GUARD(!teardown_ok(target));
    return remove_all_subdirs(__func__, tpg_dir(target->iqn, target->tpgt) + "/lun");
}

int _lio3_remove_all_tpgt(iscsi_target_t *target)
{
    PARAM_GUARD(!target || !is_component(field_str(target->iqn)));
    std::string dir = iqn_dir(target->iqn);
    std::vector<std::string> names;
    if (!list_subdirs_or_log(__func__, dir, names))
        return ERR_PARAM;
    int rc = KORV_OK;
    for (const std::string &name : names) {
        size_t at = name.find("tpgt_");
        int tpgt = 0;
        if (at == std::string::npos || !leading_number(std::string_view(name).substr(at + 5), tpgt))
            continue;
        target->tpgt = tpgt;
        if (remove_tpg("lio3_del_target", target) != 0) {
            DBG(0, "lio3_del_target |%s:tpgt_%d| failed", target->iqn, tpgt);
            rc = ERR_CONFIGFS;
        }
    }
    // Every group's deletion but the last fails to remove the IQN directory,
    // which still holds the others: what counts is whether the target is gone.
    if (rc != 0 && configfs_path_exist(dir.c_str()) != 0)
        rc = KORV_OK;
    return rc;
}

int _lio3_remove_all_iscsi_target(void)
{
    std::string fabric = fixed_path(FABRIC_ROOT);
    if (configfs_path_exist(fabric.c_str()) != 0) {
        DBG(0, "target dir %s do not exist", fabric.c_str());
        return KORV_OK;
    }
    target_ptr scratch(iscsi_target_new());
    if (!scratch) {
        DBG(0, "new target failed");
        return ERR_NO_MEMORY;
    }
    std::vector<std::string> names;
    if (!list_subdirs_or_log(__func__, fabric, names))
        return ERR_PARAM;
    for (const std::string &name : names) {
        if (name == "discovery_auth" || name == "lio_version" || name == "sessions")
            continue;
        DBG(1, "removing %s", name.c_str());
        scratch->tpgt = -1;
        if (!korv::copy_bounded(scratch->iqn, name.c_str()) || _lio3_remove_all_tpgt(scratch.get()) != 0) {
            DBG(0, "can not remove target entry : %s", name.c_str());
            return ERR_CONFIGFS;
        }
    }
    return KORV_OK;
}
