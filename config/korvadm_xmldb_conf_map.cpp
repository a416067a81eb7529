// SPDX-License-Identifier: Apache-2.0
// Mapping LUNs into targets. A mapping is kept twice: as an entry of the
// target's "map_lun" list and as the LUN's "target_name" and "lun_num".
#include <cstdint>
#include <cstring>

#include "common/korvadm_err.h"
#include "config/korvadm_utils_db.h"
#include "config/korvadm_xmldb_conf_internal.h"

using namespace xmldb_conf;

namespace {

// The target and the LUN of a mapping operation: both entry numbers, or the
// code of the first that is missing.
int find_pair(const char *func, const char *target_name, const char *lun_name, int *t, int *l)
{
    PARAM_GUARD_AS(func, !target_name || !target_name[0], "target_name error");
    PARAM_GUARD_AS(func, !lun_name || !lun_name[0], "lun_name error");
    if ((*t = find_target(func, target_name)) < 1)
        return *t;
    if ((*l = find_entry(func, kLuns, lun_name, "can not find %s in xmldb lun entry")) < 1)
        return *l;
    return KORV_OK;
}

template <size_t N>
const char *map_root(char (&buf)[N], int target)
{
    return sub_root(buf, kTargetRoot, target, "map_lun");
}

}  // namespace

int xmldb_get_free_lun_num(int *lun_num, const char *target_name)
{
    PARAM_GUARD(!lun_num || !target_name);
    int t = find_target(__func__, target_name);
    if (t < 1)
        return t;
    *lun_num = -1;
    char root[kPathLen], path[kPathLen];
    map_root(root, t);
    pathf(path, sizeof path, "%s/count", root);
    int32_t stored = 0;
    int rc = xmldb_get_int32_t(&stored, path);
    if (rc != KORV_OK && rc != ERR_INT_VALUE) {
        DBG(0, "xmldb_get_int32_t on %s", path);
        return ERR_DB_WRITE;
    }
    int count = read_count(path, CONF_MAX_MAP_LUNS);
    bool used[CONF_MAX_MAP_LUNS] = {};
    for (int m = 1; m <= count; m++) {
        int32_t num = -1;
        if (xmldb_get_int32_t(&num, entry_path(path, root, m, "lun_num")) == KORV_OK && num >= 0 &&
            num < CONF_MAX_MAP_LUNS)
            used[num] = true;
    }
    for (int num = 0; num < CONF_MAX_MAP_LUNS; num++) {
        if (!used[num]) {
            *lun_num = num;
            return KORV_OK;
        }
        DBG(2, "id_usage[%d]=%d", num, static_cast<int>(used[num]));
    }
    return ERR_NO_ROOM;
}

int xmldb_add_target_lun_map(const char *target_name, const char *lun_name, int lun_num)
{
    int t = 0, l = 0;
    int rc = find_pair(__func__, target_name, lun_name, &t, &l);
    if (rc != KORV_OK)
        return rc;
    PARAM_GUARD(lun_num < 0, "lun_num error");
    char root[kPathLen];
    map_root(root, t);
    int m = 0;
    rc = _get_free_xmldb_id_entry(&m, root, CONF_MAX_MAP_LUNS, "lun_name");
    if (rc == ID_ENTRY_NOT_FOUND) {
        DBG(0, "the Maximum number of target lun has reached");
        return ERR_NO_ROOM;
    }
    if (rc != ID_ENTRY_FOUND) {
        DBG(0, "conf error");
        return ERR_DB_WRITE;
    }
    rc = write_fields(__func__, root, m,
                      {{"lun_name", lun_name, 0, "set %s = %s failed"}, {"lun_num", nullptr, lun_num, "set %s = %d failed"}});
    if (rc == KORV_OK)
        rc = write_fields(__func__, kLuns.root, l,
                          {{"target_name", target_name, 0, "set %s = %s failed"},
                           {"lun_num", nullptr, lun_num, "set %s = %d failed"}});
    if (rc == KORV_OK)
        rc = _xmldb_inc_target_lun_map_cnt(t);
    if (rc == KORV_OK)
        return KORV_OK;
    // Undo the half that was written, so neither side names the other.
    char path[kPathLen];
    pathf(path, sizeof path, "%s/id:%d", root, m);
    xmldb_delete_node(path);
    xmldb_set_cstring("", entry_path(path, kLuns.root, l, "target_name"));
    return ERR_DB_WRITE;
}

int xmldb_del_target_lun_map(const char *target_name, const char *lun_name)
{
    int t = 0, l = 0;
    int rc = find_pair(__func__, target_name, lun_name, &t, &l);
    if (rc != KORV_OK)
        return rc;
    char root[kPathLen];
    map_root(root, t);
    int m = 0;
    if (_search_xmldb_id_entry(&m, root, CONF_MAX_MAP_LUNS, "lun_name", lun_name) != ID_ENTRY_FOUND) {
        DBG(0, "can not find lun %s in target map lun entry", lun_name);
        return ERR_NOT_FOUND;
    }
    // The entries after it stay visible: the map is read up to its first gap.
    if (remove_compact(__func__, root, m, CONF_MAX_MAP_LUNS, "lun_name", {"lun_name", "lun_num"}) != KORV_OK)
        return ERR_DB_WRITE;
    char path[kPathLen];
    if (xmldb_set_cstring("", entry_path(path, kLuns.root, l, "target_name")) != KORV_OK) {
        DBG(0, "set %s empty failed", path);
        return ERR_DB_WRITE;
    }
    return _xmldb_dec_target_lun_map_cnt(t);
}

int xmldb_get_mapping_target(char *target_name, size_t size, int *lun_num, const char *lun_name)
{
    PARAM_GUARD(!target_name || size == 0 || !lun_num);
    PARAM_GUARD(!lun_name || !lun_name[0], "lun name error");
    int l = find_entry(__func__, kLuns, lun_name, "can not find %s in xmldb lun entry");
    if (l < 1)
        return l;
    char path[kPathLen];
    target_name[0] = '\0';
    int rc = xmldb_get_cstring(target_name, size, entry_path(path, kLuns.root, l, "target_name"));
    if (rc != KORV_OK) {
        DBG(0, "get mapping target failed, func_ret = %d", rc);
        return rc;
    }
    int32_t num = -1;
    rc = xmldb_get_int32_t(&num, entry_path(path, kLuns.root, l, "lun_num"));
    if (rc != KORV_OK) {
        DBG(0, "get lun_num failed, func_ret = %d", rc);
        *lun_num = -1;
        return rc;
    }
    *lun_num = num;
    return KORV_OK;
}

int xmldb_get_target_map_lun_conf(const char *target_name, list_t *list)
{
    PARAM_GUARD(!target_name || !list);
    int t = find_entry(__func__, kTargets, target_name, "can not find target named : %s");
    if (t < 1)
        return t;
    char root[kPathLen];
    map_root(root, t);
    static constexpr RecordKind<target_map_lun_conf_t> kind{target_map_lun_conf_new, target_map_lun_conf_free,
                                                            target_map_lun_conf_free_list,
                                                            "new target_map_lun_conf_t failed"};
    return read_records(__func__, list, kind, {root, CONF_MAX_MAP_LUNS, "lun_name"}, CONF_NAME_LEN, nullptr,
                        [&](target_map_lun_conf_t *conf, const char *lun) -> int {
                            char path[kPathLen];
                            int rc = xmldb_get_int32_t(&conf->lun_num, entry_path(path, root, conf->dbidx, "lun_num"));
                            if (rc != KORV_OK) {
                                DBG(0, "get config - lun_num failed");
                                return rc;
                            }
                            korv::copy_bounded(conf->target_name, target_name);
                            korv::copy_bounded(conf->lun_name, lun);
                            return KORV_OK;
                        });
}
