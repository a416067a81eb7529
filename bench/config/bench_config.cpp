// SPDX-License-Identifier: Apache-2.0
// Time to read all 64 targets (the daemon's lite read; the full read with
// CHAP on) from a private xmldbd, next to the floor: the same number of bare
// client reads of one value.
//
//   bench_config --benchmark_min_time=2
#include <benchmark/benchmark.h>

#include <cstdio>
#include <string>

#include "config/korvadm_conf.h"
#include "config/korvadm_xmldb_conf.h"
#include "platform/xmldbc.h"
#include "tests/support/xmldbd_fixture.h"

namespace {

constexpr int kTargets = 64;
// Client reads each operation makes: names up to the first gap (65) plus
// tpgt; the full read adds iqn, hba_id, state, chap_enable, chap_name,
// chap_pwd and status.
constexpr int kLiteReads = kTargets + 1 + kTargets;
constexpr int kFullReads = kTargets + 1 + 8 * kTargets;

bool populate()
{
    for (int i = 1; i <= kTargets; i++) {
        target_conf_t *t = target_conf_new();
        std::snprintf(t->name, sizeof t->name, "target%02d", i);
        std::snprintf(t->iqn, sizeof t->iqn, "iqn.2000-01.com.example:nas:target%02d", i);
        t->tpgt = 1;
        t->state = 1;
        t->hba_id = i - 1;
        t->chap_enable = 1;
        std::snprintf(t->chap_name, sizeof t->chap_name, "user%02d", i);
        std::snprintf(t->chap_pwd, sizeof t->chap_pwd, "secret-of-target-%02d", i);
        int rc = xmldb_add_new_target(t);
        target_conf_free(t);
        if (rc != 0)
            return false;
    }
    return true;
}

void read_all(benchmark::State &state, int (*read)(list_t *))
{
    for (auto _ : state) {
        list_t list;
        list_init(&list);
        if (read(&list) != 0 || list.count != kTargets) {
            state.SkipWithError("read failed");
            break;
        }
        target_conf_free_list(&list);
    }
}

void BM_AllTargetsLite(benchmark::State &state) { read_all(state, xmldb_get_all_target_conf_lite); }
void BM_AllTargetsFull(benchmark::State &state) { read_all(state, xmldb_get_all_target_conf); }

// The floor: n bare reads of one value through the client library.
void BM_BareReads(benchmark::State &state)
{
    const int n = static_cast<int>(state.range(0));
    char buf[256];
    for (auto _ : state)
        for (int i = 0; i < n; i++)
            if (xmldbc_get_wb(XMLDB_SOCK_ISCSI, 0, "/iscsi/target/id:1/tpgt", buf, sizeof buf) < 0) {
                state.SkipWithError("read failed");
                return;
            }
}

}  // namespace

BENCHMARK(BM_AllTargetsLite)->Unit(benchmark::kMillisecond);
BENCHMARK(BM_BareReads)->Arg(kLiteReads)->Unit(benchmark::kMillisecond);
BENCHMARK(BM_AllTargetsFull)->Unit(benchmark::kMillisecond);
BENCHMARK(BM_BareReads)->Arg(kFullReads)->Unit(benchmark::kMillisecond);

int main(int argc, char **argv)
{
    korv_test::XmldbService db;
    if (!populate()) {
        std::fprintf(stderr, "cannot store %d targets\n", kTargets);
        return 1;
    }
    benchmark::Initialize(&argc, argv);
    benchmark::RunSpecifiedBenchmarks();
    benchmark::Shutdown();
    return 0;
}
