// SPDX-License-Identifier: Apache-2.0
// Framing of the configuration database protocol and deadline-bound socket I/O.
#include "platform/xmldb_proto.h"

#include <cerrno>
#include <poll.h>
#include <sys/socket.h>

namespace xmldb {

namespace {

void put_be32(std::string &out, uint32_t v)
{
    out.push_back(static_cast<char>(v >> 24));
    out.push_back(static_cast<char>(v >> 16));
    out.push_back(static_cast<char>(v >> 8));
    out.push_back(static_cast<char>(v));
}

// Waits for the socket to be ready for `events` until the deadline.
bool wait_fd(int fd, short events, Clock::time_point deadline)
{
    for (;;) {
        auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - Clock::now());
        if (left.count() < 0)
            return false;
        pollfd p{fd, events, 0};
        int n = poll(&p, 1, static_cast<int>(left.count()) + 1);
        if (n > 0)
            return true;
        if (n == 0 || errno != EINTR)
            return false;
    }
}

}  // namespace

uint32_t load_be32(const unsigned char *p)
{
    return (uint32_t{p[0]} << 24) | (uint32_t{p[1]} << 16) | (uint32_t{p[2]} << 8) | uint32_t{p[3]};
}

void encode_request(std::string &out, Op op, std::string_view path, std::string_view value)
{
    put_be32(out, static_cast<uint32_t>(1 + 4 + path.size() + value.size()));
    out.push_back(static_cast<char>(op));
    put_be32(out, static_cast<uint32_t>(path.size()));
    out.append(path);
    out.append(value);
}

void begin_answer(std::string &out, Status status, size_t data_size)
{
    put_be32(out, static_cast<uint32_t>(1 + data_size));
    out.push_back(static_cast<char>(status));
}

void encode_answer(std::string &out, Status status, std::string_view data)
{
    begin_answer(out, status, data.size());
    out.append(data);
}

bool decode_request(std::string_view payload, Request &req)
{
    if (payload.size() < 5)
        return false;
    auto *p = reinterpret_cast<const unsigned char *>(payload.data());
    uint32_t plen = load_be32(p + 1);
    if (plen > payload.size() - 5 || plen > kPathMax)
        return false;
    req.op = static_cast<Op>(payload[0]);
    req.path = payload.substr(5, plen);
    req.value = payload.substr(5 + plen);
    if (req.value.size() > kValueMax)
        return false;
    return req.path.find('\0') == std::string_view::npos &&
           req.value.find('\0') == std::string_view::npos;
}

namespace {

// Moves len bytes through io (a non-blocking send or recv), waiting for
// events between partial transfers; false on error, end of stream or deadline.
template <class Io>
bool transfer_all(int fd, size_t len, short events, Clock::time_point deadline, Io io)
{
    for (size_t done = 0; done < len;) {
        ssize_t n = io(done, len - done);
        if (n > 0) {
            done += static_cast<size_t>(n);
        } else if (n < 0 && errno == EINTR) {
            continue;
        } else if (n < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) {
            if (!wait_fd(fd, events, deadline))
                return false;
        } else {
            return false;
        }
    }
    return true;
}

}  // namespace

bool send_all(int fd, const void *buf, size_t len, Clock::time_point deadline)
{
    auto *p = static_cast<const char *>(buf);
    return transfer_all(fd, len, POLLOUT, deadline,
                        [&](size_t at, size_t n) { return send(fd, p + at, n, MSG_NOSIGNAL | MSG_DONTWAIT); });
}

bool recv_all(int fd, void *buf, size_t len, Clock::time_point deadline)
{
    auto *p = static_cast<char *>(buf);
    return transfer_all(fd, len, POLLIN, deadline,
                        [&](size_t at, size_t n) { return recv(fd, p + at, n, MSG_DONTWAIT); });
}

}  // namespace xmldb
