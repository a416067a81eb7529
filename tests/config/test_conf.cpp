// SPDX-License-Identifier: Apache-2.0
// Configuration records, access-right words, generated target names, the
// configuration context and the stored debug level.
#include <cstdlib>
#include <cstring>
#include <utility>

#include "common/korvadm_debug.h"
#include "tests/config/store_fixture.h"

using namespace korv_test;

TEST(Records, StartUnknownAndFreeingUnlinks)
{
    // The readers rely on -1 for what the database did not supply (the LUN's
    // own fields are checked through its reader).
    target_conf_t *t = target_conf_new();
    target_map_lun_conf_t *m = target_map_lun_conf_new();
    lun_acl_conf_t *r = lun_acl_conf_new();
    EXPECT_EQ(slash(t->tpgt, t->state, t->chap_enable, t->hba_id, m->lun_num, r->access_right), "-1/-1/-1/-1/-1/-1");
    target_map_lun_conf_free(m);
    lun_acl_conf_free(r);
    korv::list_owner targets(target_conf_free_list);
    list_append(&t->node, targets.get());
    target_conf_free(t);
    EXPECT_EQ(targets.get()->head, nullptr);
    // A LUN record owns its private data: freed with it (ASan checks).
    lun_conf_t *l = lun_conf_new();
    l->priv = std::malloc(32);
    lun_conf_free(l);
}

TEST(AccessRight, WordsMatchByPrefixIgnoringCaseUpToTenCharacters)
{
    const std::string long_word(4096, 'R');
    const std::pair<const char *, int> cases[] = {
        {"deny", 0}, {"DENYALL", 0}, {"ro", 1}, {"Rox", 1}, {"ROOT", 1}, {"Rw", 2},
        {"RW34567890", 2}, {"READ", -1}, {"DEN", -1}, {"R", -1}, {"", -1}, {nullptr, -1}, {"RW345678901", -1},
        {"deny567890x", -1}, {long_word.c_str(), -1}};
    for (const auto &[text, want] : cases)
        EXPECT_EQ(iscsi_conf_parse_access_right(text), want) << (text ? text : "(null)");
}

using ConfContext = StoreTest;

TEST_F(ConfContext, GeneratedIqnIsPrefixThenFirstColonSecondCutToTheBuffer)
{
    char out[CONF_GEN_IQN_LEN + 8];
    EXPECT_EQ(slash(iscsi_conf_generate_iqn(out, "nas", "t1"), out), "6/nas:t1");
    // The prefix in front is checked through the daemon's node list.
    EXPECT_EQ(quiet([&] { return iscsi_conf_generate_iqn(out, nullptr, "t1"); }), ERR_PARAM);

    std::memset(out, 'Z', sizeof out);
    EXPECT_EQ(iscsi_conf_generate_iqn(out, "nas", std::string(300, 'n').c_str()), 304);
    EXPECT_EQ(std::strlen(out), static_cast<size_t>(CONF_GEN_IQN_LEN - 1));
    EXPECT_EQ(out[CONF_GEN_IQN_LEN], 'Z');
}

TEST_F(ConfContext, InitTakesTheHostNameInIqnFormOrFails)
{
    SysRoot::write("/proc/sys/kernel/hostname", "NAS_Box1\n");
    iscsi_conf_ctx_t ctx;
    std::memset(&ctx, 0x5a, sizeof ctx);
    EXPECT_EQ(slash(iscsi_conf_init(&ctx), ctx.host_name), "0/nas-box1");

    SysRoot::remove("/proc/sys/kernel/hostname");
    EXPECT_EQ(logged([&] { return iscsi_conf_init(&ctx); }, "get host name failed\n"), ERR_DB_WRITE);
}

TEST_F(ConfContext, StoredDebugLevelBecomesTheProcessLevelWhenReadable)
{
    // The daemon's suite sees a stored level adopted (it stores 1); here the
    // level read is reported and returned.
    int level = 7;
    EXPECT_EQ(slash(xmldb_get_debug_level(&level), level), slash(ERR_INT_VALUE, 0));
    // Unset, or a table without the slot: the process level stays.
    iscsi_conf_ops_t empty = {};
    iscsi_conf_ctx_t ctx = {};
    g_korv_debug_level = 1;
    for (const iscsi_conf_ops_t *ops : {&iscsi_conf_ops, static_cast<const iscsi_conf_ops_t *>(&empty)}) {
        ctx.ops = ops;
        EXPECT_EQ(slash(quiet([&] { return dbg_get_conf_target_debug_lv(&ctx); }), g_korv_debug_level), "0/1");
    }
    g_korv_debug_level = 0;
    EXPECT_EQ(xmldb_set_debug_level(2), KORV_OK);
    EXPECT_EQ(slash(xmldb_get_debug_level(&level), level), "0/2");
    ctx.ops = &iscsi_conf_ops;
    EXPECT_EQ(logged([&] { return dbg_get_conf_target_debug_lv(&ctx); }, "get debug level = 2\n"), 2);
    g_korv_debug_level = 0;
}
