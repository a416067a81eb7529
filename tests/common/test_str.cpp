// SPDX-License-Identifier: Apache-2.0
// The shared text helpers (the bounded copy, the shell escaping, the pipe
// reader) and the argument guard.
#include "common/korvadm_str.h"

#include <csignal>
#include <cstring>
#include <string>
#include <tuple>
#include <vector>

#include <gtest/gtest.h>

#include "common/korvadm_err.h"
#include "tests/support/process.h"

namespace {

TEST(CopyBounded, CutsTerminatesSaysWhetherAllFittedAndNeverReadsPastAField)
{
    const std::tuple<const char *, const char *, bool> cases[] = {
        {"abc", "abc", true}, {"abcd", "abc", false}, {"", "", true}, {nullptr, "", true}};
    for (const auto &[src, want, fitted] : cases) {
        char dst[4] = {'x', 'x', 'x', 'x'};
        EXPECT_EQ(korv::copy_bounded(dst, src), fitted) << (src ? src : "NULL");
        EXPECT_STREQ(dst, want);
    }
    char none[1] = {'x'};
    EXPECT_FALSE(korv::copy_bounded(none, 0, "a"));
    EXPECT_EQ(none[0], 'x');

    // A field without its terminator, followed by other bytes.
    struct {
        char field[4], guard[4];
    } rec = {{'w', 'x', 'y', 'z'}, "BAD"};
    char dst[4];
    EXPECT_FALSE(korv::copy_bounded(dst, rec.field));
    EXPECT_STREQ(dst, "wxy");
    EXPECT_EQ(korv::field_str(rec.field), "wxyz");
}

TEST(ShellEscape, BackslashesExactlyTheCharactersLiveInDoubleQuotes)
{
    EXPECT_EQ(korv::shell_escape(std::string_view("a$b\"c\\d`e 'f' ;|&")), "a\\$b\\\"c\\\\d\\`e 'f' ;|&");
    std::string out = "kept";
    EXPECT_FALSE(korv::shell_escape(nullptr, out));
    EXPECT_EQ(out, "kept");
    EXPECT_TRUE(korv::shell_escape("$(id)", out));
    EXPECT_EQ(out, "\\$(id)");
}

TEST(ReadCommandLines, LineByLineWithTheExitStatus)
{
    // Collects lines from an empty list on, asking for no more after n.
    std::vector<std::string> lines;
    auto upto = [&lines](size_t n) {
        lines.clear();
        return [&lines, n](std::string_view line) {
            lines.emplace_back(line);
            return lines.size() < n;
        };
    };
    EXPECT_EQ(korv::read_command_lines("printf 'a b\\n\\nlast'; exit 3", upto(9)), 3);
    EXPECT_EQ(lines, (std::vector<std::string>{"a b", "", "last"}));
    // Stopping early leaves the rest unread; the status still comes back.
    const int status = korv::read_command_lines("seq 1 100000", upto(1));
    EXPECT_EQ(lines, (std::vector<std::string>{"1"}));
    EXPECT_TRUE(status == 0 || status == 128 + SIGPIPE) << status;
    // An endless line comes in bounded pieces, so the reader can stop it.
    EXPECT_EQ(korv::read_command_lines("yes x | tr -d '\\n'", upto(2)), 128 + SIGPIPE);
    EXPECT_EQ(lines, std::vector<std::string>(2, std::string(korv::kCommandLineMax, 'x')));
    EXPECT_EQ(korv::read_command_lines(nullptr, upto(1)), -1);
}

int guarded(const char *name, int n)
{
    PARAM_GUARD(!name);
    PARAM_GUARD(n < 0, "bad n = %d", n);
    return 0;
}

TEST(ParamGuard, LogsUnderTheOperationAndAnswersParameterError)
{
    std::string out;
    EXPECT_EQ(korv_test::quiet([] { return guarded(nullptr, 1); }, &out), ERR_PARAM);
    EXPECT_NE(out.find(":guarded:"), std::string::npos) << out;
    EXPECT_NE(out.find("parameter error\n"), std::string::npos) << out;
    EXPECT_EQ(korv_test::quiet([] { return guarded("t", -2); }, &out), ERR_PARAM);
    EXPECT_NE(out.find("bad n = -2\n"), std::string::npos) << out;
    EXPECT_EQ(guarded("t", 0), 0);
}

}  // namespace
