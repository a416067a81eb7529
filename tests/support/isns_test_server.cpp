// SPDX-License-Identifier: Apache-2.0
#include "tests/support/isns_test_server.h"

#include <netdb.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

#include <gtest/gtest.h>

namespace korv_test {

namespace {

// Fills a sockaddr for an IPv4 or IPv6 text (no name lookup); 0 on failure.
socklen_t make_addr(const std::string &address, int port, sockaddr_storage *ss)
{
    addrinfo hints{}, *ai = nullptr;
    hints.ai_flags = AI_NUMERICHOST | AI_NUMERICSERV;
    hints.ai_socktype = SOCK_STREAM;
    if (getaddrinfo(address.c_str(), std::to_string(port).c_str(), &hints, &ai) != 0)
        return 0;
    const socklen_t len = ai->ai_addrlen;
    std::memcpy(ss, ai->ai_addr, len);
    freeaddrinfo(ai);
    return len;
}

}  // namespace

isns_fake_server::isns_fake_server(const std::string &address, isns_fake_handler handler)
    : handler_(std::move(handler))
{
    sockaddr_storage ss{};
    const socklen_t len = make_addr(address, 3205, &ss);
    const int fd = len ? socket(ss.ss_family, SOCK_STREAM | SOCK_CLOEXEC, 0) : -1;
    int one = 1;
    setsockopt(fd, SOL_SOCKET, SO_REUSEADDR, &one, sizeof one);
    if (fd < 0 || bind(fd, reinterpret_cast<sockaddr *>(&ss), len) != 0 || listen(fd, 8) != 0) {
        ADD_FAILURE() << "cannot listen on " << address << ":3205: " << std::strerror(errno);
        close(fd);
        return;
    }
    listen_fd_ = fd;
    thread_ = std::thread([this] { serve(); });
}

isns_fake_server::~isns_fake_server()
{
    stop_ = true;
    if (thread_.joinable())
        thread_.join();
    close(listen_fd_);
}

std::vector<bytes> isns_fake_server::requests() const
{
    std::lock_guard<std::mutex> lock(mu_);
    return requests_;
}

bool isns_fake_server::wait_readable(int fd, int ms) const
{
    pollfd p{fd, POLLIN, 0};
    for (int waited = 0; !stop_ && waited < ms; waited += 20)
        if (poll(&p, 1, 20) > 0)
            return !stop_;
    return false;
}

void isns_fake_server::serve()
{
    while (!stop_) {
        const int fd = wait_readable(listen_fd_, 100) ? accept4(listen_fd_, nullptr, nullptr, SOCK_CLOEXEC) : -1;
        if (fd >= 0) {
            serve_one(fd);
            close(fd);
        }
    }
}

void isns_fake_server::serve_one(int fd)
{
    // The request: 12-byte header, then the length it announces. A client
    // that sends less is answered anyway after a short wait.
    bytes req;
    uint8_t buf[4096];
    for (size_t want = 12; req.size() < want && wait_readable(fd, 2000);) {
        const ssize_t n = recv(fd, buf, std::min(sizeof buf, want - req.size()), 0);
        if (n <= 0)
            break;
        req.insert(req.end(), buf, buf + n);
        if (req.size() == 12)
            want = 12 + ((size_t{req[4]} << 8) | req[5]);
    }
    {
        std::lock_guard<std::mutex> lock(mu_);
        requests_.push_back(req);
    }
    const isns_fake_reply reply = handler_(req);
    const size_t step = reply.chunk ? reply.chunk : reply.data.size();
    for (size_t off = 0; off < reply.data.size(); off += step) {
        if (off)
            wait_readable(-1, reply.chunk_gap_ms);
        const size_t n = std::min(step, reply.data.size() - off);
        if (stop_ || send(fd, reply.data.data() + off, n, MSG_NOSIGNAL) != static_cast<ssize_t>(n))
            return;
    }
    wait_readable(-1, reply.hold_ms);
}

bytes be32(uint32_t v)
{
    return {uint8_t(v >> 24), uint8_t(v >> 16), uint8_t(v >> 8), uint8_t(v)};
}

// Version 1 and the function id, then the length and the flags, then the
// transaction and sequence ids (0).
bytes isns_pdu(uint16_t func, uint16_t flags, const bytes &payload)
{
    return be32(1u << 16 | func) + be32(static_cast<uint32_t>(payload.size()) << 16 | flags) + be32(0) + payload;
}

bytes isns_attr_raw(uint32_t tag, const bytes &value)
{
    return be32(tag) + be32(static_cast<uint32_t>(value.size())) + value;
}

bytes isns_attr_str(uint32_t tag, const std::string &text)
{
    bytes v(text.begin(), text.end());
    v.resize(text.size() / 4 * 4 + 4);  // at least one NUL, then to a multiple of 4
    return isns_attr_raw(tag, v);
}

bytes isns_query_rsp(uint32_t status, const std::string &key, const std::vector<std::string> &names)
{
    bytes b = be32(status) + isns_attr_str(32, key) + isns_attr_raw(0, {});
    for (const std::string &n : names)
        b = b + isns_attr_str(32, n);
    return b;
}

// Sized once and filled in place: growing vectors here trips GCC 12's
// -Warray-bounds false positive at -O3.
bytes operator+(bytes a, const bytes &b)
{
    bytes r(a.size() + b.size());
    std::copy(a.begin(), a.end(), r.begin());
    std::copy(b.begin(), b.end(), r.begin() + static_cast<std::ptrdiff_t>(a.size()));
    return r;
}

bool tcp_port_open(const std::string &address, int port)
{
    sockaddr_storage ss{};
    const socklen_t len = make_addr(address, port, &ss);
    const int fd = len ? socket(ss.ss_family, SOCK_STREAM | SOCK_CLOEXEC, 0) : -1;
    const bool open = fd >= 0 && connect(fd, reinterpret_cast<sockaddr *>(&ss), len) == 0;
    if (fd >= 0)
        close(fd);
    return open;
}

}  // namespace korv_test
