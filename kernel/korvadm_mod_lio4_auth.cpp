// SPDX-License-Identifier: Apache-2.0
// CHAP: checking the settings, the authentication switch, and pushing the
// credentials to one ACL or all of them.
#include "kernel/korvadm_mod_lio4_internal.h"

#include <cstring>
#include <string>
#include <vector>

#include "common/korvadm_err.h"

using namespace lio4;

namespace {

constexpr size_t CHAP_PASS_MIN = 12;
constexpr size_t CHAP_PASS_MAX = 16;

// Writes one name/password pair to an ACL's auth group: `suffix` picks the
// attributes ("" or "_mutual"), `kind` names the pair in the log.
int write_acl_credentials(const char *func, const char *iqn, int tpgt, const char *initiator, const char *suffix, const char *kind,
                          const char *user, const char *password)
{
    std::string auth = tpg_dir(iqn, tpgt) + "/acls/" + initiator + "/auth";
    std::string userid = auth + "/userid" + suffix;
    if (configfs_write_attr_str(userid.c_str(), user, 1) != 0) {
        DBG_AS(func, 0, "write %s user to %s = %s failed", kind, userid.c_str(), user);
        return ERR_CONFIGFS;
    }
    std::string pass = auth + "/password" + suffix;
    if (configfs_write_attr_str(pass.c_str(), password, 1) != 0) {
        DBG_AS(func, 0, "write %s password to %s = %s failed", kind, pass.c_str(), password);
        return ERR_CONFIGFS;
    }
    return KORV_OK;
}

int _lio3_set_target_acl_chap(const char *iqn, int tpgt, const char *initiator, const char *user,
                              const char *password)
{
    return write_acl_credentials(__func__, iqn, tpgt, initiator, "", "chap", user, password);
}

int _lio3_set_target_acl_mutual_chap(const char *iqn, int tpgt, const char *initiator, const char *user,
                                     const char *password)
{
    return write_acl_credentials(__func__, iqn, tpgt, initiator, "_mutual", "mutual chap", user, password);
}

// A name is given and the password is 12 to 16 characters; `kind` and the
// two messages name the pair in the log.
bool chap_pair_ok(const char *func, const char (&user)[ISCSI_NAME_LEN], const char (&pass)[ISCSI_NAME_LEN], const char *kind,
                  const char *no_name, const char *no_pass)
{
    size_t len = strnlen(pass, sizeof pass);
    if (user[0] == '\0') {
        DBG_AS(func, 0, "%s", no_name);
        return false;
    }
    if (len == 0) {
        DBG_AS(func, 0, "%s", no_pass);
        return false;
    }
    if (len < CHAP_PASS_MIN || len > CHAP_PASS_MAX) {
        DBG_AS(func, 0, "%s enabled, but %s password length = %u is not between 12 to 16", kind, kind,
            static_cast<unsigned>(len));
        return false;
    }
    return true;
}
}  // namespace

namespace lio4 {

// Writes the credentials the settings switch on to one ACL; mutual CHAP
// only rides on one-way CHAP.
int push_chap(const char *func, const iscsi_target_t *target, const char *initiator)
{
    if (target->chap != 1)
        return KORV_OK;
    std::string user = field_str(target->chap_user), pass = field_str(target->chap_pass);
    int rc = _lio3_set_target_acl_chap(target->iqn, target->tpgt, initiator, user.c_str(), pass.c_str());
    if (rc != 0) {
        DBG_AS(func, 0, "_lio3_set_target_acl_chap return error code: %d", rc);
        return ERR_CONFIGFS;
    }
    if (target->mutual_chap == 1) {
        std::string muser = field_str(target->mutual_user), mpass = field_str(target->mutual_pass);
        rc = _lio3_set_target_acl_mutual_chap(target->iqn, target->tpgt, initiator, muser.c_str(),
                                              mpass.c_str());
        if (rc != 0) {
            DBG_AS(func, 0, "_lio3_set_target_acl_mutual_chap return error code: %d", rc);
            return ERR_CONFIGFS;
        }
    }
    return KORV_OK;
}

}  // namespace lio4

int _lio3_set_target_auth_ability(const char *iqn, int tpgt, int chap_flag)
{
    PARAM_GUARD(!tpgt_ok(tpgt));
    return write_switch_and_auth_method(__func__, iqn, tpgt, "/attrib/authentication", chap_flag == 1 ? 1 : 0);
}
int _lio3_set_target_chap_all_acl(const iscsi_target_t *target)
{
    std::string acls = tpg_dir(target->iqn, target->tpgt) + "/acls";
    std::vector<std::string> names;
    if (!list_subdirs_or_log(__func__, acls, names))
        return ERR_CONFIGFS;
    for (const std::string &name : names)
        if (push_chap(__func__, target, name.c_str()) != 0)
            return ERR_CONFIGFS;
    return KORV_OK;
}

int _lio3_validate_target_chap_settings(const iscsi_target_t *target)
{
    if (!target) {
        DBG(0, "target is NULL");
        return 0;
    }
    if (target->chap != 1)
        return 1;
    if (!chap_pair_ok(__func__, target->chap_user, target->chap_pass, "CHAP", "CHAP Enabled, but CHAP name is not given",
                      "CHAP enabled, but CHAP password is not given"))
        return 0;
    if (target->mutual_chap != 1)
        return 1;
    return chap_pair_ok(__func__, target->mutual_user, target->mutual_pass, "Mutual CHAP",
                        "Mutual CHAP enabled, but Mutual CHAP name is not given",
                        "Mutual CHAP Enabled, but Mutual CHAP Password is not given")
               ? 1
               : 0;
}

int _lio3_set_target_chap_to_acl(const char *initiator_iqn, iscsi_target_t *target)
{
    PARAM_GUARD(!initiator_iqn || !*initiator_iqn || !is_component(initiator_iqn), "initiator iqn is empty");
    CHECK_TARGET(target, "target is NULL", "target iqn is empty", "target tpgt is wrong: %d", target->tpgt);
    PARAM_GUARD(!_lio3_validate_target_chap_settings(target), "CHAP setting is not correct");
    return push_chap(__func__, target, initiator_iqn);
}

int lio3_set_target_chap(iscsi_target_t *target)
{
    CHECK_TARGET(target, "target is NULL", "target IQN is empty", "target TPGT out of limitation");
    PARAM_GUARD(!_lio3_validate_target_chap_settings(target), "CHAP setting is not correct");
    if (_lio3_set_target_auth_ability(target->iqn, target->tpgt, target->chap) != 0) {
        DBG(0, "_lio3_set_target_attrib_authentication failed");
        return ERR_CONFIGFS;
    }
    // Turning CHAP off leaves the ACLs' credentials in place.
    if (target->chap == 1 && _lio3_set_target_chap_all_acl(target) != 0) {
        DBG(0, "_lio3_set_target_chap_all_acl failed");
        return ERR_CONFIGFS;
    }
    return KORV_OK;
}
