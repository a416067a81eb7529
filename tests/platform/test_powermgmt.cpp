// SPDX-License-Identifier: Apache-2.0
// The bundled powermgmt: "-s" asks each disk of the sysinfo database with
// hdparm -C (a stand-in first on PATH) and prints the mask of sleeping disks.
#include <unistd.h>

#include <filesystem>
#include <sstream>

#include <gtest/gtest.h>

#include "platform/xmldbc.h"
#include "tests/support/data_cases.h"
#include "tests/support/xmldbd_fixture.h"

using korv_test::SysRoot;

TEST(Powermgmt, MasksTheDisksInStandby)
{
    korv_test::XmldbService db(korv_test::kWithSysinfo);
    setenv("PATH", (std::string(KORV_TEST_DATA) + ":" + std::getenv("PATH")).c_str(), 1);
    ASSERT_EQ(chdir(SysRoot::path().c_str()), 0);
    for (const auto &[disks, mask] : data_cases("powermgmt_disks.txt")) {
        // Each disk in the sysinfo database, and hdparm's answer for it.
        SysRoot::remove("/hdparm");
        SysRoot::mkdirs("/hdparm");
        xmldbc_del(XMLDB_SOCK_SYSINFO, 0, "/disks");
        std::istringstream words(disks);
        int n = 0;
        for (std::string name, state; words >> name >> state;) {
            const std::string at = "/disks/disk:" + std::to_string(++n) + "/name";
            ASSERT_EQ(xmldbc_set(XMLDB_SOCK_SYSINFO, 0, at.c_str(), name.c_str()), 0);
            if (state != "-")
                SysRoot::write("/hdparm/" + name, state);
        }
        ASSERT_EQ(xmldbc_set(XMLDB_SOCK_SYSINFO, 0, "/disks/disk#", std::to_string(n).c_str()), 0);
        int status = -1;
        EXPECT_EQ(korv_test::run_shell(KORV_POWERMGMT_PATH " -s 2>/dev/null", &status),
                  "result: " + mask + "\n") << disks;
        EXPECT_EQ(status, 0);
    }
    EXPECT_FALSE(std::filesystem::exists("canary"));
    EXPECT_EQ(SysRoot::read("/hdparm.log").find("../"), std::string::npos);
    for (const char *usage : {"", " -x"}) {
        int status = -1;
        korv_test::run_shell(KORV_POWERMGMT_PATH + std::string(usage) + " 2>/dev/null", &status);
        EXPECT_EQ(status, 2) << usage;
    }
}
