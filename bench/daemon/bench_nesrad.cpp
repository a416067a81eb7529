// SPDX-License-Identifier: Apache-2.0
// Start-up cost and memory of nesrad with 64 targets, against its floor.
//
// One run makes a private system root (host name, 64 stored targets, each
// with the same IPv4 and IPv6 kernel portals), starts xmldbd there and an
// in-memory isnsd on 127.30.0.1, then times, alternating, N runs of:
//   daemon  the installed nesrad from exec until its exit: start-up, the
//           configuration read, 64 registrations, then the SIGTERM sent as
//           soon as it waits for its first check (a stop during the pass
//           would cut it), one deregistration and the pid cleared: 65
//           exchanges;
//   floor   this program re-executed in --floor mode: the same 65 exchanges,
//           the same bytes (same encoder, names and portals), no
//           configuration and no kernel reads;
//   bare    a bare C++ program linked the way nesrad is (memory anchor);
// and, in-process, the configuration read the daemon makes (context, debug
// level, the 64 targets, two pid writes). A last daemon run checks that
// isnsd really holds the 64 targets before the SIGTERM.
//
// --memory: the daemon's memory in its steady check loop against a bare C
// program making the same exchanges (nesrad_bare_isns: the same 64
// registrations, then the check query every minute), each with an isnsd of
// its own, run side by side: VmHWM from /proc/PID/status, Rss, Pss and
// Private from /proc/PID/smaps_rollup, read once the server holds all 64
// targets and each program has made its first check (about a minute).
//
//   bench_nesrad [runs]     (default 20; needs isnsd and isnsadm)
//   bench_nesrad --memory
//   bench_nesrad --trace OUT   (nesrad under valgrind; see trace_mode)
#include <arpa/inet.h>
#include <fcntl.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <initializer_list>
#include <string>
#include <thread>
#include <vector>

#include "common/korvadm_debug.h"
#include "common/korvadm_log.h"
#include "daemon/nesrad.h"
#include "isns/isns_transport.h"
#include "platform/platform_util.h"

namespace {

using clock_type = std::chrono::steady_clock;

constexpr const char *kServer = "127.30.0.1";
constexpr const char *kBareServer = "127.30.0.2";  // the bare program's own isnsd (--memory)
constexpr const char *kPrefix = "iqn.2026-01.org.example:";
constexpr const char *kEid = "bench-nas";
constexpr int kTargets = 64;
const char *const kPortals[] = {"192.0.2.10:3260", "[2001:db8::10]:3260"};

std::string g_root;

[[noreturn]] void die(const std::string &why)
{
    std::fprintf(stderr, "bench_nesrad: %s\n", why.c_str());
    std::exit(1);
}

std::string iqn_of(int i)
{
    return std::string(kPrefix) + kEid + ":t" + std::to_string(i);
}

void mkdirs(const std::string &dir)
{
    for (size_t i = 1; i <= dir.size(); ++i)
        if (i == dir.size() || dir[i] == '/')
            mkdir(dir.substr(0, i).c_str(), 0755);
}

struct child {
    pid_t pid = -1;
    clock_type::time_point start;
};

child spawn(const std::vector<std::string> &words, bool quiet = true)
{
    std::vector<char *> argv;
    std::vector<std::string> w = words;
    for (std::string &s : w)
        argv.push_back(s.data());
    argv.push_back(nullptr);
    std::fflush(nullptr);
    child c;
    c.start = clock_type::now();
    c.pid = fork();
    if (c.pid == 0) {
        if (quiet) {
            int null = open("/dev/null", O_WRONLY);
            dup2(null, 1);
            dup2(null, 2);
        }
        execv(argv[0], argv.data());
        _exit(127);
    }
    if (c.pid < 0)
        die("fork failed");
    return c;
}

struct outcome {
    double ms;
    long maxrss_kib;
    int status;
};

outcome reap(const child &c)
{
    int status = 0;
    rusage ru{};
    if (wait4(c.pid, &status, 0, &ru) != c.pid)
        die("wait4 failed");
    double ms = std::chrono::duration<double, std::milli>(clock_type::now() - c.start).count();
    return {ms, ru.ru_maxrss, WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status)};
}

// True once the daemon waits for its next check, blocked in ppoll with its
// registration pass done: a stop sent during the pass would cut it short.
bool waiting_for_check(pid_t pid)
{
    std::ifstream in("/proc/" + std::to_string(pid) + "/syscall");
    long nr = -1;
    return in >> nr && nr == SYS_ppoll;
}

long status_kib(pid_t pid, const char *field)
{
    std::ifstream in("/proc/" + std::to_string(pid) + "/status");
    for (std::string line; std::getline(in, line);)
        if (line.rfind(field, 0) == 0)
            return std::atol(line.c_str() + std::strlen(field));
    return -1;
}

// How many nodes the isnsd behind adm_conf holds.
int held_nodes(const std::string &adm_conf)
{
    std::string cmd = "timeout 5 isnsadm -c " + adm_conf + " --local --list nodes | grep -c 'iSCSI name'";
    int held = 0;
    if (FILE *p = popen(cmd.c_str(), "r")) {
        if (std::fscanf(p, "%d", &held) != 1)
            held = 0;
        pclose(p);
    }
    return held;
}

// An in-memory isnsd on addr, its files in <root>/<dir>; *adm_conf names
// the isnsadm configuration that reaches it.
child start_isnsd(const char *addr, const std::string &dir, std::string *adm_conf)
{
    std::string isns = g_root + "/" + dir;
    mkdirs(isns);
    std::ofstream(isns + "/isnsd.conf")
        << "SourceName = " << kPrefix << dir << "\nBindAddress = " << addr << "\nPIDFile = " << isns
        << "/isnsd.pid\nControlSocket = " << isns << "/isnsctl\nLocalRegistry = " << isns
        << "/isns.registry\nSecurity = 0\nSLPRegister = 0\n"
        << "DefaultDiscoveryDomain = 1\nRegistrationPeriod = 0\nESIRetries = 0\n";
    *adm_conf = isns + "/isnsadm.conf";
    std::ofstream(*adm_conf) << "SourceName = " << kPrefix << "isnsadm-bench\nControlSocket = " << isns
                             << "/isnsctl\nSecurity = 0\n";
    child c = spawn({"/usr/sbin/isnsd", "-f", "-c", isns + "/isnsd.conf"});
    for (int i = 0; i < 100; ++i) {
        if (std::system(("isnsadm -c " + *adm_conf + " --local --list entities >/dev/null 2>&1").c_str()) == 0)
            return c;
        std::this_thread::sleep_for(std::chrono::milliseconds(100));
    }
    die("isnsd on " + std::string(addr) + " did not start");
}

// nesrad until it has registered and waits, then SIGTERM; with verify,
// isnsd's view (through *held and *hwm_kib) is read before the signal.
outcome run_daemon(const std::string &adm_conf, bool verify, int *held, long *hwm_kib)
{
    child c = spawn({NESRAD_BIN, kServer});
    while (!waiting_for_check(c.pid)) {
        if (waitpid(c.pid, nullptr, WNOHANG) == c.pid)
            die("nesrad ended before its first wait");
        std::this_thread::sleep_for(std::chrono::microseconds(100));
    }
    if (verify) {
        for (int i = 0; i < 200 && *held < kTargets; ++i) {
            std::this_thread::sleep_for(std::chrono::milliseconds(50));
            *held = held_nodes(adm_conf);
        }
        *hwm_kib = status_kib(c.pid, "VmHWM:");
    }
    kill(c.pid, SIGTERM);
    return reap(c);
}

// --floor: the daemon's 65 exchanges from in-memory nodes.
int floor_mode()
{
    std::snprintf(isns_server_addr, sizeof isns_server_addr, "%s", kServer);
    isns_addr_family = AF_INET;
    std::snprintf(isns_entity_id, sizeof isns_entity_id, "%s", kEid);
    unsigned char v4[16], v6[16] = {};
    ipv4_text_to_bytes(v4, "192.0.2.10");
    inet_pton(AF_INET6, "2001:db8::10", v6);
    for (int i = 1; i <= kTargets; ++i) {
        isns_iscsi_node *node = isns_iscsi_node_new();
        std::snprintf(node->name, sizeof node->name, "%s", iqn_of(i).c_str());
        node->pg_tag = 1;
        for (const unsigned char *a : {v4, v6}) {
            isns_ip_portal *p = isns_ip_portal_new();
            std::memcpy(p->address, a, 16);
            p->port = 3260;
            isns_iscsi_node_add_portal(node, p);
        }
        if (i == 1) {
            std::snprintf(isns_entity_name, sizeof isns_entity_name, "%s", node->name);
            register_entity(node);
        } else {
            register_node(node);
        }
        isns_iscsi_node_free(node);
    }
    return deregister_entity(isns_entity_name) == 0 ? 0 : 1;
}

// Memory of a process, KiB: VmHWM from status; Rss, Pss, Private and its
// dirty part (what the kernel cannot drop and read again) from smaps_rollup.
struct memory {
    long hwm = -1, rss = 0, pss = 0, priv = 0, dirty = 0;
};

memory memory_of(pid_t pid)
{
    memory m;
    m.hwm = status_kib(pid, "VmHWM:");
    std::ifstream in("/proc/" + std::to_string(pid) + "/smaps_rollup");
    for (std::string line; std::getline(in, line);) {
        char key[32];
        long kib = 0;
        if (std::sscanf(line.c_str(), "%31s %ld kB", key, &kib) != 2)
            continue;  // the address range heading the rollup
        if (std::strcmp(key, "Rss:") == 0)
            m.rss = kib;
        else if (std::strcmp(key, "Pss:") == 0)
            m.pss = kib;
        else if (std::strcmp(key, "Private_Clean:") == 0)
            m.priv += kib;
        else if (std::strcmp(key, "Private_Dirty:") == 0) {
            m.priv += kib;
            m.dirty = kib;
        }
    }
    if (m.hwm <= 0 || m.pss <= 0 || m.priv <= 0)
        die("cannot read the memory of pid " + std::to_string(pid));
    return m;
}

// Private memory (clean and dirty) of a process per mapping, KiB, keyed by
// the mapped file's name (the program itself as "program") and permissions.
std::vector<std::pair<std::string, long>> private_by_mapping(pid_t pid)
{
    const std::string proc = "/proc/" + std::to_string(pid);
    char exe[4096] = {};
    if (readlink((proc + "/exe").c_str(), exe, sizeof exe - 1) < 0)
        die("cannot read the program of pid " + std::to_string(pid));
    std::vector<std::pair<std::string, long>> out;
    std::ifstream in(proc + "/smaps");
    std::string label;
    for (std::string line; std::getline(in, line);) {
        char key[32], perms[8] = {}, path[4096] = {};
        long kib = 0;
        if (std::sscanf(line.c_str(), "%*x-%*x %7s %*s %*s %*s %4095s", perms, path) >= 1) {  // a mapping's heading
            std::string name = path;
            if (name == exe)
                name = "program";
            else if (name.empty())
                name = "[anonymous]";
            else
                name = name.substr(name.rfind('/') + 1);
            label = name + " " + std::string(perms, 3);
            continue;
        }
        if (std::sscanf(line.c_str(), "%31s %ld kB", key, &kib) != 2 ||
            (std::strcmp(key, "Private_Clean:") != 0 && std::strcmp(key, "Private_Dirty:") != 0))
            continue;
        auto at = std::find_if(out.begin(), out.end(), [&](const auto &e) { return e.first == label; });
        if (at == out.end())
            out.emplace_back(label, kib);
        else
            at->second += kib;
    }
    return out;
}

// Follows one program to its steady check loop: all targets held by its
// server, then its first check made (it left its wait, and waits again).
struct follow {
    const char *name;
    child c;
    std::string adm_conf;
    clock_type::time_point registered{};
    long switches = -1;
    bool steady = false;

    void step()
    {
        if (steady)
            return;
        if (waitpid(c.pid, nullptr, WNOHANG) == c.pid)
            die(std::string(name) + " ended before its first check");
        if (switches < 0) {
            if (waiting_for_check(c.pid) && held_nodes(adm_conf) == kTargets) {
                registered = clock_type::now();
                switches = status_kib(c.pid, "voluntary_ctxt_switches:");
            }
            return;
        }
        // The check comes a minute after the registration; waking up in
        // between (a signal) is not one.
        steady = clock_type::now() - registered > std::chrono::seconds(50) && waiting_for_check(c.pid) &&
                 status_kib(c.pid, "voluntary_ctxt_switches:") != switches;
    }
};

int memory_mode(const std::string &adm_conf, const std::string &bare_adm)
{
    follow runs[] = {
        {"nesrad", spawn({NESRAD_BIN, kServer}), adm_conf},
        {"nesrad_bare_isns", spawn({NESRAD_BARE_ISNS_BIN, kBareServer, kEid, kPrefix, std::to_string(kTargets), "60",
                                    "3260", "192.0.2.10", "2001:db8::10"}),
         bare_adm},
    };
    auto deadline = clock_type::now() + std::chrono::seconds(180);
    while (!(runs[0].steady && runs[1].steady)) {
        if (clock_type::now() > deadline)
            die("no steady check loop within 180 s");
        for (follow &f : runs)
            f.step();
        std::this_thread::sleep_for(std::chrono::milliseconds(200));
    }
    const memory d = memory_of(runs[0].c.pid), b = memory_of(runs[1].c.pid);
    auto dm = private_by_mapping(runs[0].c.pid), bm = private_by_mapping(runs[1].c.pid);
    kill(runs[1].c.pid, SIGTERM);
    reap(runs[1].c);
    kill(runs[0].c.pid, SIGTERM);
    const int status = reap(runs[0].c).status;

    std::printf("%d targets, 2 portals each, registered with an in-memory isnsd each; after the first check\n",
                kTargets);
    std::printf("%-34s %7s %7s %7s %8s %14s\n", "KiB", "VmHWM", "Rss", "Pss", "Private", "Private_Dirty");
    for (auto [name, m] : {std::pair{"nesrad", d}, std::pair{"bare C program, same exchanges", b}})
        std::printf("%-34s %7ld %7ld %7ld %8ld %14ld\n", name, m.hwm, m.rss, m.pss, m.priv, m.dirty);
    const double pss = static_cast<double>(d.pss) / static_cast<double>(b.pss);
    const double priv = static_cast<double>(d.priv) / static_cast<double>(b.priv);
    std::printf("nesrad / bare: VmHWM %.2f, Pss %.2f, Private %.2f, Private_Dirty %.2f\n",
                static_cast<double>(d.hwm) / static_cast<double>(b.hwm), pss, priv,
                static_cast<double>(d.dirty) / static_cast<double>(b.dirty));
    std::printf("goal: Pss and Private each <= 1.5 x the bare program's: %s\n",
                pss <= 1.5 && priv <= 1.5 ? "met" : "NOT met");
    std::printf("\nPrivate per mapping, KiB        nesrad   bare\n");
    for (const auto &[label, kib] : bm)
        if (std::none_of(dm.begin(), dm.end(), [&](const auto &e) { return e.first == label; }))
            dm.emplace_back(label, 0);
    std::stable_sort(dm.begin(), dm.end(), [](const auto &x, const auto &y) { return x.second > y.second; });
    for (const auto &[label, kib] : dm) {
        auto at = std::find_if(bm.begin(), bm.end(), [&](const auto &e) { return e.first == label; });
        if (kib || at != bm.end())
            std::printf("%-32s %6ld %6ld\n", label.c_str(), kib, at == bm.end() ? 0L : at->second);
    }
    std::printf("nesrad exit status after SIGTERM: %d\n", status);
    return status == 0 ? 0 : 1;
}

// --trace OUT: nesrad under valgrind's lackey through its start, its
// registration pass, its first check and its stop: every instruction and
// data address it touched in OUT, its mappings in OUT.maps
// (scripts/nesrad-layout turns them into the link's layout).
int trace_mode(const std::string &adm_conf, const std::string &out)
{
    follow run{"nesrad",
               spawn({"/usr/bin/valgrind", "--tool=lackey", "--trace-mem=yes", "--log-file=" + out, NESRAD_BIN,
                      kServer}),
               adm_conf};
    auto deadline = clock_type::now() + std::chrono::seconds(300);
    while (!run.steady) {
        if (clock_type::now() > deadline)
            die("no steady check loop under valgrind within 300 s");
        run.step();
        std::this_thread::sleep_for(std::chrono::milliseconds(200));
    }
    std::ifstream maps("/proc/" + std::to_string(run.c.pid) + "/maps");
    std::ofstream(out + ".maps") << maps.rdbuf();
    kill(run.c.pid, SIGTERM);
    return reap(run.c).status == 0 ? 0 : 1;
}

double median(std::vector<double> v)
{
    std::sort(v.begin(), v.end());
    return v[v.size() / 2];
}

double min_of(const std::vector<double> &v)
{
    return *std::min_element(v.begin(), v.end());
}

}  // namespace

int main(int argc, char **argv)
{
    if (argc > 1 && std::strcmp(argv[1], "--floor") == 0)
        return floor_mode();
    const bool memory_run = argc > 1 && std::strcmp(argv[1], "--memory") == 0;
    const bool trace_run = argc > 2 && std::strcmp(argv[1], "--trace") == 0;
    int runs = argc > 1 && !memory_run && !trace_run ? std::atoi(argv[1]) : 20;
    if (runs < 1)
        die("usage: bench_nesrad [runs]");

    char tmpl[] = "/tmp/nesrad-bench-XXXXXX";
    if (!mkdtemp(tmpl))
        die("mkdtemp failed");
    g_root = tmpl;
    setenv("NESRAD_SYSROOT", g_root.c_str(), 1);
    mkdirs(g_root + "/proc/sys/kernel");
    mkdirs(g_root + "/var/run");
    mkdirs(g_root + "/etc/NAS_CFG");
    std::ofstream(g_root + "/proc/sys/kernel/hostname") << "Bench_NAS\n";

    // The configuration database service, ready when it writes a byte.
    int ready[2];
    if (pipe(ready) != 0)
        die("pipe failed");
    std::fflush(nullptr);
    pid_t xmldbd = fork();
    if (xmldbd == 0) {
        close(ready[0]);
        std::string fd = std::to_string(ready[1]);
        execl(XMLDBD_BIN, XMLDBD_BIN, "--ready-fd", fd.c_str(), static_cast<char *>(nullptr));
        _exit(127);
    }
    close(ready[1]);
    char byte;
    if (read(ready[0], &byte, 1) != 1)
        die("xmldbd did not start");
    close(ready[0]);

    dbSetStr(kPrefix, "/iscsi/target/iqn_prefix");
    dbSetLL(0, "/iscsi/target/dbg");
    for (int i = 1; i <= kTargets; ++i) {
        std::string base = "/iscsi/target/id:" + std::to_string(i) + "/";
        dbSetStr(("t" + std::to_string(i)).c_str(), (base + "name").c_str());
        dbSetLL(1, (base + "tpgt").c_str());
        for (const char *np : kPortals)
            mkdirs(g_root + "/sys/kernel/config/target/iscsi/" + iqn_of(i) + "/tpgt_1/np/" + np);
    }
    dbSetLL(kTargets, "/iscsi/target/count");

    std::string adm_conf;
    child isnsd = start_isnsd(kServer, "isns", &adm_conf);
    // The servers stopped and the root removed, whichever mode ran.
    auto tear_down = [&](std::initializer_list<child> servers) {
        for (const child &c : servers) {
            kill(c.pid, SIGTERM);
            reap(c);
        }
        kill(xmldbd, SIGTERM);
        waitpid(xmldbd, nullptr, 0);
        std::system(("rm -rf '" + g_root + "'").c_str());
    };
    if (trace_run) {
        int rc = trace_mode(adm_conf, argv[2]);
        tear_down({isnsd});
        return rc;
    }
    if (memory_run) {
        std::string bare_adm;
        child bare_isnsd = start_isnsd(kBareServer, "isns-bare", &bare_adm);
        int rc = memory_mode(adm_conf, bare_adm);
        tear_down({isnsd, bare_isnsd});
        return rc;
    }

    // The configuration read of the daemon, in-process.
    std::vector<double> conf_ms;
    for (int r = 0; r < runs; ++r) {
        auto t0 = clock_type::now();
        iscsi_conf_init(&g_nesrad_conf);
        dbg_get_conf_target_debug_lv(&g_nesrad_conf);
        g_korv_debug_level = -1;  // keep the bench's own output clean
        write_pid(1);
        if (init_iqn_list() != kTargets)
            die("the 64 targets do not read back");
        write_pid(0);
        conf_ms.push_back(std::chrono::duration<double, std::milli>(clock_type::now() - t0).count());
        _iqn_clear();
    }

    std::vector<double> daemon_ms, floor_ms, bare_ms;
    long daemon_rss = 0, floor_rss = 0, bare_rss = 0;
    for (int r = 0; r < runs; ++r) {
        int unused_held = 0;
        long unused_hwm = 0;
        outcome d = run_daemon(adm_conf, false, &unused_held, &unused_hwm);
        if (d.status != 0)
            die("nesrad exited with " + std::to_string(d.status));
        daemon_ms.push_back(d.ms);
        daemon_rss = std::max(daemon_rss, d.maxrss_kib);

        outcome f = reap(spawn({"/proc/self/exe", "--floor"}));
        if (f.status != 0)
            die("the floor loop failed");
        floor_ms.push_back(f.ms);
        floor_rss = std::max(floor_rss, f.maxrss_kib);

        outcome b = reap(spawn({NESRAD_BARE_BIN}));
        bare_ms.push_back(b.ms);
        bare_rss = std::max(bare_rss, b.maxrss_kib);
    }
    int held = 0;
    long hwm = 0;
    outcome v = run_daemon(adm_conf, true, &held, &hwm);

    tear_down({isnsd});

    double goal = 1.5 * median(floor_ms) + median(conf_ms);
    std::printf("runs: %d, %d targets, 2 portals each, in-memory isnsd on %s\n", runs, kTargets, kServer);
    std::printf("%-44s %9s %9s %12s\n", "", "median", "min", "peak RSS");
    std::printf("%-44s %7.2f ms %6.2f ms %8ld KiB\n", "nesrad: start to exit, 65 exchanges",
                median(daemon_ms), min_of(daemon_ms), daemon_rss);
    std::printf("%-44s %7.2f ms %6.2f ms %8ld KiB\n", "floor: same 65 exchanges, bare loop",
                median(floor_ms), min_of(floor_ms), floor_rss);
    std::printf("%-44s %7.2f ms %6.2f ms\n", "configuration read (in-process)", median(conf_ms),
                min_of(conf_ms));
    std::printf("%-44s %7.2f ms %6.2f ms %8ld KiB\n", "bare C++ program, linked as nesrad",
                median(bare_ms), min_of(bare_ms), bare_rss);
    std::printf("goal: nesrad median <= 1.5 x floor + configuration = %.2f ms: %s\n", goal,
                median(daemon_ms) <= goal ? "met" : "NOT met");
    std::printf("goal: nesrad peak RSS < 2048 KiB: %s\n", daemon_rss < 2048 ? "met" : "NOT met");
    std::printf("check run: isnsd held %d of %d targets before SIGTERM (VmHWM %ld KiB), exit %d\n", held,
                kTargets, hwm, v.status);
    return held == kTargets && v.status == 0 ? 0 : 1;
}
