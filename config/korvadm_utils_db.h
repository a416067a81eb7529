// SPDX-License-Identifier: Apache-2.0
/* Database half of the utility layer: typed access to the configuration
 * database and the number converters the schema uses.
 *
 * Every call goes to the configuration socket (XMLDB_SOCK_ISCSI) with flags 0.
 * A missing node and an empty one read alike: as "". Failures are logged here,
 * where they are detected, and returned as result codes (common/korvadm_err.h).
 * (The command, file and lock half of the layer is common/korvadm_utils.h.) */
#ifndef CONFIG_KORVADM_UTILS_DB_H
#define CONFIG_KORVADM_UTILS_DB_H

#include <stddef.h>
#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

/* Path of the saved configuration file (mapped through the system root by the
 * client library). */
#define KORV_CONFIG_FILE "/etc/NAS_CFG/config.xml"

/* *out = atoi(value) and 0, so trailing text is ignored and "abc" reads 0.
 * path NULL/empty: -9989. Client failure: *out = 0, -9992. Empty value:
 * *out = 0, -9990. */
int xmldb_get_int32_t(int32_t *out, const char *path);
/* Stores "%d". path NULL/empty: -9989; client failure: -9992. */
int xmldb_set_int32_t(int32_t value, const char *path);
/* As xmldb_get_int32_t, parsed by convert_str_to_uint64_t; a value that does
 * not parse gives *out = 0, -9990. */
int xmldb_get_uint64_t(uint64_t *out, const char *path);
/* Stores "%llu". path NULL/empty: -9989; client failure: -9992. */
int xmldb_set_uint64_t(uint64_t value, const char *path);
/* Copies the value into buf (cut to size-1 bytes). Does not clear buf first:
 * on success it holds the value, "" meaning absent. buf NULL, size 0, path
 * NULL/empty: -9989. Client failure: -9992. */
int xmldb_get_cstring(char *buf, size_t size, const char *path);
/* Stores value; "" is allowed and is how a setting is cleared. NULL value or
 * path: -9989. Client failure: -9992. */
int xmldb_set_cstring(const char *value, const char *path);
/* Removes path and its subtree. Any failure (NULL path included): -9981,
 * logged at level 2 only because callers routinely delete absent subtrees. */
int xmldb_delete_node(const char *path);
/* Saves the database to KORV_CONFIG_FILE and copies it to flash; returns the
 * copy's result. When the file cannot be written: -9981, and nothing is
 * copied. */
int xmldb_write_config_file(void);

/* Newly allocated copy of at most max_len bytes of src, always terminated.
 * NULL for a NULL src or no memory. Caller frees with free(). */
char *str_ndup(const char *src, size_t max_len);

/* The three converters: 0 with *value set and *endptr after the digits
 * (trailing text is accepted); -9989 for a NULL str or value; -1 on overflow,
 * a parse error or no digits ("No digits were found" on standard error).
 * endptr may be NULL when the caller does not need it.
 * convert_dec_str_to_uint64_t parses signed: values above LLONG_MAX overflow. */
int convert_dec_str_to_uint64_t(const char *str, char **endptr, uint64_t *value);
int convert_hex_str_to_l(const char *str, char **endptr, long *value);
int convert_dec_str_to_l(const char *str, char **endptr, long *value);
/* Unsigned decimal, trailing text accepted. 0 on success; 1 on overflow or a
 * parse error (*value = 0) and when there are no digits; -9989 for a NULL
 * str or value. */
int convert_str_to_uint64_t(const char *str, uint64_t *value);

#ifdef __cplusplus
}
#endif

#endif
