// SPDX-License-Identifier: Apache-2.0
// GoogleTest's own capture: it flushes every stream and redirects the
// descriptor, so printf, iostreams and write(2) all land in the text.
#include "tests/support/capture.h"

#include <gtest/gtest.h>

#include "tests/support/process.h"

namespace korv_test {

std::string capture_stdout(const std::function<void()> &fn)
{
    testing::internal::CaptureStdout();
    fn();
    return testing::internal::GetCapturedStdout();
}

std::string capture_stderr(const std::function<void()> &fn)
{
    testing::internal::CaptureStderr();
    fn();
    return testing::internal::GetCapturedStderr();
}

int run_in_child(const std::function<int()> &fn)
{
    child_process child;
    return child.start(fn) ? child.wait(std::chrono::hours(1)) : -1;
}

}  // namespace korv_test
