// SPDX-License-Identifier: Apache-2.0
// LUN records: filling one from its entry, reading one by name or volume
// UUID, reading them all.
#include <cstdint>
#include <cstring>

#include "common/korvadm_err.h"
#include "config/korvadm_utils_db.h"
#include "config/korvadm_xmldb_conf_internal.h"

using namespace xmldb_conf;

namespace {

// A number that may be missing: the field keeps its "unknown" value then.
// Only a failure of the service is an error.
template <class T, class Read>
int read_optional(const char *func, T *field, T unknown, int n, const char *name, Read read,
                  const char *empty_msg = nullptr)
{
    char path[kPathLen];
    T v{};
    int rc = read(&v, entry_path(path, kLuns.root, n, name));
    if (rc == KORV_OK) {
        *field = v;
        return KORV_OK;
    }
    *field = unknown;
    if (rc == ERR_INT_VALUE) {
        if (empty_msg)
            DBG_AS(func, 1, "%s", empty_msg);
        return KORV_OK;
    }
    return rc;
}

template <size_t N>
int read_text(char (&field)[N], int n, const char *name)
{
    char path[kPathLen];
    field[0] = '\0';
    return xmldb_get_cstring(field, N, entry_path(path, kLuns.root, n, name));
}

}  // namespace

// Fills conf from entry n, whose name the caller has read and copied.
int _xmldb_fill_lun_conf(lun_conf_t *conf, int n)
{
    PARAM_GUARD(!conf || n < 1);
    const char *func = __func__;
    conf->dbidx = n;
    int rc;
    int32_t sector = 0;
    if ((rc = read_text(conf->uuid, n, "uuid")) != KORV_OK || (rc = read_text(conf->serial, n, "serial")) != KORV_OK ||
        (rc = read_text(conf->img_file, n, "img_file")) != KORV_OK ||
        (rc = read_text(conf->target_name, n, "target_name")) != KORV_OK ||
        (rc = read_optional(func, &conf->size, uint64_t{0}, n, "size", xmldb_get_uint64_t)) != KORV_OK ||
        (rc = read_optional(func, &conf->alloc_size, uint64_t{0}, n, "alloc_size", xmldb_get_uint64_t)) != KORV_OK ||
        (rc = read_optional(func, &sector, int32_t{0}, n, "sector", xmldb_get_int32_t, "sector is empty")) != KORV_OK ||
        (rc = read_optional(func, &conf->devid, int32_t{-1}, n, "devid", xmldb_get_int32_t)) != KORV_OK ||
        (rc = read_optional(func, &conf->prealloc, int32_t{0}, n, "prealloc", xmldb_get_int32_t)) != KORV_OK ||
        (rc = read_optional(func, &conf->prealloc_state, int32_t{-1}, n, "prealloc_state", xmldb_get_int32_t,
                            "prealloc_state is empty")) != KORV_OK ||
        (rc = read_optional(func, &conf->vol_state, int32_t{-1}, n, "vol_state", xmldb_get_int32_t,
                            "vol_state is empty")) != KORV_OK ||
        (rc = read_optional(func, &conf->connected, int32_t{-1}, n, "connected", xmldb_get_int32_t)) != KORV_OK ||
        (rc = read_optional(func, &conf->lun_num, int32_t{-1}, n, "lun_num", xmldb_get_int32_t, "lun_num is empty")) !=
            KORV_OK)
        return rc;
    return KORV_OK;
}

namespace {

// Reads entries 1..128 up to the first empty name. A record that cannot be
// filled is skipped with the message operators know; only a failure of the
// service (or of memory) fails the whole read.
int read_all_luns(const char *func, list_t *out, bool full)
{
    PARAM_GUARD_AS(func, !out);
    static constexpr RecordKind<lun_conf_t> kind{lun_conf_new, lun_conf_free, lun_conf_free_list, "new l_conf failed"};
    return read_records(func, out, kind, kLuns, CONF_NAME_LEN, "fill lun conf failed when lun = %s",
                        [&](lun_conf_t *conf, const char *name) -> int {
                            korv::copy_bounded(conf->name, name);
                            return full ? _xmldb_fill_lun_conf(conf, conf->dbidx) : KORV_OK;
                        });
}

}  // namespace

int xmldb_get_all_lun_conf(list_t *list) { return read_all_luns(__func__, list, true); }
int xmldb_get_all_lun_conf_lite(list_t *list) { return read_all_luns(__func__, list, false); }
// What a crash left is read as every LUN is: the records themselves say
// what state each was in.
int xmldb_get_all_lun_conf_in_crash_conf(list_t *list) { return read_all_luns(__func__, list, true); }

int xmldb_get_lun_conf_by_name(lun_conf_t *conf, const char *name)
{
    PARAM_GUARD(!conf || !name || !name[0] || !fits<CONF_NAME_LEN>(name));
    int n = find_entry(__func__, kLuns, name, "can not find %s in xmldb lun entry");
    if (n < 1)
        return n;
    korv::copy_bounded(conf->name, name);
    int rc = _xmldb_fill_lun_conf(conf, n);
    if (rc != KORV_OK)
        DBG(0, "fill lun conf failed when lun = %s", name);
    return rc;
}

int xmldb_get_lun_conf_by_uuid(lun_conf_t *conf, const char *uuid)
{
    PARAM_GUARD(!conf || !uuid || !uuid[0]);
    // Walks the LUNs by name (the list's key) and takes the first whose
    // volume UUID matches; a LUN whose name does not fit the record is passed.
    int found = 0;
    int rc = walk_list(__func__, kLuns.root, kLuns.max, kLuns.key, CONF_NAME_LEN, nullptr,
                       [&](int n, const char *name) -> int {
                           if (found)
                               return KORV_OK;
                           char got[CONF_NAME_LEN + 1];
                           char path[kPathLen];
                           got[0] = '\0';
                           int read_rc = xmldb_get_cstring(got, sizeof got, entry_path(path, kLuns.root, n, "uuid"));
                           if (read_rc != KORV_OK)
                               return read_rc;
                           if (std::strcmp(got, uuid) == 0) {
                               found = n;
                               korv::copy_bounded(conf->name, name);
                           }
                           return KORV_OK;
                       });
    if (rc != KORV_OK)
        return rc;
    if (!found) {
        DBG(2, "can not find %s in xmldb lun entry", uuid);
        return ERR_NOT_FOUND;
    }
    rc = _xmldb_fill_lun_conf(conf, found);
    if (rc != KORV_OK)
        DBG(0, "fill lun conf failed when lun = %s", conf->name);
    return rc;
}
