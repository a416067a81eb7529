// SPDX-License-Identifier: Apache-2.0
// The bounded copy, the shell escaping and the reader of command output.
#include "common/korvadm_str.h"

#include <sys/wait.h>

#include <cstdio>
#include <cstring>
#include <new>

namespace korv {

bool copy_bounded(char *dst, size_t size, const char *src)
{
    if (!dst || size == 0)
        return false;
    if (!src)
        src = "";
    size_t len = strnlen(src, size - 1);
    std::memcpy(dst, src, len);
    dst[len] = '\0';
    return src[len] == '\0';
}

std::string shell_escape(std::string_view text)
{
    std::string out;
    out.reserve(text.size() + 8);
    for (char c : text) {
        if (c == '$' || c == '"' || c == '\\' || c == '`')
            out += '\\';
        out += c;
    }
    return out;
}

bool shell_escape(const char *src, std::string &out)
{
    if (!src)
        return false;
    try {
        out = shell_escape(std::string_view(src));
    } catch (const std::bad_alloc &) {
        return false;
    }
    return true;
}

int read_command_lines(const char *cmd, const std::function<bool(std::string_view line)> &on_line)
{
    if (!cmd)
        return -1;
    std::fflush(stdout);
    std::FILE *p = popen(cmd, "r");
    if (!p)
        return -1;
    // Output is untrusted: a line longer than the buffer comes in pieces, so
    // an endless line neither grows memory nor stops on_line from ending it.
    char buf[kCommandLineMax + 1];
    while (std::fgets(buf, sizeof buf, p)) {
        std::string_view text(buf);
        if (!text.empty() && text.back() == '\n')
            text.remove_suffix(1);
        if (!on_line(text))
            break;
    }
    int status = pclose(p);
    if (status == -1)
        return -1;
    if (WIFEXITED(status))
        return WEXITSTATUS(status);
    return WIFSIGNALED(status) ? 128 + WTERMSIG(status) : -1;
}

}  // namespace korv
