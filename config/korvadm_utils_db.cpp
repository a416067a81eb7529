// SPDX-License-Identifier: Apache-2.0
// Typed access to the configuration database and the number converters.
#include "config/korvadm_utils_db.h"

#include <cerrno>
#include <climits>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "common/korvadm_err.h"
#include "common/korvadm_log.h"
#include "platform/platform_util.h"
#include "platform/xmldbc.h"

namespace {
constexpr const char *kSock = XMLDB_SOCK_ISCSI;
constexpr size_t kValueLen = 128;

bool empty_path(const char *path)
{
    return !path || !path[0];
}

// Reads path into a zeroed value buffer: 0, -9992 on client failure, -9990 empty.
int read_value(const char *path, char (&value)[kValueLen])
{
    std::memset(value, 0, sizeof value);
    if (xmldbc_get_wb(kSock, 0, path, value, sizeof value) < 0)
        return ERR_DB_CLIENT;
    return value[0] ? KORV_OK : ERR_INT_VALUE;
}
}  // namespace

int xmldb_get_int32_t(int32_t *out, const char *path)
{
    if (!out || empty_path(path))
        return ERR_PARAM;
    char value[kValueLen];
    int rc = read_value(path, value);
    // atoi, not a strict parse: stored values with trailing text have always read this way.
    *out = rc == KORV_OK ? std::atoi(value) : 0;
    return rc;
}

int xmldb_set_int32_t(int32_t value, const char *path)
{
    if (empty_path(path))
        return ERR_PARAM;
    char text[kValueLen];
    std::snprintf(text, sizeof text, "%d", value);
    if (xmldbc_set(kSock, 0, path, text) != 0) {
        DBG(0, "xmldbc_set() failed");
        return ERR_DB_CLIENT;
    }
    return KORV_OK;
}

int xmldb_get_uint64_t(uint64_t *out, const char *path)
{
    if (!out || empty_path(path))
        return ERR_PARAM;
    char value[kValueLen];
    int rc = read_value(path, value);
    *out = 0;
    if (rc != KORV_OK)
        return rc;
    uint64_t v = 0;
    if (convert_str_to_uint64_t(value, &v) != 0)
        return ERR_INT_VALUE;
    *out = v;
    return KORV_OK;
}

int xmldb_set_uint64_t(uint64_t value, const char *path)
{
    if (empty_path(path))
        return ERR_PARAM;
    char text[kValueLen];
    std::snprintf(text, sizeof text, "%llu", static_cast<unsigned long long>(value));
    if (xmldbc_set(kSock, 0, path, text) != 0) {
        DBG(0, "xmldbc_set() failed");
        return ERR_DB_CLIENT;
    }
    return KORV_OK;
}

int xmldb_get_cstring(char *buf, size_t size, const char *path)
{
    if (!buf || size == 0 || empty_path(path))
        return ERR_PARAM;
    if (xmldbc_get_wb(kSock, 0, path, buf, size) < 0) {
        DBG(0, "xmldbc_get path = %s failed", path);
        return ERR_DB_CLIENT;
    }
    DBG(4, "get %s = %s", path, buf);
    return KORV_OK;
}

int xmldb_set_cstring(const char *value, const char *path)
{
    if (!value || !path)
        return ERR_PARAM;
    if (xmldbc_set(kSock, 0, path, value) != 0) {
        DBG(0, "xmldbc_set %s = %s failed", path, value);
        return ERR_DB_CLIENT;
    }
    return KORV_OK;
}

int xmldb_delete_node(const char *path)
{
    if (!path || xmldbc_del(kSock, 0, path) != 0) {
        DBG(2, "xmldbc_del %s failed", path ? path : "(null)");
        return ERR_DB_WRITE;
    }
    return KORV_OK;
}

int xmldb_write_config_file(void)
{
    // A file that was not written must not replace the good copy on flash.
    if (xml_write_file(KORV_CONFIG_FILE) != 0) {
        DBG(0, "xml_write_file(%s) failed", KORV_CONFIG_FILE);
        return ERR_DB_WRITE;
    }
    // The flash copy is what survives a reboot; its result is the one that matters.
    return LIB_CP_Config_To_MTD(1);
}

char *str_ndup(const char *src, size_t max_len)
{
    if (!src)
        return nullptr;
    size_t len = strnlen(src, max_len);
    auto *copy = static_cast<char *>(std::malloc(len + 1));
    if (!copy)
        return nullptr;
    std::memcpy(copy, src, len);
    copy[len] = '\0';
    return copy;
}

/* ---------------------------------------------------------------------------
 * Converters. Their error output (perror, "No digits were found") goes to
 * standard error, apart from the log, because management scripts read it.
 * ------------------------------------------------------------------------- */

namespace {
// One body for the three signed converters: Parse(str, end) -> T, with the
// range limits it reports through errno.
template <class T, class Parse>
int convert_signed(const char *str, char **endptr, T *value, T lo, T hi, Parse parse)
{
    PARAM_GUARD(!str || !value, "ERR_PARAM_ERROR");
    char *local_end = nullptr;
    if (!endptr)
        endptr = &local_end;
    errno = 0;
    T v = parse(str, endptr);
    *value = v;
    if ((errno == ERANGE && (v == hi || v == lo)) || (errno != 0 && v == 0)) {
        std::perror("strtoll");
        return -1;
    }
    if (*endptr == str) {
        std::fputs("No digits were found\n", stderr);
        return -1;
    }
    return KORV_OK;
}
}  // namespace

int convert_dec_str_to_uint64_t(const char *str, char **endptr, uint64_t *value)
{
    // Parsed signed on purpose: values above LLONG_MAX count as overflow.
    long long v = 0;
    int rc = convert_signed<long long>(str, endptr, value ? &v : nullptr, LLONG_MIN, LLONG_MAX,
                                       [](const char *s, char **e) { return std::strtoll(s, e, 10); });
    if (value && rc != ERR_PARAM)
        *value = static_cast<uint64_t>(v);
    return rc;
}

int convert_hex_str_to_l(const char *str, char **endptr, long *value)
{
    return convert_signed<long>(str, endptr, value, LONG_MIN, LONG_MAX,
                                [](const char *s, char **e) { return std::strtol(s, e, 16); });
}

int convert_dec_str_to_l(const char *str, char **endptr, long *value)
{
    return convert_signed<long>(str, endptr, value, LONG_MIN, LONG_MAX,
                                [](const char *s, char **e) { return std::strtol(s, e, 10); });
}

int convert_str_to_uint64_t(const char *str, uint64_t *value)
{
    PARAM_GUARD(!str || !value, "ERR_PARAM_ERROR");
    char *end = nullptr;
    errno = 0;
    unsigned long long v = std::strtoull(str, &end, 10);
    if ((errno == ERANGE && v == ULLONG_MAX) || (errno == EINVAL && v == 0)) {
        *value = 0;
        std::perror("strtoll");
        return 1;
    }
    *value = v;
    if (end == str && v == 0) {
        std::fputs("No digits were found\n", stderr);
        return 1;
    }
    return KORV_OK;
}
