// SPDX-License-Identifier: Apache-2.0
// Real xmldbd services serving the configuration (and system-information)
// databases in the test process's system root (sysroot.h).
//
//   korv_test::XmldbService db;       configuration database, empty tree
//   korv_test::XmldbService db(korv_test::kWithSysinfo);   plus the sysinfo database
//
// Each service starts with an empty tree, also when test cases share the root.
#pragma once

#include <sys/types.h>

#include <string>
#include <vector>

#include "tests/support/process.h"
#include "tests/support/sysroot.h"

namespace korv_test {

// Path of the built xmldbd and xmldbc executables.
inline std::string xmldbd_binary() { return KORV_XMLDBD_PATH; }
inline std::string xmldbc_binary() { return KORV_XMLDBC_PATH; }

// XmldbService's first argument: also serve "/var/run/xmldb_sock_sysinfo".
inline constexpr bool kWithSysinfo = true;

// One xmldbd process on a socket (a mapped path) with its command-line
// options (by default an empty tree).
class XmldbProcess {
public:
    explicit XmldbProcess(std::string socket, std::vector<std::string> options = {"--empty"})
        : socket_(std::move(socket)), options_(std::move(options)) {}
    ~XmldbProcess();

    // Starts the service (no-op when running); returns when it is serving.
    // Throws std::runtime_error when it does not come up within 10 s.
    void start();
    // The same in two steps: spawn() returns at once, ready() waits up to
    // 10 s and is false when the service exited (or hung) instead.
    void spawn();
    bool ready();
    // SIGTERM and wait; the service removes its socket. Returns its exit
    // status (128+N when killed by signal N, also after the 5 s grace
    // SIGKILL), or -1 when it was not running.
    int stop() { return proc_.stop(); }
    // SIGKILL and reap, as a crash would: the socket stays behind.
    void kill() { proc_.kill(); }
    pid_t pid() const { return proc_.pid(); }

private:
    std::string socket_;
    std::vector<std::string> options_;
    child_process proc_;
    int ready_fd_ = -1;
};

// The value at path in the configuration database, "<failed>" when the call
// fails; rc (if given) gets xmldbc_get_wb's result.
std::string xmldb_get(const std::string &path, int *rc = nullptr);

// The configuration database service (and optionally the sysinfo one) in the
// process's SysRoot, each with an empty tree; load_file (a real path) is an
// XML file the configuration service loads at every start instead.
class XmldbService {
public:
    explicit XmldbService(bool sysinfo = false, std::string load_file = {});

    XmldbProcess &config() { return config_; }

    // Stops (SIGTERM) / kills (SIGKILL) / restarts the configuration service.
    // A restart begins with an empty tree unless load_file was given.
    int stop() { return config_.stop(); }
    void kill() { config_.kill(); }
    void restart()
    {
        config_.stop();
        config_.start();
    }

private:
    XmldbProcess config_;
    XmldbProcess sysinfo_;
};

}  // namespace korv_test
