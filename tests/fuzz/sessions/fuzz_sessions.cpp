// SPDX-License-Identifier: Apache-2.0
// libFuzzer target: arbitrary bytes as the kernel's sessions text, through
// the session listing's parser.
//
// Invariants checked beyond the sanitizers (which catch reads past the
// exactly-sized input and leaks): every listed session has its initiator,
// listed once by name; connections have a CID and a bounded address; a
// session is linked to its target and initiator together or not at all.
#include <cstdint>
#include <cstring>
#include <memory>

#include "common/korvadm_log.h"
#include "kernel/korvadm_mod_lio4_internal.h"
#include "kernel/korvadm_sess.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size)
{
    if (size > 32768)
        return 0;
    g_korv_debug_level = -1;
    // A copy of exactly the input's size: no terminator to lean on.
    std::unique_ptr<char[]> buf(new char[size ? size : 1]);
    if (size)
        std::memcpy(buf.get(), data, size);
    iscsi_target_t *target = iscsi_target_new();
    std::strcpy(target->iqn, "iqn.2026-01.test:t1");
    target->tpgt = 1;
    list_t sessions, initiators;
    list_init(&sessions);
    list_init(&initiators);

    if (_lio3_parse_sessions(&sessions, &initiators, target, buf.get(), size) != 0)
        __builtin_trap();
    int linked = 0;
    for (iscsi_sess_t *s : korv::list_records<iscsi_sess_t>(&sessions)) {
        if (!s->initiator || s->target != target ||
            iscsi_initiator_list_search(&initiators, s->initiator->name) != s->initiator ||
            strnlen(s->initiator->name, sizeof s->initiator->name) > 222)
            __builtin_trap();
        bool to_target = s->target_node.list == &target->sess_list;
        bool to_initiator = s->initiator_node.list == &s->initiator->sess_list;
        if (to_target != to_initiator || (!to_target && s->target_node.list))
            __builtin_trap();
        linked += to_target;
        for (iscsi_conn_t *c : korv::list_records<iscsi_conn_t>(&s->conn_list))
            if (c->cid < 0 || (c->address && std::strlen(c->address) > 31))
                __builtin_trap();
    }
    if (linked != target->sess_list.count)
        __builtin_trap();

    iscsi_sess_free_list(&sessions);
    if (!list_is_empty(&target->sess_list))
        __builtin_trap();
    iscsi_initiator_free_list(&initiators);
    iscsi_target_free(target);
    return 0;
}
