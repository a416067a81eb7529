// SPDX-License-Identifier: Apache-2.0
// Target records: filling one, reading them all.
#include <cstdint>

#include "common/korvadm_err.h"
#include "config/korvadm_utils_db.h"
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

// Reads entries 1..64 up to the first empty name. A record that cannot be
// filled is skipped (the fill logged why); only a failure of the service
// fails the whole read, so the caller can tell an outage from bad data.
int read_all_targets(const char *func, list_t *out, bool full)
{
    PARAM_GUARD_AS(func, !out);
    static constexpr RecordKind<target_conf_t> kind{target_conf_new, target_conf_free, target_conf_free_list,
                                                    "new t_conf failed error"};
    return read_records(func, out, kind, kTargets, CONF_NAME_LEN, nullptr,
                        [&](target_conf_t *conf, const char *name) -> int {
                            korv::copy_bounded(conf->name, name);
                            return fill_target_conf(func, conf, conf->dbidx, full);
                        });
}
}  // namespace

int xmldb_get_target_conf_by_name(target_conf_t *conf, const char *name)
{
    PARAM_GUARD(!conf || !name || !fits<CONF_NAME_LEN>(name));
    int n = find_target(__func__, name);
    if (n < 1)
        return n;
    korv::copy_bounded(conf->name, name);
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

