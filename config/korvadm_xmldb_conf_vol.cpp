// SPDX-License-Identifier: Apache-2.0
// The per-volume summaries of LUN space under "/iscsi/lun/total_size" and
// their totals. The allocation figure of a summary is kept up by the LUN
// operations, not measured, so a rewrite carries it over.
#include <cstdlib>
#include <cstring>

#include "common/korvadm_err.h"
#include "common/korvadm_sys.h"
#include "config/korvadm_utils_db.h"
#include "config/korvadm_xmldb_conf_internal.h"

using namespace xmldb_conf;

namespace {

constexpr const char *kVolRoot = "/iscsi/lun/total_size";
constexpr const char *kVolCount = "/iscsi/lun/total_size/count";
constexpr const char *kTotalAlloc = "/iscsi/lun/total_size/total_alloc_size";
constexpr const char *kTotalSize = "/iscsi/lun/total_size/total_size";
constexpr int kAttempts = 3;

template <size_t N>
const char *vol_path(char (&buf)[N], int id, const char *field)
{
    return entry_path(buf, kVolRoot, id, field);
}

uint64_t add_capped(uint64_t a, uint64_t b)
{
    return a > UINT64_MAX - b ? UINT64_MAX : a + b;
}

// Step 1: the stored allocation (when non-zero) replaces the measured one.
void carry_over_old_summary(vol_info_t *vol)
{
    int id = xmldb_get_vol_lun_info_idx_by_uuid(vol->uuid);
    if (id <= 0)
        return;
    char path[kPathLen];
    uint64_t alloc = 0;
    if (xmldb_get_uint64_t(&alloc, vol_path(path, id, "vol_alloc_size")) == KORV_OK && alloc != 0)
        vol->alloc_size = alloc;
    vol->claim_free_size = vol->free_size;
}

// The six values of summary id, in their order; false at the first failure.
bool write_summary(int id, const vol_info_t *vol)
{
    const struct {
        const char *field;
        const char *text;
        uint64_t size;
    } values[] = {
        {"uuid", vol->uuid, 0},
        {"mnt", vol->mnt_path, 0},
        {"vol_size", nullptr, vol->vol_size},
        {"vol_alloc_size", nullptr, vol->alloc_size},
        {"vol_claim_alloc_size", nullptr, vol->claim_alloc_size},
        {"vol_claim_free_size", nullptr, vol->claim_free_size},
    };
    for (const auto &v : values) {
        char path[kPathLen];
        vol_path(path, id, v.field);
        int rc = v.text ? xmldb_set_cstring(v.text, path) : xmldb_set_uint64_t(v.size, path);
        if (rc != KORV_OK) {
            DBG(0, "xmldbc_set(%s) failed ", path);
            return false;
        }
    }
    return true;
}

int set_total(const char *path, uint64_t size)
{
    if (xmldb_set_uint64_t(size, path) != KORV_OK) {
        DBG(0, "xmldb_set_uint64_t(%s) failed ", path);
        return ERR_DB_WRITE;
    }
    return KORV_OK;
}

}  // namespace

int xmldb_get_vol_lun_info_idx_by_uuid(const char *uuid)
{
    PARAM_GUARD(!uuid);
    char text[128] = "";
    if (xmldb_get_cstring(text, sizeof text, kVolCount) != KORV_OK && !text[0]) {
        DBG(0, "xmldb error at strNode: %s", kVolCount);
        return ERR_DB_WRITE;
    }
    int count = std::atoi(text);
    for (int id = 1; id <= count; ++id) {
        char path[kPathLen], value[kPathLen] = "";
        vol_path(path, id, "uuid");
        if (xmldb_get_cstring(value, sizeof value, path) != KORV_OK || !value[0]) {
            DBG(0, "xmldb error at strNode: %s", path);
            return ERR_DB_WRITE;
        }
        if (std::strcmp(value, uuid) == 0)
            return id;
    }
    DBG(1, "can not find: %s", uuid);
    return -1;
}

int xmldb_set_lun_total_alloc_size(uint64_t size) { return set_total(kTotalAlloc, size); }

int xmldb_set_lun_total_apparent_size(uint64_t size) { return set_total(kTotalSize, size); }

int xmldb_update_total_vol_size_info(list_t *volumes)
{
    PARAM_GUARD(!volumes);
    for (vol_info_t *vol : korv::list_records<vol_info_t>(volumes))
        if (!vol->keep_figures)
            carry_over_old_summary(vol);

    char text[128] = "";
    if (xmldb_get_cstring(text, sizeof text, kVolCount) == KORV_OK && text[0]) {
        int tries = 0;
        while (xmldb_delete_node(kVolRoot) != KORV_OK) {
            DBG(0, "xmldbc_set(%s) failed", kVolRoot);
            if (++tries == kAttempts)
                return ERR_DB_WRITE;
        }
    }

    int id = 0;
    uint64_t total_size = 0, total_alloc = 0;
    for (vol_info_t *vol : korv::list_records<vol_info_t>(volumes)) {
        ++id;
        total_size = add_capped(total_size, vol->vol_size);
        total_alloc = add_capped(total_alloc, vol->alloc_size);
        int tries = 1;
        while (!write_summary(id, vol))
            if (++tries > kAttempts)
                return ERR_DB_WRITE;
        DBG(2, "cur->next : %p", static_cast<void *>(vol->node.next));
    }

    int tries = 1;
    while (xmldb_set_int32_t(id, kVolCount) != KORV_OK)
        if (++tries > kAttempts)
            return ERR_DB_WRITE;

    if (xmldb_set_lun_total_alloc_size(total_alloc) != KORV_OK) {
        DBG(0, "xmldb_update_lun_total_alloc_size() failed ");
        return ERR_DB_WRITE;
    }
    if (xmldb_set_lun_total_apparent_size(total_size) != KORV_OK) {
        DBG(0, "xmldb_set_lun_total_apparent_size() failed ");
        return ERR_DB_WRITE;
    }
    return KORV_OK;
}
