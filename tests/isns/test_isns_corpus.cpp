// The fuzz target's seed corpus, replayed through the fuzz entry point (so the
// sanitizer pass checks every seed), and the capture that made it.
#include <gtest/gtest.h>

#include <dirent.h>
#include <fstream>
#include <iterator>
#include <string>
#include <vector>

#include "tests/isns/isns_test_util.h"
#include "tests/support/isns_isnsd.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size);

using namespace isns_test;

namespace {

std::vector<std::string> corpus_files()
{
    std::vector<std::string> files;
    if (DIR *d = opendir(KORV_ISNS_CORPUS)) {
        while (dirent *e = readdir(d))
            if (e->d_name[0] != '.')
                files.push_back(std::string(KORV_ISNS_CORPUS) + "/" + e->d_name);
        closedir(d);
    }
    return files;
}

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
    const auto files = corpus_files();
    ASSERT_GE(files.size(), 5u) << "seed corpus missing in " << KORV_ISNS_CORPUS;
    reset_client("127.10.6.1");
    for (const std::string &f : files) {
        std::ifstream in(f, std::ios::binary);
        const std::string data((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
        ASSERT_GE(data.size(), 16u) << f;
        EXPECT_EQ(LLVMFuzzerTestOneInput(reinterpret_cast<const uint8_t *>(data.data()), data.size()), 0);
        EXPECT_EQ(isns_rsp_hdr[0], 0);  // each seed is a whole real response
        EXPECT_EQ(isns_rsp_hdr[1], 1);
    }
}

// Regenerates the corpus from a live isnsd:
//   test_isns_corpus --gtest_also_run_disabled_tests --gtest_filter='*CaptureSeeds'
TEST(IsnsCorpus, DISABLED_CaptureSeeds)
{
    if (!korv_test::isnsd_available())
        GTEST_SKIP() << "isnsd not installed";
    korv_test::isnsd_server srv("127.10.6.2");
    ASSERT_TRUE(srv.start()) << srv.error();
    reset_client("127.10.6.2");
    const char *t1 = "iqn.2026-01.test:nas1.t1";
    std::snprintf(isns_entity_name, sizeof isns_entity_name, "%s", t1);
    isns_iscsi_node *n1 = make_node(t1, 1, {"192.168.1.10", "2001:db8::10"});
    isns_iscsi_node *n2 = make_node("iqn.2026-01.test:nas1.t2", 1, {"192.168.1.10", "2001:db8::10"});
    isns_iscsi_node *bad = make_node("iqn.2026-01.test:nas1.t3", 1, {"192.168.1.99"});
    ASSERT_EQ(register_entity(n1), 0);
    save_seed("reg-entity-rsp");
    ASSERT_EQ(register_node(n2), 0);
    save_seed("reg-node-rsp");
    EXPECT_EQ(register_node(bad), -1);
    save_seed("reg-refused-status3-rsp");
    ASSERT_GE(query_entity(t1), 4);
    save_seed("query-held-rsp");
    ASSERT_EQ(deregister_entity(t1), 0);
    save_seed("dereg-rsp");
    ASSERT_GE(query_entity(t1), 4);
    save_seed("query-gone-rsp");
    isns_iscsi_node_free(n1);
    isns_iscsi_node_free(n2);
    isns_iscsi_node_free(bad);
}
