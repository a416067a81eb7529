// SPDX-License-Identifier: Apache-2.0
// Session and connection records, their equality and their lists.
#include "kernel/korvadm_sess.h"

#include <cstdlib>
#include <cstring>
#include <string_view>

#include "common/korvadm_err.h"
#include "common/korvadm_log.h"

namespace {

std::string_view text_of(const char *s)
{
    return s ? std::string_view(s) : std::string_view();
}

// A heap copy of a non-empty text; NULL for an empty one. `ok` turns false
// only when memory is short.
char *dup_text(const char *s, bool &ok)
{
    if (!s || !*s)
        return nullptr;
    char *copy = strdup(s);
    if (!copy)
        ok = false;
    return copy;
}

}  // namespace

/* ================================================================ sessions */

iscsi_sess_t *iscsi_sess_new(void)
{
    iscsi_sess_t *s = korv::list_record_new(&iscsi_sess_t::node);
    if (!s) {
        DBG(0, "malloc iscsi_sess_t failed");
        return nullptr;
    }
    s->tsih = -1;
    list_node_init(&s->initiator_node, s);
    list_node_init(&s->target_node, s);
    list_init(&s->conn_list);
    return s;
}

void iscsi_sess_free(iscsi_sess_t *sess)
{
    if (!sess) {
        DBG(0, "ERR_PARAM_ERROR");
        return;
    }
    list_release(&sess->conn_list, [](void *c) { iscsi_conn_free(static_cast<iscsi_conn_t *>(c)); });
    list_remove(&sess->node);
    list_remove(&sess->initiator_node);
    list_remove(&sess->target_node);
    std::free(sess);
}

void iscsi_sess_free_list(list_t *list)
{
    list_release(list, [](void *s) { iscsi_sess_free(static_cast<iscsi_sess_t *>(s)); });
}

void iscsi_sess_detach_list(list_t *list)
{
    if (!list)
        return;
    while (list_node_t *node = list->head) {
        auto *s = static_cast<iscsi_sess_t *>(node->owner);
        if (node == &s->target_node)
            s->target = nullptr;
        else if (node == &s->initiator_node)
            s->initiator = nullptr;
        list_remove(node);
    }
}

int _iscsi_sess_cmp(const iscsi_sess_t *lhs, const iscsi_sess_t *rhs)
{
    PARAM_GUARD(!lhs || !rhs, "ERR_PARAM_ERROR");
    if (lhs->sid != rhs->sid || !lhs->target || !rhs->target || !iscsi_target_cmp(lhs->target, rhs->target))
        return 0;
    const iscsi_initiator_t *a = lhs->initiator, *b = rhs->initiator;
    if (!a || !b)
        return 0;
    return a == b || iscsi_initiator_cmp(a->name, b->name);
}

void _iscsi_sess_list_add(list_t *list, iscsi_sess_t *sess)
{
    if (!list || !sess) {
        DBG(0, "ERR_PARAM_ERROR");
        return;
    }
    list_append(&sess->node, list);
}

iscsi_sess_t *iscsi_sess_list_search_node(list_t *list, const iscsi_sess_t *sess)
{
    if (!list) {
        DBG(0, "ERR_PARAM_ERROR");
        return nullptr;
    }
    if (!sess)
        return nullptr;
    return korv::list_find<iscsi_sess_t>(list, [sess](const iscsi_sess_t *s) { return _iscsi_sess_cmp(s, sess) == 1; });
}

iscsi_sess_t *iscsi_sess_list_search(list_t *list, uint64_t sid, iscsi_target_t *target,
                                     iscsi_initiator_t *initiator)
{
    iscsi_sess_t key{};
    key.sid = sid;
    key.target = target;
    key.initiator = initiator;
    return iscsi_sess_list_search_node(list, &key);
}

iscsi_sess_t *iscsi_sess_list_add(list_t *list, uint64_t sid, const uint8_t isid[ISCSI_ISID_LEN],
                                  int32_t tsih, iscsi_target_t *target, iscsi_initiator_t *initiator)
{
    if (!list || !isid || !target || !initiator) {
        DBG(0, "ERR_PARAM_ERROR");
        return nullptr;
    }
    if (iscsi_sess_t *found = iscsi_sess_list_search(list, sid, target, initiator))
        return found;
    iscsi_sess_t *s = iscsi_sess_new();
    if (!s)
        return nullptr;
    s->sid = sid;
    s->tsih = tsih;
    std::memcpy(s->isid, isid, ISCSI_ISID_LEN);
    s->target = target;
    s->initiator = initiator;
    list_append(&s->node, list);
    return s;
}

int iscsi_sess_list_add_node(list_t *list, iscsi_sess_t *sess)
{
    PARAM_GUARD(!list || !sess, "ERR_PARAM_ERROR");
    return korv::list_add_unique(list, sess, &sess->node,
                                 [](const iscsi_sess_t *a, const iscsi_sess_t *b) { return _iscsi_sess_cmp(a, b) == 1; });
}

int iscsi_sess_get_target_session(list_t *sess_list, list_t *initiator_list, iscsi_target_t *target)
{
    return iscsi_mod_get_target_session(sess_list, initiator_list, target);
}

/* ============================================================= connections */

iscsi_conn_t *iscsi_conn_new(void)
{
    iscsi_conn_t *c = korv::list_record_new(&iscsi_conn_t::node);
    if (!c) {
        DBG(0, "malloc iscsi_conn_t failed");
        return nullptr;
    }
    c->cid = -1;
    return c;
}

void iscsi_conn_free(iscsi_conn_t *conn)
{
    if (!conn)
        return;
    list_remove(&conn->node);
    std::free(conn->address);
    std::free(conn->local_address);
    std::free(conn->initiator_name);
    std::free(conn);
}

int _iscsi_conn_cmp(const iscsi_conn_t *lhs, const iscsi_conn_t *rhs)
{
    PARAM_GUARD(!lhs || !rhs, "ERR_PARAM_ERROR");
    return lhs->cid >= 0 && lhs->cid == rhs->cid && text_of(lhs->address) == text_of(rhs->address);
}

void _iscsi_conn_list_add(list_t *list, iscsi_conn_t *conn)
{
    if (!list || !conn) {
        DBG(0, "ERR_PARAM_ERROR");
        return;
    }
    list_append(&conn->node, list);
}

iscsi_conn_t *iscsi_conn_list_search_node(list_t *list, const iscsi_conn_t *conn)
{
    if (!list) {
        DBG(0, "ERR_PARAM_ERROR");
        return nullptr;
    }
    if (!conn || conn->cid < 0)
        return nullptr;
    return korv::list_find<iscsi_conn_t>(list, [conn](const iscsi_conn_t *c) { return _iscsi_conn_cmp(c, conn) == 1; });
}

iscsi_conn_t *iscsi_conn_list_search(list_t *list, int cid, const char *local, const char *address)
{
    (void)local;  // accepted, never compared
    if (!address)
        return nullptr;
    iscsi_conn_t key{};
    key.cid = cid;
    key.address = const_cast<char *>(address);
    return iscsi_conn_list_search_node(list, &key);
}

iscsi_conn_t *iscsi_conn_list_add(list_t *list, int cid, const char *local, const char *address,
                                  const char *initiator_name)
{
    if (!list || cid < 0 || !address)
        return nullptr;
    if (iscsi_conn_t *found = iscsi_conn_list_search(list, cid, local, address))
        return found;
    iscsi_conn_t *c = iscsi_conn_new();
    if (!c)
        return nullptr;
    bool ok = true;
    c->cid = cid;
    c->address = dup_text(address, ok);
    c->local_address = dup_text(local, ok);
    c->initiator_name = dup_text(initiator_name, ok);
    if (!ok) {
        DBG(0, "malloc iscsi_conn_t failed");
        iscsi_conn_free(c);
        return nullptr;
    }
    list_append(&c->node, list);
    return c;
}

int iscsi_conn_list_add_node(list_t *list, iscsi_conn_t *conn)
{
    PARAM_GUARD(!list || !conn, "ERR_PARAM_ERROR");
    return korv::list_add_unique(list, conn, &conn->node,
                                 [](const iscsi_conn_t *a, const iscsi_conn_t *b) { return _iscsi_conn_cmp(a, b) == 1; });
}
