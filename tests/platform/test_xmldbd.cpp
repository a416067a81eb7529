// SPDX-License-Identifier: Apache-2.0
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
#include <deque>
#include <random>
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
using korv_test::xmldb_get;
using korv_test::XmldbProcess;
using korv_test::XmldbService;

namespace {

const char *const S = XMLDB_SOCK_ISCSI;

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
    RawClient(const RawClient &) = delete;
    RawClient &operator=(const RawClient &) = delete;
    // False when the service has hung up.
    bool send(const std::string &bytes)
    {
        return ::send(fd, bytes.data(), bytes.size(), MSG_NOSIGNAL) == static_cast<ssize_t>(bytes.size());
    }
    // The next answer: status byte + data, "" on end of stream, "timeout" when none comes.
    std::string answer()
    {
        auto deadline = xmldb::Clock::now() + std::chrono::seconds(10);
        unsigned char hdr[4];
        if (!xmldb::recv_all(fd, hdr, 4, deadline))
            return xmldb::Clock::now() >= deadline ? "timeout" : "";
        std::string body(xmldb::load_be32(hdr), '\0');
        return xmldb::recv_all(fd, body.data(), body.size(), deadline) ? body : "truncated";
    }
    std::string ask(xmldb::Op op, const std::string &path, const std::string &value = {})
    {
        std::string f;
        xmldb::encode_request(f, op, path, value);
        return send(f) ? answer() : "";
    }
};

std::string be32(uint32_t v)
{
    return {static_cast<char>(v >> 24), static_cast<char>(v >> 16), static_cast<char>(v >> 8), static_cast<char>(v)};
}

// From /proc/PID/status: the size in bytes on the line "Key: N kB".
// From /proc/PID/stat ("ticks"): the CPU time used, in clock ticks.
size_t proc_figure(pid_t pid, const std::string &key)
{
    std::ifstream in("/proc/" + std::to_string(pid) + (key == "ticks" ? "/stat" : "/status"));
    std::string all((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    unsigned long user = 0, sys = 0;
    if (key == "ticks")  // after the name: state and 10 fields before utime and stime
        std::sscanf(all.c_str() + all.rfind(')') + 2, "%*s %*s %*s %*s %*s %*s %*s %*s %*s %*s %*s %lu %lu", &user, &sys);
    return key == "ticks" ? user + sys : std::stoul(all.substr(all.find(key + ":") + key.size() + 1)) * 1024;
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
    for (const std::string &bad :
         {be32(5) + "xAAAA", be32(6) + "z" + be32(1) + "/", be32(8) + "g" + be32(3) + std::string("/\0k", 3)}) {
        c.send(bad);
        EXPECT_EQ(c.answer()[0], xmldb::kFail);
    }
    EXPECT_EQ(c.ask(xmldb::Op::Set, "/" + std::string(xmldb::kPathMax, 'p'), "v")[0], xmldb::kFail);
    EXPECT_EQ(c.ask(xmldb::Op::Get, "/k"), std::string(1, xmldb::kOk) + "v");

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
    EXPECT_EQ(xmldb_get("/k"), "v");

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
    const size_t tree_rss = proc_figure(db.config().pid(), "VmRSS");

    RawClient whole, half;  // a dump over 64 MiB is refused before it is built
    EXPECT_NE(whole.ask(xmldb::Op::Dump, "/").find("64 MiB"), std::string::npos);
    half.send(be32(100) + "g" + be32(2) + "/k");  // promises 100 bytes, sends 7
    std::deque<RawClient> greedy(40);  // ask for 4 MiB dumps, never read
    std::string dumps;
    for (int k = 0; k < 20; ++k)
        xmldb::encode_request(dumps, xmldb::Op::Dump, "/big", "");
    for (auto &g : greedy)
        g.send(dumps);
    RawClient probe;  // served once the service has gone round the greedy ones
    EXPECT_EQ(probe.ask(xmldb::Op::Ping, "/"), std::string(1, xmldb::kOk) + "xmldbd");
    for (int i = 0; i < 50; ++i) {  // and then no more held up by them
        ASSERT_EQ(xmldbc_set(S, 0, ("/other/" + std::to_string(i)).c_str(), "ok"), 0);
        ASSERT_EQ(xmldb_get("/other/" + std::to_string(i)), "ok");
    }
    EXPECT_LT(proc_figure(db.config().pid(), "VmHWM"), tree_rss + (72u << 20));

    // Those over the budget were hung up on; the others get whole answers.
    int dropped = 0;
    for (auto &g : greedy) {
        std::string a = g.answer();
        dropped += a.empty();
        EXPECT_TRUE(a.empty() || (a[0] == xmldb::kOk && a.size() > 70 * value.size())) << a.size();
    }
    EXPECT_GE(dropped, 20);
    half.send(std::string(93, 'y'));  // the half-sent request completes
    EXPECT_EQ(half.answer()[0], xmldb::kOk);
}

// More clients than slots: the longest idle are hung up on. More than the
// descriptor limit allows (lowered while they close): the service sheds or
// waits for one to leave, neither spinning nor giving up.
TEST(XmldbBadInput, ConnectionFloodsNeitherLockOthersOutNorMakeTheServiceSpin)
{
    XmldbService db;
    ASSERT_EQ(xmldbc_set(S, 0, "/before", "ok"), 0);  // the library's cached connection, now idle
    std::deque<RawClient> many(300);
    EXPECT_EQ(many.back().ask(xmldb::Op::Ping, "/")[0], xmldb::kOk);
    EXPECT_EQ(many.front().ask(xmldb::Op::Ping, "/"), "");
    ASSERT_EQ(xmldbc_set(S, 0, "/after", "ok"), 0);  // the library reconnects
    many.clear();

    const pid_t pid = db.config().pid();
    const rlimit few{16, 16};
    ASSERT_EQ(::prlimit(pid, RLIMIT_NOFILE, &few, nullptr), 0) << std::strerror(errno);
    std::deque<RawClient> flood(30);
    const size_t ticks = proc_figure(pid, "ticks");
    ::usleep(1000 * 1000);
    // A spinning service burns most of a core; a quarter of one leaves room
    // for a loaded machine (or a sanitizer build) shedding the flood.
    EXPECT_LT(proc_figure(pid, "ticks") - ticks, ::sysconf(_SC_CLK_TCK) / 4) << "the service spins";
    for (int i = 0; i < 20; ++i)
        flood.pop_front();
    EXPECT_EQ(flood.back().ask(xmldb::Op::Ping, "/"), std::string(1, xmldb::kOk) + "xmldbd");
}

// Forked writers, each on its own connection, interleave with a shared scratch delete.
TEST(XmldbConcurrency, ParallelWritersLoseNothing)
{
    XmldbService db;
    auto key = [](int p, int k) { return "/c/p" + std::to_string(p) + "/id:" + std::to_string(k); };
    std::vector<pid_t> kids;
    for (int p = 0; p < 6; ++p) {
        if ((kids.emplace_back(::fork())) != 0)
            continue;
        int bad = 0;
        for (int k = 0; k < 150; ++k)
            bad += xmldbc_set(S, 0, key(p, k).c_str(), std::to_string(p * 1000 + k).c_str()) != 0 ||
                   xmldb_get(key(p, k)) != std::to_string(p * 1000 + k) || xmldbc_del(S, 0, "/c/scratch") != 0;
        ::_exit(bad == 0 ? 0 : 1);
    }
    for (pid_t k : kids) {
        int st = 0;
        EXPECT_TRUE(::waitpid(k, &st, 0) == k && WIFEXITED(st) && WEXITSTATUS(st) == 0) << "writer " << k;
    }
    for (int p = 0; p < 6; ++p)
        for (int k = 0; k < 150; ++k)
            ASSERT_EQ(xmldb_get(key(p, k)), std::to_string(p * 1000 + k)) << key(p, k);
}

// The service as started by hand, loading the saved file by default: every
// restart, ordinary or after SIGKILL in the middle of saves, must come back
// with a saved state, and the next save must keep what it did not change.
// A few hundred rounds, bounded in time.
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
    for (const auto stop_at = std::chrono::steady_clock::now() + std::chrono::seconds(45);
         round < 300 && std::chrono::steady_clock::now() < stop_at; ++round) {
        // What the file holds must be exactly one generation, never a mix.
        xmldb::Tree t;
        std::string text, err;
        ASSERT_TRUE(xmldb::read_file(file, text, err) && t.from_xml(text, err)) << "round " << round << ": " << err;
        ASSERT_EQ(t.get("/iscsi/target/id:1/name"), "kept") << "round " << round;
        const int gen = std::atoi(std::string(t.get("/gen")).c_str());
        EXPECT_GE(gen, last_saved) << "an acknowledged save was lost";
        for (int i = 0; gen > 0 && i < 4; ++i)
            ASSERT_EQ(t.get("/blob/" + std::to_string(i)), blob(gen, i)) << "gen " << gen;
        ASSERT_EQ(xmldb_get("/gen"), gen ? std::to_string(gen) : "") << "the restarted service did not load it";
        const auto delay = static_cast<useconds_t>(rng() % 20000);
        const pid_t victim = db.pid(), killer = ::fork();
        if (killer == 0) {
            ::usleep(delay);
            ::_exit(::kill(victim, round % 50 == 0 ? SIGTERM : SIGKILL));
        }
        for (bool ok = true; ok; last_saved += ok) {
            const std::string next = std::to_string(last_saved + 1);
            ok = xmldbc_set(S, 0, "/gen", next.c_str()) == 0;
            for (int i = 0; ok && i < 4; ++i)
                ok = xmldbc_set(S, 0, ("/blob/" + std::to_string(i)).c_str(), blob(last_saved + 1, i).c_str()) == 0;
            ok = ok && xml_write_file("/etc/NAS_CFG/config.xml") == 0;
        }
        ::waitpid(killer, nullptr, 0);
        db.stop();
        db.start();
    }
    EXPECT_GE(round, 50);
    EXPECT_GT(last_saved, 0);
    db.stop();  // temporaries of killed saves are cleared when the service starts again
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
    EXPECT_EQ(xmldbc("save /tmp/outside.xml").status, 1);
    EXPECT_NE(xmldbc("--help").out.find("usage: xmldbc"), std::string::npos);
    for (const char *usage : {"", "frobnicate", "get relative", "set /only-path", "wait soon"})
        EXPECT_EQ(xmldbc(usage).status, 2) << usage;
    for (const char *failing : {"load /no/such.xml", "get /x"}) {  // the second once the service is down
        Ran r = xmldbc(failing);
        EXPECT_EQ(r.status, 1);
        EXPECT_NE(r.err.find("xmldbc: "), std::string::npos) << r.err;
        db.stop();
    }
    auto t0 = std::chrono::steady_clock::now();
    EXPECT_EQ(xmldbc("wait 0.3").status, 1);
    EXPECT_LT(std::chrono::steady_clock::now() - t0, std::chrono::seconds(2));
}

TEST(XmldbService, OneServicePerSocketAndCleanShutdown)
{
    const std::string sock = SysRoot::file(XMLDB_SOCK_ISCSI), start = korv_test::xmldbd_binary() + " --socket " + sock;
    {
        XmldbService db;
        struct stat st{};
        EXPECT_TRUE(::stat(sock.c_str(), &st) == 0 && (st.st_mode & 0777) == 0600);
        Ran twice = run(start + " --empty");
        EXPECT_EQ(twice.status, 1);
        EXPECT_NE(twice.err.find("already serves"), std::string::npos) << twice.err;
        EXPECT_EQ(db.stop(), 0);
    }
    EXPECT_NE(::access(sock.c_str(), F_OK), 0) << "SIGTERM should remove the socket";

    for (int trial = 0; trial < 60; ++trial) {  // started together over a crashed one's socket
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
    EXPECT_EQ(SysRoot::read("/etc/NAS_CFG/torn.xml"), "<xmldb><a value=\"1\">");  // never overwritten
}
