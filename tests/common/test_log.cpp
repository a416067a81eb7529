// SPDX-License-Identifier: Apache-2.0
// The logging statement: exact prefix and message, and the debug-level filter.
#include "common/korvadm_log.h"

#include <unistd.h>

#include <cstdio>
#include <tuple>
#include <utility>

#include <gtest/gtest.h>

#include "tests/support/process.h"

using korv_test::capture_stdout;

namespace {

class LogTest : public ::testing::Test {
protected:
    void TearDown() override { g_korv_debug_level = saved_; }
    int saved_ = std::exchange(g_korv_debug_level, 0);
};

TEST_F(LogTest, PrefixIsUnitFunctionLineAndTheMessageIsKeptAsIs)
{
    // (The unit is the file name without directory and extension: the flush case.)
    // A format ending in a newline leaves an empty line.
    EXPECT_EQ(capture_stdout([] { korv_log(0, "u.cpp", "f", 1, "Error unknown access right = %d\n", 9); }),
              "(u:f:1):Error unknown access right = 9\n\n");
}

TEST_F(LogTest, NothingAtAllAboveTheDebugLevelAndANegativeLevelSilencesErrorsToo)
{
    // The debug level, a statement's level, whether it shows.
    const std::tuple<int, int, bool> cases[] = {
        {1, 2, false}, {1, 4, false}, {1, 1, true}, {1, 0, true}, {-1, 0, false}};
    for (const auto &[debug_level, level, shown] : cases) {
        g_korv_debug_level = debug_level;
        EXPECT_EQ(capture_stdout([l = level] { DBG(l, "shown %s", "x"); }).empty(), !shown)
            << debug_level << " " << level;
    }
}

TEST_F(LogTest, StatementsFlushEvenWhenNothingPrints)
{
    // Raw writes to the descriptor (as a child shell's would be) must land
    // after whatever stdio held before the statement.
    std::string out = capture_stdout([] {
        std::printf("pending");
        DBG(3, "hidden");
        (void)!write(1, "|", 1);
        DBG(0, "shown %d", 2);
        (void)!write(1, "|", 1);
    });
    EXPECT_EQ(out, "pending|(test_log:operator():" + std::to_string(__LINE__ - 3) + "):shown 2\n|");
}

}  // namespace
