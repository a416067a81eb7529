// nesrad end to end inside the test VM: the configuration database service
// and a private isnsd run in the VM, targets are created in the real kernel
// through the driver and stored in the database, and the daemon (the
// installed binary) registers them. isnsadm must then show every target with
// the portals the kernel reports, and nothing after SIGTERM.
#include <arpa/inet.h>
#include <signal.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <chrono>
#include <cstring>
#include <map>
#include <memory>
#include <set>
#include <sstream>
#include <string>
#include <vector>

#include "common/korvadm_sys.h"
#include "config/korvadm_conf.h"
#include "config/korvadm_xmldb_conf.h"
#include "kernel/korvadm_mod.h"
#include "kernel/korvadm_mod_lio4.h"
#include "tests/daemon/daemon_harness.h"
#include "tests/support/isns_isnsd.h"
#include "tests/support/xmldbd_fixture.h"

using namespace std::chrono_literals;
using korv_test::daemon_process;
using korv_test::eventually;

namespace {

const char *const kPrefix = "iqn.2026-01.org.example:";
const char *const kServer = "127.0.0.1"; // the VM's own loopback

struct TargetFree {
    void operator()(iscsi_target_t *t) const { iscsi_target_free(t); }
};
using Target = std::unique_ptr<iscsi_target_t, TargetFree>;

struct Portal {
    std::string v4, v6, dev;
    int port;
};

// The automatic fe80:: address of dummy0, from /proc/net/if_inet6.
std::string link_local()
{
    static const std::string ll = [] {
        std::string found;
        FILE *f = std::fopen("/proc/net/if_inet6", "r");
        char hex[33], name[32];
        unsigned idx, plen, scope, flags;
        while (f && std::fscanf(f, "%32s %x %x %x %x %31s", hex, &idx, &plen, &scope, &flags, name) == 6) {
            if (std::strcmp(name, "dummy0") != 0 || std::strncmp(hex, "fe80", 4) != 0)
                continue;
            unsigned char bytes[16];
            for (int i = 0; i < 16; i++)
                bytes[i] = static_cast<unsigned char>(std::stoi(std::string(hex + 2 * i, 2), nullptr, 16));
            char text[INET6_ADDRSTRLEN];
            if (inet_ntop(AF_INET6, bytes, text, sizeof text))
                found = text;
        }
        if (f)
            std::fclose(f);
        return found;
    }();
    return ll;
}

// The host name in IQN form, as the daemon derives its entity identifier.
std::string entity_id()
{
    char buf[128] = {};
    EXPECT_EQ(sys_net_get_host_name_in_iqn_spec(buf, sizeof buf, 1), 0);
    return buf;
}

std::string iqn_of(const std::string &name)
{
    char out[CONF_GEN_IQN_LEN] = {};
    EXPECT_GT(iscsi_conf_generate_iqn(out, entity_id().c_str(), name.c_str()), 0);
    return out;
}

// A target as target management would make it: in the database and, through
// the driver, in the kernel with its portals, enabled.
void create_target(const std::string &name, int tpgt, const std::vector<Portal> &portals)
{
    const std::string iqn = iqn_of(name);
    target_conf_t *conf = target_conf_new();
    ASSERT_NE(conf, nullptr);
    std::snprintf(conf->name, sizeof conf->name, "%s", name.c_str());
    std::snprintf(conf->iqn, sizeof conf->iqn, "%s", iqn.c_str());
    conf->tpgt = tpgt;
    conf->chap_enable = 0;
    conf->hba_id = tpgt;
    int rc = xmldb_add_new_target(conf);
    target_conf_free(conf);
    ASSERT_EQ(rc, 0) << "storing " << name;

    Target t(iscsi_target_new());
    ASSERT_TRUE(t);
    std::snprintf(t->iqn, sizeof t->iqn, "%s", iqn.c_str());
    std::snprintf(t->alias, sizeof t->alias, "%s", name.c_str());
    t->tpgt = tpgt;
    for (const Portal &p : portals) {
        iscsi_ip_t *ip = iscsi_ip_new();
        ASSERT_NE(ip, nullptr);
        std::snprintf(ip->ipv4, sizeof ip->ipv4, "%s", p.v4.c_str());
        std::snprintf(ip->ipv6, sizeof ip->ipv6, "%s", p.v6.c_str());
        std::snprintf(ip->dev_name, sizeof ip->dev_name, "%s", p.dev.c_str());
        ip->port = p.port;
        list_append(&ip->node, &t->ip_list);
    }
    ASSERT_EQ(iscsi_mod_add_target(t.get()), 0);
    ASSERT_EQ(iscsi_mod_set_target_ip(t.get()), 0);
    ASSERT_EQ(iscsi_mod_enable_target(t.get()), 0);
}

void delete_target(const std::string &name)
{
    Target t(iscsi_target_new());
    ASSERT_TRUE(t);
    int tpgt = -1;
    ASSERT_EQ(xmldb_get_target_tpgt(&tpgt, name.c_str()), 0);
    std::snprintf(t->iqn, sizeof t->iqn, "%s", iqn_of(name).c_str());
    t->tpgt = tpgt;
    ASSERT_EQ(iscsi_mod_del_target(t.get()), 0);
    ASSERT_EQ(xmldb_del_target_by_name(name.c_str()), 0);
}

// "iqn address port/tcp tag" for every portal the kernel reports for the
// target: what the server must end up holding as its portal groups.
std::set<std::string> kernel_portal_groups(const std::string &name, int tpgt)
{
    std::set<std::string> out;
    list_t ips;
    list_init(&ips);
    EXPECT_EQ(iscsi_mod_get_target_ip_list_in_target_parm(&ips, iqn_of(name).c_str(), tpgt), 0);
    for (iscsi_ip_t *ip : korv::list_records<iscsi_ip_t>(&ips)) {
        for (const char *addr : {ip->ipv4, ip->ipv6}) {
            if (!*addr)
                continue;
            out.insert(iqn_of(name) + " " + addr + " " + std::to_string(ip->port) + "/tcp " +
                       std::to_string(tpgt));
        }
    }
    iscsi_ip_free_list(&ips);
    return out;
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

std::set<std::string> listed(const korv_test::isnsd_server &srv, const char *what,
                             std::initializer_list<const char *> keys)
{
    std::set<std::string> out;
    for (auto &o : objects(srv.adm(std::string("--list ") + what))) {
        std::string row;
        for (const char *k : keys)
            row += (row.empty() ? "" : " ") + o[k];
        out.insert(row);
    }
    return out;
}

std::set<std::string> nodes(const korv_test::isnsd_server &srv)
{
    return listed(srv, "nodes", {"iSCSI name"});
}

// Portal groups the server holds for the targets with their own tags. The
// server adds default groups for an entity's portals a node has none for
// (with another tag); those are not ours.
std::set<std::string> portal_groups(const korv_test::isnsd_server &srv,
                                    std::initializer_list<std::pair<const char *, int>> targets)
{
    std::set<std::string> out;
    for (const std::string &pg :
         listed(srv, "portal-groups",
                {"Portal group name", "Portal group address", "Portal group port", "Portal group tag"}))
        for (auto [name, tag] : targets)
            if (pg.rfind(iqn_of(name) + " ", 0) == 0 && pg.substr(pg.rfind(' ') + 1) == std::to_string(tag))
                out.insert(pg);
    return out;
}

// isnsd prints IPv6 addresses in compressed form; the kernel's listing
// carries the text of the portal directory.
std::string compressed(const std::string &full)
{
    unsigned char b[16];
    char text[64];
    if (inet_pton(AF_INET6, full.c_str(), b) != 1 || !inet_ntop(AF_INET6, b, text, sizeof text))
        return full;
    return text;
}

std::set<std::string> normalised(const std::set<std::string> &pgs)
{
    std::set<std::string> out;
    for (const std::string &pg : pgs) {
        std::istringstream f(pg);
        std::string iqn, addr, port, tag;
        f >> iqn >> addr >> port >> tag;
        out.insert(iqn + " " + compressed(addr) + " " + port + " " + tag);
    }
    return out;
}

std::vector<Portal> shared_portals()
{
    return {{"127.0.0.1", "::1", "", 3260}, {"", link_local(), "dummy0", 3260}};
}

// Adds (or, with an empty list, drops) portals of a target in the kernel
// through the diffing update; the wanted list is the target's whole set.
void set_portals(const std::string &name, int tpgt, const std::vector<Portal> &portals)
{
    Target t(iscsi_target_new());
    ASSERT_TRUE(t);
    std::snprintf(t->iqn, sizeof t->iqn, "%s", iqn_of(name).c_str());
    t->tpgt = tpgt;
    for (const Portal &p : portals) {
        iscsi_ip_t *ip = iscsi_ip_new();
        ASSERT_NE(ip, nullptr);
        std::snprintf(ip->ipv4, sizeof ip->ipv4, "%s", p.v4.c_str());
        std::snprintf(ip->ipv6, sizeof ip->ipv6, "%s", p.v6.c_str());
        std::snprintf(ip->dev_name, sizeof ip->dev_name, "%s", p.dev.c_str());
        ip->port = p.port;
        list_append(&ip->node, &t->ip_list);
    }
    ASSERT_EQ(lio3_set_target_ip_v2(t.get()), 0);
}

// What fn() returns once it equals want or the time is over: for
// EXPECT_EQ, which then shows both sides.
template <class Fn, class T>
T settled(Fn fn, const T &want, std::chrono::milliseconds limit)
{
    eventually([&] { return fn() == want; }, limit);
    return fn();
}

class NesradInTheVm : public ::testing::Test {
protected:
    static void SetUpTestSuite()
    {
        ASSERT_FALSE(link_local().empty()) << "dummy0 has no link-local address";
        db_ = new korv_test::XmldbProcess("/var/run/xmldb_sock_iscsi");
        db_->start();
        ASSERT_EQ(xmldb_set_iqn_prefix(kPrefix), 0);
        ASSERT_EQ(xmldb_set_debug_level(1), 0);
        ASSERT_EQ(iscsi_mod_select(ISCSI_MOD_TYPE_LIO), 0);
        ASSERT_EQ(iscsi_mod_start(), 0);
        // Like the appliance's targets, both listen on every address; the
        // server accepts further targets only on the first one's portals.
        for (auto [name, tpgt] : {std::pair{"disk1", 1}, std::pair{"disk2", 2}})
            create_target(name, tpgt, shared_portals());
        create_target("disk3", 3, {}); // registered by name only
    }
    static void TearDownTestSuite()
    {
        EXPECT_EQ(iscsi_mod_stop(), 0);
        delete db_;
        db_ = nullptr;
    }

    void SetUp() override
    {
        if (!korv_test::isnsd_available())
            GTEST_SKIP() << "isnsd/isnsadm were not copied into the VM";
        srv_ = std::make_unique<korv_test::isnsd_server>(kServer);
        ASSERT_TRUE(srv_->start()) << srv_->error();
    }

    std::set<std::string> expected_groups(std::initializer_list<std::pair<const char *, int>> targets)
    {
        std::set<std::string> all;
        for (auto [name, tpgt] : targets)
            all.merge(kernel_portal_groups(name, tpgt));
        return normalised(all);
    }

    static korv_test::XmldbProcess *db_;
    std::unique_ptr<korv_test::isnsd_server> srv_;
};

korv_test::XmldbProcess *NesradInTheVm::db_ = nullptr;

TEST_F(NesradInTheVm, RegistersEveryTargetWithTheKernelsPortalsAndLeavesOnSigterm)
{
    // The kernel reports what the driver made, the link-local portal included.
    const std::string disk2 = iqn_of("disk2");
    ASSERT_EQ(kernel_portal_groups("disk2", 2),
              (std::set<std::string>{disk2 + " 127.0.0.1 3260/tcp 2", disk2 + " ::1 3260/tcp 2",
                                     disk2 + " " + link_local() + " 3260/tcp 2"}));

    daemon_process d(korv_test::nesrad_binary(), kServer);
    const std::set<std::string> want_nodes{iqn_of("disk1"), iqn_of("disk2"), iqn_of("disk3")};
    ASSERT_TRUE(eventually([&] { return nodes(*srv_) == want_nodes; }, 15s))
        << srv_->adm("--list nodes") << d.output();
    EXPECT_EQ(listed(*srv_, "entities", {"Entity identifier"}), std::set<std::string>{entity_id()});
    const auto want_groups = expected_groups({{"disk1", 1}, {"disk2", 2}, {"disk3", 3}});
    EXPECT_EQ(want_groups.size(), 6u);
    EXPECT_EQ(settled([&] { return portal_groups(*srv_, {{"disk1", 1}, {"disk2", 2}}); }, want_groups, 5s), want_groups);
    EXPECT_EQ(portal_groups(*srv_, {{"disk3", 3}}), std::set<std::string>{}) << "disk3 has no portal";
    EXPECT_EQ(korv_test::stored_pid(), d.pid());

    d.signal(SIGTERM);
    EXPECT_EQ(d.wait_exit(10s), 0) << d.output();
    EXPECT_TRUE(nodes(*srv_).empty()) << srv_->adm("--list nodes");
    EXPECT_EQ(korv_test::stored_pid(), 0);
}

TEST_F(NesradInTheVm, SignalsPickUpTargetsAndPortalsChangedInTheKernel)
{
    daemon_process d(korv_test::nesrad_binary(), kServer);
    ASSERT_TRUE(eventually([&] { return nodes(*srv_).size() == 3; }, 15s)) << d.output();

    create_target("disk4", 4, {{"127.0.0.1", "", "", 3260}});
    d.signal(SIGUSR1);
    EXPECT_TRUE(eventually([&] { return nodes(*srv_).count(iqn_of("disk4")) == 1; }, 10s))
        << srv_->adm("--list nodes") << d.output();
    const auto with_disk4 = expected_groups({{"disk1", 1}, {"disk2", 2}, {"disk4", 4}});
    EXPECT_EQ(settled([&] { return portal_groups(*srv_, {{"disk1", 1}, {"disk2", 2}, {"disk4", 4}}); }, with_disk4, 5s),
              with_disk4);

    // A portal added in the kernel and a target deleted: after SIGUSR2 the
    // server holds exactly the new state.
    std::vector<Portal> more = shared_portals();
    more.push_back({"127.0.0.9", "", "", 3269});
    set_portals("disk1", 1, more);
    set_portals("disk2", 2, more);
    delete_target("disk4");
    d.signal(SIGUSR2);
    const std::set<std::string> want_nodes{iqn_of("disk1"), iqn_of("disk2"), iqn_of("disk3")};
    EXPECT_TRUE(eventually([&] { return nodes(*srv_) == want_nodes; }, 10s))
        << srv_->adm("--list nodes") << d.output();
    const auto want_groups = expected_groups({{"disk1", 1}, {"disk2", 2}});
    EXPECT_EQ(want_groups.count(iqn_of("disk2") + " 127.0.0.9 3269/tcp 2"), 1u);
    EXPECT_EQ(settled([&] { return portal_groups(*srv_, {{"disk1", 1}, {"disk2", 2}}); }, want_groups, 5s), want_groups);

    d.signal(SIGTERM);
    EXPECT_EQ(d.wait_exit(10s), 0) << d.output();
    set_portals("disk1", 1, shared_portals());
    set_portals("disk2", 2, shared_portals());
}

TEST_F(NesradInTheVm, ServerThatStartsLateOrLosesItsDataGetsEverythingAgain)
{
    // The test build of the daemon checks every 2 s instead of every minute.
    srv_->stop();
    daemon_process d(korv_test::nesrad_test_binary(), kServer);
    ASSERT_TRUE(d.wait_for("server failed", 15s)) << d.output();
    ASSERT_TRUE(srv_->start()) << srv_->error();
    const std::set<std::string> want_nodes{iqn_of("disk1"), iqn_of("disk2"), iqn_of("disk3")};
    EXPECT_TRUE(eventually([&] { return nodes(*srv_) == want_nodes; }, 15s))
        << srv_->adm("--list nodes") << d.output();

    ASSERT_TRUE(srv_->restart()) << srv_->error(); // in-memory database: empty again
    EXPECT_TRUE(eventually([&] { return nodes(*srv_) == want_nodes; }, 15s))
        << srv_->adm("--list nodes") << d.output();
    const auto want_groups = expected_groups({{"disk1", 1}, {"disk2", 2}});
    EXPECT_EQ(settled([&] { return portal_groups(*srv_, {{"disk1", 1}, {"disk2", 2}}); }, want_groups, 5s),
              want_groups);

    d.signal(SIGTERM);
    EXPECT_EQ(d.wait_exit(10s), 0) << d.output();
}

TEST_F(NesradInTheVm, TargetOnPortalsTheEntityLacksIsRefusedByTheServer)
{
    // Further targets are registered with portal groups only; their portals
    // come with the first target. A target listening elsewhere names portals
    // the entity does not have, and the server refuses it (status 3).
    create_target("disk5", 5, {{"127.0.0.5", "", "", 3265}});
    daemon_process d(korv_test::nesrad_binary(), kServer);
    ASSERT_TRUE(d.wait_for("iSNS server answered status 3", 15s)) << d.output();
    EXPECT_TRUE(eventually([&] { return nodes(*srv_).size() == 3; }, 5s)) << srv_->adm("--list nodes");
    EXPECT_EQ(nodes(*srv_).count(iqn_of("disk5")), 0u);

    d.signal(SIGTERM);
    EXPECT_EQ(d.wait_exit(10s), 0) << d.output();
    delete_target("disk5");
}

} // namespace
