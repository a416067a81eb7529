// SPDX-License-Identifier: Apache-2.0
// The bytes the client puts on the wire, captured by a test server and
// compared with the recorded requests (data/requests.txt).
#include <gtest/gtest.h>

#include <functional>
#include <map>

#include "tests/isns/isns_test_util.h"
#include "tests/support/process.h"

using namespace isns_test;

TEST(IsnsEncoding, RequestsAreTheRecordedBytes)
{
    std::map<std::string, bytes> want;
    for (const pdu_record &r : pdu_records(KORV_ISNS_DATA "/requests.txt"))
        want[r.label] = r.data;
    auto srv = fake_at("127.10.1.1", {isns_pdu(0x8001, 0x4c00, be32(0))}, "iqn.x:t1");
    emit_hdr(1);
    for (const char *text : {"iqn.x", "iqn.xyz", static_cast<const char *>(nullptr), ""})
        emit_attr(32, text);
    EXPECT_EQ(bytes(isns_pdu_buf, isns_pdu_buf + isns_pdu_len()), want["strings"]);

    isns_iscsi_node *entity = make_node("iqn.x:t1", 1, {"192.168.1.10", "2001:db8::10"});
    isns_iscsi_node *portalless = make_node("iqn.x:t2", 2, {});
    const std::pair<const char *, std::function<int()>> ops[] = {
        {"deregister", [] { return deregister_entity("iqn.x:t1"); }},
        {"deregister empty", [] { return deregister_entity(""); }},
        {"deregister empty", [] { return deregister_entity(nullptr); }},
        {"register entity", [&] { return register_entity(entity); }},
        {"register portal-less node", [&] { return register_node(portalless); }},
        {"query", [] { return query_entity("iqn.x:t1") >= 4 ? 0 : -1; }},
    };
    for (size_t i = 0; i < std::size(ops); i++) {
        EXPECT_EQ(ops[i].second(), 0) << ops[i].first;
        const std::vector<bytes> sent = srv->requests();
        ASSERT_EQ(sent.size(), i + 1) << ops[i].first;
        EXPECT_EQ(sent[i], want.at(ops[i].first)) << ops[i].first;
    }
    isns_iscsi_node_free(entity);
    isns_iscsi_node_free(portalless);

    // 400 portals (44 + 52 bytes each) or a long alias alone: far past the
    // buffer, so nothing is sent; the next message is whole again.
    isns_iscsi_node *big = make_node("iqn.x:t1", 1, std::vector<std::string>(400, "::"));
    const std::string out = capture_stdout([big] { EXPECT_EQ(register_entity(big), -1); });
    EXPECT_NE(out.find("10000"), std::string::npos) << out;
    EXPECT_LE(isns_pdu_len(), size_t{ISNS_PDU_SIZE});
    isns_alias_on = 1;
    std::memset(isns_alias, 'a', sizeof isns_alias - 1);
    isns_iscsi_node *small = make_node("iqn.x:t2", 1, {"10.0.0.1"});
    capture_stdout([small] { EXPECT_EQ(register_node(small), -1); });
    EXPECT_EQ(srv->requests().size(), std::size(ops));
    isns_alias_on = 0;
    EXPECT_EQ(register_node(small), 0);
    EXPECT_EQ(srv->requests().size(), std::size(ops) + 1);
    isns_iscsi_node_free(small);
    isns_iscsi_node_free(big);
}

TEST(IsnsEncoding, TraceLinesOnlyWhenSwitchedOn)
{
    const unsigned char a[16] = {0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0xff, 0xff, 10, 0, 0, 1};
    auto emit_some = [&] {
        emit_hdr(4);
        emit_addr(0, a);
        emit_port(1, 3260);
        emit_delimiter();
    };
    isns_trace = 0;
    EXPECT_EQ(capture_stdout(emit_some), "");
    isns_trace = 1;
    EXPECT_EQ(capture_stdout(emit_some),
              "   emit_hdr() func = 4\n"
              "16 emit_addr() addr = 00 00 00 00 00 00 00 00 00 00 ff ff 0a 00 00 01 \n"
              "50 emit_port() port = 3260\n"
              " 0 emit_delimiter()\n");
    isns_trace = 0;
}
