// SPDX-License-Identifier: Apache-2.0
// A scriptable iSNS server for tests: faults a real server will not produce.
//
// isns_fake_server listens on one loopback address (IPv4 or IPv6 text) and
// port 3205 and serves connections one at a time on its own
// thread. For each connection it reads one request PDU (header and payload),
// records it, asks its handler for the reply and plays it: the bytes at once
// or in timed chunks (a trickling server), then keeps the connection open for
// a while (a silent server) or closes it. The destructor stops the thread
// promptly even in the middle of a reply.
//
// The builders below make the response bytes: isns_pdu() a PDU with header,
// isns_attr_*() one TLV, isns_query_rsp() a DevAttrQryRsp payload, be32() a
// 32-bit value (a status).
#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

namespace korv_test {

using bytes = std::vector<uint8_t>;

struct isns_fake_reply {
    bytes data;            // everything sent back, headers included
    size_t chunk = 0;      // 0: one send; else sends of this many bytes ...
    int chunk_gap_ms = 0;  // ... with this pause between them
    int hold_ms = 0;       // stays connected (silent) this long before closing
};

// A reply computed from the request received (whole PDU bytes).
using isns_fake_handler = std::function<isns_fake_reply(const bytes &request)>;

class isns_fake_server {
public:
    // Binds address, port 3205 (a test failure says why it cannot), and
    // answers every connection with what the handler computes ...
    isns_fake_server(const std::string &address, isns_fake_handler handler);
    // ... or with one reply for all.
    isns_fake_server(const std::string &address, const isns_fake_reply &reply)
        : isns_fake_server(address, [reply](const bytes &) { return reply; }) {}
    ~isns_fake_server();

    // Requests received so far, whole PDUs.
    std::vector<bytes> requests() const;

private:
    void serve();
    void serve_one(int fd);
    // Up to ms for fd to turn readable (-1: just the wait); false on
    // time-out or once asked to stop.
    bool wait_readable(int fd, int ms) const;

    int listen_fd_ = -1;
    std::atomic<bool> stop_{false};
    const isns_fake_handler handler_;
    mutable std::mutex mu_;
    std::vector<bytes> requests_;
    std::thread thread_;
};

// A PDU: version 1, function id, payload length, flags, ids 0, then payload.
bytes isns_pdu(uint16_t func, uint16_t flags, const bytes &payload);
// A 32-bit value, big-endian.
bytes be32(uint32_t value);
// TLVs: a string padded with NULs to a multiple of 4, raw bytes.
bytes isns_attr_str(uint32_t tag, const std::string &text);
bytes isns_attr_raw(uint32_t tag, const bytes &value);
// Payload of a DevAttrQryRsp: status, the echoed key (node name), delimiter,
// then one iSCSI Name attribute per held name.
bytes isns_query_rsp(uint32_t status, const std::string &key, const std::vector<std::string> &names);
// Concatenation.
bytes operator+(bytes a, const bytes &b);

// True when something accepts TCP connections on address:port now.
bool tcp_port_open(const std::string &address, int port);

}  // namespace korv_test
