// SPDX-License-Identifier: Apache-2.0
// The daemon as a real process: start-up, registration, signals, server
// faults and resources, against xmldbd in the test's root, a private isnsd
// (or the fault server) on the test's own loopback address, and plain
// portal directories standing for the kernel's. The program runs as process 1
// of a PID namespace of its own (tests/support/pidns), so that the
// management tool's "killall nesrad" can only reach the test's daemons.
#include <unistd.h>

#include <filesystem>
#include <memory>

#include <gtest/gtest.h>

#include "platform/xmldbc.h"
#include "tests/daemon/daemon_harness.h"
#include "tests/support/isns_isnsd.h"
#include "tests/support/isns_test_server.h"
#include "tests/support/xmldbd_fixture.h"

using namespace korv_test;
using namespace std::chrono_literals;
using ms = std::chrono::milliseconds;
using clock_type = std::chrono::steady_clock;

namespace {

constexpr uint16_t ISNS_REG = 1, ISNS_QRY = 2, ISNS_DEREG = 4;
constexpr ms kInterval = std::chrono::seconds(kTestInterval);
const std::string kEid = "nas-box1";
const std::vector<target_spec> kThreeTargets = {{"t1", 1}, {"t2", 2}, {"t3", 3}};

std::set<std::string> iqns(const std::string &eid, std::initializer_list<const char *> targets)
{
    std::set<std::string> out;
    for (const char *t : targets)
        out.insert(target_iqn(eid, t));
    return out;
}

const std::set<std::string> kThree = iqns(kEid, {"t1", "t2", "t3"});

std::set<std::string> node_names(const isnsd_server &srv) { return isnsadm_rows(srv, "nodes", "iSCSI name"); }
std::set<std::string> entity_ids(const isnsd_server &srv) { return isnsadm_rows(srv, "entities", "Entity identifier"); }

uint16_t func_of(const bytes &pdu) { return pdu.size() >= 4 ? static_cast<uint16_t>(pdu[2] << 8 | pdu[3]) : 0; }

// The function ids of the requests a fault server received.
std::vector<uint16_t> funcs(const isns_fake_server &srv)
{
    std::vector<uint16_t> out;
    for (const bytes &r : srv.requests())
        out.push_back(func_of(r));
    return out;
}

// Answers like a server that takes no registration: DevAttrReg fails with
// status 3, queries find nothing, deregistrations succeed.
isns_fake_reply refusing_server(const bytes &req)
{
    const uint16_t func = func_of(req);
    const bytes payload = func == ISNS_QRY ? isns_query_rsp(0, "", {}) : be32(func == ISNS_REG ? 3 : 0);
    return {isns_pdu(0x8000 | func, 0x4c00, payload)};
}

// An appliance with its configuration service (which loads the saved
// configuration file at every start) and host name NAS_Box1; a private isnsd
// on the test's own address when the case starts one.
class Appliance : public ::testing::Test {
protected:
    void SetUp() override { set_host_name("NAS_Box1"); }
    void start_isnsd(const std::string &address, int period = 0)
    {
        srv_ = std::make_unique<isnsd_server>(address, period);
        ASSERT_TRUE(srv_->start()) << srv_->error();
    }
    bool holds(const std::set<std::string> &names, ms limit)
    {
        return eventually([&] { return node_names(*srv_) == names; }, limit);
    }
    static bool pid_stored(const daemon_process &d)
    {
        return eventually([&] { return stored_pid() == d.pid(); }, 5s);
    }

    XmldbService db_{false, SysRoot::file("/etc/NAS_CFG/config.xml")};
    std::unique_ptr<isnsd_server> srv_;
};

// The cases that need a real isnsd (a skip must come from the fixture or the
// case itself: a helper's only ends the helper).
class ApplianceWithIsnsd : public Appliance {
protected:
    void SetUp() override
    {
        Appliance::SetUp();
        if (!isnsd_available())
            GTEST_SKIP() << "isnsd not installed";
    }
};

}  // namespace

// ---- start-up ----

TEST_F(Appliance, StartUpFailuresExitWithTheirStatusAndMessages)
{
    store_targets(kEid, kThreeTargets);
    struct {
        std::string arg, says;
        int status = 1;
    } cases[] = {
        {"", "isns host address not given"},
        {std::string(256, 'a'), "isns host address length exceed max len = 255\n"},
        // 255 characters pass the length check and fail the lookup (a label
        // over 63 characters is refused without asking any name server).
        {std::string(255, 'a'), "getaddrinfo return"},
        {"--help", "usage: nesrad <server>\n", 0},
        {"--version", "nesrad " NESRAD_VERSION "\n", 0},
    };
    for (auto &c : cases) {
        daemon_process d(nesrad_test_binary(), c.arg);
        EXPECT_EQ(c.status, d.wait(5s)) << c.arg.substr(0, 10);
        EXPECT_GE(d.count(c.says), 1) << d.output();
    }
    EXPECT_LE(stored_pid(), 0) << "no failed start stores a pid";

    // The database gone: asked again once a second for 10 s, then 255. (A
    // broken record alone does not fail the read: the store skips it.)
    db_.stop();
    daemon_process no_db(nesrad_test_binary(), "127.20.1.2");
    EXPECT_EQ(255, no_db.wait(20s));
    EXPECT_GE(no_db.count("get target conf from config failed"), 1) << no_db.output();
    EXPECT_NEAR(10, no_db.count("configuration service not answering"), 1) << no_db.output();
    db_.restart();

    // The installed daemon's host lookup (also when linked statically).
    // Without targets nothing goes to that server.
    store_targets(kEid, {});
    daemon_process local(nesrad_binary(), "localhost");
    ASSERT_TRUE(local.wait_for("resolve address as ", 5s)) << local.output();
    EXPECT_EQ(1, local.count("resolve address as 127.0.0.1\n") + local.count("resolve address as ::1\n"))
        << local.output();
    SysRoot::remove("/proc/sys/kernel/hostname");
    daemon_process d(nesrad_binary(), "127.20.1.1");
    EXPECT_EQ(1, d.wait(5s));
    EXPECT_GE(d.count("get config failed"), 1) << d.output();
}

// ---- registration ----

TEST_F(ApplianceWithIsnsd, RegistersEveryTargetAndFollowsSignals)
{
    // The server comes up only after the daemon's first attempt failed.
    srv_ = std::make_unique<isnsd_server>("127.20.2.1");
    std::vector<target_spec> targets = {{"t1", 1}, {"t2", 2}, {"t3", 3}, {"t4", 4}};
    targets[1].portals.clear();                   // registered by name
    targets[2].portals = {"198.51.100.7:3260"};  // not the entity's: refused
    store_targets(kEid, targets);
    daemon_process d(nesrad_test_binary(), "127.20.2.1");
    ASSERT_TRUE(d.wait_for("server failed", kInterval + 5s)) << d.output();
    ASSERT_TRUE(srv_->start()) << srv_->error();
    ASSERT_TRUE(holds(iqns(kEid, {"t1", "t2", "t4"}), 2 * kInterval + 5s)) << srv_->adm("--list nodes") << d.output();
    EXPECT_EQ(std::set<std::string>{kEid}, entity_ids(*srv_));
    EXPECT_EQ(1, d.count("server is back, reinit"));

    // A reload (a server that lost our data: EverythingHangsOnTheFirstTarget)
    // while the configuration service is down for 3 s, to come back with
    // the saved file. Portal groups with each target's own tag:
    // vm_appliance_e2e; SIGUSR1 re-registration: the reload cases below.
    set_host_name("NAS_Box2");
    store_targets("nas-box2", kThreeTargets);
    ASSERT_EQ(0, xml_write_file("/etc/NAS_CFG/config.xml"));
    db_.stop();
    d.signal(SIGUSR2);
    ASSERT_TRUE(holds({}, 5s)) << "deregistered for the reload";
    std::this_thread::sleep_for(3s);
    db_.restart();
    EXPECT_TRUE(holds(iqns("nas-box2", {"t1", "t2", "t3"}), 5s)) << srv_->adm("--list nodes") << d.output();
    EXPECT_EQ(std::set<std::string>{"nas-box2"}, entity_ids(*srv_)) << "the old entity was deregistered";
    EXPECT_EQ(1, d.count("Received event SIGUSR2(12)"));

    // Twenty more reloads keep the descriptors (leaks: the sanitizer build's
    // leak check fails the exit status), counted while it waits between passes.
    const std::string last = "register iqn=" + target_iqn("nas-box2", "t3");
    auto idle_fds = [&] {
        EXPECT_TRUE(eventually([&] { return d.idle(); }, 5s));
        auto fds = std::filesystem::directory_iterator("/proc/" + std::to_string(d.pid()) + "/fd");
        return std::distance(begin(fds), end(fds));
    };
    const auto fds = idle_fds();
    ASSERT_GT(fds, 0);
    for (int i = 2; i <= 21; ++i) {
        d.signal(i % 2 ? SIGUSR1 : SIGUSR2);
        ASSERT_TRUE(d.wait_for(last, 5s, i)) << d.output();
    }
    EXPECT_EQ(fds, idle_fds());
    EXPECT_TRUE(holds(iqns("nas-box2", {"t1", "t2", "t3"}), 5s)) << d.output();

    // A second daemon waits for the first, and gives up after 20 s (one that
    // starts while the first stops takes over: RestartsAreOrdered).
    const auto started = clock_type::now();
    daemon_process d2(nesrad_test_binary(), "127.20.2.1");
    EXPECT_EQ(1, d2.wait(30s)) << d2.output();
    EXPECT_GE(clock_type::now() - started, 19s);
    EXPECT_EQ(1, d2.count("another nesrad is running\n")) << d2.output();
    EXPECT_EQ(d.pid(), stored_pid());

    // SIGINT stops as SIGTERM does: deregistered, pid 0.
    d.signal(SIGINT);
    EXPECT_EQ(0, d.wait(5s)) << d.output();
    EXPECT_TRUE(entity_ids(*srv_).empty()) << srv_->adm("--list entities");
    EXPECT_EQ(0, stored_pid());
}

TEST_F(ApplianceWithIsnsd, EverythingHangsOnTheFirstTarget)
{
    start_isnsd("127.20.2.3");
    std::vector<target_spec> targets = kThreeTargets;
    targets[0].in_kernel = false;
    store_targets(kEid, targets);
    // Its portals cannot be listed: no entity, and the further nodes go
    // out with an empty source, which the server refuses. Judged once the
    // pass is over (the daemon back in its wait), which the installed
    // daemon's minute keeps clear of the next check's clean-up.
    daemon_process first(nesrad_binary(), "127.20.2.3");
    ASSERT_TRUE(first.wait_for("register iqn=" + target_iqn(kEid, "t3"), 5s)) << first.output();
    ASSERT_TRUE(eventually([&] { return first.idle(); }, 10s)) << first.output();
    EXPECT_GE(first.count("can not get target ip"), 1) << first.output();
    EXPECT_TRUE(entity_ids(*srv_).empty()) << srv_->adm("--list nodes");
    first.kill();
    // It has no portals: the node type is dropped, so the check keyed on
    // type Target never finds the entity's node and registers again each time.
    targets[0] = {"t1", 1, {}};
    store_targets(kEid, targets);
    daemon_process d(nesrad_test_binary(), "127.20.2.3");
    EXPECT_TRUE(d.wait_for("our data on server has been delete, reinit", 6 * kInterval + 10s, 4)) << d.output();
}

// ---- signals ----

TEST_F(Appliance, SignalsWaitForTheExchangeInHandAndAStopForNoMore)
{
    const bytes ok = isns_pdu(0x8001, 0x4c00, {0, 0, 0, 0});
    auto first_trickles = [&, n = std::make_shared<int>(0)](const bytes &req) {
        return func_of(req) == ISNS_REG && (*n)++ == 0 ? isns_fake_reply{ok, 4, 300} : refusing_server(req);
    };
    std::vector<target_spec> eight;
    for (int i = 1; i <= 8; ++i)
        eight.push_back({"t" + std::to_string(i), i});
    struct {
        const char *server;
        size_t targets, most;  // most: without `want`, at most this many requests, the last a deregistration
        std::function<isns_fake_reply(const bytes &)> reply;
        std::string binary;
        ms quiet, exit_within;                    // quiet: before the first signal
        std::vector<std::pair<int, ms>> signals;  // each then a pause
        std::vector<uint16_t> want;               // every request
    } cases[] = {
        // No targets: nothing goes out while waiting; one empty deregistration per signal.
        {"127.20.3.4", 0, 0, refusing_server, nesrad_test_binary(), 2 * kInterval + 500ms, 3s,
         {{SIGUSR1, 1s}, {SIGUSR2, 1s}, {SIGTERM, 0s}}, {ISNS_DEREG, ISNS_DEREG, ISNS_DEREG}},
        // A reload during a slow answer: the pass goes on, the reload follows at once.
        {"127.20.3.5", 3, 0, first_trickles, nesrad_binary(), 0ms, 3s, {{SIGUSR1, 4s}, {SIGTERM, 0s}},
         {ISNS_REG, ISNS_REG, ISNS_REG, ISNS_DEREG, ISNS_REG, ISNS_REG, ISNS_REG, ISNS_DEREG}},
        // The management tool's pacing against a silent server (1 s per
        // exchange): the stop ends the pass after the exchange in hand.
        {"127.20.3.6", 8, 5, [](const bytes &) { return isns_fake_reply{{}, 0, 0, 1000}; }, nesrad_binary(), 0ms, 5s,
         {{SIGUSR1, 1s}, {SIGUSR1, 1s}, {SIGTERM, 0s}}, {}},
    };
    for (auto &c : cases) {
        isns_fake_server srv(c.server, c.reply);
        store_targets(kEid, {eight.begin(), eight.begin() + c.targets});
        daemon_process d(c.binary, c.server);
        ASSERT_TRUE(pid_stored(d)) << d.output();
        std::this_thread::sleep_for(c.quiet);
        for (auto [sig, pause] : c.signals) {
            d.signal(sig);
            std::this_thread::sleep_for(pause);
        }
        EXPECT_EQ(0, d.wait(c.exit_within)) << c.server << d.output();
        EXPECT_EQ(0, stored_pid());
        // The server reads each request only when done with the one before.
        EXPECT_TRUE(eventually([&] { return !funcs(srv).empty() && funcs(srv).back() == ISNS_DEREG; }, 13s));
        if (c.want.empty())
            EXPECT_LE(funcs(srv).size(), c.most) << c.server;
        else
            EXPECT_EQ(c.want, funcs(srv)) << c.server;
        // Without targets the source is attribute 32 of length 4, four zero bytes.
        for (const bytes &r : c.targets ? std::vector<bytes>{} : srv.requests())
            EXPECT_EQ(isns_attr_str(32, ""), bytes(r.begin() + 12, r.begin() + std::min<size_t>(24, r.size())));
    }
}

TEST_F(ApplianceWithIsnsd, AStopIsNeverLostAndRestartsAreOrdered)
{
    start_isnsd("127.20.3.9");
    store_targets(kEid, kThreeTargets);
    // A stop and a reload both arriving while the registration holds them
    // back, in either order; SIGINT is a stop.
    for (int i = 0; i < 30; ++i) {
        const int stop = i % 2 ? SIGTERM : SIGINT;
        daemon_process d(nesrad_test_binary(), "127.20.3.9");
        ASSERT_TRUE(pid_stored(d)) << d.output();
        d.signal(i % 4 < 2 ? SIGUSR1 : stop);
        d.signal(i % 4 < 2 ? stop : SIGUSR1);
        ASSERT_EQ(0, d.wait(5s)) << "run " << i << d.output();
        EXPECT_EQ(0, stored_pid()) << "run " << i;
        EXPECT_TRUE(entity_ids(*srv_).empty()) << "run " << i;
    }

    // The management tool's restart, "killall -SIGTERM nesrad" then a new
    // daemon at once, 30 times against a healthy and a silent server: the old
    // daemon ends, the stored pid is then the new one's, and the healthy
    // server holds the registration a moment later.
    if (getpid() != 1)
        GTEST_SKIP() << "killall needs a PID namespace of the test's own (root, unshare)";
    isns_fake_server silent("127.20.3.10", isns_fake_reply{{}, 0, 0, 1000});
    for (const std::string server : {"127.20.3.9", "127.20.3.10"}) {
        std::unique_ptr<daemon_process> d;
        for (int i = 0; i <= 30; ++i) {
            ASSERT_NE(-1, std::system("killall -SIGTERM nesrad 1>/dev/null 2>/dev/null"));
            auto next = std::make_unique<daemon_process>(nesrad_binary(), server);
            if (d) {
                EXPECT_EQ(0, d->wait(30s)) << server << " run " << i << d->output();
            }
            d = std::move(next);
            ASSERT_TRUE(pid_stored(*d)) << server << " run " << i;
            EXPECT_TRUE(server != "127.20.3.9" || holds(kThree, 5s)) << "run " << i;
        }
    }
}

// ---- server faults ----

// Judged on the mean spacing of five passes, so a loaded machine that delays
// one does not fail the test while a daemon that checks twice as often or
// half as often still does.
TEST_F(Appliance, RefusingServerGetsOneDeregistrationAndOneRegistrationPerInterval)
{
    store_targets(kEid, {{"t1", 1}});
    isns_fake_server srv("127.20.4.3", refusing_server);
    daemon_process d(nesrad_test_binary(), "127.20.4.3");
    const std::string pass = "):register entity=";  // "):" ends the log prefix: not "deregister"
    ASSERT_TRUE(d.wait_for(pass, 2 * kInterval + 5s)) << d.output();
    const auto first = clock_type::now();
    ASSERT_TRUE(d.wait_for(pass, 12 * kInterval, 5)) << d.output();
    const auto mean = (clock_type::now() - first) / 4;
    EXPECT_GE(mean, kInterval * 3 / 4) << "faster than once per interval";
    EXPECT_LE(mean, kInterval * 3 / 2) << "slower than once per interval";
    // Registration, then per pass query, deregistration, registration: never
    // two checks in one pass.
    const std::vector<uint16_t> got = funcs(srv);
    ASSERT_GE(got.size(), 13u);
    EXPECT_EQ(ISNS_REG, got[0]);
    for (size_t i = 1; i + 2 < got.size(); i += 3)
        EXPECT_EQ(std::vector<uint16_t>({ISNS_QRY, ISNS_DEREG, ISNS_REG}), std::vector(&got[i], &got[i + 3])) << i;
}

TEST_F(ApplianceWithIsnsd, ShortRegistrationPeriodNeverLetsTheTargetsExpire)
{
    // 20 s: the installed daemon's minute would lose them two times in three.
    start_isnsd("127.20.4.5", 20);
    store_targets(kEid, kThreeTargets);
    daemon_process d(nesrad_binary(), "127.20.4.5");
    ASSERT_TRUE(holds(kThree, 5s)) << d.output();
    int missing = 0;
    for (auto at = clock_type::now(), end = at + 120s; at < end; std::this_thread::sleep_until(at += 1s))
        missing += node_names(*srv_) != kThree;
    EXPECT_EQ(0, missing) << "seconds without the targets" << d.output();
    EXPECT_EQ(0, d.count("reinit")) << d.output();
}
