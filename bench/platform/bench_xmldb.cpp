// SPDX-License-Identifier: Apache-2.0
// Round-trip latency of the configuration database client library against a
// running xmldbd (in $NESRAD_SYSROOT), and filling it for the memory figure.
//   bench_xmldb latency [ROUNDS]   get/set round trips, 128-get target scan
//   bench_xmldb fill               10,002 nodes (2,000 LUN records of 4 fields)
#include "platform/xmldbc.h"

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

namespace {

using Clock = std::chrono::steady_clock;
const char *const S = XMLDB_SOCK_ISCSI;

double us(Clock::duration d) { return std::chrono::duration<double, std::micro>(d).count(); }

void report(const char *what, std::vector<double> v, const char *unit, double scale)
{
    std::sort(v.begin(), v.end());
    auto pct = [&](double p) { return v[static_cast<size_t>(p * (v.size() - 1))] / scale; };
    std::printf("%-28s n=%zu median=%.2f %s p99=%.2f %s max=%.2f %s\n", what, v.size(), pct(0.5), unit, pct(0.99),
                unit, v.back() / scale, unit);
}

bool must(bool ok, const char *what)
{
    if (!ok) {
        std::fprintf(stderr, "bench_xmldb: %s failed (is xmldbd running?)\n", what);
        std::exit(1);
    }
    return ok;
}

int latency(int rounds)
{
    char buf[256];
    for (int i = 0; i < 1000; ++i)  // warm-up: connection, caches, allocator
        must(xmldbc_set(S, 0, "/bench/warm", "x") == 0, "set");

    std::vector<double> set_us, get_us;
    for (int i = 0; i < rounds; ++i) {
        std::string v = "value-" + std::to_string(i);
        auto t0 = Clock::now();
        must(xmldbc_set(S, 0, "/bench/key", v.c_str()) == 0, "set");
        auto t1 = Clock::now();
        must(xmldbc_get_wb(S, 0, "/bench/key", buf, sizeof buf) > 0, "get");
        auto t2 = Clock::now();
        set_us.push_back(us(t1 - t0));
        get_us.push_back(us(t2 - t1));
    }
    report("set round trip", set_us, "us", 1);
    report("get round trip", get_us, "us", 1);

    // The daemon's read of 64 targets: name and tpgt of each.
    char path[128];
    for (int id = 1; id <= 64; ++id) {
        std::snprintf(path, sizeof path, "/iscsi/target/id:%d/name", id);
        must(xmldbc_set(S, 0, path, ("iqn.2026-01.bench:target-" + std::to_string(id)).c_str()) == 0, "set");
        std::snprintf(path, sizeof path, "/iscsi/target/id:%d/tpgt", id);
        must(xmldbc_set(S, 0, path, "1") == 0, "set");
    }
    std::vector<double> scan_us;
    for (int r = 0; r < 500; ++r) {
        auto t0 = Clock::now();
        for (int id = 1; id <= 64; ++id) {
            std::snprintf(path, sizeof path, "/iscsi/target/id:%d/name", id);
            must(xmldbc_get_wb(S, 0, path, buf, sizeof buf) > 1, "get");
            std::snprintf(path, sizeof path, "/iscsi/target/id:%d/tpgt", id);
            must(xmldbc_get_wb(S, 0, path, buf, sizeof buf) > 1, "get");
        }
        scan_us.push_back(us(Clock::now() - t0));
    }
    report("64 targets (128 gets)", scan_us, "ms", 1000);
    return 0;
}

int fill()
{
    char path[128], value[128];
    static const char *const fields[] = {"name", "path", "size", "uuid"};
    for (int id = 1; id <= 2000; ++id)
        for (const char *f : fields) {
            std::snprintf(path, sizeof path, "/iscsi/lun/id:%d/%s", id, f);
            std::snprintf(value, sizeof value, "%s-of-lun-%d-%08x", f, id, id * 2654435761u);
            must(xmldbc_set(S, 0, path, value) == 0, "set");
        }
    std::printf("filled 10002 nodes\n");
    return 0;
}

}  // namespace

int main(int argc, char **argv)
{
    if (argc >= 2 && std::strcmp(argv[1], "latency") == 0)
        return latency(argc >= 3 ? std::atoi(argv[2]) : 20000);
    if (argc == 2 && std::strcmp(argv[1], "fill") == 0)
        return fill();
    std::fprintf(stderr, "usage: bench_xmldb latency [ROUNDS] | fill\n");
    return 2;
}
