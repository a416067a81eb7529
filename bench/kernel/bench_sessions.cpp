// SPDX-License-Identifier: Apache-2.0
// Time to parse a full 32768-byte sessions text (as many real-shaped blocks,
// one session of two connections each, as fit) into records and free them,
// next to the anchor: one pass over the same buffer counting its lines.
//
//   bench_sessions --benchmark_min_time=2
#include <benchmark/benchmark.h>

#include <cstdio>
#include <cstring>
#include <string>
#include <vector>

#include "kernel/korvadm_mod_lio4_internal.h"
#include "kernel/korvadm_sess.h"

namespace {

constexpr size_t kSize = 32768;

std::string block(int n)
{
    char text[1024];
    std::snprintf(text, sizeof text,
                  "InitiatorName: iqn.2026-01.com.example:host%04d\n"
                  "InitiatorAlias: host%04d\n"
                  "LIO Session ID: %d   ISID: 0x80 28 09 49 %02x %02x  TSIH: %d  SessionType: Normal\n"
                  "Session State: TARG_SESS_STATE_LOGGED_IN\n"
                  "---------------------[iSCSI Session Values]-----------------------\n"
                  "  CmdSN/WR  :  CmdSN/WC  :  ExpCmdSN  :  MaxCmdSN  :     ITT    :     TTT\n"
                  " 0x00000040   0x00000040   0x2682186c   0x268218ab   0x3f2c4d19   0x000019ca\n"
                  "----------------------[iSCSI Connections]-------------------------\n"
                  "CID: 0  Connection State: TARG_CONN_STATE_LOGGED_IN\n"
                  "   Address 192.0.2.%d TCP  StatSN: 0xf62d9e7c\n"
                  "CID: 1  Connection State: TARG_CONN_STATE_LOGGED_IN\n"
                  "   Address 2001:db8::%x TCP  StatSN: 0x269d87fa\n",
                  n, n, n, n >> 8 & 0xff, n & 0xff, n, n % 250 + 1, n);
    return text;
}

// The buffer as the reader leaves it: whole blocks, zeros after them.
struct Text {
    std::vector<char> buf = std::vector<char>(kSize, '\0');
    int sessions = 0;
    Text()
    {
        size_t used = 0;
        for (std::string b = block(1); used + b.size() <= kSize; b = block(++sessions + 1)) {
            std::memcpy(buf.data() + used, b.data(), b.size());
            used += b.size();
        }
    }
};

const Text &text()
{
    static const Text t;
    return t;
}

void BM_ParseFullText(benchmark::State &state)
{
    const Text &t = text();
    iscsi_target_t *target = iscsi_target_new();
    std::strcpy(target->iqn, "iqn.2026-01.com.example:nas.t1");
    target->tpgt = 1;
    for (auto _ : state) {
        list_t sessions, initiators;
        list_init(&sessions);
        list_init(&initiators);
        if (_lio3_parse_sessions(&sessions, &initiators, target, t.buf.data(), kSize) != 0 ||
            sessions.count != t.sessions) {
            state.SkipWithError("parse failed");
            break;
        }
        iscsi_sess_free_list(&sessions);
        iscsi_initiator_free_list(&initiators);
    }
    iscsi_target_free(target);
    state.counters["sessions"] = t.sessions;
    state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * kSize));
}

// The anchor: every byte looked at once, lines counted.
void BM_CountLines(benchmark::State &state)
{
    const Text &t = text();
    for (auto _ : state) {
        size_t lines = 0;
        for (char c : t.buf)
            lines += c == '\n';
        benchmark::DoNotOptimize(lines);
    }
    state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * kSize));
}

}  // namespace

BENCHMARK(BM_CountLines);
BENCHMARK(BM_ParseFullText);
BENCHMARK(BM_CountLines);
BENCHMARK(BM_ParseFullText);

BENCHMARK_MAIN();
