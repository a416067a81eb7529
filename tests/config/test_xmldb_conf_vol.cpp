// SPDX-License-Identifier: Apache-2.0
// The per-volume summaries under "/iscsi/lun/total_size": lookup by UUID and
// the rewrite from a volume list, checked against whole dumps of the store.
#include <sstream>

#include "common/korvadm_sys.h"
#include "tests/config/store_fixture.h"

using namespace korv_test;

namespace {

constexpr char kBefore[] = "vol_summaries_before.xml";

class VolSummaries : public LoadedStore<kBefore> {
protected:
    void SetUp() override
    {
        std::istringstream vols(data("vol_summaries_volumes.txt"));
        for (std::string l; std::getline(vols, l);) {
            vol_info_t *v = vol_info_new();
            ASSERT_NE(v, nullptr);
            std::istringstream(l) >> v->uuid >> v->mnt_path >> v->vol_size >> v->alloc_size >> v->claim_alloc_size >>
                v->free_size >> v->claim_free_size >> v->keep_figures;
            list_append(&v->node, vols_.get());
        }
    }
    korv::list_owner vols_{vol_info_free_list};
};

TEST_F(VolSummaries, FoundByUuid)
{
    EXPECT_EQ(xmldb_get_vol_lun_info_idx_by_uuid("u-b"), 2);
    EXPECT_EQ(quiet([] { return xmldb_get_vol_lun_info_idx_by_uuid("u-x"); }), -1);
    EXPECT_EQ(quiet([] { return xmldb_get_vol_lun_info_idx_by_uuid(nullptr); }), ERR_PARAM);
    put("/iscsi/lun/total_size/count", "5");  // entry 5 is missing
    EXPECT_EQ(quiet([] { return xmldb_get_vol_lun_info_idx_by_uuid("u-x"); }), ERR_DB_WRITE);
    put("/iscsi/lun/total_size/count", "");
    EXPECT_EQ(quiet([] { return xmldb_get_vol_lun_info_idx_by_uuid("u-a"); }), -1);
}

TEST_F(VolSummaries, RewriteKeepsStoredAllocationsAndTotals)
{
    EXPECT_EQ(quiet([&] { return iscsi_conf_ops.xmldb_update_total_vol_size_info(vols_.get()); }), 0);
    EXPECT_EQ(dump("/iscsi/lun"), data("vol_summaries_after.txt"));
    vol_info_free_list(vols_.get());
    EXPECT_EQ(quiet([&] { return xmldb_update_total_vol_size_info(vols_.get()); }), 0);
    EXPECT_EQ(dump("/iscsi/lun"), data("vol_summaries_empty.txt"));
}

TEST_F(VolSummaries, FailingWritesGiveUpAfterThreeAttempts)
{
    db().stop();
    std::string log;
    EXPECT_EQ(quiet([&] { return xmldb_update_total_vol_size_info(vols_.get()); }, &log), ERR_DB_WRITE);
    const std::string attempt = "xmldbc_set(/iscsi/lun/total_size/id:1/uuid) failed \n";
    int attempts = 0;
    for (size_t at = log.find(attempt); at != std::string::npos; at = log.find(attempt, at + 1))
        attempts++;
    EXPECT_EQ(attempts, 3) << log;
}

}  // namespace
