// SPDX-License-Identifier: Apache-2.0
// A process a test starts (a service, a server): it never outlives the test,
// and stopping it is bounded, so a hung child cannot hang the suite.
#pragma once

#include <sys/types.h>

#include <functional>
#include <string>
#include <vector>

namespace korv_test {

class child_process {
public:
    child_process() = default;
    ~child_process() { stop(); }
    child_process(const child_process &) = delete;
    child_process &operator=(const child_process &) = delete;

    // Forks and executes argv[0] with argv; `prepare` runs in the child just
    // before (redirections). False when the fork fails.
    bool start(std::vector<std::string> argv, const std::function<void()> &prepare = {});
    // SIGTERM, then SIGKILL after about 5 s. The exit status (128+N when
    // killed by signal N), or -1 when it was not running.
    int stop();
    // SIGKILL and reap, as a crash would.
    void kill();
    // False (and reaped) once the process has exited.
    bool running();
    pid_t pid() const { return pid_; }

private:
    pid_t pid_ = -1;
};

}  // namespace korv_test
