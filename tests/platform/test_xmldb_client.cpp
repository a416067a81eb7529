// The client library against a real xmldbd: path semantics, buffers, saving,
// and a service that is missing or restarts.
#include "platform/xmldbc.h"
#include "tests/support/xmldbd_fixture.h"

#include <chrono>
#include <csignal>
#include <cstring>
#include <gtest/gtest.h>
#include <string>

using korv_test::SysRoot;
using korv_test::XmldbService;

namespace {

const char *const S = XMLDB_SOCK_ISCSI;

std::string get(const char *path, int *rc = nullptr)
{
    char buf[512];
    int r = xmldbc_get_wb(S, 0, path, buf, sizeof buf);
    if (rc)
        *rc = r;
    return buf;
}

}  // namespace

TEST(XmldbSemantics, MissingAndEmptyReadAlike)
{
    XmldbService db;
    int rc = 0;
    EXPECT_EQ(get("/iscsi/target/id:1/name", &rc), "");
    EXPECT_EQ(rc, 1);
    ASSERT_EQ(xmldbc_set(S, 0, "/iscsi/target/id:1/name", ""), 0);
    EXPECT_EQ(get("/iscsi/target/id:1/name", &rc), "");
    EXPECT_EQ(rc, 1);
    ASSERT_EQ(xmldbc_set(S, 0, "/iscsi/target/id:1/name", "tgt"), 0);
    EXPECT_EQ(get("/iscsi/target/id:1/name", &rc), "tgt");
    EXPECT_EQ(rc, 4);
}

TEST(XmldbSemantics, SetCreatesParentsAndDeleteRemovesSubtrees)
{
    XmldbService db;
    ASSERT_EQ(xmldbc_set(S, 0, "/a/b/c/d", "deep"), 0);
    EXPECT_EQ(get("/a/b/c/d"), "deep");
    ASSERT_EQ(xmldbc_set(S, 0, "/a/b", "mid"), 0);
    EXPECT_EQ(get("/a/b/c/d"), "deep");  // giving a parent a value keeps its children

    ASSERT_EQ(xmldbc_set(S, 0, "/a/x", "sibling"), 0);
    ASSERT_EQ(xmldbc_del(S, 0, "/a/b"), 0);
    EXPECT_EQ(get("/a/b"), "");
    EXPECT_EQ(get("/a/b/c/d"), "");
    EXPECT_EQ(get("/a/x"), "sibling");

    // Deleting what is not there succeeds and changes nothing.
    EXPECT_EQ(xmldbc_del(S, 0, "/a/b"), 0);
    EXPECT_EQ(xmldbc_del(S, 0, "/never/was"), 0);
    EXPECT_EQ(get("/a/x"), "sibling");
}

TEST(XmldbSemantics, IdNamesAreNamesNotPositions)
{
    XmldbService db;
    for (int i = 1; i <= 3; ++i) {
        std::string p = "/iscsi/target/id:" + std::to_string(i) + "/name";
        ASSERT_EQ(xmldbc_set(S, 0, p.c_str(), ("t" + std::to_string(i)).c_str()), 0);
    }
    ASSERT_EQ(xmldbc_del(S, 0, "/iscsi/target/id:2"), 0);
    EXPECT_EQ(get("/iscsi/target/id:1/name"), "t1");
    EXPECT_EQ(get("/iscsi/target/id:2/name"), "");
    EXPECT_EQ(get("/iscsi/target/id:3/name"), "t3");
    // Re-creating the gap does not disturb its neighbours either.
    ASSERT_EQ(xmldbc_set(S, 0, "/iscsi/target/id:2/name", "again"), 0);
    EXPECT_EQ(get("/iscsi/target/id:3/name"), "t3");
}

TEST(XmldbSemantics, LongValuesAreCutInTheCallersBuffer)
{
    XmldbService db;
    std::string big(1000, 'v');
    big.back() = 'Z';
    ASSERT_EQ(xmldbc_set(S, 0, "/long", big.c_str()), 0);

    char small[8];
    std::memset(small, 'x', sizeof small);
    EXPECT_EQ(xmldbc_get_wb(S, 0, "/long", small, sizeof small), 1001);
    EXPECT_EQ(std::string(small), "vvvvvvv");

    char one[1] = {'x'};
    EXPECT_EQ(xmldbc_get_wb(S, 0, "/long", one, 1), 1001);
    EXPECT_EQ(one[0], '\0');

    std::string back(2000, '\0');
    EXPECT_EQ(xmldbc_get_wb(S, 0, "/long", back.data(), back.size()), 1001);
    EXPECT_EQ(std::string(back.c_str()), big);
}

TEST(XmldbSemantics, BadArgumentsFailWithoutAsking)
{
    XmldbService db;
    char buf[16] = "keep";
    EXPECT_EQ(xmldbc_get_wb(S, 0, nullptr, buf, sizeof buf), -1);
    EXPECT_EQ(xmldbc_get_wb(S, 0, "relative/path", buf, sizeof buf), -1);
    EXPECT_EQ(xmldbc_get_wb(S, 0, "/x", nullptr, 16), -1);
    EXPECT_EQ(xmldbc_get_wb(S, 0, "/x", buf, 0), -1);
    EXPECT_EQ(xmldbc_set(S, 0, "/x", nullptr), -1);
    EXPECT_EQ(xmldbc_set(S, 0, "/", "root has no value"), -1);
    EXPECT_EQ(xmldbc_del(S, 0, nullptr), -1);
    std::string huge(70000, 'h');
    EXPECT_EQ(xmldbc_set(S, 0, "/huge", huge.c_str()), -1);
    EXPECT_EQ(xmldbc_set(S, 0, "/ok", "still serving"), 0);
    EXPECT_EQ(get("/ok"), "still serving");
}

TEST(XmldbSemantics, SysinfoIsASeparateDatabase)
{
    XmldbService db(korv_test::kWithSysinfo);
    ASSERT_EQ(xmldbc_set(XMLDB_SOCK_SYSINFO, 0, "/vols/vol:1/name", "Volume_1"), 0);
    char buf[32];
    EXPECT_EQ(xmldbc_get_wb(XMLDB_SOCK_SYSINFO, 0, "/vols/vol:1/name", buf, sizeof buf), 9);
    EXPECT_STREQ(buf, "Volume_1");
    EXPECT_EQ(get("/vols/vol:1/name"), "");
}

TEST(XmldbSave, WritesTheTreeIntoTheConfigDirectoryOnly)
{
    XmldbService db;
    ASSERT_EQ(xmldbc_set(S, 0, "/iscsi/target/count", "1"), 0);
    ASSERT_EQ(xml_write_file("/etc/NAS_CFG/config.xml"), 0);
    std::string saved = SysRoot::read("/etc/NAS_CFG/config.xml");
    EXPECT_NE(saved.find("<count value=\"1\""), std::string::npos) << saved;

    EXPECT_EQ(xml_write_file("/tmp/elsewhere.xml"), -1);
    EXPECT_EQ(xml_write_file("/etc/NAS_CFG/../escape.xml"), -1);
    EXPECT_EQ(xml_write_file("/etc/NAS_CFG/"), -1);
    EXPECT_EQ(xml_write_file("relative.xml"), -1);
    EXPECT_EQ(SysRoot::read("/escape.xml"), "");
}

TEST(XmldbSave, ReloadedServiceHoldsWhatWasSaved)
{
    {
        XmldbService db;
        ASSERT_EQ(xmldbc_set(S, 0, "/system_mgr/iscsi/iSNS/ip", "10.0.0.1"), 0);
        ASSERT_EQ(xmldbc_set(S, 0, "/iscsi/target/id:7/name", "seven"), 0);
        ASSERT_EQ(xml_write_file("/etc/NAS_CFG/config.xml"), 0);
    }
    XmldbService db(false, SysRoot::file("/etc/NAS_CFG/config.xml"));
    EXPECT_EQ(get("/system_mgr/iscsi/iSNS/ip"), "10.0.0.1");
    EXPECT_EQ(get("/iscsi/target/id:7/name"), "seven");
}

TEST(XmldbAvailability, MissingServiceFailsQuicklyAndRestartIsPickedUp)
{
    XmldbService db;
    ASSERT_EQ(xmldbc_set(S, 0, "/k", "v"), 0);  // leaves a cached connection behind
    db.kill();

    auto t0 = std::chrono::steady_clock::now();
    char buf[8] = "x";
    EXPECT_EQ(xmldbc_get_wb(S, 0, "/k", buf, sizeof buf), -1);
    EXPECT_STREQ(buf, "");
    EXPECT_EQ(xmldbc_set(S, 0, "/k", "v"), -1);
    EXPECT_EQ(xmldbc_del(S, 0, "/k"), -1);
    EXPECT_EQ(xml_write_file("/etc/NAS_CFG/config.xml"), -1);
    EXPECT_LT(std::chrono::steady_clock::now() - t0, std::chrono::seconds(2));

    db.restart();
    EXPECT_EQ(xmldbc_set(S, 0, "/k", "again"), 0);
    EXPECT_EQ(get("/k"), "again");

    // A restart between two calls, with the connection still cached.
    db.restart();
    EXPECT_EQ(get("/k"), "");
}

TEST(XmldbAvailability, StalledServiceTimesOut)
{
    XmldbService db;
    ASSERT_EQ(xmldbc_set(S, 0, "/k", "v"), 0);
    ::kill(db.config().pid(), SIGSTOP);
    auto t0 = std::chrono::steady_clock::now();
    EXPECT_EQ(xmldbc_set(S, 0, "/k", "w"), -1);
    auto took = std::chrono::steady_clock::now() - t0;
    EXPECT_GE(took, std::chrono::milliseconds(1500));
    EXPECT_LT(took, std::chrono::milliseconds(3500));
    ::kill(db.config().pid(), SIGCONT);
    EXPECT_EQ(xmldbc_set(S, 0, "/k", "w"), 0);
}

TEST(XmldbAvailability, SocketPathTooLongIsRefusedNotCut)
{
    XmldbService db;
    std::string sock = "/var/run/" + std::string(200, 's');
    EXPECT_EQ(xmldbc_set(sock.c_str(), 0, "/k", "v"), -1);
    char buf[4];
    EXPECT_EQ(xmldbc_get_wb(sock.c_str(), 0, "/k", buf, sizeof buf), -1);
}
