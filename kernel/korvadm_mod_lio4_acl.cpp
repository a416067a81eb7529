// SPDX-License-Identifier: Apache-2.0
// Initiator ACL nodes of a portal group and their per-LUN access rights.
#include "kernel/korvadm_mod_lio4_internal.h"

#include <cstring>
#include <string>

#include "common/korvadm_err.h"
#include "common/korvadm_utils.h"

using namespace lio4;

namespace {

// The kernel's catch-all node in some versions; never made or removed here.
constexpr const char *DEFAULT_POLICY = "default_policy";

enum { RIGHT_DENY = 0, RIGHT_READ_ONLY = 1, RIGHT_READ_WRITE = 2 };

// An initiator name names the ACL directory: one path component.
bool initiator_ok(const char *name)
{
    return name && strnlen(name, ISCSI_INITIATOR_LEN) < ISCSI_INITIATOR_LEN && is_component(name);
}

std::string acl_dir(const iscsi_target_t *target, const char *initiator)
{
    return tpg_dir(target->iqn, target->tpgt) + "/acls/" + initiator;
}

// The checks of slots 17 and 18, logged under `func`.
int check_acl_args(const char *func, const char *initiator_name, const iscsi_target_t *target)
{
    if (!initiator_name) {
        DBG_AS(func, 0, "initr is NULL");
        return ERR_PARAM;
    }
    if (!target) {
        DBG_AS(func, 0, "target is NULL");
        return ERR_PARAM;
    }
    if (!initiator_ok(initiator_name)) {
        DBG_AS(func, 0, "initiator name is empty");
        return ERR_PARAM;
    }
    switch (check_target(target)) {
    case tcheck::ok: return KORV_OK;
    case tcheck::tpgt: DBG_AS(func, 0, "target tpgt is wrong: %d", target->tpgt); return ERR_PARAM;
    default: DBG_AS(func, 0, "target's IQN is empty"); return ERR_PARAM;
    }
}

// The access right's paths for one mapping: the initiator's mapped-LUN
// group, the link in it and the target LUN it points to.
struct mapped_paths {
    std::string node, link, lun;
    mapped_paths(const iscsi_lun_acl_t *acl)
    {
        const iscsi_target_t *t = acl->map_lun->target;
        std::string n = "lun_" + std::to_string(acl->map_lun->lun_num);
        node = acl_dir(t, acl->initiator->name) + "/" + n;
        link = node + "/" + n;
        lun = tpg_dir(t->iqn, t->tpgt) + "/lun/" + n;
    }
};

// Read-only (write_protect 1) and read-write (0). Links and groups made here
// go again when the right cannot be set, so a failure grants nothing.
int set_mapped_right(const char *func, const iscsi_lun_acl_t *acl, int write_protect)
{
    mapped_paths p(acl);
    if (configfs_path_exist(p.lun.c_str()) != 0) {
        DBG_AS(func, 0, "the lun %d of target %s does not exist", acl->map_lun->lun_num,
               acl->map_lun->target->iqn);
        return ERR_CONFIGFS;
    }
    bool new_node = configfs_path_exist(p.node.c_str()) != 0;
    if (new_node && (make_dir(p.node.c_str(), 0700) != 0 || configfs_path_exist(p.node.c_str()) != 0)) {
        DBG_AS(func, 0, "create acl node %s fail", p.node.c_str());
        return ERR_CONFIGFS;
    }
    bool new_link = !entry_exists(p.link);
    int rc = create_symlink(p.lun.c_str(), p.link.c_str());
    if (rc != 0) {
        DBG_AS(func, 0, "create_symlink rc = %d", rc);
        if (rc == -2) {
            remove_file(p.link.c_str());
            new_link = true;
            rc = create_symlink(p.lun.c_str(), p.link.c_str());
        }
    }
    std::string wp = p.node + "/write_protect";
    if (rc == 0 && configfs_write_attr_int(wp.c_str(), write_protect, 1) == 0)
        return KORV_OK;
    DBG_AS(func, 0, "set write protect = %d on node %s fail", write_protect, p.node.c_str());
    if (rc == 0 && new_link)
        remove_file(p.link.c_str());
    if (new_node)
        configfs_rmdir(p.node.c_str());
    return ERR_CONFIGFS;
}

}  // namespace

/* ============================================================= ACL nodes */

int _lio3_add_acl_initiator(const char *initiator_name, iscsi_target_t *target)
{
    if (!initiator_ok(initiator_name) || check_target(target) != tcheck::ok)
        return ERR_PARAM;
    if (std::strcmp(initiator_name, DEFAULT_POLICY) == 0)
        return KORV_OK;
    // Only the node itself: a missing portal group is not made on the way.
    std::string dir = acl_dir(target, initiator_name);
    if (make_dir(dir.c_str(), 0700) != 0 || configfs_path_exist(dir.c_str()) != 0) {
        DBG(0, "create acl node %s fail", dir.c_str());
        return ERR_CONFIGFS;
    }
    return KORV_OK;
}

int _lio3_del_acl_initiator(const char *initiator_name, iscsi_target_t *target)
{
    if (!initiator_ok(initiator_name) || check_target(target) != tcheck::ok)
        return ERR_PARAM;
    std::string dir = acl_dir(target, initiator_name);
    if (configfs_path_exist(dir.c_str()) != 0) {
        DBG(0, "the acl node %s not exist", dir.c_str());
        return KORV_OK;
    }
    return remove_tree(dir);
}

int lio3_add_acl_initiator(const char *initiator_name, iscsi_target_t *target)
{
    if (check_acl_args(__func__, initiator_name, target) != 0)
        return ERR_PARAM;
    if (configfs_path_exist(tpg_dir(target->iqn, target->tpgt).c_str()) != 0) {
        DBG(0, "target %s not in module", target->iqn);
        return ERR_TARGET_NOT_IN_KERNEL;
    }
    if (_lio3_add_acl_initiator(initiator_name, target) != 0) {
        DBG(0, "_lio3_add_acl_initiator(%s , %s) failed", initiator_name, target->iqn);
        return ERR_CONFIGFS;
    }
    if (std::strcmp(initiator_name, DEFAULT_POLICY) == 0)
        return KORV_OK;
    // Best effort, as the target's own settings are: the node is there.
    _lio3_set_target_chap_to_acl(initiator_name, target);
    _lio3_set_target_acl_dataout_timeout(target->dataout_timeout, target->iqn, target->tpgt, initiator_name);
    return KORV_OK;
}

int lio3_del_acl_initiator(const char *initiator_name, iscsi_target_t *target)
{
    if (check_acl_args(__func__, initiator_name, target) != 0)
        return ERR_PARAM;
    if (std::strcmp(initiator_name, DEFAULT_POLICY) == 0)
        return KORV_OK;
    if (configfs_path_exist(iqn_dir(target->iqn).c_str()) != 0) {
        DBG(0, "target %s not in module", target->iqn);
        return KORV_OK;
    }
    if (_lio3_del_acl_initiator(initiator_name, target) != 0) {
        DBG(0, "_lio3_del_acl_initiator(%s , %s) failed", initiator_name, target->iqn);
        return ERR_CONFIGFS;
    }
    return KORV_OK;
}

/* ======================================================= per-LUN rights */

int _lio3_set_lun_acl_read_only(iscsi_lun_acl_t *lun_acl)
{
    return set_mapped_right(__func__, lun_acl, 1);
}

int _lio3_set_lun_acl_read_write(iscsi_lun_acl_t *lun_acl)
{
    return set_mapped_right(__func__, lun_acl, 0);
}

int _lio3_set_lun_acl_deny(iscsi_lun_acl_t *lun_acl)
{
    mapped_paths p(lun_acl);
    if (entry_exists(p.link)) {
        int rc = remove_file(p.link.c_str());
        DBG(2, "remove_file %s, rc = %d", p.link.c_str(), rc);
        if (rc != 0) {
            DBG(0, "delete acl lun link %s fail", p.link.c_str());
            return ERR_CONFIGFS;
        }
    }
    if (configfs_path_exist(p.node.c_str()) == 0 && configfs_rmdir(p.node.c_str()) != 0) {
        DBG(0, "delete acl lun node %s fail", p.node.c_str());
        return ERR_CONFIGFS;
    }
    return KORV_OK;
}

int lio3_add_lun_acl(iscsi_lun_acl_t *lun_acl)
{
    PARAM_GUARD(!lun_acl, "lun_acl is NULL");
    PARAM_GUARD(!lun_acl->map_lun || !lun_acl->initiator, "map_lun or initiator is NULL");
    iscsi_target_t *target = lun_acl->map_lun->target;
    PARAM_GUARD(!target, "map target is NULL");
    PARAM_GUARD(check_target(target) != tcheck::ok, "map target error");
    PARAM_GUARD(lun_acl->map_lun->lun_num < 0 || lun_acl->map_lun->lun_num > ISCSI_LUN_NUM_MAX, "map lun error");
    PARAM_GUARD(!initiator_ok(lun_acl->initiator->name), "initiator error");
    int rc;
    switch (lun_acl->access_right) {
    case RIGHT_DENY: {
        // The mapping goes with the target switched off, and the switch is
        // put back whatever happened.
        bool enabled = configfs_path_exist(tpg_dir(target->iqn, target->tpgt).c_str()) == 0 &&
                       _lio3_read_target_enable(target) == 1;
        if (enabled)
            lio3_disable_target(target);
        rc = _lio3_set_lun_acl_deny(lun_acl);
        if (enabled)
            lio3_enable_target(target);
        break;
    }
    case RIGHT_READ_ONLY: rc = _lio3_set_lun_acl_read_only(lun_acl); break;
    case RIGHT_READ_WRITE: rc = _lio3_set_lun_acl_read_write(lun_acl); break;
    default: DBG(0, "access right error"); return ERR_PARAM;
    }
    if (rc != 0) {
        DBG(0, "set access right error");
        return ERR_CONFIGFS;
    }
    return KORV_OK;
}

int lio3_del_lun_acl(iscsi_lun_acl_t *lun_acl)
{
    PARAM_GUARD(!lun_acl, "lun_acl is NULL");
    lun_acl->access_right = RIGHT_DENY;
    int rc = lio3_add_lun_acl(lun_acl);
    if (rc == ERR_PARAM)
        return rc;
    if (rc != 0) {
        DBG(0, "remove acl node failed");
        return ERR_CONFIGFS;
    }
    return KORV_OK;
}
