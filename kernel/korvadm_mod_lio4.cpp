// The LIO configfs back end: attribute I/O, modules, targets, portals, CHAP,
// data-out time-out, and the teardown used by deletion and stop.
#include "kernel/korvadm_mod_lio4.h"

#include <dirent.h>
#include <sys/stat.h>

#include <climits>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "common/korvadm_err.h"
#include "common/korvadm_log.h"
#include "common/korvadm_sysroot.h"
#include "common/korvadm_utils.h"
#include "platform/platform_util.h"


namespace {

constexpr const char *CONFIGFS_MOUNT = "/sys/kernel/config";
constexpr const char *FABRIC_ROOT = "/sys/kernel/config/target/iscsi";
constexpr const char *CORE_ROOT = "/sys/kernel/config/target/core";
constexpr const char *VAR_PR_DIR = "/var/target/pr";
constexpr const char *VAR_ALUA_DIR = "/var/target/alua";

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

constexpr int DEFAULT_MAX_CONNECTIONS = 8;
constexpr int DEFAULT_CMDSN_DEPTH = 64;
constexpr const char *AUTH_METHOD = "CHAP,None";
constexpr size_t CHAP_PASS_MIN = 12;
constexpr size_t CHAP_PASS_MAX = 16;

using korv::file_ptr;

struct free_deleter {
    void operator()(void *p) const { std::free(p); }
};

struct dir_closer {
    void operator()(DIR *d) const { closedir(d); }
};
using dir_ptr = std::unique_ptr<DIR, dir_closer>;

struct target_deleter {
    void operator()(iscsi_target_t *t) const { iscsi_target_free(t); }
};
using target_ptr = std::unique_ptr<iscsi_target_t, target_deleter>;

struct ip_list_guard {
    list_t list;
    ip_list_guard() { list_init(&list); }
    ~ip_list_guard() { iscsi_ip_free_list(&list); }
    ip_list_guard(const ip_list_guard &) = delete;
    ip_list_guard &operator=(const ip_list_guard &) = delete;
};

// A fixed text field as a string, never reading past the field.
template <size_t N>
std::string field(const char (&text)[N])
{
    return std::string(text, strnlen(text, N));
}

// Names from records become one path component: no '/', not "." or "..".
bool is_component(std::string_view name)
{
    return !name.empty() && name != "." && name != ".." && name.find('/') == std::string_view::npos;
}

std::string iqn_dir(std::string_view iqn)
{
    return sysroot_path(FABRIC_ROOT) + "/" + std::string(iqn);
}

std::string tpg_dir(std::string_view iqn, int tpgt)
{
    return iqn_dir(iqn) + "/tpgt_" + std::to_string(tpgt);
}

std::string fileio_dir(int hba_id, std::string_view lun_name)
{
    return sysroot_path(CORE_ROOT) + "/fileio_" + std::to_string(hba_id) + "/" + std::string(lun_name);
}

// Names of the sub-directories of path (not "." or ".."), read in full
// before the caller changes anything. False when path cannot be opened.
bool list_subdirs(const std::string &path, std::vector<std::string> &names)
{
    dir_ptr d(opendir(path.c_str()));
    if (!d)
        return false;
    while (struct dirent *e = readdir(d.get())) {
        std::string_view name(e->d_name);
        if (name == "." || name == "..")
            continue;
        bool is_dir = e->d_type == DT_DIR;
        if (e->d_type == DT_UNKNOWN) {
            struct stat st;
            std::string full = path + "/" + e->d_name;
            is_dir = stat(full.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
        }
        if (is_dir)
            names.emplace_back(name);
    }
    return true;
}

// The decimal number at the start of text, when there is one that fits.
bool leading_number(std::string_view text, int &out)
{
    if (text.empty() || text[0] < '0' || text[0] > '9')
        return false;
    long v = 0;
    for (char c : text) {
        if (c < '0' || c > '9')
            break;
        v = v * 10 + (c - '0');
        if (v > INT_MAX)
            return false;
    }
    out = static_cast<int>(v);
    return true;
}

bool tpgt_ok(int tpgt)
{
    return tpgt >= 0 && tpgt <= ISCSI_TPGT_MAX;
}

enum class tcheck { ok, null, iqn, bad_iqn, tpgt };

tcheck check_target(const iscsi_target_t *t)
{
    if (!t)
        return tcheck::null;
    if (t->iqn[0] == '\0')
        return tcheck::iqn;
    if (strnlen(t->iqn, sizeof t->iqn) == sizeof t->iqn || !is_component(t->iqn))
        return tcheck::bad_iqn;
    if (!tpgt_ok(t->tpgt))
        return tcheck::tpgt;
    return tcheck::ok;
}

}  // namespace

// Logs and returns -9989 from the calling operation when the target is
// unusable; the trailing arguments are the tpgt message and its values.
#define CHECK_TARGET(t, null_msg, iqn_msg, ...)                                     \
    do {                                                                            \
        switch (check_target(t)) {                                                  \
        case tcheck::null: DBG(0, null_msg); return ERR_PARAM;                      \
        case tcheck::iqn: DBG(0, iqn_msg); return ERR_PARAM;                        \
        case tcheck::bad_iqn: DBG(0, "target IQN is not a usable name"); return ERR_PARAM; \
        case tcheck::tpgt: DBG(0, __VA_ARGS__); return ERR_PARAM;                   \
        case tcheck::ok: break;                                                     \
        }                                                                           \
    } while (0)

/* ===================================================== configfs primitives */

int configfs_mkdir(const char *path)
{
    if (!path)
        return ERR_PARAM;
    if (make_dir_include_parent(path, 0700) != 0)
        DBG(0, "mkdir %s failed", path);
    return KORV_OK;
}

int configfs_rmdir(const char *path)
{
    if (!path)
        return ERR_PARAM;
    if (remove_dir(path) != 0) {
        DBG(2, "remove %s failed", path);
        return ERR_SHELL;
    }
    return KORV_OK;
}

int configfs_rmdir_recursive(const char *path)
{
    if (!path)
        return ERR_PARAM;
    return remove_dir_recurive(path) == 0 ? KORV_OK : ERR_SHELL;
}

int configfs_path_exist(const char *path)
{
    return check_path_exist(path);
}

int configfs_is_mounted(void)
{
    std::string mount_point = sysroot_path(CONFIGFS_MOUNT);
    if (!sys_mount_point(mount_point.c_str()))
        return -1;
    return configfs_path_exist(mount_point.c_str());
}

int configfs_mount(void)
{
    std::string mount_point;
    if (!korv::shell_escape(sysroot_path(CONFIGFS_MOUNT).c_str(), mount_point))
        return ERR_NO_MEMORY;
    return System("mount -t configfs configfs \"%s\"", mount_point.c_str()) == 0 ? KORV_OK : ERR_SHELL;
}

int configfs_read_attr_str(const char *path, char *buf, size_t size)
{
    if (!path || !buf || size == 0)
        return ERR_PARAM;
    file_ptr f(std::fopen(path, "r"));
    if (!f) {
        DBG(0, "open attribute %s failed", path);
        return ERR_CONFIGFS;
    }
    // Terminating at the count read keeps a full buffer (a verified write's
    // read-back: value plus newline) from being read past its end.
    size_t n = std::fread(buf, 1, size - 1, f.get());
    bool failed = std::ferror(f.get()) != 0;
    buf[n] = '\0';
    if (failed) {
        DBG(0, "read attribute %s failed", path);
        return ERR_CONFIGFS;
    }
    DBG(2, "get |%s|", buf);
    size_t len = std::strlen(buf);
    for (size_t k = 1; k <= 10 && k < len; ++k) {
        if (buf[len - k] == '\n') {
            buf[len - k] = '\0';
            break;
        }
    }
    buf[size - 1] = '\0';
    return KORV_OK;
}

int configfs_read_attr_buf(const char *path, char *buf, size_t size, size_t *out_len)
{
    if (!path || !buf || size == 0 || !out_len)
        return ERR_PARAM;
    file_ptr f(std::fopen(path, "r"));
    if (!f) {
        DBG(0, "open attribute %s failed", path);
        return ERR_CONFIGFS;
    }
    *out_len = std::fread(buf, 1, size, f.get());
    return KORV_OK;
}

int configfs_read_attr_int(const char *path, int *out)
{
    if (!path || !out)
        return ERR_PARAM;
    char buf[128] = {0};
    int rc = configfs_read_attr_str(path, buf, sizeof buf);
    if (rc != 0)
        return rc;
    if (buf[0] == '\0') {
        DBG(1, "get empty value from %s", path);
        return ERR_ATTR_EMPTY;
    }
    std::sscanf(buf, "%40d", out);
    DBG(2, "get %d from %s", *out, path);
    return KORV_OK;
}

int configfs_write_attr_str(const char *path, const char *value, int verify)
{
    if (!path || !value)
        return ERR_PARAM;
    DBG(2, "write |%s| to |%s| ", value, path);
    std::string v, p;
    if (!korv::shell_escape(value, v) || !korv::shell_escape(path, p))
        return ERR_NO_MEMORY;
    // printf, not echo: dash's echo would rewrite backslashes in the value.
    if (System("printf '%%s' \"%s\" > \"%s\"", v.c_str(), p.c_str()) != 0) {
        DBG(0, "Error! write |%s| to |%s| failed, re-write with \"newline\" character now.", value, path);
        if (System("printf '%%s\\n' \"%s\" > \"%s\"", v.c_str(), p.c_str()) != 0) {
            DBG(0, "Error! write |%s| to |%s| failed.", value, path);
            return ERR_CONFIGFS;
        }
        DBG(0, "Re-write done without errors.");
    }
    if (!verify)
        return KORV_OK;
    size_t read_size = std::strlen(value) + 1;
    std::unique_ptr<char, free_deleter> read_val(static_cast<char *>(std::calloc(1, read_size)));
    if (!read_val) {
        DBG(0, "unable to allocate read_val");
        return ERR_NO_MEMORY;
    }
    if (configfs_read_attr_str(path, read_val.get(), read_size) != 0) {
        DBG(0, "unable to read attribute");
        return ERR_CONFIGFS;
    }
    if (std::strcmp(value, read_val.get()) != 0) {
        DBG(0, "write |%s|, but get attribute value = |%s|", value, read_val.get());
        return ERR_ATTR_MISMATCH;
    }
    return KORV_OK;
}

int configfs_write_attr_int(const char *path, int value, int verify)
{
    char buf[128];
    std::snprintf(buf, sizeof buf, "%d", value);
    return configfs_write_attr_str(path, buf, verify);
}

/* ========================================================== kernel modules */

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
        if (korv::shell_escape(sysroot_path(tree).c_str(), path))
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
    _insert_mod(sysroot_path(MODULES[0].file).c_str());
    if (check_kmodule_inserted(MODULES[0].name) != 0)
        DBG(0, "Insert module target_core_mod.ko failed");

    std::string fabric = sysroot_path(FABRIC_ROOT);
    bool started = false;
    do {
        _insert_mod(sysroot_path(MODULES[1].file).c_str());
        if (check_kmodule_inserted(MODULES[1].name) != 0) {
            DBG(0, "Insert module target_core_file.ko failed");
            break;
        }
        _insert_mod(sysroot_path(MODULES[2].file).c_str());
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
        std::string path = sysroot_path(dir);
        if (make_dir_include_parent(path.c_str(), 0700) != 0)
            DBG(0, "make var dir %s failed", path.c_str());
    }
    return KORV_OK;
}

int lio3_get_module_state(void)
{
    if (check_kmodule_inserted("iscsi_target_mod") != 0)
        return 1;
    return configfs_path_exist(sysroot_path(FABRIC_ROOT).c_str()) == 0 ? 0 : ERR_MODULE_NO_CONFIGFS;
}

int lio3_stop_module(void)
{
    int state = lio3_get_module_state();
    if (state == 1)
        return KORV_OK;
    if (state == 0) {
        // Half started has nothing in configfs to clear.
        _lio3_remove_all_iscsi_target();
        configfs_rmdir(sysroot_path(FABRIC_ROOT).c_str());
        _lio3_shutdown_all_hba();
    }
    if (_remove_mod("iscsi_target_mod", 1) != 0 || _remove_mod("target_core_file", 1) != 0)
        return ERR_MODULE_REMOVE;
    if (_remove_mod("target_core_mod", 1) != 0)
        DBG(1, "failed to remove kmod %s", "target_core_mod");
    return KORV_OK;
}

/* ====================================================== default attributes */

namespace {

// Writes value to the portal group's attribute `rel` and verifies it; the
// log shows the value as `shown`, under `func`.
int write_tpg_attr(const char *func, const char *iqn, int tpgt, const char *rel, const std::string &value,
                   const char *shown)
{
    if (!iqn || !tpgt_ok(tpgt))
        return ERR_PARAM;
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

int _lio3_set_enable_default_policy(const char *iqn, int tpgt, int enable)
{
    return write_tpg_attr(__func__, iqn, tpgt, "/attrib/generate_node_acls", enable ? "1" : "0",
                          enable ? "Enable" : "Disable");
}

int _lio3_set_mcs_max_connection(const char *iqn, int tpgt, int max_conn)
{
    return write_tpg_attr(__func__, iqn, tpgt, "/param/MaxConnections", max_conn);
}

int _lio3_set_target_alias(const char *iqn, int tpgt, const char *alias)
{
    return alias ? write_tpg_attr(__func__, iqn, tpgt, "/param/TargetAlias", alias, alias) : ERR_PARAM;
}

int _lio3_set_target_default_cmdsn_depth(const char *iqn, int tpgt, int depth)
{
    return depth >= 0 ? write_tpg_attr(__func__, iqn, tpgt, "/attrib/default_cmdsn_depth", depth) : ERR_PARAM;
}

// Every step is tried even after a failure, so one refused attribute does
// not leave the others at the kernel's defaults.
int _set_target_default_attributes(const iscsi_target_t *target)
{
    std::string alias = field(target->alias);
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
    if (timeout < 0 || !iqn || !initiator || !tpgt_ok(tpgt))
        return ERR_PARAM;
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
    if (flag != 0 && flag != 1) {
        DBG(0, "parameter error");
        return ERR_PARAM;
    }
    if (_lio3_read_target_enable(target) == flag)
        return KORV_OK;
    return write_switch_and_auth_method(__func__, target->iqn, target->tpgt, "/enable", flag);
}

/* ================================================================ portals */

std::string np_name(const char *address, const char *interface, int port, int type)
{
    if (type != IP_TYPE_V4 && type != IP_TYPE_V6)
        type = _check_np_ip_type(address);
    if (type == IP_TYPE_V4)
        return std::string(address) + ":" + std::to_string(port);
    // An address that does not parse is scoped too: the kernel then refuses
    // it rather than binding an unintended address.
    if (is_ipv6_link_local(address) != 0)
        return "[" + std::string(address) + "%" + (interface ? interface : "") + "]:" + std::to_string(port);
    return "[" + std::string(address) + "]:" + std::to_string(port);
}

// The np directory of a portal; false when the arguments cannot name one.
bool np_path(const char *iqn, int tpgt, const char *interface, const char *address, int port, int type,
             std::string &path)
{
    if (!iqn || !address || !*address || std::strchr(address, '/') || !tpgt_ok(tpgt))
        return false;
    path = tpg_dir(iqn, tpgt) + "/np/" + np_name(address, interface, port, type);
    return true;
}

int _lio3_create_network_portal(const char *iqn, int tpgt, const char *interface, const char *address,
                                int port, int type)
{
    std::string path;
    if (!np_path(iqn, tpgt, interface, address, port, type, path))
        return ERR_PARAM;
    return make_dir(path.c_str(), 0700) == 0 ? KORV_OK : ERR_CONFIGFS;
}

int _lio3_remove_network_portal(const char *iqn, int tpgt, const char *interface, const char *address,
                                int port, int type)
{
    std::string path;
    if (!np_path(iqn, tpgt, interface, address, port, type, path))
        return ERR_PARAM;
    return configfs_rmdir(path.c_str()) == 0 ? KORV_OK : ERR_CONFIGFS;
}

const char *ip_address(const iscsi_ip_t *ip, int type)
{
    return type == IP_TYPE_V4 ? ip->ipv4 : ip->ipv6;
}

const char *ip_type_name(int type)
{
    return type == IP_TYPE_V4 ? "IP_TYPE_V4" : "IP_TYPE_V6";
}

bool list_has_address(list_t *list, const iscsi_ip_t *ip, int type)
{
    return type == IP_TYPE_V4 ? iscsi_ip_search_list_by_IPv4(list, ip->ipv4) != nullptr
                              : iscsi_ip_search_list_by_IPv6(list, ip->ipv6) != nullptr;
}

// Creates the wanted portals of target, every IPv4 one first, leaving out
// addresses `existing` already holds when it is given. Failures are logged.
void create_portals(const char *func, iscsi_target_t *target, list_t *existing)
{
    for (int type : {IP_TYPE_V4, IP_TYPE_V6}) {
        for (iscsi_ip_t *ip : korv::list_records<iscsi_ip_t>(&target->ip_list)) {
            const char *address = ip_address(ip, type);
            if (!address[0] || (existing && list_has_address(existing, ip, type)))
                continue;
            if (_lio3_create_network_portal(target->iqn, target->tpgt, ip->dev_name, address, ip->port, type) != 0)
                DBG_AS(func, 0, "_lio3_create_network_portal( %s , %d , %s , %s , %d, %s ) return error", target->iqn,
                    target->tpgt, ip->dev_name, address, ip->port, ip_type_name(type));
        }
    }
}

// The kernel's portals of target, appended to list in directory order only
// when all of them could be read.
int _get_exist_ip_list(const iscsi_target_t *target, list_t *list)
{
    std::string np = tpg_dir(target->iqn, target->tpgt) + "/np";
    std::vector<std::string> names;
    if (!list_subdirs(np, names)) {
        DBG(0, "can not open directory : %s", np.c_str());
        return ERR_PARAM;
    }
    ip_list_guard found;
    for (const std::string &name : names) {
        DBG(2, "get one existing np : %s", name.c_str());
        iscsi_ip_t *ip = iscsi_ip_new();
        if (!ip) {
            DBG(0, "malloc iscsi_ip_t failed");
            return ERR_CONFIGFS;
        }
        int port = 0;
        int rc;
        if (_check_np_ip_type(name.c_str()) == IP_TYPE_V4)
            rc = _parse_lio_np_entry(ip->ipv4, sizeof ip->ipv4, &port, ip->dev_name, sizeof ip->dev_name,
                                     name.c_str());
        else
            rc = _parse_lio_np_entry(ip->ipv6, sizeof ip->ipv6, &port, ip->dev_name, sizeof ip->dev_name,
                                     name.c_str());
        if (rc != 0) {
            DBG(0, "parse %s failed", name.c_str());
            iscsi_ip_free(ip);
            continue;
        }
        ip->port = port;
        list_append(&ip->node, &found.list);
    }
    while (found.list.head) {
        list_node_t *node = found.list.head;
        list_remove(node);
        list_append(node, list);
    }
    return KORV_OK;
}

int _lio3_remove_all_np(const iscsi_target_t *target)
{
    std::string np = tpg_dir(target->iqn, target->tpgt) + "/np";
    std::vector<std::string> names;
    if (!list_subdirs(np, names)) {
        DBG(0, "can not open directory : %s", np.c_str());
        return ERR_PARAM;
    }
    for (const std::string &name : names) {
        std::string path = np + "/" + name;
        if (remove_dir(path.c_str()) != 0) {
            DBG(0, "can not remove network portal : %s", path.c_str());
            return ERR_CONFIGFS;
        }
    }
    return KORV_OK;
}

/* =================================================================== CHAP */

int _lio3_set_target_auth_ability(const char *iqn, int tpgt, int chap_flag)
{
    return write_switch_and_auth_method(__func__, iqn, tpgt, "/attrib/authentication", chap_flag == 1 ? 1 : 0);
}

// Writes one name/password pair to an ACL's auth group: `suffix` picks the
// attributes ("" or "_mutual"), `kind` names the pair in the log.
int write_acl_credentials(const char *func, const char *iqn, int tpgt, const char *initiator, const char *suffix, const char *kind,
                          const char *user, const char *password)
{
    std::string auth = tpg_dir(iqn, tpgt) + "/acls/" + initiator + "/auth";
    std::string userid = auth + "/userid" + suffix;
    if (configfs_write_attr_str(userid.c_str(), user, 1) != 0) {
        DBG_AS(func, 0, "write %s user to %s = %s failed", kind, userid.c_str(), user);
        return ERR_CONFIGFS;
    }
    std::string pass = auth + "/password" + suffix;
    if (configfs_write_attr_str(pass.c_str(), password, 1) != 0) {
        DBG_AS(func, 0, "write %s password to %s = %s failed", kind, pass.c_str(), password);
        return ERR_CONFIGFS;
    }
    return KORV_OK;
}

int _lio3_set_target_acl_chap(const char *iqn, int tpgt, const char *initiator, const char *user,
                              const char *password)
{
    return write_acl_credentials(__func__, iqn, tpgt, initiator, "", "chap", user, password);
}

int _lio3_set_target_acl_mutual_chap(const char *iqn, int tpgt, const char *initiator, const char *user,
                                     const char *password)
{
    return write_acl_credentials(__func__, iqn, tpgt, initiator, "_mutual", "mutual chap", user, password);
}

// Writes the credentials the settings switch on to one ACL; mutual CHAP
// only rides on one-way CHAP.
int push_chap(const char *func, const iscsi_target_t *target, const char *initiator)
{
    if (target->chap != 1)
        return KORV_OK;
    std::string user = field(target->chap_user), pass = field(target->chap_pass);
    int rc = _lio3_set_target_acl_chap(target->iqn, target->tpgt, initiator, user.c_str(), pass.c_str());
    if (rc != 0) {
        DBG_AS(func, 0, "_lio3_set_target_acl_chap return error code: %d", rc);
        return ERR_CONFIGFS;
    }
    if (target->mutual_chap == 1) {
        std::string muser = field(target->mutual_user), mpass = field(target->mutual_pass);
        rc = _lio3_set_target_acl_mutual_chap(target->iqn, target->tpgt, initiator, muser.c_str(),
                                              mpass.c_str());
        if (rc != 0) {
            DBG_AS(func, 0, "_lio3_set_target_acl_mutual_chap return error code: %d", rc);
            return ERR_CONFIGFS;
        }
    }
    return KORV_OK;
}

int _lio3_set_target_chap_all_acl(const iscsi_target_t *target)
{
    std::string acls = tpg_dir(target->iqn, target->tpgt) + "/acls";
    std::vector<std::string> names;
    if (!list_subdirs(acls, names)) {
        DBG(0, "can not open directory : %s", acls.c_str());
        return ERR_CONFIGFS;
    }
    for (const std::string &name : names)
        if (push_chap(__func__, target, name.c_str()) != 0)
            return ERR_CONFIGFS;
    return KORV_OK;
}

/* ========================================================= teardown steps */

// Removes a configfs group the way the kernel allows: attribute files cannot
// be unlinked ("rm -rf" stops at them), so links are unlinked, child groups
// removed depth first, attributes left to go with their group. Default groups
// refuse rmdir and vanish with their parent, so only the top result counts.
int remove_configfs_group(const std::string &path, int depth = 0)
{
    if (depth > 16)
        return ERR_CONFIGFS;
    if (dir_ptr d{opendir(path.c_str())}) {
        std::vector<std::pair<std::string, bool>> entries;  // name, is a directory
        while (struct dirent *e = readdir(d.get())) {
            std::string_view name(e->d_name);
            if (name == "." || name == "..")
                continue;
            struct stat st;
            std::string full = path + "/" + e->d_name;
            if (lstat(full.c_str(), &st) != 0)
                continue;
            if (S_ISLNK(st.st_mode))
                entries.emplace_back(full, false);
            else if (S_ISDIR(st.st_mode))
                entries.emplace_back(full, true);
        }
        d.reset();
        for (const auto &[full, is_dir] : entries) {
            if (is_dir)
                remove_configfs_group(full, depth + 1);
            else
                remove_file(full.c_str());
        }
    }
    return remove_dir(path.c_str()) == 0 ? KORV_OK : ERR_CONFIGFS;
}

// Removes every sub-directory of dir, ignoring single failures.
int remove_all_subdirs(const char *func, const std::string &dir)
{
    std::vector<std::string> names;
    if (!list_subdirs(dir, names)) {
        DBG_AS(func, 0, "can not open directory : %s", dir.c_str());
        return ERR_PARAM;
    }
    for (const std::string &name : names)
        if (remove_configfs_group(dir + "/" + name) != 0)
            DBG_AS(func, 2, "remove %s/%s failed", dir.c_str(), name.c_str());
    return KORV_OK;
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

/* ==================================================== target operations */

int lio3_add_target(iscsi_target_t *target)
{
    CHECK_TARGET(target, "target is null", "target iqn is not given", "target tpgt is wrong: %d", target->tpgt);
    std::string tpg = tpg_dir(target->iqn, target->tpgt);
    if (configfs_path_exist(tpg.c_str()) == 0) {
        DBG(2, "target : %s , already exist", tpg.c_str());
        return KORV_OK;
    }
    std::string alua = sysroot_path(VAR_ALUA_DIR) + "/iSCSI/" + target->iqn + "+" + std::to_string(target->tpgt);
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
        DBG(0, "lio3_add_target failed, rc = %d", rc);
        remove_configfs_group(iqn_dir(target->iqn));
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

int lio3_del_target(iscsi_target_t *target)
{
    CHECK_TARGET(target, "target is NULL", "target IQN is empty", "target tpgt is wrong: %d", target->tpgt);
    std::string tpg = tpg_dir(target->iqn, target->tpgt);
    if (configfs_path_exist(tpg.c_str()) != 0) {
        DBG(2, "target : %s , already removed", tpg.c_str());
        return KORV_OK;
    }
    if (_lio3_set_target_enable(target, 0) != 0) {
        DBG(0, "disable target failed");
        return ERR_CONFIGFS;
    }
    if (_lio3_remove_all_np(target) != 0) {
        DBG(0, "remove network portal failed");
        return ERR_CONFIGFS;
    }
    if (_lio3_remove_all_acl(target) != 0) {
        DBG(0, "remove all acl node failed");
        return ERR_CONFIGFS;
    }
    if (_lio3_remove_all_lun(target) != 0) {
        DBG(0, "remove all lun node failed");
        return ERR_CONFIGFS;
    }
    if (configfs_rmdir(tpg.c_str()) != 0) {
        DBG(0, "remove tpg node failed: %s", tpg.c_str());
        return ERR_CONFIGFS;
    }
    std::string iqn = iqn_dir(target->iqn);
    if (configfs_rmdir(iqn.c_str()) != 0) {
        DBG(0, "remove iqn node failed: %s", iqn.c_str());
        return ERR_CONFIGFS;
    }
    return KORV_OK;
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
    if (target && !tpgt_ok(target->tpgt)) {
        DBG(0, "target tpgt is wrong: %d", target->tpgt);
        return ERR_PARAM;
    }
    CHECK_TARGET(target, "target is NULL", "target's IQN is empty", "target tpgt is wrong: %d", target->tpgt);
    if (_lio3_read_target_enable(target) == 0)
        return KORV_OK;
    if (_lio3_set_target_enable(target, 0) != 0) {
        DBG(0, "disable target failed");
        return ERR_CONFIGFS;
    }
    return KORV_OK;
}

int lio3_set_target_ip(iscsi_target_t *target)
{
    CHECK_TARGET(target, "target is NULL", "target IQN is empty", "target TPGT out of limitation");
    if (_lio3_remove_all_np(target) != 0)
        DBG(0, "_lio3_remove_all_np error");
    create_portals(__func__, target, nullptr);
    return KORV_OK;
}

int lio3_set_target_ip_v2(iscsi_target_t *target)
{
    CHECK_TARGET(target, "target is NULL", "target IQN is empty", "target TPGT out of limitation");
    ip_list_guard existing;
    if (_get_exist_ip_list(target, &existing.list) != 0)
        DBG(0, "_get_exist_ip_list error");
    create_portals(__func__, target, &existing.list);
    for (iscsi_ip_t *ip : korv::list_records<iscsi_ip_t>(&existing.list)) {
        for (int type : {IP_TYPE_V4, IP_TYPE_V6}) {
            const char *address = ip_address(ip, type);
            if (!address[0] || list_has_address(&target->ip_list, ip, type))
                continue;
            if (_lio3_remove_network_portal(target->iqn, target->tpgt, ip->dev_name, address, ip->port, type) != 0)
                DBG(0, "_lio3_remove_network_portal( %s , %d , %s , %s , %d , %s) return error", target->iqn,
                    target->tpgt, ip->dev_name, address, ip->port, ip_type_name(type));
        }
    }
    return KORV_OK;
}

int lio3_get_target_existing_ip_list(list_t *ip_list, iscsi_target_t *target)
{
    if (!ip_list || !target) {
        DBG(0, "ip_list or target is NULL");
        return ERR_PARAM;
    }
    CHECK_TARGET(target, "target is NULL", "target IQN is empty", "target TPGT out of limitation");
    if (_get_exist_ip_list(target, ip_list) != 0) {
        DBG(0, "_get_exist_ip_list error");
        return ERR_CONFIGFS;
    }
    return KORV_OK;
}

namespace {
// A name is given and the password is 12 to 16 characters; `kind` and the
// two messages name the pair in the log.
bool chap_pair_ok(const char *func, const char (&user)[ISCSI_NAME_LEN], const char (&pass)[ISCSI_NAME_LEN], const char *kind,
                  const char *no_name, const char *no_pass)
{
    size_t len = strnlen(pass, sizeof pass);
    if (user[0] == '\0') {
        DBG_AS(func, 0, "%s", no_name);
        return false;
    }
    if (len == 0) {
        DBG_AS(func, 0, "%s", no_pass);
        return false;
    }
    if (len < CHAP_PASS_MIN || len > CHAP_PASS_MAX) {
        DBG_AS(func, 0, "%s enabled, but %s password length = %u is not between 12 to 16", kind, kind,
            static_cast<unsigned>(len));
        return false;
    }
    return true;
}
}  // namespace

int _lio3_validate_target_chap_settings(const iscsi_target_t *target)
{
    if (!target) {
        DBG(0, "target is NULL");
        return 0;
    }
    if (target->chap != 1)
        return 1;
    if (!chap_pair_ok(__func__, target->chap_user, target->chap_pass, "CHAP", "CHAP Enabled, but CHAP name is not given",
                      "CHAP enabled, but CHAP password is not given"))
        return 0;
    if (target->mutual_chap != 1)
        return 1;
    return chap_pair_ok(__func__, target->mutual_user, target->mutual_pass, "Mutual CHAP",
                        "Mutual CHAP enabled, but Mutual CHAP name is not given",
                        "Mutual CHAP Enabled, but Mutual CHAP Password is not given")
               ? 1
               : 0;
}

int _lio3_set_target_chap_to_acl(const char *initiator_iqn, iscsi_target_t *target)
{
    if (!initiator_iqn || !*initiator_iqn || !is_component(initiator_iqn)) {
        DBG(0, "initiator iqn is empty");
        return ERR_PARAM;
    }
    CHECK_TARGET(target, "target is NULL", "target iqn is empty", "target tpgt is wrong: %d", target->tpgt);
    if (!_lio3_validate_target_chap_settings(target)) {
        DBG(0, "CHAP setting is not correct");
        return ERR_PARAM;
    }
    return push_chap(__func__, target, initiator_iqn);
}

int lio3_set_target_chap(iscsi_target_t *target)
{
    CHECK_TARGET(target, "target is NULL", "target IQN is empty", "target TPGT out of limitation");
    if (!_lio3_validate_target_chap_settings(target)) {
        DBG(0, "CHAP setting is not correct");
        return ERR_PARAM;
    }
    if (_lio3_set_target_auth_ability(target->iqn, target->tpgt, target->chap) != 0) {
        DBG(0, "_lio3_set_target_attrib_authentication failed");
        return ERR_CONFIGFS;
    }
    // Turning CHAP off leaves the ACLs' credentials in place.
    if (target->chap == 1 && _lio3_set_target_chap_all_acl(target) != 0) {
        DBG(0, "_lio3_set_target_chap_all_acl failed");
        return ERR_CONFIGFS;
    }
    return KORV_OK;
}

int lio3_set_target_attr_dataout_timeout(int timeout, iscsi_target_t *target)
{
    if (!target) {
        DBG(0, "target is NULL");
        return ERR_PARAM;
    }
    if (timeout < 0) {
        DBG(0, "da_out_timeout has an invalid value");
        return ERR_PARAM;
    }
    CHECK_TARGET(target, "target is NULL", "target IQN is empty", "target TPGT out of limitation");
    if (configfs_path_exist(iqn_dir(target->iqn).c_str()) != 0) {
        DBG(2, "target %s not in module", field(target->alias).c_str());
        return ERR_TARGET_NOT_IN_KERNEL;
    }
    std::string acls = tpg_dir(target->iqn, target->tpgt) + "/acls";
    std::vector<std::string> names;
    if (!list_subdirs(acls, names)) {
        DBG(0, "can not open directory : %s", acls.c_str());
        return ERR_CONFIGFS;
    }
    for (const std::string &name : names) {
        int rc = _lio3_set_target_acl_dataout_timeout(timeout, target->iqn, target->tpgt, name.c_str());
        if (rc != 0)
            DBG(1, "FUNC Fail ret = %d -> _lio3_set_target_acl_dataout_timeout(%d, %s, %d, %s)", rc, timeout,
                target->iqn, target->tpgt, name.c_str());
    }
    return KORV_OK;
}

/* ================================================================ np names */

int _check_np_ip_type(const char *name)
{
    int colons = 0;
    for (const char *p = name; p && *p; ++p)
        colons += *p == ':';
    return colons < 2 ? IP_TYPE_V4 : IP_TYPE_V6;
}

int _parse_lio_np_entry(char *addr, size_t addr_size, int *port, char *iface, size_t if_size, const char *name)
{
    if (!addr || !port || !iface || !name || addr_size == 0 || if_size == 0) {
        DBG(0, "parameter error");
        return ERR_PARAM;
    }
    if (!*name) {
        DBG(0, "np_ent_name is empty");
        return ERR_ATTR_EMPTY;
    }
    std::string_view rest(name);
    if (rest.front() == '[')
        rest.remove_prefix(1);
    size_t colon = rest.rfind(':');
    if (colon == std::string_view::npos) {
        DBG(0, "can not find port number in %s", name);
        return ERR_PARAM;
    }
    std::string_view address = rest.substr(0, colon);
    if (!address.empty() && address.back() == ']')
        address.remove_suffix(1);
    std::string_view port_text = rest.substr(colon + 1);
    if (port_text.size() >= 6) {
        DBG(0, "can not find port number in %s", name);
        return ERR_PARAM;
    }
    std::string_view scope;
    if (size_t pct = address.rfind('%'); pct != std::string_view::npos) {
        scope = address.substr(pct + 1);
        address = address.substr(0, pct);
    }
    if (address.size() >= addr_size || scope.size() >= if_size) {
        DBG(0, "address or interface of %s too long", name);
        return ERR_PARAM;
    }
    address.copy(addr, address.size());
    addr[address.size()] = '\0';
    scope.copy(iface, scope.size());
    iface[scope.size()] = '\0';
    *port = std::atoi(std::string(port_text).c_str());
    return KORV_OK;
}

/* ========================================================= backstores etc. */

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

int _lio3_remove_all_acl(iscsi_target_t *target)
{
    if (check_target(target) != tcheck::ok)
        return ERR_PARAM;
    return remove_all_subdirs(__func__, tpg_dir(target->iqn, target->tpgt) + "/acls");
}

int _lio3_remove_all_lun(iscsi_target_t *target)
{
    if (check_target(target) != tcheck::ok)
        return ERR_PARAM;
    return remove_all_subdirs(__func__, tpg_dir(target->iqn, target->tpgt) + "/lun");
}

int _lio3_remove_all_tpgt(iscsi_target_t *target)
{
    if (!target || !is_component(field(target->iqn)))
        return ERR_PARAM;
    std::string dir = iqn_dir(target->iqn);
    std::vector<std::string> names;
    if (!list_subdirs(dir, names)) {
        DBG(0, "can not open directory : %s", dir.c_str());
        return ERR_PARAM;
    }
    int rc = KORV_OK;
    for (const std::string &name : names) {
        size_t at = name.find("tpgt_");
        int tpgt = 0;
        if (at == std::string::npos || !leading_number(std::string_view(name).substr(at + 5), tpgt))
            continue;
        target->tpgt = tpgt;
        if (lio3_del_target(target) != 0) {
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
    std::string fabric = sysroot_path(FABRIC_ROOT);
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
    if (!list_subdirs(fabric, names)) {
        DBG(0, "can not open directory : %s", fabric.c_str());
        return ERR_PARAM;
    }
    for (const std::string &name : names) {
        if (name == "discovery_auth" || name == "lio_version" || name == "sessions")
            continue;
        DBG(1, "removing %s", name.c_str());
        iscsi_target_t *t = scratch.get();
        bool fits = name.size() < sizeof t->iqn;
        std::memset(t->iqn, 0, sizeof t->iqn);
        t->tpgt = -1;
        if (fits)
            std::memcpy(t->iqn, name.data(), name.size());
        if (!fits || _lio3_remove_all_tpgt(t) != 0) {
            DBG(0, "can not remove target entry : %s", name.c_str());
            return ERR_CONFIGFS;
        }
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

/* ================================================================== table */

const iscsi_mod_ops_t lio3_mod_ops = {
    .start_module = lio3_start_module,
    .stop_module = lio3_stop_module,
    .get_module_state = lio3_get_module_state,
    .add_target = lio3_add_target,
    .del_target = lio3_del_target,
    .enable_target = lio3_enable_target,
    .disable_target = lio3_disable_target,
    .set_target_chap = lio3_set_target_chap,
    .set_target_ip = lio3_set_target_ip,
    .set_target_attr_dataout_timeout = lio3_set_target_attr_dataout_timeout,
    .get_target_existing_ip_list = lio3_get_target_existing_ip_list,
    // Backstores, LUN mapping, ACLs and sessions arrive with later work.
    .add_backstore = nullptr,
    .del_backstore = nullptr,
    .shutdown_backstore = lio3_shutdown_backstore,
    .change_backstore_size = nullptr,
    .add_lun_mapping = nullptr,
    .del_lun_mapping = nullptr,
    .add_acl_initiator = nullptr,
    .del_acl_initiator = nullptr,
    .add_lun_acl = nullptr,
    .del_lun_acl = nullptr,
    .get_target_session = nullptr,
};
static_assert(sizeof(iscsi_mod_ops_t) == 22 * sizeof(void *), "the driver table has 22 slots");
