// SPDX-License-Identifier: Apache-2.0
// Commands, files and locks: the utility layer against the real file system,
// shell and System V semaphores.
#include "common/korvadm_utils.h"

#include <arpa/inet.h>
#include <signal.h>
#include <sys/sem.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstring>
#include <filesystem>
#include <sstream>
#include <string>
#include <tuple>
#include <vector>

#include <gtest/gtest.h>

#include "tests/support/data_cases.h"
#include "tests/support/process.h"
#include "tests/support/sysroot.h"

namespace {

namespace fs = std::filesystem;
using UtilsTest = korv_test::SysRootTest;

TEST_F(UtilsTest, KernelModuleCheckMatchesSubstringsOfProcModules)
{
    EXPECT_EQ(check_kmodule_inserted("target_core_mod"), -1);  // no /proc/modules at all
    write_file(at("/proc/modules"), "configfs 57344 2 - Live 0x0\ntarget_core_mod 16384 0 - Live 0x0\n");
    for (auto [name, rc] : {std::pair{"target_core_mod", 0}, {"core_mod", 0}, {"iscsi_target_mod", -1}, {nullptr, -1}})
        EXPECT_EQ(check_kmodule_inserted(name), rc) << (name ? name : "NULL");
}

TEST_F(UtilsTest, MakeDirIncludeParentCreatesEveryLevelAndIsRepeatable)
{
    for (int round = 0; round < 2; ++round)
        ASSERT_EQ(make_dir_include_parent(at("/a/b/c").c_str(), 0), 0) << round;
    for (const char *p : {"/a", "/a/b", "/a/b/c"})
        EXPECT_TRUE(fs::is_directory(at(p)) && fs::status(at(p)).permissions() == fs::perms::owner_all) << p;
    // A file in the way is a failure, not an existing directory.
    write_file(at("/f"), "x");
    for (const std::string &bad : {at("/f/g"), at("/f")})
        EXPECT_EQ(make_dir_include_parent(bad.c_str(), 0), -1) << bad;
    EXPECT_EQ(make_dir_include_parent(nullptr, 0), -1);
}

TEST_F(UtilsTest, RemovalHelpersTreatMissingAsDoneAndNeverRunNames)
{
    EXPECT_EQ(remove_dir(at("/missing").c_str()), 0);
    EXPECT_EQ(remove_file(at("/missing").c_str()), 0);
    EXPECT_EQ(remove_dir_recurive(""), 0);
    EXPECT_EQ(remove_dir_recurive(nullptr), -1);
    mkdirs(at("/full/x"));
    EXPECT_EQ(remove_dir(at("/full").c_str()), -1);  // not empty

    // A name that would run a command if it reached the shell unescaped.
    const std::string canary = at("/CANARY");
    const std::string tree = at("/t\"; touch " + canary + "; echo \"$(touch " + canary + ")`touch " + canary + "`");
    write_file(tree + "/sub/file", "x");
    EXPECT_EQ(remove_dir_recurive(tree.c_str()), 0);
    EXPECT_FALSE(exists(tree));
    EXPECT_FALSE(exists(canary));
}

TEST_F(UtilsTest, AllocatedSizeOfASparseFileIsBelowItsLength)
{
    const std::string path = at("/sparse");
    write_file(path, std::string(8192, 'x'));
    ASSERT_EQ(truncate(path.c_str(), 64 << 20), 0);  // a hole after the data
    unsigned long long size = 1;
    ASSERT_EQ(get_file_alloc_size(&size, path.c_str()), 0);
    EXPECT_TRUE(size >= 8192 && size < (64ull << 20)) << size;
    EXPECT_EQ(get_file_alloc_size(&size, at("/missing").c_str()), -1);
    EXPECT_EQ(size, 0u);
}

TEST_F(UtilsTest, SymlinkOverAnExistingLink)
{
    const std::string link = at("/link");
    write_file(at("/plain"), "x");
    const std::tuple<const char *, std::string, int> steps[] = {
        {"/target/one", link, 0}, {"/target/one", link, 0}, {"/target/two", link, -2},
        {"/target/one", at("/plain"), -1}, {"/t", at("/no/such/dir/link"), -1}};
    for (const auto &[target, at_path, rc] : steps)
        EXPECT_EQ(create_symlink(target, at_path.c_str()), rc) << target << " at " << at_path;
    EXPECT_EQ(fs::read_symlink(link), "/target/one");
}

TEST_F(UtilsTest, FileCreationPathChecksAndWritabilityProbe)
{
    const std::string path = at("/new");
    EXPECT_EQ(create_file_if_absent(path.c_str(), 0400), 0);
    EXPECT_EQ(check_path_exist(path.c_str()), 0);
    write_file(path, "keep");
    EXPECT_EQ(create_file_if_absent(path.c_str(), 0700), 0);
    EXPECT_EQ(read_file(path), "keep");
    EXPECT_EQ(check_path_access(path.c_str(), X_OK), -1);
    EXPECT_EQ(check_path_exist(at("/none").c_str()), -1);

    const std::string probe = at("/vol/.iscsi_vol_test.temp");
    mkdirs(at("/vol"));
    EXPECT_EQ(check_dir_is_writable(at("/vol").c_str(), ".iscsi_vol_test.temp", (1 << 20) + 17), 0);
    EXPECT_FALSE(exists(probe));
    EXPECT_EQ(check_dir_is_writable(at("/nodir").c_str(), ".iscsi_vol_test.temp", 1), -1);
    // Whatever a user planted at the probe's name stays as it was.
    write_file(at("/victim"), "13 bytes here");
    ASSERT_EQ(symlink(at("/victim").c_str(), probe.c_str()), 0);
    EXPECT_EQ(check_dir_is_writable(at("/vol").c_str(), ".iscsi_vol_test.temp", 1 << 20), -1);
    EXPECT_EQ(read_file(at("/victim")), "13 bytes here");
    EXPECT_TRUE(exists(probe));
    write_file(at("/vol/plain"), "mine");
    EXPECT_EQ(check_dir_is_writable(at("/vol").c_str(), "plain", 1), -1);
    EXPECT_EQ(read_file(at("/vol/plain")), "mine");
}

TEST_F(UtilsTest, RunSystemCmdQuotesItsArgumentWhateverTheFormat)
{
    const std::string canary = at("/CANARY"), out = at("/out");
    const std::string arg = "$(touch " + canary + ")`touch " + canary + "`\"x; touch " + canary;
    EXPECT_EQ(run_system_cmd(("printf '%%s' %s > " + out).c_str(), arg.c_str()), 0);
    EXPECT_EQ(read_file(out), arg);
    EXPECT_EQ(run_system_cmd(": %s", ("x; touch " + canary).c_str()), 0);
    // A %s inside the format's own quotes would end them: refused.
    for (const char *f : {": '%s'", ": \"%s\"", "touch %s %d", "exit 3 # %s"})
        EXPECT_EQ(run_system_cmd(f, ("x; touch " + canary).c_str()), -1) << f;
    EXPECT_FALSE(exists(canary));
}

TEST_F(UtilsTest, RetriedCommandRunsUntilSuccessOrTriesRunOut)
{
    const std::string count = at("/count"), fail = "echo x >> " + count + "; exit 2";
    const int status = process_system_cmd_mt(fail.c_str(), 3, 1000);
    EXPECT_EQ(read_file(count), "x\nx\nx\n");
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 2) << status;
    // One try never waits, however long the allowed delay (about 2000 s).
    write_file(count, "");
    const auto t0 = std::chrono::steady_clock::now();
    EXPECT_NE(process_system_cmd_mt(fail.c_str(), 1, 2000000000), 0);
    EXPECT_LT(std::chrono::steady_clock::now() - t0, std::chrono::seconds(60));
    EXPECT_EQ(read_file(count), "x\n");
    EXPECT_EQ(process_system_cmd_mt(("echo y >> " + count + "y").c_str(), 3, 1000), 0);
    EXPECT_EQ(read_file(count + "y"), "y\n");
}

TEST_F(UtilsTest, SemaphoreIsRecreatedAfterTheLastHolderLeaves)
{
    const key_t key = static_cast<key_t>(0x4b000000 | (getpid() & 0xffffff));
    int id = -1;
    for (int round = 0; round < 2; ++round) {  // the second one recreates it at 1
        ASSERT_EQ(sem_P(&id, key), 0);
        EXPECT_EQ(semctl(id, 0, GETVAL), 0);  // held
        EXPECT_EQ(sem_V(&id, key), 0);        // nobody waits: removed
        EXPECT_EQ(id, -1);
        EXPECT_EQ(semget(key, 1, 0666), -1);
    }
}

TEST_F(UtilsTest, StopPreallocSignalsOnlyALivePidFromItsFile)
{
    korv_test::child_process child;
    ASSERT_TRUE(child.start([] { return pause(); }));
    write_file(at("/var/run/prealloc_lun1.pid"), std::to_string(child.pid()) + "\n");
    write_file(at("/var/run/prealloc_bad.pid"), "0\n");
    for (const char *name : {"bad", "missing", "", "../lun1", static_cast<const char *>(nullptr)})
        stop_prealloc(name);
    EXPECT_TRUE(child.running()) << "none of those reached it";
    stop_prealloc("lun1");
    EXPECT_EQ(child.wait(std::chrono::seconds(10)), 128 + SIGTERM);
}

TEST_F(UtilsTest, NameCharacters)
{
    for (const std::string &good : {std::string("iqn.2026-01.test:disk-1"), std::string(223, 'a')})
        EXPECT_EQ(check_name_chars_valid(good.c_str()), 0) << good;
    for (const std::string &bad : std::vector<std::string>{"", "Upper", "a_b", "a b", "a/b", "a%b", std::string(224, 'a')})
        EXPECT_EQ(check_name_chars_valid(bad.c_str()), -1) << bad;
    EXPECT_EQ(check_name_chars_valid(nullptr), -1);
}

// Addresses the C library parses must give its bytes (data/ipv6_texts.txt).
TEST_F(UtilsTest, Ipv6TextToBytesAndLinkLocal)
{
    for (const auto &[text, want] : data_cases("ipv6_texts.txt")) {
        std::istringstream w(want);
        std::string same_as;
        int link_local = 0;
        w >> same_as >> link_local;
        unsigned char got[16], expect[16];
        const bool refused = inet_pton(AF_INET6, same_as.c_str(), expect) != 1;  // as "refused" is
        EXPECT_EQ(ipv6_text_to_bytes(got, text.c_str()), refused ? -1 : 0) << text;
        EXPECT_TRUE(refused || std::memcmp(got, expect, 16) == 0) << text;
        EXPECT_EQ(is_ipv6_link_local(text.c_str()), link_local) << text;
    }
}

}  // namespace
