// SPDX-License-Identifier: Apache-2.0
// The system root: fixed paths map under NESRAD_SYSROOT and only there, and
// a path that would have to be cut is refused.
#include "common/korvadm_sysroot.h"

#include <cstdlib>
#include <string>

#include <gtest/gtest.h>

#include "tests/support/capture.h"

TEST(SysrootTest, MapsUnderTheRootWhenSetAndOnlyThen)
{
    const struct {
        const char *root, *path;
        size_t size;
        const char *want;  // nullptr: refused
    } cases[] = {
        {"/tmp/r", "/proc/modules", 64, "/tmp/r/proc/modules"},
        {"/tmp/r//", "/var/run/x", 64, "/tmp/r/var/run/x"},  // trailing slashes do not double up
        {nullptr, "/sys/kernel/config", 64, "/sys/kernel/config"},
        {"", "/etc/NAS_CFG/config.xml", 64, "/etc/NAS_CFG/config.xml"},
        {"/root-of-sixteen", "/var/run/sock", 20, nullptr},
        {"", "relative/path", 64, nullptr},
        {"", nullptr, 64, nullptr},
        {"", "/x", 0, nullptr},
    };
    // The root is read once per process, so every case runs in a fresh child.
    for (const auto &c : cases)
        EXPECT_EQ(korv_test::run_in_child([&] {
                      c.root ? setenv(KORV_SYSROOT_ENV, c.root, 1) : unsetenv(KORV_SYSROOT_ENV);
                      char buf[64] = "stale";
                      const int n = sysroot_map(c.path, buf, c.size);
                      if (!c.want)  // refused, and nothing left in the buffer
                          return n == -1 && (c.size == 0 || buf[0] == '\0') ? 0 : 1;
                      const std::string want = c.want;
                      return n == static_cast<int>(want.size()) && buf == want && sysroot_path(c.path) == want ? 0 : 2;
                  }),
                  0)
            << (c.path ? c.path : "NULL") << " under " << (c.root ? c.root : "no root");
}
