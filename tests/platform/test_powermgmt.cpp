// SPDX-License-Identifier: Apache-2.0
// The bundled powermgmt: "-s" asks each disk of the sysinfo database with
// hdparm -C (a stand-in first on PATH) and prints the mask of sleeping disks.
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <sstream>

#include <gtest/gtest.h>

#include "platform/xmldbc.h"
#include "tests/support/xmldbd_fixture.h"

using korv_test::SysRoot;
using Disks = std::vector<std::pair<std::string, std::string>>;

namespace {

// Lists the disks (name, hdparm's answer; "-" for none), runs `powermgmt args`
// and returns its output and exit status.
std::pair<std::string, int> powermgmt(const Disks &disks, const std::string &args = "-s")
{
    SysRoot::remove("/hdparm");
    SysRoot::mkdirs("/hdparm");
    xmldbc_del(XMLDB_SOCK_SYSINFO, 0, "/disks");
    xmldbc_set(XMLDB_SOCK_SYSINFO, 0, "/disks/disk#", std::to_string(disks.size()).c_str());
    for (size_t i = 0; i < disks.size(); ++i) {
        xmldbc_set(XMLDB_SOCK_SYSINFO, 0, ("/disks/disk:" + std::to_string(i + 1) + "/name").c_str(),
                   disks[i].first.c_str());
        if (disks[i].second != "-")
            std::ofstream(SysRoot::file("/hdparm/") + disks[i].first) << disks[i].second;
    }
    std::string out;
    std::FILE *p = popen((KORV_POWERMGMT_PATH " " + args + " 2>/dev/null").c_str(), "r");
    for (int c; p && (c = std::fgetc(p)) != EOF;)
        out += static_cast<char>(c);
    int st = p ? pclose(p) : -1;
    return {out, WIFEXITED(st) ? WEXITSTATUS(st) : -1};
}

TEST(Powermgmt, MasksTheDisksInStandby)
{
    korv_test::XmldbService db(korv_test::kWithSysinfo);
    setenv("PATH", (std::string(KORV_TEST_DATA) + ":" + std::getenv("PATH")).c_str(), 1);
    ASSERT_EQ(chdir(SysRoot::path().c_str()), 0);
    std::ifstream in(std::string(KORV_TEST_DATA) + "/powermgmt_disks.txt");
    for (std::string line; std::getline(in, line);) {
        if (line.empty() || line[0] == '#')
            continue;
        std::istringstream words(line.substr(0, line.find("=>")));
        Disks disks;
        for (std::string name, state; words >> name >> state;)
            disks.emplace_back(name, state);
        EXPECT_EQ(powermgmt(disks), std::pair("result: " + line.substr(line.find("=>") + 3) + "\n", 0)) << line;
    }
    EXPECT_FALSE(std::filesystem::exists("canary"));
    EXPECT_EQ(SysRoot::read("/hdparm.log").find("../"), std::string::npos);

    Disks many(34, {"sdx", "active/idle"});  // disk 33 shares bit 1 with disk 1
    for (int i = 0; i < 34; ++i)
        many[i].first = "sd" + std::to_string(i);
    many[33].second = "standby";
    EXPECT_EQ(powermgmt(many).first, "result: 2\n");
    EXPECT_EQ(powermgmt({}, "").second, 2);
    EXPECT_EQ(powermgmt({}, "-x").second, 2);
}

}  // namespace
