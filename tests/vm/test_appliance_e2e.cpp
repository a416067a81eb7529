// SPDX-License-Identifier: Apache-2.0
// The whole appliance in the test VM, driven the way the management tool
// drives it: two targets built in the real kernel and the configuration
// database, nesrad started and stopped through the control interface, a
// private isnsd, and an initiator that finds the targets through iSNS
// (isnsadm registered as the initiator and querying as it) and then logs in
// with CHAP and does I/O through libiscsi.
#include <signal.h>
#include <unistd.h>

#include <gtest/gtest.h>
#include <iscsi/iscsi.h>
#include <iscsi/scsi-lowlevel.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <iterator>
#include <map>
#include <sstream>
#include <string>

#include "common/korvadm_nesrad_if.h"
#include "common/korvadm_sys.h"
#include "config/korvadm_conf.h"
#include "config/korvadm_xmldb_conf.h"
#include "kernel/korvadm_mod.h"
#include "tests/daemon/daemon_harness.h"
#include "tests/support/isns_isnsd.h"
#include "tests/support/xmldbd_fixture.h"
#include "tests/vm/vm_targets.h"

using namespace std::chrono_literals;
using korv_test::eventually;

namespace {

const char *const kServer = "127.0.0.1";
const char *const kAddress = "192.0.2.1"; // dummy0: the VM's own address
const char *const kInitiator = "iqn.2026-01.vm:host1";
const char *const kUser = "korvuser", *const kSecret = "e2e-secret-42";
const char *const kIsnsadmConf = "/tmp/initiator-isnsadm.conf";

std::string slurp(const std::string &path)
{
    std::ifstream in(path);
    return std::string(std::istreambuf_iterator<char>(in), {});
}

std::string run(const std::string &cmd)
{
    std::string out;
    if (FILE *p = ::popen((cmd + " 2>&1").c_str(), "r")) {
        char buf[512];
        while (size_t n = std::fread(buf, 1, sizeof buf, p))
            out.append(buf, n);
        ::pclose(p);
    }
    return out;
}

std::string iqn_of(const std::string &name)
{
    char host[128] = {}, out[CONF_GEN_IQN_LEN] = {};
    EXPECT_EQ(sys_net_get_host_name_in_iqn_spec(host, sizeof host, 1), 0);
    EXPECT_GT(iscsi_conf_generate_iqn(out, host, name.c_str()), 0);
    return out;
}

// What the initiator discovers: each target's name and its portal groups
// ("address:port"), from a query sent as the initiator over TCP.
std::map<std::string, std::string> discover()
{
    std::istringstream in(run(std::string("isnsadm -c ") + kIsnsadmConf + " --query iscsi-node-type=Target"));
    std::map<std::string, std::string> found;
    std::string line, name, address;
    auto value = [&] {
        std::string v = line.substr(line.find(" = ") + 3);
        return v.size() > 1 && v.front() == '"' ? v.substr(1, v.size() - 2) : v;
    };
    while (std::getline(in, line)) {
        if (line.find("Portal group name = ") != std::string::npos)
            name = value();
        else if (line.find("Portal group address = ") != std::string::npos)
            address = value();
        else if (line.find("Portal group port = ") != std::string::npos)
            found[name] += address + ":" + value().substr(0, value().find('/')) + " ";
        else if (line.find("iSCSI name = ") != std::string::npos)
            found.emplace(value(), "");
    }
    return found;
}

// Logs in to iqn at portal as the initiator with CHAP; writes `data` at
// block 8 when it is not empty; returns block 8 as read back, or "" when the
// login or a command failed.
std::string login_and_io(const std::string &portal, const std::string &iqn, const char *secret,
                         const std::string &data = "")
{
    iscsi_context *ctx = iscsi_create_context(kInitiator);
    iscsi_set_targetname(ctx, iqn.c_str());
    iscsi_set_initiator_username_pwd(ctx, kUser, secret);
    iscsi_set_session_type(ctx, ISCSI_SESSION_NORMAL);
    iscsi_set_noautoreconnect(ctx, 1);
    iscsi_set_timeout(ctx, 10);
    std::string got;
    if (iscsi_connect_sync(ctx, portal.c_str()) == 0 && iscsi_login_sync(ctx) == 0) {
        std::string buf = data;
        // The first command after login may report a unit attention.
        for (int attempt = 0; attempt < 2 && !data.empty(); attempt++) {
            scsi_task *t = iscsi_write16_sync(ctx, 0, 8, reinterpret_cast<unsigned char *>(buf.data()), 512, 512,
                                              0, 0, 0, 0, 0);
            const bool good = t && t->status == SCSI_STATUS_GOOD;
            if (t)
                scsi_free_scsi_task(t);
            if (good)
                break;
        }
        for (int attempt = 0; attempt < 2 && got.empty(); attempt++) {
            scsi_task *t = iscsi_read16_sync(ctx, 0, 8, 512, 512, 0, 0, 0, 0, 0);
            if (t && t->status == SCSI_STATUS_GOOD)
                got.assign(reinterpret_cast<char *>(t->datain.data), t->datain.size);
            if (t)
                scsi_free_scsi_task(t);
        }
        // While logged in, the kernel lists the session under the ACL.
        const std::string info = slurp("/sys/kernel/config/target/iscsi/" + iqn + "/tpgt_1/acls/" +
                                       kInitiator + "/info");
        if (info.find("LIO Session ID") == std::string::npos)
            ADD_FAILURE() << "no session under the ACL: " << info;
        iscsi_logout_sync(ctx);
    }
    iscsi_destroy_context(ctx);
    return got;
}

// A target as the management tool makes it: stored, then in the kernel with
// a portal on the VM's address, CHAP, a fileio LUN and a read-write ACL.
void build_target(const std::string &name, int hba)
{
    const std::string iqn = iqn_of(name), img = "/tmp/" + name + ".img";
    target_conf_t *conf = target_conf_new();
    std::snprintf(conf->name, sizeof conf->name, "%s", name.c_str());
    std::snprintf(conf->iqn, sizeof conf->iqn, "%s", iqn.c_str());
    std::snprintf(conf->chap_name, sizeof conf->chap_name, "%s", kUser);
    std::snprintf(conf->chap_pwd, sizeof conf->chap_pwd, "%s", kSecret);
    conf->tpgt = 1;
    conf->chap_enable = 1;
    conf->hba_id = hba;
    ASSERT_EQ(xmldb_add_new_target(conf), 0) << name;
    target_conf_free(conf);
    lun_conf_t *lc = lun_conf_new();
    std::snprintf(lc->name, sizeof lc->name, "%s-lun", name.c_str());
    std::snprintf(lc->uuid, sizeof lc->uuid, "uuid-%s", name.c_str());
    std::snprintf(lc->serial, sizeof lc->serial, "sn-%s", name.c_str());
    std::snprintf(lc->img_file, sizeof lc->img_file, "%s", img.c_str());
    lc->size = 4 << 20;
    lc->prealloc = 0;
    const std::string lun_name = lc->name;
    ASSERT_EQ(xmldb_add_new_lun(lc), 0) << name;
    lun_conf_free(lc);
    ASSERT_EQ(xmldb_add_target_lun_map(name.c_str(), lun_name.c_str(), 0), 0);
    if (hba == 1) { // one ACL record serves both targets
        ASSERT_EQ(xmldb_add_acl_initiator(kInitiator, "host1"), 0);
    }
    ASSERT_EQ(xmldb_set_lun_acl(kInitiator, "host1", lun_name.c_str(), 2), 0);

    vm::Target t = vm::make_target(iqn, 1, name);
    ASSERT_TRUE(t);
    t->dataout_timeout = 5;
    ASSERT_TRUE(vm::want_portal(t.get(), kAddress, "", 3260));
    ASSERT_EQ(iscsi_mod_add_target(t.get()), 0);
    ASSERT_EQ(iscsi_mod_set_target_ip(t.get()), 0);
    t->chap = 1;
    std::snprintf(t->chap_user, sizeof t->chap_user, "%s", kUser);
    std::snprintf(t->chap_pass, sizeof t->chap_pass, "%s", kSecret);
    ASSERT_EQ(iscsi_mod_set_target_chap(t.get()), 0);
    iscsi_lun_t *lun = iscsi_lun_new();
    std::snprintf(lun->name, sizeof lun->name, "%s", lun_name.c_str());
    std::snprintf(lun->path, sizeof lun->path, "%s", img.c_str());
    std::snprintf(lun->serial, sizeof lun->serial, "sn-%s", name.c_str());
    lun->size = 4 << 20;
    lun->hba_id = hba;
    ASSERT_EQ(iscsi_mod_add_backstore(lun), 0);
    ASSERT_EQ(iscsi_mod_add_lun_mapping(lun, t.get(), 0), 0);
    ASSERT_EQ(iscsi_mod_add_acl_initiator(kInitiator, t.get()), 0);
    iscsi_map_lun_t *map = iscsi_map_lun_new();
    iscsi_initiator_t *init = iscsi_initiator_new();
    iscsi_lun_acl_t *acl = iscsi_lun_acl_new();
    map->target = t.get();
    map->lun_num = 0;
    std::snprintf(init->name, sizeof init->name, "%s", kInitiator);
    acl->map_lun = map;
    acl->initiator = init;
    acl->access_right = 2;
    const int rc = iscsi_mod_add_lun_acl(acl);
    iscsi_lun_acl_free(acl);
    iscsi_initiator_free(init);
    iscsi_map_lun_free(map);
    iscsi_lun_free(lun);
    ASSERT_EQ(rc, 0);
    ASSERT_EQ(iscsi_mod_enable_target(t.get()), 0);
}

// Running, and not a zombie left for the VM's init to reap.
bool alive(long long pid)
{
    const std::string stat = slurp("/proc/" + std::to_string(pid) + "/stat");
    const size_t close = stat.rfind(')');
    return close != std::string::npos && stat.compare(close + 2, 1, "Z") != 0;
}

TEST(ApplianceInTheVm, AnInitiatorFindsTheTargetsThroughIsnsAndUsesThem)
{
    if (!korv_test::isnsd_available())
        GTEST_SKIP() << "isnsd/isnsadm were not copied into the VM";
    korv_test::XmldbProcess db("/var/run/xmldb_sock_iscsi");
    db.start();
    korv_test::isnsd_server srv(kServer);
    ASSERT_TRUE(srv.start()) << srv.error();
    ASSERT_EQ(xmldb_set_iqn_prefix("iqn.2026-01.org.example:"), 0);
    ASSERT_EQ(iscsi_mod_select(ISCSI_MOD_TYPE_LIO), 0);
    ASSERT_EQ(iscsi_mod_start(), 0);
    ASSERT_NO_FATAL_FAILURE(build_target("disk1", 1));
    ASSERT_NO_FATAL_FAILURE(build_target("disk2", 2));
    const std::string disk1 = iqn_of("disk1"), disk2 = iqn_of("disk2");
    const std::string portal = std::string(kAddress) + ":3260 ";

    // The initiator as an iSNS client: registered, then querying as itself.
    std::ofstream(kIsnsadmConf) << "SourceName = " << kInitiator << "\nServerAddress = " << kServer
                                << "\nSecurity = 0\n";
    const std::string reg = run(std::string("isnsadm -c ") + kIsnsadmConf +
                                " --register entity=host1 initiator=" + kInitiator);
    ASSERT_NE(reg.find("Successfully registered"), std::string::npos) << reg;
    EXPECT_EQ(discover(), (std::map<std::string, std::string>{})) << "no target before the daemon runs";

    // The management tool's start: nesrad from PATH through the shell.
    const std::string bin = korv_test::nesrad_binary();
    ::setenv("PATH", (bin.substr(0, bin.rfind('/')) + ":" + ::getenv("PATH")).c_str(), 1);
    ASSERT_EQ(xmldb_set_service_enable(1), 0);
    ASSERT_EQ(isns_set_setting(1, kServer, 0), 0);
    long long pid = 0;
    EXPECT_TRUE(eventually([&] { return (pid = korv_test::stored_pid()) > 0 && alive(pid); }, 10s));
    const std::map<std::string, std::string> both{{disk1, portal}, {disk2, portal}};
    EXPECT_TRUE(eventually([&] { return discover() == both; }, 15s)) << srv.adm("--list nodes");

    // Login with CHAP at the discovered portal; the pattern lands in the file.
    std::string pattern(512, '\0');
    for (size_t i = 0; i < pattern.size(); i++)
        pattern[i] = static_cast<char>("appliance"[i % 9] ^ (i / 9));
    for (const std::string &iqn : {disk1, disk2}) {
        const std::string at = discover()[iqn];
        ASSERT_FALSE(at.empty()) << iqn;
        EXPECT_EQ(login_and_io(at.substr(0, at.find(' ')), iqn, kSecret, pattern), pattern) << iqn;
        EXPECT_EQ(login_and_io(at.substr(0, at.find(' ')), iqn, "wrong-secret-1"), "") << iqn;
    }
    EXPECT_EQ(slurp("/tmp/disk2.img").substr(8 * 512, 512), pattern);

    // disk2 deleted in kernel and store; SIGUSR1 makes the daemon follow.
    vm::Target gone = vm::make_target(disk2, 1);
    ASSERT_EQ(iscsi_mod_del_target(gone.get()), 0);
    ASSERT_EQ(xmldb_del_target_by_name("disk2"), 0);
    notify_isnsclient(SIGUSR1);
    EXPECT_TRUE(eventually([&] { return discover() == std::map<std::string, std::string>{{disk1, portal}}; },
                           15s))
        << srv.adm("--list nodes");
    EXPECT_EQ(login_and_io(kAddress + std::string(":3260"), disk1, kSecret), pattern);
    EXPECT_EQ(korv_test::stored_pid(), pid) << "SIGUSR1 restarted the daemon";

    // Off: the daemon deregisters and exits, and stores pid 0.
    ASSERT_EQ(isns_set_setting(0, nullptr, 1), 0);
    EXPECT_TRUE(eventually([&] { return korv_test::stored_pid() == 0 && !alive(pid); }, 10s));
    EXPECT_EQ(discover(), (std::map<std::string, std::string>{})) << srv.adm("--list nodes");
    int enabled = -1;
    EXPECT_EQ(xmldb_get_nesrad_enable(&enabled), 0);
    EXPECT_EQ(enabled, 0);
    char server[64] = {};
    xmldb_get_nesrad_ip(server, sizeof server);
    EXPECT_STREQ(server, kServer);

    EXPECT_EQ(isns_factory_reset(), 0);
    server[0] = 0;
    xmldb_get_nesrad_ip(server, sizeof server);
    EXPECT_STREQ(server, "");
    EXPECT_EQ(iscsi_mod_stop(), 0);
}

} // namespace
