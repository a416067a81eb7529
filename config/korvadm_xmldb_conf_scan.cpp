// SPDX-License-Identifier: Apache-2.0
// The numbered-entry scanner every list of the store rests on, and the
// counters kept beside the lists.
#include <cstdint>
#include <cstring>
#include <vector>

#include "common/korvadm_err.h"
#include "config/korvadm_utils_db.h"
#include "config/korvadm_xmldb_conf_internal.h"

using namespace xmldb_conf;

bool xmldb_conf::read_key(const char *root, int id, const char *key, char (&value)[kKeyLen], int *rc_out)
{
    char path[kPathLen];
    entry_path(path, root, id, key);
    value[0] = '\0';
    int rc = xmldb_get_cstring(value, sizeof value, path);
    if (rc_out)
        *rc_out = rc;
    return rc == KORV_OK && value[0];
}

int _search_xmldb_id_entry(int *out_id, const char *root, int max, const char *key, const char *value)
{
    PARAM_GUARD(!out_id || !root || !key || !value);
    *out_id = 0;
    for (int n = 1; n <= max; n++) {
        char got[kKeyLen];
        if (!read_key(root, n, key, got))
            return ID_ENTRY_NOT_FOUND;
        // A key that filled the buffer may have been cut: never a match.
        if (strnlen(got, sizeof got) < sizeof got - 1 && std::strcmp(got, value) == 0) {
            *out_id = n;
            return ID_ENTRY_FOUND;
        }
    }
    return ID_ENTRY_NOT_FOUND;
}

int _get_free_xmldb_id_entry(int *out_id, const char *root, int max, const char *key)
{
    PARAM_GUARD(!out_id || !root || !key);
    *out_id = 0;
    if (max <= 0)
        return ID_ENTRY_NOT_FOUND;
    DBG(2, "searching free id entry in %s", root);
    for (int n = 1; n <= max; n++) {
        char path[kPathLen];
        char got[kPathLen] = "";
        entry_path(path, root, n, key);
        DBG(2, "trying id entry in |%s|", path);
        int rc = xmldb_get_cstring(got, sizeof got, path);
        if (rc == ERR_PARAM)
            return ERR_PARAM;
        if (rc != KORV_OK || !got[0]) {
            *out_id = n;
            return ID_ENTRY_FOUND;
        }
    }
    return ID_ENTRY_NOT_FOUND;
}

int _cal_xmldb_id_entry_count(const char *root, int max, const char *key)
{
    if (!root || !key) {
        DBG(0, "parameter error");
        return -1;
    }
    int count = 0;
    char got[kKeyLen];
    while (count < max && read_key(root, count + 1, key, got))
        count++;
    return count;
}

/* ---------------------------------------------------------------------------
 * Counters
 * ------------------------------------------------------------------------- */

namespace {
// Read-modify-write; not atomic, like every writer of the store.
int adjust_counter(const char *func, const char *path, int delta, const char *fail_fmt)
{
    int32_t count = 0;
    if (xmldb_get_int32_t(&count, path) != KORV_OK || count < 0)
        count = 0;
    if (delta > 0)
        count = count < INT32_MAX ? count + 1 : count;
    else if (count > 0)
        count--;
    else
        count = 0;
    if (xmldb_set_int32_t(count, path) != KORV_OK) {
        DBG_AS(func, 0, fail_fmt, count);
        return ERR_DB_WRITE;
    }
    return KORV_OK;
}

int adjust_map_counter(const char *func, int target_id, int delta)
{
    char path[kPathLen];
    pathf(path, sizeof path, "/iscsi/target/id:%d/map_lun/count", target_id);
    return adjust_counter(func, path, delta, "set LUN count = %d failed");
}
}  // namespace

int _xmldb_inc_target_count(void) { return adjust_counter(__func__, kTargetCount, 1, "set target count = %d failed"); }
int _xmldb_dec_target_count(void) { return adjust_counter(__func__, kTargetCount, -1, "set target count = %d failed"); }
int _xmldb_inc_lun_count(void) { return adjust_counter(__func__, "/iscsi/lun/count", 1, "set LUN count = %d failed"); }
int _xmldb_dec_lun_count(void) { return adjust_counter(__func__, "/iscsi/lun/count", -1, "set LUN count = %d failed"); }
int _xmldb_inc_acl_count(void) { return adjust_counter(__func__, "/iscsi/acl/count", 1, "set acl count = %d failed"); }
int _xmldb_dec_acl_count(void) { return adjust_counter(__func__, "/iscsi/acl/count", -1, "set acl count = %d failed"); }
int _xmldb_inc_target_lun_map_cnt(int target_id) { return adjust_map_counter(__func__, target_id, 1); }
int _xmldb_dec_target_lun_map_cnt(int target_id) { return adjust_map_counter(__func__, target_id, -1); }

int _xmldb_update_current_aclcnt(void)
{
    const char *path = "/iscsi/acl/count";
    int count = _cal_xmldb_id_entry_count("/iscsi/acl", CONF_MAX_ACLS, "initiator");
    if (xmldb_set_int32_t(count, path) != KORV_OK) {
        DBG(0, "xmldb_set_int32_t(%d, %s) failed", count, path);
        return ERR_DB_WRITE;
    }
    DBG(1, "total acl's entry count =%d", count);
    return KORV_OK;
}

int xmldb_update_current_aclcnt(void)
{
    return _xmldb_update_current_aclcnt();
}

int xmldb_conf::remove_ghost(const char *func, const char *root, int n)
{
    char path[kPathLen];
    char value[kKeyLen] = "";
    if (xmldb_get_cstring(value, sizeof value, entry_path(path, root, n, "status")) != KORV_OK || !value[0])
        return KORV_OK;
    value[0] = '\0';
    if (xmldb_get_cstring(value, sizeof value, entry_path(path, root, n, "name")) != KORV_OK || value[0])
        return KORV_OK;
    pathf(path, sizeof path, "%s/id:%d", root, n);
    DBG_AS(func, 1, "discover and remove ghost entry at PATH: %s", path);
    if (xmldb_delete_node(path) != KORV_OK) {
        DBG_AS(func, 0, "xmldbc_delete(%s) failed", path);
        return ERR_DB_WRITE;
    }
    return KORV_OK;
}

int xmldb_conf::find_entry(const char *func, const Keyed &list, const char *value, const char *not_found_fmt,
                           int not_found_level)
{
    int n = 0;
    int rc = _search_xmldb_id_entry(&n, list.root, list.max, list.key, value);
    switch (rc) {
    case ID_ENTRY_FOUND:
        return n;
    case ID_ENTRY_NOT_FOUND:
        DBG_AS(func, not_found_level, not_found_fmt, value);
        return ERR_NOT_FOUND;
    case ERR_PARAM:
        DBG_AS(func, 0, "_search_xmldb_id_entry failed");
        return ERR_DB_WRITE;
    default:
        DBG_AS(func, 0, "IT SHOULD NEVER BE HERE, func_ret = %d", rc);
        return ERR_DB_WRITE;
    }
}

int xmldb_conf::check_entry(const char *func, const char *root, int max, const char *key, const char *value)
{
    for (int n = 1; n <= max; n++) {
        char got[kKeyLen];
        if (!read_key(root, n, key, got)) {
            char path[kPathLen];
            DBG_AS(func, 1, "xmldbc_get(%s) failed", entry_path(path, root, n, key));
            return 0;
        }
        if (std::strcmp(got, value) == 0)
            return 1;
    }
    return ERR_NO_ROOM;
}

int xmldb_conf::free_number(const char *func, const char *root, const char *field, int capacity, int *out,
                            const char *found_fmt)
{
    std::vector<bool> used(capacity, false);
    // One past the capacity, so a list that somehow holds more still stops.
    for (int n = 1; n <= capacity + 1; n++) {
        char path[kPathLen];
        int32_t v = 0;
        if (xmldb_get_int32_t(&v, entry_path(path, root, n, field)) != KORV_OK) {
            DBG_AS(func, 2, "get free devid break at %d", n);
            break;
        }
        if (v >= 0 && v < capacity)
            used[v] = true;
    }
    for (int id = 0; id < capacity; id++) {
        if (!used[id]) {
            *out = id;
            DBG_AS(func, 2, found_fmt, id);
            return KORV_OK;
        }
    }
    *out = -1;
    DBG_AS(func, 0, "can not get free devid");
    return ERR_NO_ROOM;
}

int xmldb_conf::read_count(const char *path, int capacity)
{
    int32_t count = 0;
    if (xmldb_get_int32_t(&count, path) != KORV_OK || count < 0)
        return 0;
    return count < capacity ? count : capacity;
}

int xmldb_conf::write_fields(const char *func, const char *root, int n, std::initializer_list<FieldWrite> fields)
{
    for (const FieldWrite &f : fields) {
        char path[kPathLen];
        entry_path(path, root, n, f.field);
        int rc;
        if (f.text)
            rc = xmldb_set_cstring(f.text, path);
        else if (f.u64)
            rc = xmldb_set_uint64_t(static_cast<uint64_t>(f.number), path);
        else
            rc = xmldb_set_int32_t(static_cast<int32_t>(f.number), path);
        if (rc == KORV_OK)
            continue;
        if (f.text)
            DBG_AS(func, 0, f.fail, path, f.text);
        else if (f.u64)
            DBG_AS(func, 0, f.fail, path, static_cast<unsigned long long>(f.number));
        else
            DBG_AS(func, 0, f.fail, path, static_cast<int>(f.number));
        return ERR_DB_WRITE;
    }
    return KORV_OK;
}

int xmldb_conf::delete_entry(const char *func, const char *root, int n, int (*dec_count)(void))
{
    char path[kPathLen];
    pathf(path, sizeof path, "%s/id:%d", root, n);
    if (xmldb_delete_node(path) != KORV_OK) {
        DBG_AS(func, 0, "xmldb_delete_node(%s) failed", path);
        return ERR_DB_WRITE;
    }
    return dec_count();
}

int xmldb_conf::find_in(const char *func, const Keyed &list, const char *value)
{
    int n = 0;
    int rc = _search_xmldb_id_entry(&n, list.root, list.max, list.key, value);
    if (rc == ID_ENTRY_FOUND)
        return n;
    if (rc == ID_ENTRY_NOT_FOUND) {
        DBG_AS(func, 2, "can not find %s", value);
        return ERR_NOT_FOUND;
    }
    DBG_AS(func, 0, "db failed");
    return ERR_DB_WRITE;
}

int xmldb_conf::remove_compact(const char *func, const char *root, int n, int max, const char *key,
                               std::initializer_list<const char *> fields)
{
    int last = _cal_xmldb_id_entry_count(root, max, key);
    char path[kPathLen];
    if (last > n) {
        for (const char *field : fields) {
            char value[kKeyLen] = "";
            if (xmldb_get_cstring(value, sizeof value, entry_path(path, root, last, field)) != KORV_OK ||
                xmldb_set_cstring(value, entry_path(path, root, n, field)) != KORV_OK) {
                DBG_AS(func, 0, "del node %s failed", path);
                return ERR_DB_WRITE;
            }
        }
        n = last;
    }
    pathf(path, sizeof path, "%s/id:%d", root, n);
    if (xmldb_delete_node(path) != KORV_OK) {
        DBG_AS(func, 0, "del node %s failed", path);
        return ERR_DB_WRITE;
    }
    return KORV_OK;
}

int xmldb_conf::find_or_free(const char *root, int max, const char *key, const char *value, bool *is_new)
{
    for (int n = 1; n <= max; n++) {
        char got[kKeyLen];
        int rc = KORV_OK;
        if (!read_key(root, n, key, got, &rc)) {
            if (is_new)
                *is_new = rc == KORV_OK;
            return rc == KORV_OK ? n : rc;
        }
        if (strnlen(got, sizeof got) < sizeof got - 1 && std::strcmp(got, value) == 0)
            return n;
    }
    return ERR_NO_ROOM;
}
