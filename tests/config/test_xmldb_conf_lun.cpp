// SPDX-License-Identifier: Apache-2.0
// LUNs: add, delete, recount, free device number, the field operations and
// the record readers.
#include <cstring>
#include <string>

#include <gtest/gtest.h>

#include "common/korvadm_err.h"
#include "common/korvadm_log.h"
#include "config/korvadm_xmldb_conf.h"
#include "tests/config/store_fixture.h"

using korv_test::quiet;
using korv_test::StoreTest;

namespace {

lun_conf_t *filled_lun(const std::string &name, uint64_t size = 4096)
{
    lun_conf_t *l = lun_conf_new();
    std::snprintf(l->name, sizeof l->name, "%s", name.c_str());
    std::snprintf(l->uuid, sizeof l->uuid, "vol-%s", name.c_str());
    std::snprintf(l->serial, sizeof l->serial, "sn-%s", name.c_str());
    std::snprintf(l->img_file, sizeof l->img_file, "/mnt/v/%s.img", name.c_str());
    l->size = size;
    l->devid = 3;
    l->prealloc = 1;
    return l;
}

std::string lpath(int id, const char *field)
{
    return "/iscsi/lun/id:" + std::to_string(id) + "/" + field;
}

// The LUNs a list reader hands out, as "name/devid/dbidx" per record.
std::string read_luns(int (*reader)(list_t *), std::string *log = nullptr)
{
    list_t list;
    list_init(&list);
    EXPECT_EQ(quiet([&] { return reader(&list); }, log), KORV_OK);
    std::string out;
    for (lun_conf_t *l : korv::list_records<lun_conf_t>(&list))
        out += std::string(out.empty() ? "" : " ") + l->name + "/" + std::to_string(l->devid) + "/" +
               std::to_string(l->dbidx);
    lun_conf_free_list(&list);
    return out;
}

}  // namespace

using LunAdd = StoreTest;

TEST_F(LunAdd, WritesEveryFieldWithSector512AndVolumeState1)
{
    lun_conf_t *l = filled_lun("l1", 1ULL << 40);
    ASSERT_EQ(iscsi_conf_ops.xmldb_add_new_lun(l), KORV_OK);
    EXPECT_EQ(l->vol_state, 1);
    const char *want[][2] = {{"name", "l1"},      {"uuid", "vol-l1"}, {"serial", "sn-l1"},
                             {"size", "1099511627776"}, {"sector", "512"}, {"devid", "3"},
                             {"prealloc", "1"},   {"img_file", "/mnt/v/l1.img"}, {"vol_state", "1"}};
    for (auto [field, value] : want)
        EXPECT_EQ(raw(lpath(1, field)), value) << field;
    EXPECT_EQ(raw("/iscsi/lun/count"), "1");
    EXPECT_EQ(xmldb_check_lun_exist("l1"), 1);
    EXPECT_EQ(xmldb_check_add_lun("l2"), 0);
    lun_conf_free(l);
}

TEST_F(LunAdd, RefusesInvalidRecordsBeforeAnyWriteAndThe129th)
{
    struct {
        const char *message;
        void (*spoil)(lun_conf_t *);
    } cases[] = {
        {"name is empty", [](lun_conf_t *l) { l->name[0] = '\0'; }},
        {"name is too long", [](lun_conf_t *l) { std::memset(l->name, 'n', sizeof l->name); }},
        {"volume uuid is empty", [](lun_conf_t *l) { l->uuid[0] = '\0'; }},
        {"lun serial is empty", [](lun_conf_t *l) { l->serial[0] = '\0'; }},
        {"size is not given", [](lun_conf_t *l) { l->size = 0; }},
        {"prealloc is wrong", [](lun_conf_t *l) { l->prealloc = 2; }},
    };
    for (const auto &c : cases) {
        lun_conf_t *l = filled_lun("bad");
        c.spoil(l);
        std::string out;
        EXPECT_EQ(quiet([&] { return xmldb_add_new_lun(l); }, &out), ERR_PARAM) << c.message;
        EXPECT_NE(out.find(c.message), std::string::npos) << out;
        lun_conf_free(l);
    }
    EXPECT_EQ(raw(lpath(1, "name")) + raw("/iscsi/lun/count"), "");

    for (int i = 1; i <= 128; i++)
        put(lpath(i, "name"), "l" + std::to_string(i));
    lun_conf_t *l = filled_lun("l129");
    std::string out;
    EXPECT_EQ(quiet([&] { return xmldb_add_new_lun(l); }, &out), ERR_NO_ROOM);
    EXPECT_NE(out.find("the Maximum number of LUNs has reached"), std::string::npos) << out;
    EXPECT_EQ(raw(lpath(129, "name")), "");
    EXPECT_EQ(xmldb_check_add_lun("l129"), ERR_NO_ROOM);
    lun_conf_free(l);
}

using LunFields = StoreTest;

TEST_F(LunFields, EachOperationReadsOrWritesItsOwnFieldOfTheNamedLun)
{
    put(lpath(1, "name"), "a");
    put(lpath(2, "name"), "b");
    EXPECT_EQ(xmldb_set_lun_serial("S", "b"), KORV_OK);
    EXPECT_EQ(xmldb_set_lun_vol_state(2, "b"), KORV_OK);
    EXPECT_EQ(xmldb_set_lun_size(1ULL << 33, "b"), KORV_OK);
    EXPECT_EQ(xmldb_set_lun_alloc_size(77, "b"), KORV_OK);
    EXPECT_EQ(xmldb_set_lun_connect_state(1, "b"), KORV_OK);
    EXPECT_EQ(xmldb_set_lun_prealloc_state(4, "b"), KORV_OK);
    EXPECT_EQ(xmldb_set_lun_prealloc_progress(100, "b"), KORV_OK);
    EXPECT_EQ(xmldb_set_lun_status("Ready", "b"), KORV_OK);
    const char *want[][2] = {{"serial", "S"},       {"vol_state", "2"},      {"size", "8589934592"},
                             {"alloc_size", "77"},  {"connected", "1"},      {"prealloc_state", "4"},
                             {"prealloc_progress", "100"}, {"status", "Ready"}};
    for (auto [field, value] : want) {
        EXPECT_EQ(raw(lpath(2, field)), value) << field;
        EXPECT_EQ(raw(lpath(1, field)), "") << field;
    }
    put(lpath(2, "uuid"), "vol-9");
    put(lpath(2, "img_file"), "/f.img");
    put(lpath(2, "prealloc"), "1");
    std::string got;
    char buf[CONF_NAME_LEN];
    for (auto get : {xmldb_get_lun_uuid, xmldb_get_lun_img_file, xmldb_get_lun_serial, xmldb_get_lun_status}) {
        EXPECT_EQ(get(buf, sizeof buf, "b"), KORV_OK);
        got += std::string(buf) + " ";
    }
    EXPECT_EQ(got, "vol-9 /f.img S Ready ");
    EXPECT_EQ(xmldb_get_lun_img_file(buf, 4, "b"), KORV_OK);
    EXPECT_STREQ(buf, "/f.");  // cut to the caller's buffer
    uint64_t size = 0, alloc = 0;
    EXPECT_EQ(xmldb_get_lun_size(&size, "b") + xmldb_get_lun_alloc_size(&alloc, "b"), KORV_OK);
    EXPECT_EQ(std::to_string(size) + "/" + std::to_string(alloc), "8589934592/77");
    int v = -1;
    got.clear();
    for (auto get : {xmldb_get_lun_vol_state, xmldb_get_lun_connect_state, xmldb_get_lun_prealloc,
                     xmldb_get_lun_prealloc_state}) {
        EXPECT_EQ(get(&v, "b"), KORV_OK);
        got += std::to_string(v);
    }
    EXPECT_EQ(got, "2114");
    EXPECT_EQ(quiet([&] { return xmldb_get_lun_vol_state(&v, "a"); }), ERR_INT_VALUE);
}

TEST_F(LunFields, BadNamesAndBadValuesWriteNothing)
{
    put(lpath(1, "name"), "a");
    std::string out;
    EXPECT_EQ(quiet([] { return xmldb_set_lun_vol_state(1, "zz"); }, &out), ERR_NOT_FOUND);
    EXPECT_NE(out.find("can not find zz in xmldb entry"), std::string::npos) << out;
    EXPECT_EQ(quiet([] { return xmldb_set_lun_size(1, ""); }, &out), ERR_PARAM);
    EXPECT_NE(out.find("lun name error"), std::string::npos) << out;
    char buf[8];
    EXPECT_EQ(quiet([&] { return xmldb_get_lun_serial(buf, sizeof buf, "zz"); }), ERR_NOT_FOUND);

    struct {
        const char *message;
        int (*call)();
    } refused[] = {
        {"vol state error", [] { return xmldb_set_lun_vol_state(-1, "a"); }},
        {"prealloc_state error", [] { return xmldb_set_lun_prealloc_state(-2, "a"); }},
        {"connect state error", [] { return xmldb_set_lun_connect_state(-1, "a"); }},
        {"prealloc_progress error", [] { return xmldb_set_lun_prealloc_progress(101, "a"); }},
        {"prealloc_progress error", [] { return xmldb_set_lun_prealloc_progress(-1, "a"); }},
        {"status error", [] { return xmldb_set_lun_status(nullptr, "a"); }},
    };
    for (const auto &r : refused) {
        EXPECT_EQ(quiet(r.call, &out), ERR_PARAM) << r.message;
        EXPECT_NE(out.find(r.message), std::string::npos) << out;
    }
    for (const char *f : {"vol_state", "prealloc_state", "connected", "prealloc_progress", "status"})
        EXPECT_EQ(raw(lpath(1, f)), "") << f;
    // An empty status clears it.
    put(lpath(1, "status"), "Busy");
    EXPECT_EQ(xmldb_set_lun_status("", "a"), KORV_OK);
    EXPECT_EQ(raw(lpath(1, "status")), "");
}

TEST_F(LunFields, FreeDeviceNumberDeleteAndRecount)
{
    for (auto [n, devid] : {std::pair{1, "0"}, {2, "1"}, {3, "3"}, {4, "-7"}, {5, "5000"}}) {
        put(lpath(n, "name"), "l" + std::to_string(n));
        put(lpath(n, "devid"), devid);
        put(lpath(n, "status"), "Ready");
    }
    int id = -1;
    EXPECT_EQ(quiet([&] { return xmldb_get_free_lun_devid(&id); }), KORV_OK);
    EXPECT_EQ(id, 2);

    // A middle delete leaves a gap; the recount counts across it and keeps
    // the named entry at count + 1, but removes a nameless one with a status.
    put("/iscsi/lun/count", "5");
    EXPECT_EQ(quiet([] { return xmldb_del_lun_by_name("l2"); }), KORV_OK);
    EXPECT_EQ(raw(lpath(2, "devid")) + raw("/iscsi/lun/count"), "4");
    EXPECT_EQ(quiet([] { return xmldb_del_lun_by_name("l2"); }), ERR_NOT_FOUND);
    put(lpath(2, "name"), "l2");
    EXPECT_EQ(quiet([] { return xmldb_del_lun_by_name("l4"); }), KORV_OK);
    EXPECT_EQ(quiet([] { return iscsi_conf_ops.xmldb_update_lun_current_count(); }), KORV_OK);
    EXPECT_EQ(raw("/iscsi/lun/count"), "4");
    EXPECT_EQ(raw(lpath(5, "name")), "l5");
    put(lpath(5, "name"), "");
    put(lpath(4, "status"), "Ready");
    EXPECT_EQ(quiet([] { return xmldb_update_lun_current_count(); }), KORV_OK);
    EXPECT_EQ(raw("/iscsi/lun/count") + raw(lpath(4, "status")), "3");
}

using LunRead = StoreTest;

TEST_F(LunRead, RecordsCarryEveryFieldOrItsUnknownValue)
{
    lun_conf_t *l = filled_lun("a", 8192);
    ASSERT_EQ(xmldb_add_new_lun(l), KORV_OK);
    lun_conf_free(l);
    put(lpath(1, "alloc_size"), "4096");
    put(lpath(1, "prealloc_state"), "2");
    put(lpath(1, "connected"), "1");
    put(lpath(1, "target_name"), "t1");
    put(lpath(1, "lun_num"), "7");
    put(lpath(2, "name"), "bare");
    put(lpath(2, "uuid"), "vol-a");  // shares a's volume

    list_t list;
    list_init(&list);
    ASSERT_EQ(quiet([&] { return xmldb_get_all_lun_conf(&list); }), KORV_OK);
    ASSERT_EQ(list.count, 2);
    auto *a = static_cast<lun_conf_t *>(list.head->owner);
    auto *bare = static_cast<lun_conf_t *>(list.tail->owner);
    EXPECT_EQ(std::string(a->uuid) + "/" + a->serial + "/" + a->img_file + "/" + a->target_name,
              "vol-a/sn-a//mnt/v/a.img/t1");
    EXPECT_EQ(std::to_string(a->size) + "/" + std::to_string(a->alloc_size), "8192/4096");
    EXPECT_EQ(std::to_string(a->devid) + std::to_string(a->prealloc) + std::to_string(a->prealloc_state) +
                  std::to_string(a->vol_state) + std::to_string(a->connected) + std::to_string(a->lun_num),
              "312117");
    EXPECT_EQ(std::to_string(bare->size) + std::to_string(bare->alloc_size) + std::to_string(bare->prealloc), "000");
    for (int unknown : {bare->devid, bare->prealloc_state, bare->vol_state, bare->connected, bare->lun_num})
        EXPECT_EQ(unknown, -1);
    lun_conf_free_list(&list);

    EXPECT_EQ(read_luns(xmldb_get_all_lun_conf_in_crash_conf), "a/3/1 bare/-1/2");
    EXPECT_EQ(read_luns(xmldb_get_all_lun_conf_lite), "a/-1/1 bare/-1/2");

    lun_conf_t *one = lun_conf_new();
    EXPECT_EQ(xmldb_get_lun_conf_by_uuid(one, "vol-a"), KORV_OK);
    EXPECT_EQ(std::string(one->name) + "/" + std::to_string(one->lun_num), "a/7");
    EXPECT_EQ(xmldb_get_lun_conf_by_name(one, "bare"), KORV_OK);
    EXPECT_EQ(std::string(one->name) + "/" + std::to_string(one->dbidx), "bare/2");
    EXPECT_EQ(quiet([&] { return xmldb_get_lun_conf_by_uuid(one, "vol-zz"); }), ERR_NOT_FOUND);
    EXPECT_EQ(quiet([&] { return xmldb_get_lun_conf_by_name(one, "zz"); }), ERR_NOT_FOUND);
    lun_conf_free(one);
}

TEST_F(LunRead, ALongNameIsSkippedNeverCutAndOnlyADeadServiceFailsTheRead)
{
    put(lpath(1, "name"), "a");
    put(lpath(2, "name"), std::string(CONF_NAME_LEN, 'n'));
    put(lpath(3, "name"), "c");
    std::string log;
    EXPECT_EQ(read_luns(xmldb_get_all_lun_conf, &log), "a/-1/1 c/-1/3");
    EXPECT_NE(log.find("/iscsi/lun/id:2/name is too long"), std::string::npos) << log;
    db().kill();
    list_t list;
    list_init(&list);
    for (auto reader : {xmldb_get_all_lun_conf, xmldb_get_all_lun_conf_lite, xmldb_get_all_lun_conf_in_crash_conf})
        EXPECT_EQ(quiet([&] { return reader(&list); }), ERR_DB_CLIENT);
    EXPECT_TRUE(list_is_empty(&list));
}
