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

// Makes the namespace and the interfaces; false (reason on stderr) when the
// machine cannot.
bool make_namespace(const std::vector<std::string> &ifaces)
{
    if (geteuid() != 0) {
        std::fprintf(stderr, "skip: needs root for a private network namespace\n");
        return false;
    }
    if (unshare(CLONE_NEWNET) != 0) {
        std::fprintf(stderr, "skip: unshare(CLONE_NEWNET) failed\n");
        return false;
    }
    sh("ip link set lo up");
    for (const std::string &i : ifaces) {
        // dummy where the kernel has it, else ifb: both drop what they send.
        if (!sh("ip link add " + i + " type dummy") && !sh("ip link add " + i + " type ifb")) {
            std::fprintf(stderr, "skip: neither dummy nor ifb interfaces can be created here\n");
            return false;
        }
        if (!sh("ip link set " + i + " up")) {
            std::fprintf(stderr, "skip: cannot bring %s up\n", i.c_str());
            return false;
        }
    }
    return true;
}

// The kernel adds each interface's fe80::/64 route a little after the link
// comes up; measuring before that would see instant failures, not time-outs.
bool wait_routes(const std::vector<std::string> &ifaces, const std::string &holder)
{
    for (int i = 0; i < 250; i++) {
        bool all = holder.empty() || sh("ip -6 route show table local dev " + holder + " | grep -q '^local fe80::1 '");
        for (const std::string &dev : ifaces)
            all = all && sh("ip -6 route show dev " + dev + " | grep -q '^fe80::/64'");
        if (all)
            return true;
        usleep(20 * 1000);
    }
    return false;
}

// In the child: server on fe80::1 held by `holder` (none: ""), connect, and
// compare the scope used and the time taken. Returns 0 when as expected.
int scope_case(const std::vector<std::string> &ifaces, const std::string &holder, const std::string &want_scope,
               double min_s, double max_s)
{
    if (!make_namespace(ifaces))
        return kSkip;
    int lfd = -1;
    if (!holder.empty()) {
        if (!sh("ip -6 addr add fe80::1/64 dev " + holder + " nodad")) {
            std::fprintf(stderr, "skip: cannot add fe80::1 to %s\n", holder.c_str());
            return kSkip;
        }
        sockaddr_in6 sa{};
        sa.sin6_family = AF_INET6;
        sa.sin6_port = htons(3205);
        inet_pton(AF_INET6, "fe80::1", &sa.sin6_addr);
        sa.sin6_scope_id = if_nametoindex(holder.c_str());
        lfd = socket(AF_INET6, SOCK_STREAM, 0);
        if (bind(lfd, reinterpret_cast<sockaddr *>(&sa), sizeof sa) != 0 || listen(lfd, 4) != 0) {
            std::fprintf(stderr, "skip: cannot listen on fe80::1%%%s\n", holder.c_str());
            return kSkip;
        }
    }
    if (!wait_routes(ifaces, holder)) {
        std::fprintf(stderr, "link-local routes did not appear within 5 s\n");
        return 1;
    }
    const auto t0 = std::chrono::steady_clock::now();
    int fd = -1;
    const int rc = isns_connect(&fd, AF_INET6, "fe80::1", 3205);
    const double s = std::chrono::duration<double>(std::chrono::steady_clock::now() - t0).count();
    int bad = 0;
    if (s < min_s || s > max_s) {
        std::fprintf(stderr, "took %.2f s, expected %.1f..%.1f\n", s, min_s, max_s);
        bad = 1;
    }
    if (want_scope.empty()) {
        if (rc != -1) {
            std::fprintf(stderr, "connected, expected failure\n");
            bad = 1;
        }
        return bad;
    }
    sockaddr_in6 peer{};
    socklen_t len = sizeof peer;
    if (rc != 0 || getpeername(fd, reinterpret_cast<sockaddr *>(&peer), &len) != 0) {
        std::fprintf(stderr, "no connection (rc %d)\n", rc);
        return 1;
    }
    if (peer.sin6_scope_id != if_nametoindex(want_scope.c_str())) {
        char name[IF_NAMESIZE] = "?";
        if_indextoname(peer.sin6_scope_id, name);
        std::fprintf(stderr, "connected through %s, expected %s\n", name, want_scope.c_str());
        bad = 1;
    }
    close(fd);
    close(lfd);
    return bad;
}

void expect_case(const std::vector<std::string> &ifaces, const std::string &holder, const std::string &want,
                 double min_s, double max_s)
{
    const int rc = korv_test::run_in_child([&] { return scope_case(ifaces, holder, want, min_s, max_s); });
    if (rc == kSkip)
        GTEST_SKIP() << "no private network namespace with test interfaces here (reason above)";
    EXPECT_EQ(rc, 0) << "holder " << holder << " (details above)";
}

}  // namespace

TEST(IsnsLinkLocal, Bond0IsTriedFirstWhenPresent)
{
    expect_case({"bond0", "eth0", "eth1"}, "bond0", "bond0", 0.0, 0.8);
    expect_case({"bond0", "eth0", "eth1"}, "eth0", "eth0", 0.9, 1.9);
    expect_case({"bond0", "eth0", "eth1"}, "eth1", "eth1", 1.9, 2.9);
}

TEST(IsnsLinkLocal, Bond0IsSkippedWhenAbsent)
{
    expect_case({"eth0", "eth1"}, "eth0", "eth0", 0.0, 0.8);
    expect_case({"eth0", "eth1"}, "eth1", "eth1", 0.9, 1.9);
}

TEST(IsnsLinkLocal, NoScopeAnswersAfterOneSecondEach)
{
    expect_case({"bond0", "eth0", "eth1"}, "", "", 2.9, 3.9);
}
