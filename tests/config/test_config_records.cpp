// Configuration records, access-right words, generated target names, the
// configuration context and the stored debug level.
#include <cstring>
#include <string>

#include <gtest/gtest.h>

#include "common/korvadm_debug.h"
#include "common/korvadm_err.h"
#include "common/korvadm_log.h"
#include "config/korvadm_conf.h"
#include "config/korvadm_xmldb_conf.h"
#include "tests/config/store_fixture.h"
#include "tests/support/capture.h"

using korv_test::quiet;
using korv_test::StoreTest;
using korv_test::SysRoot;

TEST(Records, StartWithUnknownIntegersAndEmptyTexts)
{
    target_conf_t *t = target_conf_new();
    ASSERT_NE(t, nullptr);
    EXPECT_EQ(t->dbidx, 0);
    EXPECT_EQ(t->tpgt, -1);
    EXPECT_EQ(t->state, -1);
    EXPECT_EQ(t->chap_enable, -1);
    EXPECT_EQ(t->hba_id, -1);
    EXPECT_STREQ(t->name, "");
    EXPECT_STREQ(t->chap_pwd, "");
    EXPECT_EQ(t->node.owner, t);

    lun_conf_t *l = lun_conf_new();
    ASSERT_NE(l, nullptr);
    EXPECT_EQ(l->size, 0u);
    EXPECT_EQ(l->devid, -1);
    EXPECT_EQ(l->lun_num, -1);
    EXPECT_EQ(l->prealloc, -1);
    EXPECT_EQ(l->priv, nullptr);
    l->priv = std::malloc(32);  // owned: freed with the record (ASan checks)

    target_map_lun_conf_t *m = target_map_lun_conf_new();
    EXPECT_EQ(m->lun_num, -1);
    lun_acl_conf_t *a = lun_acl_conf_new();
    EXPECT_EQ(a->access_right, -1);
    acl_initiator_conf_t *i = acl_initiator_conf_new();
    EXPECT_STREQ(i->initiator, "");

    target_conf_free(t);
    lun_conf_free(l);
    target_map_lun_conf_free(m);
    lun_acl_conf_free(a);
    acl_initiator_conf_free(i);
    target_conf_free(nullptr);
    lun_conf_free(nullptr);
}

TEST(Records, FreeingUnlinksAndListsEmpty)
{
    list_t list;
    list_init(&list);
    target_conf_t *a = target_conf_new();
    target_conf_t *b = target_conf_new();
    target_conf_t *c = target_conf_new();
    list_append(&a->node, &list);
    list_append(&b->node, &list);
    list_append(&c->node, &list);
    target_conf_free(b);
    EXPECT_EQ(list.count, 2);
    EXPECT_EQ(a->node.next, &c->node);
    target_conf_free_list(&list);
    EXPECT_TRUE(list_is_empty(&list));
    EXPECT_EQ(list.count, 0);
    target_conf_free_list(nullptr);

    list_t luns;
    list_init(&luns);
    for (int k = 0; k < 3; k++) {
        lun_conf_t *l = lun_conf_new();
        l->priv = std::malloc(8);
        list_append(&l->node, &luns);
    }
    lun_conf_free_list(&luns);
    EXPECT_TRUE(list_is_empty(&luns));
}

TEST(AccessRight, WordsMatchByPrefixIgnoringCase)
{
    EXPECT_EQ(iscsi_conf_parse_access_right("deny"), 0);
    EXPECT_EQ(iscsi_conf_parse_access_right("DENYALL"), 0);
    EXPECT_EQ(iscsi_conf_parse_access_right("ro"), 1);
    EXPECT_EQ(iscsi_conf_parse_access_right("Rox"), 1);
    EXPECT_EQ(iscsi_conf_parse_access_right("ROOT"), 1);
    EXPECT_EQ(iscsi_conf_parse_access_right("Rw"), 2);
    EXPECT_EQ(iscsi_conf_parse_access_right("READ"), -1);
    EXPECT_EQ(iscsi_conf_parse_access_right("DEN"), -1);
    EXPECT_EQ(iscsi_conf_parse_access_right("R"), -1);
    EXPECT_EQ(iscsi_conf_parse_access_right(""), -1);
    EXPECT_EQ(iscsi_conf_parse_access_right(nullptr), -1);
}

TEST(AccessRight, LengthLimits)
{
    EXPECT_EQ(iscsi_conf_parse_access_right("RW34567890"), 2);   // 10 characters
    EXPECT_EQ(iscsi_conf_parse_access_right("RW345678901"), -1); // 11
    EXPECT_EQ(iscsi_conf_parse_access_right("deny567890x"), -1);
    EXPECT_EQ(iscsi_conf_parse_access_right(std::string(4096, 'R').c_str()), -1);
}

using GeneratedIqn = StoreTest;

TEST_F(GeneratedIqn, PrefixThenFirstColonSecond)
{
    char out[CONF_GEN_IQN_LEN];
    EXPECT_EQ(iscsi_conf_generate_iqn(out, "nas", "t1"), 6);
    EXPECT_STREQ(out, "nas:t1");
    put("/iscsi/target/iqn_prefix", "iqn.2000-01.com.example:");
    EXPECT_EQ(iscsi_conf_generate_iqn(out, "nas", "t1"), 30);
    EXPECT_STREQ(out, "iqn.2000-01.com.example:nas:t1");
    EXPECT_EQ(quiet([&] { return iscsi_conf_generate_iqn(out, nullptr, "t1"); }), ERR_PARAM);
}

TEST_F(GeneratedIqn, LongPartsAreCutToTheBuffer)
{
    char out[CONF_GEN_IQN_LEN + 8];
    std::memset(out, 'Z', sizeof out);
    std::string longname(300, 'n');
    int len = iscsi_conf_generate_iqn(out, "nas", longname.c_str());
    EXPECT_EQ(len, 304);
    EXPECT_EQ(std::strlen(out), static_cast<size_t>(CONF_GEN_IQN_LEN - 1));
    EXPECT_EQ(out[CONF_GEN_IQN_LEN], 'Z');
}

using ConfContext = StoreTest;

TEST_F(ConfContext, InitFillsHostNameInIqnFormAndTheTable)
{
    SysRoot::write("/proc/sys/kernel/hostname", "NAS_Box1\n");
    iscsi_conf_ctx_t ctx;
    std::memset(&ctx, 0x5a, sizeof ctx);
    ASSERT_EQ(iscsi_conf_init(&ctx), KORV_OK);
    EXPECT_STREQ(ctx.host_name, "nas-box1");
    EXPECT_EQ(ctx.ops, &iscsi_conf_ops);
}

TEST_F(ConfContext, InitFailsWithoutAHostName)
{
    SysRoot::remove("/proc/sys/kernel/hostname");
    iscsi_conf_ctx_t ctx;
    std::string out;
    EXPECT_EQ(quiet([&] { return iscsi_conf_init(&ctx); }, &out), ERR_DB_WRITE);
    EXPECT_EQ(out, "get host name failed\n");
}

using DebugLevel = StoreTest;

TEST_F(DebugLevel, StoredLevelBecomesTheProcessLevel)
{
    iscsi_conf_ctx_t ctx = {};
    ctx.ops = &iscsi_conf_ops;
    g_korv_debug_level = 0;
    put("/iscsi/target/dbg", "2");
    std::string out;
    EXPECT_EQ(quiet([&] { return dbg_get_conf_target_debug_lv(&ctx); }, &out), 2);
    EXPECT_EQ(g_korv_debug_level, 2);
    EXPECT_NE(out.find("(korvadm_debug:dbg_get_conf_target_debug_lv:"), std::string::npos) << out;
    EXPECT_NE(out.find("get debug level = 2\n"), std::string::npos) << out;
    g_korv_debug_level = 0;
}

TEST_F(DebugLevel, UnsetOrUnreachableLeavesTheLevelAlone)
{
    iscsi_conf_ctx_t ctx = {};
    ctx.ops = &iscsi_conf_ops;
    g_korv_debug_level = 1;
    std::string out;
    EXPECT_EQ(quiet([&] { return dbg_get_conf_target_debug_lv(&ctx); }, &out), 0);
    EXPECT_EQ(g_korv_debug_level, 1);
    EXPECT_EQ(out.find("get debug level"), std::string::npos);

    EXPECT_EQ(dbg_get_conf_target_debug_lv(nullptr), 0);
    iscsi_conf_ops_t empty = {};
    ctx.ops = &empty;
    EXPECT_EQ(dbg_get_conf_target_debug_lv(&ctx), 0);
    EXPECT_EQ(g_korv_debug_level, 1);
    g_korv_debug_level = 0;
}
