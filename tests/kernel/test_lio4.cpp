// The LIO back end on the host: attribute I/O on plain files, shell escaping,
// module start/stop decisions with stand-in commands, CHAP checks, portal
// names and portal lists. How configfs itself reacts is the VM suite's part.
#include "kernel/korvadm_mod_lio4_internal.h"

#include <fcntl.h>
#include <unistd.h>

#include <cstdio>
#include <cstring>
#include <filesystem>
#include <initializer_list>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include <gtest/gtest.h>

#include "common/korvadm_err.h"
#include "tests/support/sysroot.h"
#include "tests/support/capture.h"

namespace {

using korv_test::capture_stdout;
using korv_test::SysRootTest;

const char *const IQN = "iqn.2026-01.test:t1";

class Lio4Test : public SysRootTest {
protected:
    void SetUp() override
    {
        SysRootTest::SetUp();
        t = iscsi_target_new();
        std::strcpy(t->iqn, IQN);
        t->tpgt = 1;
    }
    void TearDown() override
    {
        iscsi_target_free(t);
        SysRootTest::TearDown();
    }
    std::string tpg() { return at("/sys/kernel/config/target/iscsi/") + IQN + "/tpgt_1"; }
    iscsi_target_t *t = nullptr;
};

/* ------------------------------------------------------- attribute reads */

TEST_F(Lio4Test, ReadStripsOneLineEndNearTheEndAndStaysInsideTheBuffer)
{
    std::string path = at("/attr");
    char buf[64];
    struct {
        const char *text;
        const char *want;
    } cases[] = {
        {"1\n", "1"},
        {"abc", "abc"},
        {"ab\ncdefghijkl", "ab\ncdefghijkl"},  // newline 11 characters from the end stays
        {"ab\ncdefghijk", "ab"},               // ... at 10 it goes
        {"\n", "\n"},                          // the first character is never stripped
        {"", ""},
    };
    for (auto &c : cases) {
        write_file(path, c.text);
        ASSERT_EQ(configfs_read_attr_str(path.c_str(), buf, sizeof buf), 0) << c.text;
        EXPECT_STREQ(buf, c.want) << c.text;
    }
    int v = -5;
    write_file(path, "42\n");
    ASSERT_EQ(configfs_read_attr_int(path.c_str(), &v), 0);
    EXPECT_EQ(v, 42);
    write_file(path, "");
    EXPECT_EQ(configfs_read_attr_int(path.c_str(), &v), ERR_ATTR_EMPTY);
    EXPECT_EQ(configfs_read_attr_int(at("/missing").c_str(), &v), ERR_CONFIGFS);

    // A full buffer, as a verified write's read-back sees it: the value plus
    // the kernel's newline.
    write_file(path, "CHAP,None\n");
    for (size_t size : {10, 1}) {
        std::vector<char> buf(size, 'Z');  // heap, so the sanitizer sees an overrun
        ASSERT_EQ(configfs_read_attr_str(path.c_str(), buf.data(), size), 0);
        EXPECT_EQ(std::string(buf.data()), std::string("CHAP,None").substr(0, size - 1));
    }
}

/* ------------------------------------------------------ attribute writes */

TEST_F(Lio4Test, WritesKeepTheValueExactNeverRunItAndVerifyTheReadBack)
{
    std::string canary = at("/CANARY");
    const std::string values[] = {
        "x\"; touch " + canary + "; echo \"", "$(touch " + canary + ")", "`touch " + canary + "`",
        "a\\tb\\c", "100%s %d", "-n", "",
    };
    // The attribute's own path carries shell syntax too.
    std::string path = at("/dir $(id) `id`/attr\"x");
    write_file(path, "");
    for (const std::string &v : values) {
        ASSERT_EQ(configfs_write_attr_str(path.c_str(), v.c_str(), 1), 0) << v;
        EXPECT_EQ(read_file(path), v);
    }
    EXPECT_FALSE(exists(canary));

    // /dev/null takes the write and reads back empty, like a refused value.
    ASSERT_EQ(symlink("/dev/null", at("/null").c_str()), 0);
    EXPECT_EQ(configfs_write_attr_str(at("/null").c_str(), "CHAP,None", 1), ERR_ATTR_MISMATCH);
    EXPECT_EQ(configfs_write_attr_str(at("/null").c_str(), "CHAP,None", 0), 0);
    EXPECT_EQ(configfs_write_attr_str(at("/no/dir/attr").c_str(), "1", 0), ERR_CONFIGFS);
}

// The first write fails because the attribute's directory is missing; a
// helper creates it before the retry. The retry cannot start early: our log
// line in between blocks on a full standard-output pipe until the helper,
// having seen the first attempt's shell error, creates the directory and
// drains the pipe. Runs in a child, whose output it may take over.
TEST_F(Lio4Test, WriteFallsBackToALineEnd)
{
    std::string dir = at("/late");
    int status = korv_test::run_in_child([&] {
        int out[2], err[2];
        if (pipe(out) != 0 || pipe(err) != 0)
            return 4;
        fcntl(out[1], F_SETFL, O_NONBLOCK);
        char fill[4096] = {0};
        while (write(out[1], fill, sizeof fill) > 0 || write(out[1], fill, 1) > 0) {
        }
        fcntl(out[1], F_SETFL, 0);
        dup2(out[1], 1);
        dup2(err[1], 2);
        std::string shell_error;
        std::thread([&] {
            char c;
            while (read(err[0], &c, 1) == 1 && c != '\n')
                shell_error += c;
            mkdirs(dir);
            while (read(out[0], fill, sizeof fill) > 0) {
            }
        }).detach();
        int rc = configfs_write_attr_str((dir + "/attr").c_str(), "value", 1);
        return (rc == 0 ? 0 : 1) | (shell_error.find("late") != std::string::npos ? 0 : 2);
    });
    EXPECT_EQ(status, 0);  // 1: the write failed, 2: the first attempt did not
    EXPECT_EQ(read_file(dir + "/attr"), "value\n");
}

/* ---------------------------------------------------------------- modules */

class ModuleTest : public Lio4Test {
protected:
    void install(std::initializer_list<const char *> names)
    {
        for (const char *n : names)
            write_file(at("/usr/local/modules/driver/") + n + ".ko", "");
    }
    void install_all() { install({"target_core_mod", "target_core_file", "iscsi_target_mod"}); }
    std::string fabric() { return at("/sys/kernel/config/target/iscsi"); }
    std::string modules() { return read_file(at("/proc/modules")); }
    std::string calls() { return read_file(at("/calls.log")); }
};

TEST_F(ModuleTest, StartAndStopFromRunning)
{
    install_all();
    EXPECT_EQ(lio3_get_module_state(), 1);
    ASSERT_EQ(lio3_start_module(), 0);
    EXPECT_EQ(lio3_get_module_state(), 0);
    std::string m = modules();
    EXPECT_LT(m.find("target_core_mod"), m.find("target_core_file"));
    EXPECT_LT(m.find("target_core_file"), m.find("iscsi_target_mod"));
    EXPECT_TRUE(exists(at("/var/target/pr")) && exists(at("/var/target/alua")));
    EXPECT_NE(calls().find("mount -t configfs configfs " + at("/sys/kernel/config")), std::string::npos);

    mkdirs(at("/sys/kernel/config/target/core/alua"));
    EXPECT_EQ(lio3_stop_module(), 0);
    EXPECT_EQ(modules(), "");
    EXPECT_FALSE(exists(fabric()));
    EXPECT_TRUE(exists(at("/sys/kernel/config/target/core/alua")));
    EXPECT_EQ(lio3_get_module_state(), 1);

    // configfs stays mounted: a second start does not mount again.
    ASSERT_EQ(lio3_start_module(), 0);
    std::string c = calls();
    EXPECT_EQ(c.find("mount "), c.rfind("mount "));
}

TEST_F(ModuleTest, StartWithAModuleMissingRollsBack)
{
    install({"target_core_mod", "target_core_file"});
    EXPECT_EQ(lio3_start_module(), ERR_MODULE_START);
    EXPECT_EQ(modules(), "");
    EXPECT_FALSE(exists(fabric()));
    std::string c = calls();
    size_t a = c.find("rmmod iscsi_target_mod"), b = c.find("rmmod target_core_file");
    size_t d = c.find("rmmod target_core_mod");
    ASSERT_NE(d, std::string::npos);
    EXPECT_LT(a, b);
    EXPECT_LT(b, d);

    // Only the core module may be missing: start goes on and logs it.
    install({"iscsi_target_mod"});
    std::remove(at("/usr/local/modules/driver/target_core_mod.ko").c_str());
    std::string log = capture_stdout([] { EXPECT_EQ(lio3_start_module(), 0); });
    EXPECT_NE(log.find("Insert module target_core_mod.ko failed"), std::string::npos);
}

TEST_F(ModuleTest, StopFromHalfStartedOrStopped)
{
    // Stopped: nothing is touched.
    mkdirs(fabric() + "/iqn.x/tpgt_1");
    EXPECT_EQ(lio3_stop_module(), 0);
    EXPECT_EQ(calls(), "");
    EXPECT_TRUE(exists(fabric() + "/iqn.x/tpgt_1"));

    // Half started: only the modules go, configfs is not cleared.
    std::filesystem::remove_all(fabric());
    write_file(at("/proc/modules"),
               "target_core_mod 1 0 - Live 0x0\ntarget_core_file 1 0 - Live 0x0\niscsi_target_mod 1 0 - Live 0x0\n");
    mkdirs(at("/sys/kernel/config/target/core/fileio_0/disk1"));
    EXPECT_EQ(lio3_get_module_state(), ERR_MODULE_NO_CONFIGFS);
    EXPECT_EQ(lio3_stop_module(), 0);
    EXPECT_EQ(modules(), "");
    EXPECT_TRUE(exists(at("/sys/kernel/config/target/core/fileio_0/disk1")));
}

TEST_F(ModuleTest, StopReportsAModuleThatStaysIn)
{
    install_all();
    ASSERT_EQ(lio3_start_module(), 0);
    write_file(at("/busy-target_core_file"), "");
    EXPECT_EQ(lio3_stop_module(), ERR_MODULE_REMOVE);
    EXPECT_NE(modules().find("target_core_file"), std::string::npos);

    std::remove(at("/busy-target_core_file").c_str());
    ASSERT_EQ(lio3_start_module(), 0);
    write_file(at("/busy-target_core_mod"), "");
    EXPECT_EQ(lio3_stop_module(), 0);  // the core module alone is only logged
    EXPECT_NE(modules().find("target_core_mod"), std::string::npos);
}

/* ------------------------------------------------------------------- CHAP */

TEST_F(Lio4Test, ChapPasswordLengthAndMutualOnlyWithOneWay)
{
    t->chap = 1;
    std::strcpy(t->chap_user, "user");
    const std::pair<int, int> lens[] = {{11, 0}, {12, 1}, {16, 1}, {17, 0}, {0, 0}};
    for (auto [len, valid] : lens) {
        std::strcpy(t->chap_pass, std::string(len, 'p').c_str());
        EXPECT_EQ(_lio3_validate_target_chap_settings(t), valid) << len;
    }
    std::strcpy(t->chap_pass, std::string(17, 'p').c_str());
    std::string log = capture_stdout([&] { _lio3_validate_target_chap_settings(t); });
    EXPECT_NE(log.find("(korvadm_mod_lio4:_lio3_validate_target_chap_settings:"), std::string::npos) << log;
    EXPECT_NE(log.find("CHAP enabled, but CHAP password length = 17 is not between 12 to 16"), std::string::npos);
    std::strcpy(t->chap_pass, "twelve-chars");
    t->chap_user[0] = '\0';
    EXPECT_EQ(_lio3_validate_target_chap_settings(t), 0);
    std::strcpy(t->chap_user, "user");

    t->mutual_chap = 1;
    std::strcpy(t->mutual_user, "muser");
    std::strcpy(t->mutual_pass, "short");
    EXPECT_EQ(_lio3_validate_target_chap_settings(t), 0);
    std::strcpy(t->mutual_pass, "sixteen-chars-xx");
    EXPECT_EQ(_lio3_validate_target_chap_settings(t), 1);
    t->mutual_user[0] = '\0';
    EXPECT_EQ(_lio3_validate_target_chap_settings(t), 0);

    t->chap = 0;  // one-way off: mutual is not looked at, even when invalid
    EXPECT_EQ(_lio3_validate_target_chap_settings(t), 1);
}

/* ---------------------------------------------------------------- portals */

TEST_F(Lio4Test, PortalNamesParse)
{
    char addr[40], iface[16];
    struct {
        const char *name;
        int rc;
        const char *addr = "", *iface = "";
        int port = 0;
    } cases[] = {
        {"[fe80::1%eth0]:3260", 0, "fe80::1", "eth0", 3260},
        {"10.0.0.1:3260", 0, "10.0.0.1", "", 3260},
        {"[2001:db8::1]:65535", 0, "2001:db8::1", "", 65535},
        {"10.0.0.1:", 0, "10.0.0.1", "", 0},
        {"10.0.0.1:326000", ERR_PARAM},  // a six-character port
        {"10.0.0.1", ERR_PARAM},
        {"", ERR_ATTR_EMPTY},
        {"[aaaaaaaaaaaaaaaaaaaaaaaaaaaaaaaaaaaaaaaa::1]:3260", ERR_PARAM},  // over-long address
        {"[fe80::1%eeeeeeeeeeeeeeee]:3260", ERR_PARAM},                     // over-long interface
    };
    for (auto &c : cases) {
        int port = -1;
        ASSERT_EQ(_parse_lio_np_entry(addr, sizeof addr, &port, iface, sizeof iface, c.name), c.rc) << c.name;
        if (c.rc == 0) {
            EXPECT_STREQ(addr, c.addr);
            EXPECT_STREQ(iface, c.iface);
            EXPECT_EQ(port, c.port);
        }
    }
    EXPECT_EQ(_check_np_ip_type("10.0.0.1:3260"), IP_TYPE_V4);
    EXPECT_EQ(_check_np_ip_type("[::1]:3260"), IP_TYPE_V6);
}

TEST_F(Lio4Test, PortalListDropsNamesThatDoNotParse)
{
    for (const char *n : {"10.0.0.1:3260", "[fe80::1%eth0]:3260", "[2001:db8::1]:3261", "10.0.0.2:3260000", "noport"})
        mkdirs(tpg() + "/np/" + n);
    mkdirs(tpg() + "/np/[" + std::string(60, 'f') + "::1]:3260");
    write_file(tpg() + "/np/10.9.9.9:3260-file", "");  // not a directory

    list_t list;
    list_init(&list);
    ASSERT_EQ(lio3_get_target_existing_ip_list(&list, t), 0);
    EXPECT_EQ(list.count, 3);
    iscsi_ip_t *ll = iscsi_ip_search_list_by_IPv6(&list, "fe80::1");
    ASSERT_NE(ll, nullptr);
    EXPECT_STREQ(ll->dev_name, "eth0");
    EXPECT_EQ(ll->port, 3260);
    iscsi_ip_free_list(&list);

    t->tpgt = 2;  // no such portal group
    EXPECT_EQ(lio3_get_target_existing_ip_list(&list, t), ERR_CONFIGFS);
    EXPECT_EQ(list.count, 0);
}

/* ------------------------------------------------ targets on plain files */

TEST_F(Lio4Test, TargetChecksComeFirst)
{
    list_t list;
    list_init(&list);
    for (int tpgt : {-1, 64}) {
        t->tpgt = tpgt;
        EXPECT_EQ(lio3_add_target(t), ERR_PARAM);
        EXPECT_EQ(lio3_del_target(t), ERR_PARAM);
        EXPECT_EQ(lio3_disable_target(t), ERR_PARAM);
        EXPECT_EQ(lio3_get_target_existing_ip_list(&list, t), ERR_PARAM);
    }
    t->tpgt = 1;
    for (const char *iqn : {"", "a/b", "..", "../../escape"}) {
        std::strcpy(t->iqn, iqn);
        EXPECT_EQ(lio3_add_target(t), ERR_PARAM) << iqn;
        EXPECT_EQ(lio3_set_target_chap(t), ERR_PARAM) << iqn;
        EXPECT_EQ(lio3_get_target_existing_ip_list(&list, t), ERR_PARAM) << iqn;
    }
    std::memset(t->iqn, 'a', sizeof t->iqn);  // no terminator in the field
    EXPECT_EQ(lio3_add_target(t), ERR_PARAM);
    EXPECT_EQ(lio3_add_target(nullptr), ERR_PARAM);

    // An unreadable switch counts as enabled, so disabling writes it; the
    // failure is logged under the setter's name.
    std::strcpy(t->iqn, IQN);
    std::string log = capture_stdout([&] { EXPECT_EQ(lio3_disable_target(t), ERR_CONFIGFS); });
    EXPECT_NE(log.find("(korvadm_mod_lio4:_lio3_set_target_enable:"), std::string::npos) << log;
    EXPECT_NE(log.find(tpg() + "/enable = 0 failed"), std::string::npos);
    EXPECT_FALSE(exists(at("/sys")));
}

TEST_F(Lio4Test, GroupRemovalUnlinksLinksWithoutFollowingThem)
{
    std::string backstore = at("/sys/kernel/config/target/core/fileio_0/disk1");
    write_file(backstore + "/data", "keep");
    mkdirs(tpg() + "/lun/lun_0");
    mkdirs(tpg() + "/acls/iqn.i1/lun_0");
    ASSERT_EQ(symlink(backstore.c_str(), (tpg() + "/lun/lun_0/disk1").c_str()), 0);
    ASSERT_EQ(symlink((tpg() + "/lun/lun_0").c_str(), (tpg() + "/acls/iqn.i1/lun_0/lun_0").c_str()), 0);

    ASSERT_EQ(_lio3_remove_all_acl(t), 0);
    EXPECT_FALSE(exists(tpg() + "/acls/iqn.i1"));
    EXPECT_TRUE(exists(tpg() + "/lun/lun_0/disk1"));
    ASSERT_EQ(_lio3_remove_all_lun(t), 0);
    EXPECT_FALSE(exists(tpg() + "/lun/lun_0"));
    EXPECT_EQ(read_file(backstore + "/data"), "keep");

    iscsi_lun_t lun{};  // a LUN naming no backstore directory is refused
    std::strcpy(lun.name, "../x");
    EXPECT_EQ(lio3_shutdown_backstore(&lun), ERR_PARAM);
    std::strcpy(lun.name, "gone");  // an absent backstore is done, and said so at error level
    lun.hba_id = 0;
    std::string log = capture_stdout([&] { EXPECT_EQ(lio3_shutdown_backstore(&lun), 0); });
    EXPECT_NE(log.find("the lun fileio device : "), std::string::npos) << log;
}

}  // namespace
