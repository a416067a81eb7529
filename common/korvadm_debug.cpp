// SPDX-License-Identifier: Apache-2.0
// Reading the stored debug level into the process-wide one.
#include "common/korvadm_debug.h"

#include "common/korvadm_log.h"
#include "config/korvadm_conf.h"

int dbg_get_conf_target_debug_lv(const iscsi_conf_ctx_t *ctx)
{
    if (!ctx || !ctx->ops || !ctx->ops->xmldb_get_debug_level)
        return 0;
    int level = 0;
    if (ctx->ops->xmldb_get_debug_level(&level) != 0)
        return 0;
    g_korv_debug_level = level;
    DBG(1, "get debug level = %d", level);
    return level;
}
