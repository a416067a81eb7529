// SPDX-License-Identifier: Apache-2.0
// Mapping LUNs into targets: both sides of a mapping, free LUN numbers, and
// what a failed mapping leaves.
#include <string>

#include <gtest/gtest.h>

#include "common/korvadm_err.h"
#include "common/korvadm_log.h"
#include "config/korvadm_xmldb_conf.h"
#include "tests/config/store_fixture.h"

using korv_test::quiet;
using korv_test::StoreTest;

namespace {

class Mapping : public StoreTest {
protected:
    void SetUp() override
    {
        put_target(1, "t1");
        put_target(2, "t2");
        for (int n = 1; n <= 4; n++)
            put("/iscsi/lun/id:" + std::to_string(n) + "/name", "l" + std::to_string(n));
    }
    // The target's map as "lun_name:lun_num ..." read raw, and the LUN's own record of it.
    static std::string map_of(int t)
    {
        std::string out;
        for (int m = 1; !raw(tpath(t, "map_lun/id:") + std::to_string(m) + "/lun_name").empty(); m++) {
            std::string e = tpath(t, "map_lun/id:") + std::to_string(m);
            out += (out.empty() ? "" : " ") + raw(e + "/lun_name") + ":" + raw(e + "/lun_num");
        }
        return out + " #" + raw(tpath(t, "map_lun/count"));
    }
    static std::string lun_side(int l)
    {
        std::string e = "/iscsi/lun/id:" + std::to_string(l);
        return raw(e + "/target_name") + ":" + raw(e + "/lun_num");
    }
};

}  // namespace

TEST_F(Mapping, BothSidesAgreeThroughMapAndUnmap)
{
    EXPECT_EQ(iscsi_conf_ops.xmldb_add_target_lun_map("t1", "l1", 0), KORV_OK);
    EXPECT_EQ(xmldb_add_target_lun_map("t1", "l2", 1), KORV_OK);
    EXPECT_EQ(xmldb_add_target_lun_map("t1", "l3", 5), KORV_OK);
    EXPECT_EQ(map_of(1), "l1:0 l2:1 l3:5 #3");
    EXPECT_EQ(lun_side(1) + " " + lun_side(3), "t1:0 t1:5");

    int num = -1;
    EXPECT_EQ(xmldb_get_free_lun_num(&num, "t1"), KORV_OK);
    EXPECT_EQ(num, 2);
    EXPECT_EQ(xmldb_get_free_lun_num(&num, "t2"), KORV_OK);
    EXPECT_EQ(num, 0);
    char target[CONF_NAME_LEN];
    EXPECT_EQ(xmldb_get_mapping_target(target, sizeof target, &num, "l3"), KORV_OK);
    EXPECT_EQ(std::string(target) + ":" + std::to_string(num), "t1:5");

    list_t list;
    list_init(&list);
    ASSERT_EQ(xmldb_get_target_map_lun_conf("t1", &list), KORV_OK);
    std::string got;
    for (target_map_lun_conf_t *m : korv::list_records<target_map_lun_conf_t>(&list))
        got += std::string(m->target_name) + "/" + m->lun_name + "/" + std::to_string(m->lun_num) + " ";
    EXPECT_EQ(got, "t1/l1/0 t1/l2/1 t1/l3/5 ");
    target_map_lun_conf_free_list(&list);

    // Unmapping the first keeps the later ones visible to every map reader.
    EXPECT_EQ(xmldb_del_target_lun_map("t1", "l1"), KORV_OK);
    EXPECT_EQ(map_of(1), "l3:5 l2:1 #2");
    EXPECT_EQ(lun_side(1), ":0");
    EXPECT_EQ(xmldb_get_free_lun_num(&num, "t1"), KORV_OK);
    EXPECT_EQ(num, 0);
    EXPECT_EQ(quiet([] { return xmldb_del_target_lun_map("t1", "l1"); }), ERR_NOT_FOUND);
}

TEST_F(Mapping, RefusesUnknownOrEmptyNamesAndAFullMap)
{
    struct {
        int rc;
        const char *target, *lun, *message;
    } cases[] = {
        {ERR_PARAM, "", "l1", "target_name error"},
        {ERR_PARAM, "t1", "", "lun_name error"},
        {ERR_NOT_FOUND, "t9", "l1", "can not find t9 in xmldb target entry"},
        {ERR_NOT_FOUND, "t1", "l9", "can not find l9 in xmldb lun entry"},
    };
    g_korv_debug_level = 2;
    for (const auto &c : cases) {
        std::string out;
        EXPECT_EQ(quiet([&] { return xmldb_add_target_lun_map(c.target, c.lun, 0); }, &out), c.rc) << c.message;
        EXPECT_NE(out.find(c.message), std::string::npos) << out;
    }
    g_korv_debug_level = 0;
    EXPECT_EQ(map_of(1) + lun_side(1), " #:");

    for (int m = 1; m <= 128; m++)
        put(tpath(2, "map_lun/id:") + std::to_string(m) + "/lun_name", "x");
    std::string out;
    EXPECT_EQ(quiet([] { return xmldb_add_target_lun_map("t2", "l1", 0); }, &out), ERR_NO_ROOM);
    EXPECT_NE(out.find("the Maximum number of target lun has reached"), std::string::npos) << out;
    EXPECT_EQ(lun_side(1), ":");
}
