// SPDX-License-Identifier: Apache-2.0
// The driver table selection and the iscsi_mod_ wrappers.
#include "kernel/korvadm_mod.h"

#include <string>

#include <gtest/gtest.h>

#include "common/korvadm_err.h"
#include "kernel/korvadm_mod_lio4.h"
#include "tests/kernel/lio4_test.h"

namespace {

// The last call that reached the recording table: slot and arguments.
struct call {
    int slot = -1;
    const void *arg1 = nullptr, *arg2 = nullptr;
    int number = 0;
    bool operator==(const call &) const = default;
} rec;

iscsi_mod_ops_t recording_table()
{
    iscsi_mod_ops_t t{};
    t.set_target_attr_dataout_timeout = [](int timeout, iscsi_target_t *target) {
        rec = {9, target, nullptr, timeout};
        return 19;
    };
    t.add_lun_mapping = [](iscsi_lun_t *lun, iscsi_target_t *target, int n) {
        rec = {15, lun, target, n};
        return 25;
    };
    t.get_target_session = [](list_t *sess, list_t *init, iscsi_target_t *) {
        rec = {21, sess, init, 0};
        return 31;
    };
    return t;
}

class ModTest : public korv_test::Lio4Test {
protected:
    void SetUp() override
    {
        Lio4Test::SetUp();
        saved_ = iscsi_mod_ops;
        rec = call{};
        list_init(&list_);
    }
    void TearDown() override
    {
        iscsi_mod_ops = saved_;
        Lio4Test::TearDown();
    }
    const iscsi_mod_ops_t *saved_ = nullptr;
    iscsi_target_t target_{};
    iscsi_lun_t lun_{};
    list_t list_;
};

TEST_F(ModTest, SelectAcceptsOnlyTheLioTypeAndWithoutATableEachWrapperAnswersItsOwnCode)
{
    iscsi_mod_ops = nullptr;
    EXPECT_EQ(iscsi_mod_select(-1), ERR_PARAM);
    EXPECT_EQ(iscsi_mod_select(1), ERR_MODULE_TYPE);
    ASSERT_EQ(iscsi_mod_ops, nullptr);
    EXPECT_EQ(iscsi_mod_start(), ERR_MODULE_START);
    EXPECT_EQ(iscsi_mod_stop(), ERR_MODULE_START);
    EXPECT_EQ(iscsi_mod_get_state(), 1);
    EXPECT_EQ(iscsi_mod_add_target(&target_), ERR_PARAM);
    EXPECT_EQ(iscsi_mod_get_target_ip_list(&list_, &target_), ERR_PARAM);
    EXPECT_EQ(iscsi_mod_del_backstore(&lun_), ERR_MODULE_START);
    EXPECT_EQ(iscsi_mod_get_target_ip_list_in_target_parm(&list_, "iqn.x", 1), ERR_PARAM);
    // Every slot of the LIO table is called through it in test_lio4_ops.cpp.
    ASSERT_EQ(iscsi_mod_select(ISCSI_MOD_TYPE_LIO), 0);
    EXPECT_EQ(iscsi_mod_ops, &lio3_mod_ops);
}

TEST_F(ModTest, WrappersCheckArgumentsThenPassThemThrough)
{
    iscsi_mod_ops_t table = recording_table();
    iscsi_mod_ops = &table;
    iscsi_map_lun_t map{};
    iscsi_lun_acl_t acl{};
    acl.map_lun = &map;  // initiator still missing
    EXPECT_EQ(iscsi_mod_add_target(nullptr), ERR_PARAM);
    EXPECT_EQ(iscsi_mod_set_dataout_timeout(-1, &target_), ERR_PARAM);
    EXPECT_EQ(iscsi_mod_get_target_ip_list(nullptr, &target_), ERR_PARAM);
    EXPECT_EQ(iscsi_mod_add_lun_mapping(&lun_, &target_, -1), ERR_PARAM);
    EXPECT_EQ(iscsi_mod_del_backstore(nullptr), ERR_PARAM);
    EXPECT_EQ(iscsi_mod_add_lun_acl(&acl), ERR_PARAM);
    EXPECT_EQ(iscsi_mod_get_target_session(&list_, nullptr, &target_), ERR_PARAM);
    EXPECT_EQ(rec, call{});  // nothing reached the table
    EXPECT_EQ(iscsi_mod_stop(), ERR_OP_NOT_PROVIDED);

    EXPECT_EQ(iscsi_mod_set_dataout_timeout(0, &target_), 19);
    EXPECT_EQ(rec, (call{9, &target_, nullptr, 0}));
    EXPECT_EQ(iscsi_mod_add_lun_mapping(&lun_, &target_, 255), 25);
    EXPECT_EQ(rec, (call{15, &lun_, &target_, 255}));
    list_t other;
    EXPECT_EQ(iscsi_mod_get_target_session(&list_, &other, &target_), 31);
    EXPECT_EQ(rec, (call{21, &list_, &other, 0}));
}

// Through the table: the names a kernel makes, not the others (portals.tree).
TEST_F(ModTest, PortalsOfATargetByNameAndTag)
{
    ASSERT_EQ(iscsi_mod_select(ISCSI_MOD_TYPE_LIO), 0);
    load_tree("portals.tree");
    ASSERT_EQ(iscsi_mod_get_target_ip_list_in_target_parm(&list_, "iqn.2026-01.test:t1", 1), 0);
    ASSERT_EQ(list_.count, 3);
    iscsi_ip_t *ll = iscsi_ip_search_list_by_IPv6(&list_, "fe80::1");
    ASSERT_TRUE(ll && iscsi_ip_search_list_by_IPv4(&list_, "10.0.0.1") &&
                iscsi_ip_search_list_by_IPv6(&list_, "2001:db8::1"));
    EXPECT_STREQ(ll->dev_name, "eth0");
    EXPECT_EQ(ll->port, 3260);

    // A target or portal group the kernel does not hold, and bad arguments.
    const struct {
        std::string iqn;
        int tpgt, rc;
    } bad[] = {
        {"iqn.2026-01.test:t2", 1, ERR_CONFIGFS}, {"iqn.2026-01.test:t1", 2, ERR_CONFIGFS}, {"", 1, ERR_PARAM},
        {"iqn.2026-01.test:t1", -1, ERR_PARAM}, {std::string(300, 'a'), 1, ERR_PARAM},
    };
    for (const auto &b : bad)
        EXPECT_EQ(iscsi_mod_get_target_ip_list_in_target_parm(&list_, b.iqn.c_str(), b.tpgt), b.rc) << b.iqn << b.tpgt;
    EXPECT_EQ(list_.count, 3) << "a failed read adds nothing";
    iscsi_ip_free_list(&list_);
}

TEST(TargetRecordTest, FreeTakesTheRecordOffItsListWithItsPortals)
{
    iscsi_target_t *t = iscsi_target_new();
    ASSERT_NE(t, nullptr);
    EXPECT_EQ(t->tpgt, -1);
    for (int i = 0; i < 3; ++i)
        list_append(&iscsi_ip_new()->node, &t->ip_list);
    list_t targets;
    list_init(&targets);
    list_append(&t->node, &targets);
    iscsi_target_free(t);  // portals freed too; leaks show under the sanitizer
    EXPECT_TRUE(list_is_empty(&targets));

    iscsi_lun_t *lun = iscsi_lun_new();
    EXPECT_EQ(lun->hba_id, -1);  // unset, which backstore shutdown refuses
    iscsi_lun_free(lun);
}

}  // namespace
