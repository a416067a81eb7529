// Temporary system roots and real xmldbd processes for tests.
#include "tests/support/xmldbd_fixture.h"

#include "common/korvadm_sysroot.h"
#include "platform/xmldbc.h"

#include <cerrno>
#include <chrono>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <fstream>
#include <ftw.h>
#include <poll.h>
#include <sstream>
#include <stdexcept>
#include <sys/prctl.h>
#include <sys/stat.h>
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

namespace {

pid_t g_root_owner = 0;

int rm_entry(const char *p, const struct stat *, int, FTW *)
{
    ::remove(p);
    return 0;
}

void rm_tree(const std::string &p)
{
    ::nftw(p.c_str(), rm_entry, 32, FTW_DEPTH | FTW_PHYS);
}

void remove_root_at_exit()
{
    // Forked children exit through here too: only the creator cleans up.
    if (::getpid() == g_root_owner)
        rm_tree(SysRoot::path());
}

void mkdirs_real(const std::string &dir)
{
    for (size_t i = 1; i <= dir.size(); ++i)
        if (i == dir.size() || dir[i] == '/')
            ::mkdir(dir.substr(0, i).c_str(), 0755);
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
    mkdirs_real(file(abs));
}

void SysRoot::write(const std::string &abs, const std::string &content)
{
    std::string f = file(abs);
    mkdirs_real(f.substr(0, f.rfind('/')));
    std::ofstream(f, std::ios::binary | std::ios::trunc) << content;
}

std::string SysRoot::read(const std::string &abs)
{
    std::ifstream in(file(abs), std::ios::binary);
    std::ostringstream s;
    s << in.rdbuf();
    return s.str();
}

void SysRoot::remove(const std::string &abs)
{
    rm_tree(file(abs));
}

std::string xmldbd_binary() { return KORV_XMLDBD_PATH; }
std::string xmldbc_binary() { return KORV_XMLDBC_PATH; }

XmldbProcess::XmldbProcess(std::string socket, std::string load_file)
    : socket_(std::move(socket)), load_(std::move(load_file))
{
}

XmldbProcess::~XmldbProcess()
{
    stop();
}

void XmldbProcess::start()
{
    if (pid_ > 0)
        return;
    std::vector<std::string> args = {xmldbd_binary(), "--socket", socket_, "--ready-fd", "3"};
    if (!load_.empty()) {
        args.push_back("--load");
        args.push_back(load_);
    }
    std::vector<char *> argv;
    for (auto &a : args)
        argv.push_back(a.data());
    argv.push_back(nullptr);

    int p[2];
    if (::pipe2(p, O_CLOEXEC) != 0)
        throw std::runtime_error("pipe: " + std::string(std::strerror(errno)));
    pid_t parent = ::getpid();
    pid_t pid = ::fork();
    if (pid < 0) {
        ::close(p[0]);
        ::close(p[1]);
        throw std::runtime_error("fork: " + std::string(std::strerror(errno)));
    }
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
    pollfd pfd{p[0], POLLIN, 0};
    char c = 0;
    int n = ::poll(&pfd, 1, 10000);
    ssize_t got = n > 0 ? ::read(p[0], &c, 1) : -1;
    ::close(p[0]);
    if (got != 1) {
        kill();
        throw std::runtime_error("xmldbd did not come up on " + socket_);
    }
}

void XmldbProcess::kill(int sig)
{
    if (pid_ <= 0)
        return;
    ::kill(pid_, sig);
    int st;
    while (::waitpid(pid_, &st, 0) < 0 && errno == EINTR) {
    }
    pid_ = -1;
}

int XmldbProcess::stop()
{
    if (pid_ <= 0)
        return -1;
    ::kill(pid_, SIGTERM);
    auto until = std::chrono::steady_clock::now() + std::chrono::seconds(5);
    int st = 0;
    for (;;) {
        pid_t r = ::waitpid(pid_, &st, WNOHANG);
        if (r == pid_ || (r < 0 && errno != EINTR)) {
            pid_ = -1;
            if (r < 0)
                return -1;
            return WIFEXITED(st) ? WEXITSTATUS(st) : 128 + WTERMSIG(st);
        }
        if (std::chrono::steady_clock::now() > until) {
            kill(SIGKILL);  // a hung service must not hang the test
            return 128 + SIGKILL;
        }
        ::usleep(2000);
    }
}

XmldbService::XmldbService(bool sysinfo, std::string load_file)
    : with_sysinfo_(sysinfo),
      config_(SysRoot::file(XMLDB_SOCK_ISCSI), std::move(load_file)),
      sysinfo_(SysRoot::file(XMLDB_SOCK_SYSINFO))
{
    config_.start();
    if (with_sysinfo_)
        sysinfo_.start();
}

XmldbProcess &XmldbService::sysinfo()
{
    if (!with_sysinfo_)
        throw std::logic_error("XmldbService: sysinfo service not requested");
    return sysinfo_;
}

void XmldbService::restart()
{
    config_.stop();
    config_.start();
}

}  // namespace korv_test
