// SPDX-License-Identifier: Apache-2.0
// Session and connection records: who owns what, which records count as the
// same, and the initiator and target comparisons the listing relies on.
// Leaks and stale links show under the sanitizer pass.
#include "kernel/korvadm_sess.h"

#include <cstring>
#include <memory>

#include <gtest/gtest.h>

#include "common/korvadm_err.h"

namespace {

const uint8_t kIsid[ISCSI_ISID_LEN] = {0x80, 0x28, 0x09, 0x49, 0x00, 0x01};

iscsi_target_t *target(const char *iqn)
{
    iscsi_target_t *t = iscsi_target_new();
    std::strcpy(t->iqn, iqn);
    t->tpgt = 1;
    return t;
}

// A session as the parser leaves it: in the caller's list, its target's and
// its initiator's, with two connections.
iscsi_sess_t *listed(list_t *sessions, iscsi_target_t *t, iscsi_initiator_t *i, uint64_t sid)
{
    iscsi_sess_t *s = iscsi_sess_list_add(sessions, sid, kIsid, 3, t, i);
    list_append(&s->target_node, &t->sess_list);
    list_append(&s->initiator_node, &i->sess_list);
    iscsi_conn_list_add(&s->conn_list, 0, "", "10.0.0.1", i->name);
    iscsi_conn_list_add(&s->conn_list, 1, "", "::1", i->name);
    return s;
}

struct World {
    korv::list_owner sessions_{iscsi_sess_free_list}, initiators_{iscsi_initiator_free_list};
    list_t &sessions = *sessions_.get(), &initiators = *initiators_.get();
    std::unique_ptr<iscsi_target_t, decltype(&iscsi_target_free)> t_{target("iqn.2026-01.test:t1"), iscsi_target_free};
    iscsi_target_t *t = t_.get();
    iscsi_initiator_t *a = iscsi_initiator_list_add(&initiators, "iqn.2026-01.test:a");
    iscsi_initiator_t *b = iscsi_initiator_list_add(&initiators, "iqn.2026-01.test:b");
};

TEST(Sess, FreeingUnlinksFromEveryListAndARecordGoneLeavesItsSessionsWithoutIt)
{
    World w;
    iscsi_sess_t *s1 = listed(&w.sessions, w.t, w.a, 1);
    iscsi_sess_t *s2 = listed(&w.sessions, w.t, w.b, 2);
    listed(&w.sessions, w.t, w.a, 3);
    iscsi_sess_free(s1);
    EXPECT_EQ(w.sessions.count, 2);
    EXPECT_EQ(w.t->sess_list.count, 2);
    EXPECT_EQ(w.a->sess_list.count, 1);

    // A freed initiator or target leaves its sessions listed, without it;
    // searching walks them without touching what is gone.
    iscsi_initiator_free(w.b);
    EXPECT_EQ(s2->initiator, nullptr);
    EXPECT_EQ(s2->initiator_node.list, nullptr);
    iscsi_target_t *t2 = target("iqn.2026-01.test:t2");
    iscsi_sess_t *s4 = listed(&w.sessions, t2, w.a, 4);
    iscsi_target_free(t2);
    EXPECT_EQ(s4->target, nullptr);
    EXPECT_EQ(iscsi_sess_list_search(&w.sessions, 4, w.t, w.a), nullptr);
    EXPECT_EQ(w.sessions.count, 3) << "the sessions stay the caller's";

    // Clearing by way of the target's list frees them from every list.
    iscsi_sess_free_list(&w.t->sess_list);
    EXPECT_EQ(w.sessions.count, 1);
    EXPECT_EQ(w.a->sess_list.count, 1);
    iscsi_sess_free(nullptr);
    iscsi_sess_free_list(nullptr);
}

TEST(Sess, SameSessionIsSameIdTargetIqnAndInitiatorName)
{
    World w;
    iscsi_sess_t *s = iscsi_sess_list_add(&w.sessions, 5, kIsid, 3, w.t, w.a);
    ASSERT_NE(s, nullptr);
    const uint8_t other[ISCSI_ISID_LEN] = {1, 2, 3, 4, 5, 6};
    // Found again, unchanged: neither ISID nor TSIH is updated.
    EXPECT_EQ(iscsi_sess_list_add(&w.sessions, 5, other, 9, w.t, w.a), s);
    EXPECT_EQ(s->tsih, 3);
    EXPECT_EQ(std::memcmp(s->isid, kIsid, ISCSI_ISID_LEN), 0);

    iscsi_target_t *same_iqn = target("iqn.2026-01.test:t1");
    iscsi_initiator_t *same_name = iscsi_initiator_new();
    std::strcpy(same_name->name, "iqn.2026-01.test:a");
    EXPECT_EQ(iscsi_sess_list_search(&w.sessions, 5, same_iqn, same_name), s);
    EXPECT_EQ(iscsi_sess_list_search(&w.sessions, 6, w.t, w.a), nullptr);
    EXPECT_EQ(iscsi_sess_list_search(&w.sessions, 5, w.t, w.b), nullptr);
    iscsi_target_t *other_t = target("iqn.2026-01.test:t1x");
    EXPECT_EQ(iscsi_sess_list_search(&w.sessions, 5, other_t, w.a), nullptr);

    iscsi_sess_t *twin = iscsi_sess_new();
    twin->sid = 5;
    twin->target = same_iqn;
    twin->initiator = same_name;
    EXPECT_EQ(iscsi_sess_list_add_node(&w.sessions, s), -1);
    EXPECT_EQ(iscsi_sess_list_add_node(&w.sessions, twin), -2);
    EXPECT_EQ(iscsi_sess_list_add_node(nullptr, twin), ERR_PARAM);
    EXPECT_EQ(_iscsi_sess_cmp(s, nullptr), ERR_PARAM);
    EXPECT_EQ(w.sessions.count, 1);
    twin->sid = 6;
    EXPECT_EQ(iscsi_sess_list_add_node(&w.sessions, twin), 0);
    EXPECT_EQ(iscsi_sess_list_add(&w.sessions, 7, nullptr, 3, w.t, w.a), nullptr);

    iscsi_initiator_free(same_name);
    iscsi_target_free(same_iqn);
    iscsi_target_free(other_t);
}

TEST(Sess, ConnectionsAreCidAndAddressAndOwnTheirTexts)
{
    list_t conns;
    list_init(&conns);
    iscsi_conn_t *c = iscsi_conn_list_add(&conns, 0, "", "10.0.0.1", "iqn.2026-01.test:a");
    ASSERT_NE(c, nullptr);
    EXPECT_EQ(c->local_address, nullptr) << "an empty text is not stored";
    EXPECT_STREQ(c->initiator_name, "iqn.2026-01.test:a");
    EXPECT_EQ(iscsi_conn_list_add(&conns, 0, "192.0.2.1", "10.0.0.1", "other"), c) << "local takes no part";
    struct {
        int cid;
        const char *address;
        bool found;
    } lookups[] = {{0, "10.0.0.1", true}, {0, "10.0.0.10", false}, {0, "10.0.0.", false},
                   {1, "10.0.0.1", false}, {-1, "10.0.0.1", false}, {0, nullptr, false}};
    for (auto &q : lookups)
        EXPECT_EQ(iscsi_conn_list_search(&conns, q.cid, "", q.address) == c, q.found) << q.cid << q.address;
    EXPECT_EQ(iscsi_conn_list_add(&conns, -1, "", "10.0.0.1", ""), nullptr);
    EXPECT_EQ(iscsi_conn_list_add(&conns, 1, "", nullptr, ""), nullptr);
    iscsi_conn_t *no_addr = iscsi_conn_list_add(&conns, 2, "", "", "");
    ASSERT_NE(no_addr, nullptr);
    EXPECT_EQ(no_addr->address, nullptr);
    EXPECT_EQ(iscsi_conn_list_search(&conns, 2, nullptr, ""), no_addr);
    EXPECT_EQ(iscsi_conn_list_add_node(&conns, c), -1);
    EXPECT_EQ(conns.count, 2);

    // A session frees the connections it owns.
    iscsi_sess_t *s = iscsi_sess_new();
    while (!list_is_empty(&conns)) {
        iscsi_conn_t *head = static_cast<iscsi_conn_t *>(conns.head->owner);
        list_remove(&head->node);
        ASSERT_EQ(iscsi_conn_list_add_node(&s->conn_list, head), 0);
    }
    iscsi_sess_free(s);
}

TEST(Sess, InitiatorsByExactNameTargetsByIqn)
{
    list_t inits;
    list_init(&inits);
    iscsi_initiator_t *a = iscsi_initiator_list_add(&inits, "iqn.2026-01.test:a");
    EXPECT_EQ(iscsi_initiator_list_add(&inits, "iqn.2026-01.test:a"), a);
    EXPECT_EQ(iscsi_initiator_list_search(&inits, "iqn.2026-01.test:"), nullptr);
    EXPECT_EQ(iscsi_initiator_list_search(&inits, "iqn.2026-01.test:ab"), nullptr);
    EXPECT_EQ(iscsi_initiator_list_search(&inits, "IQN.2026-01.test:a"), nullptr);
    EXPECT_EQ(iscsi_initiator_list_add(&inits, ""), nullptr);
    EXPECT_EQ(iscsi_initiator_list_add(&inits, std::string(ISCSI_INITIATOR_LEN, 'x').c_str()), nullptr);
    EXPECT_EQ(inits.count, 1);
    iscsi_initiator_free_list(&inits);

    iscsi_target_t *t1 = target("iqn.2026-01.test:t1"), *t1b = target("iqn.2026-01.test:t1"),
                   *empty = target(""), *t2 = target("iqn.2026-01.test:t2");
    t1b->tpgt = 2;
    EXPECT_EQ(iscsi_target_cmp(t1, t1b), 1);
    EXPECT_EQ(iscsi_target_cmp(t1, t2), 0);
    EXPECT_EQ(iscsi_target_cmp(empty, empty), 0);
    EXPECT_EQ(iscsi_target_cmp(t1, nullptr), 0);
    for (iscsi_target_t *t : {t1, t1b, empty, t2})
        iscsi_target_free(t);
}

}  // namespace
