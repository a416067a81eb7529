// SPDX-License-Identifier: Apache-2.0
// The LIO driver against the real kernel target, inside the test VM
// (scripts/vm/run boots it; tests/vm/lio_kernel.sh runs this binary there).
// The VM has configfs and the target modules' dependencies preloaded and the
// three target modules in /usr/local/modules/driver; nothing else. Each suite
// leaves the driver stopped, so the order of the suites does not matter.
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <string>
#include <vector>

#include "common/korvadm_err.h"
#include "common/korvadm_sys.h"
#include "kernel/korvadm_mod.h"
#include "kernel/korvadm_mod_lio4.h"
#include "tests/vm/vm_targets.h"

namespace {

const std::string kIscsi = "/sys/kernel/config/target/iscsi";
const std::string kCore = "/sys/kernel/config/target/core";
const char *const kModules[] = {"target_core_mod", "target_core_file", "iscsi_target_mod"};

// ---- the kernel as seen by hand, independent of the driver ----

ino_t inode_of(const std::string &path)
{
    struct stat st;
    return ::lstat(path.c_str(), &st) == 0 ? st.st_ino : 0;
}

bool exists(const std::string &path) { return inode_of(path) != 0; }

// The attribute's text as the kernel gives it (line end included).
std::string slurp(const std::string &path)
{
    std::ifstream in(path);
    return in ? std::string(std::istreambuf_iterator<char>(in), {}) : "<unreadable: " + path + ">";
}

// A value written the way an operator would: 0 when the kernel took it.
int poke(const std::string &path, const std::string &value)
{
    std::ofstream out(path);
    return (out << value << std::flush) ? 0 : -1;
}

std::vector<std::string> subdirs(const std::string &dir)
{
    std::vector<std::string> names;
    std::error_code ec;
    for (const auto &e : std::filesystem::directory_iterator(dir, ec))
        if (!e.is_symlink(ec) && e.is_directory(ec))
            names.push_back(e.path().filename());
    std::sort(names.begin(), names.end());
    return names;
}

// The target modules now loaded, in load order.
std::vector<std::string> loaded_target_modules()
{
    std::ifstream in("/proc/modules");
    std::string all, line;
    while (std::getline(in, line))
        all += " " + line.substr(0, line.find(' ')) + " ";
    std::vector<std::string> loaded;
    for (const char *m : kModules)
        if (all.find(" " + std::string(m) + " ") != std::string::npos)
            loaded.push_back(m);
    return loaded;
}

bool configfs_mounted()
{
    return ::system("grep -q ' /sys/kernel/config configfs ' /proc/mounts") == 0;
}

// A listening TCP socket (state 0A) on port, from /proc/net/tcp or tcp6.
bool kernel_listens(int port, bool ipv6)
{
    char cmd[160];
    std::snprintf(cmd, sizeof cmd, "grep -qE '^ *[0-9]+: [0-9A-F]+:%04X [0-9A-F]+:[0-9A-F]+ 0A ' /proc/net/tcp%s",
                  port, ipv6 ? "6" : "");
    return ::system(cmd) == 0;
}

// ---- the driver's records ----

using vm::make_target;
using vm::Target;
using vm::want_portal;

std::string tpg_dir(const iscsi_target_t *t)
{
    return kIscsi + "/" + t->iqn + "/tpgt_" + std::to_string(t->tpgt);
}

// What lio3_get_target_existing_ip_list reports, one "ipv4|ipv6|port|dev" a portal.
std::vector<std::string> reported_portals(iscsi_target_t *t, int *rc)
{
    list_t got;
    list_init(&got);
    *rc = lio3_get_target_existing_ip_list(&got, t);
    std::vector<std::string> out;
    for (iscsi_ip_t *ip : korv::list_records<iscsi_ip_t>(&got))
        out.push_back(std::string(ip->ipv4) + "|" + ip->ipv6 + "|" + std::to_string(ip->port) + "|" +
                      ip->dev_name);
    iscsi_ip_free_list(&got);
    std::sort(out.begin(), out.end());
    return out;
}

// A fileio backstore made by hand (the backstore operations are not this
// suite's subject), mapped as LUN 0 of the portal group.
void hand_made_lun(const std::string &tpg, const std::string &name)
{
    const std::string dev = kCore + "/fileio_0/" + name;
    ASSERT_EQ(::system(("mkdir -p '" + dev + "'").c_str()), 0);
    ASSERT_EQ(poke(dev + "/control", "fd_dev_name=/tmp/" + name + ".img,fd_dev_size=1048576"), 0);
    ASSERT_EQ(poke(dev + "/enable", "1"), 0);
    ASSERT_EQ(::mkdir((tpg + "/lun/lun_0").c_str(), 0700), 0);
    ASSERT_EQ(::symlink(dev.c_str(), (tpg + "/lun/lun_0/" + name).c_str()), 0);
}

// An ACL made by hand, with the portal group's LUN 0 mapped into it when mapped.
void hand_made_acl(const std::string &tpg, const std::string &initiator, bool mapped = false)
{
    const std::string acl = tpg + "/acls/" + initiator;
    ASSERT_EQ(::mkdir(acl.c_str(), 0700), 0);
    if (mapped) {
        ASSERT_EQ(::mkdir((acl + "/lun_0").c_str(), 0700), 0);
        ASSERT_EQ(::symlink((tpg + "/lun/lun_0").c_str(), (acl + "/lun_0/lun_0").c_str()), 0);
    }
}

// The driver's stop must leave no target module and configfs mounted,
// whatever a test left behind.
void expect_stopped()
{
    EXPECT_EQ(lio3_stop_module(), 0);
    EXPECT_TRUE(loaded_target_modules().empty());
    EXPECT_TRUE(configfs_mounted());
}

// ---- starting and stopping the driver ----

class LioModules : public ::testing::Test {
protected:
    void SetUp() override { ASSERT_EQ(iscsi_mod_select(ISCSI_MOD_TYPE_LIO), 0); }
    void TearDown() override { expect_stopped(); }
};

TEST_F(LioModules, StartLoadsTheModulesAndStopUnloadsThem)
{
    ASSERT_TRUE(loaded_target_modules().empty());
    EXPECT_EQ(iscsi_mod_get_state(), 1);
    EXPECT_FALSE(exists("/sys/kernel/config/target")); // comes with target_core_mod

    ASSERT_EQ(iscsi_mod_start(), 0);
    EXPECT_EQ(loaded_target_modules(), std::vector<std::string>(std::begin(kModules), std::end(kModules)));
    EXPECT_TRUE(exists(kIscsi + "/lio_version")) << "the fabric directory the kernel populates";
    EXPECT_TRUE(exists("/var/target/pr"));
    EXPECT_TRUE(exists("/var/target/alua"));
    EXPECT_EQ(iscsi_mod_get_state(), 0);

    ASSERT_EQ(iscsi_mod_stop(), 0);
    EXPECT_TRUE(loaded_target_modules().empty());
    EXPECT_EQ(iscsi_mod_get_state(), 1);
    EXPECT_TRUE(configfs_mounted());
    // Stopping a stopped driver is a no-op, and it starts again afterwards,
    // mounting configfs when nothing is mounted.
    EXPECT_EQ(iscsi_mod_stop(), 0);
    ASSERT_EQ(::system("umount /sys/kernel/config"), 0);
    ASSERT_EQ(iscsi_mod_start(), 0);
    EXPECT_TRUE(configfs_mounted());
    EXPECT_EQ(iscsi_mod_get_state(), 0);
}

TEST_F(LioModules, StopTearsDownEverythingTheKernelHolds)
{
    ASSERT_EQ(iscsi_mod_start(), 0);
    Target t = make_target("iqn.2026-01.vm:stop-full", 1);
    ASSERT_EQ(lio3_add_target(t.get()), 0);
    want_portal(t.get(), "127.0.0.1", "::1", 3260);
    ASSERT_EQ(lio3_set_target_ip(t.get()), 0);
    ASSERT_EQ(lio3_enable_target(t.get()), 0);
    Target second = make_target("iqn.2026-01.vm:stop-second", 2);
    ASSERT_EQ(lio3_add_target(second.get()), 0);
    // Two portal groups under each IQN: the first group's deletion cannot
    // remove its IQN yet, which must not end the walk over the others.
    Target full2 = make_target("iqn.2026-01.vm:stop-full", 2), second1 = make_target("iqn.2026-01.vm:stop-second", 1);
    ASSERT_EQ(lio3_add_target(full2.get()), 0);
    ASSERT_EQ(lio3_add_target(second1.get()), 0);
    // Groups the driver would not make: a tag the kernel takes past 63.
    ASSERT_EQ(::system(("mkdir -p " + kIscsi + "/iqn.2026-01.vm:stop-full/tpgt_64 " + kIscsi +
                        "/iqn.2026-01.vm:by-hand/tpgt_64").c_str()), 0);
    // With configuration present the kernel refuses to unload the modules,
    // so the driver must have emptied configfs first, in an order it accepts.
    ASSERT_NE(::system("rmmod iscsi_target_mod 2>/dev/null"), 0);

    EXPECT_EQ(iscsi_mod_stop(), 0);

    EXPECT_TRUE(loaded_target_modules().empty());
    EXPECT_FALSE(exists(kIscsi));
    EXPECT_FALSE(exists(kCore)) << "target_core_mod gone with its tree";
    EXPECT_FALSE(kernel_listens(3260, false));
}

TEST_F(LioModules, PartlyLoadedModulesAreRemovedAgain)
{
    // A module missing: start fails and removes the two it inserted.
    ASSERT_EQ(::rename("/usr/local/modules/driver/iscsi_target_mod.ko", "/tmp/iscsi_target_mod.ko"), 0);
    int rc = iscsi_mod_start();
    ASSERT_EQ(::rename("/tmp/iscsi_target_mod.ko", "/usr/local/modules/driver/iscsi_target_mod.ko"), 0);
    EXPECT_EQ(rc, ERR_MODULE_START);
    EXPECT_TRUE(loaded_target_modules().empty());
    EXPECT_EQ(iscsi_mod_get_state(), 1);

    // Modules in, but no mkdir under the fabric yet: the kernel has not made
    // the iscsi directory, which the probe reports as half started.
    for (const char *m : kModules)
        ASSERT_EQ(::system(("insmod /usr/local/modules/driver/" + std::string(m) + ".ko").c_str()), 0);
    ASSERT_FALSE(exists(kIscsi));
    EXPECT_EQ(iscsi_mod_get_state(), ERR_MODULE_NO_CONFIGFS);
    EXPECT_EQ(iscsi_mod_stop(), 0);
    EXPECT_TRUE(loaded_target_modules().empty());
}

// ---- targets in a running driver ----

class LioTarget : public ::testing::Test {
protected:
    static void SetUpTestSuite()
    {
        ASSERT_EQ(iscsi_mod_select(ISCSI_MOD_TYPE_LIO), 0);
        expect_stopped();
        ASSERT_EQ(iscsi_mod_start(), 0);
    }
    static void TearDownTestSuite() { expect_stopped(); }

    void SetUp() override
    {
        static int n = 0;
        t_ = make_target("iqn.2026-01.vm:target" + std::to_string(++n), 1);
        ASSERT_TRUE(t_);
        tpg_ = tpg_dir(t_.get());
    }
    void TearDown() override
    {
        if (exists(kIscsi + "/" + t_->iqn)) {
            EXPECT_EQ(lio3_del_target(t_.get()), 0) << "left-over target could not be deleted";
        }
    }

    std::string attr(const std::string &rel) const { return slurp(tpg_ + "/" + rel); }

    Target t_;
    std::string tpg_;
};

TEST_F(LioTarget, AddCreatesThePortalGroupWithItsDefaultsOnce)
{
    t_->tpgt = 64; // the kernel takes tpgt_64 and beyond; the appliance stops at 63
    EXPECT_EQ(lio3_add_target(t_.get()), ERR_PARAM);
    EXPECT_FALSE(exists(kIscsi + "/" + t_->iqn));
    t_->tpgt = 1;
    ASSERT_EQ(lio3_add_target(t_.get()), 0);

    EXPECT_TRUE(exists(tpg_ + "/np"));
    EXPECT_EQ(attr("attrib/generate_node_acls"), "1\n");
    EXPECT_EQ(attr("param/MaxConnections"), "8\n");
    EXPECT_EQ(attr("param/TargetAlias"), "vm alias\n");
    EXPECT_EQ(attr("attrib/default_cmdsn_depth"), "64\n");
    EXPECT_EQ(attr("enable"), "0\n") << "added targets stay disabled";
    EXPECT_TRUE(exists(std::string("/var/target/alua/iSCSI/") + t_->iqn + "+1"));
    // The data-out time-out goes to acls/default_policy, which this kernel
    // does not have: the write fails, is ignored, and no ACL appears.
    EXPECT_EQ(subdirs(tpg_ + "/acls"), std::vector<std::string>{});

    // Adding it again changes nothing.
    ASSERT_EQ(poke(tpg_ + "/param/TargetAlias", "changed by hand"), 0);
    ASSERT_EQ(poke(tpg_ + "/attrib/generate_node_acls", "0"), 0);
    EXPECT_EQ(lio3_add_target(t_.get()), 0);
    EXPECT_EQ(attr("param/TargetAlias"), "changed by hand\n");
    EXPECT_EQ(attr("attrib/generate_node_acls"), "0\n");

    ASSERT_EQ(lio3_del_target(t_.get()), 0);
    t_->tpgt = 0;
    EXPECT_EQ(lio3_add_target(t_.get()), 0);
    EXPECT_TRUE(exists(kIscsi + "/" + t_->iqn + "/tpgt_0"));
}

TEST_F(LioTarget, AFailedAddTakesDownOnlyWhatItMade)
{
    // A working sibling under the same IQN: enabled, listening, with an ACL.
    ASSERT_EQ(lio3_add_target(t_.get()), 0);
    want_portal(t_.get(), "127.0.0.1", "", 3260);
    ASSERT_EQ(lio3_set_target_ip(t_.get()), 0);
    hand_made_acl(tpg_, "iqn.2026-01.vm:init-rb");
    ASSERT_EQ(lio3_enable_target(t_.get()), 0);
    Target sibling = make_target(t_->iqn, 2), fresh = make_target(std::string(t_->iqn) + "-fresh", 1);

    // A file where the ALUA state directories must go: each portal group is
    // made in the kernel first, then must be taken down again.
    ASSERT_EQ(::rename("/var/target/alua", "/var/target/alua.saved"), 0);
    { std::ofstream blocker("/var/target/alua"); }
    int rc_sibling = lio3_add_target(sibling.get()), rc_fresh = lio3_add_target(fresh.get());
    ::unlink("/var/target/alua");
    ASSERT_EQ(::rename("/var/target/alua.saved", "/var/target/alua"), 0);

    EXPECT_EQ(rc_sibling, ERR_CONFIGFS);
    EXPECT_FALSE(exists(tpg_dir(sibling.get())));
    EXPECT_EQ(attr("enable"), "1\n");
    EXPECT_EQ(subdirs(tpg_ + "/acls"), std::vector<std::string>{"iqn.2026-01.vm:init-rb"});
    EXPECT_TRUE(kernel_listens(3260, false)) << "the sibling's portal closed";
    EXPECT_EQ(rc_fresh, ERR_CONFIGFS);
    EXPECT_FALSE(exists(kIscsi + "/" + fresh->iqn)) << "the half-made target stayed in the kernel";
    EXPECT_EQ(lio3_add_target(fresh.get()), 0) << "and a second try works";
}

TEST_F(LioTarget, AttributePrimitivesAgainstTheKernel)
{
    ASSERT_EQ(lio3_add_target(t_.get()), 0);
    char buf[64] = {};
    ASSERT_EQ(configfs_read_attr_str((tpg_ + "/param/AuthMethod").c_str(), buf, sizeof buf), 0);
    EXPECT_STREQ(buf, "CHAP") << "the kernel's line end is stripped";
    int v = -1;
    EXPECT_EQ(configfs_read_attr_int((tpg_ + "/attrib/login_timeout").c_str(), &v), 0);
    EXPECT_EQ(v, 15);
    EXPECT_EQ(configfs_write_attr_str((tpg_ + "/param/AuthMethod").c_str(), "CHAP,None", 1), 0);
    EXPECT_EQ(configfs_write_attr_int((tpg_ + "/attrib/login_timeout").c_str(), 20, 1), 0);
    EXPECT_EQ(attr("attrib/login_timeout"), "20\n");

    // The kernel refuses out-of-range values with and without a line end.
    EXPECT_EQ(configfs_write_attr_int((tpg_ + "/attrib/generate_node_acls").c_str(), 2, 1), ERR_CONFIGFS);
    EXPECT_EQ(attr("attrib/generate_node_acls"), "1\n");
    EXPECT_EQ(configfs_read_attr_str((tpg_ + "/no_such_attr").c_str(), buf, sizeof buf), ERR_CONFIGFS);
    // Values with shell metacharacters reach the kernel as text.
    EXPECT_EQ(configfs_write_attr_str((tpg_ + "/param/TargetAlias").c_str(), "a \"b\" $(c) `d`;e", 1), 0);
    EXPECT_EQ(attr("param/TargetAlias"), "a \"b\" $(c) `d`;e\n");
    // A line end inside the value: the kernel's own is the one stripped.
    EXPECT_EQ(configfs_write_attr_str((tpg_ + "/param/TargetAlias").c_str(), "a\nbc", 1), 0);
    EXPECT_EQ(attr("param/TargetAlias"), "a\nbc\n");
}

TEST_F(LioTarget, PortalsOfEveryKindAreCreatedListenedOnAndListed)
{
    const std::string ll = vm::link_local_of("dummy0");
    ASSERT_FALSE(ll.empty()) << "dummy0 has no link-local address";
    ASSERT_EQ(lio3_add_target(t_.get()), 0);
    want_portal(t_.get(), "127.0.0.1", "", 3260);
    want_portal(t_.get(), "", "::1", 3261);
    want_portal(t_.get(), "", ll, 3262, "dummy0");

    ASSERT_EQ(lio3_set_target_ip(t_.get()), 0);

    const std::vector<std::string> made{"127.0.0.1:3260", "[::1]:3261", "[" + ll + "%dummy0]:3262"};
    EXPECT_EQ(subdirs(tpg_ + "/np"), made);
    EXPECT_TRUE(kernel_listens(3260, false));
    EXPECT_TRUE(kernel_listens(3261, true));
    EXPECT_TRUE(kernel_listens(3262, true));
    int rc = -1;
    EXPECT_EQ(reported_portals(t_.get(), &rc),
              (std::vector<std::string>{"127.0.0.1||3260|", "|::1|3261|", "|" + ll + "|3262|dummy0"}));
    EXPECT_EQ(rc, 0);

    // Interface names that step out through the link-local portal's
    // directory, out of configfs and into the fabric: refused before
    // anything changes.
    const ino_t kept = inode_of(tpg_ + "/np/" + made[2]);
    want_portal(t_.get(), "", ll, 3262, "dummy0]:3262/../../../../../../../../../../tmp/escaped");
    want_portal(t_.get(), "", ll, 3262, "dummy0]:3262/../../../../iqn.2026-01.vm:other");
    EXPECT_EQ(lio3_set_target_ip(t_.get()), ERR_PARAM);
    EXPECT_EQ(subdirs(tpg_ + "/np"), made);
    EXPECT_EQ(inode_of(tpg_ + "/np/" + made[2]), kept);
    EXPECT_FALSE(exists("/tmp/escaped]:3262"));
    EXPECT_FALSE(exists(kIscsi + "/iqn.2026-01.vm:other]:3262"));
}

TEST_F(LioTarget, PortalsAreReplacedOrDiffedByAddress)
{
    ASSERT_EQ(lio3_add_target(t_.get()), 0);
    want_portal(t_.get(), "127.0.0.1", "::1", 3260);
    ASSERT_EQ(lio3_set_target_ip(t_.get()), 0);
    ASSERT_EQ(subdirs(tpg_ + "/np"), (std::vector<std::string>{"127.0.0.1:3260", "[::1]:3260"}));
    const ino_t kept = inode_of(tpg_ + "/np/127.0.0.1:3260");

    // The same list again changes nothing: same directories, same inodes.
    EXPECT_EQ(lio3_set_target_ip_v2(t_.get()), 0);
    EXPECT_EQ(subdirs(tpg_ + "/np"), (std::vector<std::string>{"127.0.0.1:3260", "[::1]:3260"}));
    EXPECT_EQ(inode_of(tpg_ + "/np/127.0.0.1:3260"), kept);

    iscsi_ip_free_list(&t_->ip_list);
    want_portal(t_.get(), "127.0.0.1", "", 3299); // present by address: port not compared
    want_portal(t_.get(), "127.0.0.3", "", 3263);
    EXPECT_EQ(lio3_set_target_ip_v2(t_.get()), 0);
    EXPECT_EQ(subdirs(tpg_ + "/np"), (std::vector<std::string>{"127.0.0.1:3260", "127.0.0.3:3263"}));
    EXPECT_EQ(inode_of(tpg_ + "/np/127.0.0.1:3260"), kept);
    EXPECT_TRUE(kernel_listens(3263, false));

    // Replacing drops the old ones; a portal the kernel refuses (no such
    // host) is skipped, the rest is made.
    iscsi_ip_free_list(&t_->ip_list);
    want_portal(t_.get(), "127.0.0.2", "", 3270);
    want_portal(t_.get(), "", "not-an-address", 3271);
    EXPECT_EQ(lio3_set_target_ip(t_.get()), 0);
    EXPECT_EQ(subdirs(tpg_ + "/np"), std::vector<std::string>{"127.0.0.2:3270"});
    EXPECT_FALSE(kernel_listens(3260, false)) << "the kernel closed the removed portal";

    // And they can all go while the target is enabled.
    ASSERT_EQ(lio3_enable_target(t_.get()), 0);
    iscsi_ip_free_list(&t_->ip_list);
    EXPECT_EQ(lio3_set_target_ip_v2(t_.get()), 0);
    EXPECT_EQ(subdirs(tpg_ + "/np"), std::vector<std::string>{});
    EXPECT_EQ(attr("enable"), "1\n");
}

TEST_F(LioTarget, EnableAndDisable)
{
    // Missing from the kernel: the enable switch cannot be read, which counts
    // as enabled, and disabling fails.
    EXPECT_EQ(lio3_enable_target(t_.get()), 0);
    EXPECT_FALSE(exists(kIscsi + "/" + t_->iqn));
    EXPECT_EQ(lio3_disable_target(t_.get()), ERR_CONFIGFS);

    ASSERT_EQ(lio3_add_target(t_.get()), 0);
    ASSERT_EQ(poke(tpg_ + "/param/AuthMethod", "None"), 0);

    EXPECT_EQ(lio3_enable_target(t_.get()), 0);
    EXPECT_EQ(attr("enable"), "1\n");
    EXPECT_EQ(attr("param/AuthMethod"), "CHAP,None\n");
    EXPECT_EQ(lio3_enable_target(t_.get()), 0) << "already enabled";
    EXPECT_EQ(attr("enable"), "1\n");

    ASSERT_EQ(poke(tpg_ + "/param/AuthMethod", "None"), 0);
    EXPECT_EQ(lio3_disable_target(t_.get()), 0);
    EXPECT_EQ(attr("enable"), "0\n");
    EXPECT_EQ(attr("param/AuthMethod"), "CHAP,None\n") << "rewritten on disabling too";
    EXPECT_EQ(lio3_disable_target(t_.get()), 0);
    EXPECT_EQ(attr("enable"), "0\n");
}

TEST_F(LioTarget, DataoutTimeoutAndChapReachEveryAcl)
{
    EXPECT_EQ(lio3_set_target_attr_dataout_timeout(7, t_.get()), ERR_TARGET_NOT_IN_KERNEL);
    ASSERT_EQ(lio3_add_target(t_.get()), 0);
    hand_made_acl(tpg_, "iqn.2026-01.vm:init-a");
    hand_made_acl(tpg_, "iqn.2026-01.vm:init-b");
    ASSERT_EQ(attr("acls/iqn.2026-01.vm:init-a/attrib/dataout_timeout"), "3\n");

    EXPECT_EQ(lio3_set_target_attr_dataout_timeout(7, t_.get()), 0);
    EXPECT_EQ(attr("acls/iqn.2026-01.vm:init-a/attrib/dataout_timeout"), "7\n");
    EXPECT_EQ(attr("acls/iqn.2026-01.vm:init-b/attrib/dataout_timeout"), "7\n");
    // This kernel takes 2..60 seconds; outside that it refuses the write,
    // which the driver logs per ACL while still answering 0.
    EXPECT_EQ(lio3_set_target_attr_dataout_timeout(61, t_.get()), 0);
    EXPECT_EQ(lio3_set_target_attr_dataout_timeout(0, t_.get()), 0);
    EXPECT_EQ(attr("acls/iqn.2026-01.vm:init-b/attrib/dataout_timeout"), "7\n");

    t_->chap = 1;
    std::strcpy(t_->chap_user, "vmuser");
    // An invalid setting changes nothing.
    std::strcpy(t_->chap_pass, "short123456"); // 11 characters
    const std::string before = attr("attrib/authentication");
    const std::string user_before = attr("acls/iqn.2026-01.vm:init-a/auth/userid");
    EXPECT_EQ(lio3_set_target_chap(t_.get()), ERR_PARAM);
    EXPECT_EQ(attr("attrib/authentication"), before);
    EXPECT_EQ(attr("acls/iqn.2026-01.vm:init-a/auth/userid"), user_before);

    // 13 characters, shell metacharacters reaching the kernel as the secret.
    std::strcpy(t_->chap_pass, "pa$(x)\"q`z;w1");
    t_->mutual_chap = 1;
    std::strcpy(t_->mutual_user, "vmtarget");
    std::strcpy(t_->mutual_pass, "mutualsecret1234"); // 16 characters

    ASSERT_EQ(lio3_set_target_chap(t_.get()), 0);

    EXPECT_EQ(attr("attrib/authentication"), "1\n");
    EXPECT_EQ(attr("param/AuthMethod"), "CHAP,None\n");
    for (const char *acl : {"iqn.2026-01.vm:init-a", "iqn.2026-01.vm:init-b"}) {
        const std::string auth = std::string("acls/") + acl + "/auth/";
        EXPECT_EQ(attr(auth + "userid"), "vmuser\n") << acl;
        EXPECT_EQ(attr(auth + "password"), "pa$(x)\"q`z;w1\n") << acl;
        EXPECT_EQ(attr(auth + "userid_mutual"), "vmtarget\n") << acl;
        EXPECT_EQ(attr(auth + "password_mutual"), "mutualsecret1234\n") << acl;
    }

    // Off: the switch drops, the credentials stay.
    t_->chap = 0;
    EXPECT_EQ(lio3_set_target_chap(t_.get()), 0);
    EXPECT_EQ(attr("attrib/authentication"), "0\n");
    EXPECT_EQ(attr("acls/iqn.2026-01.vm:init-a/auth/userid"), "vmuser\n");
}

TEST_F(LioTarget, DeleteTearsDownAnEnabledTargetInAnOrderTheKernelAccepts)
{
    ASSERT_EQ(lio3_add_target(t_.get()), 0);
    want_portal(t_.get(), "127.0.0.1", "::1", 3260);
    ASSERT_EQ(lio3_set_target_ip(t_.get()), 0);
    hand_made_lun(tpg_, "deldisk");
    hand_made_acl(tpg_, "iqn.2026-01.vm:init-f", true);
    hand_made_acl(tpg_, "iqn.2026-01.vm:init-g");
    ASSERT_EQ(lio3_enable_target(t_.get()), 0);
    // The kernel refuses to drop the group while anything is in it, and the
    // backstore while the LUN links to it.
    ASSERT_EQ(::rmdir(tpg_.c_str()), -1);
    ASSERT_EQ(::rmdir((kCore + "/fileio_0/deldisk").c_str()), -1);
    // configfs attribute files cannot be unlinked, so "rm -rf" (the forced
    // removal) fails: the driver reports it and the kernel keeps the target.
    EXPECT_EQ(configfs_rmdir_recursive((kIscsi + "/" + t_->iqn).c_str()), ERR_SHELL);
    EXPECT_EQ(configfs_rmdir(tpg_.c_str()), ERR_SHELL);
    EXPECT_EQ(subdirs(tpg_ + "/np"), (std::vector<std::string>{"127.0.0.1:3260", "[::1]:3260"}));

    EXPECT_EQ(lio3_del_target(t_.get()), 0);

    EXPECT_FALSE(exists(kIscsi + "/" + t_->iqn));
    EXPECT_FALSE(kernel_listens(3260, false));
    EXPECT_TRUE(exists(std::string("/var/target/alua/iSCSI/") + t_->iqn + "+1")) << "left in place";
    EXPECT_EQ(lio3_del_target(t_.get()), 0) << "already removed";
    // Backstores outlive their targets, unlinked: the kernel now lets them go.
    EXPECT_TRUE(exists(kCore + "/fileio_0/deldisk/control"));
    EXPECT_EQ(::rmdir((kCore + "/fileio_0/deldisk").c_str()), 0);
    EXPECT_EQ(::rmdir((kCore + "/fileio_0").c_str()), 0);
}

} // namespace
