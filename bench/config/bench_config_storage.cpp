// SPDX-License-Identifier: Apache-2.0
// The storage side of the store against a private xmldbd, each next to its
// anchor measured in the same run:
// - all 128 LUNs with every field (xmldb_get_all_lun_conf), and all rights
//   of one LUN with 129 initiators (xmldb_get_all_lun_acl_conf_from_lun),
//   against a bare loop making the same client reads;
// - xmldb_set_lun_acl for the 129th initiator of a LUN that has 128: its
//   requests are counted (the client calls are wrapped at link time) and
//   set against the fewest its steps need.
//
//   bench_config_storage --benchmark_min_time=2
#include <benchmark/benchmark.h>

#include <cstdio>
#include <string>
#include <vector>

#include "config/korvadm_conf.h"
#include "config/korvadm_xmldb_conf.h"
#include "platform/xmldbc.h"
#include "tests/support/xmldbd_fixture.h"

namespace {
long g_requests = 0;
}

extern "C" {
int __real_xmldbc_get_wb(const char *, int, const char *, char *, size_t);
int __real_xmldbc_set(const char *, int, const char *, const char *);
int __real_xmldbc_del(const char *, int, const char *);
int __wrap_xmldbc_get_wb(const char *s, int f, const char *p, char *b, size_t n)
{
    g_requests++;
    return __real_xmldbc_get_wb(s, f, p, b, n);
}
int __wrap_xmldbc_set(const char *s, int f, const char *p, const char *v)
{
    g_requests++;
    return __real_xmldbc_set(s, f, p, v);
}
int __wrap_xmldbc_del(const char *s, int f, const char *p)
{
    g_requests++;
    return __real_xmldbc_del(s, f, p);
}
}

namespace {

constexpr int kLuns = 128;
constexpr int kInitiators = 128;
// Fields _xmldb_fill_lun_conf reads per LUN.
constexpr const char *kLunFields[] = {"uuid",     "serial",         "img_file",  "target_name", "size",
                                      "alloc_size", "sector",       "devid",     "prealloc",    "prealloc_state",
                                      "vol_state",  "connected",    "lun_num"};

std::string lun_path(int n, const char *field) { return "/iscsi/lun/id:" + std::to_string(n) + "/" + field; }

bool populate()
{
    for (int n = 1; n <= kLuns; n++) {
        lun_conf_t *l = lun_conf_new();
        std::snprintf(l->name, sizeof l->name, "lun%03d", n);
        std::snprintf(l->uuid, sizeof l->uuid, "vol-%d", n % 4);
        std::snprintf(l->serial, sizeof l->serial, "serial%03d", n);
        std::snprintf(l->img_file, sizeof l->img_file, "/mnt/vol%d/lun%03d.img", n % 4, n);
        l->size = 1ULL << 34;
        l->devid = n - 1;
        l->prealloc = 0;
        int rc = xmldb_add_new_lun(l);
        lun_conf_free(l);
        if (rc != 0)
            return false;
        for (auto [f, v] : {std::pair{"alloc_size", "4096"}, {"prealloc_state", "0"}, {"connected", "1"},
                            {"target_name", "t1"}, {"lun_num", "0"}})
            if (xmldbc_set(XMLDB_SOCK_ISCSI, 0, lun_path(n, f).c_str(), v) != 0)
                return false;
    }
    // 128 initiators with a right on lun001, 129 on lun002.
    for (int i = 1; i <= kInitiators + 1; i++) {
        std::string iqn = "iqn.1994-05.com.example:host" + std::to_string(i);
        if (i <= kInitiators && xmldb_set_lun_acl(iqn.c_str(), "h", "lun001", 2) != 0)
            return false;
        if (xmldb_set_lun_acl(iqn.c_str(), "h", "lun002", 1) != 0)
            return false;
    }
    return true;
}

void BM_AllLuns(benchmark::State &state)
{
    for (auto _ : state) {
        list_t list;
        list_init(&list);
        if (xmldb_get_all_lun_conf(&list) != 0 || list.count != kLuns) {
            state.SkipWithError("read failed");
            break;
        }
        lun_conf_free_list(&list);
    }
}

void BM_LunRights(benchmark::State &state)
{
    for (auto _ : state) {
        list_t list;
        list_init(&list);
        if (xmldb_get_all_lun_acl_conf_from_lun("lun002", &list) != 0 || list.count != kInitiators + 1) {
            state.SkipWithError("read failed");
            break;
        }
        lun_acl_conf_free_list(&list);
    }
}

// The anchor: the same client reads in a bare loop (paths built beforehand).
std::vector<std::string> g_paths;
void BM_BareReads(benchmark::State &state)
{
    char buf[4096];
    for (auto _ : state)
        for (const std::string &p : g_paths)
            if (__real_xmldbc_get_wb(XMLDB_SOCK_ISCSI, 0, p.c_str(), buf, sizeof buf) < 0) {
                state.SkipWithError("read failed");
                return;
            }
}

// The reads each reader makes, recorded by running it once.
std::vector<std::string> reads_of(bool luns)
{
    std::vector<std::string> paths;
    if (luns) {
        for (int n = 1; n <= kLuns + 1; n++) {
            paths.push_back(lun_path(n, "name"));
            if (n <= kLuns)
                for (const char *f : kLunFields)
                    paths.push_back(lun_path(n, f));
        }
    } else {
        for (int n = 1; n <= 2; n++)
            paths.push_back(lun_path(n, "name"));
        for (int k = 1; k <= kInitiators + 2; k++) {
            std::string e = lun_path(2, "acl/id:") + std::to_string(k);
            paths.push_back(e + "/initiator");
            if (k <= kInitiators + 1) {
                paths.push_back(e + "/alias");
                paths.push_back(e + "/access_right");
            }
        }
    }
    return paths;
}

void BM_AllLunsAnchor(benchmark::State &state) { g_paths = reads_of(true); BM_BareReads(state); }
void BM_LunRightsAnchor(benchmark::State &state) { g_paths = reads_of(false); BM_BareReads(state); }

// The 129th initiator's right on lun001, undone between iterations.
void BM_SetRight129(benchmark::State &state)
{
    const char *iqn = "iqn.1994-05.com.example:host129";
    long requests = 0;
    for (auto _ : state) {
        long before = g_requests;
        if (xmldb_set_lun_acl(iqn, "h", "lun001", 2) != 0) {
            state.SkipWithError("grant failed");
            break;
        }
        requests = g_requests - before;
        state.PauseTiming();
        __real_xmldbc_del(XMLDB_SOCK_ISCSI, 0, "/iscsi/lun/id:1/acl/id:129");
        __real_xmldbc_del(XMLDB_SOCK_ISCSI, 0, "/iscsi/acl/id:129/mapped_lun/id:2");
        state.ResumeTiming();
    }
    state.counters["requests"] = static_cast<double>(requests);
    // The fewest the steps need: the LUN (first entry, 1 read); the
    // initiator, 129th of the ACL list (129 reads); its entry under the LUN
    // among 128 others and the LUN under it (129 + 2 reads, each also
    // finding the free entry); 3 + 2 writes; the two counts (2 writes, the
    // lists' lengths being known by then).
    state.counters["fewest"] = 1 + 129 + 129 + 2 + 5 + 2;
}

}  // namespace

BENCHMARK(BM_AllLuns)->Unit(benchmark::kMillisecond);
BENCHMARK(BM_AllLunsAnchor)->Unit(benchmark::kMillisecond);
BENCHMARK(BM_LunRights)->Unit(benchmark::kMillisecond);
BENCHMARK(BM_LunRightsAnchor)->Unit(benchmark::kMillisecond);
BENCHMARK(BM_SetRight129)->Unit(benchmark::kMillisecond);

int main(int argc, char **argv)
{
    korv_test::XmldbService db;
    if (!populate()) {
        std::fprintf(stderr, "cannot store the LUNs and rights\n");
        return 1;
    }
    benchmark::Initialize(&argc, argv);
    benchmark::RunSpecifiedBenchmarks();
    benchmark::Shutdown();
    return 0;
}
