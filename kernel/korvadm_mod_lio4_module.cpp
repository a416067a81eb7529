// SPDX-License-Identifier: Apache-2.0
// The three kernel modules and the driver's start, stop and state probe.
#include "kernel/korvadm_mod_lio4_internal.h"

#include <climits>
#include <initializer_list>
#include <string>

#include "common/korvadm_err.h"
#include "common/korvadm_utils.h"
#include "platform/platform_util.h"

using namespace lio4;

namespace {

struct kmodule {
    const char *file;
    const char *name;
};
// Insertion order; removal runs backwards.
constexpr kmodule MODULES[] = {
    {"/usr/local/modules/driver/target_core_mod.ko", "target_core_mod"},
    {"/usr/local/modules/driver/target_core_file.ko", "target_core_file"},
    {"/usr/local/modules/driver/iscsi_target_mod.ko", "iscsi_target_mod"},
};

}  // namespace

int _insert_mod(const char *mod_path)
{
    if (!mod_path) {
        DBG(2, "mod_path is NULL");
        return ERR_PARAM;
    }
    std::string path;
    if (!korv::shell_escape(mod_path, path))
        return ERR_NO_MEMORY;
    if (System("insmod \"%s\"", path.c_str()) != 0) {
        DBG(0, "system() of cmd '%s' failed", "");
        return ERR_SHELL;
    }
    return KORV_OK;
}

int _remove_mod(const char *mod_proc_name, int check_inserted)
{
    if (!mod_proc_name) {
        DBG(2, "mod_proc_name is NULL");
        return ERR_PARAM;
    }
    if (check_inserted == 1 && check_kmodule_inserted(mod_proc_name) != 0) {
        DBG(2, "can not find %s in the inserted modules", mod_proc_name);
        return KORV_OK;
    }
    std::string name;
    if (!korv::shell_escape(mod_proc_name, name))
        return ERR_NO_MEMORY;
    if (System("rmmod \"%s\"", name.c_str()) != 0) {
        DBG(0, "remove module %s failed", mod_proc_name);
        return ERR_SHELL;
    }
    return KORV_OK;
}

int _brute_force_remove_mod(void)
{
    DBG(1, "!!! FORCE TO REMOVE ISCSI MODULE !!!");
    for (const char *tree : {FABRIC_ROOT, CORE_ROOT}) {
        std::string path;
        if (korv::shell_escape(fixed_path(tree).c_str(), path))
            System("rm -rf \"%s\"", path.c_str());
    }
    // The core module goes before the file backstore module: kept in this order.
    System("rmmod iscsi_target_mod");
    System("rmmod target_core_mod");
    return System("rmmod target_core_file") == 0 ? KORV_OK : ERR_SHELL;
}

int _process_system_cmd_mt(const char *cmd, int max_retry, int max_sleep_us)
{
    int tries = max_retry < 0 ? 0 : (max_retry == INT_MAX ? INT_MAX : max_retry + 1);
    return process_system_cmd_mt(cmd, tries, max_sleep_us);
}

int lio3_start_module(void)
{
    if (configfs_is_mounted() == -1 && configfs_mount() != 0)
        return ERR_MODULE_START;

    // Success is judged by /proc/modules alone: insmod also fails when the
    // module is already there.
    _insert_mod(fixed_path(MODULES[0].file).c_str());
    if (check_kmodule_inserted(MODULES[0].name) != 0)
        DBG(0, "Insert module target_core_mod.ko failed");

    std::string fabric = fixed_path(FABRIC_ROOT);
    bool started = false;
    do {
        _insert_mod(fixed_path(MODULES[1].file).c_str());
        if (check_kmodule_inserted(MODULES[1].name) != 0) {
            DBG(0, "Insert module target_core_file.ko failed");
            break;
        }
        _insert_mod(fixed_path(MODULES[2].file).c_str());
        if (check_kmodule_inserted(MODULES[2].name) != 0) {
            DBG(0, "Insert module iscsi_target_mod failed");
            break;
        }
        if (configfs_mkdir(fabric.c_str()) != 0) {
            DBG(0, "create iscsi sub system failed");
            break;
        }
        if (configfs_path_exist(fabric.c_str()) != 0) {
            DBG(0, "path: %s is not existed", fabric.c_str());
            break;
        }
        started = true;
    } while (false);

    if (!started) {
        for (int i = 2; i >= 0; --i)
            _remove_mod(MODULES[i].name, 0);
        return ERR_MODULE_START;
    }
    for (const char *dir : {VAR_PR_DIR, VAR_ALUA_DIR}) {
        std::string path = fixed_path(dir);
        if (make_dir_include_parent(path.c_str(), 0700) != 0)
            DBG(0, "make var dir %s failed", path.c_str());
    }
    return KORV_OK;
}

int lio3_get_module_state(void)
{
    if (check_kmodule_inserted("iscsi_target_mod") != 0)
        return 1;
    return configfs_path_exist(fixed_path(FABRIC_ROOT).c_str()) == 0 ? 0 : ERR_MODULE_NO_CONFIGFS;
}

int lio3_stop_module(void)
{
    int state = lio3_get_module_state();
    if (state == 1)
        return KORV_OK;
    if (state == 0) {
        // Half started has nothing in configfs to clear.
        _lio3_remove_all_iscsi_target();
        configfs_rmdir(fixed_path(FABRIC_ROOT).c_str());
        _lio3_shutdown_all_hba();
    }
    if (_remove_mod("iscsi_target_mod", 1) != 0 || _remove_mod("target_core_file", 1) != 0)
        return ERR_MODULE_REMOVE;
    if (_remove_mod("target_core_mod", 1) != 0)
        DBG(1, "failed to remove kmod %s", "target_core_mod");
    return KORV_OK;
}
