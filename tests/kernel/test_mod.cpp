// The driver table selection and the iscsi_mod_ wrappers.
#include "kernel/korvadm_mod.h"

#include <cstring>
#include <string>

#include <gtest/gtest.h>

#include "common/korvadm_err.h"
#include "kernel/korvadm_mod_lio4.h"
#include "tests/kernel/kernel_root.h"

namespace {

using korv_test::KernelRoot;

// A table that records what reached it.
struct recorder {
    int slot = -1;
    const void *arg1 = nullptr;
    const void *arg2 = nullptr;
    int number = 0;
} rec;

iscsi_mod_ops_t recording_table()
{
    iscsi_mod_ops_t t{};
    t.start_module = [] { rec.slot = 0; return 11; };
    t.get_module_state = [] { rec.slot = 2; return 0; };
    t.set_target_attr_dataout_timeout = [](int timeout, iscsi_target_t *target) {
        rec = {9, target, nullptr, timeout};
        return 19;
    };
    t.add_lun_mapping = [](iscsi_lun_t *lun, iscsi_target_t *target, int n) {
        rec = {15, lun, target, n};
        return 25;
    };
    t.del_backstore = [](iscsi_lun_t *lun) {
        rec = {12, lun, nullptr, 0};
        return 22;
    };
    t.get_target_session = [](list_t *sess, list_t *init, iscsi_target_t *) {
        rec = {21, sess, init, 0};
        return 31;
    };
    return t;
}

class ModTest : public KernelRoot {
protected:
    void SetUp() override
    {
        KernelRoot::SetUp();
        saved_ = iscsi_mod_ops;
        rec = recorder{};
    }
    void TearDown() override
    {
        iscsi_mod_ops = saved_;
        KernelRoot::TearDown();
    }
    const iscsi_mod_ops_t *saved_ = nullptr;
};

TEST_F(ModTest, SelectAcceptsOnlyTheLioType)
{
    iscsi_mod_ops = nullptr;
    EXPECT_EQ(iscsi_mod_select(-1), ERR_PARAM);
    EXPECT_EQ(iscsi_mod_select(1), ERR_MODULE_TYPE);
    EXPECT_EQ(iscsi_mod_select(3), ERR_MODULE_TYPE);
    EXPECT_EQ(iscsi_mod_ops, nullptr);
    EXPECT_EQ(iscsi_mod_select(ISCSI_MOD_TYPE_LIO), 0);
    EXPECT_EQ(iscsi_mod_ops, &lio3_mod_ops);
}

TEST_F(ModTest, WithoutATableEachWrapperAnswersItsOwnCode)
{
    iscsi_mod_ops = nullptr;
    iscsi_target_t target{};
    iscsi_lun_t lun{};
    list_t list;
    list_init(&list);
    EXPECT_EQ(iscsi_mod_start(), ERR_MODULE_START);
    EXPECT_EQ(iscsi_mod_stop(), ERR_MODULE_START);
    EXPECT_EQ(iscsi_mod_get_state(), 1);
    EXPECT_EQ(iscsi_mod_add_target(&target), ERR_PARAM);
    EXPECT_EQ(iscsi_mod_set_dataout_timeout(5, &target), ERR_PARAM);
    EXPECT_EQ(iscsi_mod_get_target_ip_list(&list, &target), ERR_PARAM);
    EXPECT_EQ(iscsi_mod_shutdown_backstore(&lun), ERR_PARAM);
    EXPECT_EQ(iscsi_mod_del_backstore(&lun), ERR_MODULE_START);
    EXPECT_EQ(iscsi_mod_get_target_ip_list_in_target_parm(&list, "iqn.x", 1), ERR_PARAM);
}

TEST_F(ModTest, LioTableLeavesLaterSlotsEmpty)
{
    ASSERT_EQ(iscsi_mod_select(ISCSI_MOD_TYPE_LIO), 0);
    iscsi_target_t target{};
    iscsi_lun_t lun{};
    iscsi_initiator_t initiator{};
    iscsi_map_lun_t map{};
    iscsi_lun_acl_t acl{};
    acl.map_lun = &map;
    acl.initiator = &initiator;
    list_t a, b;
    list_init(&a);
    list_init(&b);
    EXPECT_EQ(iscsi_mod_add_backstore(&lun), ERR_OP_NOT_PROVIDED);
    EXPECT_EQ(iscsi_mod_del_backstore(&lun), ERR_OP_NOT_PROVIDED);
    EXPECT_EQ(iscsi_mod_change_backstore_size(&lun), ERR_OP_NOT_PROVIDED);
    EXPECT_EQ(iscsi_mod_add_lun_mapping(&lun, &target, 0), ERR_OP_NOT_PROVIDED);
    EXPECT_EQ(iscsi_mod_del_lun_mapping(&lun, &target), ERR_OP_NOT_PROVIDED);
    EXPECT_EQ(iscsi_mod_add_acl_initiator("iqn.i", &target), ERR_OP_NOT_PROVIDED);
    EXPECT_EQ(iscsi_mod_del_acl_initiator("iqn.i", &target), ERR_OP_NOT_PROVIDED);
    EXPECT_EQ(iscsi_mod_add_lun_acl(&acl), ERR_OP_NOT_PROVIDED);
    EXPECT_EQ(iscsi_mod_del_lun_acl(&acl), ERR_OP_NOT_PROVIDED);
    EXPECT_EQ(iscsi_mod_get_target_session(&a, &b, &target), ERR_OP_NOT_PROVIDED);
    // Filled slots reach the back end, which checks the record itself.
    EXPECT_EQ(iscsi_mod_add_target(&target), ERR_PARAM);
    lun.hba_id = -1;
    EXPECT_EQ(iscsi_mod_shutdown_backstore(&lun), ERR_PARAM);
}

TEST_F(ModTest, ArgumentsAreCheckedBeforeTheTable)
{
    iscsi_mod_ops_t table = recording_table();
    iscsi_mod_ops = &table;
    iscsi_target_t target{};
    iscsi_lun_t lun{};
    iscsi_map_lun_t map{};
    iscsi_lun_acl_t acl{};
    list_t list;
    list_init(&list);
    EXPECT_EQ(iscsi_mod_add_target(nullptr), ERR_PARAM);
    EXPECT_EQ(iscsi_mod_set_dataout_timeout(-1, &target), ERR_PARAM);
    EXPECT_EQ(iscsi_mod_set_dataout_timeout(1, nullptr), ERR_PARAM);
    EXPECT_EQ(iscsi_mod_get_target_ip_list(nullptr, &target), ERR_PARAM);
    EXPECT_EQ(iscsi_mod_add_lun_mapping(&lun, &target, -1), ERR_PARAM);
    EXPECT_EQ(iscsi_mod_add_lun_mapping(nullptr, &target, 0), ERR_PARAM);
    EXPECT_EQ(iscsi_mod_del_backstore(nullptr), ERR_PARAM);
    EXPECT_EQ(iscsi_mod_add_acl_initiator(nullptr, &target), ERR_PARAM);
    acl.map_lun = &map;  // initiator still missing
    EXPECT_EQ(iscsi_mod_add_lun_acl(&acl), ERR_PARAM);
    EXPECT_EQ(iscsi_mod_del_lun_acl(nullptr), ERR_PARAM);
    EXPECT_EQ(iscsi_mod_get_target_session(&list, nullptr, &target), ERR_PARAM);
    EXPECT_EQ(rec.slot, -1);  // nothing reached the table
    EXPECT_EQ(iscsi_mod_stop(), ERR_OP_NOT_PROVIDED);
}

TEST_F(ModTest, WrappersPassArgumentsAndResultsThrough)
{
    iscsi_mod_ops_t table = recording_table();
    iscsi_mod_ops = &table;
    iscsi_target_t target{};
    iscsi_lun_t lun{};
    list_t a, b;
    list_init(&a);
    list_init(&b);

    EXPECT_EQ(iscsi_mod_start(), 11);
    EXPECT_EQ(rec.slot, 0);
    EXPECT_EQ(iscsi_mod_get_state(), 0);
    EXPECT_EQ(rec.slot, 2);
    EXPECT_EQ(iscsi_mod_set_dataout_timeout(0, &target), 19);
    EXPECT_EQ(rec.slot, 9);
    EXPECT_EQ(rec.arg1, &target);
    EXPECT_EQ(rec.number, 0);
    EXPECT_EQ(iscsi_mod_add_lun_mapping(&lun, &target, 255), 25);
    EXPECT_EQ(rec.slot, 15);
    EXPECT_EQ(rec.arg1, &lun);
    EXPECT_EQ(rec.arg2, &target);
    EXPECT_EQ(rec.number, 255);
    EXPECT_EQ(iscsi_mod_del_backstore(&lun), 22);
    EXPECT_EQ(rec.arg1, &lun);
    EXPECT_EQ(iscsi_mod_get_target_session(&a, &b, &target), 31);
    EXPECT_EQ(rec.arg1, &a);
    EXPECT_EQ(rec.arg2, &b);
}

TEST_F(ModTest, PortalsOfATargetByNameAndTag)
{
    ASSERT_EQ(iscsi_mod_select(ISCSI_MOD_TYPE_LIO), 0);
    std::string np = at("/sys/kernel/config/target/iscsi/iqn.2026-01.test:t1/tpgt_1/np");
    mkdirs(np + "/10.0.0.1:3260");
    mkdirs(np + "/[2001:db8::5]:3261");

    list_t list;
    list_init(&list);
    ASSERT_EQ(iscsi_mod_get_target_ip_list_in_target_parm(&list, "iqn.2026-01.test:t1", 1), 0);
    ASSERT_EQ(list.count, 2);
    iscsi_ip_t *v4 = iscsi_ip_search_list_by_IPv4(&list, "10.0.0.1");
    iscsi_ip_t *v6 = iscsi_ip_search_list_by_IPv6(&list, "2001:db8::5");
    ASSERT_TRUE(v4 && v6);
    EXPECT_EQ(v4->port, 3260);
    EXPECT_EQ(v6->port, 3261);
    EXPECT_STREQ(v6->ipv4, "");

    // A target the kernel does not hold, and bad arguments.
    EXPECT_EQ(iscsi_mod_get_target_ip_list_in_target_parm(&list, "iqn.2026-01.test:t2", 1), ERR_CONFIGFS);
    EXPECT_EQ(iscsi_mod_get_target_ip_list_in_target_parm(&list, "", 1), ERR_PARAM);
    EXPECT_EQ(iscsi_mod_get_target_ip_list_in_target_parm(&list, "iqn.2026-01.test:t1", -1), ERR_PARAM);
    EXPECT_EQ(iscsi_mod_get_target_ip_list_in_target_parm(nullptr, "iqn.2026-01.test:t1", 1), ERR_PARAM);
    EXPECT_EQ(iscsi_mod_get_target_ip_list_in_target_parm(&list, std::string(300, 'a').c_str(), 1), ERR_PARAM);
    EXPECT_EQ(list.count, 2);
    iscsi_ip_free_list(&list);
}

TEST(TargetRecordTest, NewAndFreeOwnThePortalList)
{
    iscsi_target_t *t = iscsi_target_new();
    ASSERT_NE(t, nullptr);
    EXPECT_EQ(t->tpgt, -1);
    EXPECT_STREQ(t->iqn, "");
    EXPECT_EQ(t->chap, 0);
    for (int i = 0; i < 3; ++i)
        list_append(&iscsi_ip_new()->node, &t->ip_list);
    list_t targets;
    list_init(&targets);
    list_append(&t->node, &targets);
    iscsi_target_free(t);  // portals freed too; leaks show under the sanitizer
    EXPECT_TRUE(list_is_empty(&targets));
    iscsi_target_free(nullptr);

    iscsi_lun_t *lun = iscsi_lun_new();
    ASSERT_NE(lun, nullptr);
    EXPECT_EQ(lun->lun_num, -1);
    EXPECT_EQ(lun->hba_id, -1);
    iscsi_lun_free(lun);
}

}  // namespace
