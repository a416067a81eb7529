// SPDX-License-Identifier: Apache-2.0
/* Result codes shared by every layer of the library and the daemon.
 *
 * 0 is success; failures come from one family of negative numbers so that a
 * code passed up through several layers still says where it started. The
 * id-entry scanner of the configuration store alone answers the two small
 * positive codes (found / not found). */
#ifndef KORVADM_ERR_H
#define KORVADM_ERR_H

#include "common/korvadm_log.h"

#ifdef __cplusplus
extern "C" {
#endif

enum korv_rc {
    KORV_OK = 0,
    ERR_OP_NOT_PROVIDED      = -9967, /* operation not provided by the selected driver table */
    ERR_TARGET_NOT_IN_KERNEL = -9968, /* target not present in the kernel */
    ERR_BACKSTORE_MISSING    = -9969, /* backstore not present */
    ERR_LUN_ALREADY_MAPPED   = -9970, /* LUN number already mapped */
    ERR_ATTR_EMPTY           = -9971, /* attribute empty */
    ERR_ATTR_MISMATCH        = -9972, /* attribute read back differs from what was written */
    ERR_CONFIGFS             = -9973, /* configfs attribute or directory operation failed */
    ERR_MODULE_NO_CONFIGFS   = -9974, /* module inserted but its configfs directory missing */
    ERR_MODULE_REMOVE        = -9975, /* module removal failed */
    ERR_MODULE_START         = -9976, /* module start failed, or no driver table selected */
    ERR_MODULE_TYPE          = -9977, /* unknown module type */
    ERR_CONF_TYPE            = -9978, /* configuration type not supported */
    ERR_NO_ROOM              = -9979, /* no room (list full, no free number) */
    ERR_NOT_FOUND            = -9980, /* named object not found */
    ERR_DB_WRITE             = -9981, /* database write or delete failed; generic failure */
    ERR_SHELL_START          = -9984, /* the daemon's start command could not be run */
    ERR_BACKING_FILE_MISSING = -9986, /* backing file missing */
    ERR_NO_MEMORY            = -9987, /* allocation (or command building) failed */
    ERR_SHELL                = -9988, /* shell command or directory removal failed */
    ERR_PARAM                = -9989, /* parameter error ("ERR_PARAM_ERROR", "parameter error") */
    ERR_INT_VALUE            = -9990, /* integer value empty or not a number */
    ERR_DB_CLIENT            = -9992, /* the database client reported failure */
    ERR_SYSINFO              = -9998, /* system-information lookup (RAID device or members) failed */

    /* The id-entry scanner's own answers. */
    ID_ENTRY_FOUND     = 5,
    ID_ENTRY_NOT_FOUND = 6,
};

/* The argument guard of an operation answering result codes:
 *
 *   PARAM_GUARD(!name || !name[0]);              logs "parameter error"
 *   PARAM_GUARD(!addr, "addr is NULL");          logs its own message
 *   PARAM_GUARD_AS(func, !out);                  in a helper shared by several
 *                                                operations: logs under func
 *
 * When the condition holds, logs at level 0 under the calling function (or
 * func) and returns ERR_PARAM (-9989) from it. At most four values may
 * follow the message. */
#define PARAM_GUARD(...) PARAM_GUARD_AS(__func__, __VA_ARGS__)
#define PARAM_GUARD_AS(func, ...)                                                        \
    KORV_PARAM_GUARD_PICK(__VA_ARGS__, KORV_PARAM_GUARD_MSG, KORV_PARAM_GUARD_MSG, KORV_PARAM_GUARD_MSG, \
                          KORV_PARAM_GUARD_MSG, KORV_PARAM_GUARD_MSG, KORV_PARAM_GUARD_PLAIN, )(func, __VA_ARGS__)
#define KORV_PARAM_GUARD_PICK(a1, a2, a3, a4, a5, a6, name, ...) name
#define KORV_PARAM_GUARD_PLAIN(func, refused) KORV_PARAM_GUARD_MSG(func, refused, "parameter error")
#define KORV_PARAM_GUARD_MSG(func, refused, ...) \
    do {                                         \
        if (refused) {                           \
            DBG_AS(func, 0, __VA_ARGS__);        \
            return ERR_PARAM;                    \
        }                                        \
    } while (0)

/* Short English meaning of a code, for messages and tests; never NULL. */
const char *korv_rc_str(int rc);

#ifdef __cplusplus
}
#endif

#endif
