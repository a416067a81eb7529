// The bundled powermgmt: "-s" asks each disk of the sysinfo database with
// hdparm -C (a stand-in first on PATH) and prints the mask of sleeping disks.
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>

#include <gtest/gtest.h>

#include "platform/xmldbc.h"
#include "tests/support/xmldbd_fixture.h"

using korv_test::SysRoot;

namespace {

// Output and exit status of a command line.
std::pair<std::string, int> run(const std::string &cmd)
{
    std::string out;
    std::FILE *p = popen(cmd.c_str(), "r");
    if (!p)
        return {"", -1};
    char buf[256];
    while (std::fgets(buf, sizeof buf, p))
        out += buf;
    int st = pclose(p);
    return {out, WIFEXITED(st) ? WEXITSTATUS(st) : -1};
}

class Powermgmt : public ::testing::Test {
protected:
    void SetUp() override
    {
        setenv("PATH", (std::string(KORV_PLATFORM_TEST_DATA) + ":" + std::getenv("PATH")).c_str(), 1);
        ASSERT_EQ(chdir(SysRoot::path().c_str()), 0);
    }
    // Lists the disks (name, state; "-" answers nothing) and runs "powermgmt -s".
    std::pair<std::string, int> ask(const std::vector<std::pair<std::string, std::string>> &disks)
    {
        SysRoot::remove("/hdparm");
        SysRoot::mkdirs("/hdparm");
        EXPECT_EQ(xmldbc_del(XMLDB_SOCK_SYSINFO, 0, "/disks"), 0);
        EXPECT_EQ(xmldbc_set(XMLDB_SOCK_SYSINFO, 0, "/disks/disk#", std::to_string(disks.size()).c_str()), 0);
        for (size_t i = 0; i < disks.size(); ++i) {
            std::string key = "/disks/disk:" + std::to_string(i + 1) + "/name";
            EXPECT_EQ(xmldbc_set(XMLDB_SOCK_SYSINFO, 0, key.c_str(), disks[i].first.c_str()), 0);
            if (disks[i].second != "-")
                std::ofstream(SysRoot::file("/hdparm/") + disks[i].first) << disks[i].second;
        }
        return run(std::string(KORV_POWERMGMT_PATH) + " -s");
    }

    korv_test::XmldbService db_{korv_test::kWithSysinfo};
};

TEST_F(Powermgmt, MasksTheDisksInStandby)
{
    std::ifstream in(std::string(KORV_PLATFORM_TEST_DATA) + "/powermgmt_disks.txt");
    int cases = 0;
    for (std::string line; std::getline(in, line);) {
        if (line.empty() || line[0] == '#')
            continue;
        std::istringstream words(line.substr(0, line.find("=>")));
        std::vector<std::pair<std::string, std::string>> disks;
        for (std::string name, state; words >> name >> state;)
            disks.emplace_back(name, state);
        EXPECT_EQ(ask(disks), std::make_pair("result: " + line.substr(line.find("=>") + 3) + "\n", 0)) << line;
        ++cases;
    }
    EXPECT_EQ(cases, 6);
    EXPECT_FALSE(std::filesystem::exists("canary"));
    EXPECT_EQ(SysRoot::read("/hdparm.log").find("../"), std::string::npos);

    // Disk 33 shares bit 1 with disk 1.
    std::vector<std::pair<std::string, std::string>> many;
    for (int i = 0; i < 34; ++i)
        many.emplace_back("sd" + std::to_string(i), i == 33 ? "standby" : "active/idle");
    EXPECT_EQ(ask(many).first, "result: 2\n");
}

TEST_F(Powermgmt, RefusesOtherUse)
{
    EXPECT_EQ(run(std::string(KORV_POWERMGMT_PATH) + " 2>/dev/null").second, 2);
    EXPECT_EQ(run(std::string(KORV_POWERMGMT_PATH) + " -x 2>/dev/null").second, 2);
}

}  // namespace
