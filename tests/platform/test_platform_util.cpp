// SPDX-License-Identifier: Apache-2.0
// The platform utility calls: database shortcuts on a real service, the shell
// runner and escaping, string helpers, and queries of a fake /proc and /sys.
#include <sys/stat.h>
#include <unistd.h>

#include <cstdint>
#include <cstring>
#include <filesystem>
#include <set>

#include <gtest/gtest.h>

#include "common/korvadm_str.h"
#include "platform/platform_util.h"
#include "platform/xmldbc.h"
#include "tests/support/xmldbd_fixture.h"

using korv_test::SysRoot;

namespace {

// The permission bits of a file in the root, -1 when it is missing.
int mode_of(const std::string &abs)
{
    struct stat st{};
    return ::stat(SysRoot::file(abs).c_str(), &st) == 0 ? static_cast<int>(st.st_mode & 07777) : -1;
}

}  // namespace

TEST(PlatformDb, IntegersStringsAndTheSavedFile)
{
    korv_test::XmldbService db;
    EXPECT_EQ(dbGetLL("/system_mgr/iscsi/enable"), 0);
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
    SysRoot::mkdirs("/usr/local");
    EXPECT_EQ(LIB_CP_Config_To_MTD(1), -1);
    ASSERT_EQ(xml_write_file("/etc/NAS_CFG/config.xml"), 0);
    ASSERT_EQ(LIB_CP_Config_To_MTD(1), 0);
    const std::string copy = SysRoot::read("/usr/local/config/config.xml");
    EXPECT_EQ(copy, SysRoot::read("/etc/NAS_CFG/config.xml"));
    EXPECT_NE(copy.find("99999999999999999999"), std::string::npos);
    EXPECT_EQ(mode_of("/usr/local/config/config.xml"), 0600);
    SysRoot::remove("/usr/local");
    EXPECT_EQ(LIB_CP_Config_To_MTD(1), -1);
    EXPECT_EQ(mode_of("/usr/local"), -1);

    // The service gone: the calls pass the client's failure on (XmldbAvailability).
    db.stop();
    EXPECT_EQ(dbGetStr(buf, sizeof buf, "/system_mgr/iscsi/enable"), -1);
    EXPECT_STREQ(buf, "");
    EXPECT_EQ(dbSetLL(1, "/x"), -1);
}

TEST(PlatformSystem, ReturnsTheShellStatusAndEscapedValuesStayData)
{
    EXPECT_EQ(System("exit %d", 3), 3);
    EXPECT_EQ(System("exit 255"), 255);
    EXPECT_EQ(System("kill -9 $$"), 128 + 9);
    EXPECT_EQ(System("true; %s", "false"), 1);
    EXPECT_EQ(System(nullptr), -1);
    EXPECT_EQ(str_insert_back_slash(nullptr), nullptr);

    // What the shell reads inside double quotes, a trailing backslash
    // included, through the real shell. Each escape: ShellEscape (test_str).
    const std::string canary = SysRoot::file("/canary"), out = SysRoot::file("/echo-out");
    const std::string v = "$(touch " + canary + ")`touch " + canary + "`\"; touch " + canary + "; $HOME\t\n'q' \\";
    const korv::c_buffer esc(str_insert_back_slash(v.c_str()));
    ASSERT_NE(esc, nullptr);
    EXPECT_EQ(System("printf '%%s' \"%s\" > %s", esc.get(), out.c_str()), 0);
    EXPECT_EQ(SysRoot::read("/echo-out"), v);
    EXPECT_NE(::access(canary.c_str(), F_OK), 0) << "a value ran as a command";
}

TEST(PlatformStrings, Str2llIsStrictAndStrsepExCollapsesRuns)
{
    long long v = 77;
    for (auto [text, want] : {std::pair{"42", 42LL}, {"  -9223372036854775808", INT64_MIN}, {"1000\n", 1000LL}}) {
        EXPECT_EQ(str2ll(text, &v), 0) << text;  // the line end as read from a /sys file
        EXPECT_EQ(v, want);
    }
    v = 5;
    for (const char *bad : {"", "   ", "12abc", "abc", "9223372036854775808", "1 2", "0x10", (const char *)nullptr})
        EXPECT_EQ(str2ll(bad, &v), -1) << (bad ? bad : "NULL");
    EXPECT_EQ(v, 5) << "a failed parse must not touch the value";
    EXPECT_EQ(str2ll("1", nullptr), -1);

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

TEST(PlatformQueries, MountPointsHostNameMacAddressLinkSpeedAndRandomNumbers)
{
    SysRoot::mkdirs("/proc/self");
    std::filesystem::copy_file(KORV_TEST_DATA "/mountinfo", SysRoot::file("/proc/self/mountinfo"),
                               std::filesystem::copy_options::overwrite_existing);
    const char *configfs = "/sys/kernel/config";
    EXPECT_EQ(sys_mount_point(configfs), configfs);
    for (const char *mounted : {"/sys/kernel/config/", "/mnt/Volume 1"})
        EXPECT_NE(sys_mount_point(mounted), nullptr) << mounted;
    for (const char *not_mounted : {"/sys/kernel", "/mnt/Volume\\0401", "relative", (const char *)nullptr})
        EXPECT_EQ(sys_mount_point(not_mounted), nullptr) << (not_mounted ? not_mounted : "NULL");
    SysRoot::remove("/proc/self/mountinfo");
    EXPECT_EQ(sys_mount_point(configfs), nullptr);

    // Reading it: HostName (test_sys). Never a cut name, and a missing file
    // is a failure (the library would take an empty name for one too).
    SysRoot::write("/proc/sys/kernel/hostname", "My_Host01\n");
    char tight[9];
    EXPECT_EQ(sys_hostname(tight, sizeof tight), -1);
    EXPECT_STREQ(tight, "");
    SysRoot::remove("/proc/sys/kernel/hostname");
    EXPECT_EQ(sys_hostname(tight, sizeof tight), -1);

    // A good address in either case: MacAddress (test_sys).
    SysRoot::write("/sys/class/net/egiga0/address", "00:14:Fd:1a:2B:ff\n");
    ASSERT_NE(sys_get_mac_addr("egiga0"), nullptr);
    for (const char *bad : {"00:14:fd:1a:2b", "00:14:fd:1a:2b:ff:00", "00-14-fd-1a-2b-ff", "zz:14:fd:1a:2b:ff", ""}) {
        SysRoot::write("/sys/class/net/bad0/address", std::string(bad) + "\n");
        EXPECT_EQ(sys_get_mac_addr("bad0"), nullptr) << bad;
    }
    for (const char *dev : {"absent0", "../../../sys/class/net/egiga0", "", (const char *)nullptr})
        EXPECT_EQ(sys_get_mac_addr(dev), nullptr) << (dev ? dev : "NULL");

    // Port 1 is egiga1; a driver without a link may say -1.
    for (auto [operstate, speed, want] : {std::tuple{"up", "1000", 1000}, {"down", "100", 0}, {"up", "-1", 0},
                                          {"up", "10000", 10000}}) {
        SysRoot::write("/sys/class/net/egiga1/operstate", std::string(operstate) + "\n");
        SysRoot::write("/sys/class/net/egiga1/speed", std::string(speed) + "\n");
        EXPECT_EQ(LIB_Get_Lan_Link_Speed(1), want) << operstate << " " << speed;
    }
    SysRoot::write("/sys/class/net/egiga0/speed", "1000\n");
    EXPECT_EQ(LIB_Get_Lan_Link_Speed(0), 0) << "no operstate";
    SysRoot::write("/sys/class/net/egiga0/operstate", "up\n");
    EXPECT_EQ(LIB_Get_Lan_Link_Speed(0), 1000);
    EXPECT_EQ(LIB_Get_Lan_Link_Speed(2), 0);

    std::set<int> seen;
    for (int i = 0; i < 16; ++i)
        seen.insert(sys_random());
    EXPECT_GE(*seen.begin(), 0);
    EXPECT_GT(seen.size(), 8u);
}
