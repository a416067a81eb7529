// SPDX-License-Identifier: Apache-2.0
// Targets: add, the field operations by name, connection records, and the
// record readers.
#include <cstring>
#include <utility>

#include "tests/config/store_fixture.h"

using namespace korv_test;

using Targets = StoreTest;

TEST_F(Targets, AddWritesEveryFieldButCredentialsOnlyWithChapOn)
{
    target_ptr t = new_target("t1", 1);
    t->tpgt = 3;
    t->hba_id = 7;
    ASSERT_EQ(xmldb_add_new_target(t.get()), KORV_OK);
    EXPECT_EQ(t->dbidx, 1);
    t = new_target("t2", 0);  // credentials left in the record must not be written
    ASSERT_EQ(xmldb_add_new_target(t.get()), KORV_OK);
    EXPECT_EQ(dump("/iscsi"), data("targets_added.txt"));
}

TEST_F(Targets, AddRefusesInvalidRecordsBeforeAnyWrite)
{
    const std::pair<const char *, void (*)(target_conf_t *)> cases[] = {
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
    for (const auto &[message, spoil] : cases) {
        target_ptr t = new_target("bad");
        spoil(t.get());
        EXPECT_EQ(logged([&] { return xmldb_add_new_target(t.get()); }, message), ERR_PARAM);
    }
    EXPECT_EQ(raw(tpath(1, "name")) + raw("/iscsi/target/count"), "");
    EXPECT_EQ(quiet([&] { return xmldb_add_new_target(nullptr); }), ERR_PARAM);
}

using NamedTargets = SampleStore;

TEST_F(NamedTargets, FieldsAreReadAndWrittenByNameIncludingChapAndConnections)
{
    int v = 0;
    EXPECT_EQ(slash(xmldb_get_target_tpgt(&v, "t2"), v), "0/5");
    EXPECT_EQ(xmldb_set_target_state(9, "t2"), KORV_OK);
    EXPECT_EQ(xmldb_set_target_hba_id(11, "t1"), KORV_OK);
    EXPECT_EQ(xmldb_set_target_status("Ready", "t1"), KORV_OK);
    EXPECT_EQ(xmldb_set_target_iqn("iqn.2000-01.com.example:new", "t1"), KORV_OK);
    EXPECT_EQ(slash(raw(tpath(2, "state")), raw(tpath(1, "hba_id")), raw(tpath(1, "status"))), "9/11/Ready");
    char buf[CONF_IQN_LEN];
    EXPECT_EQ(slash(xmldb_get_target_iqn(buf, sizeof buf, "t1"), buf), "0/iqn.2000-01.com.example:new");

    // A missing name is "not found" except for the IQN, which reports a parameter error.
    EXPECT_EQ(quiet([&] { return xmldb_set_target_state(1, "t9"); }), ERR_NOT_FOUND);
    EXPECT_EQ(quiet([&] { return xmldb_get_target_iqn(buf, sizeof buf, "t9"); }), ERR_PARAM);
    EXPECT_EQ(logged([&] { return xmldb_get_target_status(buf, CONF_NAME_LEN - 1, "t1"); },
                     "parameter length error"),
              ERR_PARAM);
    put(tpath(2, "tpgt"), "");
    EXPECT_EQ(quiet([&] { return xmldb_get_target_tpgt(&v, "t2"); }), ERR_INT_VALUE);

    // CHAP on writes the credentials, connection records go in beside them;
    // CHAP off clears them, a bad switch writes nothing, the connection
    // records go alone.
    EXPECT_EQ(xmldb_set_target_chap(1, "u", "pw", "t1"), KORV_OK);
    EXPECT_EQ(xmldb_set_target_conn_info("t1", 2, "192.0.2.5", "iqn.1994-05.com.example:init"), KORV_OK);
    EXPECT_EQ(dump("/iscsi/target/id:1"), data("target_chap_conn.txt"));
    EXPECT_EQ(xmldb_set_target_chap(0, "ignored", "ignored", "t1"), KORV_OK);
    EXPECT_EQ(quiet([&] { return xmldb_set_target_chap(2, "u", "p", "t1"); }), ERR_PARAM);
    EXPECT_EQ(quiet([&] { return xmldb_set_target_chap(1, "u", "p", "nobody"); }), ERR_NOT_FOUND);
    EXPECT_EQ(xmldb_set_target_conn_info("zz", 1, "x", "y"), ID_ENTRY_NOT_FOUND);
    EXPECT_EQ(xmldb_del_target_conn_info("t1"), KORV_OK);
    EXPECT_EQ(dump("/iscsi/target/id:1"), data("target_plain.txt"));
    // "": a plain "no", never a truthy code
    EXPECT_EQ(slash(xmldb_check_target_exist("t1"), xmldb_check_target_exist("")), "1/0");
}

constexpr char kBroken[] = "targets_broken.xml";
using BrokenTargets = LoadedStore<kBroken>;

TEST_F(BrokenTargets, ReadersSkipBrokenRecordsAndFillEveryFieldChapOnlyWhenOn)
{
    // A name too long for the record is never cut (the cut name could be
    // another target's); an unreadable tag costs only its own record; the
    // list ends at the first gap; CHAP credentials are read only when on.
    const std::string good = "a/1/1 " + std::string(CONF_NAME_LEN - 1, 'n') + "/1/3 c/1/5";
    std::string log;
    EXPECT_EQ(records<target_conf_t>(xmldb_get_all_target_conf_lite, target_conf_free_list, KORV_OK, &log), good);
    EXPECT_NE(log.find("/iscsi/target/id:2/name is too long"), std::string::npos) << log;
    EXPECT_EQ(records<target_conf_t>(iscsi_conf_ops.xmldb_get_all_target_conf, target_conf_free_list, KORV_OK, &log),
              good);
    EXPECT_NE(log.find("get target tpgt error"), std::string::npos) << log;

    target_ptr one(target_conf_new(), target_conf_free);
    EXPECT_EQ(slash(xmldb_get_target_conf_by_name(one.get(), "c"), one->iqn, one->chap_name, one->chap_pwd, one->dbidx),
              "0/iqn.2000-01.com.example:c/user/secret12345678/5");
    one.reset(target_conf_new());
    EXPECT_EQ(slash(xmldb_get_target_conf_by_name(one.get(), "a"), one->chap_enable, one->chap_name, one->status),
              "0/0//Ready");
    EXPECT_EQ(quiet([&] { return xmldb_get_target_conf_by_name(one.get(), "zz"); }), ERR_NOT_FOUND);
    EXPECT_EQ(quiet([&] { return xmldb_get_target_conf_by_name(one.get(), raw(tpath(2, "name")).c_str()); }),
              ERR_PARAM);

    EXPECT_EQ(xmldb_clean_target_conf(), KORV_OK);
    EXPECT_EQ(raw(tpath(1, "name")) + raw("/iscsi/target/count"), "");
}
