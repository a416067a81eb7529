// The numbered-entry scanner every list of the store rests on, and the
// counters kept beside the lists.
#include <cstdint>
#include <cstring>

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
    PARAM_ERROR_IF(!out_id || !root || !key || !value);
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
    PARAM_ERROR_IF(!out_id || !root || !key);
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
    if (xmldb_get_int32_t(&count, path) != KORV_OK)
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
