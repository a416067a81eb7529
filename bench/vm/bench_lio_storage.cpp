// SPDX-License-Identifier: Apache-2.0
// Runs in the test VM (bench/vm/lio_storage): 16 targets, each with a 64 MiB
// fileio backstore, one LUN and two ACLs with rights, built and torn down
// through the driver, against a floor that does the same configfs
// operations with direct mkdir/write/symlink/unlink/rmdir calls. Rounds
// alternate; medians are reported with the shell commands the driver ran
// (forks counted by the kernel) and the cost of one shell.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <string>
#include <vector>

#include "kernel/korvadm_mod.h"

namespace {

constexpr int TARGETS = 16, ROUNDS = 5;
constexpr uint64_t SIZE = 64ull << 20;
const char *const INITIATORS[] = {"iqn.2026-01.bench:ro", "iqn.2026-01.bench:rw"};
const std::string FABRIC = "/sys/kernel/config/target/iscsi", CORE = "/sys/kernel/config/target/core";

using clock_type = std::chrono::steady_clock;

double ms_since(clock_type::time_point t0)
{
    return std::chrono::duration<double, std::milli>(clock_type::now() - t0).count();
}

// Processes created since boot (/proc/stat "processes").
long forks()
{
    std::ifstream in("/proc/stat");
    std::string key;
    long v = 0;
    while (in >> key)
        if (key == "processes" && (in >> v))
            break;
    return v;
}

std::string iqn(int i) { return "iqn.2026-01.bench:t" + std::to_string(i); }
std::string name(int i) { return "bench" + std::to_string(i); }
std::string image(int i) { return "/tmp/" + name(i) + ".img"; }

bool ok(int rc, const char *what, int i)
{
    if (rc != 0)
        std::fprintf(stderr, "%s of target %d: %d\n", what, i, rc);
    return rc == 0;
}

// ---- through the driver ----

bool driver_round()
{
    struct rec {
        iscsi_target_t *t;
        iscsi_lun_t *lun;
        iscsi_map_lun_t map;
        iscsi_initiator_t init[2];
        iscsi_lun_acl_t acl[2];
    };
    std::vector<rec> r(TARGETS);
    bool good = true;
    for (int i = 0; i < TARGETS; i++) {
        rec &x = r[i];
        x.t = iscsi_target_new();
        std::snprintf(x.t->iqn, sizeof x.t->iqn, "%s", iqn(i).c_str());
        std::snprintf(x.t->alias, sizeof x.t->alias, "bench %d", i);
        x.t->tpgt = 1;
        x.t->dataout_timeout = 5;
        x.lun = iscsi_lun_new();
        std::snprintf(x.lun->name, sizeof x.lun->name, "%s", name(i).c_str());
        std::snprintf(x.lun->path, sizeof x.lun->path, "%s", image(i).c_str());
        x.lun->size = SIZE;
        x.lun->hba_id = 0;
        x.map = {};
        x.map.target = x.t;
        x.map.lun_num = 0;
        good = good && ok(iscsi_mod_add_target(x.t), "add target", i) &&
               ok(iscsi_mod_add_backstore(x.lun), "add backstore", i) &&
               ok(iscsi_mod_add_lun_mapping(x.lun, x.t, 0), "map", i);
        for (int a = 0; a < 2 && good; a++) {
            x.init[a] = {};
            std::snprintf(x.init[a].name, sizeof x.init[a].name, "%s", INITIATORS[a]);
            x.acl[a] = {};
            x.acl[a].map_lun = &x.map;
            x.acl[a].initiator = &x.init[a];
            x.acl[a].access_right = 1 + a;
            good = ok(iscsi_mod_add_acl_initiator(INITIATORS[a], x.t), "add ACL", i) &&
                   ok(iscsi_mod_add_lun_acl(&x.acl[a]), "set right", i);
        }
    }
    for (int i = 0; i < TARGETS; i++) {
        rec &x = r[i];
        for (int a = 0; a < 2; a++)
            good = ok(iscsi_mod_del_lun_acl(&x.acl[a]), "deny", i) &&
                   ok(iscsi_mod_del_acl_initiator(INITIATORS[a], x.t), "del ACL", i) && good;
        good = ok(iscsi_mod_del_lun_mapping(x.lun, x.t), "unmap", i) && good;
        good = ok(iscsi_mod_del_target(x.t), "del target", i) && good;
        good = ok(iscsi_mod_del_backstore(x.lun), "del backstore", i) && good;
        iscsi_target_free(x.t);
        iscsi_lun_free(x.lun);
    }
    return good;
}

// ---- the floor: the same configfs operations, by hand ----

bool put(const std::string &path, const std::string &value)
{
    int fd = ::open(path.c_str(), O_WRONLY);
    bool good = fd >= 0 && ::write(fd, value.data(), value.size()) == static_cast<ssize_t>(value.size());
    if (fd >= 0)
        ::close(fd);
    return good;
}

bool floor_round()
{
    int failures = 0;
    auto check = [&](bool good) { failures += !good; };
    ::mkdir((CORE + "/fileio_0").c_str(), 0700);
    for (int i = 0; i < TARGETS; i++) {
        std::string tpg = FABRIC + "/" + iqn(i) + "/tpgt_1", dev = CORE + "/fileio_0/" + name(i);
        check(::mkdir((FABRIC + "/" + iqn(i)).c_str(), 0700) == 0 && ::mkdir(tpg.c_str(), 0700) == 0);
        check(put(tpg + "/attrib/generate_node_acls", "1") && put(tpg + "/param/MaxConnections", "8") &&
              put(tpg + "/param/TargetAlias", "bench") && put(tpg + "/attrib/default_cmdsn_depth", "64"));
        int fd = ::open(image(i).c_str(), O_WRONLY | O_CREAT, 0700);
        check(fd >= 0);
        if (fd >= 0)
            ::close(fd);
        check(::mkdir(dev.c_str(), 0700) == 0);
        check(put(dev + "/control", "fd_dev_name=" + image(i) + ",fd_dev_size=" + std::to_string(SIZE) +
                                        ",fd_buffered_io=1") &&
              put(dev + "/enable", "1"));
        check(::mkdir((tpg + "/lun/lun_0").c_str(), 0700) == 0 &&
              ::symlink(dev.c_str(), (tpg + "/lun/lun_0/" + name(i)).c_str()) == 0 &&
              put(tpg + "/lun/lun_0/alua_tg_pt_write_md", "1"));
        for (int a = 0; a < 2; a++) {
            std::string acl = tpg + "/acls/" + INITIATORS[a];
            check(::mkdir(acl.c_str(), 0700) == 0 && put(acl + "/attrib/dataout_timeout", "5") &&
                  ::mkdir((acl + "/lun_0").c_str(), 0700) == 0 &&
                  ::symlink((tpg + "/lun/lun_0").c_str(), (acl + "/lun_0/lun_0").c_str()) == 0 &&
                  put(acl + "/lun_0/write_protect", a == 0 ? "1" : "0"));
        }
    }
    for (int i = 0; i < TARGETS; i++) {
        std::string tpg = FABRIC + "/" + iqn(i) + "/tpgt_1";
        for (const char *init : INITIATORS) {
            std::string acl = tpg + "/acls/" + init;
            check(::unlink((acl + "/lun_0/lun_0").c_str()) == 0 && ::rmdir((acl + "/lun_0").c_str()) == 0 &&
                  ::rmdir(acl.c_str()) == 0);
        }
        check(::unlink((tpg + "/lun/lun_0/" + name(i)).c_str()) == 0 && ::rmdir((tpg + "/lun/lun_0").c_str()) == 0);
        check(::rmdir(tpg.c_str()) == 0 && ::rmdir((FABRIC + "/" + iqn(i)).c_str()) == 0);
        check(::rmdir((CORE + "/fileio_0/" + name(i)).c_str()) == 0);
    }
    check(::rmdir((CORE + "/fileio_0").c_str()) == 0);
    if (failures)
        std::fprintf(stderr, "floor: %d failed steps\n", failures);
    return failures == 0;
}

double median(std::vector<double> v)
{
    std::sort(v.begin(), v.end());
    return v[v.size() / 2];
}

}  // namespace

int main()
{
    if (iscsi_mod_select(ISCSI_MOD_TYPE_LIO) != 0 || iscsi_mod_start() != 0) {
        std::fprintf(stderr, "the driver does not start\n");
        return 1;
    }
    std::vector<double> driver, floor;
    long shells = 0;
    bool good = true;
    for (int round = 0; round < ROUNDS && good; round++) {
        auto t0 = clock_type::now();
        good = floor_round();
        floor.push_back(ms_since(t0));
        long f0 = forks();
        t0 = clock_type::now();
        good = driver_round() && good;
        driver.push_back(ms_since(t0));
        shells = forks() - f0;
    }
    // One shell doing what the driver's attribute writer does.
    auto t0 = clock_type::now();
    for (int i = 0; i < 100; i++)
        std::system("printf '%s' \"1\" > /dev/null");
    double shell_ms = ms_since(t0) / 100;
    iscsi_mod_stop();
    if (!good)
        return 1;
    double d = median(driver), f = median(floor);
    std::printf("| what | value |\n|---|---|\n");
    std::printf("| floor: direct configfs calls, %d targets built and torn down (median of %d) | %.1f ms |\n",
                TARGETS, ROUNDS, f);
    std::printf("| driver: the same through iscsi_mod_ (median of %d) | %.1f ms |\n", ROUNDS, d);
    std::printf("| ratio driver / floor | %.0f |\n", d / f);
    std::printf("| shell commands per target | %.1f |\n", static_cast<double>(shells) / TARGETS);
    std::printf("| one shell command (printf to /dev/null, mean of 100) | %.2f ms |\n", shell_ms);
    std::printf("| share of the driver's time in shell commands | %.0f %% |\n", 100.0 * shells * shell_ms / d);
    return 0;
}
