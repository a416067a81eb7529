// SPDX-License-Identifier: Apache-2.0
/* iSNS transport: connect with time-outs, send one PDU, read one response. */
#include "isns/isns_transport.h"

#include <arpa/inet.h>
#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <fcntl.h>
#include <net/if.h>
#include <netinet/in.h>
#include <poll.h>
#include <unistd.h>

#include "isns/isns_internal.h"
#include "isns/isns_pdu.h"

char isns_server_addr[256];
int isns_addr_family = AF_INET;
int isns_last_status = 0;
unsigned char isns_rsp_hdr[12];
int isns_connect_timeout = 3;

namespace {

using clock_type = std::chrono::steady_clock;

/* Closes on every path unless released to the caller. */
class socket_fd {
public:
    socket_fd() = default;
    explicit socket_fd(int fd) : fd_(fd) {}
    socket_fd(const socket_fd &) = delete;
    socket_fd &operator=(const socket_fd &) = delete;
    ~socket_fd() { reset(); }
    int get() const { return fd_; }
    int release() { int fd = fd_; fd_ = -1; return fd; }
    void reset(int fd = -1)
    {
        if (fd_ >= 0)
            close(fd_);
        fd_ = fd;
    }

private:
    int fd_ = -1;
};

/* The receive deadline of the response being read; recv_pdu_header and
 * recv_payload called on their own get a fresh one. */
bool g_in_response = false;
clock_type::time_point g_deadline;

clock_type::time_point current_deadline()
{
    return g_in_response ? g_deadline
                         : clock_type::now() + std::chrono::milliseconds(ISNS_RECV_DEADLINE_MS);
}

/* Reads until len bytes, 1 s of silence, end of stream or the deadline.
 * Reads first and waits only when nothing is there: the payload usually
 * arrives with its header. */
int read_bounded(int fd, unsigned char *dest, int len, clock_type::time_point deadline)
{
    int got = 0;
    while (got < len) {
        const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
                              deadline - clock_type::now()).count();
        if (left <= 0)
            break;
        const ssize_t n = recv(fd, dest + got, static_cast<size_t>(len - got), MSG_DONTWAIT);
        if (n > 0) {
            got += static_cast<int>(n);
            continue;
        }
        if (n == 0 || (errno != EAGAIN && errno != EWOULDBLOCK && errno != EINTR))
            break;
        pollfd pfd{fd, POLLIN, 0};
        const int pr = poll(&pfd, 1, static_cast<int>(left < ISNS_SILENCE_MS ? left : ISNS_SILENCE_MS));
        if (pr == 0 || (pr < 0 && errno != EINTR))
            break;
    }
    return got;
}

unsigned be16(const unsigned char *p)
{
    return (static_cast<unsigned>(p[0]) << 8) | p[1];
}

/* A fresh non-blocking socket; the flags it had before go to *saved. */
int open_nonblocking(int family, int *saved, const char *socket_msg)
{
    socket_fd fd(socket(family, SOCK_STREAM | SOCK_CLOEXEC, 0));
    if (fd.get() < 0) {
        _isns_tracef(socket_msg, errno, strerror(errno));
        return -1;
    }
    const int flags = fcntl(fd.get(), F_GETFL, 0);
    if (flags < 0) {
        _isns_tracef("isnsc: get socketfd flag failed (%s)\n", strerror(errno));
        return -1;
    }
    if (fcntl(fd.get(), F_SETFL, flags | O_NONBLOCK) < 0) {
        _isns_tracef("isnsc: set socketfd flag failed (%s)\n", strerror(errno));
        return -1;
    }
    *saved = flags;
    return fd.release();
}

bool is_link_local(const in6_addr &a)
{
    return a.s6_addr[0] == 0xfe && (a.s6_addr[1] & 0xc0) == 0x80;
}

}  // namespace

int connect_non_block(int fd, const struct sockaddr *addr, socklen_t len)
{
    errno = 0;
    int rc = connect(fd, addr, len);
    if (rc < 0 && errno != EINPROGRESS) {
        _isns_tracef("isnsc:   connect() failed, errno = %d (%s)\n", errno, strerror(errno));
        return -1;
    }
    if (rc == 0) {
        _isns_tracef("isnsc: after connect func_ret = %d, errno = %d (%s)\n", rc, errno, strerror(errno));
        return 0;
    }
    /* poll rather than select: a descriptor number above FD_SETSIZE must not
     * overflow an fd_set. */
    pollfd pfd{fd, POLLOUT, 0};
    do
        rc = poll(&pfd, 1, isns_connect_timeout * 1000);
    while (rc < 0 && errno == EINTR);
    if (rc < 0) {
        _isns_tracef("isnsc:   select() errno = %d (%s)\n", errno, strerror(errno));
        return -1;
    }
    if (rc == 0) {
        _isns_tracef("isnsc:   select timeout , ret = %d, errno = %d (%s)\n", rc, errno, strerror(errno));
        return -1;
    }
    if (!(pfd.revents & (POLLOUT | POLLERR | POLLHUP))) {
        _isns_tracef("isnsc:   sockfd error - FD_ISSET is false\n");
        return -1;
    }
    int err = 0;
    socklen_t err_len = sizeof err;
    if (getsockopt(fd, SOL_SOCKET, SO_ERROR, &err, &err_len) < 0)
        err = errno;
    if (err != 0) {
        _isns_tracef("isnsc: error in connection(), error = %d (%s)\n", err, strerror(err));
        return -1;
    }
    return 0;
}

int isns_connect(int *fd, int family, const char *address, int port)
{
    if (!fd || !address)
        return -1;
    *fd = -1;
    int saved = 0;
    socket_fd sock(open_nonblocking(family, &saved, "isnsc: socket() error errno = %d (%s)\n"));
    if (sock.get() < 0)
        return -1;
    if (port < 1) {
        _isns_tracef("isnsc: Warning! Destination port is not given, apply default port %d\n", ISNS_SERVER_PORT);
        port = ISNS_SERVER_PORT;
    }

    int rc = -1;
    if (family == AF_INET) {
        sockaddr_in sa{};
        sa.sin_family = AF_INET;
        sa.sin_port = htons(static_cast<uint16_t>(port));
        if (inet_aton(address, &sa.sin_addr) == 0)
            return -1;
        isns_connect_timeout = 3;
        rc = connect_non_block(sock.get(), reinterpret_cast<sockaddr *>(&sa), sizeof sa);
    } else if (family == AF_INET6) {
        sockaddr_in6 sa{};
        sa.sin6_family = AF_INET6;
        sa.sin6_port = htons(static_cast<uint16_t>(port));
        if (inet_pton(AF_INET6, address, &sa.sin6_addr) != 1)
            return -1;
        if (is_link_local(sa.sin6_addr)) {
            isns_connect_timeout = 1;
            unsigned scopes[3];
            int n = 0;
            if (const unsigned bond = if_nametoindex("bond0")) {
                _isns_tracef("scope_id = %d\n", static_cast<int>(bond));
                scopes[n++] = bond;
            }
            scopes[n++] = if_nametoindex("eth0");
            scopes[n++] = if_nametoindex("eth1");
            for (int i = 0; i < n && rc != 0; i++) {
                if (i > 0) {
                    sock.reset(open_nonblocking(family, &saved, "isnsc: socket() errno = %d (%s)\n"));
                    if (sock.get() < 0)
                        return -1;
                }
                sa.sin6_scope_id = scopes[i];
                rc = connect_non_block(sock.get(), reinterpret_cast<sockaddr *>(&sa), sizeof sa);
            }
        } else {
            isns_connect_timeout = 3;
            rc = connect_non_block(sock.get(), reinterpret_cast<sockaddr *>(&sa), sizeof sa);
        }
    } else {
        _isns_tracef("isnsc: error: inet_type = %d not supported\n", family);
        return -1;
    }

    if (rc != 0)
        return -1;
    fcntl(sock.get(), F_SETFL, saved);
    *fd = sock.release();
    return 0;
}

int recv_pdu_header(int fd)
{
    return read_bounded(fd, isns_rsp_hdr, sizeof isns_rsp_hdr, current_deadline());
}

int recv_payload(int fd, unsigned char *dest, int len)
{
    if (!dest || len <= 0)
        return 0;
    return read_bounded(fd, dest, len, current_deadline());
}

int recv_response(int fd)
{
    struct scope {
        scope()
        {
            g_deadline = clock_type::now() + std::chrono::milliseconds(ISNS_RECV_DEADLINE_MS);
            g_in_response = true;
        }
        ~scope() { g_in_response = false; }
    } in_response;

    int total = 0;
    do {
        if (recv_pdu_header(fd) < static_cast<int>(sizeof isns_rsp_hdr))
            return 0;
        const int len = static_cast<int>(be16(isns_rsp_hdr + 4));
        if (total + len > ISNS_PDU_SIZE)
            return 0;
        if (recv_payload(fd, isns_pdu_buf + total, len) < len)
            return 0;
        total += len;
    } while (!(be16(isns_rsp_hdr + 6) & ISNS_FLAG_LAST_PDU));
    return total;
}

int send_and_recv(void)
{
    isns_last_status = 0;
    _isns_tracef("   send_and_recv()\nserver ip: %s\n", isns_server_addr);
    /* The emitter that refused the attribute has logged why. */
    if (isns_pdu_overflowed())
        return -1;
    const size_t total = isns_pdu_len();
    const size_t payload = total - ISNS_HDR_LEN;
    isns_pdu_buf[4] = static_cast<unsigned char>(payload >> 8);
    isns_pdu_buf[5] = static_cast<unsigned char>(payload);

    int raw = -1;
    if (isns_connect(&raw, isns_addr_family, isns_server_addr, ISNS_SERVER_PORT) != 0) {
        _isns_tracef("isnsc:   connect_non_block() error\n");
        return -1;
    }
    socket_fd sock(raw);
    /* Never blocks: a request (at most 10000 bytes) fits a fresh socket's
     * send buffer, and a server that stops reading must not hold us. */
    const ssize_t sent = send(sock.get(), isns_pdu_buf, total, MSG_NOSIGNAL | MSG_DONTWAIT);
    _isns_tracef("sent %d bytes\n", static_cast<int>(sent));

    const int n = recv_response(sock.get());
    _isns_tracef("received %d payload bytes\n", n);
    sock.reset();
    return _isns_response_status(n);
}

int _isns_response_status(int n)
{
    if (n < 4)
        return -1;
    isns_last_status = static_cast<int>((static_cast<uint32_t>(isns_pdu_buf[0]) << 24) |
                                        (static_cast<uint32_t>(isns_pdu_buf[1]) << 16) |
                                        (static_cast<uint32_t>(isns_pdu_buf[2]) << 8) | isns_pdu_buf[3]);
    _isns_tracef("status = %d\n", isns_last_status);
    return isns_last_status != 0 ? -1 : n;
}
