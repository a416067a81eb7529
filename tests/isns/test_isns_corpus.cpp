// The fuzz target's seed corpus, replayed through the fuzz entry point (so the
// sanitizer pass checks every seed), and the capture that made it.
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <functional>
#include <iterator>
#include <string>

#include "tests/isns/isns_test_util.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size);

using namespace isns_test;

namespace {

// Saves the last response (header and single-PDU payload) as a seed.
void save_seed(const char *name)
{
    const size_t n = (size_t{isns_rsp_hdr[4]} << 8) | isns_rsp_hdr[5];
    std::ofstream out(std::string(KORV_ISNS_CORPUS) + "/" + name, std::ios::binary);
    out.write(reinterpret_cast<const char *>(isns_rsp_hdr), 12);
    out.write(reinterpret_cast<const char *>(isns_pdu_buf), static_cast<std::streamsize>(n));
}

}  // namespace

TEST(IsnsCorpus, SeedsReplayCleanly)
{
    reset_client("127.10.6.1");
    size_t seeds = 0;
    for (const auto &f : std::filesystem::directory_iterator(KORV_ISNS_CORPUS)) {
        ++seeds;
        std::ifstream in(f.path(), std::ios::binary);
        const std::string data((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
        ASSERT_GE(data.size(), 16u) << f;
        EXPECT_EQ(LLVMFuzzerTestOneInput(reinterpret_cast<const uint8_t *>(data.data()), data.size()), 0);
        EXPECT_EQ(isns_rsp_hdr[0], 0);  // each seed is a whole real response
        EXPECT_EQ(isns_rsp_hdr[1], 1);
    }
    EXPECT_GE(seeds, 5u) << "seed corpus missing in " << KORV_ISNS_CORPUS;
}

// Regenerates the corpus from a live isnsd:
//   test_isns_corpus --gtest_also_run_disabled_tests --gtest_filter='*CaptureSeeds'
TEST(IsnsCorpus, DISABLED_CaptureSeeds)
{
    const char *t1 = "iqn.2026-01.test:nas1.t1";
    START_ISNSD(srv, "127.10.6.2", AF_INET, t1);
    isns_iscsi_node *n1 = make_node(t1, 1, {"192.168.1.10", "2001:db8::10"});
    isns_iscsi_node *n2 = make_node("iqn.2026-01.test:nas1.t2", 1, {"192.168.1.10", "2001:db8::10"});
    isns_iscsi_node *bad = make_node("iqn.2026-01.test:nas1.t3", 1, {"192.168.1.99"});
    const std::pair<const char *, std::function<bool()>> steps[] = {
        {"reg-entity-rsp", [&] { return register_entity(n1) == 0; }},
        {"reg-node-rsp", [&] { return register_node(n2) == 0; }},
        {"reg-refused-status3-rsp", [&] { return register_node(bad) == -1; }},
        {"query-held-rsp", [&] { return query_entity(t1) >= 4; }},
        {"dereg-rsp", [&] { return deregister_entity(t1) == 0; }},
        {"query-gone-rsp", [&] { return query_entity(t1) >= 4; }},
    };
    for (const auto &[seed, step] : steps) {
        EXPECT_TRUE(step()) << seed;
        save_seed(seed);
    }
    for (isns_iscsi_node *n : {n1, n2, bad})
        isns_iscsi_node_free(n);
}
