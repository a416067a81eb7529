// SPDX-License-Identifier: Apache-2.0
// What the daemon's tests stand on: an appliance in the test's system root
// (host name, stored targets and IQN prefix, the kernel's portal directories),
// the daemon run as a real process with its output in a file, and what an
// isnsd holds as isnsadm lists it. The VM suite uses the process and listing
// parts against the real root.
#pragma once

#include <set>
#include <string>
#include <vector>

#include "tests/support/process.h"

namespace korv_test {

class isnsd_server;

// The IQN prefix the tests store; neutral domain.
inline constexpr const char *kPrefix = "iqn.2026-01.org.example:";

struct target_spec {
    std::string name;
    int tpgt = 1;
    // np/ entries as the kernel names them
    std::vector<std::string> portals{"192.0.2.10:3260", "[2001:db8::10]:3260"};
    bool in_kernel = true;  // false: no configfs directory at all
};

// Writes "<root>/proc/sys/kernel/hostname".
void set_host_name(const std::string &name);

// Stores the IQN prefix, debug level 1 and the targets (entries 1..n,
// anything stored beyond them removed) in the running configuration
// service, and creates each target's portal directories for the IQN the
// daemon will build for host `entity_id`. Previous portal directories go.
void store_targets(const std::string &entity_id, const std::vector<target_spec> &targets);

// prefix + entity_id + ":" + target.
inline std::string target_iqn(const std::string &eid, const std::string &name) { return kPrefix + eid + ":" + name; }

// The stored daemon pid ("/system_mgr/iscsi/iSNS/pid"); -1 when unreadable.
long long stored_pid();

// The installed daemon and the test-only one (same loop, short interval).
inline std::string nesrad_binary() { return NESRAD_BIN; }
inline std::string nesrad_test_binary() { return NESRAD_TEST_BIN; }
// Interval of the test-only daemon, seconds.
inline constexpr int kTestInterval = NESRAD_TEST_INTERVAL;

// The values of attribute `key` in `isnsadm --list <what>` (quotes stripped).
std::set<std::string> isnsadm_rows(const isnsd_server &srv, const std::string &what, const std::string &key);

// The daemon as a child process (pid(), signal(), wait() for its exit status)
// with its standard output and error in a file.
class daemon_process : public child_process {
public:
    // Runs `binary server`; env as ours.
    daemon_process(const std::string &binary, const std::string &server);
    ~daemon_process();  // SIGKILLs a daemon still running

    // Everything the daemon printed so far.
    std::string output() const;
    // Occurrences of `text` in the output.
    int count(const std::string &text) const;
    // Waits until the output holds `text` at least n times.
    bool wait_for(const std::string &text, std::chrono::milliseconds limit, int n = 1) const;
    // True while it sleeps between passes (its wait: ppoll on no descriptor),
    // not in an exchange, a start-up step or a lock wait.
    bool idle() const;

private:
    std::string log_;
};

}  // namespace korv_test
