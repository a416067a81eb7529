// SPDX-License-Identifier: Apache-2.0
// Connect time-outs against servers that never answer: a link-local IPv6
// server is tried on the scopes bond0 (when present), eth0, eth1 in that
// order, 1 s each; any other server for 3 s. Each case runs in a forked child
// inside a private network namespace whose interfaces of those names drop
// everything they send, so only the interface holding the server's address
// connects.
#include <gtest/gtest.h>

#include <cstdlib>
#include <cstring>
#include <tuple>
#include <net/if.h>
#include <netinet/in.h>
#include <sched.h>
#include <sys/socket.h>
#include <unistd.h>

#include "tests/isns/isns_test_util.h"
#include "tests/support/process.h"

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

// In the child: the interfaces (dummy where the kernel has it, else ifb:
// both drop what they send), a server on fe80::1 held by `holder` (none: ""),
// a global server's network on the first interface, then the connect to
// `server`; 0 when it connected (none: failed) in time.
int scope_case(const std::vector<std::string> &ifaces, const std::string &holder, const char *server, double min_s)
{
    const int family = std::strchr(server, ':') ? AF_INET6 : AF_INET;
    std::string setup = "ip link set lo up", routes = "true";
    for (const std::string &i : ifaces) {
        setup += " && { ip link add " + i + " type dummy || ip link add " + i + " type ifb; }";
        setup += " && ip link set " + i + " up";
        routes += " && ip -6 route show dev " + i + " | grep -q '^fe80::/64'";
    }
    if (!holder.empty()) {
        setup += " && ip -6 addr add fe80::1/64 dev " + holder + " nodad";
        routes += " && ip -6 route show table local dev " + holder + " | grep -q '^local fe80::1 '";
    }
    if (std::strcmp(server, "fe80::1") != 0)
        setup += std::string(" && ip addr add ") + (family == AF_INET ? "192.0.2.1/24" : "2001:db8::1/64 nodad") +
                 " dev " + ifaces[0];
    if (geteuid() != 0 || unshare(CLONE_NEWNET) != 0 || !sh(setup))
        return why(kSkip, "needs root, a private network namespace and dummy or ifb interfaces: " + setup);
    int lfd = socket(AF_INET6, SOCK_STREAM, 0);
    sockaddr_in6 sa{AF_INET6, htons(3205), 0, {}, if_nametoindex(holder.c_str())};
    inet_pton(AF_INET6, "fe80::1", &sa.sin6_addr);
    if (!holder.empty() && (bind(lfd, reinterpret_cast<sockaddr *>(&sa), sizeof sa) != 0 || listen(lfd, 4) != 0))
        return why(kSkip, "cannot listen on fe80::1%" + holder);
    // The kernel adds each interface's fe80::/64 route a little after the link
    // comes up; measuring before that would see instant failures, not time-outs.
    if (!korv_test::eventually([&] { return sh(routes); }, std::chrono::seconds(10)))
        return why(1, "link-local routes did not appear within 10 s");
    int fd = -1;
    const auto [rc, s] = isns_test::timed([&] { return isns_connect(&fd, family, server, 3205); });
    if (s < min_s || s > min_s + 0.9)
        return why(1, "took " + std::to_string(s) + " s, expected " + std::to_string(min_s) + " to 0.9 s more");
    // Only the holder's scope can connect, so the time says which scopes came first.
    if (rc != (holder.empty() ? -1 : 0))
        return why(1, "connect answered " + std::to_string(rc));
    return 0;
}

}  // namespace

// Each scope tried in vain costs its second; the upper bound stays below
// one more.
TEST(IsnsConnectTimeouts, LinkLocalScopesBond0FirstThenEth0AndEth1OneSecondEachOthersThreeSeconds)
{
    const std::vector<std::string> all = {"bond0", "eth0", "eth1"}, no_bond = {"eth0", "eth1"};
    // Interfaces, the one holding the server ("": nobody answers), server, least seconds.
    const std::tuple<const std::vector<std::string> &, const char *, const char *, double> cases[] = {
        {all, "bond0", "fe80::1", 0.0}, {all, "eth0", "fe80::1", 0.9}, {all, "eth1", "fe80::1", 1.9},
        {no_bond, "eth0", "fe80::1", 0.0}, {no_bond, "eth1", "fe80::1", 0.9}, {all, "", "fe80::1", 2.9},
        {no_bond, "", "192.0.2.2", 2.9}, {no_bond, "", "2001:db8::2", 2.9}};
    for (const auto &c : cases) {
        const int rc = korv_test::run_in_child([&c] { return std::apply(scope_case, c); });
        if (rc == kSkip)
            GTEST_SKIP() << "no private network namespace with test interfaces here (reason above)";
        EXPECT_EQ(rc, 0) << std::get<2>(c) << ", " << std::get<0>(c).size() << " interfaces, holder " << std::get<1>(c)
                         << " (details above)";
    }
}
