// SPDX-License-Identifier: Apache-2.0
// The system root: fixed paths map under NESRAD_SYSROOT and only there.
#include "common/korvadm_sysroot.h"

#include <cstdlib>
#include <cstring>
#include <string>

#include <gtest/gtest.h>

#include "tests/support/capture.h"

using korv_test::run_in_child;

namespace {

// The root is read once per process, so every case runs in a fresh child.
int mapped_equals(const char *root, const char *path, const char *want)
{
    if (root)
        setenv(KORV_SYSROOT_ENV, root, 1);
    else
        unsetenv(KORV_SYSROOT_ENV);
    char buf[256];
    int n = sysroot_map(path, buf, sizeof buf);
    if (n < 0 || std::strcmp(buf, want) != 0 || n != static_cast<int>(std::strlen(want)))
        return 1;
    return sysroot_path(path) == want ? 0 : 2;
}

TEST(SysrootTest, MapsUnderTheRootWhenSetAndOnlyThen)
{
    const struct {
        const char *root, *path, *want;
    } cases[] = {
        {"/tmp/r", "/proc/modules", "/tmp/r/proc/modules"},
        {"/tmp/r//", "/var/run/x", "/tmp/r/var/run/x"},  // trailing slashes do not double up
        {nullptr, "/sys/kernel/config", "/sys/kernel/config"},
        {"", "/etc/NAS_CFG/config.xml", "/etc/NAS_CFG/config.xml"},
    };
    for (const auto &c : cases)
        EXPECT_EQ(run_in_child([&] { return mapped_equals(c.root, c.path, c.want); }), 0) << c.path;
}

TEST(SysrootTest, RefusesWhatWouldHaveToBeCutOrIsNotAbsolute)
{
    EXPECT_EQ(run_in_child([] {
                  setenv(KORV_SYSROOT_ENV, "/root-of-sixteen", 1);
                  char buf[20];
                  int n = sysroot_map("/var/run/sock", buf, sizeof buf);
                  return (n == -1 && buf[0] == '\0') ? 0 : 1;
              }),
              0);
    char buf[64];
    EXPECT_EQ(sysroot_map("relative/path", buf, sizeof buf), -1);
    EXPECT_EQ(sysroot_map(nullptr, buf, sizeof buf), -1);
    EXPECT_EQ(sysroot_map("/x", buf, 0), -1);
}

}  // namespace
