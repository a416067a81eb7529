// SPDX-License-Identifier: Apache-2.0
// What only the files of korvadm_xmldb_conf share: path building, the
// argument guard, the key reader, the target lookup, and the underscore
// functions of the scanner and counters (tests reach them here too).
#pragma once

// Every file of the unit logs under the unit's name.
#undef KORV_LOG_UNIT
#define KORV_LOG_UNIT "korvadm_xmldb_conf"

#include <cstdarg>
#include <cstddef>
#include <cstdio>
#include <cstring>
#include <initializer_list>

#include "common/korvadm_err.h"
#include "common/korvadm_list.h"
#include "common/korvadm_log.h"
#include "common/korvadm_str.h"
#include "config/korvadm_xmldb_conf.h"

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

/* ---- korvadm_xmldb_conf_lun.cpp, korvadm_xmldb_conf_lun_read.cpp ---- */

/* Entry number of the named LUN, as _xmldb_get_target_dbidx_by_name. */
int _xmldb_get_lun_dbidx_by_name(const char *name);
/* Fills every field of conf but its name from LUN entry n; a missing
 * number keeps the field's unknown value. 0, or the failed read's code. */
int _xmldb_fill_lun_conf(lun_conf_t *conf, int n);

/* ---- korvadm_xmldb_conf_acl.cpp, korvadm_xmldb_conf_sess.cpp ---- */

/* Entry number of the initiator under "/iscsi/acl" (>= 1), or a code. */
int _xmldb_acl_get_dbidx_by_name(const char *initiator);
/* Entry number of initiator under LUN entry lun's "acl", or a code. */
int _xmldb_lun_acl_get_dbidx(int lun, const char *initiator);
/* Entry number of lun_name under ACL entry acl's "mapped_lun", or a code. */
int _xmldb_acl_get_mapped_lun_dbidx(int acl, const char *lun_name);
/* Recount the two sides' lists of one entry. 0 / -9981. */
int _xmldb_update_current_lun_aclcnt(int lun);
int _xmldb_update_current_acl_mapluncnt(int acl);
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

// Room for a key as read: larger than any record's key field, so a stored
// key too long for its field is seen as such rather than cut to fit.
constexpr size_t kKeyLen = 512;

// Reads entry N's key: true with a non-empty value; false when empty or
// unreadable. *rc_out, when given, receives the read's own result.
bool read_key(const char *root, int id, const char *key, char (&value)[kKeyLen], int *rc_out = nullptr);

// Deletes entry n of a list when it is a ghost, what an interrupted delete
// leaves: a status without a name. An entry with a name is never touched,
// whatever its status (after a delete left a gap, count + 1 is a real entry).
// 0, or -9981 when the delete fails.
int remove_ghost(const char *func, const char *root, int n);

// True when text (NUL-terminated within max bytes or not) fits a field of N
// bytes with its terminator.
template <size_t N>
bool fits(const char *text)
{
    return strnlen(text, N) < N;
}

// A failure of the service itself (or of memory) fails a whole list read;
// any other failure only costs the record that could not be filled.
inline bool whole_read_failure(int rc)
{
    return rc == ERR_DB_CLIENT || rc == ERR_NO_MEMORY || rc == ERR_PARAM;
}

// A keyed list of the schema: its root, capacity and key field.
struct Keyed {
    const char *root;
    int max;
    const char *key;
};
inline constexpr Keyed kTargets{kTargetRoot, CONF_MAX_TARGETS, "name"};
inline constexpr Keyed kLuns{"/iscsi/lun", CONF_MAX_LUNS, "name"};
inline constexpr Keyed kAcls{"/iscsi/acl", CONF_MAX_ACLS, "initiator"};
inline constexpr Keyed kSessions{"/iscsi/sess/initiator", CONF_MAX_ACLS, "name"};

// Walks entries 1..max of a list up to the first empty key, calling
// fill(n, key) for each; fill answers 0 or a code. A key too long for a
// field of key_field bytes is a broken record and skipped, never cut (a cut
// key could name another record); so is a record fill() cannot fill, logged
// with skip_fmt (one %s: the key) when given. Returns 0, or the first whole
// failure.
template <class Fill>
int walk_list(const char *func, const char *root, int max, const char *key, size_t key_field,
              const char *skip_fmt, Fill fill)
{
    for (int n = 1; n <= max; n++) {
        char value[kKeyLen];
        int rc = KORV_OK;
        if (!read_key(root, n, key, value, &rc)) {
            if (rc != KORV_OK) {
                char path[kPathLen];
                DBG_AS(func, 0, "xmldbc_get(%s) failed", entry_path(path, root, n, key));
            }
            return rc;
        }
        if (strnlen(value, key_field) >= key_field) {
            DBG_AS(func, 0, "%s/id:%d/%s is too long for the record, skipped", root, n, key);
            continue;
        }
        rc = fill(n, value);
        if (whole_read_failure(rc))
            return rc;
        if (rc != KORV_OK && skip_fmt)
            DBG_AS(func, 0, skip_fmt, value);
    }
    return KORV_OK;
}


// One kind of record: how one is made and freed, and what a failed
// allocation logs.
template <class T>
struct RecordKind {
    T *(*make)(void);
    void (*free)(T *);
    void (*free_list)(list_t *);
    const char *make_fail;
};

// Reads the entries of list (walk_list, keys of at most key_field bytes)
// into new records of a kind: each gets dbidx = its entry number and is
// filled by fill(record, key), or freed and skipped when fill() fails. The
// records go to out only when the whole read succeeds.
template <class T, class Fill>
int read_records(const char *func, list_t *out, const RecordKind<T> &kind, const Keyed &list, size_t key_field,
                 const char *skip_fmt, Fill fill)
{
    return korv::fill_and_hand_over(out, kind.free_list, [&](list_t *got) {
        return walk_list(func, list.root, list.max, list.key, key_field, skip_fmt, [&](int n, const char *key) -> int {
            T *conf = kind.make();
            if (!conf) {
                DBG_AS(func, 0, "%s", kind.make_fail);
                return ERR_NO_MEMORY;
            }
            conf->dbidx = n;
            int rc = fill(conf, key);
            if (rc != KORV_OK) {
                kind.free(conf);
                return rc;
            }
            list_append(&conf->node, got);
            return KORV_OK;
        });
    });
}

// Entry number of value in list: >= 1, or the operation's result code
// (-9980 not found, logged with not_found_fmt, one %s, at not_found_level;
// -9981 when the scan itself fails), logged under the operation's name.
int find_entry(const char *func, const Keyed &list, const char *value, const char *not_found_fmt,
               int not_found_level = 0);
// The target form of find_entry, with the target's message.
int find_target(const char *func, const char *name);

// Entry of value in a dense list, or the first free one when it is absent,
// in one pass: >= 1 (*is_new tells which, when given); -9979 when all max
// entries hold other keys; -9992 when the service fails.
int find_or_free(const char *root, int max, const char *key, const char *value, bool *is_new = nullptr);

// Whether value is the key of an entry, scanning 1..max up to the first
// empty key: 1 found; -9979 when all max entries hold other keys; else 0.
int check_entry(const char *func, const char *root, int max, const char *key, const char *value);

// Lowest number 0..capacity-1 that no entry's int field holds, reading
// entries 1..capacity+1 up to the first unreadable one; logs found_fmt (one
// %d) at level 2. -9979 with *out = -1 when all are used.
int free_number(const char *func, const char *root, const char *field, int capacity, int *out,
                const char *found_fmt);

// A count read back from the database, trusted no further than a list's
// capacity: negative, unreadable or not a number counts as 0.
int read_count(const char *path, int capacity);

// One value of an entry's write sequence, and the message its failure logs
// (arguments: path, value).
struct FieldWrite {
    const char *field;
    const char *text;  // a text value, or nullptr for a number
    long long number;  // written "%d" (or "%llu" when u64)
    const char *fail;
    bool u64 = false;
};
// Writes the fields of entry n of root in order; the first failure is
// logged under func and gives -9981 (what was written stays).
int write_fields(const char *func, const char *root, int n, std::initializer_list<FieldWrite> fields);

// Deletes entry n of a list ("<root>/id:<n>", logged "xmldb_delete_node(%s)
// failed", -9981), then decrements the list's counter with dec_count.
int delete_entry(const char *func, const char *root, int n, int (*dec_count)(void));

// Entry number of value under a sub-list: >= 1; -9980 (logged "can not find
// %s" at level 2); -9981 (logged "db failed") when the scan fails.
int find_in(const char *func, const Keyed &list, const char *value);

// Removes entry n of a dense sub-list without hiding the entries after it:
// the last entry's fields move into n, then the last entry goes. 0, or
// -9981 (logged "del node %s failed") when a write or delete fails.
int remove_compact(const char *func, const char *root, int n, int max, const char *key,
                   std::initializer_list<const char *> fields);

// Path of entry n's sub-list root ("<root>/id:<n>/<sub>").
template <size_t N>
const char *sub_root(char (&buf)[N], const char *root, int n, const char *sub)
{
    return pathf(buf, N, "%s/id:%d/%s", root, n, sub);
}

}  // namespace xmldb_conf
