// SPDX-License-Identifier: Apache-2.0
#include "tests/support/process.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>

#include "common/korvadm_str.h"

namespace korv_test {

using namespace std::chrono_literals;

bool child_process::start(const std::function<int()> &body)
{
    std::fflush(nullptr);
    const pid_t parent = ::getpid(), pid = ::fork();
    if (pid == 0) {
        ::prctl(PR_SET_PDEATHSIG, SIGKILL);
        sigset_t none;
        sigemptyset(&none);
        ::sigprocmask(SIG_SETMASK, &none, nullptr);
        ::_exit(::getppid() == parent ? body() : 127);
    }
    pid_ = pid;
    return pid > 0;
}

bool child_process::start(std::vector<std::string> argv, const std::string &log, const std::function<void()> &prepare)
{
    return start([&] {
        const int fd = log.empty() ? -1 : ::open(log.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0600);
        if (fd >= 0 && (::dup2(fd, STDOUT_FILENO) < 0 || ::dup2(fd, STDERR_FILENO) < 0))
            return 127;
        if (prepare)
            prepare();
        std::vector<char *> args;
        for (std::string &a : argv)
            args.push_back(a.data());
        args.push_back(nullptr);
        ::execv(args[0], args.data());
        return 127;
    });
}

int child_process::wait(std::chrono::milliseconds limit)
{
    int st = 0;
    if (pid_ <= 0 || !eventually([&] { return ::waitpid(pid_, &st, WNOHANG) == pid_; }, limit))
        return -1;
    pid_ = -1;
    return WIFEXITED(st) ? WEXITSTATUS(st) : 128 + WTERMSIG(st);
}

int child_process::stop()
{
    signal(SIGTERM);
    const int st = wait(5s);
    if (st >= 0 || pid_ <= 0)
        return st;
    kill();
    return 128 + SIGKILL;
}

void child_process::kill()
{
    signal(SIGKILL);
    wait(std::chrono::hours(1));
}

void child_process::signal(int sig) const
{
    if (pid_ > 0)
        ::kill(pid_, sig);
}

std::string run_shell(const std::string &cmd, int *status)
{
    std::string out;
    const int st = korv::read_command_lines(cmd.c_str(), [&](std::string_view line) {
        out.append(line).push_back('\n');
        return true;
    });
    if (status)
        *status = st;
    return out;
}

int run_in_child(const std::function<int()> &fn)
{
    child_process child;
    return child.start(fn) ? child.wait(1h) : -1;
}

}  // namespace korv_test
