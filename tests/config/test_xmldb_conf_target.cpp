// SPDX-License-Identifier: Apache-2.0
// The numbered-entry scanner, the counters and the target schema.
#include <cstring>
#include <string>

#include <gtest/gtest.h>

#include "common/korvadm_err.h"
#include "common/korvadm_log.h"
#include "config/korvadm_conf.h"
#include "config/korvadm_xmldb_conf.h"
#include "config/korvadm_xmldb_conf_internal.h"
#include "tests/config/store_fixture.h"
#include "tests/support/capture.h"

using korv_test::quiet;
using korv_test::StoreTest;

namespace {

target_conf_t *filled_target(const char *name, int chap = 0)
{
    target_conf_t *t = target_conf_new();
    std::snprintf(t->name, sizeof t->name, "%s", name);
    std::snprintf(t->iqn, sizeof t->iqn, "iqn.2000-01.com.example:%s", name);
    t->tpgt = 1;
    t->state = 0;
    t->chap_enable = chap;
    t->hba_id = 0;
    std::strcpy(t->chap_name, "user");
    std::strcpy(t->chap_pwd, "secret12345678");
    return t;
}

// The targets reader finds, as "name/tpgt/dbidx" per record.
std::string read_targets(int (*reader)(list_t *), std::string *log = nullptr)
{
    list_t list;
    list_init(&list);
    EXPECT_EQ(quiet([&] { return reader(&list); }, log), KORV_OK);
    std::string out;
    for (target_conf_t *t : korv::list_records<target_conf_t>(&list))
        out += std::string(out.empty() ? "" : " ") + t->name + "/" + std::to_string(t->tpgt) + "/" +
               std::to_string(t->dbidx);
    target_conf_free_list(&list);
    return out;
}

}  // namespace

using TargetAdd = StoreTest;

TEST_F(TargetAdd, WritesEveryFieldButCredentialsOnlyWithChapOn)
{
    target_conf_t *t = filled_target("t1", 1);
    t->tpgt = 3;
    t->hba_id = 7;
    ASSERT_EQ(xmldb_add_new_target(t), KORV_OK);
    EXPECT_EQ(t->dbidx, 1);
    const char *want[][2] = {{"name", "t1"},        {"iqn", "iqn.2000-01.com.example:t1"}, {"tpgt", "3"},
                             {"hba_id", "7"},       {"chap_enable", "1"},                  {"chap_name", "user"},
                             {"chap_pwd", "secret12345678"}, {"map_lun/count", "0"}};
    for (auto [field, value] : want)
        EXPECT_EQ(raw(tpath(1, field)), value) << field;
    target_conf_free(t);

    t = filled_target("t2", 0);  // credentials left in the record must not be written
    ASSERT_EQ(xmldb_add_new_target(t), KORV_OK);
    EXPECT_EQ(t->dbidx, 2);
    EXPECT_EQ(raw(tpath(2, "chap_enable")), "0");
    EXPECT_EQ(raw(tpath(2, "chap_name")) + raw(tpath(2, "chap_pwd")), "");
    EXPECT_EQ(raw("/iscsi/target/count"), "2");
    target_conf_free(t);
}

TEST_F(TargetAdd, RefusesInvalidRecordsBeforeAnyWrite)
{
    struct Case {
        const char *message;
        void (*spoil)(target_conf_t *);
    } cases[] = {
        {"target_suffix error", [](target_conf_t *t) { t->name[0] = '\0'; }},
        // 128 characters leave no room for the terminator: every reader would cut it.
        {"target_suffix error", [](target_conf_t *t) { std::memset(t->name, 'n', sizeof t->name); }},
        {"IQN error", [](target_conf_t *t) { t->iqn[0] = '\0'; }},
        {"TPGT error", [](target_conf_t *t) { t->tpgt = -1; }},
        {"enable_chap error", [](target_conf_t *t) { t->chap_enable = 2; }},
        {"hba_id error", [](target_conf_t *t) { t->hba_id = -1; }},
        {"chap_name error", [](target_conf_t *t) { t->chap_enable = 1; t->chap_name[0] = '\0'; }},
        {"chap_password error", [](target_conf_t *t) { t->chap_enable = 1; t->chap_pwd[0] = '\0'; }},
    };
    for (const auto &c : cases) {
        target_conf_t *t = filled_target("bad");
        c.spoil(t);
        std::string out;
        EXPECT_EQ(quiet([&] { return xmldb_add_new_target(t); }, &out), ERR_PARAM) << c.message;
        EXPECT_NE(out.find(c.message), std::string::npos) << out;
        target_conf_free(t);
    }
    EXPECT_EQ(raw(tpath(1, "name")) + raw("/iscsi/target/count"), "");
    EXPECT_EQ(quiet([&] { return xmldb_add_new_target(nullptr); }), ERR_PARAM);
}

TEST_F(TargetAdd, SixtyFifthTargetIsRefusedAndWritesNothing)
{
    for (int i = 1; i <= 64; i++)
        put_target(i, "t" + std::to_string(i), 1, i - 1);
    int id = -1;
    EXPECT_EQ(_get_free_xmldb_id_entry(&id, "/iscsi/target", 64, "name"), ID_ENTRY_NOT_FOUND);
    EXPECT_EQ(id, 0);
    EXPECT_EQ(xmldb_check_add_target("t65"), ERR_NO_ROOM);
    EXPECT_EQ(xmldb_check_add_target("t64"), 1);

    target_conf_t *t = filled_target("t65");
    EXPECT_EQ(quiet([&] { return xmldb_add_new_target(t); }), ERR_NO_ROOM);
    EXPECT_EQ(raw(tpath(65, "name")) + raw("/iscsi/target/count"), "");
    target_conf_free(t);
    EXPECT_EQ(quiet([&] { return xmldb_get_free_target_hba_id(&id); }), ERR_NO_ROOM);
    EXPECT_EQ(id, -1);
    put(tpath(3, "hba_id"), "70");  // out of range: ignored, and number 2 is free again
    EXPECT_EQ(quiet([&] { return xmldb_get_free_target_hba_id(&id); }), KORV_OK);
    EXPECT_EQ(id, 2);
}

using TargetFields = StoreTest;

TEST_F(TargetFields, ReadAndWriteByNameIncludingChap)
{
    put_target(1, "alpha", 2, 4);
    put_target(2, "beta", 5, 6);
    int v = 0;
    EXPECT_EQ(xmldb_get_target_tpgt(&v, "beta"), KORV_OK);
    EXPECT_EQ(v, 5);
    EXPECT_EQ(xmldb_set_target_state(9, "beta"), KORV_OK);
    EXPECT_EQ(xmldb_set_target_hba_id(11, "alpha"), KORV_OK);
    EXPECT_EQ(xmldb_set_target_status("Ready", "alpha"), KORV_OK);
    EXPECT_EQ(xmldb_set_target_iqn("iqn.2000-01.com.example:new", "alpha"), KORV_OK);
    EXPECT_EQ(raw(tpath(2, "state")) + raw(tpath(1, "hba_id")) + raw(tpath(1, "status")), "911Ready");
    char buf[CONF_IQN_LEN];
    EXPECT_EQ(xmldb_get_target_iqn(buf, sizeof buf, "alpha"), KORV_OK);
    EXPECT_STREQ(buf, "iqn.2000-01.com.example:new");

    // A missing name is "not found" except for the IQN, which reports a parameter error.
    EXPECT_EQ(quiet([&] { return xmldb_set_target_state(1, "gamma"); }), ERR_NOT_FOUND);
    EXPECT_EQ(quiet([&] { return xmldb_get_target_iqn(buf, sizeof buf, "gamma"); }), ERR_PARAM);
    EXPECT_EQ(quiet([&] { return xmldb_get_target_status(buf, CONF_NAME_LEN - 1, "alpha"); }), ERR_PARAM);
    put(tpath(2, "tpgt"), "");
    EXPECT_EQ(quiet([&] { return xmldb_get_target_tpgt(&v, "beta"); }), ERR_INT_VALUE);

    // The CHAP switch writes or clears the credentials; a bad switch writes nothing.
    EXPECT_EQ(xmldb_set_target_chap(1, "u", "pw", "alpha"), KORV_OK);
    EXPECT_EQ(raw(tpath(1, "chap_enable")) + raw(tpath(1, "chap_name")) + raw(tpath(1, "chap_pwd")), "1upw");
    EXPECT_EQ(xmldb_set_target_chap(0, "ignored", "ignored", "alpha"), KORV_OK);
    EXPECT_EQ(raw(tpath(1, "chap_enable")) + raw(tpath(1, "chap_name")) + raw(tpath(1, "chap_pwd")), "0");
    EXPECT_EQ(quiet([&] { return xmldb_set_target_chap(2, "u", "p", "alpha"); }), ERR_PARAM);
    EXPECT_EQ(quiet([&] { return xmldb_set_target_chap(1, "u", "p", "nobody"); }), ERR_NOT_FOUND);
    EXPECT_EQ(raw(tpath(1, "chap_enable")), "0");
}

using TargetDelete = StoreTest;

TEST_F(TargetDelete, LeavesAGapThatHidesLaterTargetsAndConnectionsGoAlone)
{
    put_target(1, "a");
    put_target(2, "b");
    put_target(3, "c");
    put("/iscsi/target/count", "3");
    EXPECT_EQ(quiet([&] { return xmldb_del_target_by_name("b"); }), KORV_OK);
    EXPECT_EQ(raw(tpath(2, "iqn")), "");
    EXPECT_EQ(raw("/iscsi/target/count"), "2");
    EXPECT_EQ(raw(tpath(3, "name")), "c");
    EXPECT_EQ(xmldb_check_target_exist("c"), 0);
    EXPECT_EQ(xmldb_check_target_exist("a"), 1);
    EXPECT_EQ(xmldb_check_target_exist(""), 0);  // a plain "no", never a truthy code
    EXPECT_EQ(read_targets(xmldb_get_all_target_conf_lite), "a/1/1");
    EXPECT_EQ(quiet([&] { return xmldb_del_target_by_name("b"); }), ERR_NOT_FOUND);

    // Connection records go alone; the target stays.
    EXPECT_EQ(xmldb_set_target_conn_info("a", 2, "192.0.2.5", "iqn.1994-05.com.example:init"), KORV_OK);
    EXPECT_EQ(raw("/iscsi/target/id:1/conn_info/conn:2/ip"), "192.0.2.5");
    EXPECT_EQ(raw("/iscsi/target/id:1/conn_info/conn:2/iqn"), "iqn.1994-05.com.example:init");
    EXPECT_EQ(xmldb_set_target_conn_info("zz", 1, "x", "y"), ID_ENTRY_NOT_FOUND);
    EXPECT_EQ(xmldb_del_target_conn_info("a"), KORV_OK);
    EXPECT_EQ(raw("/iscsi/target/id:1/conn_info/conn:2/ip"), "");
    EXPECT_EQ(raw(tpath(1, "name")), "a");
}

TEST_F(TargetDelete, RecountCountsAcrossGapsAndRemovesOnlyTheGhostAtCountPlusOne)
{
    // Four targets (1, 2, 4, 6), one of them running; a ghost at 5, another further on.
    const char *status[] = {"Ready", "Inactive", nullptr, "No Existence", "Ready", nullptr, "Ready"};
    for (int n : {1, 2, 4, 6})
        put_target(n, "t" + std::to_string(n));
    for (int n = 1; n <= 7; n++)
        if (status[n - 1])
            put(tpath(n, "status"), status[n - 1]);
    put("/iscsi/target/count", "17");
    std::string out;
    g_korv_debug_level = 1;
    EXPECT_EQ(quiet([&] { return xmldb_update_current_targetcnt(); }, &out), KORV_OK);
    g_korv_debug_level = 0;
    EXPECT_EQ(raw("/iscsi/target/count") + "/" + raw("/iscsi/target/running_count"), "4/1");
    EXPECT_NE(out.find("discover and remove ghost entry at PATH: /iscsi/target/id:5"), std::string::npos) << out;
    EXPECT_EQ(raw(tpath(5, "status")), "");
    EXPECT_EQ(raw(tpath(7, "status")), "Ready");
    EXPECT_EQ(raw(tpath(4, "name")) + raw(tpath(6, "name")), "t4t6");

    // After a middle delete, count + 1 is a real target: its status does not make it a ghost.
    EXPECT_EQ(xmldb_clean_target_conf(), KORV_OK);
    for (int n : {1, 2, 3}) {
        put_target(n, "t" + std::to_string(n));
        put(tpath(n, "status"), "Ready");
    }
    EXPECT_EQ(quiet([] { return xmldb_del_target_by_name("t2"); }), KORV_OK);
    EXPECT_EQ(quiet([] { return xmldb_update_current_targetcnt(); }), KORV_OK);
    EXPECT_EQ(raw(tpath(3, "name")) + raw(tpath(3, "iqn")), "t3iqn.2000-01.com.example:t3");
}

using TargetRead = StoreTest;

TEST_F(TargetRead, LiteReadsNamesAndTagsUpToTheFirstGap)
{
    EXPECT_EQ(read_targets(xmldb_get_all_target_conf_lite), "");
    put_target(1, "a", 3);
    put_target(2, "b", 4);
    put_target(4, "d", 5);
    EXPECT_EQ(read_targets(iscsi_conf_ops.xmldb_get_all_target_conf_lite), "a/3/1 b/4/2");
}

TEST_F(TargetRead, BrokenRecordsAreSkippedAndOnlyADeadServiceFailsTheRead)
{
    // A name too long for the record is never cut (the cut name could be
    // another target's); an unreadable tag costs only its own record.
    put_target(1, "a");
    put_target(2, std::string(CONF_NAME_LEN, 'n'));
    put_target(3, std::string(CONF_NAME_LEN - 1, 'n'));
    put_target(4, "b");
    put(tpath(4, "tpgt"), "");
    put_target(5, "c");
    std::string out;
    const std::string good = "a/1/1 " + std::string(CONF_NAME_LEN - 1, 'n') + "/1/3 c/1/5";
    EXPECT_EQ(read_targets(xmldb_get_all_target_conf_lite, &out), good);
    EXPECT_NE(out.find("get tpgt error"), std::string::npos) << out;
    EXPECT_NE(out.find("/iscsi/target/id:2/name is too long"), std::string::npos) << out;
    EXPECT_EQ(read_targets(xmldb_get_all_target_conf), good);
    target_conf_t *t = target_conf_new();
    EXPECT_EQ(quiet([&] { return xmldb_get_target_conf_by_name(t, raw(tpath(2, "name")).c_str()); }), ERR_PARAM);
    target_conf_free(t);

    db().kill();
    list_t list;
    list_init(&list);
    EXPECT_EQ(quiet([&] { return xmldb_get_all_target_conf_lite(&list); }), ERR_DB_CLIENT);
    EXPECT_EQ(quiet([&] { return xmldb_get_all_target_conf(&list); }), ERR_DB_CLIENT);
    EXPECT_TRUE(list_is_empty(&list));
}

TEST_F(TargetRead, FullReadFillsEveryFieldAndChapOnlyWhenOn)
{
    target_conf_t *t = filled_target("a", 1);
    ASSERT_EQ(xmldb_add_new_target(t), KORV_OK);
    target_conf_free(t);
    put_target(2, "b");
    put(tpath(2, "chap_name"), "stale");  // CHAP off: not read
    put(tpath(2, "status"), "Ready");

    list_t list;
    list_init(&list);
    ASSERT_EQ(xmldb_get_all_target_conf(&list), KORV_OK);
    ASSERT_EQ(list.count, 2);
    auto *a = static_cast<target_conf_t *>(list.head->owner);
    auto *b = static_cast<target_conf_t *>(list.tail->owner);
    EXPECT_STREQ(a->iqn, "iqn.2000-01.com.example:a");
    EXPECT_EQ(a->chap_enable + a->hba_id + a->state, 1);
    EXPECT_EQ(std::string(a->chap_name) + "/" + a->chap_pwd, "user/secret12345678");
    EXPECT_EQ(std::to_string(b->chap_enable) + b->chap_name + "/" + b->status, "0/Ready");
    target_conf_free_list(&list);

    target_conf_t *one = target_conf_new();
    EXPECT_EQ(xmldb_get_target_conf_by_name(one, "b"), KORV_OK);
    EXPECT_EQ(one->dbidx, 2);
    EXPECT_EQ(quiet([&] { return xmldb_get_target_conf_by_name(one, "zz"); }), ERR_NOT_FOUND);
    target_conf_free(one);

    EXPECT_EQ(xmldb_clean_target_conf(), KORV_OK);
    EXPECT_EQ(raw(tpath(1, "name")) + raw("/iscsi/target/count"), "");
}
