// The xmldbd service under stress: hostile and greedy clients, concurrent
// writers and services, crashes during saves, and its command line with the
// xmldbc tool.
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
#include <fstream>
#include <gtest/gtest.h>
#include <memory>
#include <random>
#include <sstream>
#include <string>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <tuple>
#include <unistd.h>
#include <vector>

using korv_test::SysRoot;
using korv_test::XmldbProcess;
using korv_test::XmldbService;

namespace {

const char *const S = XMLDB_SOCK_ISCSI;

std::string get(const std::string &path)
{
    char buf[256];
    return xmldbc_get_wb(S, 0, path.c_str(), buf, sizeof buf) < 0 ? "<failed>" : buf;
}

// A client that speaks bytes, not the protocol.
struct RawClient {
    int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    RawClient()
    {
        sockaddr_un sa{};
        sa.sun_family = AF_UNIX;
        std::strcpy(sa.sun_path, SysRoot::file(XMLDB_SOCK_ISCSI).c_str());
        EXPECT_EQ(::connect(fd, reinterpret_cast<sockaddr *>(&sa), sizeof sa), 0) << std::strerror(errno);
    }
    ~RawClient() { ::close(fd); }
    // False when the service has hung up.
    bool send(const std::string &bytes)
    {
        return ::send(fd, bytes.data(), bytes.size(), MSG_NOSIGNAL) == static_cast<ssize_t>(bytes.size());
    }
    // The next answer: status byte + data, "" on end of stream, "timeout" when none comes.
    std::string answer()
    {
        auto deadline = xmldb::Clock::now() + std::chrono::seconds(5);
        unsigned char hdr[4];
        if (!xmldb::recv_all(fd, hdr, 4, deadline))
            return xmldb::Clock::now() >= deadline ? "timeout" : "";
        std::string body(xmldb::load_be32(hdr), '\0');
        return xmldb::recv_all(fd, body.data(), body.size(), deadline) ? body : "truncated";
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

// A line "Key:  N kB" of /proc/PID/status, in bytes.
size_t status_bytes(pid_t pid, const std::string &key)
{
    std::ifstream in("/proc/" + std::to_string(pid) + "/status");
    for (std::string line; std::getline(in, line);)
        if (line.rfind(key + ":", 0) == 0)
            return std::stoul(line.substr(key.size() + 1)) * 1024;
    return 0;
}

// CPU time the process has used, in clock ticks.
long cpu_ticks(pid_t pid)
{
    std::ifstream in("/proc/" + std::to_string(pid) + "/stat");
    std::string all((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>()), f;
    std::istringstream rest(all.substr(all.rfind(')') + 2));
    long utime = 0, stime = 0;
    for (int i = 3; i <= 13; ++i)
        rest >> f;
    rest >> utime >> stime;
    return utime + stime;
}

struct Ran {
    int status;
    std::string out, err;
};

// Runs a shell command line; a program that never ends is killed after 20 s.
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
    // A path length beyond the payload, an unknown operation, a NUL inside
    // the path, a path over the limit.
    for (const std::string &bad : {be32(5) + "xAAAA", be32(6) + "z" + be32(1) + "/",
                                   be32(8) + "g" + be32(3) + std::string("/\0k", 3),
                                   frame(xmldb::Op::Set, "/" + std::string(xmldb::kPathMax, 'p'), "v")}) {
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
            std::string a = r.send(be32(static_cast<uint32_t>(payload.size())) + payload) ? r.answer() : "";
            if (a.empty())
                break;  // the service may hang up; it must not die
            ASSERT_TRUE(a[0] == xmldb::kOk || a[0] == xmldb::kFail);
        }
    }
    EXPECT_EQ(get("/k"), "v");

    // Lengths that cannot be skipped: refused once, then the connection closes.
    for (uint32_t len : {0u, 0xffffffffu, static_cast<uint32_t>(xmldb::kRequestMax + 1)}) {
        RawClient c;
        c.send(be32(len) + "g");
        EXPECT_EQ(c.answer().substr(0, 1), std::string(1, xmldb::kFail)) << len;
        EXPECT_EQ(c.answer(), "") << "connection should be closed after length " << len;
    }
}

// A tree of 4 MiB under /big and more than 64 MiB in all.
TEST(XmldbBadInput, StuckAndGreedyClientsStayWithinTheAnswerBudgetAndOthersAreServed)
{
    XmldbService db;
    const std::string value(60000, 'x');
    for (int i = 0; i < 1150; ++i)
        ASSERT_EQ(xmldbc_set(S, 0, ((i < 70 ? "/big/" : "/rest/") + std::to_string(i)).c_str(), value.c_str()), 0);
    const size_t tree_rss = status_bytes(db.config().pid(), "VmRSS");

    RawClient whole;  // a dump over 64 MiB is refused before it is built
    whole.send(frame(xmldb::Op::Dump, "/"));
    EXPECT_NE(whole.answer().find("64 MiB"), std::string::npos);
    RawClient half;
    half.send(be32(100) + "g" + be32(2) + "/k");  // promises 100 bytes, sends 7
    std::vector<std::unique_ptr<RawClient>> greedy;  // ask for 4 MiB dumps, never read
    for (int i = 0; i < 40; ++i) {
        greedy.push_back(std::make_unique<RawClient>());
        for (int k = 0; k < 20; ++k)
            greedy.back()->send(frame(xmldb::Op::Dump, "/big"));
    }
    auto t0 = std::chrono::steady_clock::now();
    for (int i = 0; i < 50; ++i) {
        ASSERT_EQ(xmldbc_set(S, 0, ("/other/" + std::to_string(i)).c_str(), "ok"), 0);
        ASSERT_EQ(get("/other/" + std::to_string(i)), "ok");
    }
    // A stalled service would have failed the calls above (2 s each); this
    // bound only catches a service that answers others after each dump.
    EXPECT_LT(std::chrono::steady_clock::now() - t0, std::chrono::seconds(4));
    EXPECT_LT(status_bytes(db.config().pid(), "VmHWM"), tree_rss + (72u << 20));

    // Those over the budget were hung up on; the others get whole answers.
    int dropped = 0;
    for (auto &g : greedy) {
        std::string a = g->answer();
        dropped += a.empty();
        EXPECT_TRUE(a.empty() || (a[0] == xmldb::kOk && a.size() > 70 * value.size())) << a.size();
    }
    EXPECT_GE(dropped, 20);
    half.send(std::string(93, 'y'));  // the half-sent request completes
    EXPECT_EQ(half.answer()[0], xmldb::kOk);
}

TEST(XmldbBadInput, OutOfDescriptorsTheServiceWaitsForAClientToLeaveInsteadOfSpinning)
{
    XmldbService db;
    const pid_t pid = db.config().pid();
    const rlimit few{16, 16};
    ASSERT_EQ(::prlimit(pid, RLIMIT_NOFILE, &few, nullptr), 0) << std::strerror(errno);
    std::vector<std::unique_ptr<RawClient>> clients(30);
    for (auto &c : clients)
        c = std::make_unique<RawClient>();
    const long ticks = cpu_ticks(pid);
    ::usleep(1000 * 1000);
    EXPECT_LT(cpu_ticks(pid) - ticks, ::sysconf(_SC_CLK_TCK) / 10) << "the service spins";
    clients.erase(clients.begin(), clients.begin() + 20);
    clients.back()->send(frame(xmldb::Op::Ping, "/"));
    EXPECT_EQ(clients.back()->answer(), std::string(1, xmldb::kOk) + "xmldbd");
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
    EXPECT_TRUE(!many.front()->send(frame(xmldb::Op::Ping, "/")) || many.front()->answer().empty());
    ASSERT_EQ(xmldbc_set(S, 0, "/after", "ok"), 0);  // the library reconnects
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
            bad += xmldbc_set(S, 0, key(p, k).c_str(), v.c_str()) != 0 || get(key(p, k)) != v;
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
            ASSERT_EQ(get(key(p, k)), std::to_string(p * 1000 + k)) << key(p, k);
}

// The service as started by hand, loading the saved file by default: every
// restart, ordinary or after SIGKILL in the middle of saves, must come back
// with a saved state, and the next save must keep what it did not change.
TEST(XmldbDurability, EveryRestartLoadsASavedStateAndKeepsWhatItHolds)
{
    const std::string file = SysRoot::file("/etc/NAS_CFG/config.xml");
    SysRoot::remove("/etc/NAS_CFG");
    XmldbProcess db(SysRoot::file(XMLDB_SOCK_ISCSI), {});
    db.start();
    ASSERT_EQ(xmldbc_set(S, 0, "/iscsi/target/id:1/name", "kept"), 0);
    ASSERT_EQ(xml_write_file("/etc/NAS_CFG/config.xml"), 0);
    std::mt19937 rng(12345);
    int last_saved = 0, round = 0;
    auto blob = [](int gen, int i) { return std::to_string(gen) + ":" + std::string(20000 + i, 'a' + gen % 26); };
    const auto stop_at = std::chrono::steady_clock::now() + std::chrono::seconds(45);
    for (; round < 300 && std::chrono::steady_clock::now() < stop_at; ++round) {
        // What the file holds must be exactly one generation, never a mix.
        xmldb::Tree t;
        std::string text, err;
        ASSERT_TRUE(xmldb::read_file(file, text, err) && t.from_xml(text, err)) << "round " << round << ": " << err;
        ASSERT_EQ(t.get("/iscsi/target/id:1/name"), "kept") << "round " << round;
        const int gen = std::atoi(std::string(t.get("/gen")).c_str());
        EXPECT_GE(gen, last_saved) << "an acknowledged save was lost";
        for (int i = 0; gen > 0 && i < 4; ++i)
            ASSERT_EQ(t.get("/blob/" + std::to_string(i)), blob(gen, i)) << "gen " << gen;
        ASSERT_EQ(get("/gen"), gen ? std::to_string(gen) : "") << "the restarted service did not load it";
        const auto delay = static_cast<useconds_t>(rng() % 20000);
        const pid_t victim = db.pid(), killer = ::fork();
        if (killer == 0) {
            ::usleep(delay);
            ::kill(victim, round % 50 == 0 ? SIGTERM : SIGKILL);
            ::_exit(0);
        }
        for (int next = gen + 1;; ++next) {
            bool ok = xmldbc_set(S, 0, "/gen", std::to_string(next).c_str()) == 0;
            for (int i = 0; ok && i < 4; ++i)
                ok = xmldbc_set(S, 0, ("/blob/" + std::to_string(i)).c_str(), blob(next, i).c_str()) == 0;
            if (!ok || xml_write_file("/etc/NAS_CFG/config.xml") != 0)
                break;
            last_saved = next;
        }
        ::waitpid(killer, nullptr, 0);
        db.stop();
        db.start();
    }
    EXPECT_GE(round, 50);
    EXPECT_GT(last_saved, 0);
    // Temporaries of killed saves are cleared when the service starts again.
    db.stop();
    db.start();
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
    EXPECT_NE(xmldbc("--help").out.find("usage: xmldbc"), std::string::npos);
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

TEST(XmldbService, OneServicePerSocketAndCleanShutdown)
{
    const std::string sock = SysRoot::file(XMLDB_SOCK_ISCSI), xmldbd = korv_test::xmldbd_binary();
    {
        XmldbService db;
        struct stat st{};
        ASSERT_EQ(::stat(sock.c_str(), &st), 0);
        EXPECT_EQ(st.st_mode & 0777, 0600u);
        Ran twice = run(xmldbd + " --empty --socket " + sock);
        EXPECT_EQ(twice.status, 1);
        EXPECT_NE(twice.err.find("already serves"), std::string::npos) << twice.err;
        EXPECT_EQ(db.stop(), 0);
    }
    EXPECT_NE(::access(sock.c_str(), F_OK), 0) << "SIGTERM should remove the socket";

    // Two services started together over the stale socket of a crashed one.
    for (int trial = 0; trial < 60; ++trial) {
        XmldbProcess a(sock), b(sock);
        a.spawn();
        b.spawn();
        const bool a_up = a.ready(), b_up = b.ready();
        ASSERT_NE(a_up, b_up) << "trial " << trial;
        EXPECT_EQ(xmldbc_set(S, 0, "/k", "v"), 0);
        EXPECT_EQ((a_up ? b : a).stop(), 1);
        (a_up ? a : b).kill();
    }

    SysRoot::write("/etc/NAS_CFG/torn.xml", "<xmldb><a value=\"1\">");
    ::mkfifo(SysRoot::file("/etc/NAS_CFG/fifo.xml").c_str(), 0600);
    const std::string start = xmldbd + " --socket " + sock;
    const std::vector<std::tuple<std::string, int, std::string>> refused = {
        {" --load " + SysRoot::file("/etc/NAS_CFG/torn.xml"), 1, "cannot load"},
        {" --load " + SysRoot::file("/etc/NAS_CFG/fifo.xml"), 1, "not a regular file"},
        {" --empty --load /x.xml", 2, "exclude"},
        {" --bogus", 2, "usage"},
        {" --empty --socket /tmp/" + std::string(120, 'x'), 1, "too long"},
    };
    for (const auto &[args, status, says] : refused) {
        Ran r = run(start + args);
        EXPECT_EQ(r.status, status) << args;
        EXPECT_NE(r.err.find(says), std::string::npos) << args << ": " << r.err;
    }
    EXPECT_EQ(SysRoot::read("/etc/NAS_CFG/torn.xml"), "<xmldb><a value=\"1\">");
}
