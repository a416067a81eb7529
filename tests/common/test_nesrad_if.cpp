// SPDX-License-Identifier: Apache-2.0
// The daemon control interface: starting, restarting, stopping and
// signalling nesrad through the shell and the stored settings, with a
// stand-in daemon as the witness of what the shell passed, and the real
// daemon for the stored pid. Everything here stops daemons by
// name, so it runs only as process 1 of its own PID namespace.
#include "common/korvadm_nesrad_if.h"
#include "common/korvadm_err.h"
#include "config/korvadm_xmldb_conf.h"
#include "tests/daemon/daemon_harness.h"
#include "tests/support/xmldbd_fixture.h"

#include <gtest/gtest.h>

#include <chrono>
#include <csignal>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <string>
#include <sys/wait.h>
#include <tuple>
#include <unistd.h>
#include <vector>

namespace {

using namespace korv_test;
using namespace std::chrono_literals;

// Daemons the shell started are orphans reparented to us (process 1): reap
// the ones that ended, then list the live processes named nesrad.
std::vector<pid_t> running_daemons()
{
    while (waitpid(-1, nullptr, WNOHANG) > 0) {
    }
    std::vector<pid_t> pids;
    for (const auto &e : std::filesystem::directory_iterator("/proc")) {
        std::ifstream comm(e.path() / "comm");
        std::string name;
        if (std::getline(comm, name) && name == "nesrad")
            pids.push_back(std::atoi(e.path().filename().c_str()));
    }
    return pids;
}

bool settled(size_t count)
{
    return eventually([&] { return running_daemons().size() == count; }, 10s);
}

// The stored iSNS enable flag and server: "<flag> <server>".
std::string stored()
{
    return xmldb_get("/system_mgr/iscsi/iSNS/enable") + " " + xmldb_get("/system_mgr/iscsi/iSNS/ip");
}

class NesradControl : public SysRootTest {
protected:
    void SetUp() override
    {
        if (getpid() != 1)
            GTEST_SKIP() << "stops processes by name: needs its own PID namespace (run as root with unshare)";
        SysRootTest::SetUp();
        db_ = std::make_unique<XmldbService>();
    }
    void TearDown() override
    {
        if (getpid() == 1) {
            isns_set_ctl_module(0, nullptr);
            settled(0);
            setenv("PATH", path_.c_str(), 1);
        }
    }
    // "nesrad" on PATH is the stand-in (or the real daemon's directory).
    void use_daemon_dir(const std::string &dir) { setenv("PATH", (dir + ":" + path_).c_str(), 1); }
    // The arguments the stand-in was started with, one start a line.
    static std::string standin_args() { return SysRoot::read("/standin.args"); }

    std::unique_ptr<XmldbService> db_;
    std::string path_ = std::getenv("PATH");
};

TEST_F(NesradControl, SettingStartsRestartsAndStopsOnlyWhenTheServiceRuns)
{
    use_daemon_dir(STANDIN_DIR);
    const std::string hostile = "isns\"$(touch x)`id`\\.example", both = hostile + "\nsecond.example\n";
    // The service switch; the call's state, server and use_stored; its answer;
    // then the stored settings, the stand-in's arguments so far (a line a
    // start) and the daemons running.
    const std::tuple<int, int, const char *, int, int, std::string, std::string, size_t> steps[] = {
        // Service disabled: only stored, nothing started.
        {0, 1, "first.example", 0, KORV_OK, "1 first.example", "", 0},
        {0, 2, "first.example", 0, ERR_PARAM, "1 first.example", "", 0},
        // Service enabled, flag already 1 with another server: a start with the
        // escaped server, which reaches the daemon byte for byte.
        {1, 1, hostile.c_str(), 0, KORV_OK, "1 " + hostile, hostile + "\n", 1},
        // Same server (stored one used): the running daemon is left alone.
        {1, 1, "ignored", 1, KORV_OK, "1 " + hostile, hostile + "\n", 1},
        // Another server: stopped by name, then a new daemon.
        {1, 1, "second.example", 0, KORV_OK, "1 second.example", both, 1},
        // Off with the service disabled: stored only; with it enabled: stopped.
        {0, 0, nullptr, 0, KORV_OK, "0 second.example", both, 1},
        {1, 0, nullptr, 0, KORV_OK, "0 second.example", both, 0}};
    for (const auto &[service, state, server, use_stored, rc, settings, starts, running] : steps) {
        const std::vector<pid_t> before = running_daemons();
        const std::string started = standin_args();
        xmldb_set_service_enable(service);
        EXPECT_EQ(rc, isns_set_setting(state, server, use_stored)) << settings;
        EXPECT_EQ(stored(), settings);
        EXPECT_TRUE(eventually([want = starts] { return standin_args() == want; }, 10s)) << standin_args();
        EXPECT_TRUE(settled(running)) << settings;
        // Neither started nor stopped: the very same daemon.
        EXPECT_TRUE(starts != started || running != before.size() || running_daemons() == before) << settings;
    }
    EXPECT_FALSE(exists(at("/x"))) << "a command in the server text ran";
}

// The signal path itself (SIGUSR1, a target re-registered) runs end to end
// in vm_appliance_e2e; here the pid the real daemon stores is the one signalled.
TEST_F(NesradControl, NotifyReachesTheRealDaemonAndResetClearsTheSettings)
{
    // No daemon: nothing is signalled and the tool does not wait.
    auto t0 = std::chrono::steady_clock::now();
    notify_isnsclient(SIGUSR1);
    EXPECT_LT(std::chrono::steady_clock::now() - t0, 999ms);

    set_host_name("nas1");
    store_targets("nas1", {});
    use_daemon_dir(NESRAD_DIR);
    xmldb_set_service_enable(1);
    ASSERT_EQ(0, isns_set_setting(1, "127.60.0.1", 0));
    ASSERT_TRUE(eventually([&] { return stored_pid() > 0; }, 10s));
    // An empty server is refused before anything is stopped (a daemon stopped
    // is gone well within the second).
    EXPECT_EQ(ERR_PARAM, isns_set_ctl_module(1, ""));
    EXPECT_FALSE(eventually([&] { return running_daemons().empty(); }, 1s));
    notify_isnsclient(SIGTERM);
    EXPECT_TRUE(settled(0));
    EXPECT_EQ(0, isns_factory_reset());
    EXPECT_EQ(stored(), " ");
}

}  // namespace
