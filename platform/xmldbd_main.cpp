// SPDX-License-Identifier: Apache-2.0
// xmldbd: the configuration database service. One tree, one Unix socket, one
// thread; requests from every client are served one at a time in arrival order.
// This file: the command line and the process.
#include "common/korvadm_sysroot.h"
#include "platform/xmldbc.h"
#include "platform/xmldbd_internal.h"

#include <climits>
#include <cstdarg>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <getopt.h>
#include <string>
#include <utility>

namespace xmldbd {

volatile sig_atomic_t g_stop = 0;

void say(const char *fmt, ...) __attribute__((format(printf, 1, 2)));
void say(const char *fmt, ...)
{
    va_list ap;
    va_start(ap, fmt);
    std::fputs("xmldbd: ", stderr);
    std::vfprintf(stderr, fmt, ap);
    std::fputc('\n', stderr);
    va_end(ap);
}

}  // namespace xmldbd

namespace {

using xmldbd::Options;
using xmldbd::say;

constexpr const char *kDefaultAllowDir = "/etc/NAS_CFG";
constexpr const char *kDefaultLoad = "/etc/NAS_CFG/config.xml";

void on_stop(int) { xmldbd::g_stop = 1; }

void usage(FILE *to)
{
    std::fprintf(to,
        "usage: xmldbd [--socket PATH] [--load FILE | --empty] [--allow-dir DIR]... [--ready-fd N]\n"
        "       xmldbd --help | --version\n"
        "Serves one configuration database tree on a Unix socket.\n"
        "  --socket PATH     socket to serve (default %s under the system root)\n"
        "  --load FILE       the saved tree to load at start (default %s under the\n"
        "                    system root); a missing file starts empty, a file that\n"
        "                    does not load stops the service\n"
        "  --empty           start with an empty tree, loading nothing\n"
        "  --allow-dir DIR   a directory clients may save into (repeatable;\n"
        "                    default %s under the system root)\n"
        "  --ready-fd N      write one byte to descriptor N and close it once serving\n"
        "Paths given here are used as they are. SIGTERM/SIGINT: finish the request\n"
        "in hand, remove the socket, exit 0.\n",
        XMLDB_SOCK_ISCSI, kDefaultLoad, kDefaultAllowDir);
}

// 0 parsed, 1 exit successfully (help, version), 2 usage error.
int parse_args(int argc, char **argv, Options &o)
{
    static const option longs[] = {
        {"socket", required_argument, nullptr, 's'},
        {"load", required_argument, nullptr, 'l'},
        {"empty", no_argument, nullptr, 'e'},
        {"allow-dir", required_argument, nullptr, 'a'},
        {"ready-fd", required_argument, nullptr, 'r'},
        {"help", no_argument, nullptr, 'h'},
        {"version", no_argument, nullptr, 'V'},
        {nullptr, 0, nullptr, 0},
    };
    int c;
    while ((c = getopt_long(argc, argv, "s:l:ea:r:h", longs, nullptr)) != -1) {
        switch (c) {
        case 's': o.socket = optarg; break;
        case 'l': o.load = optarg; break;
        case 'e': o.empty = true; break;
        case 'a': o.allow_dirs.emplace_back(optarg); break;
        case 'r': {
            char *end = nullptr;
            long v = std::strtol(optarg, &end, 10);
            if (*optarg == '\0' || *end != '\0' || v < 0 || v > INT_MAX) {
                say("bad --ready-fd \"%s\"", optarg);
                return 2;
            }
            o.ready_fd = static_cast<int>(v);
            break;
        }
        case 'h': usage(stdout); return 1;
        case 'V': std::puts("xmldbd " KORV_VERSION); return 1;
        default: usage(stderr); return 2;
        }
    }
    if (optind != argc) {
        say("unexpected argument \"%s\"", argv[optind]);
        usage(stderr);
        return 2;
    }
    if (o.empty && !o.load.empty()) {
        say("--load and --empty exclude each other");
        return 2;
    }
    if (o.socket.empty())
        o.socket = sysroot_path(XMLDB_SOCK_ISCSI);
    if (!o.empty && o.load.empty())
        o.load = sysroot_path(kDefaultLoad);
    if (o.allow_dirs.empty())
        o.allow_dirs.push_back(sysroot_path(kDefaultAllowDir));
    return 0;
}

}  // namespace

int main(int argc, char **argv)
{
    Options o;
    int rc = parse_args(argc, argv, o);
    if (rc != 0)
        return rc == 1 ? 0 : 2;

    struct sigaction sa{};
    sa.sa_handler = on_stop;
    sigemptyset(&sa.sa_mask);
    sigaction(SIGTERM, &sa, nullptr);
    sigaction(SIGINT, &sa, nullptr);
    signal(SIGPIPE, SIG_IGN);
    sigset_t block;
    sigemptyset(&block);
    sigaddset(&block, SIGTERM);
    sigaddset(&block, SIGINT);
    sigprocmask(SIG_BLOCK, &block, nullptr);  // delivered only inside ppoll

    return xmldbd::Service(std::move(o)).run();
}
