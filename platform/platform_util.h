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
/* Value at path as a 64-bit integer; 0 when missing, empty or unreadable. */
long long dbGetLL(const char *path);
/* Stores value ("%lld") at path. 0 / -1. */
int dbSetLL(long long value, const char *path);
/* Copies the value at path into buf (NUL-terminated, cut to size-1). 0 / -1 (buf then ""). */
int dbGetStr(char *buf, int size, const char *path);
/* Stores value at path. 0 / -1. */
int dbSetStr(const char *value, const char *path);
/* Removes path and its subtree. 0 / -1. */
int dbDelete(const char *path);

/* ---- commands ---- */
/* Formats a command printf-style and runs it with /bin/sh -c. Returns the
 * shell's exit status (0..255), or -1 when it could not be run. */
int System(const char *fmt, ...) __attribute__((format(printf, 1, 2)));

/* ---- strings ---- */
/* A newly allocated copy of src with a backslash before each $, ", \ and `,
 * safe inside a double-quoted shell word. Caller frees. NULL on NULL or no memory. */
char *str_insert_back_slash(const char *src);
/* Parses a whole decimal integer (leading blanks, optional sign). 0 with
 * *value set, or -1 for NULL, empty, trailing garbage or overflow. */
int str2ll(const char *str, long long *value);
/* strsep() that treats a run of separators as one. */
char *strsep_ex(char **stringp, const char *delim);

/* ---- system queries ---- */
/* `path` itself when a file system is mounted exactly there (per
 * /proc/self/mountinfo under the system root), else NULL. */
const char *sys_mount_point(const char *path);
/* The kernel's host name (/proc/sys/kernel/hostname under the root), without
 * the line end. 0, or -1 when unreadable or it does not fit. */
int sys_hostname(char *buf, size_t size);
/* The six bytes of /sys/class/net/<dev>/address under the root, in a static
 * buffer; NULL when absent or malformed. */
unsigned char *sys_get_mac_addr(const char *dev);
/* A random non-negative number (from the kernel's generator). */
int sys_random(void);
/* Link speed in Mb/s of LAN port 0 ("egiga0") or 1 ("egiga1") from
 * /sys/class/net/<dev>/{operstate,speed} under the root; 0 when down or absent. */
int LIB_Get_Lan_Link_Speed(int port);
/* Copies the saved configuration file to the persistent-storage directory,
 * atomically (see the implementation for where). 0 / -1. */
int LIB_CP_Config_To_MTD(int flag);

#ifdef __cplusplus
}
#endif

#endif
