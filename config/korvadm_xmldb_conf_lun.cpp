// SPDX-License-Identifier: Apache-2.0
// LUNs: add, delete, existence checks, free device number, recount, and the
// single-field operations by LUN name.
#include <cstdint>
#include <cstring>

#include "common/korvadm_err.h"
#include "config/korvadm_utils_db.h"
#include "config/korvadm_xmldb_conf_internal.h"

using namespace xmldb_conf;

namespace {

constexpr const char *kLunCount = "/iscsi/lun/count";

/* ---- one field of a LUN found by name ----
 * Every operation below is "find the LUN, then read or write one field";
 * what differs is the field, its type and the operation's messages. */

struct LunField {
    const char *field;
    const char *fail;               // getters: "... func_ret = %d"; setters: (path, value) or func_ret
    const char *bad_value = nullptr; // setters: logged for a refused value
    bool fail_with_rc = false;       // setters whose failure message names the code, not the value
};

// Path of the named LUN's field for a field operation: the LUN's entry
// number, or its code.
int lun_field(const char *func, const char *name, bool setter, const char *field, char (&path)[kPathLen])
{
    PARAM_GUARD_AS(func, !name || !name[0], "lun name error");
    int n = find_entry(func, kLuns, name,
                       setter ? "can not find %s in xmldb entry" : "can not find %s in xmldb lun entry");
    if (n >= 1)
        entry_path(path, kLuns.root, n, field);
    return n;
}

int read_value(int32_t *out, const char *path) { return xmldb_get_int32_t(out, path); }
int read_value(uint64_t *out, const char *path) { return xmldb_get_uint64_t(out, path); }
int write_value(int32_t v, const char *path) { return xmldb_set_int32_t(v, path); }
int write_value(uint64_t v, const char *path) { return xmldb_set_uint64_t(v, path); }
int write_value(const char *v, const char *path) { return xmldb_set_cstring(v, path); }
int log_arg(int32_t v) { return v; }
unsigned long long log_arg(uint64_t v) { return v; }
const char *log_arg(const char *v) { return v; }

template <class T>
int get_lun_number(const char *func, T *out, const char *name, const LunField &f)
{
    PARAM_GUARD_AS(func, !out);
    char path[kPathLen];
    if (int n = lun_field(func, name, false, f.field, path); n < 1)
        return n;
    T v{};
    int rc = read_value(&v, path);
    if (rc != KORV_OK) {
        DBG_AS(func, 0, f.fail, rc);
        return rc;
    }
    *out = v;
    return KORV_OK;
}

int get_lun_text(const char *func, char *buf, size_t size, const char *name, const LunField &f)
{
    PARAM_GUARD_AS(func, !buf || size == 0);
    char path[kPathLen];
    if (int n = lun_field(func, name, false, f.field, path); n < 1)
        return n;
    buf[0] = '\0';
    int rc = xmldb_get_cstring(buf, size, path);
    if (rc != KORV_OK)
        DBG_AS(func, 0, f.fail, rc);
    return rc;
}

// value_ok is the operation's own check; a refused value writes nothing.
template <class T>
int set_lun_field(const char *func, T value, bool value_ok, const char *name, const LunField &f)
{
    char path[kPathLen];
    if (int n = lun_field(func, name, true, f.field, path); n < 1)
        return n;
    PARAM_GUARD_AS(func, !value_ok, "%s", f.bad_value);
    int rc = write_value(value, path);
    if (rc != KORV_OK) {
        if (f.fail_with_rc)
            DBG_AS(func, 0, f.fail, rc);
        else
            DBG_AS(func, 0, f.fail, path, log_arg(value));
        return ERR_DB_WRITE;
    }
    return KORV_OK;
}

constexpr LunField kUuid{"uuid", "get lun volume uuid failed, func_ret = %d"};
constexpr LunField kImgFile{"img_file", "get lun volume img_file failed, func_ret = %d"};
constexpr LunField kSerialGet{"serial", "get lun serial failed, func_ret = %d"};
constexpr LunField kSerialSet{"serial", "set lun serial failed, func_ret = %d", "lun serial error", true};
constexpr LunField kVolStateGet{"vol_state", "get vol state failed, func_ret = %d"};
constexpr LunField kVolStateSet{"vol_state", "set LUN vol state %s = %d failed", "vol state error"};
constexpr LunField kSizeGet{"size", "get lun size failed, func_ret = %d"};
constexpr LunField kSizeSet{"size", "set LUN size %s = %llu failed"};
constexpr LunField kAllocGet{"alloc_size", "get lun allocated size failed, func_ret = %d"};
constexpr LunField kAllocSet{"alloc_size", "set LUN allocated size %s = %llu failed"};
constexpr LunField kConnGet{"connected", "get lun connect state failed, func_ret = %d"};
constexpr LunField kConnSet{"connected", "set LUN connect state %s = %d failed", "connect state error"};
constexpr LunField kPrealloc{"prealloc", "get lun prealloc failed, func_ret = %d"};
constexpr LunField kPreStateGet{"prealloc_state", "get lun prealloc_state failed, func_ret = %d"};
constexpr LunField kPreStateSet{"prealloc_state", "set LUN prealloc state %s = %d failed", "prealloc_state error"};
constexpr LunField kProgressSet{"prealloc_progress", "set LUN prealloc progress %s = %d failed",
                                "prealloc_progress error"};
// The status reader's message is the prealloc-state reader's, as operators know it.
constexpr LunField kStatusGet{"status", "get lun prealloc_state failed, func_ret = %d"};
constexpr LunField kStatusSet{"status", "set LUN status %s = %s failed", "status error"};

}  // namespace

int xmldb_get_lun_uuid(char *buf, size_t size, const char *name) { return get_lun_text(__func__, buf, size, name, kUuid); }
int xmldb_get_lun_img_file(char *buf, size_t size, const char *name) { return get_lun_text(__func__, buf, size, name, kImgFile); }
int xmldb_get_lun_serial(char *buf, size_t size, const char *name) { return get_lun_text(__func__, buf, size, name, kSerialGet); }
int xmldb_set_lun_serial(const char *serial, const char *name) { return set_lun_field(__func__, serial ? serial : "", serial != nullptr, name, kSerialSet); }
int xmldb_get_lun_vol_state(int *state, const char *name) { return get_lun_number(__func__, state, name, kVolStateGet); }
int xmldb_set_lun_vol_state(int state, const char *name) { return set_lun_field(__func__, int32_t{state}, state >= 0, name, kVolStateSet); }
int xmldb_get_lun_size(uint64_t *size, const char *name) { return get_lun_number(__func__, size, name, kSizeGet); }
int xmldb_set_lun_size(uint64_t size, const char *name) { return set_lun_field(__func__, size, true, name, kSizeSet); }
int xmldb_get_lun_alloc_size(uint64_t *size, const char *name) { return get_lun_number(__func__, size, name, kAllocGet); }
int xmldb_set_lun_alloc_size(uint64_t size, const char *name) { return set_lun_field(__func__, size, true, name, kAllocSet); }
int xmldb_get_lun_connect_state(int *state, const char *name) { return get_lun_number(__func__, state, name, kConnGet); }
int xmldb_set_lun_connect_state(int state, const char *name) { return set_lun_field(__func__, int32_t{state}, state >= 0, name, kConnSet); }
int xmldb_get_lun_prealloc(int *prealloc, const char *name) { return get_lun_number(__func__, prealloc, name, kPrealloc); }
int xmldb_get_lun_prealloc_state(int *state, const char *name) { return get_lun_number(__func__, state, name, kPreStateGet); }
int xmldb_set_lun_prealloc_state(int state, const char *name) { return set_lun_field(__func__, int32_t{state}, state >= 0, name, kPreStateSet); }
int xmldb_set_lun_prealloc_progress(int progress, const char *name) { return set_lun_field(__func__, int32_t{progress}, progress >= 0 && progress <= 100, name, kProgressSet); }
int xmldb_get_lun_status(char *buf, size_t size, const char *name) { return get_lun_text(__func__, buf, size, name, kStatusGet); }
int xmldb_set_lun_status(const char *status, const char *name) { return set_lun_field(__func__, status ? status : "", status != nullptr, name, kStatusSet); }

int _xmldb_get_lun_dbidx_by_name(const char *name)
{
    PARAM_GUARD(!name);
    return find_entry(__func__, kLuns, name, "can not find %s in xmldb lun entry", 2);
}

int xmldb_check_lun_exist(const char *name)
{
    PARAM_GUARD(!name);
    return name[0] && xmldb_check_add_lun(name) == 1 ? 1 : 0;
}

int xmldb_check_add_lun(const char *name)
{
    PARAM_GUARD(!name || !name[0]);
    return check_entry(__func__, kLuns.root, kLuns.max, kLuns.key, name);
}

int xmldb_add_new_lun(lun_conf_t *conf)
{
    PARAM_GUARD(!conf);
    // Every check before the first write, so a refused record leaves no trace.
    const char *invalid = !conf->name[0]                        ? "name is empty"
                          : !fits<CONF_NAME_LEN>(conf->name)    ? "name is too long"
                          : !conf->uuid[0]                      ? "volume uuid is empty"
                          : !conf->serial[0]                    ? "lun serial is empty"
                          : conf->size == 0                     ? "size is not given"
                          : conf->prealloc != 0 && conf->prealloc != 1 ? "prealloc is wrong"
                                                                : nullptr;
    PARAM_GUARD(invalid, "%s", invalid);
    conf->vol_state = 1;
    int n = 0;
    int rc = _get_free_xmldb_id_entry(&n, kLuns.root, kLuns.max, kLuns.key);
    if (rc == ID_ENTRY_NOT_FOUND) {
        DBG(0, "the Maximum number of LUNs has reached");
        return ERR_NO_ROOM;
    }
    if (rc != ID_ENTRY_FOUND) {
        DBG(0, "conf error");
        return ERR_DB_WRITE;
    }
    // Bounded copies: a record filled by hand may lack its terminators.
    char name[CONF_NAME_LEN], uuid[CONF_NAME_LEN], serial[CONF_NAME_LEN], img_file[CONF_IMG_FILE_LEN];
    korv::copy_bounded(name, conf->name);
    korv::copy_bounded(uuid, conf->uuid);
    korv::copy_bounded(serial, conf->serial);
    korv::copy_bounded(img_file, conf->img_file);
    const long long size = static_cast<long long>(conf->size);
    // The sector size reuses the size's message, as operators know it.
    rc = write_fields(__func__, kLuns.root, n,
                      {{"name", name, 0, "set LUN name %s = %s failed"},
                       {"uuid", uuid, 0, "set LUN volume uuid %s = %s failed"},
                       {"serial", serial, 0, "set LUN serial %s = %s failed"},
                       {"size", nullptr, size, "set LUN size %s = %llu failed", true},
                       {"sector", nullptr, 512, "set LUN size %s = %llu failed", true},
                       {"devid", nullptr, conf->devid, "set LUN devid %s = %d failed"},
                       {"prealloc", nullptr, conf->prealloc, "set LUN prealloc %s = %d failed"},
                       {"img_file", img_file, 0, "set LUN image file %s = %s failed"},
                       {"vol_state", nullptr, conf->vol_state, "set LUN volume state %s = %d failed"}});
    if (rc != KORV_OK)
        return rc;
    conf->dbidx = n;
    if (_xmldb_inc_lun_count() != KORV_OK) {
        DBG(0, "increment lun count failed");
        return ERR_DB_WRITE;
    }
    return KORV_OK;
}

int xmldb_del_lun_by_name(const char *name)
{
    PARAM_GUARD(!name);
    int n = find_entry(__func__, kLuns, name, "can not find %s in xmldb target entry");
    if (n < 1)
        return n;
    DBG(1, "update xmldb - del lun %s @ db_idx = %d", name, n);
    return delete_entry(__func__, kLuns.root, n, _xmldb_dec_lun_count);
}

int xmldb_get_free_lun_devid(int *devid)
{
    PARAM_GUARD(!devid);
    return free_number(__func__, kLuns.root, "devid", CONF_MAX_LUNS, devid, "get free devid: %d");
}

int xmldb_update_lun_current_count(void)
{
    int count = 0;
    for (int n = 1; n <= kLuns.max; n++) {
        char name[kKeyLen];
        if (read_key(kLuns.root, n, kLuns.key, name))
            count++;
    }
    if (xmldb_set_int32_t(count, kLunCount) != KORV_OK) {
        DBG(0, "xmldbc_set(%d ,%s) failed", count, kLunCount);
        return ERR_DB_WRITE;
    }
    DBG(1, "total lun entry=%d", count);
    return remove_ghost(__func__, kLuns.root, count + 1);
}
