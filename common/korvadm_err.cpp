// SPDX-License-Identifier: Apache-2.0
// Names of the shared result codes.
#include "common/korvadm_err.h"

#include <utility>

namespace {
constexpr std::pair<int, const char *> kMeanings[] = {
    {KORV_OK, "success"},
    {ERR_OP_NOT_PROVIDED, "operation not provided by the selected driver table"},
    {ERR_TARGET_NOT_IN_KERNEL, "target not present in the kernel"},
    {ERR_BACKSTORE_MISSING, "backstore not present"},
    {ERR_LUN_ALREADY_MAPPED, "LUN number already mapped"},
    {ERR_ATTR_EMPTY, "attribute empty"},
    {ERR_ATTR_MISMATCH, "attribute read back differs from what was written"},
    {ERR_CONFIGFS, "configfs attribute or directory operation failed"},
    {ERR_MODULE_NO_CONFIGFS, "module inserted but its configfs directory missing"},
    {ERR_MODULE_REMOVE, "module removal failed"},
    {ERR_MODULE_START, "module start failed, or no driver table selected"},
    {ERR_MODULE_TYPE, "unknown module type"},
    {ERR_CONF_TYPE, "configuration type not supported"},
    {ERR_NO_ROOM, "no room"},
    {ERR_NOT_FOUND, "named object not found"},
    {ERR_DB_WRITE, "database write or delete failed"},
    {ERR_SHELL_START, "shell command failed to start"},
    {ERR_BACKING_FILE_MISSING, "backing file missing"},
    {ERR_NO_MEMORY, "allocation failed"},
    {ERR_SHELL, "shell command or directory removal failed"},
    {ERR_PARAM, "parameter error"},
    {ERR_INT_VALUE, "integer value empty or not a number"},
    {ERR_DB_CLIENT, "the database client reported failure"},
    {ERR_SYSINFO, "system-information lookup failed"},
    {ID_ENTRY_FOUND, "entry found"},
    {ID_ENTRY_NOT_FOUND, "entry not found"},
};
}  // namespace

const char *korv_rc_str(int rc)
{
    for (const auto &[code, text] : kMeanings)
        if (code == rc)
            return text;
    return "unknown result code";
}
