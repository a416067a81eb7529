// SPDX-License-Identifier: Apache-2.0
// Volumes and disks: room from df, mount paths and lock state, disk
// hibernation, the chain of volumes. Real mounts (tmpfs, in a private mount
// namespace) and real df where a test needs them; stand-in df/powermgmt first
// on PATH for what real ones will not print.
#include <sched.h>
#include <sys/mount.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <filesystem>

#include <gtest/gtest.h>

#include "common/korvadm_err.h"
#include "common/korvadm_sys_internal.h"
#include "platform/xmldbc.h"
#include "tests/support/data_cases.h"
#include "tests/support/process.h"
#include "tests/support/sysroot.h"
#include "tests/support/xmldbd_fixture.h"

using korv_test::quiet;
using korv_test::SysRoot;
using U64s = std::vector<uint64_t>;

namespace {

namespace fs = std::filesystem;

class Storage : public ::testing::Test {
protected:
    void SetUp() override
    {
        std::error_code ec;
        fs::create_symlink("/proc", SysRoot::file("/proc"), ec);  // the real mountinfo
        SysRoot::mkdirs("/standin/bin");
    }
    void TearDown() override { setenv("PATH", path_.c_str(), 1); }

    // From here on `cmd` is the stand-in, printing out and exiting with rc.
    void standin(const std::string &cmd, const std::string &out, int rc = 0)
    {
        std::error_code ec;
        fs::create_symlink(KORV_TEST_DATA "/standin", SysRoot::file("/standin/bin/" + cmd), ec);
        SysRoot::write("/standin/" + cmd + ".out", out);
        SysRoot::write("/standin/" + cmd + ".rc", std::to_string(rc));
        setenv("PATH", (SysRoot::file("/standin/bin") + ":" + path_).c_str(), 1);
    }
    static void put(const std::string &key, const std::string &value)
    {
        ASSERT_EQ(xmldbc_set(XMLDB_SOCK_SYSINFO, 0, key.c_str(), value.c_str()), 0) << key;
    }

    korv_test::XmldbService db_{korv_test::kWithSysinfo};
    std::string path_ = std::getenv("PATH");
};

TEST_F(Storage, DfOutputIsSharedOrRefused)
{
    for (const auto &[out, want] : data_cases("df_lines.txt")) {
        standin("df", "Filesystem 1B-blocks Used Available Use% Mounted on\\n" + out);
        U64s got(3, 7);  // left as they are on failure
        const int rc = quiet([&] { return _sys_get_df_info(&got[0], &got[1], &got[2], "/"); });
        std::string text = std::to_string(rc);
        for (uint64_t v : got)
            text += " " + std::to_string(v);
        EXPECT_EQ(text, rc ? want + " 7 7 7" : want) << out;
    }
    // df runs only on a mount point, and only with all its outputs.
    SysRoot::remove("/standin/calls.log");
    uint64_t t, u, f;
    EXPECT_EQ(quiet([&] { return _sys_get_df_info(&t, &u, &f, SysRoot::path().c_str()); }), -1);
    EXPECT_EQ(quiet([&] { return _sys_get_df_info(&t, &u, nullptr, "/"); }), -1);
    EXPECT_EQ(SysRoot::read("/standin/calls.log"), "");
}

TEST_F(Storage, PowermgmtMaskGivesSleepingDisks)
{
    for (const auto &[in, want] : data_cases("powermgmt_answers.txt")) {
        size_t bar = in.rfind(" | ");
        standin("powermgmt", in.substr(0, bar), std::stoi(in.substr(bar + 3)));
        int *states = nullptr;
        const int awake = quiet([&] { return powermgmt_get_hibernate_status(&states, 34); });
        std::string got = std::to_string(awake);
        for (int disk = 0; states && disk < 34; disk++)
            got += states[disk] ? " " + std::to_string(disk) : "";
        EXPECT_EQ(got, want) << in;
        EXPECT_EQ(states != nullptr, awake >= 0) << in;
        std::free(states);
    }
    EXPECT_EQ(SysRoot::read("/standin/calls.log").substr(0, 13), "powermgmt -s\n");
}

TEST_F(Storage, ChainAddsUpdatesAndWalks)
{
    standin("df", "/dev/md1 1000 300 650 35% /\\n");
    for (auto [idx, mnt] : {std::pair{"1", "/"}, {"2", "/proc"}}) {
        put("/vols/vol:" + std::string(idx) + "/name", "Volume");
        put("/vols/vol:" + std::string(idx) + "/uuid", "u" + std::string(idx));
        put("/vols/vol:" + std::string(idx) + "/mnt", mnt);
    }
    vol_lun_info_t *head = nullptr;
    vol_lun_info_t *a = quiet([&] { return vol_lun_info_update(&head, "u1", 1, 2, 3, 0); });
    ASSERT_TRUE(a && head == a);
    EXPECT_EQ(U64s({a->vol_size, a->free_size, a->init_free_size}), U64s({1000, 682, 682}));
    EXPECT_EQ(quiet([&] { return vol_lun_info_update(&head, "missing", 0, 0, 0, 0); }), nullptr);
    vol_lun_info_t *b = quiet([&] { return vol_lun_info_update(&head, "u2", 0, 0, 0, 1); });
    ASSERT_TRUE(b && a->next == b && std::string(b->vol_mnt_path) == "/proc");

    // Claims beyond the allocation eat free space, never below 0; a negative
    // flag keeps the stored one.
    EXPECT_EQ(vol_lun_info_update(&head, "u1", 10, 110, 0, -1), a);
    EXPECT_EQ(std::pair(a->free_size, a->hibernation), std::pair(uint64_t{582}, 0));
    vol_lun_info_update(&head, "u1", 0, 5000, 0, 1);
    EXPECT_EQ(U64s({a->free_size, a->lun_alloc_size, a->lun_claim_size, a->lun_extra_size}), U64s({0, 11, 5112, 3}));
    EXPECT_EQ(a->hibernation, 1);

    // The walk remembers its place; a record pointing at itself ends it.
    for (auto [n, want] : {std::pair{0, a}, {-1, b}, {-1, nullptr}, {1, b}})
        EXPECT_EQ(vol_lun_info_list_get_nth(head, n), want) << n;
    b->next = b;
    EXPECT_EQ(vol_lun_info_list_get_nth(head, 5), nullptr);
    quiet([&] { vol_lun_info_list_deinit(&head); return 0; });
    EXPECT_EQ(head, nullptr);
}

TEST_F(Storage, CountsAreClamped)
{
    for (auto [text, n] : {std::pair{"3", 3}, {"257", 256}, {"99999999999999999999", 0}, {"-1", 0}, {"x", 0}}) {
        put("/vols/vol#", text);
        put("/disks/disk#", text);
        EXPECT_EQ(quiet([] { return std::pair(xmldb_get_vol_cnt(), xmldb_get_disk_cnt()); }), std::pair(n, n)) << text;
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
        for (const auto &d : {mnt1_, mnt2_, none_})
            fs::create_directories(d);
        for (const auto &m : {mnt1_, mnt2_}) {
            ASSERT_EQ(mount("tmpfs", m.c_str(), "tmpfs", 0, "size=4m"), 0) << m;
            mounted_.push_back(m);
        }
        for (const auto &[path, value] : data_cases("sysinfo_volumes.txt"))
            put(path, subst(value));
    }
    // The mount points for their @NAME@ placeholders.
    std::string subst(std::string text) const
    {
        for (const auto &[from, to] : {std::pair{"@MNT1@", mnt1_}, {"@MNT2@", mnt2_}, {"@NONE@", none_}})
            for (size_t at; (at = text.find(from)) != std::string::npos;)
                text.replace(at, std::strlen(from), to);
        return text;
    }
    void TearDown() override
    {
        for (const auto &m : mounted_)
            umount2(m.c_str(), MNT_DETACH);
        Storage::TearDown();
    }

    std::string mnt1_ = SysRoot::file("/mnt/one"), mnt2_ = SysRoot::file("/mnt/two"),
                none_ = SysRoot::file("/mnt/none");
    std::vector<std::string> mounted_;
};

TEST_F(RealMounts, MountPathAndLockStateByUuid)
{
    for (const auto &[uuid, want] : data_cases("mount_lookups.txt")) {
        char out[VOL_MNT_PATH_LEN] = "stale";
        const char *id = uuid == "\"\"" ? "" : uuid.c_str();  // clang 14 cannot capture a structured binding
        const int found = quiet([&] { return sys_raid_get_mnt_path_by_uuid(out, sizeof out, id); });
        const int unlocked = quiet([&] { return sys_raid_vol_is_unlocked_by_uuid(id); });
        EXPECT_EQ(std::to_string(found) + " " + (*out ? out : "-") + " " + std::to_string(unlocked), subst(want))
            << uuid;
    }
    char small[8];
    EXPECT_EQ(quiet([&] { return sys_raid_get_mnt_path_by_uuid(small, sizeof small, "u-one"); }), 6);
}

TEST_F(RealMounts, VolumeListAndRootChainEndToEnd)
{
    korv::list_owner list(vol_info_free_list);
    ASSERT_EQ(quiet([&] { return get_vol_info_list(list.get()); }), 0);
    std::string got;
    for (vol_info_t *v : korv::list_records<vol_info_t>(list.get()))
        got += std::string(v->uuid) + " " + v->mnt_path + ";";
    EXPECT_EQ(got, subst("u-one @MNT1@;u-two @MNT2@;u-locked @NONE@;u-dup @MNT2@;u-dup @MNT1@;u-dup2 @NONE@;"
                         "u-dup2 @MNT2@;"));
    EXPECT_EQ(quiet([&] { return get_vol_info_list(list.get()); }), ERR_PARAM);  // not empty

    // The walk's result, then uuid, mount path and sleep of each volume.
    auto chain = [&](const char *mask) {
        standin("powermgmt", mask);
        vol_lun_info_t *head = nullptr;
        std::string v = std::to_string(quiet([&] { return init_root_vol_lun_info(&head, 1); }));
        for (vol_lun_info_t *r = head; r; r = r->next)
            v += std::string(";") + r->uuid + " " + r->vol_mnt_path + " " + std::to_string(r->hibernation);
        quiet([&] { vol_lun_info_list_deinit(&head); return 0; });
        return v;
    };
    // sdc, md2's only member, sleeps.
    EXPECT_EQ(chain("result: 4"), subst("0;u-one @MNT1@ 0;u-two @MNT2@ 1;u-dup @MNT1@ 0;u-dup2 @MNT2@ 1"));
    // Every disk asleep: every volume sleeps and no member list is read;
    // with one awake, the missing lists fail the walk.
    ASSERT_EQ(xmldbc_del(XMLDB_SOCK_SYSINFO, 0, "/raids"), 0);
    EXPECT_EQ(chain("result: 7"), subst("0;u-one @MNT1@ 1;u-two @MNT2@ 1;u-dup @MNT1@ 1;u-dup2 @MNT2@ 1"));
    EXPECT_EQ(chain("result: 3"), std::to_string(ERR_SYSINFO));
}

TEST_F(RealMounts, HostileMountPathRunsNothing)
{
    std::string dir = SysRoot::file("/mnt/x\"$(touch canary1)`touch canary2`\"y");
    fs::create_directories(dir);
    ASSERT_EQ(mount("tmpfs", dir.c_str(), "tmpfs", 0, "size=2m"), 0);
    mounted_.push_back(dir);
    ASSERT_EQ(chdir(SysRoot::path().c_str()), 0);
    U64s got(3);  // real df's figures of an empty tmpfs
    EXPECT_EQ(quiet([&] { return _sys_get_df_info(&got[0], &got[1], &got[2], dir.c_str()); }), 0);
    EXPECT_EQ(got, U64s({2u << 20, 0, 2u << 20}));
    EXPECT_FALSE(fs::exists("canary1") || fs::exists("canary2"));
}

}  // namespace
