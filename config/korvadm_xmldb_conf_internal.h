// What only the files of korvadm_xmldb_conf share: path building, the
// argument guard, the key reader, the target lookup, and the underscore
// functions of the scanner and counters (tests reach them here too).
#pragma once

#include <cstdarg>
#include <cstddef>
#include <cstdio>

#include "common/korvadm_log.h"
#include "config/korvadm_xmldb_conf.h"

// An operation's argument guard: logged under the operation, -9989.
#define PARAM_ERROR_IF(refused)        \
    do {                               \
        if (refused) {                 \
            DBG(0, "parameter error"); \
            return ERR_PARAM;          \
        }                              \
    } while (0)

extern "C" {
/* ---- korvadm_xmldb_conf_scan.cpp: scanner and counters ---- */

/* Entry number whose <key> equals value, scanning 1..max until the first
 * empty or unreadable key. ID_ENTRY_FOUND (5) with *out_id = N, or
 * ID_ENTRY_NOT_FOUND (6) with *out_id = 0; -9989 for a NULL argument. */
int _search_xmldb_id_entry(int *out_id, const char *root, int max, const char *key, const char *value);
/* First number 1..max whose key is empty or unreadable: 5 with *out_id = N;
 * 6 with *out_id = 0 when all max are taken; -9989 for a NULL argument. */
int _get_free_xmldb_id_entry(int *out_id, const char *root, int max, const char *key);
/* Number of consecutive entries from 1 (at most max) holding a key; -1 for a
 * NULL argument. */
int _cal_xmldb_id_entry_count(const char *root, int max, const char *key);

/* Counter updates: read (failed or empty reads as 0), adjust (never below 0),
 * write back. 0, or -9981 when the write fails. */
int _xmldb_inc_target_count(void);
int _xmldb_dec_target_count(void);
int _xmldb_inc_lun_count(void);
int _xmldb_dec_lun_count(void);
int _xmldb_inc_acl_count(void);
int _xmldb_dec_acl_count(void);
int _xmldb_inc_target_lun_map_cnt(int target_id);
int _xmldb_dec_target_lun_map_cnt(int target_id);
/* Recounts the ACL initiators (1..129) into "/iscsi/acl/count". 0 / -9981. */
int _xmldb_update_current_aclcnt(void);

/* ---- korvadm_xmldb_conf_target.cpp ---- */

/* Entry number of the named target (>= 1); -9980 when it is not found,
 * -9989 for NULL, -9981 on a scan failure. */
int _xmldb_get_target_dbidx_by_name(const char *name);
}

namespace xmldb_conf {

constexpr size_t kPathLen = 256;
constexpr const char *kTargetRoot = "/iscsi/target";
constexpr const char *kTargetCount = "/iscsi/target/count";

__attribute__((format(printf, 3, 4))) inline const char *pathf(char *buf, size_t size, const char *fmt, ...)
{
    va_list ap;
    va_start(ap, fmt);
    std::vsnprintf(buf, size, fmt, ap);
    va_end(ap);
    return buf;
}

template <size_t N>
const char *entry_path(char (&buf)[N], const char *root, int id, const char *field)
{
    return pathf(buf, N, "%s/id:%d/%s", root, id, field);
}

template <size_t N>
const char *target_path(char (&buf)[N], int id, const char *field)
{
    return entry_path(buf, kTargetRoot, id, field);
}

// Reads entry N's key: true with a non-empty value; false when empty or
// unreadable. *rc_out, when given, receives the read's own result.
bool read_key(const char *root, int id, const char *key, char (&value)[kPathLen], int *rc_out = nullptr);

// Entry number of a target for the single-field operations: >= 1, or the
// operation's result code, logged under the operation's name.
int find_target(const char *func, const char *name);

}  // namespace xmldb_conf
