// SPDX-License-Identifier: Apache-2.0
/* The platform's common utility calls, as the appliance provides them.
 *
 * Database shortcuts work on the configuration database (XMLDB_SOCK_ISCSI).
 * Fixed system paths read here (/proc, /sys) are mapped through the system
 * root; paths given by callers are used as they are. */
#ifndef PLATFORM_UTIL_H
#define PLATFORM_UTIL_H

#include <stddef.h>

#ifdef __cplusplus
extern "C" {
#endif

/* ---- database shortcuts (configuration database) ---- */
/* Value at path as a 64-bit integer, read like strtoll ("12abc" is 12); 0
 * when missing, empty, not a number, out of range or unreadable. */
long long dbGetLL(const char *path);
/* Stores value ("%lld") at path. 0 / -1. */
int dbSetLL(long long value, const char *path);
/* Copies the value at path into buf (NUL-terminated, cut to size-1). 0 / -1
 * (buf then "" when it can hold it; -1 at once for NULL buf or size <= 0). */
int dbGetStr(char *buf, int size, const char *path);
/* Stores value at path. 0 / -1. */
int dbSetStr(const char *value, const char *path);
/* Removes path and its subtree. 0 / -1. */
int dbDelete(const char *path);

/* ---- commands ---- */
/* Formats a command printf-style and runs it with /bin/sh -c (standard output
 * is flushed first). Returns the shell's exit status (0..255; 128+N when the
 * shell died of signal N), or -1 when it could not be run. Values from data
 * must go through str_insert_back_slash inside double quotes. */
int System(const char *fmt, ...) __attribute__((format(printf, 1, 2)));

/* ---- strings ---- */
/* A newly allocated copy of src with a backslash before each $, ", \ and `,
 * safe inside a double-quoted shell word. Caller frees. NULL on NULL or no memory. */
char *str_insert_back_slash(const char *src);
/* Parses a whole decimal integer (leading blanks, optional sign, trailing
 * blanks and line end allowed). 0 with
 * *value set, or -1 for NULL, empty, trailing garbage or overflow. */
int str2ll(const char *str, long long *value);
/* strsep() that treats a run of separators as one and skips leading ones:
 * returns the next token (terminated in place) and advances *stringp past the
 * separators after it, or NULL (and *stringp NULL) when no token is left.
 * Never returns an empty token. */
char *strsep_ex(char **stringp, const char *delim);

/* ---- system queries ---- */
/* `path` itself when a file system is mounted exactly there (per
 * /proc/self/mountinfo under the system root; a trailing '/' is ignored,
 * octal escapes such as \040 are decoded), else NULL. `path` is compared as
 * given: the caller maps fixed paths. */
const char *sys_mount_point(const char *path);
/* The kernel's host name (/proc/sys/kernel/hostname under the root), without
 * the line end. 0, or -1 (buf "") when unreadable or it does not fit: a name
 * is never cut. */
int sys_hostname(char *buf, size_t size);
/* The six bytes of /sys/class/net/<dev>/address under the root, in a buffer
 * of the calling thread that the next call overwrites; NULL when the device
 * name is not one path component, or the file is absent or not
 * "xx:xx:xx:xx:xx:xx". */
unsigned char *sys_get_mac_addr(const char *dev);
/* A random number from 0 to INT_MAX (from the kernel's generator). */
int sys_random(void);
/* Link speed in Mb/s of LAN port 0 ("egiga0") or 1 ("egiga1") from
 * /sys/class/net/<dev>/{operstate,speed} under the root; 0 when operstate is
 * not "up", the speed is not a positive number, a file is absent, or the port
 * is neither 0 nor 1. */
int LIB_Get_Lan_Link_Speed(int port);
/* Copies the saved configuration file /etc/NAS_CFG/config.xml to
 * /usr/local/config/config.xml (both under the system root; /usr/local is the
 * persistent partition), atomically. Creates /usr/local/config when missing
 * but never /usr/local itself. `flag` is accepted for compatibility and
 * ignored (callers pass 1). 0 / -1. */
int LIB_CP_Config_To_MTD(int flag);

#ifdef __cplusplus
}
#endif

#endif
