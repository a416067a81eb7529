// SPDX-License-Identifier: Apache-2.0
// configfs attribute I/O on plain files: line ends, buffer bounds, values
// that must reach the file exactly and never run, and the read-back.
#include <fcntl.h>
#include <thread>
#include <vector>

#include "tests/kernel/lio4_test.h"

namespace {

using Lio4Test = korv_test::Lio4Test;

TEST_F(Lio4Test, ReadStripsOneLineEndNearTheEndAndStaysInsideTheBuffer)
{
    std::string path = at("/attr");
    struct {
        const char *text;
        size_t size;
        const char *want;
    } cases[] = {
        {"1\n", 64, "1"},
        {"ab\ncdefghijkl", 64, "ab\ncdefghijkl"},  // newline 11 characters from the end stays
        {"ab\ncdefghijk", 64, "ab"},               // ... at 10 it goes
        {"\n", 64, "\n"},                          // the first character is never stripped
        {"", 64, ""},
        {"CHAP,None\n", 5, "CHAP"},
        // A verified write's read-back (value plus one): the kernel's own
        // line end is the one stripped, not one inside the value.
        {"a\nbc\n", 5, "a\nbc"},
        {"\n", 1, ""},
    };
    for (auto &c : cases) {
        write_file(path, c.text);
        std::vector<char> buf(c.size, 'Z');  // heap, so the sanitizer sees an overrun
        ASSERT_EQ(configfs_read_attr_str(path.c_str(), buf.data(), c.size), 0) << c.text;
        EXPECT_EQ(std::string(buf.data()), c.want) << c.text << " in " << c.size;
    }
    int v = -5;
    write_file(path, "");
    EXPECT_EQ(configfs_read_attr_int(path.c_str(), &v), ERR_ATTR_EMPTY);
    EXPECT_EQ(configfs_read_attr_int(at("/missing").c_str(), &v), ERR_CONFIGFS);
}

TEST_F(Lio4Test, WritesKeepTheValueExactNeverRunItAndVerifyTheReadBack)
{
    std::string canary = at("/CANARY");
    const std::string values[] = {
        "x\"; touch " + canary + "; echo \"", "$(touch " + canary + ")", "`touch " + canary + "`",
        "a\\tb\\c", "100%s %d", "-n", "",
    };
    // The attribute's own path carries shell syntax too.
    std::string path = at("/dir $(id) `id`/attr\"x");
    write_file(path, "");
    for (const std::string &v : values) {
        ASSERT_EQ(configfs_write_attr_str(path.c_str(), v.c_str(), 1), 0) << v;
        EXPECT_EQ(read_file(path), v);
    }
    EXPECT_FALSE(exists(canary));

    // /dev/null takes the write and reads back empty, like a refused value.
    ASSERT_EQ(symlink("/dev/null", at("/null").c_str()), 0);
    EXPECT_EQ(configfs_write_attr_str(at("/null").c_str(), "CHAP,None", 1), ERR_ATTR_MISMATCH);
    EXPECT_EQ(configfs_write_attr_str(at("/null").c_str(), "CHAP,None", 0), 0);
    EXPECT_EQ(configfs_write_attr_str(at("/no/dir/attr").c_str(), "1", 0), ERR_CONFIGFS);
}

// The first write fails because the attribute's directory is missing; a
// helper creates it before the retry. The retry cannot start early: our log
// line in between blocks on a full standard-output pipe until the helper,
// having seen the first attempt's shell error, creates the directory and
// drains the pipe. Runs in a child, whose output it may take over.
TEST_F(Lio4Test, WriteFallsBackToALineEnd)
{
    std::string dir = at("/late");
    int status = korv_test::run_in_child([&] {
        int out[2], err[2];
        if (pipe(out) != 0 || pipe(err) != 0)
            return 4;
        fcntl(out[1], F_SETFL, O_NONBLOCK);
        char fill[4096] = {0};
        while (write(out[1], fill, sizeof fill) > 0 || write(out[1], fill, 1) > 0) {
        }
        fcntl(out[1], F_SETFL, 0);
        dup2(out[1], 1);
        dup2(err[1], 2);
        std::string shell_error;
        std::thread([&] {
            char c;
            while (read(err[0], &c, 1) == 1 && c != '\n')
                shell_error += c;
            mkdirs(dir);
            while (read(out[0], fill, sizeof fill) > 0) {
            }
        }).detach();
        int rc = configfs_write_attr_str((dir + "/attr").c_str(), "value", 1);
        return (rc == 0 ? 0 : 1) | (shell_error.find("late") != std::string::npos ? 0 : 2);
    });
    EXPECT_EQ(status, 0);  // 1: the write failed, 2: the first attempt did not
    EXPECT_EQ(read_file(dir + "/attr"), "value\n");
}

}  // namespace
