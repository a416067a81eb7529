// SPDX-License-Identifier: Apache-2.0
// Targets on plain files: every operation checks the record first, and the
// teardown of a portal group unlinks links without following them.
#include <string>

#include "common/korvadm_err.h"
#include "kernel/korvadm_mod_lio4_internal.h"
#include "tests/kernel/sample_tree.h"
#include "tests/support/capture.h"

namespace {

using Lio4Test = korv_test::SampleTree;

TEST_F(Lio4Test, TargetChecksComeFirst)
{
    list_t list;
    list_init(&list);
    for (int tpgt : {-1, 64}) {
        target.tpgt = tpgt;
        EXPECT_EQ(lio3_add_target(&target), ERR_PARAM);
        EXPECT_EQ(lio3_del_target(&target), ERR_PARAM);
        EXPECT_EQ(lio3_disable_target(&target), ERR_PARAM);
        EXPECT_EQ(lio3_get_target_existing_ip_list(&list, &target), ERR_PARAM);
    }
    target.tpgt = 1;
    for (const char *iqn : {"", "a/b", "..", "../../escape"}) {
        std::strcpy(target.iqn, iqn);
        EXPECT_EQ(lio3_add_target(&target), ERR_PARAM) << iqn;
        EXPECT_EQ(lio3_set_target_chap(&target), ERR_PARAM) << iqn;
        EXPECT_EQ(lio3_get_target_existing_ip_list(&list, &target), ERR_PARAM) << iqn;
    }
    std::memset(target.iqn, 'a', sizeof target.iqn);  // no terminator in the field
    EXPECT_EQ(lio3_add_target(&target), ERR_PARAM);
    EXPECT_EQ(lio3_add_target(nullptr), ERR_PARAM);

    // An unreadable switch counts as enabled, so disabling writes it; the
    // failure is logged under the setter's name.
    std::strcpy(target.iqn, IQN);
    std::string log = korv_test::capture_stdout([&] { EXPECT_EQ(lio3_disable_target(&target), ERR_CONFIGFS); });
    EXPECT_NE(log.find("(korvadm_mod_lio4:_lio3_set_target_enable:"), std::string::npos) << log;
    EXPECT_NE(log.find(at(TPG) + "/enable = 0 failed"), std::string::npos);
    EXPECT_FALSE(exists(at("/sys")));
}

TEST_F(Lio4Test, GroupRemovalUnlinksLinksWithoutFollowingThem)
{
    load_tree("mapped_lun.tree");
    ASSERT_EQ(_lio3_remove_all_acl(&target), 0);
    EXPECT_FALSE(exists(at(TPG) + "/acls/iqn.i1"));
    EXPECT_TRUE(exists(at(TPG) + "/lun/lun_0/disk1"));
    ASSERT_EQ(_lio3_remove_all_lun(&target), 0);
    EXPECT_FALSE(exists(at(TPG) + "/lun/lun_0"));
    EXPECT_EQ(read_file(at("/sys/kernel/config/target/core/fileio_0/disk1/data")), "keep");
}

}  // namespace
