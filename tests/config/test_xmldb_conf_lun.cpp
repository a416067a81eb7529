// SPDX-License-Identifier: Apache-2.0
// LUNs: add, the field operations by name and the record readers.
#include <cstring>
#include <utility>

#include "tests/config/store_fixture.h"

using namespace korv_test;

using Luns = StoreTest;

TEST_F(Luns, AddWritesEveryFieldWithSector512AndVolumeState1)
{
    lun_ptr l = new_lun("l1", 1ULL << 40);
    ASSERT_EQ(iscsi_conf_ops.xmldb_add_new_lun(l.get()), KORV_OK);
    EXPECT_EQ(l->vol_state, 1);
    EXPECT_EQ(dump("/iscsi"), data("lun_added.txt"));
    EXPECT_EQ(xmldb_check_lun_exist("l1"), 1);
}

TEST_F(Luns, AddRefusesInvalidRecordsBeforeAnyWrite)
{
    const std::pair<const char *, void (*)(lun_conf_t *)> cases[] = {
        {"name is empty", [](lun_conf_t *l) { l->name[0] = '\0'; }},
        {"name is too long", [](lun_conf_t *l) { std::memset(l->name, 'n', sizeof l->name); }},
        {"volume uuid is empty", [](lun_conf_t *l) { l->uuid[0] = '\0'; }},
        {"lun serial is empty", [](lun_conf_t *l) { l->serial[0] = '\0'; }},
        {"size is not given", [](lun_conf_t *l) { l->size = 0; }},
        {"prealloc is wrong", [](lun_conf_t *l) { l->prealloc = 2; }},
    };
    for (const auto &[message, spoil] : cases) {
        lun_ptr l = new_lun("bad");
        spoil(l.get());
        EXPECT_EQ(logged([&] { return xmldb_add_new_lun(l.get()); }, message), ERR_PARAM);
    }
    EXPECT_EQ(raw(lpath(1, "name")) + raw("/iscsi/lun/count"), "");
}

constexpr char kLunsRead[] = "luns_read.xml";
using LunRecords = LoadedStore<kLunsRead>;

TEST_F(LunRecords, EachFieldOperationReadsOrWritesItsOwnFieldOfTheNamedLun)
{
    int (*const sets[])() = {
        [] { return xmldb_set_lun_serial("S", "bare"); },
        [] { return xmldb_set_lun_vol_state(2, "bare"); },
        [] { return xmldb_set_lun_size(1ULL << 33, "bare"); },
        [] { return xmldb_set_lun_alloc_size(77, "bare"); },
        [] { return xmldb_set_lun_connect_state(1, "bare"); },
        [] { return xmldb_set_lun_prealloc_state(4, "bare"); },
        [] { return xmldb_set_lun_prealloc_progress(100, "bare"); },
        [] { return xmldb_set_lun_status("Ready", "bare"); },
    };
    for (auto set : sets)
        EXPECT_EQ(set(), KORV_OK);
    EXPECT_EQ(dump("/iscsi/lun"), data("luns_fields_set.txt"));
    std::string got;
    char buf[CONF_NAME_LEN];
    for (auto get : {xmldb_get_lun_uuid, xmldb_get_lun_img_file, xmldb_get_lun_serial, xmldb_get_lun_status}) {
        EXPECT_EQ(get(buf, sizeof buf, "a"), KORV_OK);
        got += std::string(buf) + " ";
    }
    EXPECT_EQ(xmldb_get_lun_img_file(buf, 4, "a"), KORV_OK);  // cut to the caller's buffer
    int v = -1;
    for (auto get : {xmldb_get_lun_vol_state, xmldb_get_lun_connect_state, xmldb_get_lun_prealloc,
                     xmldb_get_lun_prealloc_state}) {
        EXPECT_EQ(get(&v, "a"), KORV_OK);
        got += std::to_string(v);
    }
    uint64_t size = 0, alloc = 0;
    EXPECT_EQ(xmldb_get_lun_size(&size, "a") + xmldb_get_lun_alloc_size(&alloc, "a"), KORV_OK);
    EXPECT_EQ(slash(got + buf, size, alloc), "vol-a /mnt/v/a.img sn-a Busy 1112/mn/8192/4096");
    EXPECT_EQ(quiet([&] { return xmldb_get_lun_prealloc(&v, "bare"); }), ERR_INT_VALUE);
}

TEST_F(LunRecords, BadNamesAndBadValuesWriteNothing)
{
    const std::string before = dump("/iscsi/lun");
    char buf[8];
    EXPECT_EQ(logged([] { return xmldb_set_lun_vol_state(1, "zz"); }, "can not find zz in xmldb entry"), ERR_NOT_FOUND);
    EXPECT_EQ(logged([&] { return xmldb_get_lun_serial(buf, 8, "zz"); }, "can not find zz in xmldb lun entry"),
              ERR_NOT_FOUND);
    EXPECT_EQ(logged([] { return xmldb_set_lun_size(1, ""); }, "lun name error"), ERR_PARAM);
    EXPECT_EQ(logged([] { return xmldb_set_lun_vol_state(-1, "a"); }, "vol state error"), ERR_PARAM);
    EXPECT_EQ(logged([] { return xmldb_set_lun_prealloc_state(-2, "a"); }, "prealloc_state error"), ERR_PARAM);
    EXPECT_EQ(logged([] { return xmldb_set_lun_connect_state(-1, "a"); }, "connect state error"), ERR_PARAM);
    EXPECT_EQ(logged([] { return xmldb_set_lun_prealloc_progress(101, "a"); }, "prealloc_progress error"), ERR_PARAM);
    EXPECT_EQ(logged([] { return xmldb_set_lun_prealloc_progress(-1, "a"); }, "prealloc_progress error"), ERR_PARAM);
    EXPECT_EQ(logged([] { return xmldb_set_lun_status(nullptr, "a"); }, "status error"), ERR_PARAM);
    EXPECT_EQ(dump("/iscsi/lun"), before);
    // An empty status clears it.
    EXPECT_EQ(xmldb_set_lun_status("", "a"), KORV_OK);
    EXPECT_EQ(raw(lpath(1, "status")), "");
}

TEST_F(LunRecords, CarryEveryFieldOrItsUnknownValue)
{
    korv::list_owner list(lun_conf_free_list);
    ASSERT_EQ(quiet([&] { return xmldb_get_all_lun_conf(list.get()); }), KORV_OK);
    ASSERT_EQ(list.get()->count, 2);
    auto *a = static_cast<lun_conf_t *>(list.get()->head->owner);
    auto *b = static_cast<lun_conf_t *>(list.get()->tail->owner);
    EXPECT_EQ(slash(a->uuid, a->serial, a->img_file, a->target_name, a->size, a->alloc_size),
              "vol-a/sn-a//mnt/v/a.img/t1/8192/4096");
    EXPECT_EQ(slash(a->devid, a->prealloc, a->prealloc_state, a->vol_state, a->connected, a->lun_num), "3/1/2/1/1/7");
    EXPECT_EQ(slash(b->size, b->alloc_size, b->prealloc, b->devid, b->prealloc_state, b->vol_state, b->connected,
                    b->lun_num),
              "0/0/0/-1/-1/-1/-1/-1");

    EXPECT_EQ(records<lun_conf_t>(xmldb_get_all_lun_conf_in_crash_conf, lun_conf_free_list), "a/3/1 bare/-1/2");
    EXPECT_EQ(records<lun_conf_t>(xmldb_get_all_lun_conf_lite, lun_conf_free_list), "a/-1/1 bare/-1/2");
    lun_ptr one(lun_conf_new(), lun_conf_free);
    EXPECT_EQ(slash(xmldb_get_lun_conf_by_uuid(one.get(), "vol-a"), one->name, one->lun_num), "0/a/7");
    EXPECT_EQ(slash(xmldb_get_lun_conf_by_name(one.get(), "bare"), one->name, one->dbidx), "0/bare/2");
    EXPECT_EQ(quiet([&] { return xmldb_get_lun_conf_by_uuid(one.get(), "vol-zz"); }), ERR_NOT_FOUND);
    EXPECT_EQ(quiet([&] { return xmldb_get_lun_conf_by_name(one.get(), "zz"); }), ERR_NOT_FOUND);
}
