// SPDX-License-Identifier: Apache-2.0
// Link-local IPv6 servers: the scopes bond0 (when present), eth0, eth1 are
// tried in that order, 1 s each. Each case runs in a forked child inside a
// private network namespace whose interfaces of those names drop everything
// they send, so only the interface holding the server's address connects.
#include <gtest/gtest.h>

#include <chrono>
#include <cstdlib>
#include <net/if.h>
#include <netinet/in.h>
#include <sched.h>
#include <string>
#include <sys/socket.h>
#include <unistd.h>
#include <vector>

#include "tests/isns/isns_test_util.h"
#include "tests/support/capture.h"

namespace {

constexpr int kSkip = 77;

bool sh(const std::string &cmd)
{
    return std::system((cmd + " >/dev/null 2>&1").c_str()) == 0;
}

// Prints why (in the child, so the parent's output shows it) and returns rc.
int why(int rc, const std::string &reason)
{
    std::fprintf(stderr, "%s%s\n", rc == kSkip ? "skip: " : "", reason.c_str());
    return rc;
}

// In the child: a private namespace with ifaces, a server on fe80::1 held by
// `holder` (none: ""), then the connect; 0 when it went through holder (none:
// failed) and took min_s..max_s.
int scope_case(const std::vector<std::string> &ifaces, const std::string &holder, double min_s, double max_s)
{
    if (geteuid() != 0 || unshare(CLONE_NEWNET) != 0)
        return why(kSkip, "needs root and unshare(CLONE_NEWNET) for a private network namespace");
    sh("ip link set lo up");
    for (const std::string &i : ifaces) {
        // dummy where the kernel has it, else ifb: both drop what they send.
        if (!sh("ip link add " + i + " type dummy") && !sh("ip link add " + i + " type ifb"))
            return why(kSkip, "neither dummy nor ifb interfaces can be created here");
        if (!sh("ip link set " + i + " up"))
            return why(kSkip, "cannot bring " + i + " up");
    }
    int lfd = -1;
    if (!holder.empty()) {
        sockaddr_in6 sa{};
        sa.sin6_family = AF_INET6;
        sa.sin6_port = htons(3205);
        inet_pton(AF_INET6, "fe80::1", &sa.sin6_addr);
        sa.sin6_scope_id = if_nametoindex(holder.c_str());
        lfd = socket(AF_INET6, SOCK_STREAM, 0);
        if (!sh("ip -6 addr add fe80::1/64 dev " + holder + " nodad") ||
            bind(lfd, reinterpret_cast<sockaddr *>(&sa), sizeof sa) != 0 || listen(lfd, 4) != 0)
            return why(kSkip, "cannot listen on fe80::1%" + holder);
    }
    // The kernel adds each interface's fe80::/64 route a little after the link
    // comes up; measuring before that would see instant failures, not time-outs.
    bool routes = false;
    for (int i = 0; i < 250 && !routes; i++, usleep(20 * 1000)) {
        routes = holder.empty() || sh("ip -6 route show table local dev " + holder + " | grep -q '^local fe80::1 '");
        for (const std::string &dev : ifaces)
            routes = routes && sh("ip -6 route show dev " + dev + " | grep -q '^fe80::/64'");
    }
    if (!routes)
        return why(1, "link-local routes did not appear within 5 s");

    const auto t0 = std::chrono::steady_clock::now();
    int fd = -1;
    const int rc = isns_connect(&fd, AF_INET6, "fe80::1", 3205);
    const double s = std::chrono::duration<double>(std::chrono::steady_clock::now() - t0).count();
    if (s < min_s || s > max_s)
        return why(1, "took " + std::to_string(s) + " s, expected " + std::to_string(min_s) + ".." +
                          std::to_string(max_s));
    if (holder.empty())
        return rc == -1 ? 0 : why(1, "connected, expected failure");
    sockaddr_in6 peer{};
    socklen_t len = sizeof peer;
    if (rc != 0 || getpeername(fd, reinterpret_cast<sockaddr *>(&peer), &len) != 0)
        return why(1, "no connection (rc " + std::to_string(rc) + ")");
    char name[IF_NAMESIZE] = "?";
    if_indextoname(peer.sin6_scope_id, name);
    close(fd);
    close(lfd);
    return name == holder ? 0 : why(1, std::string("connected through ") + name + ", expected " + holder);
}

}  // namespace

TEST(IsnsLinkLocal, ScopesAreTriedBond0FirstThenEth0AndEth1OneSecondEach)
{
    const std::vector<std::string> all = {"bond0", "eth0", "eth1"}, no_bond = {"eth0", "eth1"};
    const struct {
        const std::vector<std::string> &ifaces;
        const char *holder;  // "": nobody answers
        double min_s, max_s;
    } cases[] = {
        {all, "bond0", 0.0, 0.8}, {all, "eth0", 0.9, 1.9}, {all, "eth1", 1.9, 2.9},
        {no_bond, "eth0", 0.0, 0.8}, {no_bond, "eth1", 0.9, 1.9}, {all, "", 2.9, 3.9},
    };
    for (const auto &c : cases) {
        const int rc = korv_test::run_in_child([&] { return scope_case(c.ifaces, c.holder, c.min_s, c.max_s); });
        if (rc == kSkip)
            GTEST_SKIP() << "no private network namespace with test interfaces here (reason above)";
        EXPECT_EQ(rc, 0) << c.ifaces.size() << " interfaces, holder " << c.holder << " (details above)";
    }
}
