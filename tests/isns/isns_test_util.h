// SPDX-License-Identifier: Apache-2.0
// Shared setup of the iSNS client tests: the client's globals in a known
// state, nodes, scripted and real servers, recorded PDUs.
#pragma once

#include <arpa/inet.h>
#include <chrono>
#include <fstream>
#include <memory>
#include <sstream>
#include <string>
#include <vector>

#include <gtest/gtest.h>

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
    korv::copy_bounded(isns_entity_name, source);
    isns_trace = 0;
    isns_alias_on = 0;
}

// A node with the given portals (IPv4 or IPv6 text, port 3260).
inline isns_iscsi_node *make_node(const char *name, uint32_t tag, const std::vector<std::string> &addrs)
{
    isns_iscsi_node *n = isns_iscsi_node_new();
    korv::copy_bounded(n->name, name);
    n->pg_tag = tag;
    for (const std::string &a : addrs) {
        isns_ip_portal *p = isns_ip_portal_new();
        inet_pton(AF_INET6, (a.find(':') == std::string::npos ? "::ffff:" + a : a).c_str(), p->address);
        p->port = 3260;
        isns_iscsi_node_add_portal(n, p);
    }
    return n;
}

// A scripted server on address answering every connection with reply, and
// the client pointed at it with `source` as the source name.
inline std::unique_ptr<isns_fake_server> fake_at(const char *address, isns_fake_reply reply, const char *source = "")
{
    auto srv = std::make_unique<isns_fake_server>(address, reply);
    reset_client(address, AF_INET, source);
    return srv;
}

// Seconds fn() took, with its result.
template <class Fn>
std::pair<int, double> timed(Fn fn)
{
    const auto t0 = std::chrono::steady_clock::now();
    const int rc = fn();
    return {rc, std::chrono::duration<double>(std::chrono::steady_clock::now() - t0).count()};
}

// The PDUs of a data file: a line "[label] what" starts a record, hex bytes
// follow ("#" comments to the end of a line).
struct pdu_record {
    std::string label, heading;
    bytes data;
};

inline std::vector<pdu_record> pdu_records(const std::string &path)
{
    std::ifstream in(path);
    std::vector<pdu_record> out;
    for (std::string line, word; std::getline(in, line);) {
        if (line.starts_with('['))
            out.push_back({line.substr(1, line.find(']') - 1), line, {}});
        for (std::istringstream words(line.starts_with('[') ? "" : line.substr(0, line.find('#'))); words >> word;)
            for (size_t i = 0; i + 1 < word.size() && !out.empty(); i += 2)
                out.back().data.push_back(static_cast<uint8_t>(std::stoi(word.substr(i, 2), nullptr, 16)));
    }
    EXPECT_FALSE(out.empty()) << path;
    return out;
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
