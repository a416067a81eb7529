// SPDX-License-Identifier: Apache-2.0
#include "tests/support/isns_isnsd.h"

#include <unistd.h>

#include <filesystem>
#include <fstream>

#include "tests/support/isns_test_server.h"
#include "tests/support/sysroot.h"

namespace korv_test {

namespace {
constexpr const char *kIsnsd = "/usr/sbin/isnsd", *kIsnsadm = "/usr/sbin/isnsadm";
}  // namespace

bool isnsd_available() { return access(kIsnsd, X_OK) == 0 && access(kIsnsadm, X_OK) == 0; }

isnsd_server::isnsd_server(std::string address, int registration_period)
    : address_(std::move(address)), period_(registration_period)
{
    char tmpl[] = "/tmp/korv-isnsd-XXXXXX";
    dir_ = mkdtemp(tmpl) ? tmpl : "";
}

isnsd_server::~isnsd_server()
{
    stop();
    std::error_code ignored;
    std::filesystem::remove_all(dir_, ignored);
}

bool isnsd_server::start()
{
    if (proc_.pid() > 0)
        return true;
    if (dir_.empty() || tcp_port_open(address_, 3205)) {
        error_ = dir_.empty() ? "mkdtemp failed" : "port 3205 on " + address_ + " is already held by another server";
        return false;
    }
    const bool v6 = address_.find(':') != std::string::npos;
    std::ofstream(dir_ + "/isnsd.conf")
        << "SourceName = iqn.2026-01.test:isnsd\n"
        << "BindAddress = " << (v6 ? "[" + address_ + "]" : address_) << "\n"
        << "PIDFile = " << dir_ << "/isnsd.pid\n"
        << "ControlSocket = " << dir_ << "/isnsctl\n"
        << "LocalRegistry = " << dir_ << "/isns.registry\n"
        << "Security = 0\nSLPRegister = 0\nDefaultDiscoveryDomain = 1\n"
        << "RegistrationPeriod = " << period_ << "s\nESIRetries = 0\n";
    std::ofstream(dir_ + "/isnsadm.conf") << "SourceName = iqn.2026-01.test:isnsadm\n"
                                          << "ControlSocket = " << dir_ << "/isnsctl\n"
                                          << "Security = 0\n";
    const std::string log = dir_ + "/isnsd.log";
    proc_.start({kIsnsd, "-f", "-c", dir_ + "/isnsd.conf"}, log);
    const bool up = eventually([&] {
        return !proc_.running() || (tcp_port_open(address_, 3205) && access((dir_ + "/isnsctl").c_str(), F_OK) == 0);
    }, std::chrono::seconds(5));
    if (up && proc_.running())
        return true;
    error_ = (up ? "isnsd exited at start: " : "isnsd did not accept connections within 5 s: ") +
             SysRootTest::read_file(log);
    stop();
    return false;
}

void isnsd_server::stop()
{
    if (proc_.stop() < 0)
        return;
    unlink((dir_ + "/isnsd.pid").c_str());
    unlink((dir_ + "/isnsctl").c_str());
}

std::string isnsd_server::adm(const std::string &args) const
{
    return run_shell(std::string(kIsnsadm) + " -c '" + dir_ + "/isnsadm.conf' --local " + args + " 2>&1");
}

}  // namespace korv_test
