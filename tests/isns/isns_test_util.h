// SPDX-License-Identifier: Apache-2.0
// Shared setup of the iSNS client tests: the client's globals in a known state.
#pragma once

#include <arpa/inet.h>
#include <cstring>
#include <memory>
#include <string>

#include "common/korvadm_err.h"
#include "common/korvadm_str.h"
#include "isns/isns_client.h"
#include "isns/isns_pdu.h"
#include "isns/isns_transport.h"
#include "tests/support/isns_isnsd.h"
#include "tests/support/isns_test_server.h"

namespace isns_test {

// The test server, its byte builders and + on byte vectors.
using namespace korv_test;

inline void reset_client(const char *server, int family = AF_INET, const char *source = "")
{
    korv::copy_bounded(isns_server_addr, server);
    isns_addr_family = family;
    korv::copy_bounded(isns_entity_id, "nas1");
    std::memset(isns_entity_name, 0, sizeof isns_entity_name);
    korv::copy_bounded(isns_entity_name, source);
    isns_trace = 0;
    isns_alias_on = 0;
}

// 16-byte portal address from IPv4 (mapped) or IPv6 text.
inline void portal_addr(const char *text, unsigned char out[16])
{
    const std::string t = std::strchr(text, ':') ? text : std::string("::ffff:") + text;
    inet_pton(AF_INET6, t.c_str(), out);
}

// A node with the given portals (addresses as text, one port for all).
inline isns_iscsi_node *make_node(const char *name, uint32_t tag, std::initializer_list<const char *> addrs,
                                  uint32_t port = 3260)
{
    isns_iscsi_node *n = isns_iscsi_node_new();
    korv::copy_bounded(n->name, name);
    n->pg_tag = tag;
    for (const char *a : addrs) {
        isns_ip_portal *p = isns_ip_portal_new();
        portal_addr(a, p->address);
        p->port = port;
        isns_iscsi_node_add_portal(n, p);
    }
    return n;
}

inline bytes status_rsp(uint32_t status, uint16_t func = 0x8002)
{
    return isns_pdu(func, 0x4c00, {static_cast<uint8_t>(status >> 24), static_cast<uint8_t>(status >> 16),
                                   static_cast<uint8_t>(status >> 8), static_cast<uint8_t>(status)});
}

// A scripted server on address answering every connection with reply, and
// the client pointed at it with `source` as the source name.
inline std::unique_ptr<isns_fake_server> fake_at(const char *address, isns_fake_reply reply, const char *source = "")
{
    auto srv = std::make_unique<isns_fake_server>(address);
    EXPECT_TRUE(srv->ok()) << srv->error();
    srv->set_reply(std::move(reply));
    reset_client(address, AF_INET, source);
    return srv;
}

// A fresh isnsd named srv on address (skips when isnsd is not installed),
// with the client pointed at it and `source` as the source name.
#define START_ISNSD(srv, address, family, source)                                              \
    if (!isns_test::isnsd_available())                                                         \
        GTEST_SKIP() << "isnsd/isnsadm not installed (open-isns-server, open-isns-utils)";     \
    isns_test::isnsd_server srv(address);                                                      \
    ASSERT_TRUE(srv.start()) << srv.error();                                                   \
    isns_test::reset_client(address, family, source)

}  // namespace isns_test
