// SPDX-License-Identifier: Apache-2.0
// The driver table selection, the iscsi_mod_ wrappers and the driver's records.
#include "kernel/korvadm_mod.h"

#include <cstdlib>
#include <cstring>
#include <string_view>

#include "common/korvadm_err.h"
#include "common/korvadm_log.h"
#include "common/korvadm_str.h"
#include "kernel/korvadm_mod_lio4.h"
#include "kernel/korvadm_sess.h"

const iscsi_mod_ops_t *iscsi_mod_ops = nullptr;

/* ---------------------------------------------------------------- records */

iscsi_target_t *iscsi_target_new(void)
{
    iscsi_target_t *t = korv::list_record_new(&iscsi_target_t::node);
    if (!t)
        return nullptr;
    t->tpgt = -1;
    list_init(&t->ip_list);
    list_init(&t->sess_list);
    return t;
}

void iscsi_target_free(iscsi_target_t *target)
{
    if (!target)
        return;
    iscsi_sess_detach_list(&target->sess_list);
    list_remove(&target->node);
    iscsi_ip_free_list(&target->ip_list);
    std::free(target);
}

int iscsi_target_cmp(const iscsi_target_t *lhs, const iscsi_target_t *rhs)
{
    if (!lhs || !rhs) {
        DBG(0, "lhs or rhs is NULL");
        return 0;
    }
    size_t n = strnlen(lhs->iqn, sizeof lhs->iqn);
    return n > 0 && n == strnlen(rhs->iqn, sizeof rhs->iqn) && std::memcmp(lhs->iqn, rhs->iqn, n) == 0;
}

iscsi_lun_t *iscsi_lun_new(void)
{
    iscsi_lun_t *l = korv::list_record_new(&iscsi_lun_t::node);
    if (!l)
        return nullptr;
    l->lun_num = -1;
    l->hba_id = -1;
    return l;
}

void iscsi_lun_free(iscsi_lun_t *lun) { korv::list_record_free(lun, &iscsi_lun_t::node); }

iscsi_initiator_t *iscsi_initiator_new(void)
{
    iscsi_initiator_t *i = korv::list_record_new(&iscsi_initiator_t::node);
    if (i)
        list_init(&i->sess_list);
    return i;
}

void iscsi_initiator_free(iscsi_initiator_t *initiator)
{
    if (initiator)
        iscsi_sess_detach_list(&initiator->sess_list);
    korv::list_record_free(initiator, &iscsi_initiator_t::node);
}

void iscsi_initiator_free_list(list_t *list)
{
    list_release(list, [](void *rec) { iscsi_initiator_free(static_cast<iscsi_initiator_t *>(rec)); });
}

int iscsi_initiator_cmp(const char *lhs, const char *rhs)
{
    return lhs && rhs && *lhs && std::strcmp(lhs, rhs) == 0;
}

iscsi_initiator_t *iscsi_initiator_list_search(list_t *list, const char *name)
{
    if (!list) {
        DBG(0, "ERR_PARAM_ERROR");
        return nullptr;
    }
    if (!name || !*name)
        return nullptr;
    std::string_view want(name);
    // The record's name is read within its field, terminated or not.
    return korv::list_find<iscsi_initiator_t>(list, [want](const iscsi_initiator_t *i) {
        return std::string_view(i->name, strnlen(i->name, sizeof i->name)) == want;
    });
}

iscsi_initiator_t *iscsi_initiator_list_add(list_t *list, const char *name)
{
    if (!list || !name || !*name)
        return nullptr;
    if (iscsi_initiator_t *found = iscsi_initiator_list_search(list, name))
        return found;
    iscsi_initiator_t *i = iscsi_initiator_new();
    if (!i)
        return nullptr;
    if (!korv::copy_bounded(i->name, name)) {
        iscsi_initiator_free(i);  // a name cut short would be another initiator
        return nullptr;
    }
    list_append(&i->node, list);
    return i;
}

iscsi_map_lun_t *iscsi_map_lun_new(void)
{
    iscsi_map_lun_t *m = korv::list_record_new(&iscsi_map_lun_t::node);
    if (m)
        m->lun_num = -1;
    return m;
}

void iscsi_map_lun_free(iscsi_map_lun_t *map_lun)
{
    korv::list_record_free(map_lun, &iscsi_map_lun_t::node);
}

iscsi_lun_acl_t *iscsi_lun_acl_new(void)
{
    return korv::list_record_new(&iscsi_lun_acl_t::node);
}

void iscsi_lun_acl_free(iscsi_lun_acl_t *lun_acl)
{
    korv::list_record_free(lun_acl, &iscsi_lun_acl_t::node);
}

/* -------------------------------------------------------------- selection */

int iscsi_mod_select(int type)
{
    if (type < 0)
        return ERR_PARAM;
    if (type != ISCSI_MOD_TYPE_LIO)
        return ERR_MODULE_TYPE;
    iscsi_mod_ops = &lio3_mod_ops;
    return KORV_OK;
}

/* --------------------------------------------------------------- wrappers */

namespace {

// The body of every wrapper: its argument check, the table, then the slot.
// `no_table` is what the wrapper answers without a table.
template <class Slot, class... Args>
int call_slot(bool args_ok, Slot iscsi_mod_ops_t::*slot, int no_table, Args... args)
{
    if (!args_ok)
        return ERR_PARAM;
    const iscsi_mod_ops_t *ops = iscsi_mod_ops;
    if (!ops)
        return no_table;
    Slot fn = ops->*slot;
    if (!fn)
        return ERR_OP_NOT_PROVIDED;
    return fn(args...);
}

}  // namespace

int iscsi_mod_start(void)
{
    return call_slot(true, &iscsi_mod_ops_t::start_module, ERR_MODULE_START);
}

int iscsi_mod_stop(void)
{
    return call_slot(true, &iscsi_mod_ops_t::stop_module, ERR_MODULE_START);
}

int iscsi_mod_get_state(void)
{
    return call_slot(true, &iscsi_mod_ops_t::get_module_state, 1);
}

int iscsi_mod_add_target(iscsi_target_t *target)
{
    return call_slot(target, &iscsi_mod_ops_t::add_target, ERR_PARAM, target);
}

int iscsi_mod_del_target(iscsi_target_t *target)
{
    return call_slot(target, &iscsi_mod_ops_t::del_target, ERR_PARAM, target);
}

int iscsi_mod_enable_target(iscsi_target_t *target)
{
    return call_slot(target, &iscsi_mod_ops_t::enable_target, ERR_PARAM, target);
}

int iscsi_mod_disable_target(iscsi_target_t *target)
{
    return call_slot(target, &iscsi_mod_ops_t::disable_target, ERR_PARAM, target);
}

int iscsi_mod_set_target_chap(iscsi_target_t *target)
{
    return call_slot(target, &iscsi_mod_ops_t::set_target_chap, ERR_PARAM, target);
}

int iscsi_mod_set_target_ip(iscsi_target_t *target)
{
    return call_slot(target, &iscsi_mod_ops_t::set_target_ip, ERR_PARAM, target);
}

int iscsi_mod_set_dataout_timeout(int timeout, iscsi_target_t *target)
{
    return call_slot(timeout >= 0 && target, &iscsi_mod_ops_t::set_target_attr_dataout_timeout,
                     ERR_PARAM, timeout, target);
}

int iscsi_mod_get_target_ip_list(list_t *ip_list, iscsi_target_t *target)
{
    return call_slot(ip_list && target, &iscsi_mod_ops_t::get_target_existing_ip_list, ERR_PARAM, ip_list, target);
}

int iscsi_mod_add_backstore(iscsi_lun_t *lun)
{
    return call_slot(lun, &iscsi_mod_ops_t::add_backstore, ERR_PARAM, lun);
}

int iscsi_mod_del_backstore(iscsi_lun_t *lun)
{
    // No table is a start failure here, not a parameter error.
    return call_slot(lun, &iscsi_mod_ops_t::del_backstore, ERR_MODULE_START, lun);
}

int iscsi_mod_shutdown_backstore(iscsi_lun_t *lun)
{
    return call_slot(lun, &iscsi_mod_ops_t::shutdown_backstore, ERR_PARAM, lun);
}

int iscsi_mod_change_backstore_size(iscsi_lun_t *lun)
{
    return call_slot(lun, &iscsi_mod_ops_t::change_backstore_size, ERR_PARAM, lun);
}

int iscsi_mod_add_lun_mapping(iscsi_lun_t *lun, iscsi_target_t *target, int lun_number)
{
    return call_slot(lun && target && lun_number >= 0, &iscsi_mod_ops_t::add_lun_mapping,
                     ERR_PARAM, lun, target, lun_number);
}

int iscsi_mod_del_lun_mapping(iscsi_lun_t *lun, iscsi_target_t *target)
{
    return call_slot(lun && target, &iscsi_mod_ops_t::del_lun_mapping, ERR_PARAM, lun, target);
}

int iscsi_mod_add_acl_initiator(const char *initiator_name, iscsi_target_t *target)
{
    return call_slot(initiator_name && target, &iscsi_mod_ops_t::add_acl_initiator,
                     ERR_PARAM, initiator_name, target);
}

int iscsi_mod_del_acl_initiator(const char *initiator_name, iscsi_target_t *target)
{
    return call_slot(initiator_name && target, &iscsi_mod_ops_t::del_acl_initiator,
                     ERR_PARAM, initiator_name, target);
}

int iscsi_mod_add_lun_acl(iscsi_lun_acl_t *lun_acl)
{
    return call_slot(lun_acl && lun_acl->map_lun && lun_acl->initiator, &iscsi_mod_ops_t::add_lun_acl,
                     ERR_PARAM, lun_acl);
}

int iscsi_mod_del_lun_acl(iscsi_lun_acl_t *lun_acl)
{
    return call_slot(lun_acl && lun_acl->map_lun && lun_acl->initiator, &iscsi_mod_ops_t::del_lun_acl,
                     ERR_PARAM, lun_acl);
}

int iscsi_mod_get_target_session(list_t *sess_list, list_t *initiator_list, iscsi_target_t *target)
{
    return call_slot(sess_list && initiator_list && target, &iscsi_mod_ops_t::get_target_session,
                     ERR_PARAM, sess_list, initiator_list, target);
}

int iscsi_mod_get_target_ip_list_in_target_parm(list_t *ip_list, const char *target_iqn, int tpgt)
{
    if (!ip_list || !target_iqn || !*target_iqn || tpgt < 0 || !iscsi_mod_ops)
        return ERR_PARAM;
    iscsi_target_t *target = iscsi_target_new();
    if (!target) {
        DBG(0, "new iscsi_target_t failed");
        return ERR_NO_MEMORY;
    }
    if (!korv::copy_bounded(target->iqn, target_iqn)) {
        DBG(0, "target iqn is too long: %s", target_iqn);
        iscsi_target_free(target);
        return ERR_PARAM;
    }
    target->tpgt = tpgt;
    int rc = iscsi_mod_get_target_ip_list(ip_list, target);
    iscsi_target_free(target);
    if (rc != 0) {
        DBG(0, "get_target_exist_ip_list failed, rc = %d", rc);
        return ERR_CONFIGFS;
    }
    return KORV_OK;
}
