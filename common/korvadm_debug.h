// SPDX-License-Identifier: Apache-2.0
/* The stored debug level: read once at start-up from the configuration store
 * into the process-wide level that gates every log statement. */
#ifndef KORVADM_DEBUG_H
#define KORVADM_DEBUG_H

#ifdef __cplusplus
extern "C" {
#endif

struct iscsi_conf_ctx_s;

/* Reads the level through ctx's "get debug level" operation. On success sets
 * g_korv_debug_level, logs "get debug level = %d" and returns the level. A
 * NULL ctx, a table without the operation or a failed read return 0 and leave
 * g_korv_debug_level as it was. */
int dbg_get_conf_target_debug_lv(const struct iscsi_conf_ctx_s *ctx);

#ifdef __cplusplus
}
#endif

#endif
