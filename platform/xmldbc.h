// SPDX-License-Identifier: Apache-2.0
/* Client library of the configuration database service (xmldbd).
 *
 * The same names and contracts as the appliance's own platform library, so
 * the management library builds against either. Socket paths and the file
 * path of xml_write_file are fixed system paths: the library maps them through
 * the system root (common/korvadm_sysroot.h); a mapped socket path too long
 * for a Unix socket address is refused (-1), never cut. A dead or missing
 * service makes every call fail (-1) within about 2 seconds; the next call
 * after the service is back works again. Node paths must be absolute; empty
 * segments are ignored. One connection per socket is kept open and shared by
 * the process's threads (calls are serialised); a forked child opens its own.
 * Wire format and limits (path 4095 bytes, value 65536 bytes): docs/xmldb.md. */
#ifndef PLATFORM_XMLDBC_H
#define PLATFORM_XMLDBC_H

#include <stddef.h>

#ifdef __cplusplus
extern "C" {
#endif

#define XMLDB_SOCK_ISCSI   "/var/run/xmldb_sock_iscsi"   /* configuration */
#define XMLDB_SOCK_SYSINFO "/var/run/xmldb_sock_sysinfo" /* system information */

/* Copies the value at `path` NUL-terminated into buf (cut to size-1 bytes).
 * Returns the stored value's length plus one (so 1 for a missing or empty
 * node, which read alike), or -1 on failure (buf then "" when size > 0).
 * `flags` is reserved (pass 0). */
int xmldbc_get_wb(const char *sock, int flags, const char *path, char *buf, size_t size);

/* Stores `value` at `path`, creating missing parents. 0 on success, -1 on
 * failure (also for the root "/" and a value over the limit). */
int xmldbc_set(const char *sock, int flags, const char *path, const char *value);

/* Removes `path` and its subtree; removing a missing node succeeds. 0 / -1. */
int xmldbc_del(const char *sock, int flags, const char *path);

/* Asks the configuration service to write its whole tree to `file_path`
 * (mapped through the system root) atomically: a crash leaves the old or the
 * new file. The service refuses files outside the directories it was allowed
 * (by default /etc/NAS_CFG). 0 / -1. */
int xml_write_file(const char *file_path);

#ifdef __cplusplus
}
#endif

#endif
