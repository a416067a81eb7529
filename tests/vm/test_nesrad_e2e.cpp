// SPDX-License-Identifier: Apache-2.0
// nesrad end to end inside the test VM: the configuration database service
// and a private isnsd run in the VM, targets are created in the real kernel
// through the driver and stored in the database, and the daemon (the
// installed binary) registers them. isnsadm must then show every target with
// the portals the kernel reports, and nothing after SIGTERM.
#include <signal.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <chrono>
#include <memory>
#include <set>
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
#include "tests/vm/vm_targets.h"

using namespace std::chrono_literals;
using korv_test::daemon_process;
using korv_test::eventually;
using korv_test::isnsadm_rows;

namespace {

const char *const kPrefix = "iqn.2026-01.org.example:";
const char *const kServer = "127.0.0.1"; // the VM's own loopback

struct Portal {
    std::string v4, v6, dev;
    int port;
};

// The automatic fe80:: address of dummy0.
std::string link_local()
{
    static const std::string ll = vm::link_local_of("dummy0");
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

// The driver's record of a target with these portals wanted.
vm::Target with_portals(const std::string &name, int tpgt, const std::vector<Portal> &portals)
{
    vm::Target t = vm::make_target(iqn_of(name), tpgt, name);
    for (const Portal &p : portals)
        if (!t || !vm::want_portal(t.get(), p.v4, p.v6, p.port, p.dev))
            return nullptr;
    return t;
}

// A target as target management would make it: in the database and, through
// the driver, in the kernel with its portals, enabled.
void create_target(const std::string &name, int tpgt, const std::vector<Portal> &portals)
{
    target_conf_t *conf = target_conf_new();
    ASSERT_NE(conf, nullptr);
    std::snprintf(conf->name, sizeof conf->name, "%s", name.c_str());
    std::snprintf(conf->iqn, sizeof conf->iqn, "%s", iqn_of(name).c_str());
    conf->tpgt = tpgt;
    conf->chap_enable = 0;
    conf->hba_id = tpgt;
    int rc = xmldb_add_new_target(conf);
    target_conf_free(conf);
    ASSERT_EQ(rc, 0) << "storing " << name;

    vm::Target t = with_portals(name, tpgt, portals);
    ASSERT_TRUE(t);
    ASSERT_EQ(iscsi_mod_add_target(t.get()), 0);
    ASSERT_EQ(iscsi_mod_set_target_ip(t.get()), 0);
    ASSERT_EQ(iscsi_mod_enable_target(t.get()), 0);
}

void delete_target(const std::string &name, int tpgt)
{
    vm::Target t = with_portals(name, tpgt, {});
    ASSERT_TRUE(t);
    ASSERT_EQ(iscsi_mod_del_target(t.get()), 0);
    ASSERT_EQ(xmldb_del_target_by_name(name.c_str()), 0);
}

using Tagged = std::initializer_list<std::pair<const char *, int>>;

// "iqn address port/tcp tag" for every portal the kernel reports for the
// targets: what the server must end up holding as their portal groups.
std::set<std::string> kernel_portal_groups(Tagged targets)
{
    std::set<std::string> out;
    for (auto [name, tpgt] : targets) {
        list_t ips;
        list_init(&ips);
        EXPECT_EQ(iscsi_mod_get_target_ip_list_in_target_parm(&ips, iqn_of(name).c_str(), tpgt), 0);
        for (iscsi_ip_t *ip : korv::list_records<iscsi_ip_t>(&ips))
            for (const char *addr : {ip->ipv4, ip->ipv6})
                if (*addr)
                    out.insert(iqn_of(name) + " " + addr + " " + std::to_string(ip->port) + "/tcp " +
                               std::to_string(tpgt));
        iscsi_ip_free_list(&ips);
    }
    return out;
}

// Portal groups the server holds for the targets with their own tags. The
// server adds default groups for an entity's portals a node has none for
// (with another tag); those are not ours.
std::set<std::string> portal_groups(const korv_test::isnsd_server &srv, Tagged targets)
{
    std::set<std::string> out;
    for (const std::string &pg :
         isnsadm_rows(srv, "portal-groups",
                                 {"Portal group name", "Portal group address", "Portal group port", "Portal group tag"}))
        for (auto [name, tag] : targets)
            if (pg.rfind(iqn_of(name) + " ", 0) == 0 && pg.substr(pg.rfind(' ') + 1) == std::to_string(tag))
                out.insert(pg);
    return out;
}

std::vector<Portal> shared_portals()
{
    return {{"127.0.0.1", "::1", "", 3260}, {"", link_local(), "dummy0", 3260}};
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

    // Waits until the server holds exactly the nodes of `names` and, for
    // those with portals, every portal the kernel reports.
    void expect_server_holds(std::initializer_list<const char *> names, Tagged portal_targets,
                             const daemon_process &d)
    {
        std::set<std::string> want_nodes;
        for (const char *n : names)
            want_nodes.insert(iqn_of(n));
        const auto want_groups = kernel_portal_groups(portal_targets);
        EXPECT_TRUE(eventually(
            [&] {
                return isnsadm_rows(*srv_, "nodes", {"iSCSI name"}) == want_nodes &&
                       portal_groups(*srv_, portal_targets) == want_groups;
            },
            15s))
            << srv_->adm("--list nodes") << srv_->adm("--list portal-groups") << d.output();
    }

    static korv_test::XmldbProcess *db_;
    std::unique_ptr<korv_test::isnsd_server> srv_;
};

korv_test::XmldbProcess *NesradInTheVm::db_ = nullptr;

TEST_F(NesradInTheVm, RegistersWhatTheKernelReportsAndFollowsItsChanges)
{
    // The kernel reports what the driver made, the link-local portal included.
    const std::string disk2 = iqn_of("disk2");
    ASSERT_EQ(kernel_portal_groups({{"disk2", 2}}),
              (std::set<std::string>{disk2 + " 127.0.0.1 3260/tcp 2", disk2 + " ::1 3260/tcp 2",
                                     disk2 + " " + link_local() + " 3260/tcp 2"}));

    daemon_process d(korv_test::nesrad_binary(), kServer);
    expect_server_holds({"disk1", "disk2", "disk3"}, {{"disk1", 1}, {"disk2", 2}}, d);
    EXPECT_EQ(isnsadm_rows(*srv_, "entities", {"Entity identifier"}), std::set<std::string>{entity_id()});
    EXPECT_EQ(portal_groups(*srv_, {{"disk3", 3}}), std::set<std::string>{}) << "disk3 has no portal";
    EXPECT_EQ(korv_test::stored_pid(), d.pid());

    create_target("disk4", 4, {{"127.0.0.1", "", "", 3260}});
    d.signal(SIGUSR1);
    expect_server_holds({"disk1", "disk2", "disk3", "disk4"}, {{"disk1", 1}, {"disk2", 2}, {"disk4", 4}}, d);

    // A portal added in the kernel and a target deleted: after SIGUSR2 the
    // server holds exactly the new state.
    std::vector<Portal> more = shared_portals();
    more.push_back({"127.0.0.9", "", "", 3269});
    // The diffing update adds the new one; the wanted list is the whole set.
    for (auto [name, tpgt] : {std::pair{"disk1", 1}, std::pair{"disk2", 2}}) {
        vm::Target t = with_portals(name, tpgt, more);
        ASSERT_TRUE(t);
        ASSERT_EQ(lio3_set_target_ip_v2(t.get()), 0);
    }
    delete_target("disk4", 4);
    ASSERT_EQ(kernel_portal_groups({{"disk2", 2}}).count(disk2 + " 127.0.0.9 3269/tcp 2"), 1u);
    d.signal(SIGUSR2);
    expect_server_holds({"disk1", "disk2", "disk3"}, {{"disk1", 1}, {"disk2", 2}}, d);

    d.signal(SIGTERM);
    EXPECT_EQ(d.wait_exit(10s), 0) << d.output();
    EXPECT_TRUE(isnsadm_rows(*srv_, "nodes", {"iSCSI name"}).empty()) << srv_->adm("--list nodes");
    EXPECT_EQ(korv_test::stored_pid(), 0);
}

} // namespace
