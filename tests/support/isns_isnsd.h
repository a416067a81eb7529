// SPDX-License-Identifier: Apache-2.0
// Debian's Open-iSNS server (isnsd) as a private iSNS peer for tests.
//
// isnsd_server runs one isnsd in the foreground, bound to one loopback
// address on port 3205, with everything (config, pid file, control socket,
// registry) in its own temporary directory, no authentication, no
// registration expiry unless a period is given, and an in-memory database (a
// restart empties it). It
// is stopped (SIGTERM) by stop() or the destructor; a server it did not start
// is never touched.
//
// adm() runs isnsadm against it through the control socket, e.g.
// adm("--list nodes") or adm("--query eid=nas1"), and returns the output.
//
// Typical use:
//   korv_test::isnsd_server srv("127.10.3.1");
//   if (!korv_test::isnsd_available()) GTEST_SKIP() << "isnsd not installed";
//   ASSERT_TRUE(srv.start()) << srv.error();
//   ... srv.adm("--list portals") ...
#pragma once

#include <string>

#include "tests/support/process.h"

namespace korv_test {

// True when isnsd and isnsadm are installed.
bool isnsd_available();

class isnsd_server {
public:
    // address: IPv4 ("127.10.3.1") or IPv6 ("::1") text; registration_period:
    // seconds after which an entity that neither registers nor queries
    // expires (0: never). Nothing starts yet.
    explicit isnsd_server(std::string address, int registration_period = 0);
    ~isnsd_server();

    // Starts isnsd and waits (up to 5 s) until it accepts connections.
    // false, with error(), when it cannot start or the port is already held.
    bool start();
    // SIGTERM and wait; no-op when not running.
    void stop();
    // stop() then start(): an empty database.
    bool restart() { stop(); return start(); }
    const std::string &error() const { return error_; }

    // Runs "isnsadm -c <conf> --local <args>"; returns stdout and stderr.
    std::string adm(const std::string &args) const;

private:
    std::string address_;
    int period_;
    std::string dir_;
    std::string error_;
    child_process proc_;
};

}  // namespace korv_test
