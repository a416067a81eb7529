// Backstores: removing fileio devices with their ALUA state, and shutting
// down every HBA when the driver stops.
#include "kernel/korvadm_mod_lio4_internal.h"

#include <cstring>
#include <string>
#include <vector>

#include "common/korvadm_err.h"
#include "common/korvadm_utils.h"

using namespace lio4;

namespace {

int _lio3_remove_all_fileio_bkstor_tg_pt_gp(const std::string &backstore)
{
    std::string alua = backstore + "/alua";
    std::vector<std::string> names;
    if (!list_subdirs(alua, names))
        return ERR_CONFIGFS;
    int rc = KORV_OK;
    for (const std::string &name : names) {
        if (name == "default_tg_pt_gp")
            continue;
        std::string path = alua + "/" + name;
        if (configfs_rmdir(path.c_str()) != 0) {
            DBG(0, "can not remove alua entry : %s", path.c_str());
            rc = ERR_CONFIGFS;
        }
    }
    return rc;
}

int _lio3_shutdown_all_fileio_hba_backstore(const std::string &hba_dir, int hba_id)
{
    std::vector<std::string> names;
    if (!list_subdirs(hba_dir, names))
        return ERR_CONFIGFS;
    iscsi_lun_t *lun = iscsi_lun_new();
    if (!lun)
        return ERR_NO_MEMORY;
    int rc = KORV_OK;
    for (const std::string &name : names) {
        if (name == "hba_info")
            continue;
        if (name.size() >= sizeof lun->name) {
            DBG(0, "can not remove backstore entry : %s", name.c_str());
            rc = ERR_CONFIGFS;
            break;
        }
        std::strcpy(lun->name, name.c_str());
        lun->hba_id = hba_id;
        if (lio3_shutdown_backstore(lun) != 0) {
            DBG(0, "can not remove backstore entry : %s", name.c_str());
            rc = ERR_CONFIGFS;
            break;
        }
    }
    iscsi_lun_free(lun);
    return rc;
}

}  // namespace

int _lio3_remove_fileio_device(iscsi_lun_t *lun)
{
    if (!lun)
        return ERR_PARAM;
    std::string name = field(lun->name);
    std::string backstore = fileio_dir(lun->hba_id, name);
    if (configfs_path_exist(backstore.c_str()) != 0) {
        DBG(0, "the lun fileio device : %s is already removed", backstore.c_str());
        return KORV_OK;
    }
    std::string serial = field(lun->serial);
    if (serial.empty()) {
        char vpd[512] = {0};
        std::string path = backstore + "/wwn/vpd_unit_serial";
        if (configfs_read_attr_str(path.c_str(), vpd, sizeof vpd) != 0)
            DBG(0, "get VPD serial failed");
    } else if (is_component(serial)) {
        std::string alua = sysroot_path(VAR_ALUA_DIR) + "/tpgs_" + serial;
        if (remove_dir_recurive(alua.c_str()) != 0)
            DBG(0, "remove var dir %s failed", alua.c_str());
    }
    if (_lio3_remove_all_fileio_bkstor_tg_pt_gp(backstore) != 0)
        DBG(0, "remove alua tg_pt_gp failed");
    if (configfs_rmdir(backstore.c_str()) != 0) {
        DBG(0, "remove lun node: %s failed", backstore.c_str());
        return ERR_CONFIGFS;
    }
    return KORV_OK;
}

int lio3_shutdown_backstore(iscsi_lun_t *lun)
{
    if (!lun) {
        DBG(0, "lun is NULL");
        return ERR_PARAM;
    }
    if (lun->name[0] == '\0' || !is_component(field(lun->name))) {
        DBG(0, "lun name is empty");
        return ERR_PARAM;
    }
    if (lun->hba_id < 0) {
        DBG(0, "lun hba id setting error");
        return ERR_PARAM;
    }
    if (_lio3_remove_fileio_device(lun) != 0) {
        DBG(0, "remove fileio device error");
        return ERR_PARAM;
    }
    return KORV_OK;
}

int _lio3_shutdown_all_hba(void)
{
    std::string core = sysroot_path(CORE_ROOT);
    if (configfs_path_exist(core.c_str()) != 0)
        return KORV_OK;
    std::vector<std::string> names;
    if (!list_subdirs(core, names)) {
        DBG(0, "can not open directory : %s", core.c_str());
        return ERR_PARAM;
    }
    int rc = KORV_OK;
    for (const std::string &name : names) {
        if (name == "alua")
            continue;
        std::string hba = core + "/" + name;
        if (name.find("fileio") == std::string::npos) {
            if (remove_configfs_group(hba) != 0)
                DBG(0, "can not remove hba entry : %s", hba.c_str());
            continue;
        }
        int hba_id = -1;
        if (name.rfind("fileio_", 0) != 0 || !leading_number(std::string_view(name).substr(7), hba_id)) {
            DBG(0, "can not remove hba entry : %s", hba.c_str());
            rc = ERR_CONFIGFS;
            continue;
        }
        if (_lio3_shutdown_all_fileio_hba_backstore(hba, hba_id) != 0 || configfs_rmdir(hba.c_str()) != 0) {
            DBG(0, "can not remove hba entry : %s", hba.c_str());
            rc = ERR_CONFIGFS;
        }
    }
    return rc;
}
