// SPDX-License-Identifier: Apache-2.0
// The platform's utility calls: database shortcuts, the shell runner, string
// helpers and the system queries read from /proc and /sys.
#include "platform/platform_util.h"

#include "common/korvadm_log.h"
#include "common/korvadm_str.h"
#include "common/korvadm_sysroot.h"
#include "platform/xmldb_file.h"
#include "platform/xmldbc.h"

#include <cerrno>
#include <climits>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <string_view>
#include <sys/random.h>
#include <sys/stat.h>
#include <sys/wait.h>

namespace {

constexpr const char *kConfigFile = "/etc/NAS_CFG/config.xml";
// The configuration directory on the appliance's persistent (flash-backed)
// partition, which is mounted at /usr/local.
constexpr const char *kPersistDir = "/usr/local/config";

// Reads a small text file whole; false when it cannot be read.
bool read_small(const std::string &path, std::string &out)
{
    std::string err;
    if (!xmldb::read_file(path, out, err))
        return false;
    return true;
}

void chomp(std::string &s)
{
    while (!s.empty() && (s.back() == '\n' || s.back() == '\r'))
        s.pop_back();
}

// A network device name is one path component.
bool sane_dev(const char *dev)
{
    if (!dev || !*dev || std::strlen(dev) > 64)
        return false;
    std::string_view d(dev);
    return d != "." && d != ".." && d.find('/') == std::string_view::npos;
}

// Undoes the octal escapes (\040 for a blank) of /proc/self/mountinfo fields.
std::string unescape_mount_field(std::string_view f)
{
    std::string out;
    for (size_t i = 0; i < f.size(); ++i) {
        if (f[i] == '\\' && i + 3 < f.size() &&
            f[i + 1] >= '0' && f[i + 1] <= '3' && f[i + 2] >= '0' && f[i + 2] <= '7' &&
            f[i + 3] >= '0' && f[i + 3] <= '7') {
            out += static_cast<char>((f[i + 1] - '0') * 64 + (f[i + 2] - '0') * 8 + (f[i + 3] - '0'));
            i += 3;
        } else {
            out += f[i];
        }
    }
    return out;
}

}  // namespace

/* ---- database shortcuts ---- */

long long dbGetLL(const char *path)
{
    char buf[64];
    if (xmldbc_get_wb(XMLDB_SOCK_ISCSI, 0, path, buf, sizeof buf) < 0 || buf[0] == '\0')
        return 0;
    errno = 0;
    char *end = nullptr;
    long long v = std::strtoll(buf, &end, 10);
    if (errno == ERANGE || end == buf)
        return 0;
    return v;
}

int dbSetLL(long long value, const char *path)
{
    char buf[32];
    std::snprintf(buf, sizeof buf, "%lld", value);
    return xmldbc_set(XMLDB_SOCK_ISCSI, 0, path, buf) == 0 ? 0 : -1;
}

int dbGetStr(char *buf, int size, const char *path)
{
    if (!buf || size <= 0)
        return -1;
    return xmldbc_get_wb(XMLDB_SOCK_ISCSI, 0, path, buf, static_cast<size_t>(size)) < 0 ? -1 : 0;
}

int dbSetStr(const char *value, const char *path)
{
    return xmldbc_set(XMLDB_SOCK_ISCSI, 0, path, value) == 0 ? 0 : -1;
}

int dbDelete(const char *path)
{
    return xmldbc_del(XMLDB_SOCK_ISCSI, 0, path) == 0 ? 0 : -1;
}

/* ---- commands ---- */

int System(const char *fmt, ...)
{
    if (!fmt)
        return -1;
    va_list ap;
    va_start(ap, fmt);
    char *cmd = nullptr;
    int n = vasprintf(&cmd, fmt, ap);
    va_end(ap);
    if (n < 0)
        return -1;
    std::fflush(stdout);  // keep our log lines ahead of the command's output
    int st = std::system(cmd);
    std::free(cmd);
    if (st == -1)
        return -1;
    if (WIFEXITED(st))
        return WEXITSTATUS(st);
    if (WIFSIGNALED(st))
        return 128 + WTERMSIG(st);
    return -1;
}

/* ---- strings ---- */

char *str_insert_back_slash(const char *src)
{
    std::string escaped;
    if (!korv::shell_escape(src, escaped))
        return nullptr;
    return strdup(escaped.c_str());
}

int str2ll(const char *str, long long *value)
{
    if (!str || !value)
        return -1;
    const char *p = str;
    while (*p == ' ' || *p == '\t')
        ++p;
    if (*p == '\0')
        return -1;
    errno = 0;
    char *end = nullptr;
    long long v = std::strtoll(p, &end, 10);
    if (end == p || errno == ERANGE)
        return -1;
    while (*end == ' ' || *end == '\t' || *end == '\n' || *end == '\r')
        ++end;  // values read from files end with a line break
    if (*end != '\0')
        return -1;
    *value = v;
    return 0;
}

char *strsep_ex(char **stringp, const char *delim)
{
    if (!stringp || !*stringp || !delim)
        return nullptr;
    char *s = *stringp + std::strspn(*stringp, delim);
    if (*s == '\0') {
        *stringp = nullptr;
        return nullptr;
    }
    char *end = s + std::strcspn(s, delim);
    if (*end == '\0') {
        *stringp = nullptr;
    } else {
        *end = '\0';
        *stringp = end + 1 + std::strspn(end + 1, delim);
    }
    return s;
}

/* ---- system queries ---- */

const char *sys_mount_point(const char *path)
{
    if (!path || path[0] != '/')
        return nullptr;
    std::string want = path;
    while (want.size() > 1 && want.back() == '/')
        want.pop_back();
    std::string text;
    if (!read_small(sysroot_path("/proc/self/mountinfo"), text))
        return nullptr;
    std::string_view rest(text);
    while (!rest.empty()) {
        size_t nl = rest.find('\n');
        std::string_view line = rest.substr(0, nl);
        rest = nl == std::string_view::npos ? std::string_view() : rest.substr(nl + 1);
        // Fields: id, parent id, major:minor, root, mount point, ...
        size_t pos = 0;
        for (int skip = 0; skip < 4 && pos != std::string_view::npos; ++skip) {
            pos = line.find(' ', pos);
            if (pos != std::string_view::npos)
                ++pos;
        }
        if (pos == std::string_view::npos)
            continue;
        size_t end = line.find(' ', pos);
        std::string_view field = line.substr(pos, end == std::string_view::npos ? line.size() - pos : end - pos);
        if (unescape_mount_field(field) == want)
            return path;
    }
    return nullptr;
}

int sys_hostname(char *buf, size_t size)
{
    if (!buf || size == 0)
        return -1;
    buf[0] = '\0';
    std::string name;
    if (!read_small(sysroot_path("/proc/sys/kernel/hostname"), name))
        return -1;
    chomp(name);
    if (name.size() + 1 > size || name.find('\0') != std::string::npos)
        return -1;
    std::memcpy(buf, name.c_str(), name.size() + 1);
    return 0;
}

unsigned char *sys_get_mac_addr(const char *dev)
{
    static thread_local unsigned char mac[6];
    if (!sane_dev(dev))
        return nullptr;
    std::string text;
    if (!read_small(sysroot_path(("/sys/class/net/" + std::string(dev) + "/address").c_str()), text))
        return nullptr;
    chomp(text);
    if (text.size() != 17)
        return nullptr;
    auto hex = [](char c) -> int {
        if (c >= '0' && c <= '9') return c - '0';
        if (c >= 'a' && c <= 'f') return c - 'a' + 10;
        if (c >= 'A' && c <= 'F') return c - 'A' + 10;
        return -1;
    };
    for (int i = 0; i < 6; ++i) {
        int hi = hex(text[i * 3]), lo = hex(text[i * 3 + 1]);
        if (hi < 0 || lo < 0 || (i < 5 && text[i * 3 + 2] != ':'))
            return nullptr;
        mac[i] = static_cast<unsigned char>(hi * 16 + lo);
    }
    return mac;
}

int sys_random(void)
{
    unsigned int v = 0;
    if (getrandom(&v, sizeof v, 0) != static_cast<ssize_t>(sizeof v)) {
        // The generator is unavailable only before the kernel seeds it.
        v = static_cast<unsigned int>(std::rand());
    }
    return static_cast<int>(v & INT_MAX);
}

int LIB_Get_Lan_Link_Speed(int port)
{
    static constexpr const char *kPorts[] = {"egiga0", "egiga1"};
    if (port < 0 || port > 1)
        return 0;
    std::string base = std::string("/sys/class/net/") + kPorts[port];
    std::string state, speed;
    if (!read_small(sysroot_path((base + "/operstate").c_str()), state))
        return 0;
    chomp(state);
    if (state != "up")
        return 0;
    long long v = 0;
    if (!read_small(sysroot_path((base + "/speed").c_str()), speed) || str2ll(speed.c_str(), &v) != 0 ||
        v <= 0 || v > INT_MAX)
        return 0;
    return static_cast<int>(v);
}

int LIB_CP_Config_To_MTD(int flag)
{
    (void)flag;
    std::string src = sysroot_path(kConfigFile);
    std::string dir = sysroot_path(kPersistDir);
    std::string text, err;
    if (!xmldb::read_file(src, text, err)) {
        DBG(0, "%s", err.c_str());
        return -1;
    }
    // The directory is made on first use, its parent (the persistent
    // partition) never: without it the copy would land on volatile storage.
    if (::mkdir(dir.c_str(), 0755) != 0 && errno != EEXIST) {
        DBG(0, "cannot create %s: %s", dir.c_str(), std::strerror(errno));
        return -1;
    }
    if (!xmldb::write_file_atomic(dir + "/config.xml", text, err)) {
        DBG(0, "%s", err.c_str());
        return -1;
    }
    return 0;
}
