// SPDX-License-Identifier: Apache-2.0
// Backstores: fileio devices of the core tree with their ALUA state, made,
// resized and removed one by one, and every HBA shut down when the driver
// stops.
#include "kernel/korvadm_mod_lio4_internal.h"

#include <sys/stat.h>

#include <climits>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <string>
#include <vector>

#include "common/korvadm_err.h"
#include "common/korvadm_utils.h"

using namespace lio4;

namespace {

// Backing files the appliance made for its LUNs; only these are deleted with
// their backstore, and only when the file's real path lies here.
constexpr const char *OWN_FILES = "/.systemfile/iscsi_target/fileio/";

template <size_t N>
bool terminated(const char (&text)[N])
{
    return strnlen(text, N) < N;
}

std::string hba_dir(int hba_id)
{
    return fixed_path(CORE_ROOT) + "/fileio_" + std::to_string(hba_id);
}

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
    std::unique_ptr<iscsi_lun_t, void (*)(iscsi_lun_t *)> lun(iscsi_lun_new(), iscsi_lun_free);
    if (!lun)
        return ERR_NO_MEMORY;
    for (const std::string &name : names) {
        if (name == "hba_info")
            continue;
        lun->hba_id = hba_id;
        if (!korv::copy_bounded(lun->name, name.c_str()) || lio3_shutdown_backstore(lun.get()) != 0) {
            DBG(0, "can not remove backstore entry : %s", name.c_str());
            return ERR_CONFIGFS;
        }
    }
    return KORV_OK;
}

}  // namespace

int _lio3_remove_fileio_device(iscsi_lun_t *lun)
{
    PARAM_GUARD(!lun);
    std::string name = field_str(lun->name);
    std::string backstore = fileio_dir(lun->hba_id, name);
    if (configfs_path_exist(backstore.c_str()) != 0) {
        DBG(0, "the lun fileio device : %s is already removed", backstore.c_str());
        return KORV_OK;
    }
    std::string serial = field_str(lun->serial);
    if (serial.empty()) {
        char vpd[512] = {0};
        std::string path = backstore + "/wwn/vpd_unit_serial";
        if (configfs_read_attr_str(path.c_str(), vpd, sizeof vpd) != 0)
            DBG(0, "get VPD serial failed");
    } else if (is_component(serial)) {
        std::string alua = alua_serial_dir(serial);
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
    PARAM_GUARD(!lun, "lun is NULL");
    PARAM_GUARD(lun->name[0] == '\0' || !is_component(field_str(lun->name)), "lun name is empty");
    PARAM_GUARD(lun->hba_id < 0, "lun hba id setting error");
    if (_lio3_remove_fileio_device(lun) != 0) {
        DBG(0, "remove fileio device error");
        return ERR_PARAM;
    }
    return KORV_OK;
}

int _lio3_shutdown_all_hba(void)
{
    std::string core = fixed_path(CORE_ROOT);
    if (configfs_path_exist(core.c_str()) != 0)
        return KORV_OK;
    std::vector<std::string> names;
    if (!list_subdirs_or_log(__func__, core, names))
        return ERR_PARAM;
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

namespace lio4 {

bool entry_exists(const std::string &path)
{
    struct stat st;
    return lstat(path.c_str(), &st) == 0;
}

int check_lun(const char *func, const iscsi_lun_t *lun, int needs)
{
    if (!lun) {
        DBG_AS(func, 0, "lun is NULL");
        return ERR_PARAM;
    }
    if (lun->name[0] == '\0' || !terminated(lun->name) || !is_component(lun->name)) {
        DBG_AS(func, 0, "lun name is empty");
        return ERR_PARAM;
    }
    if (needs & PATH) {
        if (lun->path[0] == '\0') {
            DBG_AS(func, 0, "lun device path is empty");
            return ERR_PARAM;
        }
        if (!terminated(lun->path) || std::strpbrk(lun->path, ",\n\r")) {
            DBG_AS(func, 0, "lun device path error");
            return ERR_PARAM;
        }
    }
    if ((needs & SIZE) && lun->size == 0) {
        DBG_AS(func, 0, "lun size setting error");
        return ERR_PARAM;
    }
    if (lun->hba_id < 0) {
        DBG_AS(func, 0, "lun hba id setting error");
        return ERR_PARAM;
    }
    // The serial names a state directory too.
    if (!terminated(lun->serial) || (lun->serial[0] && (!is_component(lun->serial) ||
                                                        std::strpbrk(lun->serial, "\n\r")))) {
        DBG_AS(func, 0, "lun serial error");
        return ERR_PARAM;
    }
    return KORV_OK;
}

int remove_tree(const std::string &path)
{
    if (!entry_exists(path))
        return KORV_OK;
    remove_configfs_group(path);
    if (entry_exists(path))
        configfs_rmdir_recursive(path.c_str());
    return entry_exists(path) ? ERR_CONFIGFS : KORV_OK;
}

}  // namespace lio4

/* ============================================================ backstores */

int _lio3_remove_fileio_device_brute_force(iscsi_lun_t *lun)
{
    if (!lun)
        return ERR_PARAM;
    std::string backstore = fileio_dir(lun->hba_id, field_str(lun->name));
    if (remove_tree(backstore) != 0) {
        DBG(0, "create lun node: %s failed", backstore.c_str());
        return ERR_CONFIGFS;
    }
    return KORV_OK;
}

int _lio3_create_fileio_device(iscsi_lun_t *lun)
{
    if (check_lun(__func__, lun, PATH | SIZE) != 0)
        return ERR_PARAM;
    std::string backstore = fileio_dir(lun->hba_id, field_str(lun->name));
    configfs_mkdir(backstore.c_str());
    if (configfs_path_exist(backstore.c_str()) != 0) {
        DBG(0, "create lun node: %s failed", backstore.c_str());
        return ERR_CONFIGFS;
    }
    std::string control = backstore + "/control";
    std::string params = "fd_dev_name=" + field_str(lun->path) + ",fd_dev_size=" + std::to_string(lun->size) +
                         ",fd_buffered_io=1";
    if (configfs_write_attr_str(control.c_str(), params.c_str(), 0) != 0) {
        DBG(0, "set device parameter: %s to %s failed", control.c_str(), params.c_str());
        _lio3_remove_fileio_device_brute_force(lun);
        return ERR_CONFIGFS;
    }
    std::string vpd = backstore + "/wwn/vpd_unit_serial";
    std::string serial = field_str(lun->serial);
    if (!serial.empty()) {
        if (configfs_write_attr_str(vpd.c_str(), serial.c_str(), 0) != 0) {
            DBG(0, "set device parameter: %s to %s failed", vpd.c_str(), serial.c_str());
            _lio3_remove_fileio_device_brute_force(lun);
            return ERR_CONFIGFS;
        }
    } else {
        char text[512] = {0};
        if (configfs_read_attr_str(vpd.c_str(), text, sizeof text) != 0)
            DBG(0, "get VPD serial failed");
        serial = text;
    }
    // The kernel's own text is used whole; one that cannot name a directory
    // gets none.
    std::string alua = alua_serial_dir(serial);
    if (serial.empty() || !is_component("tpgs_" + serial) || make_dir_include_parent(alua.c_str(), 0700) != 0)
        DBG(0, "make var dir %s failed", alua.c_str());
    return KORV_OK;
}

int lio3_add_backstore(iscsi_lun_t *lun)
{
    if (check_lun(__func__, lun, PATH | SIZE) != 0)
        return ERR_PARAM;
    std::string name = field_str(lun->name), path = field_str(lun->path);
    std::string backstore = fileio_dir(lun->hba_id, name);
    if (configfs_path_exist(backstore.c_str()) == 0) {
        DBG(0, "the lun : %s is already alive", name.c_str());
        return KORV_OK;
    }
    // What this call creates is taken away again when a later step fails.
    bool new_file = !entry_exists(path), new_hba = !entry_exists(hba_dir(lun->hba_id));
    auto undo = [&] {
        if (new_hba)
            configfs_rmdir(hba_dir(lun->hba_id).c_str());
        if (new_file)
            remove_file(path.c_str());
        return ERR_CONFIGFS;
    };
    if (create_file_if_absent(path.c_str(), 0700) != 0) {
        DBG(0, "create empty file failed");
        return ERR_CONFIGFS;
    }
    if (_lio3_create_fileio_device(lun) != 0) {
        DBG(0, "create lun node: %s failed", backstore.c_str());
        return undo();
    }
    std::string enable = backstore + "/enable";
    if (configfs_write_attr_int(enable.c_str(), 1, 0) != 0) {
        DBG(0, "set device %s to enable failed", enable.c_str());
        DBG(0, "enable fileio device: %s failed", backstore.c_str());
        if (_lio3_remove_fileio_device(lun) != 0)
            _lio3_remove_fileio_device_brute_force(lun);
        return undo();
    }
    return KORV_OK;
}

int lio3_del_backstore(iscsi_lun_t *lun)
{
    int rc = lio3_shutdown_backstore(lun);
    if (rc != 0)
        return rc;
    // The real path decides: a path that only mentions the directory
    // (".../fileio/../../etc/x", or a link out of it) is not ours to delete.
    char real[PATH_MAX];
    std::string path = field_str(lun->path);
    if (path.empty() || !realpath(path.c_str(), real) || !std::strstr(real, OWN_FILES))
        return KORV_OK;
    if (remove_file(real) != 0)
        DBG(0, "remove fileio file %s error", real);
    return KORV_OK;
}

int lio3_change_backstore_size(iscsi_lun_t *lun)
{
    // A size of 0 would leave the kernel computing a capacity below zero.
    if (check_lun(__func__, lun, SIZE) != 0)
        return ERR_PARAM;
    std::string backstore = fileio_dir(lun->hba_id, field_str(lun->name));
    if (configfs_path_exist(backstore.c_str()) != 0) {
        DBG(0, "the lun : %s is not alive", lun->name);
        return ERR_BACKSTORE_MISSING;
    }
    std::string control = backstore + "/control";
    std::string params = "fd_dev_size=" + std::to_string(lun->size);
    if (configfs_write_attr_str(control.c_str(), params.c_str(), 0) != 0) {
        DBG(0, "set device parameter: %s to %s failed", control.c_str(), params.c_str());
        DBG(0, "_lio3_change_backstore_size failed, ret code = %d", ERR_CONFIGFS);
        return ERR_CONFIGFS;
    }
    return KORV_OK;
}
