// SPDX-License-Identifier: Apache-2.0
// The bytes the client puts on the wire, captured by a test server.
#include <gtest/gtest.h>

#include "tests/isns/isns_test_util.h"
#include "tests/support/capture.h"

using namespace isns_test;

namespace {

bytes built()
{
    return bytes(isns_pdu_buf, isns_pdu_buf + isns_pdu_len());
}

bytes addr16(const char *text)
{
    unsigned char a[16];
    portal_addr(text, a);
    return bytes(a, a + 16);
}

// Runs op against a test server that answers status 0; returns the request.
template <class Op>
bytes request_of(const char *server, Op op)
{
    auto srv = fake_at(server, {status_rsp(0, 0x8001)}, "iqn.x:t1");
    EXPECT_EQ(op(), 0);
    auto reqs = srv->requests();
    return reqs.size() == 1 ? reqs[0] : bytes{};
}

}  // namespace

TEST(IsnsEncoding, StringsArePaddedWithTheirNul)
{
    emit_hdr(1);
    emit_attr(32, "iqn.x");
    emit_attr(32, "iqn.xyz");
    emit_attr(32, nullptr);
    emit_attr(32, "");
    const bytes want = bytes{0x00, 0x01, 0x00, 0x01, 0x00, 0x00, 0x8C, 0x00, 0, 0, 0, 0} +
                       bytes{0, 0, 0, 32, 0, 0, 0, 8, 'i', 'q', 'n', '.', 'x', 0, 0, 0} +
                       bytes{0, 0, 0, 32, 0, 0, 0, 8, 'i', 'q', 'n', '.', 'x', 'y', 'z', 0} +
                       bytes{0, 0, 0, 32, 0, 0, 0, 0} +
                       bytes{0, 0, 0, 32, 0, 0, 0, 4, 0, 0, 0, 0};
    EXPECT_EQ(built(), want);
}

TEST(IsnsEncoding, DeregistrationIsTheKnown56BytesAndAnEmptySourceHasLength4)
{
    bytes req = request_of("127.10.1.1", [] { return deregister_entity("iqn.x:t1"); });
    const bytes want = {0x00, 0x01, 0x00, 0x04, 0x00, 0x2C, 0x8C, 0x00, 0, 0, 0, 0,
                        0, 0, 0, 0x20, 0, 0, 0, 0x0C, 'i', 'q', 'n', '.', 'x', ':', 't', '1', 0, 0, 0, 0,
                        0, 0, 0, 0, 0, 0, 0, 0,
                        0, 0, 0, 0x01, 0, 0, 0, 0x08, 'n', 'a', 's', '1', 0, 0, 0, 0};
    EXPECT_EQ(req, want);

    req = request_of("127.10.1.2", [] { return deregister_entity(""); });
    ASSERT_GE(req.size(), 24u);
    EXPECT_EQ(bytes(req.begin() + 12, req.begin() + 24), (bytes{0, 0, 0, 32, 0, 0, 0, 4, 0, 0, 0, 0}));
    EXPECT_EQ(request_of("127.10.1.2", [] { return deregister_entity(nullptr); }), req);
}

TEST(IsnsEncoding, EntityRegistrationCarriesPortalsAndPortalGroups)
{
    isns_iscsi_node *n = make_node("iqn.x:t1", 1, {"192.168.1.10", "2001:db8::10"});
    bytes req = request_of("127.10.1.3", [n] { return register_entity(n); });
    const bytes v4 = addr16("192.168.1.10"), v6 = addr16("2001:db8::10");
    EXPECT_EQ(v4, (bytes{0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0xff, 0xff, 0xc0, 0xa8, 0x01, 0x0a}));
    const bytes payload = isns_attr_str(32, "iqn.x:t1") + isns_attr_str(1, "nas1") + isns_attr_raw(0, {}) +
                          isns_attr_str(1, "nas1") + isns_attr_u32(2, 2) +
                          isns_attr_raw(16, v4) + isns_attr_u32(17, 3260) +
                          isns_attr_raw(16, v6) + isns_attr_u32(17, 3260) +
                          isns_attr_str(32, "iqn.x:t1") + isns_attr_u32(33, 1) +
                          isns_attr_str(48, "iqn.x:t1") + isns_attr_raw(49, v4) + isns_attr_u32(50, 3260) +
                          isns_attr_u32(51, 1) +
                          isns_attr_str(48, "iqn.x:t1") + isns_attr_raw(49, v6) + isns_attr_u32(50, 3260) +
                          isns_attr_u32(51, 1);
    EXPECT_EQ(req, isns_pdu(1, 0x8C00, payload));
    isns_iscsi_node_free(n);
}

TEST(IsnsEncoding, PortallessNodeLosesItsTypeAndQueryAsksForTargetNames)
{
    isns_iscsi_node *n = make_node("iqn.x:t2", 2, {});
    const bytes head = isns_attr_str(32, "iqn.x:t1") + isns_attr_str(1, "nas1") + isns_attr_raw(0, {});
    EXPECT_EQ(request_of("127.10.1.4", [n] { return register_node(n); }),
              isns_pdu(1, 0x8C00, head + isns_attr_str(1, "nas1") + isns_attr_str(32, "iqn.x:t2")));
    isns_iscsi_node_free(n);

    const bytes payload = isns_attr_str(32, "iqn.x:t1") + isns_attr_str(32, "iqn.x:t1") + isns_attr_u32(33, 1) +
                          isns_attr_raw(0, {}) + isns_attr_raw(32, {});
    EXPECT_EQ(request_of("127.10.1.5", [] { return query_entity("iqn.x:t1") >= 4 ? 0 : -1; }),
              isns_pdu(2, 0x8C00, payload));
}

TEST(IsnsEncoding, MessageThatDoesNotFitIsNeverSent)
{
    auto srv = fake_at("127.10.1.6", {status_rsp(0, 0x8001)});
    isns_iscsi_node *n = make_node("iqn.x:t1", 1, {});
    for (int i = 0; i < 400; i++) {  // 400 portals: 44 + 52 bytes each, far past the buffer
        isns_ip_portal *p = isns_ip_portal_new();
        p->port = 3260;
        isns_iscsi_node_add_portal(n, p);
    }
    const std::string out = capture_stdout([n] { EXPECT_EQ(register_entity(n), -1); });
    EXPECT_NE(out.find("10000"), std::string::npos) << out;
    EXPECT_LE(isns_pdu_len(), size_t{ISNS_PDU_SIZE});
    EXPECT_TRUE(srv->requests().empty());

    // A long alias alone overflows as well; the next message is whole again.
    isns_alias_on = 1;
    std::memset(isns_alias, 'a', sizeof isns_alias - 1);
    isns_alias[sizeof isns_alias - 1] = '\0';
    isns_iscsi_node *small = make_node("iqn.x:t2", 1, {"10.0.0.1"});
    capture_stdout([small] { EXPECT_EQ(register_node(small), -1); });
    EXPECT_TRUE(srv->requests().empty());
    isns_alias_on = 0;
    EXPECT_EQ(register_node(small), 0);
    EXPECT_EQ(srv->requests().size(), 1u);
    isns_iscsi_node_free(small);
    isns_iscsi_node_free(n);
}

TEST(IsnsEncoding, TraceLinesOnlyWhenSwitchedOn)
{
    unsigned char a[16];
    portal_addr("10.0.0.1", a);
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
