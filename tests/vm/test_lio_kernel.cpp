// SPDX-License-Identifier: Apache-2.0
// The LIO driver against the real kernel target, inside the test VM
// (scripts/vm/run boots it; tests/vm/lio.sh runs the suite there). The VM
// has configfs and the target modules' dependencies preloaded and the three
// target modules in /usr/local/modules/driver; nothing else. Each suite
// leaves the driver stopped, so the order of the suites does not matter.
#include <gtest/gtest.h>
#include <unistd.h>

#include <fstream>
#include <string>
#include <vector>

#include "common/korvadm_err.h"
#include "kernel/korvadm_mod_lio4.h"
#include "tests/vm/vm_targets.h"

namespace {

using namespace vm;
using Strings = std::vector<std::string>;

// A listening TCP socket (state 0A) on port, from /proc/net/tcp or tcp6.
bool kernel_listens(int port, bool ipv6)
{
    char cmd[160];
    std::snprintf(cmd, sizeof cmd, "grep -qE '^ *[0-9]+: [0-9A-F]+:%04X [0-9A-F]+:[0-9A-F]+ 0A ' /proc/net/tcp%s",
                  port, ipv6 ? "6" : "");
    return ::system(cmd) == 0;
}

// ---- starting and stopping the driver ----

using LioModules = Driver;

// Start: the modules in an order the kernel takes and configfs mounted when
// it is not (the order of the calls and the roll-back of a failed start are
// the host's, test_lio4_module.cpp). Stop: a full configfs emptied in an
// order the kernel accepts.
TEST_F(LioModules, StartAndStopDoAndUndoEverythingInTheKernelsOrder)
{
    expect_stopped();
    EXPECT_EQ(iscsi_mod_get_state(), 1);
    ASSERT_EQ(::system("umount /sys/kernel/config"), 0);
    ASSERT_EQ(iscsi_mod_start(), 0);
    EXPECT_TRUE(exists(kIscsi)) << "start did not mount configfs";
    EXPECT_EQ(iscsi_mod_get_state(), 0);
    // Two portal groups under each IQN: the first group's deletion cannot
    // remove its IQN yet, which must not end the walk over the others.
    Target t = serve("iqn.2026-01.vm:stop-full", "127.0.0.1", "::1"), full2 = make_target(t->iqn, 2);
    Target second = make_target("iqn.2026-01.vm:stop-second", 2), second1 = make_target(second->iqn, 1);
    for (iscsi_target_t *each : {full2.get(), second.get(), second1.get()})
        ASSERT_EQ(lio3_add_target(each), 0);
    map_lun_for(t.get(), "stopdisk", "iqn.2026-01.vm:init-stop");
    ASSERT_EQ(lio3_enable_target(t.get()), 0);
    iscsi_lun_t spare = make_lun("sparedisk", "/tmp/sparedisk.img", 1 << 20, 3);
    ASSERT_EQ(iscsi_mod_add_backstore(&spare), 0);  // mapped nowhere
    // Groups the driver would not make: a tag the kernel takes past 63.
    ASSERT_EQ(::system(("mkdir -p " + kIscsi + "/iqn.2026-01.vm:stop-full/tpgt_64 " + kIscsi +
                        "/iqn.2026-01.vm:by-hand/tpgt_64").c_str()), 0);
    // With configuration present the kernel refuses to unload the modules,
    // so the driver must have emptied configfs first, in an order it accepts.
    ASSERT_NE(::system("rmmod iscsi_target_mod 2>/dev/null"), 0);

    expect_stopped();  // and again when the test ends, with nothing left to do
    EXPECT_FALSE(kernel_listens(3260, false));
    EXPECT_EQ(iscsi_mod_get_state(), 1);
}

// ---- targets in a running driver ----

class LioTarget : public ::testing::Test {
protected:
    static void SetUpTestSuite()
    {
        ASSERT_EQ(iscsi_mod_select(ISCSI_MOD_TYPE_LIO), 0);
        ASSERT_EQ(iscsi_mod_start(), 0);
    }
    static void TearDownTestSuite() { expect_stopped(); }

    void SetUp() override
    {
        static int n = 0;
        t_ = make_target("iqn.2026-01.vm:target" + std::to_string(++n), 1);
        tpg_ = tpg_dir(t_.get());
    }
    void TearDown() override { EXPECT_EQ(lio3_del_target(t_.get()), 0) << "left-over target"; }

    std::string attr(const std::string &rel) const { return read_file(tpg_ + "/" + rel); }

    Target t_;
    std::string tpg_;
};

TEST_F(LioTarget, AddCreatesThePortalGroupWithItsDefaultsOnce)
{
    ASSERT_EQ(lio3_add_target(t_.get()), 0);
    const char *const defaults[][2] = {{"attrib/generate_node_acls", "1\n"}, {"param/MaxConnections", "8\n"},
                                       {"param/TargetAlias", "vm alias\n"}, {"attrib/default_cmdsn_depth", "64\n"},
                                       {"enable", "0\n"}};
    for (const auto &[rel, value] : defaults)
        EXPECT_EQ(attr(rel), value) << rel;
    EXPECT_TRUE(exists(std::string("/var/target/alua/iSCSI/") + t_->iqn + "+1"));
    // The data-out time-out goes to acls/default_policy, which this kernel
    // does not have: the write fails, is ignored, and no ACL appears.
    EXPECT_EQ(subdirs(tpg_ + "/acls"), Strings{});

    // Adding it again changes nothing.
    ASSERT_EQ(configfs_write_attr_str((tpg_ + "/param/TargetAlias").c_str(), "changed by hand", 0), 0);
    EXPECT_EQ(lio3_add_target(t_.get()), 0);
    EXPECT_EQ(attr("param/TargetAlias"), "changed by hand\n");
    // The kernel refuses out-of-range values.
    EXPECT_EQ(configfs_write_attr_int((tpg_ + "/attrib/generate_node_acls").c_str(), 2, 1), ERR_CONFIGFS);
    EXPECT_EQ(attr("attrib/generate_node_acls"), "1\n");

    ASSERT_EQ(lio3_del_target(t_.get()), 0);
    t_->tpgt = 0;
    EXPECT_EQ(lio3_add_target(t_.get()), 0);
    EXPECT_TRUE(exists(kIscsi + "/" + t_->iqn + "/tpgt_0"));
}

TEST_F(LioTarget, AFailedAddTakesDownOnlyWhatItMade)
{
    // A working sibling under the same IQN: enabled, listening, with an ACL.
    t_ = serve(t_->iqn, "127.0.0.1");
    ASSERT_EQ(iscsi_mod_add_acl_initiator("iqn.2026-01.vm:init-rb", t_.get()), 0);
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
    EXPECT_EQ(subdirs(tpg_ + "/acls"), Strings{"iqn.2026-01.vm:init-rb"});
    EXPECT_TRUE(kernel_listens(3260, false)) << "the sibling's portal closed";
    EXPECT_EQ(rc_fresh, ERR_CONFIGFS);
    EXPECT_FALSE(exists(kIscsi + "/" + fresh->iqn)) << "the half-made target stayed in the kernel";
    EXPECT_EQ(lio3_add_target(fresh.get()), 0) << "and a second try works";
    EXPECT_EQ(lio3_del_target(fresh.get()), 0);
}

TEST_F(LioTarget, PortalsAreMadeDiffedAndReplacedAndNoneLeavesItsDirectory)
{
    const std::string ll = link_local_of("dummy0");
    ASSERT_FALSE(ll.empty()) << "dummy0 has no link-local address";
    ASSERT_EQ(lio3_add_target(t_.get()), 0);
    want_portal(t_.get(), "127.0.0.1", "::1", 3260);
    want_portal(t_.get(), "", ll, 3262, "dummy0");
    ASSERT_EQ(lio3_set_target_ip(t_.get()), 0);
    const Strings made{"127.0.0.1:3260", "[::1]:3260", "[" + ll + "%dummy0]:3262"};
    EXPECT_EQ(subdirs(tpg_ + "/np"), made);
    EXPECT_TRUE(kernel_listens(3262, true));
    const ino_t kept = inode_of(tpg_ + "/np/127.0.0.1:3260");
    // Interface names that would step out of the np directory are refused
    // before anything is made: test_lio4_portal.cpp.

    // Diffed: a portal present by address stays as it is (port not
    // compared, same inode), the others go or come.
    iscsi_ip_free_list(&t_->ip_list);
    want_portal(t_.get(), "127.0.0.1", "", 3299);
    want_portal(t_.get(), "127.0.0.3", "", 3263);
    EXPECT_EQ(lio3_set_target_ip_v2(t_.get()), 0);
    EXPECT_EQ(subdirs(tpg_ + "/np"), (Strings{"127.0.0.1:3260", "127.0.0.3:3263"}));
    EXPECT_EQ(inode_of(tpg_ + "/np/127.0.0.1:3260"), kept);
    EXPECT_TRUE(kernel_listens(3263, false));

    // Replacing drops the old ones; a portal the kernel refuses (no such
    // host) is skipped, the rest is made.
    iscsi_ip_free_list(&t_->ip_list);
    want_portal(t_.get(), "127.0.0.2", "", 3270);
    want_portal(t_.get(), "", "not-an-address", 3271);
    EXPECT_EQ(lio3_set_target_ip(t_.get()), 0);
    EXPECT_EQ(subdirs(tpg_ + "/np"), Strings{"127.0.0.2:3270"});
    EXPECT_FALSE(kernel_listens(3260, false)) << "the kernel closed the removed portal";

    // And they can all go while the target is enabled.
    ASSERT_EQ(lio3_enable_target(t_.get()), 0);
    iscsi_ip_free_list(&t_->ip_list);
    EXPECT_EQ(lio3_set_target_ip_v2(t_.get()), 0);
    EXPECT_EQ(subdirs(tpg_ + "/np"), Strings{});
    EXPECT_EQ(attr("enable"), "1\n");
}

TEST_F(LioTarget, EnableAndDisable)
{
    // Missing from the kernel: the enable switch cannot be read, which counts
    // as enabled; enabling does not make the target.
    EXPECT_EQ(lio3_set_target_attr_dataout_timeout(7, t_.get()), ERR_TARGET_NOT_IN_KERNEL);
    EXPECT_EQ(lio3_enable_target(t_.get()), 0);
    EXPECT_FALSE(exists(kIscsi + "/" + t_->iqn));

    // Either switch rewrites AuthMethod; switching again changes nothing.
    ASSERT_EQ(lio3_add_target(t_.get()), 0);
    using Switch = std::pair<int (*)(iscsi_target_t *), const char *>;
    for (auto [call, state] : {Switch{lio3_enable_target, "1\n"}, Switch{lio3_disable_target, "0\n"}}) {
        ASSERT_EQ(configfs_write_attr_str((tpg_ + "/param/AuthMethod").c_str(), "None", 0), 0);
        EXPECT_EQ(call(t_.get()), 0);
        EXPECT_EQ(call(t_.get()), 0) << "again";
        EXPECT_EQ(attr("enable"), state);
        EXPECT_EQ(attr("param/AuthMethod"), "CHAP,None\n");
    }
}

TEST_F(LioTarget, DeleteTearsDownAnEnabledTargetInAnOrderTheKernelAccepts)
{
    t_ = serve(t_->iqn, "127.0.0.1", "::1");
    map_lun_for(t_.get(), "deldisk", "iqn.2026-01.vm:init-f");
    ASSERT_EQ(iscsi_mod_add_acl_initiator("iqn.2026-01.vm:init-g", t_.get()), 0);
    ASSERT_EQ(lio3_enable_target(t_.get()), 0);
    // configfs attribute files cannot be unlinked, so "rm -rf" (the forced
    // removal) fails: the driver reports it and the kernel keeps the target.
    EXPECT_EQ(configfs_rmdir_recursive((kIscsi + "/" + t_->iqn).c_str()), ERR_SHELL);
    EXPECT_EQ(configfs_rmdir(tpg_.c_str()), ERR_SHELL);
    EXPECT_EQ(subdirs(tpg_ + "/np"), (Strings{"127.0.0.1:3260", "[::1]:3260"}));

    EXPECT_EQ(lio3_del_target(t_.get()), 0);

    EXPECT_FALSE(exists(kIscsi + "/" + t_->iqn));
    EXPECT_FALSE(kernel_listens(3260, false));
    EXPECT_TRUE(exists(std::string("/var/target/alua/iSCSI/") + t_->iqn + "+1")) << "left in place";
    // Backstores outlive their targets, unlinked: the kernel, which refuses
    // while a LUN links to one, now lets them go.
    EXPECT_TRUE(exists(kCore + "/fileio_0/deldisk/control"));
    EXPECT_EQ(::rmdir((kCore + "/fileio_0/deldisk").c_str()), 0);
    EXPECT_EQ(::rmdir((kCore + "/fileio_0").c_str()), 0);
}

}  // namespace
