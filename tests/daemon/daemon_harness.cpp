// SPDX-License-Identifier: Apache-2.0
// The appliance in a test root, the daemon as a real process, isnsadm's view.
#include "tests/daemon/daemon_harness.h"

#include <sys/syscall.h>
#include <unistd.h>

#include <cstdlib>
#include <sstream>

#include <gtest/gtest.h>

#include "platform/platform_util.h"
#include "tests/support/isns_isnsd.h"
#include "tests/support/xmldbd_fixture.h"

namespace korv_test {

namespace {
constexpr const char *kConfigfsIscsi = "/sys/kernel/config/target/iscsi";
}  // namespace

void set_host_name(const std::string &name) { SysRoot::write("/proc/sys/kernel/hostname", name + "\n"); }

void store_targets(const std::string &entity_id, const std::vector<target_spec> &targets)
{
    // The reader's walk ends only at an entry without a name: nothing an
    // earlier call stored may stay beyond the list.
    ASSERT_EQ(0, dbDelete("/iscsi/target"));
    ASSERT_EQ(0, dbSetStr(kPrefix, "/iscsi/target/iqn_prefix"));
    ASSERT_EQ(0, dbSetLL(1, "/iscsi/target/dbg"));
    for (size_t i = 0; i < targets.size(); ++i) {
        std::string base = "/iscsi/target/id:" + std::to_string(i + 1) + "/";
        ASSERT_EQ(0, dbSetStr(targets[i].name.c_str(), (base + "name").c_str()));
        ASSERT_EQ(0, dbSetLL(targets[i].tpgt, (base + "tpgt").c_str()));
    }
    ASSERT_EQ(0, dbSetLL(static_cast<long long>(targets.size()), "/iscsi/target/count"));

    SysRoot::remove(kConfigfsIscsi);
    for (const target_spec &t : targets) {
        std::string np = std::string(kConfigfsIscsi) + "/" + target_iqn(entity_id, t.name) +
                         "/tpgt_" + std::to_string(t.tpgt) + "/np";
        for (size_t i = 0; t.in_kernel && i <= t.portals.size(); ++i)
            SysRoot::mkdirs(i ? np + "/" + t.portals[i - 1] : np);
    }
}

long long stored_pid()
{
    int rc = 0;
    const std::string pid = xmldb_get("/system_mgr/iscsi/iSNS/pid", &rc);
    return rc < 0 ? -1 : std::atoll(pid.c_str());
}


std::set<std::string> isnsadm_rows(const isnsd_server &srv, const std::string &what, const std::string &key)
{
    // isnsadm prints one "<tag and type>: <name> = <value>" line per
    // attribute; the string values read here are quoted.
    std::set<std::string> values;
    std::istringstream in(srv.adm("--list " + what));
    const std::string marker = ": " + key + " = \"";
    for (std::string line; std::getline(in, line);)
        if (const size_t at = line.find(marker); at != std::string::npos && line.back() == '"')
            values.insert(line.substr(at + marker.size(), line.size() - at - marker.size() - 1));
    return values;
}

daemon_process::daemon_process(const std::string &binary, const std::string &server)
{
    char tmpl[] = "/tmp/nesrad-log-XXXXXX";
    const int fd = mkstemp(tmpl);
    EXPECT_GE(fd, 0) << "mkstemp";
    close(fd);
    log_ = tmpl;
    // Nothing of ours (the database client's connection) goes to the daemon.
    start({binary, server}, log_, [] { close_range(3, ~0U, 0); });
}

daemon_process::~daemon_process()
{
    kill();
    unlink(log_.c_str());
}

std::string daemon_process::output() const { return SysRootTest::read_file(log_); }

int daemon_process::count(const std::string &text) const
{
    std::string out = output();
    int n = 0;
    for (size_t at = out.find(text); at != std::string::npos; at = out.find(text, at + text.size()))
        ++n;
    return n;
}

bool daemon_process::wait_for(const std::string &text, std::chrono::milliseconds limit, int n) const
{
    return eventually([&] { return count(text) >= n; }, limit);
}

bool daemon_process::idle() const
{
    // "<number> <arguments...>" while blocked in a system call, "running" otherwise.
    std::istringstream in(SysRootTest::read_file("/proc/" + std::to_string(pid()) + "/syscall"));
    long nr = -1;
    std::string fds, nfds;
    return in >> nr >> fds >> nfds && nr == SYS_ppoll && nfds == "0x0";
}

}  // namespace korv_test
