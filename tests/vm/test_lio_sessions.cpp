// SPDX-License-Identifier: Apache-2.0
// The session listing against the real kernel target, in the test VM: a
// target, LUN and ACLs built by the driver; libiscsi logged in over IPv4 and
// over IPv6 with an ISID of its choosing. The listing shows that session as
// the initiator made it, and nothing once it has logged out. Debian's kernel
// has no "sessions" file, so this is the ACL "info" path; its text is
// printed for the record.
#include <gtest/gtest.h>

#include <chrono>
#include <cstring>
#include <iostream>
#include <thread>

#include "kernel/korvadm_sess.h"
#include "tests/vm/vm_initiator.h"
#include "tests/vm/vm_targets.h"

namespace {

using namespace vm;
using LioSessions = Driver;

const std::string kInitiator = "iqn.2026-01.vm:sess-init";

// Polls the listing until it holds `count` sessions; false after a minute.
bool wait_for_sessions(iscsi_target_t *t, int count)
{
    for (auto end = std::chrono::steady_clock::now() + std::chrono::minutes(1);
         std::chrono::steady_clock::now() < end; std::this_thread::sleep_for(std::chrono::milliseconds(200))) {
        korv::list_owner initiators(iscsi_initiator_free_list), sessions(iscsi_sess_free_list);
        if (iscsi_sess_get_target_session(sessions.get(), initiators.get(), t) == 0 && sessions.get()->count == count)
            return true;
    }
    return false;
}

TEST_F(LioSessions, ListsTheLoggedInInitiatorOverIpv4AndIpv6AndNothingAfterLogout)
{
    Target t = serve("iqn.2026-01.vm:sessions", "127.0.0.1", "::1");
    // LUN 0 read-write for the initiator, and an ACL no one logs in with,
    // whose text comes after the session's.
    map_lun_for(t.get(), "sessdisk", kInitiator);
    ASSERT_EQ(iscsi_mod_add_acl_initiator("iqn.2026-01.vm:v-idle", t.get()), 0);
    ASSERT_EQ(iscsi_mod_enable_target(t.get()), 0);
    const std::string info = tpg_dir(t.get()) + "/acls/" + kInitiator + "/info";

    const struct {
        const char *portal, *address;
        uint8_t isid[ISCSI_ISID_LEN];
    } logins[] = {{"127.0.0.1:3260", "127.0.0.1", {0x80, 0xa5, 0x43, 0x1f, 0x00, 0x01}},
                  {"[::1]:3260", "::1", {0x80, 0x14, 0x99, 0xf6, 0x00, 0x02}}};
    for (const auto &login : logins) {
        SCOPED_TRACE(login.address);
        {
            Session initiator(kInitiator, t->iqn, nullptr, login.portal, login.isid);
            ASSERT_TRUE(initiator.up);
            ASSERT_TRUE(wait_for_sessions(t.get(), 1)) << "no session listed:\n" << slurp(info);
            std::cout << "---- " << info << " over " << login.address << ":\n" << slurp(info) << "----\n";
            korv::list_owner initiators(iscsi_initiator_free_list), sessions(iscsi_sess_free_list);
            ASSERT_EQ(iscsi_sess_get_target_session(sessions.get(), initiators.get(), t.get()), 0);
            ASSERT_EQ(sessions.get()->count, 1);
            auto *s = static_cast<iscsi_sess_t *>(sessions.get()->head->owner);
            ASSERT_NE(s->initiator, nullptr);
            EXPECT_EQ(s->initiator->name, kInitiator);
            EXPECT_GT(s->tsih, 0);
            EXPECT_GT(s->sid, 0u);
            EXPECT_EQ(std::memcmp(s->isid, login.isid, ISCSI_ISID_LEN), 0);
            EXPECT_EQ(s->target_node.list, &t->sess_list);
            EXPECT_EQ(s->initiator_node.list, &s->initiator->sess_list);
            ASSERT_EQ(s->conn_list.count, 1);
            auto *c = static_cast<iscsi_conn_t *>(s->conn_list.head->owner);
            EXPECT_EQ(c->cid, 0);
            EXPECT_STREQ(c->address, login.address);
            EXPECT_EQ(c->initiator_name, kInitiator);
        }
        EXPECT_TRUE(wait_for_sessions(t.get(), 0)) << "still listed after logout:\n" << slurp(info);
    }
}

}  // namespace
