// SPDX-License-Identifier: Apache-2.0
// A program outside the tree, built against the installed library only.
#include "common/korvadm_err.h"
#include "common/korvadm_nesrad_if.h"
#include "kernel/korvadm_mod.h"

#include <cstdio>

int main()
{
    // No driver table selected: the state probe answers "stopped".
    std::printf("%d %s\n", iscsi_mod_get_state(), korv_rc_str(ERR_PARAM));
    return iscsi_mod_get_state() == 1 ? 0 : 1;
}
