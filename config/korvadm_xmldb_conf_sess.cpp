// SPDX-License-Identifier: Apache-2.0
// Session access records: per initiator seen in a session, which LUNs it
// accessed and with what result ("/iscsi/sess/initiator").
#include <cstdint>

#include "common/korvadm_err.h"
#include "config/korvadm_utils_db.h"
#include "config/korvadm_xmldb_conf_internal.h"

using namespace xmldb_conf;

namespace {

int recount(const char *func, const char *root, int max, const char *key, const char *msg)
{
    char path[kPathLen];
    int count = _cal_xmldb_id_entry_count(root, max, key);
    if (xmldb_set_int32_t(count, pathf(path, sizeof path, "%s/count", root)) != KORV_OK) {
        DBG_AS(func, 0, "xmldbc_set() failed");
        return ERR_DB_WRITE;
    }
    DBG_AS(func, 1, msg, count);
    return KORV_OK;
}

int set_logged(const char *func, const char *path, const char *value)
{
    DBG_AS(func, 2, "set %s=%s", path, value);
    if (xmldb_set_cstring(value, path) != KORV_OK) {
        DBG_AS(func, 0, "xmldb_set_cstring(%s) failed", path);
        return ERR_DB_WRITE;
    }
    return KORV_OK;
}

}  // namespace

int xmldb_update_sess_acl_lun_access_status(const char *initiator, const char *lun_name, unsigned status)
{
    PARAM_GUARD(!initiator || !lun_name || !initiator[0] || !lun_name[0] || !fits<CONF_IQN_LEN>(initiator) ||
                   !fits<CONF_NAME_LEN>(lun_name));
    char path[kPathLen];
    int s = find_or_free(kSessions.root, kSessions.max, kSessions.key, initiator);
    if (s < 1) {
        DBG(0, "get free sess acl idx error");
        return -1;
    }
    if (set_logged(__func__, entry_path(path, kSessions.root, s, "name"), initiator) != KORV_OK)
        return ERR_DB_WRITE;
    if (recount("_xmldb_update_sess_acl_cnt", kSessions.root, kSessions.max, kSessions.key,
                "total sess acl's entry count =%d") != KORV_OK)
        return ERR_DB_WRITE;

    char root[kPathLen];
    sub_root(root, kSessions.root, s, "access_lun");
    int a = find_or_free(root, CONF_MAX_LUNS, "lun_name", lun_name);
    if (a < 1) {
        DBG(0, "get free acl_mapped_lun_idx error");
        return -1;
    }
    char value[16];
    std::snprintf(value, sizeof value, "%u", status);
    if (set_logged(__func__, entry_path(path, root, a, "lun_name"), lun_name) != KORV_OK ||
        set_logged(__func__, entry_path(path, root, a, "access_status"), value) != KORV_OK)
        return ERR_DB_WRITE;
    if (recount("_xmldb_update_sess_acl_acc_lun_cnt", root, CONF_MAX_LUNS, "lun_name",
                "total sess acl access lun's entry count = %d") != KORV_OK)
        return ERR_DB_WRITE;
    return KORV_OK;
}
