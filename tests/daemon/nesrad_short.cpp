// SPDX-License-Identifier: Apache-2.0
// Test-only daemon: nesrad's own loop with a 2-second interval, so that the
// periodic behaviour can be watched in seconds. Never installed.
#include "daemon/nesrad.h"
#include "tests/daemon/daemon_harness.h"

int main(int argc, char **argv)
{
    return nesrad_main(argc, argv, korv_test::kTestInterval);
}
