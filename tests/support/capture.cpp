// SPDX-License-Identifier: Apache-2.0
#include "tests/support/capture.h"

#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>

#include <gtest/gtest.h>

namespace korv_test {

namespace {
std::string capture(std::FILE *stream, const std::function<void()> &fn)
{
    std::fflush(stream);
    std::FILE *tmp = std::tmpfile();
    if (!tmp) {
        ADD_FAILURE() << "tmpfile failed";
        return {};
    }
    int fd = fileno(stream);
    int saved = dup(fd);
    dup2(fileno(tmp), fd);
    fn();
    std::fflush(stream);
    dup2(saved, fd);
    close(saved);

    std::string out;
    std::rewind(tmp);
    char buf[4096];
    size_t n;
    while ((n = std::fread(buf, 1, sizeof buf, tmp)) > 0)
        out.append(buf, n);
    std::fclose(tmp);
    return out;
}
}  // namespace

std::string capture_stdout(const std::function<void()> &fn) { return capture(stdout, fn); }
std::string capture_stderr(const std::function<void()> &fn) { return capture(stderr, fn); }

int run_in_child(const std::function<int()> &fn)
{
    std::fflush(nullptr);
    pid_t pid = fork();
    if (pid == 0)
        _exit(fn());
    int status = 0;
    if (pid < 0 || waitpid(pid, &status, 0) != pid)
        return -1;
    if (WIFSIGNALED(status))
        return 128 + WTERMSIG(status);
    return WEXITSTATUS(status);
}

}  // namespace korv_test
