// SPDX-License-Identifier: Apache-2.0
// Starting and stopping the driver with stand-in insmod/rmmod/mount, which
// keep the root's /proc/modules and log every call to calls.log.
#include "tests/kernel/lio4_test.h"

namespace {

using korv_test::capture_stdout;

class ModuleTest : public korv_test::Lio4Test {
protected:
    void install_all()
    {
        for (const char *n : {"target_core_mod", "target_core_file", "iscsi_target_mod"})
            write_file(at("/usr/local/modules/driver/") + n + ".ko", "");
    }
    std::string fabric() { return at("/sys/kernel/config/target/iscsi"); }
    std::string modules() { return read_file(at("/proc/modules")); }
    std::string calls() { return read_file(at("/calls.log")); }
};

// The real kernel only shows configfs mounted and the modules gone; the order
// of the calls and the roll-back are seen here, in the stand-ins' log.
TEST_F(ModuleTest, StartAndStopFromRunning)
{
    install_all();
    ASSERT_EQ(lio3_start_module(), 0);
    const std::string m = modules();
    EXPECT_LT(m.find("target_core_mod"), m.find("target_core_file"));
    EXPECT_LT(m.find("target_core_file"), m.find("iscsi_target_mod"));
    EXPECT_TRUE(exists(at("/var/target/pr")) && exists(at("/var/target/alua")));
    mkdirs(at(CORE + "/alua"));
    EXPECT_EQ(lio3_stop_module(), 0);
    EXPECT_TRUE(exists(at(CORE + "/alua"))) << "the kernel's own group";

    // configfs stays mounted: a second start does not mount again.
    ASSERT_EQ(lio3_start_module(), 0);
    std::string c = calls();
    EXPECT_EQ(c.find("mount "), c.rfind("mount "));

    // Any other module missing: start fails and takes out, in reverse, what
    // it inserted.
    ASSERT_EQ(lio3_stop_module(), 0);
    std::remove(at("/usr/local/modules/driver/iscsi_target_mod.ko").c_str());
    std::remove(at("/calls.log").c_str());
    EXPECT_EQ(lio3_start_module(), ERR_MODULE_START);
    EXPECT_EQ(modules(), "");
    c = calls();
    EXPECT_LT(c.find("rmmod target_core_file"), c.find("rmmod target_core_mod"));

    // Only the core module may be missing: start goes on and logs it.
    install_all();
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
    load_tree("half_started.tree");
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

}  // namespace
