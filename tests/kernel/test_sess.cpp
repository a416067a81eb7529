// SPDX-License-Identifier: Apache-2.0
// Session and connection records: who owns what and which records count as
// the same, where the parser's texts (test_lio4_sessions.cpp) cannot show
// it. Leaks and stale links show under the sanitizer pass.
#include "tests/kernel/lio4_test.h"

namespace {

const uint8_t kIsid[ISCSI_ISID_LEN] = {0x80, 0x28, 0x09, 0x49, 0x00, 0x01};

struct World : korv_test::Listing {
    iscsi_initiator_t *a = iscsi_initiator_list_add(&initiators, "iqn.2026-01.test:a");
    iscsi_initiator_t *b = iscsi_initiator_list_add(&initiators, "iqn.2026-01.test:b");

    // A session as the parser leaves it: in the caller's list, its target's
    // and its initiator's, with a connection.
    iscsi_sess_t *listed(iscsi_target_t *to, iscsi_initiator_t *i, uint64_t sid)
    {
        iscsi_sess_t *s = iscsi_sess_list_add(&sessions, sid, kIsid, 3, to, i);
        list_append(&s->target_node, &to->sess_list);
        list_append(&s->initiator_node, &i->sess_list);
        iscsi_conn_list_add(&s->conn_list, 0, "", "10.0.0.1", i->name);
        return s;
    }
};

TEST(Sess, FreeingUnlinksFromEveryListAndARecordGoneLeavesItsSessionsWithoutIt)
{
    World w;
    iscsi_sess_t *s1 = w.listed(w.target, w.a, 1);
    iscsi_sess_t *s2 = w.listed(w.target, w.b, 2);
    w.listed(w.target, w.a, 3);
    iscsi_sess_free(s1);
    EXPECT_EQ(w.sessions.count, 2);
    EXPECT_EQ(w.target->sess_list.count, 2);
    EXPECT_EQ(w.a->sess_list.count, 1);

    // A freed initiator or target leaves its sessions listed, without it.
    iscsi_initiator_free(w.b);
    EXPECT_EQ(s2->initiator, nullptr);
    EXPECT_EQ(s2->initiator_node.list, nullptr);
    iscsi_target_t *t2 = iscsi_target_new();
    std::strcpy(t2->iqn, "iqn.2026-01.test:t2");
    iscsi_sess_t *s4 = w.listed(t2, w.a, 4);
    iscsi_target_free(t2);
    EXPECT_EQ(s4->target, nullptr);
    EXPECT_EQ(w.sessions.count, 3) << "the sessions stay the caller's";

    // Clearing by way of the target's list frees them from every list.
    iscsi_sess_free_list(&w.target->sess_list);
    EXPECT_EQ(w.sessions.count, 1);
    EXPECT_EQ(w.a->sess_list.count, 1);
    iscsi_sess_free(nullptr);
}

TEST(Sess, SameSessionIsSameIdTargetIqnAndInitiatorName)
{
    World w;
    iscsi_sess_t *s = iscsi_sess_list_add(&w.sessions, 5, kIsid, 3, w.target, w.a);
    ASSERT_NE(s, nullptr);
    iscsi_target_t same_iqn{};
    std::strcpy(same_iqn.iqn, w.target->iqn);
    iscsi_initiator_t *same_name = iscsi_initiator_new();
    std::strcpy(same_name->name, "iqn.2026-01.test:a");
    EXPECT_EQ(iscsi_sess_list_search(&w.sessions, 5, &same_iqn, same_name), s);
    EXPECT_EQ(iscsi_sess_list_search(&w.sessions, 6, w.target, w.a), nullptr);
    EXPECT_EQ(iscsi_sess_list_search(&w.sessions, 5, w.target, w.b), nullptr);

    iscsi_sess_t *twin = iscsi_sess_new();
    twin->sid = 5;
    twin->target = &same_iqn;
    twin->initiator = same_name;
    EXPECT_EQ(iscsi_sess_list_add_node(&w.sessions, twin), -2);
    EXPECT_EQ(iscsi_sess_list_add_node(nullptr, twin), ERR_PARAM);
    EXPECT_EQ(_iscsi_sess_cmp(s, nullptr), ERR_PARAM);
    twin->sid = 6;
    EXPECT_EQ(iscsi_sess_list_add_node(&w.sessions, twin), 0);
    EXPECT_EQ(iscsi_sess_list_add(&w.sessions, 7, nullptr, 3, w.target, w.a), nullptr);
    iscsi_initiator_free(same_name);
}

// Which connections are the same, with texts: sessions/connections.txt.
TEST(Sess, ConnectionsNeedACidAndAnAddressAndTheLocalOneTakesNoPart)
{
    // The session owns its connections: its free releases them.
    std::unique_ptr<iscsi_sess_t, decltype(&iscsi_sess_free)> s(iscsi_sess_new(), iscsi_sess_free);
    list_t *conns = &s->conn_list;
    iscsi_conn_t *c = iscsi_conn_list_add(conns, 0, "", "10.0.0.1", "iqn.2026-01.test:a");
    ASSERT_NE(c, nullptr);
    EXPECT_EQ(iscsi_conn_list_add(conns, 0, "192.0.2.1", "10.0.0.1", "other"), c);
    EXPECT_EQ(iscsi_conn_list_search(conns, 0, "", nullptr), nullptr);
    EXPECT_EQ(iscsi_conn_list_add(conns, -1, "", "10.0.0.1", ""), nullptr);
    EXPECT_EQ(iscsi_conn_list_add(conns, 1, "", nullptr, ""), nullptr);
    EXPECT_EQ(iscsi_conn_list_add_node(conns, c), -1);
    EXPECT_EQ(conns->count, 1);
}

}  // namespace
