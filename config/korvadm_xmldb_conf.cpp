// The configuration store on the configuration database: scanner, counters,
// target schema, service settings and the operations table.
#include "config/korvadm_xmldb_conf.h"

#include <climits>
#include <cstddef>
#include <initializer_list>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "common/korvadm_err.h"
#include "common/korvadm_log.h"
#include "config/korvadm_utils.h"
#include "platform/platform_util.h"
#include "platform/xmldbc.h"

// An operation's argument guard: logged under the operation, -9989.
#define PARAM_ERROR_IF(refused)        \
    do {                               \
        if (refused) {                 \
            DBG(0, "parameter error"); \
            return ERR_PARAM;          \
        }                              \
    } while (0)

namespace {

constexpr size_t kPathLen = 256;
constexpr const char *kTargetRoot = "/iscsi/target";
constexpr const char *kTargetCount = "/iscsi/target/count";
constexpr const char *kStatusNoExistence = "No Existence";
constexpr const char *kStatusInactive = "Inactive";

__attribute__((format(printf, 3, 4))) const char *pathf(char *buf, size_t size, const char *fmt, ...)
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

// Reads entry N's key: true with a non-empty value; false when empty or unreadable.
// *param_error is set when the read refused its arguments.
bool read_key(const char *root, int id, const char *key, char (&value)[kPathLen], int *rc_out = nullptr)
{
    char path[kPathLen];
    entry_path(path, root, id, key);
    value[0] = '\0';
    int rc = xmldb_get_cstring(value, sizeof value, path);
    if (rc_out)
        *rc_out = rc;
    return rc == KORV_OK && value[0];
}

}  // namespace

/* ---------------------------------------------------------------------------
 * Numbered-entry scanner
 * ------------------------------------------------------------------------- */

int _search_xmldb_id_entry(int *out_id, const char *root, int max, const char *key, const char *value)
{
    PARAM_ERROR_IF(!out_id || !root || !key || !value);
    *out_id = 0;
    for (int n = 1; n <= max; n++) {
        char got[kPathLen];
        if (!read_key(root, n, key, got))
            return ID_ENTRY_NOT_FOUND;
        if (std::strcmp(got, value) == 0) {
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
    char got[kPathLen];
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

/* ---------------------------------------------------------------------------
 * Targets
 * ------------------------------------------------------------------------- */

namespace {
// Entry number of a target for the single-field operations: >= 1, or the
// operation's result code, logged under the operation's name.
int find_target(const char *func, const char *name)
{
    int n = 0;
    int rc = _search_xmldb_id_entry(&n, kTargetRoot, CONF_MAX_TARGETS, "name", name);
    switch (rc) {
    case ID_ENTRY_FOUND:
        return n;
    case ERR_PARAM:
        DBG_AS(func, 0, "_search_xmldb_id_entry failed");
        return ERR_DB_WRITE;
    case ID_ENTRY_NOT_FOUND:
        DBG_AS(func, 2, "can not find %s in xmldb target entry", name);
        return ERR_NOT_FOUND;
    default:
        DBG_AS(func, 0, "IT SHOULD NEVER BE HERE, func_ret = %d", rc);
        return ERR_DB_WRITE;
    }
}

int get_target_int(const char *func, int *out, const char *name, const char *field)
{
    if (!out || !name) {
        DBG_AS(func, 0, "parameter error");
        return ERR_PARAM;
    }
    int n = find_target(func, name);
    if (n < 1)
        return n;
    char path[kPathLen];
    target_path(path, n, field);
    int32_t v = 0;
    int rc = xmldb_get_int32_t(&v, path);
    if (rc == ERR_INT_VALUE) {
        DBG_AS(func, 0, "get %s = %d => failed", path, v);
        return rc;
    }
    if (rc != KORV_OK) {
        DBG_AS(func, 0, "get %s failed", path);
        return rc;
    }
    *out = v;
    return KORV_OK;
}

int set_target_int(const char *func, int value, const char *name, const char *field)
{
    if (!name) {
        DBG_AS(func, 0, "parameter error");
        return ERR_PARAM;
    }
    int n = find_target(func, name);
    if (n < 1)
        return n;
    char path[kPathLen];
    target_path(path, n, field);
    if (xmldb_set_int32_t(value, path) != KORV_OK) {
        DBG_AS(func, 0, "set %s = %d failed", path, value);
        return ERR_DB_WRITE;
    }
    return KORV_OK;
}

int get_target_text(const char *func, int n, const char *field, char *buf, size_t size)
{
    char path[kPathLen];
    target_path(path, n, field);
    buf[0] = '\0';
    int rc = xmldb_get_cstring(buf, size, path);
    if (rc != KORV_OK)
        DBG_AS(func, 0, "get %s failed", path);
    return rc;
}
}  // namespace

int _xmldb_get_target_dbidx_by_name(const char *name)
{
    PARAM_ERROR_IF(!name);
    int n = 0;
    int rc = _search_xmldb_id_entry(&n, kTargetRoot, CONF_MAX_TARGETS, "name", name);
    if (rc == ID_ENTRY_FOUND)
        return n;
    if (rc == ID_ENTRY_NOT_FOUND) {
        DBG(2, "can not find %s in xmldb target entry", name);
        return ERR_NOT_FOUND;
    }
    return ERR_DB_WRITE;
}

int xmldb_check_target_exist(const char *name)
{
    PARAM_ERROR_IF(!name);
    // No target is named "": a plain "no", so callers testing the result as a
    // truth value are not told it exists.
    return name[0] && xmldb_check_add_target(name) == 1 ? 1 : 0;
}

int xmldb_check_add_target(const char *name)
{
    PARAM_ERROR_IF(!name || !name[0]);
    for (int n = 1; n <= CONF_MAX_TARGETS; n++) {
        char path[kPathLen];
        char got[kPathLen] = "";
        target_path(path, n, "name");
        if (xmldb_get_cstring(got, sizeof got, path) != KORV_OK || !got[0]) {
            DBG(1, "xmldbc_get(%s) failed", path);
            return 0;
        }
        if (std::strcmp(got, name) == 0)
            return 1;
    }
    return ERR_NO_ROOM;
}

int xmldb_add_new_target(target_conf_t *conf)
{
    PARAM_ERROR_IF(!conf);
    // Every check before the first write, so a refused record leaves no trace.
    const bool chap = conf->chap_enable == 1;
    const char *invalid = !conf->name[0]                             ? "target_suffix error"
                          : !conf->iqn[0]                            ? "IQN error"
                          : conf->tpgt < 0                           ? "TPGT error"
                          : conf->chap_enable != 0 && !chap          ? "enable_chap error"
                          : conf->hba_id < 0                         ? "hba_id error"
                          : chap && !conf->chap_name[0]              ? "chap_name error"
                          : chap && !conf->chap_pwd[0]               ? "chap_password error"
                                                                     : nullptr;
    if (invalid) {
        DBG(0, "%s", invalid);
        return ERR_PARAM;
    }
    int n = 0;
    int rc = _get_free_xmldb_id_entry(&n, kTargetRoot, CONF_MAX_TARGETS, "name");
    if (rc == ID_ENTRY_NOT_FOUND) {
        DBG(0, "the maximum number of targets has reached");
        return ERR_NO_ROOM;
    }
    if (rc != ID_ENTRY_FOUND) {
        DBG(0, "conf error");
        return ERR_DB_WRITE;
    }
    conf->dbidx = n;

    // Bounded copies: a record filled by hand may lack its terminators.
    char name[CONF_NAME_LEN], iqn[CONF_IQN_LEN], chap_name[CONF_NAME_LEN], chap_pwd[CONF_NAME_LEN];
    std::snprintf(name, sizeof name, "%.*s", static_cast<int>(sizeof name - 1), conf->name);
    std::snprintf(iqn, sizeof iqn, "%.*s", static_cast<int>(sizeof iqn - 1), conf->iqn);
    std::snprintf(chap_name, sizeof chap_name, "%.*s", static_cast<int>(sizeof chap_name - 1), conf->chap_name);
    std::snprintf(chap_pwd, sizeof chap_pwd, "%.*s", static_cast<int>(sizeof chap_pwd - 1), conf->chap_pwd);

    char path[kPathLen];
    struct TextField { const char *field; const char *value; const char *fail; bool on; };
    struct IntField { const char *field; int value; const char *fail; };
    const TextField head[] = {
        {"name", name, "set target suffix %s = %s failed", true},
        {"iqn", iqn, "set target iqn %s = %s failed", true},
    };
    const IntField ints[] = {
        {"tpgt", conf->tpgt, "set target tpgt %s = %d failed"},
        {"hba_id", conf->hba_id, "set target hba_id %s = %d failed"},
        {"state", conf->state, "set target state %s = %d failed"},
        {"chap_enable", conf->chap_enable, "set target enable_chap %s = %d failed"},
    };
    const TextField chap_fields[] = {
        {"chap_name", chap_name, "set target chap_name %s = %s failed", chap},
        {"chap_pwd", chap_pwd, "set target chap_password %s = %s failed", chap},
    };
    for (const auto &f : head) {
        if (xmldb_set_cstring(f.value, target_path(path, n, f.field)) != KORV_OK) {
            DBG(0, f.fail, path, f.value);
            return ERR_DB_WRITE;
        }
    }
    for (const auto &f : ints) {
        if (xmldb_set_int32_t(f.value, target_path(path, n, f.field)) != KORV_OK) {
            DBG(0, f.fail, path, f.value);
            return ERR_DB_WRITE;
        }
    }
    for (const auto &f : chap_fields) {
        if (f.on && xmldb_set_cstring(f.value, target_path(path, n, f.field)) != KORV_OK) {
            DBG(0, f.fail, path, f.value);
            return ERR_DB_WRITE;
        }
    }
    if (xmldb_set_int32_t(0, target_path(path, n, "map_lun/count")) != KORV_OK) {
        DBG(0, "set target mapped lun count %s = %d failed", path, 0);
        return ERR_DB_WRITE;
    }
    if (_xmldb_inc_target_count() != KORV_OK) {
        DBG(0, "increment target count failed");
        return ERR_DB_WRITE;
    }
    return KORV_OK;
}

int xmldb_del_target_by_name(const char *name)
{
    PARAM_ERROR_IF(!name);
    int n = find_target(__func__, name);
    if (n < 1)
        return n;
    DBG(1, "update xmldb");
    char path[kPathLen];
    pathf(path, sizeof path, "%s/id:%d", kTargetRoot, n);
    // Later entries keep their numbers: a name scan then stops at this gap
    // until the management logic rewrites the list.
    if (xmldb_delete_node(path) != KORV_OK) {
        DBG(0, "xmldb_delete_node(%s) failed", path);
        return ERR_DB_WRITE;
    }
    return _xmldb_dec_target_count();
}

int xmldb_get_target_state(int *state, const char *name) { return get_target_int(__func__, state, name, "state"); }
int xmldb_set_target_state(int state, const char *name) { return set_target_int(__func__, state, name, "state"); }
int xmldb_get_target_tpgt(int *tpgt, const char *name) { return get_target_int(__func__, tpgt, name, "tpgt"); }
int xmldb_get_target_hba_id(int *hba_id, const char *name) { return get_target_int(__func__, hba_id, name, "hba_id"); }
int xmldb_set_target_hba_id(int hba_id, const char *name) { return set_target_int(__func__, hba_id, name, "hba_id"); }

int xmldb_get_free_target_hba_id(int *hba_id)
{
    PARAM_ERROR_IF(!hba_id);
    bool used[CONF_MAX_TARGETS] = {};
    // One past the capacity, so a list that somehow holds more still stops.
    for (int n = 1; n <= CONF_MAX_TARGETS + 1; n++) {
        char path[kPathLen];
        int32_t v = 0;
        if (xmldb_get_int32_t(&v, target_path(path, n, "hba_id")) != KORV_OK) {
            DBG(2, "get free devid break at %d", n);
            break;
        }
        if (v >= 0 && v < CONF_MAX_TARGETS)
            used[v] = true;
    }
    for (int id = 0; id < CONF_MAX_TARGETS; id++) {
        if (!used[id]) {
            *hba_id = id;
            DBG(2, "get free hba_id: %d", id);
            return KORV_OK;
        }
    }
    *hba_id = -1;
    DBG(0, "can not get free devid");
    return ERR_NO_ROOM;
}

int xmldb_get_target_iqn(char *buf, size_t size, const char *name)
{
    PARAM_ERROR_IF(!buf || !name);
    if (size < CONF_IQN_LEN) {
        DBG(0, "parameter length error");
        return ERR_PARAM;
    }
    int n = _xmldb_get_target_dbidx_by_name(name);
    if (n < 1) {
        DBG(0, "can not find %s", name);
        return ERR_PARAM;
    }
    return get_target_text(__func__, n, "iqn", buf, size);
}

int xmldb_set_target_iqn(const char *iqn, const char *name)
{
    PARAM_ERROR_IF(!iqn || !name);
    int n = _xmldb_get_target_dbidx_by_name(name);
    if (n < 1) {
        DBG(0, "can not find %s", name);
        return ERR_PARAM;
    }
    char path[kPathLen];
    if (xmldb_set_cstring(iqn, target_path(path, n, "iqn")) != KORV_OK) {
        DBG(0, "set %s failed", path);
        return ERR_DB_WRITE;
    }
    return KORV_OK;
}

int xmldb_set_target_chap(int chap_enable, const char *chap_name, const char *chap_pwd, const char *name)
{
    PARAM_ERROR_IF((chap_enable != 0 && chap_enable != 1) || !name ||
                   (chap_enable == 1 && (!chap_name || !chap_pwd)));
    int n = _xmldb_get_target_dbidx_by_name(name);
    if (n < 1) {
        DBG(0, "get target db index failed, return code = %d", n);
        return n;
    }
    char path[kPathLen];
    if (xmldb_set_int32_t(chap_enable, target_path(path, n, "chap_enable")) != KORV_OK) {
        DBG(0, "set target enable_chap %s = %d failed", path, chap_enable);
        return ERR_DB_WRITE;
    }
    if (chap_enable) {
        if (xmldb_set_cstring(chap_name, target_path(path, n, "chap_name")) != KORV_OK) {
            DBG(0, "set target chap_name %s = %s failed", path, chap_name);
            return ERR_DB_WRITE;
        }
        if (xmldb_set_cstring(chap_pwd, target_path(path, n, "chap_pwd")) != KORV_OK) {
            DBG(0, "set target chap_password %s = %s failed", path, chap_pwd);
            return ERR_DB_WRITE;
        }
        return KORV_OK;
    }
    if (xmldb_set_cstring("", target_path(path, n, "chap_name")) != KORV_OK) {
        DBG(0, "set target chap_name %s empty failed", path);
        return ERR_DB_WRITE;
    }
    if (xmldb_set_cstring("", target_path(path, n, "chap_pwd")) != KORV_OK) {
        DBG(0, "set target chap_password %s empty failed", path);
        return ERR_DB_WRITE;
    }
    return KORV_OK;
}

int xmldb_update_current_targetcnt(void)
{
    int count = 0;
    int running = 0;
    for (int n = 1; n <= CONF_MAX_TARGETS; n++) {
        char path[kPathLen];
        char value[kPathLen] = "";
        if (xmldbc_get_wb(XMLDB_SOCK_ISCSI, 0, target_path(path, n, "name"), value, sizeof value) <= 0 || !value[0])
            continue;
        count++;
        value[0] = '\0';
        if (xmldb_get_cstring(value, sizeof value, target_path(path, n, "status")) == KORV_OK && value[0] &&
            std::strcmp(value, kStatusNoExistence) != 0 && std::strcmp(value, kStatusInactive) != 0)
            running++;
    }
    if (xmldb_set_int32_t(count, kTargetCount) != KORV_OK) {
        DBG(0, "xmldbc_set() failed");
        return ERR_DB_WRITE;
    }
    DBG(1, "total entry=%d", count);
    if (xmldb_set_int32_t(running, "/iscsi/target/running_count") != KORV_OK) {
        DBG(0, "xmldbc_set() failed");
        return ERR_DB_WRITE;
    }
    DBG(1, "total running entry=%d", running);

    // A ghost is what an interrupted delete leaves: a status right after the
    // last counted target. Only that one position is checked, and its name is
    // not: in a list with a gap, the target at count + 1 goes too.
    char path[kPathLen];
    char status[kPathLen] = "";
    if (xmldb_get_cstring(status, sizeof status, target_path(path, count + 1, "status")) == KORV_OK && status[0]) {
        pathf(path, sizeof path, "%s/id:%d", kTargetRoot, count + 1);
        DBG(1, "discover and remove ghost entry at PATH: %s", path);
        if (xmldb_delete_node(path) != KORV_OK) {
            DBG(0, "xmldbc_delete(%s) failed", path);
            return ERR_DB_WRITE;
        }
    }
    return KORV_OK;
}

int xmldb_get_target_status(char *buf, size_t size, const char *name)
{
    PARAM_ERROR_IF(!buf || !name);
    if (size < CONF_NAME_LEN) {
        DBG(0, "parameter length error");
        return ERR_PARAM;
    }
    int n = find_target(__func__, name);
    if (n < 1)
        return n;
    return get_target_text(__func__, n, "status", buf, size);
}

int xmldb_set_target_status(const char *status, const char *name)
{
    PARAM_ERROR_IF(!status || !name);
    int n = find_target(__func__, name);
    if (n < 1)
        return n;
    char path[kPathLen];
    if (xmldb_set_cstring(status, target_path(path, n, "status")) != KORV_OK) {
        DBG(0, "set %s = %s failed", path, status);
        return ERR_DB_WRITE;
    }
    return KORV_OK;
}

namespace {
// Fills conf from entry n, whose name the caller has read; `full` adds every
// field beyond name and tpgt.
int fill_target_conf(const char *func, target_conf_t *conf, int n, bool full)
{
    char path[kPathLen];
    int rc = KORV_OK;
    conf->dbidx = n;
    struct IntField { const char *field; int32_t *out; const char *fail; bool on; };
    const IntField ints[] = {
        {"tpgt", &conf->tpgt, full ? "get target tpgt error" : "get tpgt error", true},
        {"hba_id", &conf->hba_id, "get target hba_id error", full},
        {"state", &conf->state, "get target state error", full},
        {"chap_enable", &conf->chap_enable, "get target enable_chap error", full},
    };
    for (const auto &f : ints) {
        if (!f.on)
            continue;
        if ((rc = xmldb_get_int32_t(f.out, target_path(path, n, f.field))) != KORV_OK) {
            DBG_AS(func, 0, "%s", f.fail);
            *f.out = -1;
            return rc;
        }
    }
    if (!full)
        return KORV_OK;
    if ((rc = xmldb_get_cstring(conf->iqn, sizeof conf->iqn, target_path(path, n, "iqn"))) != KORV_OK) {
        DBG_AS(func, 0, "get %s failed", path);
        return rc;
    }
    if (conf->chap_enable == 1) {
        if ((rc = xmldb_get_cstring(conf->chap_name, sizeof conf->chap_name, target_path(path, n, "chap_name"))) !=
            KORV_OK) {
            DBG_AS(func, 0, "get target chap_name error");
            return rc;
        }
        if ((rc = xmldb_get_cstring(conf->chap_pwd, sizeof conf->chap_pwd, target_path(path, n, "chap_pwd"))) !=
            KORV_OK) {
            DBG_AS(func, 0, "get target chap_password error");
            return rc;
        }
    }
    if ((rc = xmldb_get_cstring(conf->status, sizeof conf->status, target_path(path, n, "status"))) != KORV_OK) {
        DBG_AS(func, 0, "get %s failed", path);
        return rc;
    }
    return KORV_OK;
}

// Reads entries 1..64 up to the first empty name into a private list, handed
// to the caller only when every entry read: a reader never sees half a set.
int read_all_targets(const char *func, list_t *out, bool full)
{
    if (!out) {
        DBG_AS(func, 0, "parameter error");
        return ERR_PARAM;
    }
    list_t got;
    list_init(&got);
    int rc = KORV_OK;
    for (int n = 1; n <= CONF_MAX_TARGETS; n++) {
        char name[kPathLen];
        int read_rc = KORV_OK;
        if (!read_key(kTargetRoot, n, "name", name, &read_rc)) {
            if (read_rc != KORV_OK) {
                char path[kPathLen];
                DBG_AS(func, 0, "xmldbc_get(%s) failed", target_path(path, n, "name"));
                rc = read_rc;
            }
            break;
        }
        target_conf_t *conf = target_conf_new();
        if (!conf) {
            DBG_AS(func, 0, "new t_conf failed error");
            rc = ERR_NO_MEMORY;
            break;
        }
        list_append(&conf->node, &got);
        std::snprintf(conf->name, sizeof conf->name, "%s", name);
        if ((rc = fill_target_conf(func, conf, n, full)) != KORV_OK)
            break;
    }
    if (rc != KORV_OK) {
        target_conf_free_list(&got);
        return rc;
    }
    for (target_conf_t *conf : korv::list_records<target_conf_t>(&got)) {
        list_remove(&conf->node);
        list_append(&conf->node, out);
    }
    return KORV_OK;
}
}  // namespace

int xmldb_get_target_conf_by_name(target_conf_t *conf, const char *name)
{
    PARAM_ERROR_IF(!conf || !name);
    int n = find_target(__func__, name);
    if (n < 1)
        return n;
    std::snprintf(conf->name, sizeof conf->name, "%s", name);
    return fill_target_conf(__func__, conf, n, true);
}

int xmldb_get_all_target_conf_lite(list_t *list)
{
    return read_all_targets(__func__, list, false);
}

int xmldb_get_all_target_conf(list_t *list)
{
    return read_all_targets(__func__, list, true);
}

int xmldb_clean_target_conf(void)
{
    if (xmldb_delete_node(kTargetRoot) != KORV_OK)
        DBG(0, "xmldb_delete_node(%s) failed", kTargetRoot);
    return KORV_OK;
}

int xmldb_del_target_conn_info(const char *name)
{
    PARAM_ERROR_IF(!name);
    int n = 0;
    if (_search_xmldb_id_entry(&n, kTargetRoot, CONF_MAX_TARGETS, "name", name) != ID_ENTRY_FOUND || n < 1)
        return ID_ENTRY_NOT_FOUND;
    char path[kPathLen];
    if (xmldb_delete_node(target_path(path, n, "conn_info")) != KORV_OK) {
        DBG(0, "xmldb_delete_node(%s) failed", path);
        return ERR_DB_WRITE;
    }
    return KORV_OK;
}

int xmldb_set_target_conn_info(const char *name, int conn, const char *ip, const char *iqn)
{
    PARAM_ERROR_IF(!name || !ip || !iqn);
    int n = 0;
    if (_search_xmldb_id_entry(&n, kTargetRoot, CONF_MAX_TARGETS, "name", name) != ID_ENTRY_FOUND || n < 1)
        return ID_ENTRY_NOT_FOUND;
    char path[kPathLen];
    pathf(path, sizeof path, "%s/id:%d/conn_info/conn:%d/ip", kTargetRoot, n, conn);
    if (xmldb_set_cstring(ip, path) != KORV_OK) {
        DBG(0, "set %s = %s failed", path, ip);
        return ERR_DB_WRITE;
    }
    pathf(path, sizeof path, "%s/id:%d/conn_info/conn:%d/iqn", kTargetRoot, n, conn);
    if (xmldb_set_cstring(iqn, path) != KORV_OK) {
        DBG(0, "set %s = %s failed", path, iqn);
        return ERR_DB_WRITE;
    }
    return KORV_OK;
}

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

// Saved-address slot of an interface: 1, 2, or 0 for a name with none.
int saved_addr_slot(const char *dev_name)
{
    if (std::strcmp(dev_name, "bond0") == 0 || std::strcmp(dev_name, "egiga0") == 0)
        return 1;
    if (std::strcmp(dev_name, "egiga1") == 0)
        return 2;
    return 0;
}

int get_saved_addr(const char *func, char *buf, size_t size, const char *dev_name, const char *fmt)
{
    if (!buf || !dev_name || !dev_name[0]) {
        DBG_AS(func, 0, "parameter error");
        return ERR_PARAM;
    }
    int slot = saved_addr_slot(dev_name);
    if (!slot) {
        DBG_AS(func, 0, "unknown interface %s", dev_name);
        return ERR_NOT_FOUND;
    }
    char path[kPathLen];
    pathf(path, sizeof path, fmt, slot);
    buf[0] = '\0';
    if (xmldb_get_cstring(buf, size, path) != KORV_OK)
        return ERR_DB_WRITE;
    return buf[0] ? KORV_OK : ERR_NOT_FOUND;
}

int set_saved_addr(const char *func, const char *addr, const char *dev_name, const char *fmt)
{
    if (!addr || !addr[0] || !dev_name || !dev_name[0]) {
        DBG_AS(func, 0, "parameter error");
        return ERR_PARAM;
    }
    int slot = saved_addr_slot(dev_name);
    if (!slot) {
        DBG_AS(func, 0, "unknown interface %s", dev_name);
        return ERR_NOT_FOUND;
    }
    char path[kPathLen];
    pathf(path, sizeof path, fmt, slot);
    DBG_AS(func, 2, "set %s = %s", path, addr);
    return xmldb_set_cstring(addr, path) == KORV_OK ? KORV_OK : ERR_DB_WRITE;
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
    PARAM_ERROR_IF(!pid);
    *pid = static_cast<int>(dbGetLL(kIsnsPid));
    return KORV_OK;
}

int xmldb_set_nesrad_pid(int pid)
{
    PARAM_ERROR_IF(pid < 0);
    dbSetLL(pid, kIsnsPid);
    DBG(2, "set nesrad pid = %d", pid);
    return KORV_OK;
}

int xmldb_get_nesrad_enable(int *enable)
{
    PARAM_ERROR_IF(!enable);
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
    PARAM_ERROR_IF(!buf || size == 0);
    std::memset(buf, 0, size);
    dbGetStr(buf, platform_size(size), kIsnsIp);
    return KORV_OK;
}

int xmldb_set_nesrad_ip(const char *ip)
{
    PARAM_ERROR_IF(!ip);
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
    PARAM_ERROR_IF(!ver);
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
    PARAM_ERROR_IF(!buf || size < kSavedHostNameLen);
    std::memset(buf, 0, size);
    if (xmldb_get_cstring(buf, size, kHostName) != KORV_OK) {
        DBG(0, "get saved host name error");
        return ERR_DB_WRITE;
    }
    return KORV_OK;
}

int xmldb_set_saved_host_name(const char *host_name)
{
    PARAM_ERROR_IF(!host_name);
    return xmldb_set_cstring(host_name, kHostName) == KORV_OK ? KORV_OK : ERR_DB_WRITE;
}

int xmldb_get_iqn_prefix(char *buf, size_t size)
{
    PARAM_ERROR_IF(!buf || size < CONF_GEN_IQN_LEN);
    buf[0] = '\0';
    if (xmldb_get_cstring(buf, size, kIqnPrefix) != KORV_OK) {
        DBG(0, "get saved iqn error");
        return ERR_DB_WRITE;
    }
    return KORV_OK;
}

int xmldb_set_iqn_prefix(const char *prefix)
{
    PARAM_ERROR_IF(!prefix);
    return xmldb_set_cstring(prefix, kIqnPrefix) == KORV_OK ? KORV_OK : ERR_DB_WRITE;
}

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

/* ---------------------------------------------------------------------------
 * The operations table. Designated initialisers follow the slot order, so a
 * slot in the wrong place does not compile. Slots of operations still to come
 * (LUNs, mappings, ACLs, sessions, volume totals) are NULL.
 * ------------------------------------------------------------------------- */

const iscsi_conf_ops_t iscsi_conf_ops = {
    .conf_type = 1,
    .xmldb_get_service_enable = xmldb_get_service_enable, /* 1 */
    .xmldb_set_service_enable = xmldb_set_service_enable,
    .xmldb_get_korvadm_ver = xmldb_get_korvadm_ver,
    .xmldb_set_korvadm_ver = xmldb_set_korvadm_ver,
    .xmldb_get_service_progress = xmldb_get_service_progress, /* 5 */
    .xmldb_set_service_progress = xmldb_set_service_progress,
    .xmldb_get_saved_host_name = xmldb_get_saved_host_name,
    .xmldb_set_saved_host_name = xmldb_set_saved_host_name,
    .xmldb_get_iqn_prefix = xmldb_get_iqn_prefix,
    .xmldb_set_iqn_prefix = xmldb_set_iqn_prefix, /* 10 */
    .xmldb_get_saved_ipv4_addr = xmldb_get_saved_ipv4_addr,
    .xmldb_set_saved_ipv4_addr = xmldb_set_saved_ipv4_addr,
    .xmldb_get_saved_ipv6_addr = xmldb_get_saved_ipv6_addr,
    .xmldb_set_saved_ipv6_addr = xmldb_set_saved_ipv6_addr,
    .xmldb_clean_saved_ip_addr = xmldb_clean_saved_ip_addr, /* 15 */
    .xmldb_get_debug_level = xmldb_get_debug_level,
    .xmldb_set_debug_level = xmldb_set_debug_level,
    .empty_18 = nullptr,
    .empty_19 = nullptr,
    .empty_20 = nullptr, /* 20 */
    .xmldb_add_new_target = xmldb_add_new_target,
    .xmldb_del_target_by_name = xmldb_del_target_by_name,
    .xmldb_check_target_exist = xmldb_check_target_exist,
    .xmldb_check_add_target = xmldb_check_add_target,
    .xmldb_get_target_state = xmldb_get_target_state, /* 25 */
    .xmldb_set_target_state = xmldb_set_target_state,
    .xmldb_get_target_tpgt = xmldb_get_target_tpgt,
    .empty_28 = nullptr,
    .xmldb_get_target_hba_id = xmldb_get_target_hba_id,
    .xmldb_set_target_hba_id = xmldb_set_target_hba_id, /* 30 */
    .xmldb_get_free_target_hba_id = xmldb_get_free_target_hba_id,
    .empty_32 = nullptr,
    .empty_33 = nullptr,
    .empty_34 = nullptr,
    .empty_35 = nullptr, /* 35 */
    .empty_36 = nullptr,
    .empty_37 = nullptr,
    .xmldb_get_target_iqn = xmldb_get_target_iqn,
    .xmldb_set_target_iqn = xmldb_set_target_iqn,
    .xmldb_set_target_chap = xmldb_set_target_chap, /* 40 */
    .empty_41 = nullptr,
    .empty_42 = nullptr,
    .empty_43 = nullptr,
    .xmldb_update_current_targetcnt = xmldb_update_current_targetcnt,
    .xmldb_get_target_status = xmldb_get_target_status, /* 45 */
    .xmldb_set_target_status = xmldb_set_target_status,
    .xmldb_get_target_conf_by_name = xmldb_get_target_conf_by_name,
    .xmldb_get_all_target_conf_lite = xmldb_get_all_target_conf_lite,
    .xmldb_get_all_target_conf = xmldb_get_all_target_conf,
    .xmldb_get_target_map_lun_conf = nullptr, /* 50 */
    .empty_51 = nullptr,
    .xmldb_clean_target_conf = xmldb_clean_target_conf,
    .xmldb_add_new_lun = nullptr,
    .xmldb_del_lun_by_name = nullptr,
    .xmldb_check_lun_exist = nullptr, /* 55 */
    .xmldb_check_add_lun = nullptr,
    .xmldb_get_lun_uuid = nullptr,
    .empty_58 = nullptr,
    .xmldb_get_lun_img_file = nullptr,
    .xmldb_get_lun_serial = nullptr, /* 60 */
    .xmldb_set_lun_serial = nullptr,
    .xmldb_get_lun_vol_state = nullptr,
    .xmldb_set_lun_vol_state = nullptr,
    .xmldb_get_lun_size = nullptr,
    .xmldb_set_lun_size = nullptr, /* 65 */
    .xmldb_get_lun_alloc_size = nullptr,
    .xmldb_set_lun_alloc_size = nullptr,
    .xmldb_get_lun_connect_state = nullptr,
    .xmldb_set_lun_connect_state = nullptr,
    .xmldb_get_free_lun_devid = nullptr, /* 70 */
    .empty_71 = nullptr,
    .empty_72 = nullptr,
    .xmldb_get_lun_prealloc = nullptr,
    .empty_74 = nullptr,
    .xmldb_get_lun_prealloc_state = nullptr, /* 75 */
    .xmldb_set_lun_prealloc_state = nullptr,
    .xmldb_set_lun_prealloc_progress = nullptr,
    .xmldb_get_lun_status = nullptr,
    .xmldb_set_lun_status = nullptr,
    .xmldb_get_all_lun_conf = nullptr, /* 80 */
    .xmldb_get_all_lun_conf_lite = nullptr,
    .xmldb_get_lun_conf_by_uuid = nullptr,
    .xmldb_get_lun_conf_by_name = nullptr,
    .xmldb_update_lun_current_count = nullptr,
    .xmldb_get_all_lun_conf_in_crash_conf = nullptr, /* 85 */
    .xmldb_check_acl_initiaor_exist = nullptr,
    .xmldb_check_acl_alias_exist = nullptr,
    .xmldb_check_add_acl_initiator = nullptr,
    .xmldb_add_acl_initiator = nullptr,
    .xmldb_del_acl_initiator = nullptr, /* 90 */
    .xmldb_get_all_acl_initiator_conf_lite = nullptr,
    .xmldb_set_lun_acl = nullptr,
    .empty_93 = nullptr,
    .xmldb_get_all_lun_acl_conf_from_lun = nullptr,
    .xmldb_remove_lun_from_all_acl = nullptr, /* 95 */
    .xmldb_update_current_aclcnt = xmldb_update_current_aclcnt,
    .xmldb_get_initiator_name_from_alias = nullptr,
    .xmldb_clean_acl_conf = nullptr,
    .xmldb_add_target_lun_map = nullptr,
    .empty_100 = nullptr, /* 100 */
    .xmldb_del_target_lun_map = nullptr,
    .xmldb_get_free_lun_num = nullptr,
    .xmldb_get_mapping_target = nullptr,
    .empty_104 = nullptr,
    .xmldb_update_total_vol_size_info = nullptr, /* 105 */
    .xmldb_get_nesrad_pid = xmldb_get_nesrad_pid,
    .xmldb_set_nesrad_pid = xmldb_set_nesrad_pid,
    .xmldb_get_nesrad_enable = xmldb_get_nesrad_enable,
    .xmldb_set_nesrad_enable = xmldb_set_nesrad_enable,
    .xmldb_get_nesrad_ip = xmldb_get_nesrad_ip, /* 110 */
    .xmldb_set_nesrad_ip = xmldb_set_nesrad_ip,
    .xmldb_clean_nesrad_conf = xmldb_clean_nesrad_conf,
    .xmldb_clean_sess_conf = xmldb_clean_sess_conf,
    .xmldb_update_sess_acl_lun_access_status = nullptr,
    .xmldb_save_conf = xmldb_save_conf, /* 115 */
    .xmldb_clean_conf = xmldb_clean_conf,
    .xmldb_set_temp_return_code = xmldb_set_temp_return_code,
    .xmldb_del_target_conn_info = xmldb_del_target_conn_info,
    .xmldb_set_target_conn_info = xmldb_set_target_conn_info,
};

// The table's shape is an interface: 119 pointer slots after the leading integer.
static_assert(offsetof(iscsi_conf_ops_t, xmldb_set_target_conn_info) ==
              offsetof(iscsi_conf_ops_t, xmldb_get_service_enable) + 118 * sizeof(void *));
static_assert(offsetof(iscsi_conf_ops_t, xmldb_add_new_target) ==
              offsetof(iscsi_conf_ops_t, xmldb_get_service_enable) + 20 * sizeof(void *));
static_assert(offsetof(iscsi_conf_ops_t, xmldb_update_total_vol_size_info) ==
              offsetof(iscsi_conf_ops_t, xmldb_get_service_enable) + 104 * sizeof(void *));
