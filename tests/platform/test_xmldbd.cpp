// The xmldbd service under stress: hostile clients, concurrent writers,
// crashes during saves, and its command line together with the xmldbc tool.
#include "platform/xmldb_file.h"
#include "platform/xmldb_proto.h"
#include "platform/xmldb_tree.h"
#include "platform/xmldbc.h"
#include "tests/support/xmldbd_fixture.h"

#include <algorithm>
#include <chrono>
#include <csignal>
#include <cstring>
#include <filesystem>
#include <gtest/gtest.h>
#include <random>
#include <string>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>
#include <vector>

using korv_test::SysRoot;
using korv_test::XmldbService;

namespace {

const char *const S = XMLDB_SOCK_ISCSI;

std::string get(const char *path)
{
    char buf[256];
    return xmldbc_get_wb(S, 0, path, buf, sizeof buf) < 0 ? "<failed>" : buf;
}

// A client that speaks bytes, not the protocol.
struct RawClient {
    int fd = -1;
    RawClient()
    {
        fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
        sockaddr_un sa{};
        sa.sun_family = AF_UNIX;
        std::string p = SysRoot::file(XMLDB_SOCK_ISCSI);
        std::memcpy(sa.sun_path, p.c_str(), p.size() + 1);
        EXPECT_EQ(::connect(fd, reinterpret_cast<sockaddr *>(&sa), sizeof sa), 0) << std::strerror(errno);
    }
    ~RawClient() { ::close(fd); }
    // False when the service has hung up.
    bool send(const std::string &bytes)
    {
        return ::send(fd, bytes.data(), bytes.size(), MSG_NOSIGNAL) == static_cast<ssize_t>(bytes.size());
    }
    // The next answer: status byte + data, "" on end of stream, "timeout" when none comes.
    std::string answer(int ms = 2000)
    {
        auto deadline = xmldb::Clock::now() + std::chrono::milliseconds(ms);
        unsigned char hdr[4];
        if (!xmldb::recv_all(fd, hdr, 4, deadline))
            return xmldb::Clock::now() >= deadline ? "timeout" : "";
        std::string body(xmldb::load_be32(hdr), '\0');
        if (!xmldb::recv_all(fd, body.data(), body.size(), deadline))
            return "truncated";
        return body;
    }
};

std::string frame(xmldb::Op op, const std::string &path, const std::string &value = {})
{
    std::string f;
    xmldb::encode_request(f, op, path, value);
    return f;
}

std::string be32(uint32_t v)
{
    return {static_cast<char>(v >> 24), static_cast<char>(v >> 16), static_cast<char>(v >> 8), static_cast<char>(v)};
}

struct Ran {
    int status;
    std::string out, err;
};

// Runs a shell command line in the test's environment; a program that never
// ends is killed after 20 s rather than hanging the test.
Ran run(const std::string &cmd)
{
    const std::string out = SysRoot::file("/tmp-out"), err = SysRoot::file("/tmp-err");
    const int st = std::system(("timeout -s KILL 20 " + cmd + " >" + out + " 2>" + err).c_str());
    return {WIFEXITED(st) ? WEXITSTATUS(st) : -1, SysRoot::read("/tmp-out"), SysRoot::read("/tmp-err")};
}

Ran xmldbc(const std::string &args) { return run(korv_test::xmldbc_binary() + " " + args); }

}  // namespace

TEST(XmldbBadInput, GarbageAndOversizedFramesAreRefusedAndNeverTakeTheServiceDown)
{
    XmldbService db;
    ASSERT_EQ(xmldbc_set(S, 0, "/k", "v"), 0);
    RawClient c;
    // A path length beyond the payload, an unknown operation, a NUL inside the path.
    for (const std::string &bad :
         {be32(5) + "xAAAA", be32(6) + "z" + be32(1) + "/", be32(8) + "g" + be32(3) + std::string("/\0k", 3)}) {
        c.send(bad);
        EXPECT_EQ(c.answer()[0], xmldb::kFail);
    }
    c.send(frame(xmldb::Op::Get, "/k"));
    EXPECT_EQ(c.answer(), std::string(1, xmldb::kOk) + "v");

    std::mt19937 rng(7);
    for (int conn = 0; conn < 20; ++conn) {
        RawClient r;
        for (int i = 0; i < 25; ++i) {
            // Well-framed but random inside: any op byte, any path length field.
            std::string payload(1 + rng() % 64, '\0');
            std::generate(payload.begin(), payload.end(), [&] { return static_cast<char>(rng()); });
            if (!r.send(be32(static_cast<uint32_t>(payload.size())) + payload))
                break;
            std::string a = r.answer();
            if (a.empty())
                break;  // the service may hang up; it must not die
            ASSERT_TRUE(a[0] == xmldb::kOk || a[0] == xmldb::kFail);
        }
    }
    EXPECT_EQ(get("/k"), "v");

    // Oversized frames are refused and the connection closed.
    for (uint32_t len : {0u, 0xffffffffu, static_cast<uint32_t>(xmldb::kRequestMax + 1)}) {
        RawClient c;
        c.send(be32(len) + "g");
        std::string a = c.answer();
        ASSERT_FALSE(a.empty()) << len;
        EXPECT_EQ(a[0], xmldb::kFail) << len;
        EXPECT_EQ(c.answer(), "") << "connection should be closed after length " << len;
    }
    // A path over the limit inside a sane frame is refused, not truncated.
    c.send(frame(xmldb::Op::Set, "/" + std::string(xmldb::kPathMax, 'p'), "v"));
    EXPECT_EQ(c.answer()[0], xmldb::kFail);
    c.send(frame(xmldb::Op::Ping, "/"));
    EXPECT_EQ(c.answer()[0], xmldb::kOk);
}

TEST(XmldbBadInput, TruncatedAndStuckClientsDoNotStallOthers)
{
    XmldbService db;
    std::string value(60000, 'x');
    for (int i = 0; i < 40; ++i)
        ASSERT_EQ(xmldbc_set(S, 0, ("/big/" + std::to_string(i)).c_str(), value.c_str()), 0);

    RawClient half;
    half.send(be32(100) + "g" + be32(2) + "/k");  // promises 100 bytes, sends 7
    RawClient greedy;                              // asks for megabytes and never reads
    for (int i = 0; i < 20; ++i)
        greedy.send(frame(xmldb::Op::Dump, "/big"));

    auto t0 = std::chrono::steady_clock::now();
    for (int i = 0; i < 50; ++i) {
        std::string k = "/other/" + std::to_string(i);
        ASSERT_EQ(xmldbc_set(S, 0, k.c_str(), "ok"), 0);
        ASSERT_EQ(get(k.c_str()), "ok");
    }
    // A stalled service would have failed the calls above (2 s each); this
    // bound only catches a service that answers others after each dump.
    EXPECT_LT(std::chrono::steady_clock::now() - t0, std::chrono::seconds(4));

    // The half-sent request completes when its remaining bytes arrive.
    half.send(std::string(93, 'y'));
    EXPECT_EQ(half.answer()[0], xmldb::kOk);
}

TEST(XmldbBadInput, IdleConnectionHoardersCannotLockOthersOut)
{
    XmldbService db;
    ASSERT_EQ(xmldbc_set(S, 0, "/before", "ok"), 0);  // the library's cached connection, now idle
    std::vector<std::unique_ptr<RawClient>> many;
    for (int i = 0; i < 300; ++i)
        many.push_back(std::make_unique<RawClient>());
    // The newest are served; the longest idle were hung up on.
    many.back()->send(frame(xmldb::Op::Ping, "/"));
    EXPECT_EQ(many.back()->answer()[0], xmldb::kOk);
    bool sent = many.front()->send(frame(xmldb::Op::Ping, "/"));
    EXPECT_TRUE(!sent || many.front()->answer().empty());
    // The library reconnects transparently.
    ASSERT_EQ(xmldbc_set(S, 0, "/after", "ok"), 0);
    EXPECT_EQ(get("/after"), "ok");
}

TEST(XmldbConcurrency, ParallelWritersLoseNothing)
{
    XmldbService db;
    constexpr int kProcs = 6, kKeys = 150;
    auto key = [](int p, int k) { return "/c/p" + std::to_string(p) + "/id:" + std::to_string(k); };
    std::vector<pid_t> kids;
    for (int p = 0; p < kProcs; ++p) {
        if ((kids.emplace_back(::fork())) != 0)
            continue;
        int bad = 0;
        for (int k = 0; k < kKeys; ++k) {
            const std::string v = std::to_string(p * 1000 + k);
            bad += xmldbc_set(S, 0, key(p, k).c_str(), v.c_str()) != 0 || get(key(p, k).c_str()) != v;
            if (k % 10 == 0)  // deletes of absent subtrees interleaved with the writes
                bad += xmldbc_del(S, 0, ("/c/p" + std::to_string(p) + "/scratch").c_str()) != 0;
        }
        ::_exit(bad == 0 ? 0 : 1);
    }
    for (pid_t k : kids) {
        int st = 0;
        ::waitpid(k, &st, 0);
        EXPECT_TRUE(WIFEXITED(st) && WEXITSTATUS(st) == 0) << "writer " << k;
    }
    for (int p = 0; p < kProcs; ++p)
        for (int k = 0; k < kKeys; ++k)
            ASSERT_EQ(get(key(p, k).c_str()), std::to_string(p * 1000 + k)) << key(p, k);
}

TEST(XmldbDurability, KilledDuringSavesLeavesALoadableSavedState)
{
    const std::string file = SysRoot::file("/etc/NAS_CFG/config.xml");
    SysRoot::remove("/etc/NAS_CFG");
    XmldbService db(false, file);
    std::mt19937 rng(12345);
    int last_saved = 0;
    auto blob = [](int gen, int i) { return std::to_string(gen) + ":" + std::string(30000 + i, 'a' + gen % 26); };

    for (int round = 0; round < 15; ++round) {
        // What the file holds must be exactly one generation, never a mix.
        // (No file yet is fine only while no save has been acknowledged.)
        if (last_saved > 0 || ::access(file.c_str(), F_OK) == 0) {
            xmldb::Tree t;
            std::string text, err;
            ASSERT_TRUE(xmldb::read_file(file, text, err) && t.from_xml(text, err)) << "round " << round << ": " << err;
            int gen = std::stoi(std::string(t.get("/gen")));
            EXPECT_GE(gen, last_saved) << "an acknowledged save was lost";
            for (int i = 0; i < 8; ++i)
                ASSERT_EQ(t.get("/blob/" + std::to_string(i)), blob(gen, i)) << "gen " << gen;
            EXPECT_EQ(get("/gen"), std::to_string(gen));  // and the service loaded it
        }
        const auto delay = static_cast<useconds_t>(1000 + rng() % 40000);
        const pid_t victim = db.config().pid(), killer = ::fork();
        if (killer == 0) {
            ::usleep(delay);
            ::kill(victim, SIGKILL);
            ::_exit(0);
        }
        for (int gen = std::atoi(get("/gen").c_str()) + 1;; ++gen) {
            bool ok = xmldbc_set(S, 0, "/gen", std::to_string(gen).c_str()) == 0;
            for (int i = 0; ok && i < 8; ++i)
                ok = xmldbc_set(S, 0, ("/blob/" + std::to_string(i)).c_str(), blob(gen, i).c_str()) == 0;
            if (!ok || xml_write_file("/etc/NAS_CFG/config.xml") != 0)
                break;
            last_saved = gen;
        }
        ::waitpid(killer, nullptr, 0);
        db.kill();  // reap
        db.restart();
    }
    EXPECT_GT(last_saved, 0);
    // Temporaries of killed saves are cleared when the service starts again.
    db.restart();
    auto files = std::filesystem::directory_iterator(SysRoot::file("/etc/NAS_CFG"));
    EXPECT_EQ(std::distance(begin(files), end(files)), 1);
}

TEST(XmldbTool, CommandsWorkAndReportFailures)
{
    XmldbService db;
    EXPECT_EQ(xmldbc("set /iscsi/target/id:1/name 'tgt one'").status, 0);
    EXPECT_EQ(xmldbc("get /iscsi/target/id:1/name").out, "tgt one\n");
    EXPECT_EQ(xmldbc("dump /iscsi").out,
              "/iscsi\n/iscsi/target\n/iscsi/target/id:1\n/iscsi/target/id:1/name = tgt one\n");
    EXPECT_EQ(xmldbc("save").status, 0);
    EXPECT_EQ(xmldbc("del /iscsi").status, 0);
    EXPECT_EQ(xmldbc("get /iscsi/target/id:1/name").out, "\n");
    EXPECT_EQ(xmldbc("load /etc/NAS_CFG/config.xml").status, 0);
    EXPECT_EQ(xmldbc("get /iscsi/target/id:1/name").out, "tgt one\n");

    Ran bad_load = xmldbc("load /no/such.xml");
    EXPECT_EQ(bad_load.status, 1);
    EXPECT_NE(bad_load.err.find("xmldbc: "), std::string::npos);
    EXPECT_EQ(xmldbc("save /tmp/outside.xml").status, 1);
    Ran help = xmldbc("--help");
    EXPECT_EQ(help.status, 0);
    EXPECT_NE(help.out.find("usage: xmldbc"), std::string::npos);
    for (const char *usage : {"", "frobnicate", "get relative", "set /only-path", "wait soon"})
        EXPECT_EQ(xmldbc(usage).status, 2) << usage;

    db.stop();
    Ran down = xmldbc("get /x");
    EXPECT_EQ(down.status, 1);
    EXPECT_NE(down.err.find("cannot connect"), std::string::npos) << down.err;
    auto t0 = std::chrono::steady_clock::now();
    EXPECT_EQ(xmldbc("wait 0.3").status, 1);
    EXPECT_LT(std::chrono::steady_clock::now() - t0, std::chrono::seconds(2));
}

TEST(XmldbService, ShutsDownCleanlyAndGuardsItsSocket)
{
    const std::string sock = SysRoot::file(XMLDB_SOCK_ISCSI), xmldbd = korv_test::xmldbd_binary();
    {
        XmldbService db;
        struct stat st{};
        ASSERT_EQ(::stat(sock.c_str(), &st), 0);
        EXPECT_EQ(st.st_mode & 0777, 0600u);
        // A second service on the same socket refuses to start.
        Ran twice = run(xmldbd + " --socket " + sock);
        EXPECT_EQ(twice.status, 1);
        EXPECT_NE(twice.err.find("already"), std::string::npos) << twice.err;
        EXPECT_EQ(xmldbc("wait 1").status, 0);
        // A service that crashed leaves a stale socket; the next one takes over.
        db.kill();
        ASSERT_EQ(::stat(sock.c_str(), &st), 0);
        db.restart();
        EXPECT_EQ(xmldbc_set(S, 0, "/k", "v"), 0);
        EXPECT_EQ(db.stop(), 0);
    }
    EXPECT_NE(::access(sock.c_str(), F_OK), 0) << "SIGTERM should remove the socket";

    SysRoot::write("/etc/NAS_CFG/torn.xml", "<xmldb><a value=\"1\">");
    Ran torn = run(xmldbd + " --socket " + sock + " --load " + SysRoot::file("/etc/NAS_CFG/torn.xml"));
    EXPECT_EQ(torn.status, 1);
    EXPECT_NE(torn.err.find("cannot load"), std::string::npos) << torn.err;
    EXPECT_EQ(run(xmldbd + " --bogus").status, 2);
    EXPECT_EQ(run(xmldbd + " --socket /tmp/" + std::string(120, 'x')).status, 1);
}
