// SPDX-License-Identifier: Apache-2.0
// Targets on plain files: the enable switch, and the teardown of a portal
// group unlinking links without following them. The argument checks every
// operation shares are in test_lio4_ops.cpp.
#include "tests/kernel/lio4_test.h"

namespace {

using korv_test::Lio4Test;

TEST_F(Lio4Test, AnUnreadableSwitchCountsAsEnabledAndItsFailureIsLoggedByTheSetter)
{
    std::string log = korv_test::capture_stdout([&] { EXPECT_EQ(lio3_disable_target(&target), ERR_CONFIGFS); });
    EXPECT_NE(log.find("(korvadm_mod_lio4:_lio3_set_target_enable:"), std::string::npos) << log;
    EXPECT_NE(log.find(tpg() + "/enable = 0 failed"), std::string::npos);
    EXPECT_FALSE(exists(at("/sys")));
}

TEST_F(Lio4Test, GroupRemovalUnlinksLinksWithoutFollowingThem)
{
    load_tree("mapped_lun.tree");
    ASSERT_EQ(_lio3_remove_all_acl(&target), 0);
    EXPECT_FALSE(exists(tpg() + "/acls/iqn.i1"));
    EXPECT_TRUE(exists(tpg() + "/lun/lun_0/disk1"));
    ASSERT_EQ(_lio3_remove_all_lun(&target), 0);
    EXPECT_FALSE(exists(tpg() + "/lun/lun_0"));
    EXPECT_EQ(read_file(at(CORE + "/fileio_0/disk1/data")), "keep");
}

}  // namespace
