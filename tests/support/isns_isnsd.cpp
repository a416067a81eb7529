// SPDX-License-Identifier: Apache-2.0
#include "tests/support/isns_isnsd.h"

#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <thread>

#include "tests/support/isns_test_server.h"

namespace korv_test {

namespace {

std::string find_tool(const char *name)
{
    for (const char *dir : {"/usr/sbin/", "/usr/bin/", "/sbin/", "/bin/"})
        if (access((std::string(dir) + name).c_str(), X_OK) == 0)
            return std::string(dir) + name;
    return {};
}

}  // namespace

bool isnsd_available()
{
    return !find_tool("isnsd").empty() && !find_tool("isnsadm").empty();
}

isnsd_server::isnsd_server(std::string address, int registration_period)
    : address_(std::move(address)), period_(registration_period)
{
    char tmpl[] = "/tmp/korv-isnsd-XXXXXX";
    if (mkdtemp(tmpl))
        dir_ = tmpl;
    else
        error_ = "mkdtemp failed";
}

isnsd_server::~isnsd_server()
{
    stop();
    if (!dir_.empty())
        (void)!std::system(("rm -rf '" + dir_ + "'").c_str());
}

bool isnsd_server::start()
{
    if (dir_.empty())
        return false;
    if (proc_.pid() > 0)
        return true;
    if (tcp_port_open(address_, 3205)) {
        error_ = "port 3205 on " + address_ + " is already held by another server";
        return false;
    }
    const bool v6 = address_.find(':') != std::string::npos;
    {
        std::ofstream conf(dir_ + "/isnsd.conf");
        conf << "SourceName = iqn.2026-01.test:isnsd\n"
             << "BindAddress = " << (v6 ? "[" + address_ + "]" : address_) << "\n"
             << "PIDFile = " << dir_ << "/isnsd.pid\n"
             << "ControlSocket = " << dir_ << "/isnsctl\n"
             << "LocalRegistry = " << dir_ << "/isns.registry\n"
             << "Security = 0\nSLPRegister = 0\nDefaultDiscoveryDomain = 1\n"
             << "RegistrationPeriod = " << period_ << "s\nESIRetries = 0\n";
        std::ofstream adm(dir_ + "/isnsadm.conf");
        adm << "SourceName = iqn.2026-01.test:isnsadm\n"
            << "ControlSocket = " << dir_ << "/isnsctl\n"
            << "Security = 0\n";
    }
    const std::string conf = dir_ + "/isnsd.conf", log = dir_ + "/isnsd.log";
    if (!proc_.start({find_tool("isnsd"), "-f", "-c", conf}, [&] {
            if (FILE *out = std::freopen(log.c_str(), "a", stdout))
                dup2(fileno(out), STDERR_FILENO);
        })) {
        error_ = "fork failed";
        return false;
    }
    for (int i = 0; i < 1000; i++) {  // about 5 s
        if (!proc_.running()) {
            std::ifstream in(log);
            error_ = "isnsd exited at start: " + std::string(std::istreambuf_iterator<char>(in), {});
            return false;
        }
        if (tcp_port_open(address_, 3205) && access((dir_ + "/isnsctl").c_str(), F_OK) == 0)
            return true;
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
    error_ = "isnsd did not accept connections within 5 s";
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
    const std::string cmd = find_tool("isnsadm") + " -c '" + dir_ + "/isnsadm.conf' --local " + args + " 2>&1";
    std::string out;
    std::fflush(nullptr);
    if (FILE *p = popen(cmd.c_str(), "r")) {
        char buf[4096];
        for (size_t n; (n = std::fread(buf, 1, sizeof buf, p)) > 0;)
            out.append(buf, n);
        pclose(p);
    }
    return out;
}

}  // namespace korv_test
