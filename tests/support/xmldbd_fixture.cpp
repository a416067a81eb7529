// Temporary system roots and real xmldbd processes for tests.
#include "tests/support/xmldbd_fixture.h"

#include "common/korvadm_sysroot.h"
#include "platform/xmldbc.h"

#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <filesystem>
#include <fstream>
#include <iterator>
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

namespace fs = std::filesystem;

namespace {

pid_t g_root_owner = 0;
std::error_code ec_ignored;  // a test's files may already be gone

void remove_root_at_exit()
{
    // Forked children exit through here too: only the creator cleans up.
    if (::getpid() == g_root_owner)
        fs::remove_all(SysRoot::path(), ec_ignored);
}

}  // namespace

const std::string &SysRoot::path()
{
    // Leaked on purpose: the exit handler below needs it after static destructors.
    static const std::string &root = *new std::string([] {
        char tmpl[] = "/tmp/korv-root-XXXXXX";
        if (!::mkdtemp(tmpl)) {
            std::perror("mkdtemp");
            std::abort();
        }
        std::string r = tmpl;
        ::setenv(KORV_SYSROOT_ENV, r.c_str(), 1);
        if (r != sysroot_prefix()) {
            std::fprintf(stderr, "SysRoot: the system root was read before the test set it (\"%s\")\n",
                         sysroot_prefix());
            std::abort();
        }
        g_root_owner = ::getpid();
        std::atexit(remove_root_at_exit);
        return r;
    }());
    return root;
}

std::string SysRoot::file(const std::string &abs)
{
    return path() + abs;
}

void SysRoot::mkdirs(const std::string &abs)
{
    fs::create_directories(file(abs), ec_ignored);
}

void SysRoot::write(const std::string &abs, const std::string &content)
{
    const fs::path f = file(abs);
    fs::create_directories(f.parent_path(), ec_ignored);
    std::ofstream(f, std::ios::binary | std::ios::trunc) << content;
}

std::string SysRoot::read(const std::string &abs)
{
    std::ifstream in(file(abs), std::ios::binary);
    return {std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>()};
}

void SysRoot::remove(const std::string &abs)
{
    fs::remove_all(file(abs), ec_ignored);
}

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
