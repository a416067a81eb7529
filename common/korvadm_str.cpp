// The bounded copy and the shell escaping.
#include "common/korvadm_str.h"

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

}  // namespace korv
