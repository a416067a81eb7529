// SPDX-License-Identifier: Apache-2.0
// Exchanges with a scripted server: the check's answers to recorded
// responses (data/check_responses.txt), oversized responses, failures, and
// the time limits of receive.
#include <gtest/gtest.h>

#include <unistd.h>

#include <tuple>
#include <utility>

#include "common/korvadm_log.h"
#include "tests/isns/isns_test_util.h"
#include "tests/support/process.h"

using namespace isns_test;

namespace {

constexpr const char *kName = "iqn.2026-01.test:t1";

// Serves one scripted reply on `server`; the check for kName and its seconds.
std::pair<int, double> check_against(const char *server, const isns_fake_reply &reply)
{
    auto srv = fake_at(server, reply, kName);
    return timed([] { return isns_check_registration(kName); });
}

}  // namespace

// None of them is worth waiting for the 1 s of silence.
TEST(IsnsCheck, AnswersFromTheResponse)
{
    for (const pdu_record &r : pdu_records(KORV_ISNS_DATA "/check_responses.txt")) {
        const auto [rc, s] = check_against("127.10.2.1", {r.data});
        EXPECT_EQ(rc, std::stoi(r.label)) << r.heading;
        EXPECT_LT(s, 0.9) << r.heading;
    }
    EXPECT_EQ(isns_check_registration(nullptr), -1);
}

TEST(IsnsReceive, JoinedPayloadsMayFillTheBufferButNoMore)
{
    for (size_t extra : {0, 4}) {
        const bytes p = bytes{0, 0, 0, 0} + isns_attr_raw(99, bytes(ISNS_PDU_SIZE - 12 + extra, 0));
        const auto half = p.begin() + p.size() / 2;
        auto srv = fake_at("127.10.2.6", {isns_pdu(0x8002, 0x4400, bytes(p.begin(), half)) +
                                          isns_pdu(0x8002, 0x4800, bytes(half, p.end()))});
        emit_hdr(2);
        EXPECT_EQ(send_and_recv(), extra ? -1 : ISNS_PDU_SIZE) << p.size();
    }
}

// The callers report failures: without its trace the transport is silent
// whatever the debug level, for a refused status and an unreachable server.
TEST(IsnsReceive, StatusStaysReadableAfterFailureAndNothingIsPrinted)
{
    auto srv = fake_at("127.10.2.7", {isns_pdu(0x8002, 0x4c00, be32(6))});
    const int level = std::exchange(g_korv_debug_level, 4);
    EXPECT_EQ(capture_stdout([] {
                  emit_hdr(2);
                  EXPECT_EQ(send_and_recv(), -1);
                  korv::copy_bounded(isns_server_addr, "127.10.2.8");
                  emit_hdr(2);
                  EXPECT_EQ(send_and_recv(), -1);
                  EXPECT_EQ(isns_last_status, 0);
              }),
              "");
    g_korv_debug_level = level;
    reset_client("127.10.2.7");
    EXPECT_EQ(deregister_entity(kName), -1);
}

// Lower bounds are the limits themselves; upper ones leave a loaded machine
// room while still telling a limit from the server's own hold.
TEST(IsnsTimeLimits, SlowOrSilentServersFailWithinTheirLimits)
{
    const bytes full = isns_pdu(0x8002, 0x4c00, isns_query_rsp(0, kName, {kName}));
    const bytes longer = isns_pdu(0x8002, 0x4c00, isns_query_rsp(0, kName, {"iqn.a", "iqn.b", kName}));
    const double deadline = ISNS_RECV_DEADLINE_MS / 1000.0;
    // What, the reply, the check's answer, least and most seconds.
    const std::tuple<const char *, isns_fake_reply, int, double, double> cases[] = {
        {"connected but silent", {{}, 0, 0, 8000}, -1, 0.9, 4.0},
        {"half a response, then silence", {bytes(full.begin(), full.begin() + 20), 0, 0, 8000}, -1, 0.9, 4.0},
        // One byte every 500 ms never trips the silence rule.
        {"trickling past the deadline", {longer, 1, 500, 0}, -1, deadline - 0.1, deadline + 2.5},
        {"slow but within the deadline", {full, 8, 20, 0}, 1, 0.0, deadline},
    };
    for (const auto &[what, reply, want, min_s, max_s] : cases) {
        const auto [rc, s] = check_against("127.10.3.1", reply);
        EXPECT_EQ(rc, want) << what;
        EXPECT_TRUE(s >= min_s && s < max_s) << what << ": " << s << " s";
    }
}

// Time-outs of servers that never answer: test_isns_transport_scope.
TEST(IsnsConnect, AddressTextMustParseForItsFamilyAndARefusalIsAtOnce)
{
    auto srv = fake_at("127.10.3.4", {isns_pdu(0x8002, 0x4c00, be32(0))});
    int fd = -1;
    for (auto [family, text] : {std::pair{AF_INET, ""}, {AF_INET, "nas.example"}, {AF_INET, "::1"},
                                {AF_INET6, "127.10.3.4"}, {AF_UNIX, "127.10.3.4"}})
        EXPECT_EQ(isns_connect(&fd, family, text, 3205), -1) << family << " " << text;
    EXPECT_EQ(fd, -1);
    // The same server is reached with a good text, port 0 meaning 3205.
    ASSERT_EQ(isns_connect(&fd, AF_INET, "127.10.3.4", 0), 0);
    close(fd);
    const auto [rc, s] = timed([&] { return isns_connect(&fd, AF_INET, "127.10.3.5", 0); });
    EXPECT_EQ(rc, -1);
    EXPECT_LT(s, 2.0) << "nothing listening: refused, not timed out";
}
