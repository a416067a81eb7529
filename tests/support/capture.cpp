// SPDX-License-Identifier: Apache-2.0
#include "tests/support/capture.h"

#include <unistd.h>

#include <cstdio>

#include <gtest/gtest.h>

#include "tests/support/process.h"

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
    const int fd = fileno(stream), saved = dup(fd);
    dup2(fileno(tmp), fd);
    fn();
    std::fflush(stream);
    dup2(saved, fd);
    close(saved);
    std::fseek(tmp, 0, SEEK_END);
    std::string out(static_cast<size_t>(std::ftell(tmp)), '\0');
    std::rewind(tmp);
    out.resize(std::fread(out.data(), 1, out.size(), tmp));
    std::fclose(tmp);
    return out;
}
}  // namespace

std::string capture_stdout(const std::function<void()> &fn) { return capture(stdout, fn); }
std::string capture_stderr(const std::function<void()> &fn) { return capture(stderr, fn); }

int run_in_child(const std::function<int()> &fn)
{
    child_process child;
    return child.start(fn) ? child.wait(std::chrono::hours(1)) : -1;
}

}  // namespace korv_test
