// SPDX-License-Identifier: Apache-2.0
/* Small text and memory helpers every layer shares: the one bounded copy,
 * the one shell escaping, the one reader of command output and the one owner
 * of malloc'd memory.
 *
 * They sit in the base library so that the bundled platform (whose
 * str_insert_back_slash is the escaping the appliance's scripts know) and
 * the management library use the very same code. */
#ifndef KORVADM_STR_H
#define KORVADM_STR_H

#include <stddef.h>

#ifdef __cplusplus
#include <cstdlib>
#include <cstring>
#include <functional>
#include <memory>
#include <string>
#include <string_view>

namespace korv {

/* Copies src into dst[size], cut to size-1 bytes and always terminated;
 * reads at most size-1 bytes of src, so a fixed field that lacks its
 * terminator is safe to copy into a field of its size. NULL src copies "".
 * True when all of src fitted, false when it was cut (or size is 0, when
 * nothing is written). */
bool copy_bounded(char *dst, size_t size, const char *src);
template <size_t N>
bool copy_bounded(char (&dst)[N], const char *src)
{
    return copy_bounded(dst, N, src);
}

/* A fixed text field as a string, never reading past the field. */
template <size_t N>
std::string field_str(const char (&text)[N])
{
    return std::string(text, strnlen(text, N));
}

/* text with a backslash before each $, ", \ and `: safe inside a
 * double-quoted shell word, and nowhere else. */
std::string shell_escape(std::string_view text);
/* The same for a C string: false (out untouched) for NULL or when memory is
 * short. */
bool shell_escape(const char *src, std::string &out);

/* The one reader of commands whose output is parsed ("df", "powermgmt -s",
 * "ps"): runs cmd through the shell (standard output flushed first) and
 * hands each line of its standard output, without the line end, to on_line
 * until on_line returns false. Returns the command's exit status as System()
 * does (0..255, 128+N when it died of signal N; a command cut short by a
 * false from on_line may die of SIGPIPE), or -1 when it could not be run.
 * A line longer than kCommandLineMax bytes comes in pieces of that size.
 * cmd is run as given: values in it must be escaped (shell_escape). */
constexpr size_t kCommandLineMax = 4096;
int read_command_lines(const char *cmd, const std::function<bool(std::string_view line)> &on_line);

/* Memory from malloc/calloc/strdup, freed when it goes out of scope. */
struct free_deleter {
    void operator()(void *p) const { std::free(p); }
};
using c_buffer = std::unique_ptr<char, free_deleter>;

}  // namespace korv
#endif

#endif
