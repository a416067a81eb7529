// SPDX-License-Identifier: Apache-2.0
// The one implementation of the logging statement.
#include "common/korvadm_log.h"

#include <cstdarg>
#include <cstdio>
#include <string_view>

int g_korv_debug_level = 0;

namespace {
// "dir/korvadm_utils.cpp" -> "korvadm_utils"
std::string_view unit_name(std::string_view file)
{
    if (auto slash = file.rfind('/'); slash != std::string_view::npos)
        file.remove_prefix(slash + 1);
    if (auto dot = file.find('.'); dot != std::string_view::npos)
        file = file.substr(0, dot);
    return file;
}
}  // namespace

void korv_log(int level, const char *file, const char *func, int line, const char *fmt, ...)
{
    // Both tests read the level once so prefix and message always agree.
    const bool shown = g_korv_debug_level >= level;
    if (shown) {
        std::string_view unit = unit_name(file ? file : "");
        std::printf("(%.*s:%s:%d):", static_cast<int>(unit.size()), unit.data(), func ? func : "", line);
    }
    std::fflush(stdout);
    if (!shown)
        return;
    va_list ap;
    va_start(ap, fmt);
    std::vprintf(fmt, ap);
    va_end(ap);
    std::fputc('\n', stdout);
    std::fflush(stdout);
}
