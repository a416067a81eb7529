// SPDX-License-Identifier: Apache-2.0
// The driver table selection, the iscsi_mod_ wrappers and the driver's
// records. The VM suite calls the LIO table through every wrapper.
#include "tests/kernel/lio4_test.h"

namespace {

class ModTest : public korv_test::Lio4Test {
protected:
    void TearDown() override
    {
        iscsi_mod_ops = saved_;
        Lio4Test::TearDown();
    }
    const iscsi_mod_ops_t *saved_ = iscsi_mod_ops;
    korv::list_owner ips_{iscsi_ip_free_list};
    list_t &list_ = *ips_.get();
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
    EXPECT_EQ(iscsi_mod_add_target(&target), ERR_PARAM);
    EXPECT_EQ(iscsi_mod_del_backstore(&lun), ERR_MODULE_START);
    EXPECT_EQ(iscsi_mod_get_target_ip_list_in_target_parm(&list_, IQN, 1), ERR_PARAM);
    ASSERT_EQ(iscsi_mod_select(ISCSI_MOD_TYPE_LIO), 0);
    EXPECT_EQ(iscsi_mod_ops, &lio3_mod_ops);
}

// An empty table tells where a call stopped: -9989 at the wrapper's check,
// -9967 at the slot.
TEST_F(ModTest, WrappersCheckArgumentsBeforeTheTable)
{
    iscsi_mod_ops_t table{};
    iscsi_mod_ops = &table;
    iscsi_map_lun_t no_map{};
    iscsi_lun_acl_t no_initiator{&no_map, nullptr, 1, {}};
    EXPECT_EQ(iscsi_mod_add_target(nullptr), ERR_PARAM);
    EXPECT_EQ(iscsi_mod_set_dataout_timeout(-1, &target), ERR_PARAM);
    EXPECT_EQ(iscsi_mod_get_target_ip_list(nullptr, &target), ERR_PARAM);
    EXPECT_EQ(iscsi_mod_add_lun_mapping(&lun, &target, -1), ERR_PARAM);
    EXPECT_EQ(iscsi_mod_del_backstore(nullptr), ERR_PARAM);
    EXPECT_EQ(iscsi_mod_add_lun_acl(&no_initiator), ERR_PARAM);
    EXPECT_EQ(iscsi_mod_get_target_session(&list_, nullptr, &target), ERR_PARAM);
    EXPECT_EQ(iscsi_mod_stop(), ERR_OP_NOT_PROVIDED);
    EXPECT_EQ(iscsi_mod_set_dataout_timeout(0, &target), ERR_OP_NOT_PROVIDED);
    EXPECT_EQ(iscsi_mod_add_lun_acl(&acl), ERR_OP_NOT_PROVIDED);
}

// Through the table: the names a kernel makes, not the others (portals.tree).
TEST_F(ModTest, PortalsOfATargetByNameAndTag)
{
    ASSERT_EQ(iscsi_mod_select(ISCSI_MOD_TYPE_LIO), 0);
    load_tree("portals.tree");
    ASSERT_EQ(iscsi_mod_get_target_ip_list_in_target_parm(&list_, IQN, 1), 0);
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
        {"iqn.2026-01.test:t2", 1, ERR_CONFIGFS}, {IQN, 2, ERR_CONFIGFS}, {"", 1, ERR_PARAM},
        {IQN, -1, ERR_PARAM}, {std::string(300, 'a'), 1, ERR_PARAM},
    };
    for (const auto &b : bad)
        EXPECT_EQ(iscsi_mod_get_target_ip_list_in_target_parm(&list_, b.iqn.c_str(), b.tpgt), b.rc) << b.iqn << b.tpgt;
    EXPECT_EQ(list_.count, 3) << "a failed read adds nothing";
}

TEST_F(ModTest, RecordsTargetsByIqnInitiatorsByExactNameAndWhatTheirFreeReleases)
{
    iscsi_target_t *t = iscsi_target_new();
    EXPECT_EQ(t->tpgt, -1);
    list_append(&iscsi_ip_new()->node, &t->ip_list);
    list_append(&t->node, &list_);
    iscsi_target_free(t);  // its portal too; leaks show under the sanitizer
    EXPECT_TRUE(list_is_empty(&list_));
    iscsi_lun_t *lun = iscsi_lun_new();
    EXPECT_EQ(lun->hba_id, -1);  // unset, which backstore shutdown refuses
    iscsi_lun_free(lun);

    korv::list_owner inits(iscsi_initiator_free_list);
    iscsi_initiator_t *a = iscsi_initiator_list_add(inits.get(), "iqn.2026-01.test:a");
    EXPECT_EQ(iscsi_initiator_list_add(inits.get(), "iqn.2026-01.test:a"), a);
    for (const char *other : {"iqn.2026-01.test:", "iqn.2026-01.test:ab", "IQN.2026-01.test:a"})
        EXPECT_EQ(iscsi_initiator_list_search(inits.get(), other), nullptr) << other;
    EXPECT_EQ(iscsi_initiator_list_add(inits.get(), ""), nullptr);
    EXPECT_EQ(iscsi_initiator_list_add(inits.get(), std::string(ISCSI_INITIATOR_LEN, 'x').c_str()), nullptr);
    EXPECT_EQ(inits.get()->count, 1);

    iscsi_target_t t1b = target, t1x = target, empty{};
    t1b.tpgt = 2;
    set(t1x.iqn, std::string(IQN) + "x");
    EXPECT_EQ(iscsi_target_cmp(&target, &t1b), 1) << "the portal group takes no part";
    EXPECT_EQ(iscsi_target_cmp(&target, &t1x), 0);
    EXPECT_EQ(iscsi_target_cmp(&empty, &empty), 0);
    EXPECT_EQ(iscsi_target_cmp(&target, nullptr), 0);
}

}  // namespace
