// SPDX-License-Identifier: Apache-2.0
#include "tests/support/process.h"

#include <signal.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>

namespace korv_test {

bool child_process::start(std::vector<std::string> argv, const std::function<void()> &prepare)
{
    std::vector<char *> args;
    for (std::string &a : argv)
        args.push_back(a.data());
    args.push_back(nullptr);
    std::fflush(nullptr);
    const pid_t parent = ::getpid(), pid = ::fork();
    if (pid == 0) {
        ::prctl(PR_SET_PDEATHSIG, SIGKILL);
        if (::getppid() != parent)
            ::_exit(127);
        if (prepare)
            prepare();
        ::execv(args[0], args.data());
        ::_exit(127);
    }
    pid_ = pid;
    return pid > 0;
}

int child_process::stop()
{
    if (pid_ <= 0)
        return -1;
    ::kill(pid_, SIGTERM);
    int st = 0;
    for (int i = 0; ::waitpid(pid_, &st, WNOHANG) == 0; ++i) {
        if (i == 2500) {
            kill();
            return 128 + SIGKILL;
        }
        ::usleep(2000);
    }
    pid_ = -1;
    return WIFEXITED(st) ? WEXITSTATUS(st) : 128 + WTERMSIG(st);
}

void child_process::kill()
{
    if (pid_ <= 0)
        return;
    ::kill(pid_, SIGKILL);
    ::waitpid(pid_, nullptr, 0);
    pid_ = -1;
}

bool child_process::running()
{
    if (pid_ > 0 && ::waitpid(pid_, nullptr, WNOHANG) == pid_)
        pid_ = -1;
    return pid_ > 0;
}

}  // namespace korv_test
