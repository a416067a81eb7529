// SPDX-License-Identifier: Apache-2.0
// Query exchanges per second and their median latency against an in-memory
// isnsd on loopback (127.30.0.1), next to the floor: a bare TCP
// connect/send/receive/close loop of the very same request bytes.
//
//   bench_isns --benchmark_min_time=3
#include <benchmark/benchmark.h>

#include <arpa/inet.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <vector>

#include "isns/isns_client.h"
#include "isns/isns_pdu.h"
#include "isns/isns_transport.h"
#include "tests/support/isns_isnsd.h"

namespace {

constexpr const char *kServer = "127.30.0.1";
constexpr const char *kName = "iqn.2026-01.bench:nas1.t1";

korv_test::isnsd_server *g_srv;
std::vector<unsigned char> g_query;  // the check's request, as sent

bool setup()
{
    static korv_test::isnsd_server srv(kServer);
    if (!korv_test::isnsd_available() || !srv.start()) {
        std::fprintf(stderr, "cannot start isnsd on %s: %s\n", kServer, srv.error().c_str());
        return false;
    }
    g_srv = &srv;
    std::snprintf(isns_server_addr, sizeof isns_server_addr, "%s", kServer);
    isns_addr_family = AF_INET;
    std::snprintf(isns_entity_id, sizeof isns_entity_id, "bench");
    std::snprintf(isns_entity_name, sizeof isns_entity_name, "%s", kName);
    isns_iscsi_node *n = isns_iscsi_node_new();
    std::snprintf(n->name, sizeof n->name, "%s", kName);
    n->pg_tag = 1;
    isns_ip_portal *p = isns_ip_portal_new();
    p->address[10] = p->address[11] = 0xff;
    p->address[12] = 192, p->address[13] = 168, p->address[14] = 1, p->address[15] = 10;
    p->port = 3260;
    isns_iscsi_node_add_portal(n, p);
    const int r = register_entity(n);
    isns_iscsi_node_free(n);
    if (r != 0 || isns_check_registration(kName) != 1) {
        std::fprintf(stderr, "registration with isnsd failed\n");
        return false;
    }
    // The check leaves its request in the buffer only until the response
    // overwrites it; build it again the same way to copy it.
    emit_hdr(ISNS_DEV_ATTR_QRY);
    emit_attr(ISNS_TAG_ISCSI_NAME, isns_entity_name);
    emit_attr(ISNS_TAG_ISCSI_NAME, kName);
    emit_iscsi_node_type(ISNS_NODE_TYPE_TARGET);
    emit_delimiter();
    emit_attr(ISNS_TAG_ISCSI_NAME, nullptr);
    g_query.assign(isns_pdu_buf, isns_pdu_buf + isns_pdu_len());
    const size_t payload = g_query.size() - ISNS_HDR_LEN;
    g_query[4] = static_cast<unsigned char>(payload >> 8);
    g_query[5] = static_cast<unsigned char>(payload);
    return true;
}

// One bare exchange: blocking connect, send, read header and payload, close.
bool bare_exchange()
{
    sockaddr_in sa{};
    sa.sin_family = AF_INET;
    sa.sin_port = htons(3205);
    inet_pton(AF_INET, kServer, &sa.sin_addr);
    int fd = socket(AF_INET, SOCK_STREAM, 0);
    bool ok = connect(fd, reinterpret_cast<sockaddr *>(&sa), sizeof sa) == 0 &&
              send(fd, g_query.data(), g_query.size(), MSG_NOSIGNAL) == static_cast<ssize_t>(g_query.size());
    unsigned char buf[ISNS_PDU_SIZE + 12];
    size_t got = 0, want = 12;
    while (ok && got < want) {
        const ssize_t n = recv(fd, buf + got, want - got, 0);
        if (n <= 0)
            ok = false;
        else if ((got += static_cast<size_t>(n)) == 12)
            want = 12 + ((size_t{buf[4]} << 8) | buf[5]);
    }
    close(fd);
    return ok;
}

template <class Fn>
void timed_loop(benchmark::State &state, Fn exchange)
{
    if (!g_srv) {
        state.SkipWithError("no isnsd");
        return;
    }
    std::vector<double> us;
    us.reserve(1 << 16);
    for (auto _ : state) {
        const auto t0 = std::chrono::steady_clock::now();
        if (!exchange()) {
            state.SkipWithError("exchange failed");
            return;
        }
        us.push_back(std::chrono::duration<double, std::micro>(std::chrono::steady_clock::now() - t0).count());
    }
    std::nth_element(us.begin(), us.begin() + us.size() / 2, us.end());
    state.counters["median_us"] = us[us.size() / 2];
    state.counters["exchanges_per_s"] = benchmark::Counter(static_cast<double>(us.size()), benchmark::Counter::kIsRate);
}

void BM_CheckRegistration(benchmark::State &state)
{
    timed_loop(state, [] { return isns_check_registration(kName) == 1; });
}

void BM_BareTcpFloor(benchmark::State &state)
{
    timed_loop(state, bare_exchange);
}

BENCHMARK(BM_BareTcpFloor)->UseRealTime();
BENCHMARK(BM_CheckRegistration)->UseRealTime();
BENCHMARK(BM_BareTcpFloor)->UseRealTime();
BENCHMARK(BM_CheckRegistration)->UseRealTime();

}  // namespace

int main(int argc, char **argv)
{
    benchmark::Initialize(&argc, argv);
    if (!setup())
        return 1;
    benchmark::RunSpecifiedBenchmarks();
    benchmark::Shutdown();
    return 0;
}
