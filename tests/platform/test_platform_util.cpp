// SPDX-License-Identifier: Apache-2.0
// The platform utility calls: database shortcuts on a real service, the shell
// runner and escaping, string helpers, and queries of a fake /proc and /sys.
#include "platform/platform_util.h"
#include "platform/xmldbc.h"
#include "tests/support/xmldbd_fixture.h"

#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <gtest/gtest.h>
#include <set>
#include <string>
#include <sys/stat.h>
#include <unistd.h>
#include <vector>

using korv_test::SysRoot;
using korv_test::XmldbService;

TEST(PlatformDb, IntegersStringsAndTheSavedFile)
{
    XmldbService db;
    EXPECT_EQ(dbGetLL("/system_mgr/iscsi/enable"), 0);
    ASSERT_EQ(dbSetLL(1, "/system_mgr/iscsi/enable"), 0);
    EXPECT_EQ(dbGetLL("/system_mgr/iscsi/enable"), 1);
    ASSERT_EQ(dbSetLL(-1099511627776LL, "/n"), 0);
    EXPECT_EQ(dbGetLL("/n"), -1099511627776LL);
    for (auto [text, want] : {std::pair{"12abc", 12LL}, {"abc", 0LL}, {"99999999999999999999", 0LL}}) {
        ASSERT_EQ(dbSetStr(text, "/n"), 0);
        EXPECT_EQ(dbGetLL("/n"), want) << text;
    }

    char buf[6];
    ASSERT_EQ(dbSetStr("192.168.1.10", "/system_mgr/iscsi/iSNS/ip"), 0);
    EXPECT_EQ(dbGetStr(buf, sizeof buf, "/system_mgr/iscsi/iSNS/ip"), 0);
    EXPECT_STREQ(buf, "192.1");
    EXPECT_EQ(dbGetStr(buf, 0, "/system_mgr/iscsi/iSNS/ip"), -1);
    EXPECT_EQ(dbGetStr(nullptr, 6, "/system_mgr/iscsi/iSNS/ip"), -1);
    EXPECT_EQ(dbDelete("/system_mgr/iscsi/iSNS"), 0);
    EXPECT_EQ(dbGetStr(buf, sizeof buf, "/system_mgr/iscsi/iSNS/ip"), 0);
    EXPECT_STREQ(buf, "");

    // The saved file goes to the persistent partition whole and private;
    // without that partition (or a saved file) nothing is written anywhere.
    SysRoot::remove("/usr/local");
    SysRoot::remove("/etc/NAS_CFG/config.xml");
    SysRoot::mkdirs("/usr/local");
    EXPECT_EQ(LIB_CP_Config_To_MTD(1), -1);
    ASSERT_EQ(xml_write_file("/etc/NAS_CFG/config.xml"), 0);
    ASSERT_EQ(LIB_CP_Config_To_MTD(1), 0);
    const std::string copy = SysRoot::read("/usr/local/config/config.xml");
    EXPECT_EQ(copy, SysRoot::read("/etc/NAS_CFG/config.xml"));
    EXPECT_NE(copy.find("99999999999999999999"), std::string::npos);
    struct stat st{};
    EXPECT_TRUE(::stat(SysRoot::file("/usr/local/config/config.xml").c_str(), &st) == 0 && (st.st_mode & 0777) == 0600);
    SysRoot::remove("/usr/local");
    EXPECT_EQ(LIB_CP_Config_To_MTD(1), -1);
    EXPECT_NE(::access(SysRoot::file("/usr/local").c_str(), F_OK), 0);

    db.stop();
    EXPECT_EQ(dbGetStr(buf, sizeof buf, "/system_mgr/iscsi/enable"), -1);
    EXPECT_STREQ(buf, "");
    EXPECT_EQ(dbGetLL("/system_mgr/iscsi/enable"), 0);
    EXPECT_EQ(dbSetLL(1, "/x"), -1);
    EXPECT_EQ(dbSetStr("v", "/x"), -1);
    EXPECT_EQ(dbDelete("/x"), -1);
}

TEST(PlatformSystem, ReturnsTheShellStatusAndEscapedValuesStayData)
{
    EXPECT_EQ(System("exit %d", 3), 3);
    EXPECT_EQ(System("exit 255"), 255);
    EXPECT_EQ(System("kill -9 $$"), 128 + 9);
    EXPECT_EQ(System("true; %s", "false"), 1);
    EXPECT_EQ(System(nullptr), -1);

    const std::string canary = SysRoot::file("/canary");
    const std::vector<std::string> hostile = {
        "plain",
        "$(touch " + canary + ")",
        "`touch " + canary + "`",
        "a\"; touch " + canary + "; echo \"",
        "back\\slash\\",
        "$HOME ${PATH} $$",
        "tab\tnew\nline 'single'",
        "",
    };
    const std::string out = SysRoot::file("/echo-out");
    for (const auto &v : hostile) {
        char *esc = str_insert_back_slash(v.c_str());
        ASSERT_NE(esc, nullptr);
        EXPECT_EQ(System("printf '%%s' \"%s\" > %s", esc, out.c_str()), 0) << v;
        std::free(esc);
        EXPECT_EQ(SysRoot::read("/echo-out"), v);
    }
    EXPECT_NE(::access(canary.c_str(), F_OK), 0) << "a value ran as a command";

    EXPECT_EQ(str_insert_back_slash(nullptr), nullptr);
}

TEST(PlatformStrings, Str2llIsStrictAndStrsepExCollapsesRuns)
{
    long long v = 77;
    EXPECT_EQ(str2ll("42", &v), 0);
    EXPECT_EQ(v, 42);
    EXPECT_EQ(str2ll("  -9223372036854775808", &v), 0);
    EXPECT_EQ(v, INT64_MIN);
    EXPECT_EQ(str2ll("1000\n", &v), 0);  // as read from a /sys file
    EXPECT_EQ(v, 1000);
    v = 5;
    for (const char *bad : {"", "   ", "12abc", "abc", "9223372036854775808", "1 2", "0x10"})
        EXPECT_EQ(str2ll(bad, &v), -1) << bad;
    EXPECT_EQ(v, 5) << "a failed parse must not touch the value";
    EXPECT_EQ(str2ll(nullptr, &v), -1);
    EXPECT_EQ(str2ll("1", nullptr), -1);

    // strsep_ex treats a run of separators as one.
    for (auto [text, want] : {std::pair{"  sda,, sdb \t sdc  ", std::vector<std::string>{"sda", "sdb", "sdc"}},
                              {"only", {"only"}},
                              {"   ", {}}}) {
        std::string copy = text;
        char *p = copy.data();
        std::vector<std::string> tokens;
        while (char *t = strsep_ex(&p, " ,\t"))
            tokens.emplace_back(t);
        EXPECT_EQ(tokens, want) << text;
        EXPECT_EQ(p, nullptr);
    }
    EXPECT_EQ(strsep_ex(nullptr, " "), nullptr);
}

TEST(PlatformQueries, MountPointsFromMountinfo)
{
    SysRoot::mkdirs("/proc/self");
    std::filesystem::copy_file(KORV_TEST_DATA "/mountinfo", SysRoot::file("/proc/self/mountinfo"),
                               std::filesystem::copy_options::overwrite_existing);
    const char *p = "/sys/kernel/config";
    EXPECT_EQ(sys_mount_point(p), p);
    EXPECT_NE(sys_mount_point("/sys/kernel/config/"), nullptr);
    EXPECT_NE(sys_mount_point("/mnt/Volume 1"), nullptr);
    EXPECT_EQ(sys_mount_point("/sys/kernel"), nullptr);
    EXPECT_EQ(sys_mount_point("/mnt/Volume\\0401"), nullptr);
    EXPECT_EQ(sys_mount_point("relative"), nullptr);
    EXPECT_EQ(sys_mount_point(nullptr), nullptr);
    SysRoot::remove("/proc/self/mountinfo");
    EXPECT_EQ(sys_mount_point(p), nullptr);
}

TEST(PlatformQueries, HostNameAndMacAddress)
{
    SysRoot::write("/proc/sys/kernel/hostname", "My_Host01\n");
    char buf[16], tight[9];
    EXPECT_EQ(sys_hostname(buf, sizeof buf), 0);
    EXPECT_STREQ(buf, "My_Host01");
    EXPECT_EQ(sys_hostname(tight, sizeof tight), -1);  // never a cut name
    EXPECT_STREQ(tight, "");
    SysRoot::remove("/proc/sys/kernel/hostname");
    EXPECT_EQ(sys_hostname(buf, sizeof buf), -1);

    SysRoot::write("/sys/class/net/egiga0/address", "00:14:Fd:1a:2B:ff\n");
    const unsigned char *m = sys_get_mac_addr("egiga0");
    ASSERT_NE(m, nullptr);
    const unsigned char want[6] = {0x00, 0x14, 0xfd, 0x1a, 0x2b, 0xff};
    EXPECT_EQ(std::memcmp(m, want, 6), 0);
    for (const char *bad : {"00:14:fd:1a:2b", "00:14:fd:1a:2b:ff:00", "00-14-fd-1a-2b-ff", "zz:14:fd:1a:2b:ff", ""}) {
        SysRoot::write("/sys/class/net/bad0/address", std::string(bad) + "\n");
        EXPECT_EQ(sys_get_mac_addr("bad0"), nullptr) << bad;
    }
    for (const char *dev : {"absent0", "../../../sys/class/net/egiga0", ""})
        EXPECT_EQ(sys_get_mac_addr(dev), nullptr) << dev;
    EXPECT_EQ(sys_get_mac_addr(nullptr), nullptr);
}

TEST(PlatformQueries, LanLinkSpeedAndRandomNumbers)
{
    SysRoot::write("/sys/class/net/egiga0/speed", "1000\n");
    const struct {
        const char *operstate, *speed;
        int want;
    } cases[] = {{"up", "1000", 1000}, {"down", "100", 0}, {"up", "-1", 0} /* some drivers without a link */,
                 {"up", "10000", 10000}};
    for (const auto &c : cases) {
        SysRoot::write("/sys/class/net/egiga1/operstate", std::string(c.operstate) + "\n");
        SysRoot::write("/sys/class/net/egiga1/speed", std::string(c.speed) + "\n");
        EXPECT_EQ(LIB_Get_Lan_Link_Speed(1), c.want) << c.operstate << " " << c.speed;
    }
    EXPECT_EQ(LIB_Get_Lan_Link_Speed(0), 0);  // egiga0 has no operstate
    SysRoot::write("/sys/class/net/egiga0/operstate", "up\n");
    EXPECT_EQ(LIB_Get_Lan_Link_Speed(0), 1000);
    EXPECT_EQ(LIB_Get_Lan_Link_Speed(2), 0);

    std::set<int> seen;
    for (int i = 0; i < 16; ++i)
        seen.insert(sys_random());
    EXPECT_GE(*seen.begin(), 0);
    EXPECT_GT(seen.size(), 8u);
}
