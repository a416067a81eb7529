// SPDX-License-Identifier: Apache-2.0
// The whole appliance in the test VM, driven the way the management tool
// drives it: targets built in the real kernel and the configuration
// database, nesrad started, signalled and stopped through the control
// interface, a private isnsd, and open-iscsi (iscsid started by
// appliance_e2e.sh, iscsiadm, the kernel's iscsi_tcp) finding the targets
// through iSNS, logging in with CHAP and using the disk. With --show each
// step prints what the server and the initiator see (scripts/demo --real-kernel).
#include <fcntl.h>
#include <signal.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <iostream>
#include <sstream>

#include "common/korvadm_nesrad_if.h"
#include "common/korvadm_sys.h"
#include "config/korvadm_conf.h"
#include "config/korvadm_xmldb_conf.h"
#include "kernel/korvadm_mod_lio4.h"
#include "kernel/korvadm_sess.h"
#include "tests/daemon/daemon_harness.h"
#include "tests/support/isns_isnsd.h"
#include "tests/support/process.h"
#include "tests/support/xmldbd_fixture.h"
#include "tests/vm/vm_targets.h"

using namespace std::chrono_literals;
using korv_test::eventually;
using korv_test::isnsadm_rows;
using vm::read_file;
using Names = std::set<std::string>;

namespace {

const char *const kServer = "127.0.0.1";
const char *const kAddress = "192.0.2.1";  // dummy0: the VM's own address
const char *const kInitiator = "iqn.2026-01.vm:host1";  // iscsid's name (appliance_e2e.sh)
const char *const kUser = "korvuser", *const kSecret = "e2e-secret-42";
bool show_steps = false;

void show(const std::string &step, const std::string &text)
{
    if (show_steps)
        std::cout << "\n==== " << step << "\n" << text << std::flush;
}

// A target's IQN as the daemon registers it, under the host name in IQN
// form (the daemon's entity identifier).
std::string iqn_of(const std::string &name)
{
    char host[128] = {}, out[CONF_GEN_IQN_LEN] = {};
    EXPECT_EQ(sys_net_get_host_name_in_iqn_spec(host, sizeof host, 1), 0);
    EXPECT_GT(iscsi_conf_generate_iqn(out, host, name.c_str()), 0);
    return out;
}

// A target as the management tool makes it: stored, then in the kernel with
// portals on 192.0.2.1, [::1] and dummy0's link-local address, CHAP, a
// fileio LUN and a read-write ACL, and enabled.
void build_target(const std::string &name, int tpgt)
{
    const std::string iqn = iqn_of(name);
    target_conf_t *conf = target_conf_new();
    std::snprintf(conf->name, sizeof conf->name, "%s", name.c_str());
    std::snprintf(conf->iqn, sizeof conf->iqn, "%s", iqn.c_str());
    std::snprintf(conf->chap_name, sizeof conf->chap_name, "%s", kUser);
    std::snprintf(conf->chap_pwd, sizeof conf->chap_pwd, "%s", kSecret);
    conf->tpgt = tpgt;
    conf->chap_enable = 1;
    conf->hba_id = tpgt;
    ASSERT_EQ(xmldb_add_new_target(conf), 0) << name;
    target_conf_free(conf);
    vm::Target t = vm::make_target(iqn, tpgt, name);
    ASSERT_EQ(iscsi_mod_add_target(t.get()), 0);
    lun_conf_t *lc = lun_conf_new();
    std::snprintf(lc->name, sizeof lc->name, "%s", name.c_str());
    std::snprintf(lc->uuid, sizeof lc->uuid, "uuid-%s", name.c_str());
    std::snprintf(lc->serial, sizeof lc->serial, "sn-%s", name.c_str());
    std::snprintf(lc->img_file, sizeof lc->img_file, "/tmp/%s.img", name.c_str());
    lc->size = 1 << 20;
    lc->prealloc = 0;
    ASSERT_EQ(xmldb_add_new_lun(lc), 0) << name;
    lun_conf_free(lc);
    ASSERT_EQ(xmldb_add_target_lun_map(name.c_str(), name.c_str(), 0), 0);
    // One ACL record serves every target.
    ASSERT_EQ(tpgt == 1 ? xmldb_add_acl_initiator(kInitiator, "host1") : 0, 0);
    ASSERT_EQ(xmldb_set_lun_acl(kInitiator, "host1", name.c_str(), 2), 0);

    t->dataout_timeout = 5;  // ACLs refuse 0
    vm::want_portal(t.get(), kAddress, "::1", 3260);
    vm::want_portal(t.get(), "", vm::link_local_of("dummy0"), 3260, "dummy0");
    ASSERT_EQ(iscsi_mod_set_target_ip(t.get()), 0);
    t->chap = 1;
    std::snprintf(t->chap_user, sizeof t->chap_user, "%s", kUser);
    std::snprintf(t->chap_pass, sizeof t->chap_pass, "%s", kSecret);
    ASSERT_EQ(iscsi_mod_set_target_chap(t.get()), 0);
    ASSERT_NO_FATAL_FAILURE(vm::map_lun_for(t.get(), name, kInitiator));  // /tmp/NAME.img
    // No one logs in with this one; the listing reads its text too.
    ASSERT_EQ(iscsi_mod_add_acl_initiator("iqn.2026-01.vm:idle", t.get()), 0);
    ASSERT_EQ(iscsi_mod_enable_target(t.get()), 0);
}

// The portals a target is built with, as iscsiadm prints one it discovered:
// "address:port,tag iqn", IPv6 in brackets without the interface. Written
// out, not read through the driver: the daemon registers what the driver
// reads, so a wrong reading would agree with itself.
Names portals(const std::string &name, int tpgt)
{
    const std::string tail = ":3260," + std::to_string(tpgt) + " " + iqn_of(name);
    return {kAddress + tail, "[::1]" + tail, "[" + vm::link_local_of("dummy0") + "]" + tail};
}

// The nodes the server holds but the initiator's own (open-iscsi registers
// itself to discover).
Names server_nodes(const korv_test::isnsd_server &srv)
{
    Names out = isnsadm_rows(srv, "nodes", {"iSCSI name"});
    out.erase(kInitiator);
    return out;
}

// What open-iscsi discovers through the iSNS server: "portal,tag iqn" lines.
Names discover()
{
    const std::string text =
        korv_test::run_shell(std::string("iscsiadm -m discovery -t isns -p ") + kServer + ":3205 2>&1");
    show("open-iscsi: iscsiadm -m discovery -t isns", text);
    std::istringstream in(text);
    Names found;
    for (std::string line; std::getline(in, line);)
        if (line.find(",") != std::string::npos && line.find(" iqn.") != std::string::npos)
            found.insert(line);
    return found;
}

// iscsiadm on iqn's node record at address (IPv6 bracketed) port 3260;
// output and "rc=N".
std::string node(const std::string &iqn, const std::string &args, const std::string &address)
{
    const std::string portal = address.find(':') == std::string::npos ? address : "[" + address + "]";
    return korv_test::run_shell("iscsiadm -m node -T " + iqn + " -p " + portal + ":3260 " + args + " 2>&1; echo rc=$?");
}

std::string login(const std::string &iqn, const std::string &secret, const std::string &address = kAddress)
{
    const std::string auth = "-o update -n node.session.auth.";
    for (const std::string &set :
         {auth + "authmethod -v CHAP", auth + "username -v " + kUser, auth + "password -v " + secret})
        node(iqn, set, address);
    return node(iqn, "--login", address);
}

// The disk of the one open session, "" until the kernel has attached it.
std::string attached_disk()
{
    const std::string text = korv_test::run_shell("iscsiadm -m session -P 3");
    const size_t at = text.find("Attached scsi disk ");
    const size_t end = text.find_first_of(" \t\n", at + 19);
    return at == std::string::npos ? "" : "/dev/" + text.substr(at + 19, end - at - 19);
}

// Writes `data` (512 bytes) at block 8 of the disk, past the page cache,
// and returns block 8 as read back ("" on an error).
std::string disk_io(const std::string &dev, const std::string &data)
{
    std::string got;
    void *buf = nullptr;
    const int fd = ::open(dev.c_str(), O_RDWR | O_DIRECT);
    if (fd >= 0 && ::posix_memalign(&buf, 4096, 512) == 0 &&
        ::pwrite(fd, std::memcpy(buf, data.data(), 512), 512, 8 * 512) == 512 &&
        ::pread(fd, std::memset(buf, 0, 512), 512, 8 * 512) == 512)
        got.assign(static_cast<char *>(buf), 512);
    std::free(buf);
    ::close(fd);  // -1 after a failed open: nothing happens
    return got;
}

// The driver's session listing (slot 21) of the target, a line per session:
// "initiator isid cid@address...", flagged when the session has no TSIH or
// SID; "failed" when the call fails. How the records link up is the host
// tests' (test_lio4_sessions.cpp, on the kernel's texts).
std::string listed_sessions(iscsi_target_t *t)
{
    korv::list_owner initiators(iscsi_initiator_free_list), sessions(iscsi_sess_free_list);
    if (iscsi_mod_get_target_session(sessions.get(), initiators.get(), t) != 0)
        return "failed\n";
    std::string out;
    for (iscsi_sess_t *s : korv::list_records<iscsi_sess_t>(sessions.get())) {
        out += s->initiator ? s->initiator->name : "(none)";
        out += s->tsih > 0 && s->sid > 0 ? " " : " no-TSIH-or-SID ";
        static const char hex[] = "0123456789abcdef";
        for (int i = 0; i < ISCSI_ISID_LEN; i++)
            out += std::string{hex[s->isid[i] >> 4], hex[s->isid[i] & 15]};
        for (iscsi_conn_t *c : korv::list_records<iscsi_conn_t>(&s->conn_list))
            out += " " + std::to_string(c->cid) + "@" + (c->address ? c->address : "");
        out += "\n";
    }
    return out;
}

// Logs in with CHAP at address, writes the pattern to the disk and reads it
// back. Meanwhile the listing shows the session with the ISID open-iscsi
// sent; once logged out, nothing.
void use_target(const std::string &name, int tpgt, const std::string &pattern, const std::string &address = kAddress)
{
    const std::string iqn = iqn_of(name), in = login(iqn, kSecret, address);
    show("open-iscsi: login to " + name + " with CHAP", in);
    ASSERT_NE(in.find("successful"), std::string::npos) << in;
    std::string dev;
    EXPECT_TRUE(eventually([&] { return !(dev = attached_disk()).empty(); }, 30s))
        << korv_test::run_shell("iscsiadm -m session -P 3");
    vm::Target t = vm::make_target(iqn, tpgt);
    // open-iscsi's ISID: its OUI 00:02:3d, then the session's number.
    const std::string isid = korv_test::run_shell("printf 00023d%06x $(ls /sys/class/iscsi_session | sed s/session//)");
    const std::string listed = listed_sessions(t.get());
    EXPECT_EQ(listed, std::string(kInitiator) + " " + isid.substr(0, 12) + " 0@" + address + "\n") << isid;
    EXPECT_EQ(disk_io(dev, pattern), pattern) << dev;
    EXPECT_EQ(read_file("/tmp/" + name + ".img").substr(8 * 512, 512), pattern) << "not in the backing file";
    show("the driver's session listing of " + name + " (" + dev + " written and read back)", listed);
    EXPECT_NE(node(iqn, "--logout", address).find("rc=0"), std::string::npos);
    EXPECT_TRUE(eventually([&] { return listed_sessions(t.get()).empty(); }, 30s)) << "listed after logout";
}

// Running, and not a zombie left for the VM's init to reap.
bool alive(long long pid)
{
    const std::string stat = read_file("/proc/" + std::to_string(pid) + "/stat");
    const size_t close = stat.rfind(')');
    return close != std::string::npos && stat.compare(close + 2, 1, "Z") != 0;
}

class ApplianceInTheVm : public vm::Driver {};

TEST_F(ApplianceInTheVm, AnInitiatorFindsTheTargetsThroughIsnsAndUsesThem)
{
    ASSERT_FALSE(vm::link_local_of("dummy0").empty()) << "dummy0 has no link-local address";
    korv_test::XmldbProcess db("/var/run/xmldb_sock_iscsi");
    db.start();
    korv_test::isnsd_server srv(kServer);
    ASSERT_TRUE(srv.start()) << srv.error();
    ASSERT_EQ(xmldb_set_iqn_prefix("iqn.2026-01.org.example:"), 0);
    // Both on the same portals: the server takes further targets only on the
    // first one's portals.
    ASSERT_NO_FATAL_FAILURE(build_target("disk1", 1));
    ASSERT_NO_FATAL_FAILURE(build_target("disk2", 2));
    const std::string disk1 = iqn_of("disk1"), disk2 = iqn_of("disk2");
    EXPECT_EQ(discover(), Names{}) << "a target found before the daemon runs";

    // The management tool's start: nesrad from PATH through the shell.
    const std::string bin = korv_test::nesrad_binary();
    ::setenv("PATH", (bin.substr(0, bin.rfind('/')) + ":" + ::getenv("PATH")).c_str(), 1);
    ASSERT_EQ(xmldb_set_service_enable(1), 0);
    ASSERT_EQ(isns_set_setting(1, kServer, 0), 0);
    long long pid = 0;
    EXPECT_TRUE(eventually([&] { return (pid = korv_test::stored_pid()) > 0 && alive(pid); }, 10s));
    EXPECT_TRUE(eventually([&] { return server_nodes(srv) == Names{disk1, disk2}; }, 20s)) << srv.adm("--list nodes");
    show("the iSNS server holds (nesrad pid " + std::to_string(pid) + ")", srv.adm("--list portal-groups"));

    Names both = portals("disk1", 1);
    both.merge(portals("disk2", 2));
    EXPECT_EQ(discover(), both);
    std::string pattern(512, '\0');
    for (size_t i = 0; i < pattern.size(); i++)
        pattern[i] = static_cast<char>("appliance"[i % 9] ^ (i / 9));
    EXPECT_NE(login(disk1, "wrong-secret-1").find("authorization failure"), std::string::npos);
    ASSERT_NO_FATAL_FAILURE(use_target("disk1", 1, pattern));
    ASSERT_NO_FATAL_FAILURE(use_target("disk2", 2, pattern, "::1"));

    // disk2 deleted in kernel and store, a portal added to disk1; SIGUSR1
    // makes the daemon follow. (A target added is nesrad_daemon_test's.)
    ASSERT_EQ(iscsi_mod_del_target(vm::make_target(disk2, 2).get()), 0);
    ASSERT_EQ(xmldb_del_target_by_name("disk2"), 0);
    vm::Target more = vm::make_target(disk1, 1);
    vm::want_portal(more.get(), kAddress, "::1", 3260);
    vm::want_portal(more.get(), "", vm::link_local_of("dummy0"), 3260, "dummy0");
    vm::want_portal(more.get(), "127.0.0.9", "", 3269);
    ASSERT_EQ(lio3_set_target_ip_v2(more.get()), 0);
    notify_isnsclient(SIGUSR1);
    EXPECT_TRUE(eventually([&] { return server_nodes(srv) == Names{disk1}; }, 20s))
        << srv.adm("--list nodes");
    show("after disk2's deletion, a new portal, and SIGUSR1", srv.adm("--list nodes"));
    Names now = portals("disk1", 1);
    now.insert("127.0.0.9:3269,1 " + disk1);
    EXPECT_EQ(discover(), now);
    ASSERT_NO_FATAL_FAILURE(use_target("disk1", 1, pattern));

    // Off: the daemon deregisters and exits, and stores pid 0.
    ASSERT_EQ(isns_set_setting(0, nullptr, 1), 0);
    EXPECT_TRUE(eventually([&] { return korv_test::stored_pid() == 0 && !alive(pid); }, 10s));
    EXPECT_EQ(server_nodes(srv), Names{}) << srv.adm("--list nodes");
    show("isns_set_setting(0): nesrad has left, stored pid 0; the server holds", srv.adm("--list nodes"));
}

}  // namespace

int main(int argc, char **argv)
{
    ::testing::InitGoogleTest(&argc, argv);
    for (int i = 1; i < argc; i++)
        show_steps |= std::strcmp(argv[i], "--show") == 0;
    return RUN_ALL_TESTS();
}
