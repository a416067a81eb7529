// SPDX-License-Identifier: Apache-2.0
// Processes a test starts (services, servers, the daemon): they never outlive
// the test, and every wait is bounded, so a hung child cannot hang the suite.
// And what a piece of code prints.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <functional>
#include <string>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

namespace korv_test {

// Polls pred every 20 ms until it holds (true) or the time is over (false).
template <class Pred>
bool eventually(Pred pred, std::chrono::milliseconds limit)
{
    using namespace std::chrono;
    for (auto end = steady_clock::now() + limit; !pred(); std::this_thread::sleep_for(milliseconds(20)))
        if (steady_clock::now() >= end)
            return false;
    return true;
}

class child_process {
public:
    child_process() = default;
    ~child_process() { stop(); }
    child_process(const child_process &) = delete;
    child_process &operator=(const child_process &) = delete;

    // Forks and runs body in the child, which exits with its result. The
    // child starts with no signal blocked and dies with the test. False when
    // the fork fails.
    bool start(const std::function<int()> &body);
    // Executes argv[0] with argv; `prepare` runs in the child just before
    // (redirections); log, when given, receives standard output and error.
    bool start(std::vector<std::string> argv, const std::string &log = {}, const std::function<void()> &prepare = {});
    // The exit status (128+N when killed by signal N) once the process has
    // ended within the limit; -1 when it is still running then, or was not.
    int wait(std::chrono::milliseconds limit);
    // SIGTERM, then SIGKILL after 5 s; the exit status, or -1 when it was not running.
    int stop();
    // SIGKILL and reap, as a crash would.
    void kill();
    void signal(int sig) const;
    // False (and reaped) once the process has exited.
    bool running() { return wait(std::chrono::milliseconds(0)) < 0 && pid_ > 0; }
    pid_t pid() const { return pid_; }

private:
    pid_t pid_ = -1;
};

// Runs cmd through the shell; returns its standard output (each line ended by
// '\n') and stores its exit status in *status when asked for.
std::string run_shell(const std::string &cmd, int *status = nullptr);

// Runs fn in a forked child and returns its exit status (or 128+signal).
// Use it for code that reads process-wide state once (the system root).
int run_in_child(const std::function<int()> &fn);

// Everything fn writes to standard output (error), printf, iostreams and
// write(2) alike: GoogleTest flushes the streams and redirects the descriptor.
template <class Fn>
std::string capture_stdout(Fn fn)
{
    testing::internal::CaptureStdout();
    fn();
    return testing::internal::GetCapturedStdout();
}
template <class Fn>
std::string capture_stderr(Fn fn)
{
    testing::internal::CaptureStderr();
    fn();
    return testing::internal::GetCapturedStderr();
}

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

}  // namespace korv_test
