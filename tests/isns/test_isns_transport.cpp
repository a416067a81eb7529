// Exchanges with a scripted server: the check's answers, malformed and
// oversized responses, and the time limits of connect and receive.
#include <gtest/gtest.h>

#include <chrono>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include "tests/isns/isns_test_util.h"

using korv_test::bytes;
using korv_test::isns_attr_raw;
using korv_test::isns_attr_str;
using korv_test::isns_fake_reply;
using korv_test::isns_fake_server;
using korv_test::isns_pdu;
using korv_test::isns_query_rsp;
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
    isns_fake_server srv(server);
    EXPECT_TRUE(srv.ok()) << srv.error();
    srv.set_reply(reply);
    reset_client(server);
    std::snprintf(isns_entity_name, sizeof isns_entity_name, "%s", kName);
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

TEST(IsnsCheck, AnswersWhetherTheServerHoldsTheName)
{
    EXPECT_EQ(check_against("127.10.2.1", whole(qry_rsp({kName}))).rc, 1);
    EXPECT_EQ(check_against("127.10.2.1", whole(qry_rsp({"iqn.other", kName}))).rc, 1);
    // The node gone: the server answers 0 with nothing after the delimiter.
    EXPECT_EQ(check_against("127.10.2.1", whole(qry_rsp({}))).rc, 0);
    // Only exact names: a longer or a shorter one does not match.
    EXPECT_EQ(check_against("127.10.2.1", whole(qry_rsp({std::string(kName) + "x"}))).rc, 0);
    EXPECT_EQ(check_against("127.10.2.1", whole(qry_rsp({std::string(kName).substr(0, 18)}))).rc, 0);
    // The echoed key before the delimiter does not count.
    EXPECT_EQ(check_against("127.10.2.1", whole(isns_pdu(0x8002, 0x4c00, bytes{0, 0, 0, 0} +
                                                isns_attr_str(32, kName)))).rc, 0);
}

TEST(IsnsCheck, SourceUnknownOrAbsentMeansLost)
{
    EXPECT_EQ(check_against("127.10.2.2", whole(status_rsp(6))).rc, 0);
    EXPECT_EQ(isns_last_status, 6);
    EXPECT_EQ(check_against("127.10.2.2", whole(status_rsp(7))).rc, 0);
    EXPECT_EQ(check_against("127.10.2.2", whole(status_rsp(3))).rc, -1);
    EXPECT_EQ(isns_last_status, 3);
}

TEST(IsnsCheck, OtherResponsesMeanNotHeld)
{
    // A name, but in a response that is not DevAttrQryRsp.
    EXPECT_EQ(check_against("127.10.2.3", whole(isns_pdu(0x8001, 0x4c00, isns_query_rsp(0, kName, {kName})))).rc, 0);
    // Only the status.
    EXPECT_EQ(check_against("127.10.2.3", whole(status_rsp(0))).rc, 0);
}

TEST(IsnsCheck, MalformedResponsesFailWithoutFalseMatch)
{
    const bytes good = isns_query_rsp(0, kName, {kName});
    // An attribute length running past the payload.
    bytes past = good;
    past[past.size() - 28 + 7] = 0x40;
    EXPECT_EQ(check_against("127.10.2.4", whole(isns_pdu(0x8002, 0x4c00, past))).rc, -1);
    // A length that is not a multiple of 4.
    bytes odd = good;
    odd[odd.size() - 28 + 7] = 19;
    EXPECT_EQ(check_against("127.10.2.4", whole(isns_pdu(0x8002, 0x4c00, odd))).rc, -1);
    // A trailing fragment shorter than an attribute header.
    EXPECT_EQ(check_against("127.10.2.4", whole(isns_pdu(0x8002, 0x4c00, good + bytes{0, 0}))).rc, -1);
    // A header announcing more than is sent before the server closes.
    bytes liar = isns_pdu(0x8002, 0x4c00, good);
    liar[5] = static_cast<uint8_t>(liar[5] + 8);
    EXPECT_EQ(check_against("127.10.2.4", whole(liar)).rc, -1);
    // A value without its NUL whose bytes are a prefix of the name.
    const bytes prefix = isns_attr_raw(32, bytes(kName, kName + 16));
    EXPECT_EQ(check_against("127.10.2.4", whole(isns_pdu(0x8002, 0x4c00,
                                                isns_query_rsp(0, kName, {}) + prefix))).rc, 0);
    // Fewer than 4 payload bytes.
    EXPECT_EQ(check_against("127.10.2.4", whole(isns_pdu(0x8002, 0x4c00, {0, 0}))).rc, -1);
    EXPECT_EQ(isns_check_registration(nullptr), -1);
}

TEST(IsnsReceive, MultiPduResponseIsJoined)
{
    const bytes payload = isns_query_rsp(0, kName, {"iqn.a", "iqn.b", kName});
    const size_t cut1 = 12, cut2 = 40;
    const bytes three = isns_pdu(0x8002, 0x4400, bytes(payload.begin(), payload.begin() + cut1)) +
                        isns_pdu(0x8002, 0x4000, bytes(payload.begin() + cut1, payload.begin() + cut2)) +
                        isns_pdu(0x8002, 0x4800, bytes(payload.begin() + cut2, payload.end()));
    EXPECT_EQ(check_against("127.10.2.5", whole(three)).rc, 1);

    isns_fake_server srv("127.10.2.5");
    ASSERT_TRUE(srv.ok()) << srv.error();
    srv.set_reply(whole(three));
    reset_client("127.10.2.5");
    emit_hdr(2);
    EXPECT_EQ(send_and_recv(), static_cast<int>(payload.size()));
    EXPECT_EQ(bytes(isns_pdu_buf, isns_pdu_buf + payload.size()), payload);
}

TEST(IsnsReceive, MoreThanTheBufferFails)
{
    // One attribute filling the payload, sent as three PDUs.
    auto split3 = [](const bytes &p) {
        const size_t a = p.size() / 3, b = 2 * p.size() / 3;
        return isns_pdu(0x8002, 0x4400, bytes(p.begin(), p.begin() + a)) +
               isns_pdu(0x8002, 0x4000, bytes(p.begin() + a, p.begin() + b)) +
               isns_pdu(0x8002, 0x4800, bytes(p.begin() + b, p.end()));
    };
    const bytes status0 = {0, 0, 0, 0};
    const bytes exact = status0 + isns_attr_raw(99, bytes(ISNS_PDU_SIZE - 12, 0));
    ASSERT_EQ(exact.size(), size_t{ISNS_PDU_SIZE});
    EXPECT_EQ(check_against("127.10.2.6", whole(split3(exact))).rc, 0);
    const bytes over = status0 + isns_attr_raw(99, bytes(ISNS_PDU_SIZE - 8, 0));
    EXPECT_EQ(check_against("127.10.2.6", whole(split3(over))).rc, -1);
}

TEST(IsnsReceive, StatusStaysReadableAfterFailure)
{
    isns_fake_server srv("127.10.2.7");
    ASSERT_TRUE(srv.ok()) << srv.error();
    srv.set_reply(whole(status_rsp(6)));
    reset_client("127.10.2.7");
    emit_hdr(2);
    EXPECT_EQ(send_and_recv(), -1);
    EXPECT_EQ(isns_last_status, 6);
    EXPECT_EQ(query_entity(kName), -2);
    EXPECT_EQ(deregister_entity(kName), -1);
}

TEST(IsnsTimeLimits, SilentOrClosingServersFailPromptly)
{
    // Connected but never answering: 1 s of silence ends the receive.
    auto silent = check_against("127.10.3.1", {{}, 0, 0, 4000});
    EXPECT_EQ(silent.rc, -1);
    EXPECT_GE(silent.seconds, 0.9);
    EXPECT_LT(silent.seconds, 2.0);
    // Closing after half a header.
    auto early = check_against("127.10.3.1", whole(bytes{0, 1, 0x80, 0x02, 0, 4}));
    EXPECT_EQ(early.rc, -1);
    EXPECT_LT(early.seconds, 0.9);
    // Half a response, then silence.
    const bytes full = qry_rsp({kName});
    auto stalled = check_against("127.10.3.1", {bytes(full.begin(), full.begin() + 20), 0, 0, 4000});
    EXPECT_EQ(stalled.rc, -1);
    EXPECT_LT(stalled.seconds, 2.0);
}

TEST(IsnsTimeLimits, TricklingServerHitsTheDeadline)
{
    // One byte every 500 ms never trips the silence rule; the deadline ends it.
    const bytes padded = isns_pdu(0x8002, 0x4c00, isns_query_rsp(0, kName, {"iqn.a", "iqn.b", kName}));
    auto slow = check_against("127.10.3.2", {padded, 1, 500, 0});
    EXPECT_EQ(slow.rc, -1);
    EXPECT_GE(slow.seconds, ISNS_RECV_DEADLINE_MS / 1000.0 - 0.1);
    EXPECT_LT(slow.seconds, ISNS_RECV_DEADLINE_MS / 1000.0 + 1.0);
    // A slow but finite answer within the deadline still counts.
    auto ok = check_against("127.10.3.2", {qry_rsp({kName}), 8, 20, 0});
    EXPECT_EQ(ok.rc, 1);
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
    isns_fake_server srv("127.10.3.4");
    ASSERT_TRUE(srv.ok()) << srv.error();
    srv.set_reply(whole(qry_rsp({kName})));
    int fd = -1;
    EXPECT_EQ(isns_connect(&fd, AF_INET, "", 3205), -1);
    EXPECT_EQ(isns_connect(&fd, AF_INET, "nas.example", 3205), -1);
    EXPECT_EQ(isns_connect(&fd, AF_INET, "::1", 3205), -1);
    EXPECT_EQ(isns_connect(&fd, AF_INET6, "127.10.3.4", 3205), -1);
    EXPECT_EQ(isns_connect(&fd, AF_UNIX, "127.10.3.4", 3205), -1);
    EXPECT_EQ(fd, -1);
    reset_client("");
    EXPECT_EQ(isns_check_registration(kName), -1);
    // The same server is reached with a good text, port 0 meaning 3205.
    ASSERT_EQ(isns_connect(&fd, AF_INET, "127.10.3.4", 0), 0);
    EXPECT_GE(fd, 0);
    close(fd);
    reset_client("127.10.3.4");
    EXPECT_EQ(isns_check_registration(kName), 1);
    EXPECT_TRUE(srv.requests().size() >= 1);
}
