// Volumes and disks: room from df, mount paths and lock state, disk
// hibernation, the chain of volumes. Real file systems (an ext4 image and a
// tmpfs, in a private mount namespace) where a test needs mounts; stand-in
// df/powermgmt first on PATH for what real ones will not print.
#include <sched.h>
#include <sys/mount.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <map>
#include <sstream>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "common/korvadm_err.h"
#include "common/korvadm_sys_internal.h"
#include "platform/xmldbc.h"
#include "tests/config/store_fixture.h"

using korv_test::quiet;
using korv_test::SysRoot;

namespace {

namespace fs = std::filesystem;
const std::string kData = KORV_COMMON_TEST_DATA;

std::vector<std::string> data_lines(const std::string &name)
{
    std::ifstream in(kData + "/" + name);
    std::vector<std::string> lines;
    for (std::string l; std::getline(in, l);)
        if (!l.empty() && l[0] != '#')
            lines.push_back(l);
    EXPECT_FALSE(lines.empty()) << name;
    return lines;
}

std::string unescape_newlines(std::string s)
{
    for (size_t at; (at = s.find("\\n")) != std::string::npos;)
        s.replace(at, 2, "\n");
    return s;
}

class Storage : public ::testing::Test {
protected:
    void SetUp() override
    {
        // mountinfo under the root is the real one.
        std::error_code ec;
        fs::create_symlink("/proc", SysRoot::file("/proc"), ec);
        SysRoot::mkdirs("/standin/bin");
        for (const char *cmd : {"df", "powermgmt"})
            fs::create_symlink(kData + "/standin", SysRoot::file(std::string("/standin/bin/") + cmd), ec);
    }
    void TearDown() override { setenv("PATH", path_.c_str(), 1); }

    // The stand-in `cmd` prints out and exits with rc; the real one when not.
    void standin(const std::string &cmd, const std::string &out, int rc = 0)
    {
        SysRoot::write("/standin/" + cmd + ".out", out);
        SysRoot::write("/standin/" + cmd + ".rc", std::to_string(rc));
        setenv("PATH", (SysRoot::file("/standin/bin") + ":" + path_).c_str(), 1);
    }
    static void put(const std::string &key, const std::string &value)
    {
        ASSERT_EQ(xmldbc_set(XMLDB_SOCK_SYSINFO, 0, key.c_str(), value.c_str()), 0) << key;
    }
    // Loads a "path = value" file, replacing @NAME@ placeholders.
    static void load_sysinfo(const std::string &name, const std::map<std::string, std::string> &subst = {})
    {
        for (std::string line : data_lines(name)) {
            for (const auto &[from, to] : subst)
                for (size_t at; (at = line.find(from)) != std::string::npos;)
                    line.replace(at, from.size(), to);
            size_t eq = line.find(" = ");
            put(line.substr(0, eq), line.substr(eq + 3));
        }
    }

    korv_test::XmldbService db_{korv_test::kWithSysinfo};
    std::string path_ = std::getenv("PATH") ? std::getenv("PATH") : "/usr/bin:/bin";
};

TEST_F(Storage, DfLinesAreSharedOrRefused)
{
    for (const std::string &c : data_lines("df_lines.txt")) {
        size_t arrow = c.find(" => ");
        standin("df", "Filesystem 1B-blocks Used Available Use% Mounted on\n" + c.substr(0, arrow) + "\n");
        std::istringstream want(c.substr(arrow + 4));
        int rc;
        uint64_t total = 0, used = 0, unused = 0, t = 7, u = 7, f = 7;
        want >> rc >> total >> used >> unused;
        EXPECT_EQ(quiet([&] { return _sys_get_df_info(&t, &u, &f, "/"); }), rc) << c;
        if (rc == 0) {
            EXPECT_EQ(std::vector<uint64_t>({t, u, f}), std::vector<uint64_t>({total, used, unused})) << c;
        }
    }
    // df runs only on a mount point, and never without its arguments.
    SysRoot::remove("/standin/calls.log");
    uint64_t t, u, f;
    EXPECT_EQ(quiet([&] { return _sys_get_df_info(&t, &u, &f, SysRoot::path().c_str()); }), -1);
    EXPECT_EQ(quiet([&] { return _sys_get_df_info(&t, &u, nullptr, "/"); }), -1);
    EXPECT_EQ(SysRoot::read("/standin/calls.log"), "");
}

TEST_F(Storage, PowermgmtAnswersGiveSleepingDisks)
{
    for (const std::string &c : data_lines("powermgmt_answers.txt")) {
        size_t bar = c.find(" | "), arrow = c.find(" => ");
        standin("powermgmt", unescape_newlines(c.substr(0, bar)), std::stoi(c.substr(bar + 3)));
        std::istringstream want(c.substr(arrow + 4));
        int awake;
        want >> awake;
        std::string rest;
        std::getline(want, rest);
        std::vector<int> asleep(34, rest == " all");
        std::istringstream disks(rest);
        for (int disk; disks >> disk;)
            asleep[disk] = 1;
        int *states = nullptr;
        EXPECT_EQ(quiet([&] { return powermgmt_get_hibernate_status(&states, 34); }), awake) << c;
        if (awake >= 0 && states) {
            EXPECT_EQ(std::vector<int>(states, states + 34), asleep) << c;
        }
        std::free(states);
    }
    EXPECT_EQ(SysRoot::read("/standin/calls.log").substr(0, 13), "powermgmt -s\n");
}

TEST_F(Storage, ChainAddsUpdatesAndWalks)
{
    standin("df", "/dev/md1 1000 300 650 35% /\n");
    put("/vols/vol:1/name", "Volume_1");
    put("/vols/vol:1/uuid", "u1");
    put("/vols/vol:1/mnt", "/");
    put("/vols/vol:2/name", "Volume_2");
    put("/vols/vol:2/uuid", "u2");
    put("/vols/vol:2/mnt", "/proc");
    vol_lun_info_t *head = nullptr;
    vol_lun_info_t *a = quiet([&] { return vol_lun_info_update(&head, "u1", 1, 2, 3, 0); });
    ASSERT_TRUE(a && head == a);
    EXPECT_EQ(std::vector<uint64_t>({a->vol_size, a->free_size, a->init_free_size, a->lun_claim_size}),
              std::vector<uint64_t>({1000, 682, 682, 2}));
    EXPECT_EQ(quiet([&] { return vol_lun_info_update(&head, "missing", 0, 0, 0, 0); }), nullptr);
    vol_lun_info_t *b = quiet([&] { return vol_lun_info_update(&head, "u2", 0, 0, 0, 1); });
    ASSERT_TRUE(b && a->next == b && std::string(b->vol_mnt_path) == "/proc");

    // A claim beyond the allocation eats free space, never below 0; a
    // negative flag keeps the stored one.
    EXPECT_EQ(vol_lun_info_update(&head, "u1", 10, 110, 0, -1), a);
    EXPECT_EQ(a->free_size, 582u);
    EXPECT_EQ(a->hibernation, 0);
    vol_lun_info_update(&head, "u1", 0, 5000, 0, 1);
    EXPECT_EQ(a->free_size, 0u);
    EXPECT_EQ(a->hibernation, 1);
    EXPECT_EQ(a->lun_alloc_size + a->lun_claim_size + a->lun_extra_size, 11u + 5112u + 3u);

    EXPECT_EQ(vol_lun_info_list_get_nth(head, 0), a);
    EXPECT_EQ(vol_lun_info_list_get_nth(head, -1), b);
    EXPECT_EQ(vol_lun_info_list_get_nth(head, -1), nullptr);
    EXPECT_EQ(vol_lun_info_list_get_nth(head, 1), b);
    b->next = b;  // a record pointing at itself ends every walk
    EXPECT_EQ(vol_lun_info_list_get_nth(head, 5), nullptr);
    quiet([&] { vol_lun_info_list_deinit(&head); return 0; });
    EXPECT_EQ(head, nullptr);
}

TEST_F(Storage, CountsAreClamped)
{
    for (auto [text, n] : std::vector<std::pair<const char *, int>>{
             {"3", 3}, {"256", 256}, {"257", 256}, {"99999999999999999999", 0}, {"-1", 0}, {"x", 0}, {"", 0}}) {
        put("/vols/vol#", text);
        put("/disks/disk#", text);
        EXPECT_EQ(quiet([] { return xmldb_get_vol_cnt(); }), n) << text;
        EXPECT_EQ(quiet([] { return xmldb_get_disk_cnt(); }), n) << text;
    }
    vol_lun_info_t *head = nullptr;
    EXPECT_EQ(quiet([&] { return init_root_vol_lun_info(&head, 1); }), 1);  // no disks: nothing asked
    EXPECT_EQ(head, nullptr);
}

// ---- on real file systems ----

class RealMounts : public Storage {
protected:
    void SetUp() override
    {
        Storage::SetUp();
        if (geteuid() != 0)
            GTEST_SKIP() << "needs root to mount file systems in a private namespace";
        if (unshare(CLONE_NEWNS) != 0 || mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0)
            GTEST_SKIP() << "no private mount namespace here: " << std::strerror(errno);
        ext4_ = SysRoot::file("/mnt/ext4");
        tmpfs_ = SysRoot::file("/mnt/tmpfs");
        none_ = SysRoot::file("/mnt/none");
        for (const auto &d : {ext4_, tmpfs_, none_})
            fs::create_directories(d);
        std::string img = SysRoot::file("/ext4.img");
        std::string cmd = "truncate -s 8M " + img + " && mkfs.ext4 -q -F " + img + " >/dev/null 2>&1 && mount -o loop " +
                          img + " " + ext4_ + " 2>/dev/null";
        if (std::system(cmd.c_str()) != 0)
            GTEST_SKIP() << "cannot make and loop-mount an ext4 image (mkfs.ext4, loop devices)";
        mounted_.push_back(ext4_);
        ASSERT_EQ(mount("tmpfs", tmpfs_.c_str(), "tmpfs", 0, "size=4m"), 0);
        mounted_.push_back(tmpfs_);
        load_sysinfo("sysinfo_volumes.txt", {{"@EXT4@", ext4_}, {"@TMPFS@", tmpfs_}, {"@NONE@", none_}});
    }
    void TearDown() override
    {
        for (const auto &m : mounted_)
            umount2(m.c_str(), MNT_DETACH);
        Storage::TearDown();
    }
    // df's own figures for a mount: size, used, available, use%.
    static std::vector<uint64_t> real_df(const std::string &mnt)
    {
        std::string cmd = "df -B 1 --output=size,used,avail,pcent '" + mnt + "' | tail -n 1";
        std::vector<uint64_t> v;
        if (std::FILE *p = popen(cmd.c_str(), "r")) {
            unsigned long long a, b, c, d;
            if (std::fscanf(p, "%llu %llu %llu %llu", &a, &b, &c, &d) == 4)
                v = {a, b, c, d};
            pclose(p);
        }
        return v;
    }

    std::string ext4_, tmpfs_, none_;
    std::vector<std::string> mounted_;
};

TEST_F(RealMounts, DfFiguresMatchDfAndShareReservedBlocks)
{
    for (const auto &mnt : {ext4_, tmpfs_}) {
        std::vector<uint64_t> d = real_df(mnt);
        ASSERT_EQ(d.size(), 4u) << mnt;
        uint64_t reserved = d[0] - d[1] - d[2];
        if (mnt == ext4_) {
            EXPECT_GT(reserved, 0u) << "ext4 keeps reserved blocks";
        }
        uint64_t used_out = d[0] - d[2] - (100 - d[3]) * reserved / 100;
        uint64_t t, u, f;
        ASSERT_EQ(quiet([&] { return _sys_get_df_info(&t, &u, &f, mnt.c_str()); }), 0) << mnt;
        EXPECT_EQ(std::vector<uint64_t>({t, u, f}), std::vector<uint64_t>({d[0], used_out, d[0] - used_out})) << mnt;
    }
    uint64_t t, u, f;
    EXPECT_EQ(quiet([&] { return _sys_get_df_info(&t, &u, &f, none_.c_str()); }), -1);
}

TEST_F(RealMounts, MountPathAndLockStateByUuid)
{
    const struct {
        const char *uuid;
        int found;
        std::string path;
        int unlocked;
    } cases[] = {
        {"u-ext4", 5, ext4_, 10},
        {"u-tmpfs", 5, tmpfs_, 10},
        {"u-locked", 6, "", 9},
        {"u-dup", 5, ext4_, 10},    // the last mounted one; the first decides the lock
        {"u-dup2", 5, tmpfs_, 9},   // the first is not mounted
        {"u-late", 6, "", 9},       // behind an empty name
        {"", 6, "", 9},
        {"u-nowhere", 6, "", 9},
    };
    for (const auto &c : cases) {
        char out[VOL_MNT_PATH_LEN] = "stale";
        EXPECT_EQ(quiet([&] { return sys_raid_get_mnt_path_by_uuid(out, sizeof out, c.uuid); }), c.found) << c.uuid;
        EXPECT_EQ(out, c.path) << c.uuid;
        EXPECT_EQ(quiet([&] { return sys_raid_vol_is_unlocked_by_uuid(c.uuid); }), c.unlocked) << c.uuid;
    }
    char small[8];
    EXPECT_EQ(quiet([&] { return sys_raid_get_mnt_path_by_uuid(small, sizeof small, "u-ext4"); }), 6);
    EXPECT_EQ(quiet([&] { return sys_raid_get_mnt_path_by_uuid(nullptr, 8, "u-ext4"); }), ERR_PARAM);
}

TEST_F(RealMounts, VolumeListEndsAtEmptyName)
{
    list_t list;
    list_init(&list);
    ASSERT_EQ(quiet([&] { return get_vol_info_list(&list); }), 0);
    std::vector<std::string> got;
    for (vol_info_t *v : korv::list_records<vol_info_t>(&list)) {
        got.push_back(std::string(v->uuid) + " " + v->mnt_path);
        EXPECT_EQ(v->vol_size + v->alloc_size + v->claim_alloc_size + v->free_size + v->keep_figures, 0u);
    }
    EXPECT_EQ(got, std::vector<std::string>({"u-ext4 " + ext4_, "u-tmpfs " + tmpfs_, "u-locked " + none_,
                                             "u-dup " + tmpfs_, "u-dup " + ext4_, "u-dup2 " + none_,
                                             "u-dup2 " + tmpfs_}));
    EXPECT_EQ(quiet([&] { return get_vol_info_list(&list); }), ERR_PARAM);  // not empty
    vol_info_free_list(&list);
}

TEST_F(RealMounts, RootChainHoldsMountedVolumesWithRoomAndSleep)
{
    auto chain = [](vol_lun_info_t *head) {
        std::vector<std::string> v;
        for (; head; head = head->next) {
            uint64_t t = 0, u = 0, f = 0;
            _sys_get_df_info(&t, &u, &f, head->vol_mnt_path);
            EXPECT_EQ(std::vector<uint64_t>({head->vol_size, head->free_size}), std::vector<uint64_t>({t, f}));
            v.push_back(std::string(head->uuid) + " " + head->vol_mnt_path + " " + std::to_string(head->hibernation));
        }
        return v;
    };
    standin("powermgmt", "result: 4\n");  // sdc (md2) sleeps
    vol_lun_info_t *head = nullptr;
    ASSERT_EQ(quiet([&] { return init_root_vol_lun_info(&head, 1); }), 0);
    EXPECT_EQ(quiet([&] { return chain(head); }),
              std::vector<std::string>({"u-ext4 " + ext4_ + " 0", "u-tmpfs " + tmpfs_ + " 1", "u-dup " + ext4_ + " 0",
                                        "u-dup2 " + tmpfs_ + " 1"}));
    quiet([&] { vol_lun_info_list_deinit(&head); return 0; });

    // Every disk asleep: every volume sleeps and no member list is read.
    ASSERT_EQ(xmldbc_del(XMLDB_SOCK_SYSINFO, 0, "/raids"), 0);
    standin("powermgmt", "result: 7\n");
    ASSERT_EQ(quiet([&] { return init_root_vol_lun_info(&head, 1); }), 0);
    for (vol_lun_info_t *r = head; r; r = r->next)
        EXPECT_EQ(r->hibernation, 1) << r->uuid;
    quiet([&] { vol_lun_info_list_deinit(&head); return 0; });

    // With the member lists gone, an awake disk makes the lookup fail.
    standin("powermgmt", "result: 0\n");
    EXPECT_EQ(quiet([&] { return init_root_vol_lun_info(&head, 1); }), ERR_SYSINFO);
    vol_lun_info_list_deinit(&head);
}

TEST_F(RealMounts, HostileMountPathRunsNothing)
{
    std::string dir = SysRoot::file("/mnt/x\"$(touch canary1)`touch canary2`\"y");
    fs::create_directories(dir);
    ASSERT_EQ(mount("tmpfs", dir.c_str(), "tmpfs", 0, "size=2m"), 0);
    mounted_.push_back(dir);
    ASSERT_EQ(chdir(SysRoot::path().c_str()), 0);
    uint64_t t = 0, u, f;
    EXPECT_EQ(quiet([&] { return _sys_get_df_info(&t, &u, &f, dir.c_str()); }), 0);
    EXPECT_EQ(t, 2u * 1024 * 1024);
    EXPECT_FALSE(fs::exists("canary1") || fs::exists("canary2"));
}

}  // namespace
