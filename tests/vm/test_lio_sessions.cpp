// SPDX-License-Identifier: Apache-2.0
// The session listing against the real kernel target, inside the test VM
// (tests/vm/lio_sessions.sh runs this binary there). A target built by the
// driver, a real initiator (libiscsi's iscsi-perf, copied in when the host
// has it) logged in over IPv4 and IPv6 to a LUN and ACL the driver made:
// the listing shows that session as the kernel's own text has it, and
// nothing once the initiator has gone.
// Debian's kernel has no "sessions" file, so this is the ACL "info" path.
#include <fcntl.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstring>
#include <fstream>
#include <iostream>
#include <iterator>
#include <sstream>
#include <string>
#include <thread>

#include <gtest/gtest.h>

#include "kernel/korvadm_mod_lio4.h"
#include "kernel/korvadm_sess.h"
#include "tests/vm/vm_targets.h"

namespace {

const char *const kPerf = "/usr/bin/iscsi-perf";
const std::string kInitiator = "iqn.2026-01.vm:sess-init";

std::string slurp(const std::string &path)
{
    std::ifstream in(path);
    return std::string(std::istreambuf_iterator<char>(in), {});
}

// One call of the listing, with its lists.
struct Listing {
    list_t sessions, initiators;
    int rc;
    explicit Listing(iscsi_target_t *t)
    {
        list_init(&sessions);
        list_init(&initiators);
        rc = iscsi_sess_get_target_session(&sessions, &initiators, t);
    }
    ~Listing()
    {
        iscsi_sess_free_list(&sessions);
        iscsi_initiator_free_list(&initiators);
    }
    iscsi_sess_t *first() const { return sessions.head ? static_cast<iscsi_sess_t *>(sessions.head->owner) : nullptr; }
};

// Polls the listing until it holds `count` sessions; false after `limit`.
bool wait_for_sessions(iscsi_target_t *t, int count, std::chrono::seconds limit)
{
    auto deadline = std::chrono::steady_clock::now() + limit;
    while (std::chrono::steady_clock::now() < deadline) {
        Listing l(t);
        if (l.rc == 0 && l.sessions.count == count)
            return true;
        std::this_thread::sleep_for(std::chrono::milliseconds(200));
    }
    return false;
}

// iscsi-perf logged in as kInitiator, reading LUN 0 for `seconds`.
pid_t start_initiator(const std::string &url, int seconds)
{
    pid_t pid = fork();
    if (pid == 0) {
        int null = open("/dev/null", O_WRONLY);
        dup2(null, 1);
        dup2(null, 2);
        std::string secs = std::to_string(seconds);
        execl(kPerf, "iscsi-perf", "-i", kInitiator.c_str(), "-t", secs.c_str(), url.c_str(), nullptr);
        _exit(127);
    }
    return pid;
}

// Waits for the initiator to log out and end; kills it after `limit`.
bool wait_exit(pid_t pid, std::chrono::seconds limit)
{
    auto deadline = std::chrono::steady_clock::now() + limit;
    int status = 0;
    while (std::chrono::steady_clock::now() < deadline) {
        if (waitpid(pid, &status, WNOHANG) == pid)
            return true;
        std::this_thread::sleep_for(std::chrono::milliseconds(100));
    }
    kill(pid, SIGKILL);
    waitpid(pid, &status, 0);
    return false;
}

// The ISID bytes as the kernel's text gives them, read apart from the parser.
bool isid_in_text(const std::string &text, uint8_t out[ISCSI_ISID_LEN])
{
    size_t at = text.find("ISID: ");
    if (at == std::string::npos)
        return false;
    std::istringstream in(text.substr(at + 6));
    for (int i = 0; i < ISCSI_ISID_LEN; ++i) {
        unsigned v = 0;
        if (!(in >> std::hex >> v))
            return false;
        out[i] = static_cast<uint8_t>(v);
    }
    return true;
}

class LioSessions : public ::testing::Test {
protected:
    void SetUp() override
    {
        if (access(kPerf, X_OK) != 0)
            GTEST_SKIP() << "no iSCSI initiator in the VM (libiscsi-bin not installed on the host)";
        ASSERT_EQ(iscsi_mod_select(ISCSI_MOD_TYPE_LIO), 0);
        ASSERT_EQ(iscsi_mod_start(), 0);
        t_ = vm::make_target("iqn.2026-01.vm:sessions", 1);
        ASSERT_EQ(iscsi_mod_add_target(t_.get()), 0);
        ASSERT_TRUE(vm::want_portal(t_.get(), "127.0.0.1", "::1", 3260));
        ASSERT_EQ(iscsi_mod_set_target_ip(t_.get()), 0);
        ASSERT_EQ(iscsi_mod_set_target_chap(t_.get()), 0);  // CHAP off
        tpg_ = std::string("/sys/kernel/config/target/iscsi/") + t_->iqn + "/tpgt_1";
        acl_ = tpg_ + "/acls/" + kInitiator;
        // A 1 MiB file as LUN 0, read-write for the initiator; and an ACL no
        // one logs in with, whose text comes after the session's.
        lun_ = iscsi_lun_new();
        ASSERT_NE(lun_, nullptr);
        std::strcpy(lun_->name, "sessdisk");
        std::strcpy(lun_->path, "/tmp/sessdisk.img");
        std::strcpy(lun_->serial, "sess0001");
        lun_->size = 1 << 20;
        lun_->hba_id = 0;
        ASSERT_EQ(iscsi_mod_add_backstore(lun_), 0);
        ASSERT_EQ(iscsi_mod_add_lun_mapping(lun_, t_.get(), 0), 0);
        ASSERT_EQ(iscsi_mod_add_acl_initiator(kInitiator.c_str(), t_.get()), 0);
        ASSERT_EQ(iscsi_mod_add_acl_initiator("iqn.2026-01.vm:v-idle", t_.get()), 0);
        iscsi_map_lun_t map{};
        map.target = t_.get();
        map.lun = lun_;
        map.lun_num = 0;
        iscsi_initiator_t init{};
        std::strcpy(init.name, kInitiator.c_str());
        iscsi_lun_acl_t acl{};
        acl.map_lun = &map;
        acl.initiator = &init;
        acl.access_right = 2;
        ASSERT_EQ(iscsi_mod_add_lun_acl(&acl), 0);
        ASSERT_EQ(iscsi_mod_enable_target(t_.get()), 0);
    }
    void TearDown() override
    {
        if (!t_)
            return;
        EXPECT_EQ(iscsi_mod_del_target(t_.get()), 0);
        if (lun_) {
            EXPECT_EQ(iscsi_mod_del_backstore(lun_), 0);
            iscsi_lun_free(lun_);
        }
        EXPECT_EQ(iscsi_mod_stop(), 0);
    }

    vm::Target t_;
    iscsi_lun_t *lun_ = nullptr;
    std::string tpg_, acl_;
};

TEST_F(LioSessions, ListsTheLoggedInInitiatorOverIpv4AndIpv6AndNothingAfterLogout)
{
    struct {
        const char *url_host;
        const char *address;
    } logins[] = {{"127.0.0.1", "127.0.0.1"}, {"[::1]", "::1"}};
    for (auto &login : logins) {
        SCOPED_TRACE(login.address);
        {
            Listing idle(t_.get());
            EXPECT_EQ(idle.rc, 0);
            EXPECT_EQ(idle.sessions.count, 0) << slurp(acl_ + "/info");
        }
        pid_t perf = start_initiator(std::string("iscsi://") + login.url_host + ":3260/" + t_->iqn + "/0", 8);
        ASSERT_GT(perf, 0);
        bool up = wait_for_sessions(t_.get(), 1, std::chrono::seconds(60));
        const std::string text = slurp(acl_ + "/info");
        std::cout << "---- " << acl_ << "/info while logged in over " << login.address << ":\n" << text << "----\n";
        EXPECT_TRUE(up) << "no session listed";
        if (up) {
            Listing l(t_.get());
            iscsi_sess_t *s = l.first();
            ASSERT_NE(s, nullptr);
            ASSERT_NE(s->initiator, nullptr);
            EXPECT_EQ(std::string(s->initiator->name), kInitiator);
            EXPECT_GT(s->tsih, 0);
            EXPECT_GT(s->sid, 0u);
            uint8_t isid[ISCSI_ISID_LEN];
            ASSERT_TRUE(isid_in_text(text, isid)) << text;
            EXPECT_EQ(std::memcmp(s->isid, isid, ISCSI_ISID_LEN), 0);
            EXPECT_EQ(s->target_node.list, &t_->sess_list);
            EXPECT_EQ(s->initiator_node.list, &s->initiator->sess_list);
            ASSERT_EQ(s->conn_list.count, 1);
            auto *c = static_cast<iscsi_conn_t *>(s->conn_list.head->owner);
            EXPECT_EQ(c->cid, 0);
            EXPECT_STREQ(c->address, login.address);
            EXPECT_STREQ(c->initiator_name, kInitiator.c_str());
        }
        EXPECT_TRUE(wait_exit(perf, std::chrono::seconds(90))) << "iscsi-perf did not end";
        EXPECT_TRUE(wait_for_sessions(t_.get(), 0, std::chrono::seconds(60)))
            << "still listed after logout:\n" << slurp(acl_ + "/info");
    }
}

}  // namespace
