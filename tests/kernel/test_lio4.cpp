// The LIO back end on the host: attribute I/O on plain files, shell escaping,
// module start/stop decisions with stand-in commands, CHAP checks, portal
// names and portal lists. How configfs itself reacts is the VM suite's part.
#include "kernel/korvadm_mod_lio4.h"

#include <fcntl.h>
#include <poll.h>
#include <unistd.h>

#include <cstdio>
#include <cstring>
#include <filesystem>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

#include "common/korvadm_err.h"
#include "common/korvadm_log.h"
#include "tests/kernel/kernel_root.h"
#include "tests/support/capture.h"

namespace {

using korv_test::capture_stdout;
using korv_test::KernelRoot;

const char *const IQN = "iqn.2026-01.test:t1";

class Lio4Test : public KernelRoot {
protected:
    std::string tpg(int tpgt = 1) { return at("/sys/kernel/config/target/iscsi/") + IQN + "/tpgt_" + std::to_string(tpgt); }

    iscsi_target_t *target(int tpgt = 1)
    {
        iscsi_target_t *t = iscsi_target_new();
        std::strcpy(t->iqn, IQN);
        t->tpgt = tpgt;
        owned_.push_back(t);
        return t;
    }
    static void add_ip(iscsi_target_t *t, const char *v4, const char *v6, const char *dev, int port)
    {
        iscsi_ip_t *ip = iscsi_ip_new();
        std::strcpy(ip->ipv4, v4);
        std::strcpy(ip->ipv6, v6);
        std::strcpy(ip->dev_name, dev);
        ip->port = port;
        list_append(&ip->node, &t->ip_list);
    }
    std::set<std::string> np_names()
    {
        std::set<std::string> names;
        for (const auto &e : std::filesystem::directory_iterator(tpg() + "/np"))
            names.insert(e.path().filename().string());
        return names;
    }
    void TearDown() override
    {
        for (iscsi_target_t *t : owned_)
            iscsi_target_free(t);
        KernelRoot::TearDown();
    }
    std::vector<iscsi_target_t *> owned_;
};

/* ------------------------------------------------------- attribute reads */

TEST_F(Lio4Test, ReadStripsOneLineEndNearTheEnd)
{
    std::string path = at("/attr");
    char buf[64];
    struct {
        const char *text;
        const char *want;
    } cases[] = {
        {"1\n", "1"},
        {"abc", "abc"},
        {"CHAP,None\n", "CHAP,None"},
        {"ab\ncdefghijkl", "ab\ncdefghijkl"},  // newline 11 characters from the end stays
        {"ab\ncdefghijk", "ab"},               // ... at 10 it goes
        {"\n", "\n"},                          // the first character is never stripped
        {"", ""},
    };
    for (auto &c : cases) {
        write_file(path, c.text);
        std::memset(buf, 0, sizeof buf);
        ASSERT_EQ(configfs_read_attr_str(path.c_str(), buf, sizeof buf), 0) << c.text;
        EXPECT_STREQ(buf, c.want) << c.text;
    }
}

TEST_F(Lio4Test, ReadIntoAFullBufferStaysInside)
{
    // As a verified write's read-back sees it: value plus the kernel's newline.
    std::string path = at("/attr");
    write_file(path, "CHAP,None\n");
    char *buf = new char[10];
    std::memset(buf, 'Z', 10);
    ASSERT_EQ(configfs_read_attr_str(path.c_str(), buf, 10), 0);
    EXPECT_STREQ(buf, "CHAP,None");
    delete[] buf;

    char one[1] = {'Z'};
    ASSERT_EQ(configfs_read_attr_str(path.c_str(), one, 1), 0);
    EXPECT_EQ(one[0], '\0');

    char big[8];
    EXPECT_EQ(configfs_read_attr_str(at("/missing").c_str(), big, sizeof big), ERR_CONFIGFS);
    EXPECT_EQ(configfs_read_attr_str(path.c_str(), big, 0), ERR_PARAM);
    EXPECT_EQ(configfs_read_attr_str(nullptr, big, sizeof big), ERR_PARAM);

    size_t len = 99;
    ASSERT_EQ(configfs_read_attr_buf(path.c_str(), big, sizeof big, &len), 0);
    EXPECT_EQ(len, sizeof big);
    EXPECT_EQ(std::string(big, len), "CHAP,Non");
}

TEST_F(Lio4Test, ReadIntegerAttribute)
{
    std::string path = at("/attr");
    int v = -5;
    write_file(path, "42\n");
    ASSERT_EQ(configfs_read_attr_int(path.c_str(), &v), 0);
    EXPECT_EQ(v, 42);
    write_file(path, "");
    EXPECT_EQ(configfs_read_attr_int(path.c_str(), &v), ERR_ATTR_EMPTY);
    write_file(path, "abc\n");
    EXPECT_EQ(configfs_read_attr_int(path.c_str(), &v), 0);  // nothing converted
    EXPECT_EQ(v, 42);
    EXPECT_EQ(configfs_read_attr_int(at("/missing").c_str(), &v), ERR_CONFIGFS);
}

/* ------------------------------------------------------ attribute writes */

TEST_F(Lio4Test, WritesKeepTheValueExactAndNeverRunIt)
{
    std::string canary = at("/CANARY");
    const std::string values[] = {
        "x\"; touch " + canary + "; echo \"",
        "$(touch " + canary + ")",
        "`touch " + canary + "`",
        "a\\tb\\c",
        "100%s %d",
        "-n",
        "",
    };
    // The attribute's own path carries shell syntax too.
    std::string path = at("/dir $(id) `id`/attr\"x");
    write_file(path, "");
    for (const std::string &v : values) {
        ASSERT_EQ(configfs_write_attr_str(path.c_str(), v.c_str(), 1), 0) << v;
        EXPECT_EQ(read_file(path), v);
    }
    EXPECT_FALSE(exists(canary));
    ASSERT_EQ(configfs_write_attr_int(path.c_str(), -17, 1), 0);
    EXPECT_EQ(read_file(path), "-17");
}

TEST_F(Lio4Test, VerifiedWriteReportsAValueThatDoesNotReadBack)
{
    // /dev/null takes the write and reads back empty, like a refused value.
    std::string path = at("/attr");
    ASSERT_EQ(symlink("/dev/null", path.c_str()), 0);
    EXPECT_EQ(configfs_write_attr_str(path.c_str(), "CHAP,None", 1), ERR_ATTR_MISMATCH);
    EXPECT_EQ(configfs_write_attr_str(path.c_str(), "CHAP,None", 0), 0);
    EXPECT_EQ(configfs_write_attr_str(at("/no/dir/attr").c_str(), "1", 0), ERR_CONFIGFS);
    EXPECT_EQ(configfs_write_attr_str(nullptr, "1", 0), ERR_PARAM);
    EXPECT_EQ(configfs_write_attr_str(path.c_str(), nullptr, 0), ERR_PARAM);
}

// The first write fails because the attribute's directory is missing; a
// helper creates it before the retry. The retry cannot start early: our log
// line in between blocks on a full standard-output pipe until the helper,
// having seen the first attempt's shell error, creates the directory and
// drains the pipe.
TEST_F(Lio4Test, WriteFallsBackToALineEnd)
{
    std::string dir = at("/late");
    std::string path = dir + "/attr";
    int out[2], err[2];
    ASSERT_EQ(pipe(out), 0);
    ASSERT_EQ(pipe(err), 0);
    fcntl(out[1], F_SETFL, O_NONBLOCK);
    char fill[4096] = {0};
    while (write(out[1], fill, sizeof fill) > 0) {
    }
    while (write(out[1], fill, 1) > 0) {
    }
    fcntl(out[1], F_SETFL, 0);

    std::fflush(stdout);
    int saved_out = dup(1), saved_err = dup(2);
    dup2(out[1], 1);
    dup2(err[1], 2);
    close(out[1]);
    close(err[1]);

    std::string shell_error;
    std::thread helper([&] {
        char c;
        while (read(err[0], &c, 1) == 1 && c != '\n')
            shell_error += c;
        mkdirs(dir);
        char buf[4096];
        while (read(out[0], buf, sizeof buf) > 0) {
        }
    });
    int rc = configfs_write_attr_str(path.c_str(), "value", 1);
    std::fflush(stdout);
    dup2(saved_out, 1);
    dup2(saved_err, 2);
    close(saved_out);
    close(saved_err);
    helper.join();
    close(out[0]);
    close(err[0]);

    EXPECT_NE(shell_error.find("late"), std::string::npos) << shell_error;
    EXPECT_EQ(rc, 0);
    EXPECT_EQ(read_file(path), "value\n");
}

/* ---------------------------------------------------------------- modules */

class ModuleTest : public Lio4Test {
protected:
    void install(const char *name) { write_file(at("/usr/local/modules/driver/") + name + ".ko", ""); }
    void install_all()
    {
        install("target_core_mod");
        install("target_core_file");
        install("iscsi_target_mod");
    }
    std::string fabric() { return at("/sys/kernel/config/target/iscsi"); }
    std::string modules() { return read_file(at("/proc/modules")); }
};

TEST_F(ModuleTest, StartMountsInsertsInOrderAndCreatesTheFabric)
{
    install_all();
    EXPECT_EQ(lio3_get_module_state(), 1);
    ASSERT_EQ(lio3_start_module(), 0);
    EXPECT_EQ(lio3_get_module_state(), 0);
    std::string m = modules();
    EXPECT_LT(m.find("target_core_mod"), m.find("target_core_file"));
    EXPECT_LT(m.find("target_core_file"), m.find("iscsi_target_mod"));
    EXPECT_TRUE(exists(fabric()));
    EXPECT_TRUE(exists(at("/var/target/pr")));
    EXPECT_TRUE(exists(at("/var/target/alua")));
    EXPECT_NE(calls().find("mount -t configfs configfs " + at("/sys/kernel/config")), std::string::npos);
    EXPECT_EQ(configfs_is_mounted(), 0);
}

TEST_F(ModuleTest, StartDoesNotMountTwice)
{
    install_all();
    std::string mp = at("/sys/kernel/config");
    mkdirs(mp);
    write_file(at("/proc/self/mountinfo"), "40 25 0:40 / " + mp + " rw - configfs configfs rw\n");
    ASSERT_EQ(lio3_start_module(), 0);
    EXPECT_EQ(calls().find("mount "), std::string::npos);
}

TEST_F(ModuleTest, StartGoesOnWithoutTheCoreModule)
{
    install("target_core_file");
    install("iscsi_target_mod");
    std::string log = capture_stdout([] { EXPECT_EQ(lio3_start_module(), 0); });
    EXPECT_NE(log.find("Insert module target_core_mod.ko failed"), std::string::npos);
    EXPECT_NE(modules().find("target_core_file"), std::string::npos);
}

TEST_F(ModuleTest, StartWithAModuleMissingRollsBack)
{
    install("target_core_mod");
    install("target_core_file");
    EXPECT_EQ(lio3_start_module(), ERR_MODULE_START);
    EXPECT_EQ(modules(), "");
    EXPECT_FALSE(exists(fabric()));
    std::string c = calls();
    size_t a = c.find("rmmod iscsi_target_mod"), b = c.find("rmmod target_core_file"), d = c.find("rmmod target_core_mod");
    ASSERT_NE(d, std::string::npos);
    EXPECT_LT(a, b);
    EXPECT_LT(b, d);
    EXPECT_EQ(lio3_get_module_state(), 1);
}

TEST_F(ModuleTest, StopFromRunningClearsConfigfsThenRemovesModules)
{
    install_all();
    ASSERT_EQ(lio3_start_module(), 0);
    mkdirs(at("/sys/kernel/config/target/core/alua"));
    EXPECT_EQ(lio3_stop_module(), 0);
    EXPECT_EQ(modules(), "");
    EXPECT_FALSE(exists(fabric()));
    EXPECT_TRUE(exists(at("/sys/kernel/config/target/core/alua")));
    EXPECT_EQ(lio3_get_module_state(), 1);
}

TEST_F(ModuleTest, StopFromHalfStartedOnlyRemovesModules)
{
    write_file(at("/proc/modules"),
               "target_core_mod 1 0 - Live 0x0\ntarget_core_file 1 0 - Live 0x0\niscsi_target_mod 1 0 - Live 0x0\n");
    // A stray backstore: only the running state's clean-up would touch it.
    mkdirs(at("/sys/kernel/config/target/core/fileio_0/disk1"));
    EXPECT_EQ(lio3_get_module_state(), ERR_MODULE_NO_CONFIGFS);
    EXPECT_EQ(lio3_stop_module(), 0);
    EXPECT_EQ(modules(), "");
    EXPECT_TRUE(exists(at("/sys/kernel/config/target/core/fileio_0/disk1")));
}

TEST_F(ModuleTest, StopWhenStoppedTouchesNothing)
{
    mkdirs(fabric() + "/iqn.x/tpgt_1");
    EXPECT_EQ(lio3_stop_module(), 0);
    EXPECT_EQ(calls(), "");
    EXPECT_TRUE(exists(fabric() + "/iqn.x/tpgt_1"));
}

TEST_F(ModuleTest, StopReportsAModuleThatStaysIn)
{
    install_all();
    ASSERT_EQ(lio3_start_module(), 0);
    write_file(at("/busy-target_core_file"), "");
    EXPECT_EQ(lio3_stop_module(), ERR_MODULE_REMOVE);
    EXPECT_NE(modules().find("target_core_file"), std::string::npos);

    // iscsi_target_mod is out, so the driver counts as stopped now.
    EXPECT_EQ(lio3_stop_module(), 0);

    std::remove(at("/busy-target_core_file").c_str());
    ASSERT_EQ(lio3_start_module(), 0);
    write_file(at("/busy-target_core_mod"), "");
    EXPECT_EQ(lio3_stop_module(), 0);  // the core module alone is only logged
    EXPECT_EQ(modules().find("target_core_file"), std::string::npos);
    EXPECT_NE(modules().find("target_core_mod"), std::string::npos);
}

/* ------------------------------------------------------------------- CHAP */

TEST_F(Lio4Test, ChapPasswordLengthAndMutualOnlyWithOneWay)
{
    iscsi_target_t *t = target();
    EXPECT_EQ(_lio3_validate_target_chap_settings(t), 1);  // off
    t->chap = 1;
    std::strcpy(t->chap_user, "user");
    struct {
        size_t len;
        int valid;
    } lens[] = {{11, 0}, {12, 1}, {16, 1}, {17, 0}, {0, 0}};
    for (auto &l : lens) {
        std::strcpy(t->chap_pass, std::string(l.len, 'p').c_str());
        EXPECT_EQ(_lio3_validate_target_chap_settings(t), l.valid) << l.len;
    }
    std::strcpy(t->chap_pass, "twelve-chars");
    t->chap_user[0] = '\0';
    EXPECT_EQ(_lio3_validate_target_chap_settings(t), 0);
    std::strcpy(t->chap_user, "user");

    t->mutual_chap = 1;  // mutual on, but with no name and a short password
    std::strcpy(t->mutual_pass, "short");
    EXPECT_EQ(_lio3_validate_target_chap_settings(t), 0);
    std::strcpy(t->mutual_user, "muser");
    EXPECT_EQ(_lio3_validate_target_chap_settings(t), 0);
    std::strcpy(t->mutual_pass, "sixteen-chars-xx");
    EXPECT_EQ(_lio3_validate_target_chap_settings(t), 1);

    t->chap = 0;  // one-way off: mutual is not looked at, even when invalid
    t->mutual_user[0] = '\0';
    std::strcpy(t->mutual_pass, "x");
    EXPECT_EQ(_lio3_validate_target_chap_settings(t), 1);
    EXPECT_EQ(_lio3_validate_target_chap_settings(nullptr), 0);
}

TEST_F(Lio4Test, ChapCredentialsGoToEveryAclAndMutualNeedsOneWay)
{
    iscsi_target_t *t = target();
    for (const char *acl : {"iqn.i1", "iqn.i2"})
        for (const char *f : {"userid", "password", "userid_mutual", "password_mutual"})
            write_file(tpg() + "/acls/" + acl + "/auth/" + f, "");
    write_file(tpg() + "/attrib/authentication", "");
    write_file(tpg() + "/param/AuthMethod", "");

    t->chap = 1;
    std::strcpy(t->chap_user, "user");
    std::strcpy(t->chap_pass, "secret-12345");
    t->mutual_chap = 1;
    std::strcpy(t->mutual_user, "muser");
    std::strcpy(t->mutual_pass, "msecret-1234");
    ASSERT_EQ(lio3_set_target_chap(t), 0);
    EXPECT_EQ(read_file(tpg() + "/attrib/authentication"), "1");
    EXPECT_EQ(read_file(tpg() + "/param/AuthMethod"), "CHAP,None");
    for (const char *acl : {"iqn.i1", "iqn.i2"}) {
        std::string auth = tpg() + "/acls/" + acl + "/auth/";
        EXPECT_EQ(read_file(auth + "userid"), "user");
        EXPECT_EQ(read_file(auth + "password"), "secret-12345");
        EXPECT_EQ(read_file(auth + "userid_mutual"), "muser");
        EXPECT_EQ(read_file(auth + "password_mutual"), "msecret-1234");
    }

    // Off: the switch drops, credentials stay where they were.
    t->chap = 0;
    ASSERT_EQ(lio3_set_target_chap(t), 0);
    EXPECT_EQ(read_file(tpg() + "/attrib/authentication"), "0");
    EXPECT_EQ(read_file(tpg() + "/param/AuthMethod"), "CHAP,None");
    EXPECT_EQ(read_file(tpg() + "/acls/iqn.i1/auth/userid"), "user");

    // One ACL alone; with one-way off the mutual pair is never written.
    write_file(tpg() + "/acls/iqn.i1/auth/userid_mutual", "");
    EXPECT_EQ(_lio3_set_target_chap_to_acl("iqn.i1", t), 0);
    EXPECT_EQ(read_file(tpg() + "/acls/iqn.i1/auth/userid_mutual"), "");

    t->chap = 1;
    std::strcpy(t->chap_pass, "short");
    EXPECT_EQ(lio3_set_target_chap(t), ERR_PARAM);
    EXPECT_EQ(_lio3_set_target_chap_to_acl("iqn.i1", t), ERR_PARAM);
    EXPECT_EQ(_lio3_set_target_chap_to_acl("", t), ERR_PARAM);
}

/* ---------------------------------------------------------------- portals */

TEST_F(Lio4Test, PortalNamesParse)
{
    char addr[40], iface[16];
    int port = -1;
    ASSERT_EQ(_parse_lio_np_entry(addr, sizeof addr, &port, iface, sizeof iface, "[fe80::1%eth0]:3260"), 0);
    EXPECT_STREQ(addr, "fe80::1");
    EXPECT_STREQ(iface, "eth0");
    EXPECT_EQ(port, 3260);
    ASSERT_EQ(_parse_lio_np_entry(addr, sizeof addr, &port, iface, sizeof iface, "10.0.0.1:3260"), 0);
    EXPECT_STREQ(addr, "10.0.0.1");
    EXPECT_STREQ(iface, "");
    EXPECT_EQ(port, 3260);
    ASSERT_EQ(_parse_lio_np_entry(addr, sizeof addr, &port, iface, sizeof iface, "[2001:db8::1]:65535"), 0);
    EXPECT_STREQ(addr, "2001:db8::1");
    EXPECT_EQ(port, 65535);
    ASSERT_EQ(_parse_lio_np_entry(addr, sizeof addr, &port, iface, sizeof iface, "10.0.0.1:"), 0);
    EXPECT_EQ(port, 0);

    EXPECT_EQ(_parse_lio_np_entry(addr, sizeof addr, &port, iface, sizeof iface, "10.0.0.1:326000"), ERR_PARAM);
    EXPECT_EQ(_parse_lio_np_entry(addr, sizeof addr, &port, iface, sizeof iface, "10.0.0.1"), ERR_PARAM);
    EXPECT_EQ(_parse_lio_np_entry(addr, sizeof addr, &port, iface, sizeof iface, ""), ERR_ATTR_EMPTY);
    EXPECT_EQ(_parse_lio_np_entry(addr, sizeof addr, &port, iface, sizeof iface, nullptr), ERR_PARAM);
    std::string long_addr = "[" + std::string(40, 'a') + "::1]:3260";
    EXPECT_EQ(_parse_lio_np_entry(addr, sizeof addr, &port, iface, sizeof iface, long_addr.c_str()), ERR_PARAM);
    std::string long_if = "[fe80::1%" + std::string(16, 'e') + "]:3260";
    EXPECT_EQ(_parse_lio_np_entry(addr, sizeof addr, &port, iface, sizeof iface, long_if.c_str()), ERR_PARAM);

    EXPECT_EQ(_check_np_ip_type("10.0.0.1:3260"), IP_TYPE_V4);
    EXPECT_EQ(_check_np_ip_type("[::1]:3260"), IP_TYPE_V6);
}

TEST_F(Lio4Test, PortalListDropsNamesThatDoNotParse)
{
    iscsi_target_t *t = target();
    for (const char *n : {"10.0.0.1:3260", "[fe80::1%eth0]:3260", "[2001:db8::1]:3261", "10.0.0.2:3260000",
                          "noport", "10.0.0.3:326"})
        mkdirs(tpg() + "/np/" + n);
    mkdirs(tpg() + "/np/[" + std::string(60, 'f') + "::1]:3260");
    write_file(tpg() + "/np/10.9.9.9:3260-file", "");  // not a directory

    list_t list;
    list_init(&list);
    ASSERT_EQ(lio3_get_target_existing_ip_list(&list, t), 0);
    EXPECT_EQ(list.count, 4);
    iscsi_ip_t *ll = iscsi_ip_search_list_by_IPv6(&list, "fe80::1");
    ASSERT_NE(ll, nullptr);
    EXPECT_STREQ(ll->dev_name, "eth0");
    EXPECT_EQ(ll->port, 3260);
    ASSERT_NE(iscsi_ip_search_list_by_IPv4(&list, "10.0.0.3"), nullptr);
    EXPECT_EQ(iscsi_ip_search_list_by_IPv4(&list, "10.0.0.3")->port, 326);
    iscsi_ip_free_list(&list);

    t->tpgt = 64;
    EXPECT_EQ(lio3_get_target_existing_ip_list(&list, t), ERR_PARAM);
    t->tpgt = 2;  // no such portal group
    EXPECT_EQ(lio3_get_target_existing_ip_list(&list, t), ERR_CONFIGFS);
    std::strcpy(t->iqn, "../../escape");
    t->tpgt = 1;
    EXPECT_EQ(lio3_get_target_existing_ip_list(&list, t), ERR_PARAM);
    EXPECT_EQ(list.count, 0);
}

TEST_F(Lio4Test, SetTargetIpReplacesEveryPortal)
{
    iscsi_target_t *t = target();
    mkdirs(tpg() + "/np/10.0.0.9:3260");
    add_ip(t, "10.0.0.1", "", "egiga0", 3260);
    add_ip(t, "", "fe80::2", "egiga1", 3260);
    add_ip(t, "10.0.0.2", "2001:db8::2", "egiga0", 3261);
    ASSERT_EQ(lio3_set_target_ip(t), 0);
    std::set<std::string> want = {"10.0.0.1:3260", "10.0.0.2:3261", "[fe80::2%egiga1]:3260", "[2001:db8::2]:3261"};
    EXPECT_EQ(np_names(), want);
}

TEST_F(Lio4Test, SetTargetIpV2ChangesOnlyTheDifference)
{
    iscsi_target_t *t = target();
    mkdirs(tpg() + "/np/10.0.0.1:3260");
    mkdirs(tpg() + "/np/10.0.0.9:3260");
    mkdirs(tpg() + "/np/[fe80::1%eth0]:3260");
    // A kept portal must not be recreated: a file inside would make rmdir fail.
    write_file(tpg() + "/np/10.0.0.1:3260/marker", "");
    write_file(tpg() + "/np/[fe80::1%eth0]:3260/marker", "");

    add_ip(t, "10.0.0.1", "", "eth0", 3299);  // same address, other port: still present
    add_ip(t, "", "fe80::1", "eth0", 3260);
    add_ip(t, "10.0.0.2", "2001:db8::7", "eth1", 3260);
    ASSERT_EQ(lio3_set_target_ip_v2(t), 0);
    std::set<std::string> want = {"10.0.0.1:3260", "10.0.0.2:3260", "[fe80::1%eth0]:3260", "[2001:db8::7]:3260"};
    EXPECT_EQ(np_names(), want);
    EXPECT_TRUE(exists(tpg() + "/np/10.0.0.1:3260/marker"));

    // Equal lists: nothing changes.
    for (const std::string &n : np_names())
        write_file(tpg() + "/np/" + n + "/marker", "");
    ASSERT_EQ(lio3_set_target_ip_v2(t), 0);
    EXPECT_EQ(np_names(), want);
    for (const std::string &n : want)
        EXPECT_TRUE(exists(tpg() + "/np/" + n + "/marker")) << n;
}

/* ------------------------------------------------ targets on plain files */

TEST_F(Lio4Test, AddingAnExistingTargetChangesNothing)
{
    iscsi_target_t *t = target();
    std::strcpy(t->alias, "new alias");
    write_file(tpg() + "/param/TargetAlias", "old alias\n");
    EXPECT_EQ(lio3_add_target(t), 0);
    EXPECT_EQ(read_file(tpg() + "/param/TargetAlias"), "old alias\n");
    EXPECT_FALSE(exists(at("/var/target/alua/iSCSI/") + IQN + "+1"));
}

TEST_F(Lio4Test, AddingATargetRollsBackWhenItsStateDirectoryCannotBeMade)
{
    iscsi_target_t *t = target();
    write_file(at("/var/target"), "");  // a file where the directory belongs
    EXPECT_EQ(lio3_add_target(t), ERR_CONFIGFS);
    EXPECT_FALSE(exists(at("/sys/kernel/config/target/iscsi/") + IQN));
}

TEST_F(Lio4Test, TargetChecksComeFirst)
{
    iscsi_target_t *t = target();
    list_t list;
    list_init(&list);
    for (int tpgt : {-1, 64}) {
        t->tpgt = tpgt;
        EXPECT_EQ(lio3_add_target(t), ERR_PARAM);
        EXPECT_EQ(lio3_del_target(t), ERR_PARAM);
        EXPECT_EQ(lio3_enable_target(t), ERR_PARAM);
        EXPECT_EQ(lio3_disable_target(t), ERR_PARAM);
        EXPECT_EQ(lio3_set_target_ip(t), ERR_PARAM);
    }
    t->tpgt = 1;
    for (const char *iqn : {"", "a/b", "..", "."}) {
        std::strcpy(t->iqn, iqn);
        EXPECT_EQ(lio3_add_target(t), ERR_PARAM) << iqn;
        EXPECT_EQ(lio3_set_target_chap(t), ERR_PARAM) << iqn;
    }
    std::memset(t->iqn, 'a', sizeof t->iqn);  // no terminator in the field
    EXPECT_EQ(lio3_add_target(t), ERR_PARAM);
    EXPECT_EQ(lio3_add_target(nullptr), ERR_PARAM);
    EXPECT_EQ(lio3_get_target_existing_ip_list(nullptr, t), ERR_PARAM);
    EXPECT_FALSE(exists(at("/sys")));
}

TEST_F(Lio4Test, EnableSwitch)
{
    iscsi_target_t *t = target();
    mkdirs(tpg() + "/param");
    // An unreadable switch counts as enabled.
    g_korv_debug_level = 1;
    std::string log = capture_stdout([&] { EXPECT_EQ(lio3_enable_target(t), 0); });
    EXPECT_NE(log.find("already enable target"), std::string::npos);
    EXPECT_FALSE(exists(tpg() + "/enable"));

    write_file(tpg() + "/enable", "0\n");
    EXPECT_EQ(lio3_disable_target(t), 0);
    EXPECT_EQ(read_file(tpg() + "/enable"), "0\n");  // untouched
    EXPECT_EQ(lio3_enable_target(t), 0);
    EXPECT_EQ(read_file(tpg() + "/enable"), "1");
    EXPECT_EQ(read_file(tpg() + "/param/AuthMethod"), "CHAP,None");
    EXPECT_EQ(lio3_disable_target(t), 0);
    EXPECT_EQ(read_file(tpg() + "/enable"), "0");
}

TEST_F(Lio4Test, DataOutTimeoutGoesToEveryAcl)
{
    iscsi_target_t *t = target();
    std::strcpy(t->alias, "alias");
    EXPECT_EQ(lio3_set_target_attr_dataout_timeout(20, t), ERR_TARGET_NOT_IN_KERNEL);
    mkdirs(tpg());
    EXPECT_EQ(lio3_set_target_attr_dataout_timeout(20, t), ERR_CONFIGFS);  // no acls directory
    write_file(tpg() + "/acls/iqn.i1/attrib/dataout_timeout", "3\n");
    write_file(tpg() + "/acls/iqn.i2/attrib/dataout_timeout", "3\n");
    mkdirs(tpg() + "/acls/iqn.broken");  // no attrib: logged, the rest still set
    ASSERT_EQ(lio3_set_target_attr_dataout_timeout(20, t), 0);
    EXPECT_EQ(read_file(tpg() + "/acls/iqn.i1/attrib/dataout_timeout"), "20");
    EXPECT_EQ(read_file(tpg() + "/acls/iqn.i2/attrib/dataout_timeout"), "20");
    EXPECT_EQ(lio3_set_target_attr_dataout_timeout(-1, t), ERR_PARAM);
}

TEST_F(Lio4Test, GroupRemovalUnlinksLinksWithoutFollowingThem)
{
    iscsi_target_t *t = target();
    std::string backstore = at("/sys/kernel/config/target/core/fileio_0/disk1");
    write_file(backstore + "/data", "keep");
    mkdirs(tpg() + "/lun/lun_0");
    mkdirs(tpg() + "/acls/iqn.i1/lun_0");
    mkdirs(tpg() + "/acls/iqn.i1/attrib");
    ASSERT_EQ(symlink(backstore.c_str(), (tpg() + "/lun/lun_0/disk1").c_str()), 0);
    ASSERT_EQ(symlink((tpg() + "/lun/lun_0").c_str(), (tpg() + "/acls/iqn.i1/lun_0/lun_0").c_str()), 0);

    ASSERT_EQ(_lio3_remove_all_acl(t), 0);
    EXPECT_FALSE(exists(tpg() + "/acls/iqn.i1"));
    EXPECT_TRUE(exists(tpg() + "/lun/lun_0/disk1"));
    ASSERT_EQ(_lio3_remove_all_lun(t), 0);
    EXPECT_FALSE(exists(tpg() + "/lun/lun_0"));
    EXPECT_EQ(read_file(backstore + "/data"), "keep");

    t->tpgt = 2;  // no such portal group
    EXPECT_EQ(_lio3_remove_all_acl(t), ERR_PARAM);
}

TEST_F(Lio4Test, ShutdownBackstoreChecksTheLun)
{
    iscsi_lun_t *lun = iscsi_lun_new();
    EXPECT_EQ(lio3_shutdown_backstore(nullptr), ERR_PARAM);
    EXPECT_EQ(lio3_shutdown_backstore(lun), ERR_PARAM);  // no name
    std::strcpy(lun->name, "disk1");
    EXPECT_EQ(lio3_shutdown_backstore(lun), ERR_PARAM);  // no HBA id
    lun->hba_id = 0;
    EXPECT_EQ(lio3_shutdown_backstore(lun), 0);  // already gone
    std::strcpy(lun->name, "../x");
    EXPECT_EQ(lio3_shutdown_backstore(lun), ERR_PARAM);
    iscsi_lun_free(lun);
}

}  // namespace
