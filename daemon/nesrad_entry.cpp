// SPDX-License-Identifier: Apache-2.0
// Entry point of the installed daemon: the loop with its fixed 60-second interval.
#include "daemon/nesrad.h"

#include <unistd.h>

#include <cstdlib>
#include <exception>

// The C++ runtime's own terminate handler names the exception's type through
// its demangler: 44 KiB of code linked into the daemon for a message that
// only a bug would print (docs/benchmarks.md). This one replaces it: it says
// so and aborts, as the runtime's does.
namespace __gnu_cxx {
void __verbose_terminate_handler()
{
    static const char msg[] = "nesrad: terminate called, aborting\n";
    if (write(STDERR_FILENO, msg, sizeof msg - 1) < 0) {
        // Nothing more to say where standard error is gone.
    }
    std::abort();
}
}  // namespace __gnu_cxx

int main(int argc, char **argv)
{
    return nesrad_main(argc, argv, NESRAD_POLL_INTERVAL);
}
