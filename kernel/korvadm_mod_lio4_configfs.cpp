// SPDX-License-Identifier: Apache-2.0
// configfs access: directories, attribute reads and verified writes through
// the shell, and walking and removing configfs groups.
#include "kernel/korvadm_mod_lio4_internal.h"

#include <sys/stat.h>
#include <algorithm>
#include <climits>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <new>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "common/korvadm_err.h"
#include "common/korvadm_utils.h"
#include "platform/platform_util.h"

using namespace lio4;

namespace {

using korv::file_ptr;

}  // namespace

namespace lio4 {

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

bool list_subdirs_or_log(const char *func, const std::string &path, std::vector<std::string> &names)
{
    if (list_subdirs(path, names))
        return true;
    DBG_AS(func, 0, "can not open directory : %s", path.c_str());
    return false;
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

// Removes a configfs group the way the kernel allows: attribute files cannot
// be unlinked ("rm -rf" stops at them), so links are unlinked, child groups
// removed depth first, attributes left to go with their group. Default groups
// refuse rmdir and vanish with their parent, so only the top result counts.
int remove_configfs_group(const std::string &path, int depth)
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
    if (!list_subdirs_or_log(func, dir, names))
        return ERR_PARAM;
    for (const std::string &name : names)
        if (remove_configfs_group(dir + "/" + name) != 0)
            DBG_AS(func, 2, "remove %s/%s failed", dir.c_str(), name.c_str());
    return KORV_OK;
}
}  // namespace lio4

/* ===================================================== configfs primitives */

int configfs_mkdir(const char *path)
{
    PARAM_GUARD(!path);
    if (make_dir_include_parent(path, 0700) != 0)
        DBG(0, "mkdir %s failed", path);
    return KORV_OK;
}

int configfs_rmdir(const char *path)
{
    PARAM_GUARD(!path);
    if (remove_dir(path) != 0) {
        DBG(2, "remove %s failed", path);
        return ERR_SHELL;
    }
    return KORV_OK;
}

int configfs_rmdir_recursive(const char *path)
{
    PARAM_GUARD(!path);
    return remove_dir_recurive(path) == 0 ? KORV_OK : ERR_SHELL;
}

int configfs_path_exist(const char *path)
{
    return check_path_exist(path);
}

int configfs_is_mounted(void)
{
    std::string mount_point = fixed_path(CONFIGFS_MOUNT);
    if (!sys_mount_point(mount_point.c_str()))
        return -1;
    return configfs_path_exist(mount_point.c_str());
}

int configfs_mount(void)
{
    std::string mount_point;
    if (!korv::shell_escape(fixed_path(CONFIGFS_MOUNT).c_str(), mount_point))
        return ERR_NO_MEMORY;
    return System("mount -t configfs configfs \"%s\"", mount_point.c_str()) == 0 ? KORV_OK : ERR_SHELL;
}

int configfs_read_attr_str(const char *path, char *buf, size_t size)
{
    PARAM_GUARD(!path || !buf || size == 0);
    file_ptr f(std::fopen(path, "r"));
    if (!f) {
        DBG(0, "open attribute %s failed", path);
        return ERR_CONFIGFS;
    }
    // Up to size bytes, one more than the caller keeps: a verified write's
    // read-back then sees the kernel's own line end after the value and
    // strips that one, not a line end inside the value.
    std::unique_ptr<char[]> text(new (std::nothrow) char[size + 1]);
    if (!text)
        return ERR_NO_MEMORY;
    size_t n = std::fread(text.get(), 1, size, f.get());
    if (std::ferror(f.get())) {
        DBG(0, "read attribute %s failed", path);
        return ERR_CONFIGFS;
    }
    text[n] = '\0';
    DBG(2, "get |%s|", text.get());
    size_t len = std::strlen(text.get());
    for (size_t k = 1; k <= 10 && k < len; ++k) {
        if (text[len - k] == '\n') {
            len -= k;
            break;
        }
    }
    size_t keep = std::min(len, size - 1);
    std::memcpy(buf, text.get(), keep);
    buf[keep] = '\0';
    return KORV_OK;
}

int configfs_read_attr_buf(const char *path, char *buf, size_t size, size_t *out_len)
{
    PARAM_GUARD(!path || !buf || size == 0 || !out_len);
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
    PARAM_GUARD(!path || !out);
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
    PARAM_GUARD(!path || !value);
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
    korv::c_buffer read_val(static_cast<char *>(std::calloc(1, read_size)));
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
