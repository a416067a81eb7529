// SPDX-License-Identifier: Apache-2.0
// The one place that reads the system-root variable and maps fixed paths.
#include "common/korvadm_sysroot.h"

#include <cstdlib>
#include <cstring>
#include <string>

namespace {
// Read once: the root cannot change under a running process.
const std::string &root()
{
    static const std::string r = [] {
        const char *env = std::getenv(KORV_SYSROOT_ENV);
        std::string s = env ? env : "";
        while (!s.empty() && s.back() == '/')
            s.pop_back();
        return s;
    }();
    return r;
}
}  // namespace

const char *sysroot_prefix(void)
{
    return root().c_str();
}

int sysroot_map(const char *abs_path, char *out, size_t size)
{
    if (!out || size == 0)
        return -1;
    out[0] = '\0';
    if (!abs_path || abs_path[0] != '/')
        return -1;
    const std::string &r = root();
    size_t len = r.size() + std::strlen(abs_path);
    if (len + 1 > size)
        return -1;
    std::memcpy(out, r.data(), r.size());
    std::memcpy(out + r.size(), abs_path, len - r.size() + 1);
    return static_cast<int>(len);
}

std::string sysroot_path(const char *abs_path)
{
    return root() + (abs_path ? abs_path : "");
}
