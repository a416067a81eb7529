// SPDX-License-Identifier: Apache-2.0
// Capturing what a piece of code writes to standard output or error.
#pragma once

#include <functional>
#include <string>

namespace korv_test {

// Runs fn with the process's standard output (fd 1 and stdout) redirected to
// a temporary file and returns everything written.
std::string capture_stdout(const std::function<void()> &fn);
// The same for standard error (fd 2 and stderr).
std::string capture_stderr(const std::function<void()> &fn);

// fn()'s result, with the log lines it prints kept out of the test's output
// (and handed back in *out when asked for).
template <class Fn>
auto quiet(Fn fn, std::string *out = nullptr)
{
    decltype(fn()) result{};
    std::string text = capture_stdout([&] { result = fn(); });
    if (out)
        *out = std::move(text);
    return result;
}

// Runs fn in a forked child and returns its exit status (or 128+signal).
// Use it for code that reads process-wide state once (the system root).
int run_in_child(const std::function<int()> &fn);

}  // namespace korv_test
