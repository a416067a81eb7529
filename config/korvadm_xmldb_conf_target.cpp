// SPDX-License-Identifier: Apache-2.0
// Targets: add, delete, lookups, single fields, CHAP, recount, connections.
#include <cstdint>
#include <cstring>

#include "common/korvadm_err.h"
#include "config/korvadm_utils_db.h"
#include "config/korvadm_xmldb_conf_internal.h"
#include "platform/xmldbc.h"

using namespace xmldb_conf;

namespace {
constexpr const char *kStatusNoExistence = "No Existence";
constexpr const char *kStatusInactive = "Inactive";
}  // namespace

int xmldb_conf::find_target(const char *func, const char *name)
{
    return find_entry(func, kTargets, name, "can not find %s in xmldb target entry", 2);
}

namespace {
// Path of the named target's field for a field operation: the target's
// entry number, or its code.
int target_field(const char *func, const char *name, const char *field, char (&path)[kPathLen])
{
    PARAM_GUARD_AS(func, !name);
    int n = find_target(func, name);
    if (n >= 1)
        target_path(path, n, field);
    return n;
}

int get_target_int(const char *func, int *out, const char *name, const char *field)
{
    PARAM_GUARD_AS(func, !out);
    char path[kPathLen];
    if (int n = target_field(func, name, field, path); n < 1)
        return n;
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
    char path[kPathLen];
    if (int n = target_field(func, name, field, path); n < 1)
        return n;
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
    PARAM_GUARD(!name);
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
    PARAM_GUARD(!name);
    // No target is named "": a plain "no", so callers testing the result as a
    // truth value are not told it exists.
    return name[0] && xmldb_check_add_target(name) == 1 ? 1 : 0;
}

int xmldb_check_add_target(const char *name)
{
    PARAM_GUARD(!name || !name[0]);
    return check_entry(__func__, kTargetRoot, CONF_MAX_TARGETS, "name", name);
}

int xmldb_add_new_target(target_conf_t *conf)
{
    PARAM_GUARD(!conf);
    // Every check before the first write, so a refused record leaves no trace.
    const bool chap = conf->chap_enable == 1;
    // A name that fills the record's field would be cut by every reader.
    const char *invalid = !conf->name[0] || !fits<CONF_NAME_LEN>(conf->name) ? "target_suffix error"
                          : !conf->iqn[0]                            ? "IQN error"
                          : conf->tpgt < 0                           ? "TPGT error"
                          : conf->chap_enable != 0 && !chap          ? "enable_chap error"
                          : conf->hba_id < 0                         ? "hba_id error"
                          : chap && !conf->chap_name[0]              ? "chap_name error"
                          : chap && !conf->chap_pwd[0]               ? "chap_password error"
                                                                     : nullptr;
    PARAM_GUARD(invalid, "%s", invalid);
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
    PARAM_GUARD(!name);
    int n = find_target(__func__, name);
    if (n < 1)
        return n;
    DBG(1, "update xmldb");
    // Later entries keep their numbers: a name scan then stops at this gap
    // until the management logic rewrites the list.
    return delete_entry(__func__, kTargetRoot, n, _xmldb_dec_target_count);
}

int xmldb_get_target_state(int *state, const char *name) { return get_target_int(__func__, state, name, "state"); }
int xmldb_set_target_state(int state, const char *name) { return set_target_int(__func__, state, name, "state"); }
int xmldb_get_target_tpgt(int *tpgt, const char *name) { return get_target_int(__func__, tpgt, name, "tpgt"); }
int xmldb_get_target_hba_id(int *hba_id, const char *name) { return get_target_int(__func__, hba_id, name, "hba_id"); }
int xmldb_set_target_hba_id(int hba_id, const char *name) { return set_target_int(__func__, hba_id, name, "hba_id"); }

int xmldb_get_free_target_hba_id(int *hba_id)
{
    PARAM_GUARD(!hba_id);
    return free_number(__func__, kTargetRoot, "hba_id", CONF_MAX_TARGETS, hba_id, "get free hba_id: %d");
}

int xmldb_get_target_iqn(char *buf, size_t size, const char *name)
{
    PARAM_GUARD(!buf || !name);
    PARAM_GUARD(size < CONF_IQN_LEN, "parameter length error");
    int n = _xmldb_get_target_dbidx_by_name(name);
    PARAM_GUARD(n < 1, "can not find %s", name);
    return get_target_text(__func__, n, "iqn", buf, size);
}

int xmldb_set_target_iqn(const char *iqn, const char *name)
{
    PARAM_GUARD(!iqn || !name);
    int n = _xmldb_get_target_dbidx_by_name(name);
    PARAM_GUARD(n < 1, "can not find %s", name);
    char path[kPathLen];
    if (xmldb_set_cstring(iqn, target_path(path, n, "iqn")) != KORV_OK) {
        DBG(0, "set %s failed", path);
        return ERR_DB_WRITE;
    }
    return KORV_OK;
}

int xmldb_set_target_chap(int chap_enable, const char *chap_name, const char *chap_pwd, const char *name)
{
    PARAM_GUARD((chap_enable != 0 && chap_enable != 1) || !name ||
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

    return remove_ghost(__func__, kTargetRoot, count + 1);
}

int xmldb_get_target_status(char *buf, size_t size, const char *name)
{
    PARAM_GUARD(!buf || !name);
    PARAM_GUARD(size < CONF_NAME_LEN, "parameter length error");
    int n = find_target(__func__, name);
    if (n < 1)
        return n;
    return get_target_text(__func__, n, "status", buf, size);
}

int xmldb_set_target_status(const char *status, const char *name)
{
    PARAM_GUARD(!status || !name);
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

int xmldb_clean_target_conf(void)
{
    if (xmldb_delete_node(kTargetRoot) != KORV_OK)
        DBG(0, "xmldb_delete_node(%s) failed", kTargetRoot);
    return KORV_OK;
}

int xmldb_del_target_conn_info(const char *name)
{
    PARAM_GUARD(!name);
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
    PARAM_GUARD(!name || !ip || !iqn);
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

