// SPDX-License-Identifier: Apache-2.0
/* The relocatable system root.
 *
 * Every fixed absolute system path of the program (configfs, /proc, /sys,
 * /var/run, /var/target, /etc/NAS_CFG, the module files) is turned into the
 * path actually used by sysroot_path(), which prefixes the directory named by
 * the environment variable NESRAD_SYSROOT (unset or empty: the real root).
 * That lets tests, the demo and benchmarks run unprivileged against a private
 * tree. Rules:
 *   - map a fixed path once, where the constant becomes a path in use
 *     (including paths placed into shell commands);
 *   - helpers that take a path take it already mapped and never map again;
 *   - paths that come from data (image files, mount points read from the
 *     database) are never mapped;
 *   - messages show the path as used (mapped).
 * Nothing else in the program reads the environment to change behaviour. */
#ifndef KORVADM_SYSROOT_H
#define KORVADM_SYSROOT_H

#include <stddef.h>

#ifdef __cplusplus
extern "C" {
#endif

#define KORV_SYSROOT_ENV "NESRAD_SYSROOT"

/* The root prefix in force ("" for the real root), without a trailing '/'. */
const char *sysroot_prefix(void);

/* Writes root + abs_path into out (size bytes, NUL-terminated).
 * Returns the length written, or -1 when abs_path is NULL or does not start
 * with '/', or when the result does not fit (out then holds ""): a path that
 * would have to be cut is refused, never shortened. */
int sysroot_map(const char *abs_path, char *out, size_t size);

#ifdef __cplusplus
}

#include <string>
/* C++ form: the mapped path (abs_path unchanged when no root is set). */
std::string sysroot_path(const char *abs_path);
#endif

#endif
