// SPDX-License-Identifier: Apache-2.0
// ACLs: the initiators known to the access lists and their rights on LUNs.
// Each right is kept on both sides, under the initiator
// ("/iscsi/acl/id:A/mapped_lun/id:M") and under the LUN
// ("/iscsi/lun/id:L/acl/id:K"); the two are written one after the other.
#include <cstdint>
#include <cstring>

#include "common/korvadm_err.h"
#include "config/korvadm_utils_db.h"
#include "config/korvadm_xmldb_conf_internal.h"

using namespace xmldb_conf;

namespace {

constexpr const char *kRightWords[] = {"DENY", "RO", "RW"};

template <size_t N>
const char *lun_acl_root(char (&buf)[N], int lun)
{
    return sub_root(buf, kLuns.root, lun, "acl");
}

template <size_t N>
const char *mapped_lun_root(char (&buf)[N], int acl)
{
    return sub_root(buf, kAcls.root, acl, "mapped_lun");
}

// Writes one value, logged as the right-writing steps are.
int set_logged(const char *func, const char *root, int n, const char *field, const char *value)
{
    char path[kPathLen];
    entry_path(path, root, n, field);
    DBG_AS(func, 2, "set %s=%s", path, value);
    if (xmldb_set_cstring(value, path) != KORV_OK) {
        DBG_AS(func, 0, "xmldb_set_cstring(%s, %s) failed", path, value);
        return ERR_DB_WRITE;
    }
    return KORV_OK;
}

// known: the list's length when the caller has just seen it whole (it took
// the first free entry), else -1 to count it.
int recount(const char *func, const char *root, int max, const char *key, const char *msg, int known = -1)
{
    char path[kPathLen];
    int count = known >= 0 ? known : _cal_xmldb_id_entry_count(root, max, key);
    if (xmldb_set_int32_t(count, pathf(path, sizeof path, "%s/count", root)) != KORV_OK) {
        DBG_AS(func, 0, "xmldb_set_int32_t( %d, %s) failed", count, path);
        return ERR_DB_WRITE;
    }
    DBG_AS(func, 1, msg, count);
    return KORV_OK;
}

// Whether some initiator entry's field equals value.
int acl_field_exists(const char *func, const char *field, const char *value)
{
    bool found = false;
    int rc = walk_list(func, kAcls.root, kAcls.max, kAcls.key, kKeyLen, nullptr, [&](int n, const char *key) -> int {
        if (found)
            return KORV_OK;
        if (field == kAcls.key) {
            found = std::strcmp(key, value) == 0;
            return KORV_OK;
        }
        char got[kKeyLen] = "";
        char path[kPathLen];
        int read_rc = xmldb_get_cstring(got, sizeof got, entry_path(path, kAcls.root, n, field));
        found = read_rc == KORV_OK && std::strcmp(got, value) == 0;
        return read_rc;
    });
    return rc == KORV_OK && found ? 1 : 0;
}

}  // namespace

int _xmldb_acl_get_dbidx_by_name(const char *initiator)
{
    PARAM_GUARD(!initiator);
    return find_entry(__func__, kAcls, initiator, "can not find %s in xmldb acl entry", 2);
}

int _xmldb_lun_acl_get_dbidx(int lun, const char *initiator)
{
    PARAM_GUARD(!initiator || lun < 1);
    char root[kPathLen];
    return find_in(__func__, {lun_acl_root(root, lun), CONF_MAX_ACLS, "initiator"}, initiator);
}

int _xmldb_acl_get_mapped_lun_dbidx(int acl, const char *lun_name)
{
    PARAM_GUARD(!lun_name || acl < 1);
    char root[kPathLen];
    return find_in(__func__, {mapped_lun_root(root, acl), CONF_MAX_LUNS, "lun_name"}, lun_name);
}

int _xmldb_update_current_lun_aclcnt(int lun)
{
    char root[kPathLen];
    return recount(__func__, lun_acl_root(root, lun), CONF_MAX_ACLS, "initiator", "total lun acl's entry count =%d");
}

int _xmldb_update_current_acl_mapluncnt(int acl)
{
    char root[kPathLen];
    return recount(__func__, mapped_lun_root(root, acl), CONF_MAX_LUNS, "lun_name", "total lun acl's entry count =%d");
}

int xmldb_check_acl_initiaor_exist(const char *initiator)
{
    PARAM_GUARD(!initiator);
    return initiator[0] ? acl_field_exists(__func__, kAcls.key, initiator) : 0;
}

int xmldb_check_acl_alias_exist(const char *alias)
{
    PARAM_GUARD(!alias);
    return alias[0] ? acl_field_exists(__func__, "alias", alias) : 0;
}

int xmldb_check_add_acl_initiator(const char *initiator, const char *alias)
{
    PARAM_GUARD(!initiator || !alias);
    return xmldb_check_acl_initiaor_exist(initiator) == 1 || xmldb_check_acl_alias_exist(alias) == 1 ? 1 : 0;
}

namespace {
// Adds the initiator at the first free entry, *out its number.
int add_initiator(const char *initiator, const char *alias, int *out)
{
    const char *func = "xmldb_add_acl_initiator";
    int &n = *out;
    int rc = _get_free_xmldb_id_entry(&n, kAcls.root, kAcls.max, kAcls.key);
    if (rc == ID_ENTRY_NOT_FOUND) {
        DBG_AS(func, 0, "the maximum number of targets has reached");
        return ERR_NO_ROOM;
    }
    if (rc != ID_ENTRY_FOUND) {
        DBG_AS(func, 0, "conf error");
        return ERR_DB_WRITE;
    }
    rc = write_fields(func, kAcls.root, n,
                      {{"initiator", initiator, 0, "set %s = %s failed"}, {"alias", alias, 0, "set %s = %s failed"}});
    if (rc != KORV_OK)
        return rc;
    if (_xmldb_inc_acl_count() != KORV_OK)
        return ERR_DB_WRITE;
    return _xmldb_update_current_acl_mapluncnt(n);
}
}  // namespace

int xmldb_add_acl_initiator(const char *initiator, const char *alias)
{
    PARAM_GUARD(!initiator || !alias || !initiator[0] || !fits<CONF_IQN_LEN>(initiator));
    int n = 0;
    return add_initiator(initiator, alias, &n);
}

namespace {
// Both copies of one right: the LUN's entry for the initiator, then the
// initiator's entry for the LUN, each found or taken free; both recounted.
int write_right(const char *initiator, const char *alias, const char *lun_name, int lun, int acl, int right)
{
    const char *func = "_xmldb_set_lun_acl";
    PARAM_GUARD_AS(func, right < 0 || right > 2, "Error unknown access right = %d\n", right);
    const char *word = kRightWords[right];
    char root[kPathLen];
    bool k_new = false, m_new = false;
    int k = find_or_free(lun_acl_root(root, lun), CONF_MAX_ACLS, "initiator", initiator, &k_new);
    DBG_AS(func, 2, "get lun acl db idx = %d", k);
    if (k < 1) {
        DBG_AS(func, 0, "Error when get new lun acl dbidx for ACL initiator_name = %s", initiator);
        return k;
    }
    int rc;
    if ((rc = set_logged(func, root, k, "initiator", initiator)) != KORV_OK ||
        (rc = set_logged(func, root, k, "alias", alias)) != KORV_OK ||
        (rc = set_logged(func, root, k, "access_right", word)) != KORV_OK)
        return rc;
    int m = find_or_free(mapped_lun_root(root, acl), CONF_MAX_LUNS, "lun_name", lun_name, &m_new);
    DBG_AS(func, 2, "get acl mapped lun db idx = %d", m);
    if (m < 1) {
        DBG_AS(func, 0, "Error when get new acl map lun dbidx for ACL initiator_name = %s", initiator);
        return m;
    }
    if ((rc = set_logged(func, root, m, "lun_name", lun_name)) != KORV_OK ||
        (rc = set_logged(func, root, m, "access_right", word)) != KORV_OK)
        return rc;
    // A new entry took the first free number, so it is also the list's length.
    char other[kPathLen];
    if (recount("_xmldb_update_current_lun_aclcnt", lun_acl_root(other, lun), CONF_MAX_ACLS, "initiator",
                "total lun acl's entry count =%d", k_new ? k : -1) != KORV_OK ||
        recount("_xmldb_update_current_acl_mapluncnt", root, CONF_MAX_LUNS, "lun_name",
                "total lun acl's entry count =%d", m_new ? m : -1) != KORV_OK)
        return ERR_DB_WRITE;
    return KORV_OK;
}
}  // namespace

int xmldb_set_lun_acl(const char *initiator, const char *alias, const char *lun_name, int access_right)
{
    PARAM_GUARD(!initiator || !alias || !lun_name);
    const char *invalid = !initiator[0] || !fits<CONF_IQN_LEN>(initiator) ? "initiator name error"
                          : !lun_name[0] || !fits<CONF_NAME_LEN>(lun_name) ? "lun name error"
                          : access_right < 0 || access_right > 2           ? "access right error"
                                                                           : nullptr;
    PARAM_GUARD(invalid, "%s", invalid);
    // The LUN before the initiator: a refused grant adds nobody.
    int lun = find_entry(__func__, kLuns, lun_name, "lun name not exist");
    if (lun < 1)
        return lun == ERR_NOT_FOUND ? ERR_PARAM : lun;
    int acl = find_entry(__func__, kAcls, initiator, "can not find %s in xmldb acl entry", 2);
    if (acl == ERR_NOT_FOUND) {
        int rc = add_initiator(initiator, alias, &acl);
        if (rc != KORV_OK) {
            DBG(0, "can not add new acl initiator");
            return rc;
        }
    }
    if (acl < 1) {
        DBG(0, "config fail");
        return ERR_DB_WRITE;
    }
    return write_right(initiator, alias, lun_name, lun, acl, access_right);
}

int xmldb_del_acl_initiator(const char *initiator)
{
    PARAM_GUARD(!initiator);
    int acl = find_entry(__func__, kAcls, initiator, "can not find %s in xmldb acl entry");
    if (acl < 1)
        return acl;
    char root[kPathLen];
    mapped_lun_root(root, acl);
    int rc = walk_list(__func__, root, CONF_MAX_LUNS, "lun_name", CONF_NAME_LEN, nullptr,
                       [&](int, const char *lun_name) -> int {
                           int lun = _xmldb_get_lun_dbidx_by_name(lun_name);
                           if (lun < 1) {
                               DBG(0, "error when call _xmldb_get_lun_dbidx_by_name(%s), rc = %d", lun_name, lun);
                               return KORV_OK;
                           }
                           int k = _xmldb_lun_acl_get_dbidx(lun, initiator);
                           if (k < 1) {
                               DBG(0, "error %s is not exist on lun %s, the acl might be inconsistency\n", initiator,
                                   lun_name);
                               return KORV_OK;
                           }
                           char lun_root[kPathLen];
                           int del_rc = remove_compact(__func__, lun_acl_root(lun_root, lun), k, CONF_MAX_ACLS,
                                                       "initiator", {"initiator", "alias", "access_right"});
                           return del_rc == KORV_OK ? _xmldb_update_current_lun_aclcnt(lun) : del_rc;
                       });
    if (rc != KORV_OK)
        return rc;
    return delete_entry(__func__, kAcls.root, acl, _xmldb_dec_acl_count);
}

int xmldb_remove_lun_from_all_acl(const char *lun_name)
{
    PARAM_GUARD(!lun_name);
    int lun = find_entry(__func__, kLuns, lun_name, "can not find lun name = %s - error");
    if (lun < 1)
        return lun;
    char root[kPathLen];
    lun_acl_root(root, lun);
    int rc = walk_list(__func__, root, CONF_MAX_ACLS, "initiator", CONF_IQN_LEN, nullptr,
                       [&](int, const char *initiator) -> int {
                           int acl = _xmldb_acl_get_dbidx_by_name(initiator);
                           if (acl < 1) {
                               DBG(0, "error when call acl_get_dbidx_by_initiator_name(%s)", initiator);
                               return KORV_OK;
                           }
                           int m = _xmldb_acl_get_mapped_lun_dbidx(acl, lun_name);
                           if (m < 1) {
                               DBG(0, "error %s is not exist on initiator %s, the acl might be inconsistency\n",
                                   lun_name, initiator);
                               return KORV_OK;
                           }
                           char acl_root[kPathLen];
                           int del_rc = remove_compact(__func__, mapped_lun_root(acl_root, acl), m, CONF_MAX_LUNS,
                                                       "lun_name", {"lun_name", "access_right"});
                           return del_rc == KORV_OK ? _xmldb_update_current_acl_mapluncnt(acl) : del_rc;
                       });
    if (rc != KORV_OK) {
        DBG(0, "fail to get initiator name from node %s", root);
        return ERR_DB_WRITE;
    }
    // The LUN's own side goes too, so both sides agree that no one has a right on it.
    if (xmldb_delete_node(root) != KORV_OK) {
        DBG(0, "del node %s failed", root);
        return ERR_DB_WRITE;
    }
    return KORV_OK;
}

int xmldb_get_all_acl_initiator_conf_lite(list_t *list)
{
    PARAM_GUARD(!list);
    static constexpr RecordKind<acl_initiator_conf_t> kind{acl_initiator_conf_new, acl_initiator_conf_free,
                                                           acl_initiator_conf_free_list, "new i_conf failed"};
    return read_records(__func__, list, kind, kAcls, CONF_IQN_LEN, "get alias error",
                        [&](acl_initiator_conf_t *conf, const char *initiator) -> int {
                            char alias[kKeyLen] = "";
                            char path[kPathLen];
                            int rc = xmldb_get_cstring(alias, sizeof alias,
                                                       entry_path(path, kAcls.root, conf->dbidx, "alias"));
                            korv::copy_bounded(conf->initiator, initiator);
                            korv::copy_bounded(conf->alias, alias);
                            return rc;
                        });
}

int xmldb_get_all_lun_acl_conf_from_lun(const char *lun_name, list_t *list)
{
    PARAM_GUARD(!lun_name || !list);
    int lun = find_entry(__func__, kLuns, lun_name, "get lun db idx error");
    if (lun < 1)
        return lun;
    char root[kPathLen];
    lun_acl_root(root, lun);
    static constexpr RecordKind<lun_acl_conf_t> kind{lun_acl_conf_new, lun_acl_conf_free, lun_acl_conf_free_list,
                                                     "new conf failed"};
    return read_records(__func__, list, kind, {root, CONF_MAX_ACLS, "initiator"}, CONF_IQN_LEN, nullptr,
                        [&](lun_acl_conf_t *conf, const char *initiator) -> int {
                            const int k = conf->dbidx;
                            char alias[kKeyLen] = "", right[kKeyLen] = "";
                            char path[kPathLen];
                            int rc = xmldb_get_cstring(alias, sizeof alias, entry_path(path, root, k, "alias"));
                            if (rc != KORV_OK) {
                                DBG(0, "get alias error");
                                return rc;
                            }
                            rc = xmldb_get_cstring(right, sizeof right, entry_path(path, root, k, "access_right"));
                            conf->access_right = rc == KORV_OK ? iscsi_conf_parse_access_right(right) : -1;
                            if (conf->access_right < 0) {
                                DBG(0, "get access right error");
                                return rc != KORV_OK ? rc : ERR_INT_VALUE;
                            }
                            korv::copy_bounded(conf->initiator, initiator);
                            korv::copy_bounded(conf->alias, alias);
                            return KORV_OK;
                        });
}

int xmldb_get_initiator_name_from_alias(char *buf, size_t size, const char *alias)
{
    PARAM_GUARD(!buf || size == 0 || !alias);
    buf[0] = '\0';
    PARAM_GUARD(!alias[0], "alias is empty");
    bool found = false;
    return walk_list(__func__, kAcls.root, kAcls.max, kAcls.key, kKeyLen, nullptr,
                     [&](int n, const char *initiator) -> int {
                         if (found)
                             return KORV_OK;
                         char got[kKeyLen] = "";
                         char path[kPathLen];
                         int rc = xmldb_get_cstring(got, sizeof got, entry_path(path, kAcls.root, n, "alias"));
                         if (rc == KORV_OK && std::strcmp(got, alias) == 0) {
                             found = true;
                             if (std::strlen(initiator) < size)
                                 std::memcpy(buf, initiator, std::strlen(initiator) + 1);
                         }
                         return rc;
                     });
}

int xmldb_clean_acl_conf(void)
{
    if (xmldb_delete_node(kAcls.root) != KORV_OK)
        DBG(0, "xmldb_delete_node(%s) failed", kAcls.root);
    return KORV_OK;
}
