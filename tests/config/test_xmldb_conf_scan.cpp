// SPDX-License-Identifier: Apache-2.0
// The numbered-entry scanner and the counters, and what they make of a
// store another writer corrupted.
#include <string>

#include <gtest/gtest.h>

#include "common/korvadm_err.h"
#include "config/korvadm_xmldb_conf.h"
#include "config/korvadm_xmldb_conf_internal.h"
#include "tests/config/store_fixture.h"

using korv_test::quiet;
using korv_test::StoreTest;

using IdEntryScan = StoreTest;

TEST_F(IdEntryScan, MatchesWholeValuesUpToTheLimitAndAnEmptyKeyHidesTheRest)
{
    put("/l/id:1/name", "a");
    put("/l/id:2/name", "");
    put("/l/id:3/name", "c");
    int id = -1;
    EXPECT_EQ(_search_xmldb_id_entry(&id, "/l", 10, "name", "a"), ID_ENTRY_FOUND);
    EXPECT_EQ(id, 1);
    EXPECT_EQ(_search_xmldb_id_entry(&id, "/l", 10, "name", "c"), ID_ENTRY_NOT_FOUND);
    EXPECT_EQ(id, 0);
    EXPECT_EQ(_cal_xmldb_id_entry_count("/l", 10, "name"), 1);
    EXPECT_EQ(_get_free_xmldb_id_entry(&id, "/l", 10, "name"), ID_ENTRY_FOUND);
    EXPECT_EQ(id, 2);

    // Whole values only, and never past the limit.
    put("/l/id:2/name", "abc");
    EXPECT_EQ(_search_xmldb_id_entry(&id, "/l", 10, "name", "ab"), ID_ENTRY_NOT_FOUND);
    EXPECT_EQ(_search_xmldb_id_entry(&id, "/l", 2, "name", "c"), ID_ENTRY_NOT_FOUND);
    EXPECT_EQ(_search_xmldb_id_entry(&id, "/l", 3, "name", "c"), ID_ENTRY_FOUND);
    EXPECT_EQ(_cal_xmldb_id_entry_count("/l", 2, "name"), 2);
    EXPECT_EQ(_get_free_xmldb_id_entry(&id, "/l", 3, "name"), ID_ENTRY_NOT_FOUND);
    EXPECT_EQ(quiet([&] { return _search_xmldb_id_entry(&id, nullptr, 10, "name", "a"); }), ERR_PARAM);
}

TEST_F(IdEntryScan, CountersNeverGoBelowZeroAndAclRecountStopsAtAGap)
{
    put("/iscsi/lun/count", "-5");  // a negative count counts as 0
    EXPECT_EQ(_xmldb_inc_lun_count(), KORV_OK);
    EXPECT_EQ(raw("/iscsi/lun/count"), "1");
    EXPECT_EQ(_xmldb_dec_target_count(), KORV_OK);
    EXPECT_EQ(_xmldb_inc_target_count(), KORV_OK);
    EXPECT_EQ(_xmldb_inc_target_count(), KORV_OK);
    EXPECT_EQ(_xmldb_inc_target_lun_map_cnt(3), KORV_OK);
    EXPECT_EQ(raw("/iscsi/target/count") + raw("/iscsi/target/id:3/map_lun/count"), "21");

    put("/iscsi/acl/id:1/initiator", "iqn.a");
    put("/iscsi/acl/id:2/initiator", "iqn.b");
    put("/iscsi/acl/id:4/initiator", "iqn.d");
    EXPECT_EQ(iscsi_conf_ops.xmldb_update_current_aclcnt(), KORV_OK);
    EXPECT_EQ(raw("/iscsi/acl/count"), "2");
}

namespace {

// Names of a list reader's records, in order.
template <class T>
std::string names(int (*reader)(list_t *), void (*free_list)(list_t *), char (T::*field)[sizeof(T::name)])
{
    list_t list;
    list_init(&list);
    EXPECT_EQ(quiet([&] { return reader(&list); }), KORV_OK);
    std::string out;
    for (T *r : korv::list_records<T>(&list))
        out += std::string(r->*field) + " ";
    free_list(&list);
    return out;
}

class HostileStore : public StoreTest {
protected:
    HostileStore() : StoreTest(korv_test::data_file("hostile.xml")) {}
};

}  // namespace

TEST_F(HostileStore, CountsAreBoundedAndBrokenRecordsSkippedEverywhere)
{
    // Counts of -5, "abc" and 1000000 under every list, keys too long for
    // their records, a right that is no word: each operation ends with a
    // code, reads only what fits, and hands out the good records.
    EXPECT_EQ(names<lun_conf_t>(xmldb_get_all_lun_conf, lun_conf_free_list, &lun_conf_t::name), "l1 l3 ");
    EXPECT_EQ(names<target_conf_t>(xmldb_get_all_target_conf, target_conf_free_list, &target_conf_t::name), "t1 ");
    list_t list;
    list_init(&list);
    ASSERT_EQ(quiet([&] { return xmldb_get_target_map_lun_conf("t1", &list); }), KORV_OK);
    EXPECT_EQ(list.count, 1);
    target_map_lun_conf_free_list(&list);
    ASSERT_EQ(quiet([&] { return xmldb_get_all_lun_acl_conf_from_lun("l1", &list); }), KORV_OK);
    ASSERT_EQ(list.count, 1);
    EXPECT_STREQ(static_cast<lun_acl_conf_t *>(list.head->owner)->initiator, "iqn.a");
    lun_acl_conf_free_list(&list);
    ASSERT_EQ(quiet([&] { return xmldb_get_all_acl_initiator_conf_lite(&list); }), KORV_OK);
    ASSERT_EQ(list.count, 2);
    EXPECT_EQ(std::string(static_cast<acl_initiator_conf_t *>(list.tail->owner)->alias), std::string(127, 'x'));
    acl_initiator_conf_free_list(&list);

    int num = -1;
    EXPECT_EQ(quiet([&] { return xmldb_get_free_lun_num(&num, "t1"); }), KORV_OK);
    EXPECT_EQ(num, 1);
    EXPECT_EQ(quiet([&] { return xmldb_get_free_lun_devid(&num); }), KORV_OK);
    EXPECT_EQ(num, 0);
    EXPECT_EQ(quiet([] { return xmldb_set_lun_acl("iqn.new", "n", "l1", 1); }), KORV_OK);
    EXPECT_EQ(raw("/iscsi/lun/id:1/acl/id:4/initiator") + raw("/iscsi/lun/id:1/acl/count"), "iqn.new4");
    EXPECT_EQ(quiet([] { return xmldb_update_sess_acl_lun_access_status("iqn.a", "l1", 1); }), KORV_OK);
    EXPECT_EQ(raw("/iscsi/sess/initiator/id:1/access_lun/count"), "1");
    EXPECT_EQ(quiet([] { return xmldb_del_acl_initiator("iqn.a"); }), KORV_OK);
    EXPECT_EQ(raw("/iscsi/lun/id:1/acl/id:1/initiator"), "iqn.new");
    EXPECT_EQ(quiet([] { return xmldb_remove_lun_from_all_acl("l1"); }), KORV_OK);
    EXPECT_EQ(quiet([] { return xmldb_update_lun_current_count(); }), KORV_OK);
    EXPECT_EQ(raw("/iscsi/lun/count"), "3");
}

using FullStore = StoreTest;

TEST_F(FullStore, EveryReaderReturnsEveryRecordOfFullTables)
{
    put_target(1, "t1");
    put_target(2, "t2");
    for (int n = 1; n <= 128; n++) {
        const std::string name = "l" + std::to_string(n);
        put("/iscsi/lun/id:" + std::to_string(n) + "/name", name);
        ASSERT_EQ(xmldb_add_target_lun_map(n % 2 ? "t1" : "t2", name.c_str(), n / 2), KORV_OK) << n;
        for (const char *i : {"iqn.a", "iqn.b", "iqn.c"})
            ASSERT_EQ(xmldb_set_lun_acl(i, i + 4, name.c_str(), n % 3), KORV_OK) << n;
    }
    for (int a = 4; a <= 129; a++)
        ASSERT_EQ(xmldb_add_acl_initiator(("iqn.n" + std::to_string(a)).c_str(), "n"), KORV_OK) << a;

    list_t list;
    list_init(&list);
    ASSERT_EQ(xmldb_get_all_lun_conf(&list), KORV_OK);
    ASSERT_EQ(list.count, 128);
    auto *last = static_cast<lun_conf_t *>(list.tail->owner);
    EXPECT_EQ(std::string(last->target_name) + ":" + std::to_string(last->lun_num), "t2:64");
    lun_conf_free_list(&list);
    ASSERT_EQ(xmldb_get_target_map_lun_conf("t2", &list), KORV_OK);
    EXPECT_EQ(list.count, 64);
    target_map_lun_conf_free_list(&list);
    ASSERT_EQ(xmldb_get_all_lun_acl_conf_from_lun("l128", &list), KORV_OK);
    EXPECT_EQ(list.count, 3);
    lun_acl_conf_free_list(&list);
    ASSERT_EQ(xmldb_get_all_acl_initiator_conf_lite(&list), KORV_OK);
    EXPECT_EQ(list.count, 129);
    acl_initiator_conf_free_list(&list);
    EXPECT_EQ(raw("/iscsi/acl/id:2/mapped_lun/count"), "128");
}
