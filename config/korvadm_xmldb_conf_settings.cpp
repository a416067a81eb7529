// SPDX-License-Identifier: Apache-2.0
// Service settings, versions, saved names and addresses, and the
// whole-store operations.
#include <climits>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <initializer_list>

#include "common/korvadm_err.h"
#include "config/korvadm_utils_db.h"
#include "config/korvadm_xmldb_conf_internal.h"
#include "platform/platform_util.h"

using namespace xmldb_conf;

/* ---------------------------------------------------------------------------
 * Service settings. "/system_mgr" values go through the platform shortcuts,
 * whose results are ignored; the rest through the typed wrappers.
 * ------------------------------------------------------------------------- */

namespace {
constexpr const char *kServiceEnable = "/system_mgr/iscsi/enable";
constexpr const char *kServiceProgress = "/system_mgr/iscsi/progress";
constexpr const char *kIsnsRoot = "/system_mgr/iscsi/iSNS";
constexpr const char *kIsnsEnable = "/system_mgr/iscsi/iSNS/enable";
constexpr const char *kIsnsPid = "/system_mgr/iscsi/iSNS/pid";
constexpr const char *kIsnsIp = "/system_mgr/iscsi/iSNS/ip";
constexpr const char *kDebugLevel = "/iscsi/target/dbg";
constexpr const char *kVersion = "/iscsi/target/ver";
constexpr const char *kHostName = "/iscsi/target/hostname";
constexpr const char *kIqnPrefix = "/iscsi/target/iqn_prefix";
constexpr size_t kSavedHostNameLen = 128;
constexpr size_t kIpv4Len = 16;
constexpr size_t kIpv6Len = 40;

// Path of an interface's saved-address slot ("bond0" and "egiga0" share
// slot 1, "egiga1" has slot 2): KORV_OK, or -9980 for any other name.
int saved_addr_path(const char *func, char (&path)[kPathLen], const char *dev_name, const char *fmt)
{
    const int slot = std::strcmp(dev_name, "bond0") == 0 || std::strcmp(dev_name, "egiga0") == 0 ? 1
                     : std::strcmp(dev_name, "egiga1") == 0                                       ? 2
                                                                                                  : 0;
    if (!slot) {
        DBG_AS(func, 0, "unknown interface %s", dev_name);
        return ERR_NOT_FOUND;
    }
    pathf(path, sizeof path, fmt, slot);
    return KORV_OK;
}

int get_saved_addr(const char *func, char *buf, size_t size, const char *dev_name, const char *fmt)
{
    PARAM_GUARD_AS(func, !buf || !dev_name || !dev_name[0]);
    char path[kPathLen];
    if (int rc = saved_addr_path(func, path, dev_name, fmt); rc != KORV_OK)
        return rc;
    buf[0] = '\0';
    if (xmldb_get_cstring(buf, size, path) != KORV_OK)
        return ERR_DB_WRITE;
    return buf[0] ? KORV_OK : ERR_NOT_FOUND;
}

int set_saved_addr(const char *func, const char *addr, const char *dev_name, const char *fmt)
{
    PARAM_GUARD_AS(func, !addr || !addr[0] || !dev_name || !dev_name[0]);
    char path[kPathLen];
    if (int rc = saved_addr_path(func, path, dev_name, fmt); rc != KORV_OK)
        return rc;
    DBG_AS(func, 2, "set %s = %s", path, addr);
    return xmldb_set_cstring(addr, path) == KORV_OK ? KORV_OK : ERR_DB_WRITE;
}

// A saved text setting: the reader wants a buffer of at least need bytes,
// empties it (whole, or its first byte) and logs fail when the service does
// not answer.
int get_saved_text(const char *func, char *buf, size_t size, size_t need, bool clear_whole, const char *path,
                   const char *fail)
{
    PARAM_GUARD_AS(func, !buf || size < need);
    std::memset(buf, 0, clear_whole ? size : 1);
    if (xmldb_get_cstring(buf, size, path) != KORV_OK) {
        DBG_AS(func, 0, "%s", fail);
        return ERR_DB_WRITE;
    }
    return KORV_OK;
}

int set_saved_text(const char *func, const char *value, const char *path)
{
    PARAM_GUARD_AS(func, !value);
    return xmldb_set_cstring(value, path) == KORV_OK ? KORV_OK : ERR_DB_WRITE;
}

// The platform reads at most INT_MAX bytes; larger buffers are simply not filled further.
int platform_size(size_t size)
{
    return size > INT_MAX ? INT_MAX : static_cast<int>(size);
}
}  // namespace

int xmldb_get_service_enable(int *enable)
{
    if (!enable)
        return ERR_PARAM;
    *enable = dbGetLL(kServiceEnable) != 0;
    return KORV_OK;
}

int xmldb_set_service_enable(int enable)
{
    dbSetLL(enable != 0, kServiceEnable);
    return KORV_OK;
}

int xmldb_get_service_progress(int *progress)
{
    if (!progress)
        return ERR_PARAM;
    *progress = static_cast<int>(dbGetLL(kServiceProgress));
    return KORV_OK;
}

int xmldb_set_service_progress(int progress)
{
    dbSetLL(progress, kServiceProgress);
    return KORV_OK;
}

int xmldb_get_nesrad_pid(int *pid)
{
    PARAM_GUARD(!pid);
    *pid = static_cast<int>(dbGetLL(kIsnsPid));
    return KORV_OK;
}

int xmldb_set_nesrad_pid(int pid)
{
    PARAM_GUARD(pid < 0);
    dbSetLL(pid, kIsnsPid);
    DBG(2, "set nesrad pid = %d", pid);
    return KORV_OK;
}

int xmldb_get_nesrad_enable(int *enable)
{
    PARAM_GUARD(!enable);
    *enable = dbGetLL(kIsnsEnable) != 0;
    return KORV_OK;
}

int xmldb_set_nesrad_enable(int enable)
{
    dbSetLL(enable != 0, kIsnsEnable);
    return KORV_OK;
}

int xmldb_get_nesrad_ip(char *buf, size_t size)
{
    PARAM_GUARD(!buf || size == 0);
    std::memset(buf, 0, size);
    dbGetStr(buf, platform_size(size), kIsnsIp);
    return KORV_OK;
}

int xmldb_set_nesrad_ip(const char *ip)
{
    PARAM_GUARD(!ip);
    dbSetStr(ip, kIsnsIp);
    return KORV_OK;
}

int xmldb_clean_nesrad_conf(void)
{
    dbDelete(kIsnsRoot);
    return KORV_OK;
}

int xmldb_get_debug_level(int *level)
{
    if (!level)
        return ERR_PARAM;
    *level = 0;
    int32_t v = 0;
    int rc = xmldb_get_int32_t(&v, kDebugLevel);
    if (rc != KORV_OK)
        return rc;
    *level = v;
    return KORV_OK;
}

int xmldb_set_debug_level(int level)
{
    return xmldb_set_int32_t(level, kDebugLevel) == KORV_OK ? KORV_OK : ERR_DB_WRITE;
}

int xmldb_get_korvadm_ver(int *ver)
{
    PARAM_GUARD(!ver);
    char value[kPathLen] = "";
    DBG(2, "get strNode: %s", kVersion);
    if (xmldb_get_cstring(value, sizeof value, kVersion) != KORV_OK)
        return ERR_DB_WRITE;
    if (value[0]) {
        *ver = std::atoi(value);
        return KORV_OK;
    }
    // No version: settings of the first layout still carry an ACL counter;
    // a fresh store carries neither.
    const char *acl_count = "/iscsi/acl/count";
    DBG(2, "get strNode: %s", acl_count);
    value[0] = '\0';
    *ver = xmldb_get_cstring(value, sizeof value, acl_count) == KORV_OK && value[0] ? 1 : 0;
    return KORV_OK;
}

int xmldb_set_korvadm_ver(int ver)
{
    return xmldb_set_int32_t(ver, kVersion) == KORV_OK ? KORV_OK : ERR_DB_WRITE;
}

int xmldb_get_saved_host_name(char *buf, size_t size)
{
    return get_saved_text(__func__, buf, size, kSavedHostNameLen, true, kHostName, "get saved host name error");
}

int xmldb_set_saved_host_name(const char *host_name) { return set_saved_text(__func__, host_name, kHostName); }

int xmldb_get_iqn_prefix(char *buf, size_t size)
{
    return get_saved_text(__func__, buf, size, CONF_GEN_IQN_LEN, false, kIqnPrefix, "get saved iqn error");
}

int xmldb_set_iqn_prefix(const char *prefix) { return set_saved_text(__func__, prefix, kIqnPrefix); }

int xmldb_get_saved_ipv4_addr(char *buf, const char *dev_name)
{
    return get_saved_addr(__func__, buf, kIpv4Len, dev_name, "/iscsi/target/IP%d");
}

int xmldb_set_saved_ipv4_addr(const char *addr, const char *dev_name)
{
    return set_saved_addr(__func__, addr, dev_name, "/iscsi/target/IP%d");
}

int xmldb_get_saved_ipv6_addr(char *buf, const char *dev_name)
{
    return get_saved_addr(__func__, buf, kIpv6Len, dev_name, "/iscsi/target/IPv6_%d");
}

int xmldb_set_saved_ipv6_addr(const char *addr, const char *dev_name)
{
    return set_saved_addr(__func__, addr, dev_name, "/iscsi/target/IPv6_%d");
}

int xmldb_clean_saved_ip_addr(void)
{
    // The IPv6 slots stay: only the IPv4 addresses are re-learnt on a change.
    for (const char *path : {"/iscsi/target/IP1", "/iscsi/target/IP2"})
        if (xmldb_set_cstring("", path) != KORV_OK)
            return ERR_DB_WRITE;
    return KORV_OK;
}

int xmldb_set_temp_return_code(int code)
{
    int rc = xmldb_set_int32_t(code, "/temp/iscsi/return_code");
    if (rc != KORV_OK) {
        DBG(0, "xmldb_set_int32_t error, return: %d", rc);
        return ERR_DB_WRITE;
    }
    DBG(2, "set temp return code = %d", code);
    return KORV_OK;
}

int xmldb_clean_sess_conf(void)
{
    xmldb_delete_node("/iscsi/sess/initiator");
    return KORV_OK;
}

int xmldb_save_conf(void)
{
    return xmldb_write_config_file();
}

int xmldb_clean_conf(void)
{
    dbDelete(kIsnsRoot);
    for (const char *path : {"/iscsi/target", "/iscsi/lun", "/iscsi/acl", "/iscsi/sess"})
        if (xmldb_delete_node(path) != KORV_OK)
            DBG(0, "xmldb_delete_node(%s) failed", path);
    return KORV_OK;
}

