// Target records: filling one, reading them all.
#include <cstdint>
#include <cstdio>

#include "common/korvadm_err.h"
#include "config/korvadm_utils.h"
#include "config/korvadm_xmldb_conf_internal.h"

using namespace xmldb_conf;

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
        std::snprintf(conf->name, sizeof conf->name, "%.*s", static_cast<int>(sizeof conf->name - 1), name);
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

