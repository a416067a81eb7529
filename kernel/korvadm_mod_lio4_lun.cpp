// SPDX-License-Identifier: Apache-2.0
// LUN mapping: a backstore linked into a target's portal group as a
// numbered LUN, and unlinked again.
#include "kernel/korvadm_mod_lio4_internal.h"

#include <string>
#include <string_view>
#include <vector>

#include "common/korvadm_err.h"
#include "common/korvadm_utils.h"

using namespace lio4;

namespace {

// ALUA attributes of a target LUN: the kernel's, never unlinked.
constexpr std::string_view LUN_ATTRS[] = {"alua_tg_pt_gp", "alua_tg_pt_offline", "alua_tg_pt_status",
                                          "alua_tg_pt_write_md"};

std::string target_lun_dir(const iscsi_target_t *target, int lun_num)
{
    return tpg_dir(target->iqn, target->tpgt) + "/lun/lun_" + std::to_string(lun_num);
}

bool lun_num_ok(int n)
{
    return n >= 0 && n <= ISCSI_LUN_NUM_MAX;
}

}  // namespace

int _lio3_add_lun_to_target(iscsi_lun_t *lun, iscsi_target_t *target)
{
    if (check_lun(__func__, lun, NAME_HBA) != 0 || check_target(target) != tcheck::ok || !lun_num_ok(lun->lun_num))
        return ERR_PARAM;
    std::string dir = target_lun_dir(target, lun->lun_num);
    configfs_mkdir(dir.c_str());
    if (configfs_path_exist(dir.c_str()) != 0) {
        DBG(0, "create lun node: %s failed", dir.c_str());
        return ERR_CONFIGFS;
    }
    std::string backstore = fileio_dir(lun->hba_id, field_str(lun->name));
    std::string link = dir + "/" + field_str(lun->name);
    if (create_symlink(backstore.c_str(), link.c_str()) != 0) {
        DBG(0, "link %s to %s failed", link.c_str(), backstore.c_str());
        configfs_rmdir(dir.c_str());
        return ERR_CONFIGFS;
    }
    if (configfs_write_attr_int((dir + "/alua_tg_pt_write_md").c_str(), 1, 0) != 0)
        DBG(0, "write 1 to alua_tg_pt_write_md failed");
    return KORV_OK;
}

int lio3_add_lun_mapping(iscsi_lun_t *lun, iscsi_target_t *target, int lun_number)
{
    if (check_lun(__func__, lun, PATH) != 0)
        return ERR_PARAM;
    std::string name = field_str(lun->name);
    PARAM_GUARD(configfs_path_exist(fileio_dir(lun->hba_id, name).c_str()) != 0, "the lun : %s dos not exist",
                name.c_str());
    CHECK_TARGET(target, "target is null", "target iqn is not given", "target tpgt is wrong: %d", target->tpgt);
    PARAM_GUARD(configfs_path_exist(tpg_dir(target->iqn, target->tpgt).c_str()) != 0, "target : %s , does not exist",
                target->iqn);
    PARAM_GUARD(!lun_num_ok(lun_number), "lun num is wrong: %d", lun_number);
    if (lun->lun_num < 0)
        lun->lun_num = lun_number;
    PARAM_GUARD(lun->lun_num != lun_number, "lun's lun num is not match: %d vs %d", lun->lun_num, lun_number);
    if (check_path_exist(lun->path) != 0) {
        DBG(0, "file io file : %s , does not exist", lun->path);
        return ERR_BACKING_FILE_MISSING;
    }
    if (configfs_path_exist(target_lun_dir(target, lun_number).c_str()) == 0) {
        DBG(0, "the lun %d of target %s has already exist", lun_number, field_str(target->alias).c_str());
        return ERR_LUN_ALREADY_MAPPED;
    }
    if (_lio3_add_lun_to_target(lun, target) != 0) {
        DBG(0, "_lio3_add_lun_to_target failed");
        return ERR_CONFIGFS;
    }
    return KORV_OK;
}

int _lio3_del_all_port_in_target_lun(iscsi_lun_t *lun, iscsi_target_t *target)
{
    if (!lun || check_target(target) != tcheck::ok || !lun_num_ok(lun->lun_num))
        return ERR_PARAM;
    std::string dir = target_lun_dir(target, lun->lun_num);
    std::vector<std::string> names;
    {
        dir_ptr d(opendir(dir.c_str()));
        if (!d)
            return ERR_CONFIGFS;
        while (struct dirent *e = readdir(d.get())) {
            std::string_view n(e->d_name);
            bool keep = n == "." || n == "..";
            for (std::string_view attr : LUN_ATTRS)
                keep = keep || n == attr;
            if (!keep)
                names.emplace_back(n);
        }
    }
    // The kernel's own groups (statistics) refuse, and are skipped.
    for (const std::string &n : names)
        if (remove_file((dir + "/" + n).c_str()) != 0)
            DBG(2, "can not remove entry : %s", (dir + "/" + n).c_str());
    return KORV_OK;
}

int _lio3_del_lun_from_target(iscsi_lun_t *lun, iscsi_target_t *target)
{
    if (_lio3_del_all_port_in_target_lun(lun, target) != 0) {
        DBG(0, "_lio3_del_all_port_in_target_lun fail");
        return ERR_CONFIGFS;
    }
    std::string dir = target_lun_dir(target, lun->lun_num);
    if (configfs_path_exist(dir.c_str()) == 0 && configfs_rmdir(dir.c_str()) != 0) {
        DBG(0, "remove lun fail");
        return ERR_CONFIGFS;
    }
    std::string state = alua_tpg_dir(target->iqn, target->tpgt) + "/lun_" + std::to_string(lun->lun_num);
    if (configfs_path_exist(state.c_str()) == 0 && remove_dir_recurive(state.c_str()) != 0)
        DBG(0, "remove var alua lun path : |%s| fail", state.c_str());
    return KORV_OK;
}

int _lio3_remove_lun(iscsi_lun_t *lun, iscsi_target_t *target)
{
    if (check_lun(__func__, lun, NAME_HBA) != 0 || check_target(target) != tcheck::ok || !lun_num_ok(lun->lun_num))
        return ERR_PARAM;
    std::string dir = target_lun_dir(target, lun->lun_num);
    std::string link = dir + "/" + field_str(lun->name);
    if (remove_file(link.c_str()) != 0) {
        DBG(0, "remove link to back store : |%s| failed", link.c_str());
        return ERR_CONFIGFS;
    }
    if (configfs_rmdir(dir.c_str()) != 0) {
        DBG(0, "remove target lun entry : |%s| failed", dir.c_str());
        return ERR_CONFIGFS;
    }
    return KORV_OK;
}

int lio3_del_lun_mapping(iscsi_lun_t *lun, iscsi_target_t *target)
{
    if (check_lun(__func__, lun, NAME_HBA) != 0)
        return ERR_PARAM;
    // With its backstore gone nothing can map this LUN any more; a wrong HBA
    // id lands here too, so it is not taken as done.
    if (configfs_path_exist(fileio_dir(lun->hba_id, field_str(lun->name)).c_str()) != 0) {
        DBG(0, "the lun : %s has been removed", lun->name);
        return ERR_BACKSTORE_MISSING;
    }
    CHECK_TARGET(target, "target is null", "target iqn is not given", "target tpgt is wrong: %d", target->tpgt);
    PARAM_GUARD(configfs_path_exist(tpg_dir(target->iqn, target->tpgt).c_str()) != 0, "target : %s , does not exist",
                target->iqn);
    PARAM_GUARD(!lun_num_ok(lun->lun_num), "lun num is wrong: %d", lun->lun_num);
    if (configfs_path_exist(target_lun_dir(target, lun->lun_num).c_str()) != 0) {
        DBG(0, "the lun %d of target %s does not exist", lun->lun_num, target->iqn);
        return KORV_OK;
    }
    int rc = _lio3_del_lun_from_target(lun, target);
    if (rc != 0)
        DBG(0, "_lio3_del_lun_from_target failed, return code = %d", rc);
    return rc;
}
