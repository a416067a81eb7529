// SPDX-License-Identifier: Apache-2.0
// The system root: fixed paths map under NESRAD_SYSROOT and only there, and
// a path that would have to be cut is refused.
#include "common/korvadm_sysroot.h"

#include <cstdlib>
#include <sstream>
#include <string>

#include <gtest/gtest.h>

#include "tests/support/data_cases.h"
#include "tests/support/process.h"

TEST(SysrootTest, MapsUnderTheRootWhenSetAndOnlyThen)
{
    for (const auto &[in, want] : data_cases("sysroot_maps.txt")) {
        std::istringstream words(in);
        std::string root, path, mapped = want;  // clang 14 cannot capture a structured binding
        size_t size = 0;
        words >> root >> path >> size;
        // The root is read once per process, so every case runs in a fresh child.
        EXPECT_EQ(korv_test::run_in_child([&] {
                      const char *r = root == "''" ? "" : root.c_str();
                      root == "-" ? unsetenv(KORV_SYSROOT_ENV) : setenv(KORV_SYSROOT_ENV, r, 1);
                      const char *p = path == "-" ? nullptr : path.c_str();
                      char buf[64] = "stale";
                      const int n = sysroot_map(p, buf, size);
                      if (mapped == "refused")  // and nothing left in the buffer
                          return n == -1 && (size == 0 || buf[0] == '\0') ? 0 : 1;
                      return n == static_cast<int>(mapped.size()) && buf == mapped && sysroot_path(p) == mapped ? 0 : 2;
                  }),
                  0)
            << in;
    }
}
