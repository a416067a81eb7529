// SPDX-License-Identifier: Apache-2.0
// Real xmldbd processes for tests.
#include "tests/support/xmldbd_fixture.h"

#include <fcntl.h>
#include <poll.h>
#include <unistd.h>

#include <stdexcept>

#include "platform/xmldbc.h"

namespace korv_test {

XmldbProcess::~XmldbProcess()
{
    if (ready_fd_ >= 0)
        ::close(ready_fd_);
}

void XmldbProcess::start()
{
    if (pid() > 0)
        return;
    spawn();
    if (!ready()) {
        kill();
        throw std::runtime_error("xmldbd did not come up on " + socket_);
    }
}

void XmldbProcess::spawn()
{
    int p[2];
    if (pid() > 0 || ::pipe2(p, O_CLOEXEC) != 0)
        return;
    std::vector<std::string> args = {xmldbd_binary(), "--socket", socket_, "--ready-fd", "3"};
    args.insert(args.end(), options_.begin(), options_.end());
    // Descriptor 3 without close-on-exec, whichever number the pipe got.
    proc_.start(args, {}, [&] { p[1] == 3 ? ::fcntl(3, F_SETFD, 0) : ::dup2(p[1], 3); });
    ::close(p[1]);
    ready_fd_ = p[0];
}

bool XmldbProcess::ready()
{
    pollfd pfd{ready_fd_, POLLIN, 0};
    char c = 0;
    const bool up = ::poll(&pfd, 1, 10000) > 0 && ::read(ready_fd_, &c, 1) == 1;
    ::close(ready_fd_);
    ready_fd_ = -1;
    return up;
}

std::string xmldb_get(const std::string &path, int *rc)
{
    char buf[512];
    const int r = xmldbc_get_wb(XMLDB_SOCK_ISCSI, 0, path.c_str(), buf, sizeof buf);
    if (rc)
        *rc = r;
    return r < 0 ? "<failed>" : buf;
}

XmldbService::XmldbService(bool sysinfo, std::string load_file)
    : config_(SysRoot::file(XMLDB_SOCK_ISCSI),
              load_file.empty() ? std::vector<std::string>{"--empty"} : std::vector<std::string>{"--load", load_file}),
      sysinfo_(SysRoot::file(XMLDB_SOCK_SYSINFO))
{
    config_.start();
    if (sysinfo)
        sysinfo_.start();
}

}  // namespace korv_test
