// SPDX-License-Identifier: Apache-2.0
// ACL nodes and per-LUN rights on plain directories: what a node gets, what
// each right writes, the target switch around deny, and what a failed step
// leaves behind. Names that must stay one component: test_lio4_ops.cpp.
#include <unistd.h>

#include <cstdio>
#include <string>

#include "common/korvadm_err.h"
#include "kernel/korvadm_mod_lio4.h"
#include "tests/kernel/lio4_test.h"

namespace {

class Lio4Acl : public korv_test::Lio4Test {
protected:
    void SetUp() override
    {
        Lio4Test::SetUp();
        load_tree("tpg_storage.tree");
        mkdirs(tpg() + "/lun/lun_3");
    }
    int apply(int n, int right)  // right to LUN n for the initiator
    {
        map.lun_num = n;
        acl.access_right = right;
        return lio3_add_lun_acl(&acl);
    }
};

TEST_F(Lio4Acl, NodesGetTheTargetsCredentialsUnderAnExistingPortalGroupOnly)
{
    EXPECT_EQ(lio3_add_acl_initiator("default_policy", &target), 0);
    EXPECT_FALSE(exists(tpg() + "/acls/default_policy"));

    const std::string i2 = tpg() + "/acls/iqn.2026-01.test:i2";
    target.chap = 1;
    set(target.chap_user, "user");
    set(target.chap_pass, "pa$(touch x)ss12");
    target.dataout_timeout = 7;
    mkdirs(i2 + "/auth");
    mkdirs(i2 + "/attrib");
    ASSERT_EQ(lio3_add_acl_initiator("iqn.2026-01.test:i2", &target), 0);
    EXPECT_EQ(read_file(i2 + "/auth/password"), "pa$(touch x)ss12");
    EXPECT_EQ(read_file(i2 + "/attrib/dataout_timeout"), "7");
    ASSERT_EQ(lio3_del_acl_initiator("iqn.2026-01.test:i2", &target), 0);
    EXPECT_FALSE(exists(i2));

    target.tpgt = 2;  // a portal group that is not there is not made on the way
    EXPECT_EQ(lio3_add_acl_initiator(I1, &target), ERR_TARGET_NOT_IN_KERNEL);
    EXPECT_FALSE(exists(at("/sys/kernel/config/target/iscsi/iqn.2026-01.test:t1/tpgt_2")));
}

TEST_F(Lio4Acl, RightsMapTheLunAndOnlyDenyTogglesTheTarget)
{
    std::string node = tpg() + "/acls/" + I1 + "/lun_3";
    ASSERT_EQ(apply(3, 1), 0);
    char link[512] = {0};
    ASSERT_GT(readlink((node + "/lun_3").c_str(), link, sizeof link - 1), 0);
    EXPECT_EQ(std::string(link), tpg() + "/lun/lun_3");
    EXPECT_EQ(read_file(node + "/write_protect"), "1");
    EXPECT_FALSE(exists(tpg() + "/param/AuthMethod")) << "read-only switched the target";
    ASSERT_EQ(apply(3, 2), 0);
    EXPECT_EQ(read_file(node + "/write_protect"), "0");
    EXPECT_EQ(apply(3, 3), ERR_PARAM);
    EXPECT_EQ(apply(256, 1), ERR_PARAM);
    EXPECT_EQ(apply(4, 1), ERR_CONFIGFS);  // no LUN 4 in the target
    EXPECT_FALSE(exists(tpg() + "/acls/" + I1 + "/lun_4"));

    // Deny: off, unmapped, on again (the switch is rewritten with AuthMethod).
    std::remove((node + "/write_protect").c_str());  // the kernel's, gone with its group
    map.lun_num = 3;
    ASSERT_EQ(lio3_del_lun_acl(&acl), 0);
    EXPECT_EQ(acl.access_right, 0);
    EXPECT_FALSE(exists(node));
    EXPECT_EQ(read_file(tpg() + "/enable"), "1");
    EXPECT_EQ(read_file(tpg() + "/param/AuthMethod"), "CHAP,None");

    // A right that cannot be set leaves no link; without an ACL node none is made.
    mkdirs(node + "/write_protect");
    EXPECT_EQ(apply(3, 1), ERR_CONFIGFS);
    EXPECT_FALSE(exists(node + "/lun_3"));
    EXPECT_TRUE(exists(node)) << "the node was there before";
    ASSERT_EQ(rename((tpg() + "/acls/" + I1).c_str(), (tpg() + "/acls/other").c_str()), 0);
    EXPECT_EQ(apply(3, 2), ERR_CONFIGFS);
    EXPECT_FALSE(exists(tpg() + "/acls/" + I1));
}

}  // namespace
