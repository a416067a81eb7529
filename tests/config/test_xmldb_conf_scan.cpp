// SPDX-License-Identifier: Apache-2.0
// The numbered-entry scanner and the counters, the rules every keyed list
// shares (capacity, free numbers, delete, recount, whole-read failure), and
// what the store makes of full tables and of a store another writer corrupted.

#include "tests/config/store_fixture.h"

using namespace korv_test;

constexpr char kScan[] = "scan.xml";
using IdEntryScan = LoadedStore<kScan>;

TEST_F(IdEntryScan, MatchesWholeValuesUpToTheLimitAndAnEmptyKeyHidesTheRest)
{
    int found = -1, free = -1;
    EXPECT_EQ(_search_xmldb_id_entry(&found, "/l", 10, "name", "a"), ID_ENTRY_FOUND);
    EXPECT_EQ(_get_free_xmldb_id_entry(&free, "/l", 10, "name"), ID_ENTRY_FOUND);
    EXPECT_EQ(slash(found, free, _cal_xmldb_id_entry_count("/l", 10, "name")), "1/2/1");
    EXPECT_EQ(_search_xmldb_id_entry(&found, "/l", 10, "name", "c"), ID_ENTRY_NOT_FOUND);
    EXPECT_EQ(found, 0);

    // Whole values only, and never past the limit.
    EXPECT_EQ(_search_xmldb_id_entry(&found, "/m", 10, "name", "ab"), ID_ENTRY_NOT_FOUND);
    EXPECT_EQ(_search_xmldb_id_entry(&found, "/m", 2, "name", "c"), ID_ENTRY_NOT_FOUND);
    EXPECT_EQ(_search_xmldb_id_entry(&found, "/m", 3, "name", "c"), ID_ENTRY_FOUND);
    EXPECT_EQ(slash(_cal_xmldb_id_entry_count("/m", 2, "name"), _get_free_xmldb_id_entry(&free, "/m", 3, "name")),
              slash(2, ID_ENTRY_NOT_FOUND));
    EXPECT_EQ(quiet([&] { return _search_xmldb_id_entry(&found, nullptr, 10, "name", "a"); }), ERR_PARAM);

    // Counters never go below zero; a negative one counts as 0.
    EXPECT_EQ(_xmldb_inc_lun_count() + _xmldb_inc_target_count() + _xmldb_inc_target_lun_map_cnt(3), KORV_OK);
    EXPECT_EQ(raw("/iscsi/lun/count") + raw("/iscsi/target/count") + raw(tpath(3, "map_lun/count")), "111");
    EXPECT_EQ(iscsi_conf_ops.xmldb_update_current_aclcnt(), KORV_OK);
    EXPECT_EQ(raw("/iscsi/acl/count"), "1");
}

namespace {

// The two top-level keyed lists and their operations.
struct KeyedList {
    const char *root;
    int capacity;
    const char *number;  // the field whose free value the list hands out
    int (*add)(const char *name);
    const char *full_message;
    int (*check_add)(const char *name);
    int (*free_number)(int *out);
    int (*del)(const char *name);
    int (*recount)();
};

const KeyedList kLists[] = {
    {"/iscsi/target", 64, "hba_id", [](const char *n) { return xmldb_add_new_target(new_target(n).get()); },
     "the maximum number of targets has reached", xmldb_check_add_target, xmldb_get_free_target_hba_id,
     xmldb_del_target_by_name, xmldb_update_current_targetcnt},
    {"/iscsi/lun", 128, "devid", [](const char *n) { return xmldb_add_new_lun(new_lun(n).get()); },
     "the Maximum number of LUNs has reached", xmldb_check_add_lun, xmldb_get_free_lun_devid, xmldb_del_lun_by_name,
     xmldb_update_lun_current_count},
};

}  // namespace

constexpr char kFullLists[] = "full_lists.xml";
using FullLists = LoadedStore<kFullLists>;

TEST_F(FullLists, RefuseTheNextEntryAndHaveNoFreeNumber)
{
    for (const KeyedList &l : kLists) {
        const std::string next = "e" + std::to_string(l.capacity + 1);
        EXPECT_EQ(logged([&] { return l.add(next.c_str()); }, l.full_message), ERR_NO_ROOM) << l.root;
        EXPECT_EQ(raw(epath(l.root, l.capacity + 1, "name")) + raw(std::string(l.root) + "/count"), "");
        EXPECT_EQ(slash(l.check_add(next.c_str()), l.check_add("e2")), slash(ERR_NO_ROOM, 1));
        int num = 0;
        EXPECT_EQ(slash(quiet([&] { return l.free_number(&num); }), num), slash(ERR_NO_ROOM, -1));
        // A number out of range is ignored, so 2 is free again.
        put(epath(l.root, 3, l.number), std::to_string(l.capacity + 6));
        EXPECT_EQ(slash(quiet([&] { return l.free_number(&num); }), num), "0/2") << l.root;
    }
}

constexpr char kGhosts[] = "ghosts.xml";
using Ghosts = LoadedStore<kGhosts>;

TEST_F(Ghosts, DeleteLeavesAGapAndTheRecountRemovesOnlyANamelessGhostAtCountPlusOne)
{
    g_korv_debug_level = 1;  // the ghost's removal is logged as a detail
    for (const KeyedList &l : kLists)
        EXPECT_EQ(logged(l.recount, "discover and remove ghost entry at PATH: " + std::string(l.root) + "/id:5"),
                  KORV_OK);
    g_korv_debug_level = 0;
    EXPECT_EQ(dump("/iscsi"), data("ghosts_recounted.txt"));
    // After a middle delete, count + 1 is a real entry: its status does not make it a ghost.
    for (const KeyedList &l : kLists) {
        EXPECT_EQ(quiet([&] { return l.del("e2"); }), KORV_OK);
        EXPECT_EQ(raw(std::string(l.root) + "/count"), "3");
        EXPECT_EQ(quiet([&] { return l.check_add("e4"); }), 0);  // hidden behind the gap
        EXPECT_EQ(quiet([&] { return l.del("e2"); }), ERR_NOT_FOUND);
        EXPECT_EQ(quiet(l.recount), KORV_OK);
    }
    EXPECT_EQ(dump("/iscsi"), data("ghosts_deleted.txt"));
}

using Lists = StoreTest;

TEST_F(Lists, OnlyADeadServiceFailsAWholeReadAndNothingIsHandedOut)
{
    db().kill();
    EXPECT_EQ(records<target_conf_t>(xmldb_get_all_target_conf_lite, target_conf_free_list, ERR_DB_CLIENT), "");
    EXPECT_EQ(records<target_conf_t>(xmldb_get_all_target_conf, target_conf_free_list, ERR_DB_CLIENT), "");
    for (auto read : {xmldb_get_all_lun_conf, xmldb_get_all_lun_conf_lite, xmldb_get_all_lun_conf_in_crash_conf})
        EXPECT_EQ(records<lun_conf_t>(read, lun_conf_free_list, ERR_DB_CLIENT), "");
    EXPECT_EQ(records<acl_initiator_conf_t>(xmldb_get_all_acl_initiator_conf_lite, acl_initiator_conf_free_list,
                                            ERR_DB_CLIENT),
              "");
}

constexpr char kHostile[] = "hostile.xml";
using HostileStore = LoadedStore<kHostile>;

TEST_F(HostileStore, CountsAreBoundedAndBrokenRecordsSkippedEverywhere)
{
    // Counts of -5, "abc" and 1000000 under every list, keys too long for
    // their records, a right that is no word: each operation ends with a
    // code, reads only what fits, and hands out the good records.
    EXPECT_EQ(records<lun_conf_t>(xmldb_get_all_lun_conf, lun_conf_free_list), "l1/1000000/1 l3/-1/3");
    EXPECT_EQ(records<target_conf_t>(xmldb_get_all_target_conf, target_conf_free_list), "t1/1/1");
    EXPECT_EQ(records<target_map_lun_conf_t>([](list_t *l) { return xmldb_get_target_map_lun_conf("t1", l); },
                                             target_map_lun_conf_free_list),
              "t1/l1/0");
    EXPECT_EQ(records<lun_acl_conf_t>([](list_t *l) { return xmldb_get_all_lun_acl_conf_from_lun("l1", l); },
                                      lun_acl_conf_free_list),
              "iqn.a/a/2");
    EXPECT_EQ(records<acl_initiator_conf_t>(xmldb_get_all_acl_initiator_conf_lite, acl_initiator_conf_free_list),
              "iqn.a/a/1 iqn.c/" + std::string(127, 'x') + "/3");
    int num = -1, devid = -1;
    EXPECT_EQ(quiet([&] { return xmldb_get_free_lun_num(&num, "t1") + xmldb_get_free_lun_devid(&devid); }), KORV_OK);
    EXPECT_EQ(slash(num, devid), "1/0");

    EXPECT_EQ(quiet([] { return xmldb_set_lun_acl("iqn.new", "n", "l1", 1); }), KORV_OK);
    EXPECT_EQ(quiet([] { return xmldb_update_sess_acl_lun_access_status("iqn.a", "l1", 1); }), KORV_OK);
    EXPECT_EQ(slash(raw(lpath(1, "acl/id:4/initiator")), raw(lpath(1, "acl/count")),
                    raw("/iscsi/sess/initiator/id:1/access_lun/count")),
              "iqn.new/4/1");
    EXPECT_EQ(quiet([] { return xmldb_del_acl_initiator("iqn.a"); }), KORV_OK);
    EXPECT_EQ(raw(lpath(1, "acl/id:1/initiator")), "iqn.new");
    EXPECT_EQ(quiet([] { return xmldb_remove_lun_from_all_acl("l1") + xmldb_update_lun_current_count(); }), KORV_OK);
    EXPECT_EQ(raw("/iscsi/lun/count"), "3");
}

using FullStore = SampleStore;

TEST_F(FullStore, EveryReaderReturnsEveryRecordOfFullTables)
{
    for (int n = 1; n <= 128; n++) {
        const std::string name = "l" + std::to_string(n);
        put(lpath(n, "name"), name);
        ASSERT_EQ(xmldb_add_target_lun_map(n % 2 ? "t1" : "t2", name.c_str(), n / 2), KORV_OK) << n;
        for (const char *i : {"iqn.a", "iqn.b", "iqn.c"})
            ASSERT_EQ(xmldb_set_lun_acl(i, i + 4, name.c_str(), n % 3), KORV_OK) << n;
    }
    for (int a = 4; a <= 129; a++)
        ASSERT_EQ(xmldb_add_acl_initiator(("iqn.n" + std::to_string(a)).c_str(), "n"), KORV_OK) << a;

    korv::list_owner luns(lun_conf_free_list), map(target_map_lun_conf_free_list), acl(lun_acl_conf_free_list),
        initiators(acl_initiator_conf_free_list);
    ASSERT_EQ(xmldb_get_all_lun_conf(luns.get()), KORV_OK);
    ASSERT_EQ(xmldb_get_target_map_lun_conf("t2", map.get()), KORV_OK);
    ASSERT_EQ(xmldb_get_all_lun_acl_conf_from_lun("l128", acl.get()), KORV_OK);
    ASSERT_EQ(xmldb_get_all_acl_initiator_conf_lite(initiators.get()), KORV_OK);
    EXPECT_EQ(slash(luns.get()->count, map.get()->count, acl.get()->count, initiators.get()->count), "128/64/3/129");
    auto *last = static_cast<lun_conf_t *>(luns.get()->tail->owner);
    EXPECT_EQ(slash(last->target_name, last->lun_num, raw("/iscsi/acl/id:2/mapped_lun/count")), "t2/64/128");
}
