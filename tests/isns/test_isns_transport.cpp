// SPDX-License-Identifier: Apache-2.0
// Exchanges with a scripted server: the check's answers, malformed and
// oversized responses, and the time limits of connect and receive.
#include <gtest/gtest.h>

#include <chrono>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include "common/korvadm_log.h"
#include "tests/isns/isns_test_util.h"
#include "tests/support/capture.h"

using namespace isns_test;

namespace {

constexpr const char *kName = "iqn.2026-01.test:t1";

struct check_result {
    int rc;
    double seconds;
};

// Serves one scripted reply on `server` and runs the check for kName.
check_result check_against(const char *server, const isns_fake_reply &reply)
{
    auto srv = fake_at(server, reply, kName);
    const auto t0 = std::chrono::steady_clock::now();
    const int rc = isns_check_registration(kName);
    return {rc, std::chrono::duration<double>(std::chrono::steady_clock::now() - t0).count()};
}

isns_fake_reply whole(bytes data)
{
    return {std::move(data), 0, 0, 0};
}

bytes qry_rsp(const std::vector<std::string> &names, uint32_t status = 0)
{
    return isns_pdu(0x8002, 0x4c00, isns_query_rsp(status, kName, names));
}

}  // namespace

TEST(IsnsCheck, AnswersFromTheResponse)
{
    const bytes good = isns_query_rsp(0, kName, {kName});
    bytes past = good, odd = good, liar = isns_pdu(0x8002, 0x4c00, good);
    past[past.size() - 28 + 7] = 0x40;  // the name's length runs past the payload
    odd[odd.size() - 28 + 7] = 19;      // not a multiple of 4
    liar[5] = static_cast<uint8_t>(liar[5] + 8);  // announces more than is sent
    const struct {
        const char *what;
        bytes reply;
        int rc;
    } cases[] = {
        {"held", qry_rsp({kName}), 1},
        {"held among others", qry_rsp({"iqn.other", kName}), 1},
        {"gone: nothing after the delimiter", qry_rsp({}), 0},
        {"longer name", qry_rsp({std::string(kName) + "x"}), 0},
        {"shorter name", qry_rsp({std::string(kName).substr(0, 18)}), 0},
        {"only the echoed key", isns_pdu(0x8002, 0x4c00, bytes{0, 0, 0, 0} + isns_attr_str(32, kName)), 0},
        {"status 6", status_rsp(6), 0},
        {"status 7", status_rsp(7), 0},
        {"status 3", status_rsp(3), -1},
        {"not DevAttrQryRsp", isns_pdu(0x8001, 0x4c00, good), 0},
        {"status only", status_rsp(0), 0},
        {"attribute past the payload", isns_pdu(0x8002, 0x4c00, past), -1},
        {"odd attribute length", isns_pdu(0x8002, 0x4c00, odd), -1},
        {"trailing fragment", isns_pdu(0x8002, 0x4c00, good + bytes{0, 0}), -1},
        {"header that lies", liar, -1},
        {"unterminated prefix of the name",
         isns_pdu(0x8002, 0x4c00, isns_query_rsp(0, kName, {}) + isns_attr_raw(32, bytes(kName, kName + 16))), 0},
        {"payload under 4 bytes", isns_pdu(0x8002, 0x4c00, {0, 0}), -1},
    };
    for (const auto &c : cases)
        EXPECT_EQ(check_against("127.10.2.1", whole(c.reply)).rc, c.rc) << c.what;
    EXPECT_EQ(isns_check_registration(nullptr), -1);
}

TEST(IsnsReceive, MultiPduResponsesAreJoinedUpToTheBuffer)
{
    auto split3 = [](const bytes &p) {
        const size_t a = p.size() / 3, b = 2 * p.size() / 3;
        return isns_pdu(0x8002, 0x4400, bytes(p.begin(), p.begin() + a)) +
               isns_pdu(0x8002, 0x4000, bytes(p.begin() + a, p.begin() + b)) +
               isns_pdu(0x8002, 0x4800, bytes(p.begin() + b, p.end()));
    };
    const bytes payload = isns_query_rsp(0, kName, {"iqn.a", "iqn.b", kName});
    {
        auto srv = fake_at("127.10.2.5", whole(split3(payload)));
        emit_hdr(2);
        EXPECT_EQ(send_and_recv(), static_cast<int>(payload.size()));
        EXPECT_EQ(bytes(isns_pdu_buf, isns_pdu_buf + payload.size()), payload);
    }
    // One attribute filling exactly the buffer, then one 4 bytes longer.
    for (size_t extra : {0, 4}) {
        const bytes p = bytes{0, 0, 0, 0} + isns_attr_raw(99, bytes(ISNS_PDU_SIZE - 12 + extra, 0));
        EXPECT_EQ(check_against("127.10.2.6", whole(split3(p))).rc, extra ? -1 : 0) << p.size();
    }
}

TEST(IsnsReceive, StatusStaysReadableAfterFailure)
{
    auto srv = fake_at("127.10.2.7", whole(status_rsp(6)));
    // Without its trace the transport prints nothing, whatever the debug
    // level: a refused status and an unreachable server alike.
    const int level = g_korv_debug_level;
    g_korv_debug_level = 4;
    const std::string out = capture_stdout([] {
        emit_hdr(2);
        EXPECT_EQ(send_and_recv(), -1);
        EXPECT_EQ(isns_last_status, 6);
        korv::copy_bounded(isns_server_addr, "127.10.2.8");
        emit_hdr(2);
        EXPECT_EQ(send_and_recv(), -1);
        EXPECT_EQ(isns_last_status, 0);
    });
    g_korv_debug_level = level;
    EXPECT_EQ(out, "");
    reset_client("127.10.2.7");
    EXPECT_EQ(query_entity(kName), -2);
    EXPECT_EQ(deregister_entity(kName), -1);
}

TEST(IsnsTimeLimits, SlowSilentOrClosingServersFailWithinTheirLimits)
{
    const bytes full = qry_rsp({kName});
    const bytes longer = isns_pdu(0x8002, 0x4c00, isns_query_rsp(0, kName, {"iqn.a", "iqn.b", kName}));
    const double deadline = ISNS_RECV_DEADLINE_MS / 1000.0;
    const struct {
        const char *what;
        isns_fake_reply reply;
        int rc;
        double min_s, max_s;
    } cases[] = {
        {"connected but silent", {{}, 0, 0, 4000}, -1, 0.9, 2.0},
        {"closes after half a header", whole(bytes{0, 1, 0x80, 0x02, 0, 4}), -1, 0.0, 0.9},
        {"half a response, then silence", {bytes(full.begin(), full.begin() + 20), 0, 0, 4000}, -1, 0.9, 2.0},
        // One byte every 500 ms never trips the silence rule.
        {"trickling past the deadline", {longer, 1, 500, 0}, -1, deadline - 0.1, deadline + 1.0},
        {"slow but within the deadline", {full, 8, 20, 0}, 1, 0.0, deadline},
    };
    for (const auto &c : cases) {
        const auto r = check_against("127.10.3.1", c.reply);
        EXPECT_EQ(r.rc, c.rc) << c.what;
        EXPECT_GE(r.seconds, c.min_s) << c.what;
        EXPECT_LT(r.seconds, c.max_s) << c.what;
    }
}

TEST(IsnsTimeLimits, UnreachableServerFailsWithinTheConnectTimeout)
{
    // Nothing listening: refused at once.
    reset_client("127.10.3.3");
    auto t0 = std::chrono::steady_clock::now();
    EXPECT_EQ(isns_check_registration(kName), -1);
    EXPECT_LT(std::chrono::duration<double>(std::chrono::steady_clock::now() - t0).count(), 0.9);

    // A listener whose accept queue is full drops the handshake: the connect
    // has to time out.
    int lfd = socket(AF_INET, SOCK_STREAM, 0);
    sockaddr_in sa{};
    sa.sin_family = AF_INET;
    sa.sin_port = htons(3205);
    inet_pton(AF_INET, "127.10.3.3", &sa.sin_addr);
    ASSERT_EQ(bind(lfd, reinterpret_cast<sockaddr *>(&sa), sizeof sa), 0);
    ASSERT_EQ(listen(lfd, 0), 0);
    std::vector<int> fillers;
    for (int i = 0; i < 4; i++) {  // fill the queue (backlog 0 still admits one)
        int f = socket(AF_INET, SOCK_STREAM | SOCK_NONBLOCK, 0);
        connect(f, reinterpret_cast<sockaddr *>(&sa), sizeof sa);
        fillers.push_back(f);
    }
    usleep(100 * 1000);
    t0 = std::chrono::steady_clock::now();
    EXPECT_EQ(isns_check_registration(kName), -1);
    const double s = std::chrono::duration<double>(std::chrono::steady_clock::now() - t0).count();
    EXPECT_GE(s, 2.9);
    EXPECT_LT(s, 4.0);
    for (int f : fillers)
        close(f);
    close(lfd);
}

TEST(IsnsConnect, AddressTextMustParseForItsFamily)
{
    auto srv = fake_at("127.10.3.4", whole(qry_rsp({kName})));
    int fd = -1;
    for (auto [family, text] : {std::pair{AF_INET, ""}, {AF_INET, "nas.example"}, {AF_INET, "::1"},
                                {AF_INET6, "127.10.3.4"}, {AF_UNIX, "127.10.3.4"}})
        EXPECT_EQ(isns_connect(&fd, family, text, 3205), -1) << family << " " << text;
    EXPECT_EQ(fd, -1);
    reset_client("");
    EXPECT_EQ(isns_check_registration(kName), -1);
    // The same server is reached with a good text, port 0 meaning 3205.
    ASSERT_EQ(isns_connect(&fd, AF_INET, "127.10.3.4", 0), 0);
    close(fd);
    reset_client("127.10.3.4");
    EXPECT_EQ(isns_check_registration(kName), 1);
}
