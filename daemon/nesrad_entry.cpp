// SPDX-License-Identifier: Apache-2.0
// Entry point of the installed daemon: the loop with its fixed 60-second interval.
#include "daemon/nesrad.h"

int main(int argc, char **argv)
{
    return nesrad_main(argc, argv, NESRAD_POLL_INTERVAL);
}
