// The daemon as a real process: start-up, registration, signals, server
// faults and resources, against xmldbd in the test's root, a private isnsd
// (or the fault server) on the test's own loopback address, and plain
// portal directories standing for the kernel's.
#include <signal.h>

#include <atomic>
#include <chrono>
#include <memory>
#include <map>
#include <set>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

#include "tests/daemon/daemon_harness.h"
#include "tests/support/isns_isnsd.h"
#include "tests/support/isns_test_server.h"
#include "tests/support/xmldbd_fixture.h"

using namespace korv_test;
using namespace std::chrono_literals;

namespace {

constexpr uint16_t ISNS_REG = 1, ISNS_QRY = 2, ISNS_DEREG = 4;
constexpr auto kInterval = std::chrono::seconds(kTestInterval);
const std::string kEid = "nas-box1";

std::vector<target_spec> three_targets()
{
    return {{"t1", 1}, {"t2", 2}, {"t3", 3}};
}

// The objects isnsadm lists, each as its "name = value" lines.
std::vector<std::map<std::string, std::string>> objects(const std::string &listing)
{
    std::vector<std::map<std::string, std::string>> out;
    std::istringstream in(listing);
    for (std::string line; std::getline(in, line);) {
        if (line.rfind("Object ", 0) == 0) {
            out.emplace_back();
            continue;
        }
        size_t colon = line.find(": ");
        size_t eq = line.find(" = ");
        if (out.empty() || colon == std::string::npos || eq == std::string::npos || eq < colon)
            continue;
        std::string value = line.substr(eq + 3);
        if (value.size() >= 2 && value.front() == '"' && value.back() == '"')
            value = value.substr(1, value.size() - 2);
        out.back()[line.substr(colon + 2, eq - colon - 2)] = value;
    }
    return out;
}

std::set<std::string> node_names(const isnsd_server &srv)
{
    std::set<std::string> names;
    for (auto &o : objects(srv.adm("--list nodes")))
        names.insert(o["iSCSI name"]);
    return names;
}

std::set<std::string> entity_ids(const isnsd_server &srv)
{
    std::set<std::string> ids;
    for (auto &o : objects(srv.adm("--list entities")))
        ids.insert(o["Entity identifier"]);
    return ids;
}

// "iqn address port tag" of every portal group.
std::set<std::string> portal_groups(const isnsd_server &srv)
{
    std::set<std::string> pgs;
    for (auto &o : objects(srv.adm("--list portal-groups")))
        pgs.insert(o["Portal group name"] + " " + o["Portal group address"] + " " +
                   o["Portal group port"] + " " + o["Portal group tag"]);
    return pgs;
}

std::set<std::string> iqns(const std::string &eid, std::initializer_list<const char *> targets)
{
    std::set<std::string> out;
    for (const char *t : targets)
        out.insert(target_iqn(eid, t));
    return out;
}

// An appliance with its configuration service and host name NAS_Box1.
class Appliance : public ::testing::Test {
protected:
    void SetUp() override { set_host_name("NAS_Box1"); }

    XmldbService db_;
};

// ... and a private isnsd on the test's own address.
class WithIsnsd : public Appliance {
protected:
    void start_isnsd(const std::string &address)
    {
        if (!isnsd_available())
            GTEST_SKIP() << "isnsd not installed";
        srv_ = std::make_unique<isnsd_server>(address);
        ASSERT_TRUE(srv_->start()) << srv_->error();
    }
    bool holds(const std::set<std::string> &names, std::chrono::milliseconds limit)
    {
        return eventually([&] { return node_names(*srv_) == names; }, limit);
    }

    std::unique_ptr<isnsd_server> srv_;
};

uint16_t func_of(const bytes &pdu)
{
    return pdu.size() >= 4 ? static_cast<uint16_t>(pdu[2] << 8 | pdu[3]) : 0;
}

int count_func(const std::vector<bytes> &reqs, uint16_t func)
{
    int n = 0;
    for (const bytes &r : reqs)
        n += func_of(r) == func;
    return n;
}

// Answers like a server that takes no registration: DevAttrReg fails with
// status 3, queries find nothing, deregistrations succeed.
isns_fake_reply refusing_server(const bytes &req)
{
    uint16_t func = func_of(req);
    if (func == ISNS_REG)
        return {isns_pdu(0x8001, 0x4c00, {0, 0, 0, 3})};
    if (func == ISNS_QRY)
        return {isns_pdu(0x8002, 0x4c00, isns_query_rsp(0, "", {}))};
    return {isns_pdu(0x8000 | func, 0x4c00, {0, 0, 0, 0})};
}

}  // namespace

/* ---- start-up ---- */

TEST_F(Appliance, BadArgumentsExitOneWithTheirMessages)
{
    store_targets(kEid, three_targets());
    {
        daemon_process d(nesrad_test_binary(), "");
        EXPECT_EQ(1, d.wait_exit(5s));
        EXPECT_NE(std::string::npos, d.output().find("isns host address not given"));
    }
    {
        daemon_process d(nesrad_test_binary(), std::string(256, 'a'));
        EXPECT_EQ(1, d.wait_exit(5s));
        EXPECT_NE(std::string::npos, d.output().find("isns host address length exceed max len = 255\n"));
    }
    {
        // 255 characters pass the length check and fail the lookup (a label
        // over 63 characters is refused without asking any name server).
        daemon_process d(nesrad_test_binary(), std::string(255, 'a'));
        EXPECT_EQ(1, d.wait_exit(5s));
        EXPECT_EQ(std::string::npos, d.output().find("exceed")) << d.output();
        EXPECT_NE(std::string::npos, d.output().find("getaddrinfo return")) << d.output();
    }
    {
        daemon_process d(nesrad_test_binary(), "unresolvable..name");
        EXPECT_EQ(1, d.wait_exit(5s));
        EXPECT_NE(std::string::npos, d.output().find("getaddrinfo return")) << d.output();
    }
    EXPECT_LE(stored_pid(), 0) << "no failed start stores a pid";
}

TEST_F(Appliance, InstalledDaemonResolvesAHostName)
{
    // The installed daemon is linked statically: its host lookup must work.
    store_targets(kEid, {});
    daemon_process d(nesrad_binary(), "localhost");
    ASSERT_TRUE(d.wait_for("resolve address as ", 5s)) << d.output();
    std::string out = d.output();
    EXPECT_TRUE(out.find("resolve address as 127.0.0.1\n") != std::string::npos ||
                out.find("resolve address as ::1\n") != std::string::npos)
        << out;
    EXPECT_TRUE(eventually([&] { return stored_pid() == d.pid(); }, 5s));
    // Without targets nothing goes to that server; the daemon is killed
    // (not signalled) so that it stays that way.
}

TEST_F(Appliance, MissingHostNameIsAConfigurationFailure)
{
    SysRoot::remove("/proc/sys/kernel/hostname");
    daemon_process d(nesrad_test_binary(), "127.20.1.1");
    EXPECT_EQ(1, d.wait_exit(5s));
    EXPECT_NE(std::string::npos, d.output().find("get config failed")) << d.output();
}

TEST_F(Appliance, UnreadableTargetsExit255WithThePidLeftStored)
{
    std::vector<target_spec> targets = three_targets();
    targets[1].tpgt = -1;  // stored without "tpgt"
    store_targets(kEid, targets);
    daemon_process d(nesrad_test_binary(), "127.20.1.2");
    pid_t pid = d.pid();
    EXPECT_EQ(255, d.wait_exit(5s));
    EXPECT_NE(std::string::npos, d.output().find("get target conf from config failed")) << d.output();
    EXPECT_EQ(pid, stored_pid());
}

TEST_F(Appliance, UnreachableDatabaseExits255)
{
    store_targets(kEid, three_targets());
    db_.stop();
    daemon_process d(nesrad_test_binary(), "127.20.1.3");
    EXPECT_EQ(255, d.wait_exit(20s));
    EXPECT_NE(std::string::npos, d.output().find("get target conf from config failed")) << d.output();
}

/* ---- registration ---- */

TEST_F(WithIsnsd, RegistersEveryTargetWithItsPortalsAndTags)
{
    start_isnsd("127.20.2.1");
    store_targets(kEid, three_targets());
    daemon_process d(nesrad_test_binary(), "127.20.2.1");
    ASSERT_TRUE(holds(iqns(kEid, {"t1", "t2", "t3"}), 5s)) << srv_->adm("--list nodes") << d.output();

    EXPECT_EQ(std::set<std::string>{kEid}, entity_ids(*srv_));
    std::set<std::string> want;
    for (int i = 1; i <= 3; ++i) {
        std::string iqn = target_iqn(kEid, "t" + std::to_string(i));
        want.insert(iqn + " 192.0.2.10 3260/tcp " + std::to_string(i));
        want.insert(iqn + " 2001:db8::10 3260/tcp " + std::to_string(i));
    }
    EXPECT_EQ(want, portal_groups(*srv_));
    EXPECT_EQ(d.pid(), stored_pid());
}

TEST_F(WithIsnsd, PortalLessTargetInSecondPlaceIsRegisteredByName)
{
    start_isnsd("127.20.2.2");
    std::vector<target_spec> targets = three_targets();
    targets[1].portals.clear();
    store_targets(kEid, targets);
    daemon_process d(nesrad_test_binary(), "127.20.2.2");
    ASSERT_TRUE(holds(iqns(kEid, {"t1", "t2", "t3"}), 5s)) << srv_->adm("--list nodes") << d.output();
    // No portal group of ours for it (the server may make default ones,
    // but never with the target's own tag 2).
    for (const std::string &pg : portal_groups(*srv_))
        EXPECT_FALSE(pg.rfind(target_iqn(kEid, "t2") + " ", 0) == 0 && pg.back() == '2') << pg;
    EXPECT_EQ(1u, portal_groups(*srv_).count(target_iqn(kEid, "t3") + " 192.0.2.10 3260/tcp 3"));
    // The entity still answers the check: nothing is registered again.
    std::this_thread::sleep_for(2 * kInterval + 500ms);
    EXPECT_EQ(0, d.count("reinit")) << d.output();
}

TEST_F(WithIsnsd, PortalLessFirstTargetIsRegisteredAgainEveryInterval)
{
    start_isnsd("127.20.2.3");
    std::vector<target_spec> targets = three_targets();
    targets[0].portals.clear();
    store_targets(kEid, targets);
    daemon_process d(nesrad_test_binary(), "127.20.2.3");
    // Without portals the node type is dropped, so the check keyed on type
    // Target never finds the entity's node.
    EXPECT_TRUE(d.wait_for("our data on server has been delete, reinit", 3 * kInterval + 2s, 2))
        << d.output();
    EXPECT_GE(d.count("register entity="), 3);
    EXPECT_LE(d.count("register entity="), 5) << "once per interval, no faster";
}

TEST_F(WithIsnsd, FurtherTargetWithAForeignPortalIsMissing)
{
    start_isnsd("127.20.2.4");
    std::vector<target_spec> targets = three_targets();
    targets[2].portals = {"198.51.100.7:3260"};
    store_targets(kEid, targets);
    daemon_process d(nesrad_test_binary(), "127.20.2.4");
    ASSERT_TRUE(holds(iqns(kEid, {"t1", "t2"}), 5s)) << srv_->adm("--list nodes") << d.output();
    std::this_thread::sleep_for(500ms);
    EXPECT_EQ(iqns(kEid, {"t1", "t2"}), node_names(*srv_));
}

TEST_F(WithIsnsd, FirstTargetWhosePortalsCannotBeListedRegistersNoEntity)
{
    start_isnsd("127.20.2.5");
    std::vector<target_spec> targets = three_targets();
    targets[0].in_kernel = false;
    store_targets(kEid, targets);
    daemon_process d(nesrad_test_binary(), "127.20.2.5");
    ASSERT_TRUE(d.wait_for("register iqn=" + target_iqn(kEid, "t3"), 5s)) << d.output();
    EXPECT_NE(std::string::npos, d.output().find("can not get target ip"));
    // The further nodes go out with an empty source and portal groups for
    // portals no entity has: the server refuses them.
    std::this_thread::sleep_for(300ms);
    EXPECT_TRUE(node_names(*srv_).empty()) << srv_->adm("--list nodes");
    EXPECT_TRUE(entity_ids(*srv_).empty()) << srv_->adm("--list entities");
}

/* ---- signals ---- */

TEST_F(WithIsnsd, Sigusr1RegistersAnAddedTarget)
{
    start_isnsd("127.20.3.1");
    std::vector<target_spec> targets = three_targets();
    store_targets(kEid, targets);
    daemon_process d(nesrad_test_binary(), "127.20.3.1");
    ASSERT_TRUE(holds(iqns(kEid, {"t1", "t2", "t3"}), 5s)) << d.output();

    targets.push_back({"t4", 4});
    store_targets(kEid, targets);
    d.signal(SIGUSR1);
    EXPECT_TRUE(holds(iqns(kEid, {"t1", "t2", "t3", "t4"}), 5s)) << d.output();
    EXPECT_EQ(1, d.count("Received event SIGUSR1(10)"));
}

TEST_F(WithIsnsd, Sigusr2AfterAHostRenameRegistersUnderTheNewIdentifier)
{
    start_isnsd("127.20.3.2");
    store_targets(kEid, three_targets());
    daemon_process d(nesrad_test_binary(), "127.20.3.2");
    ASSERT_TRUE(holds(iqns(kEid, {"t1", "t2", "t3"}), 5s)) << d.output();

    set_host_name("NAS_Box2");
    store_targets("nas-box2", three_targets());
    d.signal(SIGUSR2);
    EXPECT_TRUE(holds(iqns("nas-box2", {"t1", "t2", "t3"}), 5s)) << srv_->adm("--list nodes") << d.output();
    EXPECT_EQ(std::set<std::string>{"nas-box2"}, entity_ids(*srv_)) << "the old entity was deregistered";
}

TEST_F(WithIsnsd, SigtermOnTheInstalledDaemonDeregistersAndClearsThePid)
{
    start_isnsd("127.20.3.3");
    store_targets(kEid, three_targets());
    daemon_process d(nesrad_binary(), "127.20.3.3");
    ASSERT_TRUE(holds(iqns(kEid, {"t1", "t2", "t3"}), 5s)) << d.output();
    EXPECT_EQ(d.pid(), stored_pid());

    d.signal(SIGTERM);
    EXPECT_EQ(0, d.wait_exit(5s)) << d.output();
    EXPECT_TRUE(entity_ids(*srv_).empty()) << srv_->adm("--list entities");
    EXPECT_TRUE(node_names(*srv_).empty());
    EXPECT_EQ(0, stored_pid());
}

TEST_F(Appliance, WithoutTargetsOnlyEachSignalSendsOneEmptyDeregistration)
{
    store_targets(kEid, {});
    isns_fake_server srv("127.20.3.4");
    ASSERT_TRUE(srv.ok()) << srv.error();
    srv.set_handler(refusing_server);
    daemon_process d(nesrad_test_binary(), "127.20.3.4");
    ASSERT_TRUE(eventually([] { return stored_pid() > 0; }, 5s));
    std::this_thread::sleep_for(2 * kInterval + 500ms);
    EXPECT_TRUE(srv.requests().empty()) << "nothing is sent while waiting";

    const bytes empty_source = isns_attr_str(32, "");
    ASSERT_EQ(12u, empty_source.size()) << "tag, length 4, four zero bytes";
    int n = 0;
    for (int sig : {SIGUSR1, SIGUSR2, SIGTERM}) {
        d.signal(sig);
        ++n;
        ASSERT_TRUE(eventually([&] { return srv.requests().size() >= static_cast<size_t>(n); }, 3s));
        std::this_thread::sleep_for(300ms);
        std::vector<bytes> reqs = srv.requests();
        ASSERT_EQ(static_cast<size_t>(n), reqs.size()) << "one request per signal";
        const bytes &r = reqs.back();
        EXPECT_EQ(ISNS_DEREG, func_of(r));
        ASSERT_GE(r.size(), 24u);
        EXPECT_EQ(empty_source, bytes(r.begin() + 12, r.begin() + 24));
    }
    EXPECT_EQ(0, d.wait_exit(3s));
    EXPECT_EQ(0, stored_pid());
}

TEST_F(Appliance, SignalDuringAnExchangeIsActedOnRightAfterIt)
{
    store_targets(kEid, three_targets());
    isns_fake_server srv("127.20.3.5");
    ASSERT_TRUE(srv.ok()) << srv.error();
    // The first registration's answer trickles in for about 1.2 s.
    std::atomic<int> regs{0};
    srv.set_handler([&](const bytes &req) {
        isns_fake_reply reply = refusing_server(req);
        if (func_of(req) == ISNS_REG && regs++ == 0) {
            reply.data = isns_pdu(0x8001, 0x4c00, {0, 0, 0, 0});
            reply.chunk = 4;
            reply.chunk_gap_ms = 300;
        }
        return reply;
    });
    // The installed daemon: its next check would be a minute away.
    daemon_process d(nesrad_binary(), "127.20.3.5");
    ASSERT_TRUE(eventually([&] { return !srv.requests().empty(); }, 5s)) << d.output();
    auto sent = std::chrono::steady_clock::now();
    d.signal(SIGUSR1);

    // Everything of the pass goes out, then the reload at once.
    ASSERT_TRUE(eventually([&] { return count_func(srv.requests(), ISNS_DEREG) == 1; }, 5s)) << d.output();
    EXPECT_LT(std::chrono::steady_clock::now() - sent, 4s);
    std::vector<bytes> reqs = srv.requests();
    ASSERT_GE(reqs.size(), 4u);
    EXPECT_EQ((std::vector<uint16_t>{ISNS_REG, ISNS_REG, ISNS_REG, ISNS_DEREG}),
              (std::vector<uint16_t>{func_of(reqs[0]), func_of(reqs[1]), func_of(reqs[2]), func_of(reqs[3])}));
    ASSERT_TRUE(eventually([&] { return count_func(srv.requests(), ISNS_REG) == 6; }, 5s));

    d.signal(SIGTERM);
    EXPECT_EQ(0, d.wait_exit(5s)) << d.output();
    EXPECT_EQ(1, d.count("Received event SIGUSR1(10)"));
}

/* ---- server faults ---- */

TEST_F(WithIsnsd, ServerDownAtStartIsRegisteredAfterItsFirstAnswer)
{
    if (!isnsd_available())
        GTEST_SKIP() << "isnsd not installed";
    store_targets(kEid, three_targets());
    srv_ = std::make_unique<isnsd_server>("127.20.4.1");
    daemon_process d(nesrad_test_binary(), "127.20.4.1");
    ASSERT_TRUE(d.wait_for("server failed", kInterval + 3s)) << d.output();
    ASSERT_TRUE(srv_->start()) << srv_->error();
    EXPECT_TRUE(holds(iqns(kEid, {"t1", "t2", "t3"}), 2 * kInterval + 3s)) << d.output();
    EXPECT_EQ(1, d.count("server is back, reinit"));
}

TEST_F(WithIsnsd, ServerRestartedEmptyGetsEverythingAgainWithinAnInterval)
{
    start_isnsd("127.20.4.2");
    store_targets(kEid, three_targets());
    daemon_process d(nesrad_test_binary(), "127.20.4.2");
    ASSERT_TRUE(holds(iqns(kEid, {"t1", "t2", "t3"}), 5s)) << d.output();
    ASSERT_TRUE(srv_->restart()) << srv_->error();
    EXPECT_TRUE(node_names(*srv_).empty());
    EXPECT_TRUE(holds(iqns(kEid, {"t1", "t2", "t3"}), kInterval + 3s)) << d.output();
    EXPECT_EQ(1, d.count("our data on server has been delete, reinit"));
    EXPECT_EQ(std::set<std::string>{kEid}, entity_ids(*srv_));
}

TEST_F(Appliance, RefusingServerGetsOneDeregistrationAndOneRegistrationPerInterval)
{
    store_targets(kEid, {{"t1", 1}});
    isns_fake_server srv("127.20.4.3");
    ASSERT_TRUE(srv.ok()) << srv.error();
    srv.set_handler(refusing_server);
    daemon_process d(nesrad_test_binary(), "127.20.4.3");
    ASSERT_TRUE(eventually([&] { return !srv.requests().empty(); }, 5s));
    std::this_thread::sleep_for(3 * kInterval + kInterval / 2);

    std::vector<bytes> reqs = srv.requests();
    int regs = count_func(reqs, ISNS_REG), deregs = count_func(reqs, ISNS_DEREG);
    int qrys = count_func(reqs, ISNS_QRY);
    EXPECT_EQ(3, deregs) << "one per interval";
    EXPECT_EQ(deregs + 1, regs);
    EXPECT_EQ(deregs, qrys) << "each pass ends after exactly one check";
    // Query, deregistration, registration: never two checks in one pass.
    for (size_t i = 1; i + 2 < reqs.size(); i += 3)
        EXPECT_EQ((std::vector<uint16_t>{ISNS_QRY, ISNS_DEREG, ISNS_REG}),
                  (std::vector<uint16_t>{func_of(reqs[i]), func_of(reqs[i + 1]), func_of(reqs[i + 2])}));
}

/* ---- resources ---- */

TEST_F(WithIsnsd, ManyReloadsLeakNothingAndKeepTheDescriptors)
{
    start_isnsd("127.20.5.1");
    store_targets(kEid, three_targets());
#ifdef KORV_SANITIZED
    // The sanitizer's leak check runs at exit and fails the exit status.
    std::vector<std::string> wrapper;
    auto limit = 5s;
#else
    if (system("command -v valgrind >/dev/null 2>&1") != 0)
        GTEST_SKIP() << "valgrind not installed";
    std::vector<std::string> wrapper = {"/usr/bin/valgrind", "--leak-check=full",
                                        "--errors-for-leak-kinds=definite,indirect",
                                        "--error-exitcode=99", "--quiet"};
    auto limit = 30s;
#endif
    daemon_process d(nesrad_test_binary(), "127.20.5.1", wrapper);
    ASSERT_TRUE(d.wait_for("register iqn=" + target_iqn(kEid, "t3"), limit)) << d.output();
    int fds = d.open_fds(1024);
    ASSERT_GT(fds, 0);
    for (int i = 2; i <= 21; ++i) {
        d.signal(i % 2 ? SIGUSR1 : SIGUSR2);
        ASSERT_TRUE(d.wait_for("register iqn=" + target_iqn(kEid, "t3"), limit, i)) << d.output();
    }
    EXPECT_EQ(fds, d.open_fds(1024));
    EXPECT_EQ(iqns(kEid, {"t1", "t2", "t3"}), node_names(*srv_));
    d.signal(SIGTERM);
    EXPECT_EQ(0, d.wait_exit(limit)) << d.output();
}
