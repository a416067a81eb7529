// SPDX-License-Identifier: Apache-2.0
// Configuration records, access-right words, target names and the context.
#include "config/korvadm_conf.h"

#include <cctype>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "common/korvadm_err.h"
#include "common/korvadm_log.h"
#include "common/korvadm_sys.h"
#include "config/korvadm_xmldb_conf.h"

/* ---------------------------------------------------------------------------
 * Records
 * ------------------------------------------------------------------------- */

namespace {
// calloc clears every text; the integers the database may lack become -1.
template <class T>
T *alloc_record(const char *type_name)
{
    T *rec = korv::list_record_new(&T::node);
    if (!rec)
        DBG(0, "malloc %s failed", type_name);
    return rec;
}

template <class T>
void free_record(T *rec)
{
    korv::list_record_free(rec, &T::node);
}

// Frees every record of a list through its type's own free.
template <class T, void (*Free)(T *)>
void free_records(list_t *list)
{
    list_release(list, [](void *rec) { Free(static_cast<T *>(rec)); });
}

int init_target_conf(target_conf_t *conf)
{
    conf->dbidx = 0;
    conf->tpgt = -1;
    conf->state = -1;
    conf->chap_enable = -1;
    conf->hba_id = -1;
    return KORV_OK;
}
}  // namespace

target_conf_t *target_conf_new(void)
{
    auto *conf = alloc_record<target_conf_t>("target_conf_t");
    if (conf && init_target_conf(conf) != KORV_OK) {
        DBG(0, "init target_conf_t failed");
        free_record(conf);
        return nullptr;
    }
    return conf;
}

void target_conf_free(target_conf_t *conf) { free_record(conf); }

void target_conf_free_list(list_t *list) { free_records<target_conf_t, target_conf_free>(list); }

lun_conf_t *lun_conf_new(void)
{
    auto *conf = alloc_record<lun_conf_t>("lun_conf_t");
    if (!conf)
        return nullptr;
    conf->reserved_int1 = -1;
    conf->reserved_int2 = -1;
    conf->devid = -1;
    conf->vol_state = -1;
    conf->prealloc = -1;
    conf->prealloc_state = -1;
    conf->connected = -1;
    conf->lun_num = -1;
    return conf;
}

void lun_conf_free(lun_conf_t *conf)
{
    if (!conf)
        return;
    std::free(conf->priv);
    free_record(conf);
}

void lun_conf_free_list(list_t *list) { free_records<lun_conf_t, lun_conf_free>(list); }

target_map_lun_conf_t *target_map_lun_conf_new(void)
{
    auto *conf = alloc_record<target_map_lun_conf_t>("target_map_lun_conf_t");
    if (conf)
        conf->lun_num = -1;
    return conf;
}

void target_map_lun_conf_free(target_map_lun_conf_t *conf) { free_record(conf); }

void target_map_lun_conf_free_list(list_t *list)
{
    free_records<target_map_lun_conf_t, target_map_lun_conf_free>(list);
}

acl_initiator_conf_t *acl_initiator_conf_new(void)
{
    return alloc_record<acl_initiator_conf_t>("acl_initiator_conf_t");
}

void acl_initiator_conf_free(acl_initiator_conf_t *conf) { free_record(conf); }

void acl_initiator_conf_free_list(list_t *list) { free_records<acl_initiator_conf_t, acl_initiator_conf_free>(list); }

lun_acl_conf_t *lun_acl_conf_new(void)
{
    auto *conf = alloc_record<lun_acl_conf_t>("lun_acl_conf_t");
    if (conf)
        conf->access_right = -1;
    return conf;
}

void lun_acl_conf_free(lun_acl_conf_t *conf) { free_record(conf); }

void lun_acl_conf_free_list(list_t *list) { free_records<lun_acl_conf_t, lun_acl_conf_free>(list); }

/* ---------------------------------------------------------------------------
 * Access rights, target names, the context
 * ------------------------------------------------------------------------- */

int iscsi_conf_parse_access_right(const char *text)
{
    constexpr size_t kWork = 10;
    if (!text || !text[0])
        return -1;
    size_t len = std::strlen(text);
    if (len > kWork)
        return -1;
    // The work buffer holds 10 bytes with its terminator, so a 10-character
    // word is judged on its first 9.
    char work[kWork] = {};
    size_t keep = len < kWork ? len : kWork - 1;
    for (size_t i = 0; i < keep; i++)
        work[i] = static_cast<char>(std::toupper(static_cast<unsigned char>(text[i])));
    // Prefixes, deliberately: "ROOT" and "Rox" are read-only.
    if (std::strncmp(work, "DENY", 4) == 0)
        return 0;
    if (std::strncmp(work, "RO", 2) == 0)
        return 1;
    if (std::strncmp(work, "RW", 2) == 0)
        return 2;
    return -1;
}

int iscsi_conf_generate_iqn(char *out, const char *first, const char *second)
{
    PARAM_GUARD(!out || !first || !second);
    out[0] = '\0';
    char prefix[CONF_GEN_IQN_LEN] = {};
    // An unset or unreadable prefix simply gives an unprefixed name.
    if (iscsi_conf_ops.xmldb_get_iqn_prefix)
        iscsi_conf_ops.xmldb_get_iqn_prefix(prefix, sizeof prefix);
    return std::snprintf(out, CONF_GEN_IQN_LEN, "%s%s:%s", prefix, first, second);
}

int iscsi_conf_init(iscsi_conf_ctx_t *ctx)
{
    PARAM_GUARD(!ctx);
    ctx->ops = &iscsi_conf_ops;
    std::memset(ctx->host_name, 0, sizeof ctx->host_name);
    if (sys_net_get_host_name_in_iqn_spec(ctx->host_name, sizeof ctx->host_name, 1) != 0) {
        std::printf("get host name failed\n");
        std::fflush(stdout);
        return ERR_DB_WRITE;
    }
    return KORV_OK;
}
