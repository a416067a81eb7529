// SPDX-License-Identifier: Apache-2.0
// The fuzz target's seed corpus (responses of Open-iSNS isnsd to a
// registration, a further node, a refused node, queries before and after a
// deregistration, and the deregistration), replayed through the fuzz entry
// point so that the sanitizer pass checks every seed against its invariants.
#include <gtest/gtest.h>

#include <filesystem>

#include "tests/isns/isns_test_util.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size);

TEST(IsnsCorpus, SeedsReplayCleanly)
{
    isns_test::reset_client("127.10.6.1");
    size_t seeds = 0;
    for (const auto &f : std::filesystem::directory_iterator(KORV_ISNS_CORPUS)) {
        std::ifstream in(f.path(), std::ios::binary);
        const std::string data((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
        EXPECT_EQ(LLVMFuzzerTestOneInput(reinterpret_cast<const uint8_t *>(data.data()), data.size()), 0);
        EXPECT_EQ(isns_rsp_hdr[1], 1) << f << " is a whole response";  // its version was read
        ++seeds;
    }
    EXPECT_GE(seeds, 5u) << "seed corpus missing in " << KORV_ISNS_CORPUS;
}
