// SPDX-License-Identifier: Apache-2.0
// The client library against a real xmldbd: path semantics, buffers, saved
// and loaded files, and a service that is missing or restarts.
#include "platform/xmldb_client.h"
#include "platform/xmldb_file.h"
#include "platform/xmldbc.h"
#include "tests/support/xmldbd_fixture.h"

#include <chrono>
#include <csignal>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

using korv_test::SysRoot;
using korv_test::xmldb_get;
using korv_test::XmldbService;

const char *const S = XMLDB_SOCK_ISCSI;

TEST(XmldbCalls, ValuesLengthsBuffersAndBadArguments)
{
    XmldbService db(korv_test::kWithSysinfo);
    // Missing and empty read alike: 1, the empty value's length plus one.
    int rc = 0;
    EXPECT_EQ(xmldb_get("/iscsi/target/id:1/name", &rc), "");
    EXPECT_EQ(rc, 1);
    ASSERT_EQ(xmldbc_set(S, 0, "/iscsi/target/id:1/name", ""), 0);
    EXPECT_EQ(xmldb_get("/iscsi/target/id:1/name", &rc), "");
    EXPECT_EQ(rc, 1);
    std::string big(1000, 'v');
    big.back() = 'Z';
    ASSERT_EQ(xmldbc_set(S, 0, "/iscsi/target/id:1/name", big.c_str()), 0);
    for (size_t size : {1, 8, 2000}) {  // cut to the caller's buffer, full length reported
        std::string buf(size, 'x');
        EXPECT_EQ(xmldbc_get_wb(S, 0, "/iscsi/target/id:1/name", buf.data(), size), 1001) << size;
        EXPECT_EQ(std::string(buf.c_str()), big.substr(0, size - 1)) << size;
    }
    ASSERT_EQ(xmldbc_del(S, 0, "/iscsi/target"), 0);
    EXPECT_EQ(xmldb_get("/iscsi/target/id:1/name"), "");
    EXPECT_EQ(xmldbc_del(S, 0, "/never/was"), 0);  // deleting what is not there succeeds

    char buf[16] = "keep";
    using args = std::tuple<const char *, char *, size_t>;
    for (auto [path, into, size] : {args{nullptr, buf, 16}, {"relative", buf, 16}, {"/x", nullptr, 16}, {"/x", buf, 0}})
        EXPECT_EQ(xmldbc_get_wb(S, 0, path, into, size), -1) << (path ? path : "NULL") << " " << size;
    EXPECT_EQ(xmldbc_set(S, 0, "/x", nullptr), -1);
    EXPECT_EQ(xmldbc_set(S, 0, "/", "root has no value"), -1);
    EXPECT_EQ(xmldbc_del(S, 0, nullptr), -1);
    EXPECT_EQ(xmldbc_set(S, 0, "/huge", std::string(70000, 'h').c_str()), -1);

    // The sysinfo database is a separate one.
    ASSERT_EQ(xmldbc_set(XMLDB_SOCK_SYSINFO, 0, "/vols/vol:1/name", "Volume_1"), 0);
    EXPECT_EQ(xmldbc_get_wb(XMLDB_SOCK_SYSINFO, 0, "/vols/vol:1/name", buf, sizeof buf), 9);
    EXPECT_STREQ(buf, "Volume_1");
    EXPECT_EQ(xmldb_get("/vols/vol:1/name"), "");
}

// Saves hold CHAP secrets: they are private regular files, written only into
// the allowed directories, through links never; loads take regular files of
// at most 64 MiB and refuse anything else at once, the service serving on.
TEST(XmldbFiles, SavedFilesArePrivateAndOnlyRegularFilesLoad)
{
    XmldbService db;
    const std::string cfg = "/etc/NAS_CFG/config.xml", linked = "/etc/NAS_CFG/linked.xml";
    ASSERT_EQ(xmldbc_set(S, 0, "/iscsi/target/id:7/chap_pwd", "secret"), 0);
    SysRoot::write(cfg, "<xmldb/>");
    ::chmod(SysRoot::file(cfg).c_str(), 0644);
    SysRoot::write("/outside.xml", "keep");
    ::symlink(SysRoot::file("/outside.xml").c_str(), SysRoot::file(linked).c_str());
    // Where the temporary used to go, named after the service's pid.
    const std::string planted = SysRoot::file(cfg + ".tmp." + std::to_string(db.config().pid()));
    ::symlink(SysRoot::file("/planted.xml").c_str(), planted.c_str());
    for (const std::string &f : {cfg, linked}) {
        ASSERT_EQ(xml_write_file(f.c_str()), 0) << f;
        struct stat st{};
        EXPECT_TRUE(::lstat(SysRoot::file(f).c_str(), &st) == 0 && S_ISREG(st.st_mode) && (st.st_mode & 07777) == 0600)
            << f << " mode " << std::oct << st.st_mode;
        EXPECT_NE(SysRoot::read(f).find("secret"), std::string::npos) << f;
    }
    EXPECT_EQ(SysRoot::read("/outside.xml"), "keep");
    EXPECT_NE(::access(SysRoot::file("/planted.xml").c_str(), F_OK), 0) << "a planted link was followed";
    for (const char *outside : {"/tmp/elsewhere.xml", "/etc/NAS_CFG/../escape.xml", "/etc/NAS_CFG/", "relative.xml"})
        EXPECT_EQ(xml_write_file(outside), -1) << outside;
    EXPECT_EQ(SysRoot::read("/escape.xml"), "");

    ::mkfifo(SysRoot::file("/etc/NAS_CFG/fifo.xml").c_str(), 0600);
    ::truncate(SysRoot::file(cfg).c_str(), xmldb::kFileMax + 1);  // sparse
    for (const std::string &f : {std::string("/dev/zero"), SysRoot::file("/etc/NAS_CFG/fifo.xml"),
                                 SysRoot::file("/etc/NAS_CFG"), SysRoot::file(cfg)}) {
        std::string why;
        EXPECT_EQ(xmldb::call(SysRoot::file(S), xmldb::Op::Load, f, "", why), xmldb::CallResult::Refused) << f;
        EXPECT_TRUE(why.find("regular") != std::string::npos || why.find("64 MiB") != std::string::npos) << why;
        EXPECT_EQ(xmldb_get("/iscsi/target/id:7/chap_pwd"), "secret") << f;
    }
    EXPECT_EQ(xml_write_file("/etc/NAS_CFG/fifo.xml"), -1);
    struct stat st{};
    EXPECT_TRUE(::stat(SysRoot::file("/etc/NAS_CFG/fifo.xml").c_str(), &st) == 0 && S_ISFIFO(st.st_mode));
}

TEST(XmldbAvailability, MissingOrStalledServiceFailsInBoundedTimeAndRestartIsPickedUp)
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

    db.restart();  // picked up: every round of XmldbDurability

    // A stalled service times out; the next call after it resumes works.
    ::kill(db.config().pid(), SIGSTOP);
    t0 = std::chrono::steady_clock::now();
    EXPECT_EQ(xmldbc_set(S, 0, "/k", "w"), -1);
    auto took = std::chrono::steady_clock::now() - t0;
    EXPECT_GE(took, std::chrono::milliseconds(1500));
    EXPECT_LT(took, std::chrono::milliseconds(3500));
    ::kill(db.config().pid(), SIGCONT);
    EXPECT_EQ(xmldbc_set(S, 0, "/k", "w"), 0);

    // Cut to fit a Unix socket address, it could name some other socket.
    std::string sock = "/var/run/" + std::string(200, 's');
    EXPECT_EQ(xmldbc_set(sock.c_str(), 0, "/k", "v"), -1);
}
