// SPDX-License-Identifier: Apache-2.0
// Memory baseline for xmldbd: a program linked the same way that only waits.
#include "platform/xmldb_tree.h"

#include <csignal>
#include <cstdio>
#include <unistd.h>

int main()
{
    xmldb::Tree t;  // keep the same libraries in the image
    t.set("/ready", "1");
    std::printf("%zu\n", t.node_count());
    std::fflush(stdout);
    pause();  // until the driver's SIGTERM
    return 0;
}
