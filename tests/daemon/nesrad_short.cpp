// SPDX-License-Identifier: Apache-2.0
// Test-only daemon: nesrad's own loop with a short interval (2 s), so that the
// periodic behaviour can be watched in seconds. Never installed.
#include "daemon/nesrad.h"

int main(int argc, char **argv)
{
    return nesrad_main(argc, argv, NESRAD_TEST_INTERVAL);
}
