// SPDX-License-Identifier: Apache-2.0
// xmldbc: the configuration database from the command line, for operators
// and scripts.
#include "common/korvadm_sysroot.h"
#include "platform/xmldb_client.h"
#include "platform/xmldbc.h"

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <thread>

namespace {

constexpr const char *kDefaultFile = "/etc/NAS_CFG/config.xml";

void usage(FILE *to)
{
    std::fprintf(to,
        "usage: xmldbc [-s SOCKET | --sysinfo] COMMAND [ARG...]\n"
        "       xmldbc --help | --version\n"
        "Reads and changes the configuration database served by xmldbd.\n"
        "\n"
        "  get PATH          print the value at PATH (empty when missing)\n"
        "  set PATH VALUE    store VALUE at PATH, creating parents\n"
        "  del PATH          remove PATH and everything under it\n"
        "  dump [PATH]       list the subtree at PATH (default /), one node a line\n"
        "  save [FILE]       write the whole tree to FILE (default %s)\n"
        "  load FILE         replace the whole tree with FILE's\n"
        "  wait [SECONDS]    wait until the service answers (default 5 s)\n"
        "\n"
        "  -s SOCKET         the service's socket (default %s)\n"
        "  --sysinfo         use the system-information socket (%s)\n"
        "Socket and file paths are fixed system paths: NESRAD_SYSROOT, when set,\n"
        "is put in front of them. Exit status: 0 success, 1 failure, 2 usage.\n",
        kDefaultFile, XMLDB_SOCK_ISCSI, XMLDB_SOCK_SYSINFO);
}

int fail(const std::string &msg)
{
    std::fprintf(stderr, "xmldbc: %s\n", msg.c_str());
    return 1;
}

int usage_error(const char *msg)
{
    std::fprintf(stderr, "xmldbc: %s\n", msg);
    usage(stderr);
    return 2;
}

int run(const std::string &sock, xmldb::Op op, const std::string &path, const std::string &value, bool print)
{
    std::string data;
    switch (xmldb::call(sock, op, path, value, data)) {
    case xmldb::CallResult::Ok:
        if (print)
            std::fwrite(data.data(), 1, data.size(), stdout);
        return 0;
    case xmldb::CallResult::Refused:
        return fail("refused: " + data);
    case xmldb::CallResult::Unreachable:
        break;
    }
    return fail(data);
}

int wait_ready(const std::string &sock, const char *arg)
{
    double secs = 5;
    if (arg) {
        char *end = nullptr;
        secs = std::strtod(arg, &end);
        if (*arg == '\0' || *end != '\0' || !(secs >= 0 && secs <= 3600))
            return usage_error("wait: SECONDS must be a number from 0 to 3600");
    }
    auto deadline = xmldb::Clock::now() + std::chrono::milliseconds(static_cast<long long>(secs * 1000));
    std::string data;
    for (;;) {
        if (xmldb::call(sock, xmldb::Op::Ping, "/", "", data) == xmldb::CallResult::Ok)
            return 0;
        if (xmldb::Clock::now() >= deadline)
            return fail("no service on " + sock + ": " + data);
        std::this_thread::sleep_for(std::chrono::milliseconds(20));
    }
}

bool absolute(const char *p) { return p && p[0] == '/'; }

}  // namespace

int main(int argc, char **argv)
{
    const char *sock = XMLDB_SOCK_ISCSI;
    int i = 1;
    for (; i < argc && argv[i][0] == '-'; ++i) {
        std::string a = argv[i];
        if (a == "-h" || a == "--help") {
            usage(stdout);
            return 0;
        } else if (a == "--version") {
            std::puts("xmldbc " KORV_VERSION);
            return 0;
        } else if (a == "--sysinfo") {
            sock = XMLDB_SOCK_SYSINFO;
        } else if (a == "-s" && i + 1 < argc) {
            sock = argv[++i];
        } else {
            return usage_error(("unknown option " + a).c_str());
        }
    }
    if (i >= argc)
        return usage_error("no command given");
    std::string mapped, why;
    if (!xmldb::map_socket(sock, mapped, why))
        return fail(why);

    std::string cmd = argv[i++];
    int nargs = argc - i;
    char **args = argv + i;
    auto need_path = [&](int n) { return nargs == n && absolute(args[0]); };

    if (cmd == "get") {
        if (!need_path(1))
            return usage_error("get takes one absolute PATH");
        int rc = run(mapped, xmldb::Op::Get, args[0], "", true);
        if (rc == 0)
            std::fputc('\n', stdout);
        return rc;
    }
    if (cmd == "set") {
        if (!need_path(2))
            return usage_error("set takes an absolute PATH and a VALUE");
        return run(mapped, xmldb::Op::Set, args[0], args[1], false);
    }
    if (cmd == "del") {
        if (!need_path(1))
            return usage_error("del takes one absolute PATH");
        return run(mapped, xmldb::Op::Del, args[0], "", false);
    }
    if (cmd == "dump") {
        if (nargs > 1 || (nargs == 1 && !absolute(args[0])))
            return usage_error("dump takes at most one absolute PATH");
        return run(mapped, xmldb::Op::Dump, nargs ? args[0] : "/", "", true);
    }
    if (cmd == "save" || cmd == "load") {
        const char *file = nargs ? args[0] : (cmd == "save" ? kDefaultFile : nullptr);
        if (nargs > 1 || !absolute(file))
            return usage_error(cmd == "save" ? "save takes at most one absolute FILE" : "load takes one absolute FILE");
        return run(mapped, cmd == "save" ? xmldb::Op::Save : xmldb::Op::Load, sysroot_path(file), "", false);
    }
    if (cmd == "wait") {
        if (nargs > 1)
            return usage_error("wait takes at most one SECONDS");
        return wait_ready(mapped, nargs ? args[0] : nullptr);
    }
    return usage_error(("unknown command " + cmd).c_str());
}
