// Real xmldbd processes for tests.
#include "tests/support/xmldbd_fixture.h"

#include "platform/xmldbc.h"

#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <poll.h>
#include <stdexcept>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>
#include <vector>

#ifndef KORV_XMLDBD_PATH
#define KORV_XMLDBD_PATH "xmldbd"
#endif
#ifndef KORV_XMLDBC_PATH
#define KORV_XMLDBC_PATH "xmldbc"
#endif

namespace korv_test {

std::string xmldbd_binary() { return KORV_XMLDBD_PATH; }
std::string xmldbc_binary() { return KORV_XMLDBC_PATH; }

XmldbProcess::XmldbProcess(std::string socket, std::vector<std::string> options)
    : socket_(std::move(socket)), options_(std::move(options))
{
}

XmldbProcess::~XmldbProcess()
{
    if (ready_fd_ >= 0)
        ::close(ready_fd_);
    stop();
}

void XmldbProcess::start()
{
    if (pid_ > 0)
        return;
    spawn();
    if (!ready()) {
        kill();
        throw std::runtime_error("xmldbd did not come up on " + socket_);
    }
}

void XmldbProcess::spawn()
{
    if (pid_ > 0)
        return;
    std::vector<std::string> args = {xmldbd_binary(), "--socket", socket_, "--ready-fd", "3"};
    args.insert(args.end(), options_.begin(), options_.end());
    std::vector<char *> argv;
    for (auto &a : args)
        argv.push_back(a.data());
    argv.push_back(nullptr);

    int p[2];
    if (::pipe2(p, O_CLOEXEC) != 0)
        throw std::runtime_error("pipe: " + std::string(std::strerror(errno)));
    const pid_t parent = ::getpid(), pid = ::fork();
    if (pid == 0) {
        // Never outlive the test that started us.
        ::prctl(PR_SET_PDEATHSIG, SIGKILL);
        if (::getppid() != parent)
            ::_exit(127);
        if (p[1] == 3)
            ::fcntl(3, F_SETFD, 0);
        else
            ::dup2(p[1], 3);
        ::execv(argv[0], argv.data());
        ::_exit(127);
    }
    ::close(p[1]);
    pid_ = pid;
    ready_fd_ = p[0];
}

bool XmldbProcess::ready()
{
    pollfd pfd{ready_fd_, POLLIN, 0};
    char c = 0;
    const ssize_t got = ::poll(&pfd, 1, 10000) > 0 ? ::read(ready_fd_, &c, 1) : -1;
    ::close(ready_fd_);
    ready_fd_ = -1;
    return got == 1;
}

void XmldbProcess::kill()
{
    if (pid_ <= 0)
        return;
    ::kill(pid_, SIGKILL);
    ::waitpid(pid_, nullptr, 0);
    pid_ = -1;
}

int XmldbProcess::stop()
{
    if (pid_ <= 0)
        return -1;
    ::kill(pid_, SIGTERM);
    int st = 0;
    for (int i = 0; ::waitpid(pid_, &st, WNOHANG) == 0; ++i) {
        if (i == 2500) {  // about 5 s: a hung service must not hang the test
            kill();
            return 128 + SIGKILL;
        }
        ::usleep(2000);
    }
    pid_ = -1;
    return WIFEXITED(st) ? WEXITSTATUS(st) : 128 + WTERMSIG(st);
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

void XmldbService::restart()
{
    config_.stop();
    config_.start();
}

}  // namespace korv_test
