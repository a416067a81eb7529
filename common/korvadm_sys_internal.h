// SPDX-License-Identifier: Apache-2.0
/* What only korvadm_sys's own files (and their tests) share. */
#ifndef KORVADM_SYS_INTERNAL_H
#define KORVADM_SYS_INTERNAL_H

/* Every file of the unit logs under the unit's name. */
#undef KORV_LOG_UNIT
#define KORV_LOG_UNIT "korvadm_sys"

#include "common/korvadm_sys.h"

#ifdef __cplusplus
extern "C" {
#endif

/* ---- korvadm_sys_storage.cpp ---- */

/* Room on the file system mounted at mnt_path, from "df -B 1": the reserved
 * blocks (total - used - available) are shared between used and unused in
 * the proportion df reports. 0, or -1 when an argument is NULL, the path is
 * not a mount point, or df's line is short or garbled. */
int _sys_get_df_info(uint64_t *total, uint64_t *used, uint64_t *unused, const char *mnt_path);
/* Appends a record for the mounted volume uuid with its df figures; NULL
 * when it is not mounted or cannot be measured. */
vol_lun_info_t *_vol_info_list_insert(vol_lun_info_t **head, const char *uuid, uint64_t alloc_size,
                                      uint64_t claim_size, uint64_t extra_size, int hibernation);

#ifdef __cplusplus
}
#endif

#endif
