// SPDX-License-Identifier: Apache-2.0
// ACL nodes and per-LUN rights on plain directories: what a failed step
// leaves behind. Names that must stay one component: test_lio4_ops.cpp.
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
    // The kernel's policy for initiators without an ACL is not an ACL.
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

// What each right does to the kernel and its sessions is the VM suite's;
// here a removal, rights that cannot be set, and what they leave.
TEST_F(Lio4Acl, ARightThatCannotBeSetGrantsNothing)
{
    std::string node = tpg() + "/acls/" + I1 + "/lun_3";
    // Removing is a deny whatever right the record holds (the VM suite's
    // records already hold none).
    ASSERT_EQ(apply(3, 2), 0);
    std::remove((node + "/write_protect").c_str());  // the kernel's, gone with its group
    EXPECT_EQ(lio3_del_lun_acl(&acl), 0);
    EXPECT_EQ(acl.access_right, 0);
    EXPECT_FALSE(exists(node));
    EXPECT_EQ(apply(3, 3), ERR_PARAM);
    EXPECT_EQ(apply(256, 1), ERR_PARAM);
    EXPECT_EQ(apply(4, 1), ERR_CONFIGFS);  // no LUN 4 in the target
    EXPECT_FALSE(exists(tpg() + "/acls/" + I1 + "/lun_4"));

    mkdirs(node + "/write_protect");
    EXPECT_EQ(apply(3, 1), ERR_CONFIGFS);
    EXPECT_FALSE(exists(node + "/lun_3"));
    EXPECT_TRUE(exists(node)) << "the node was there before";
    ASSERT_EQ(rename((tpg() + "/acls/" + I1).c_str(), (tpg() + "/acls/other").c_str()), 0);
    EXPECT_EQ(apply(3, 2), ERR_CONFIGFS);
    EXPECT_FALSE(exists(tpg() + "/acls/" + I1)) << "made without its ACL node";
}

}  // namespace
