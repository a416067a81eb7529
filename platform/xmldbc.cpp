// SPDX-License-Identifier: Apache-2.0
// Client library of the configuration database service: the xmldbc_* calls
// over a cached, deadline-bound connection per socket.
#include "platform/xmldbc.h"

#include "common/korvadm_log.h"
#include "common/korvadm_sysroot.h"
#include "platform/xmldb_client.h"

#include <cerrno>
#include <cstring>
#include <map>
#include <mutex>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

namespace xmldb {

namespace {

struct Cached {
    int fd = -1;
    pid_t owner = 0;  // a child after fork must not share its parent's stream
};

std::mutex g_mu;
std::map<std::string, Cached, std::less<>> g_conns;

void drop(Cached &c)
{
    if (c.fd >= 0)
        ::close(c.fd);
    c.fd = -1;
}

int connect_to(const std::string &path, std::string &why)
{
    sockaddr_un sa{};
    sa.sun_family = AF_UNIX;
    if (path.size() >= sizeof sa.sun_path) {
        why = "socket path too long: " + path;
        return -1;
    }
    std::memcpy(sa.sun_path, path.c_str(), path.size() + 1);
    // Non-blocking: a service whose backlog is full fails at once instead of hanging.
    int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
    if (fd < 0) {
        why = std::string("socket: ") + std::strerror(errno);
        return -1;
    }
    if (::connect(fd, reinterpret_cast<sockaddr *>(&sa), sizeof sa) != 0) {
        why = "cannot connect to " + path + ": " + std::strerror(errno);
        ::close(fd);
        return -1;
    }
    return fd;
}

// One request/answer exchange on fd. False on any transport failure.
bool exchange(int fd, const std::string &frame, std::string &status_and_data, Clock::time_point deadline,
              std::string &why)
{
    if (!send_all(fd, frame.data(), frame.size(), deadline)) {
        why = "cannot send the request";
        return false;
    }
    unsigned char hdr[kHeaderSize];
    if (!recv_all(fd, hdr, sizeof hdr, deadline)) {
        why = Clock::now() >= deadline ? "no answer in time" : "connection closed by the service";
        return false;
    }
    uint32_t len = load_be32(hdr);
    if (len == 0 || len > kAnswerMax + 1) {
        why = "malformed answer";
        return false;
    }
    status_and_data.resize(len);
    if (!recv_all(fd, status_and_data.data(), len, deadline)) {
        why = "answer cut short";
        return false;
    }
    return true;
}

}  // namespace

bool map_socket(const char *sock, std::string &mapped, std::string &why)
{
    char buf[sizeof(sockaddr_un::sun_path)];
    if (!sock || sock[0] != '/') {
        why = "socket path must be absolute";
        return false;
    }
    if (sysroot_map(sock, buf, sizeof buf) < 0) {
        why = std::string("socket path too long for a Unix socket: ") + sysroot_prefix() + sock;
        return false;
    }
    mapped = buf;
    return true;
}

CallResult call(const std::string &mapped_sock, Op op, std::string_view path, std::string_view value,
                std::string &data)
{
    if (path.size() > kPathMax || value.size() > kValueMax) {
        data = "path or value over the protocol's limits";
        return CallResult::Refused;
    }
    std::string frame;
    encode_request(frame, op, path, value);
    const auto deadline = Clock::now() + kCallTimeout;

    std::lock_guard<std::mutex> lock(g_mu);
    auto it = g_conns.find(mapped_sock);
    if (it == g_conns.end())
        it = g_conns.emplace(mapped_sock, Cached{}).first;
    Cached &c = it->second;
    if (c.fd >= 0 && c.owner != ::getpid())
        drop(c);

    std::string answer, why;
    // A reused connection may belong to a service that has since restarted:
    // then one fresh attempt follows. Every request is idempotent.
    for (int attempt = 0; attempt < 2; ++attempt) {
        bool reused = c.fd >= 0;
        if (!reused) {
            c.fd = connect_to(mapped_sock, why);
            c.owner = ::getpid();
            if (c.fd < 0)
                break;
        }
        if (exchange(c.fd, frame, answer, deadline, why)) {
            data.assign(answer, 1);
            return answer[0] == kOk ? CallResult::Ok : CallResult::Refused;
        }
        drop(c);
        if (!reused || Clock::now() >= deadline)
            break;
    }
    data = why;
    return CallResult::Unreachable;
}

}  // namespace xmldb

namespace {

// Runs one call on a fixed socket path; logs transport failures.
xmldb::CallResult do_call(const char *sock, xmldb::Op op, const char *path, const char *value, std::string &data)
{
    std::string mapped;
    if (!xmldb::map_socket(sock, mapped, data)) {
        DBG(0, "%s", data.c_str());
        return xmldb::CallResult::Unreachable;
    }
    auto r = xmldb::call(mapped, op, path, value ? value : "", data);
    if (r == xmldb::CallResult::Unreachable)
        DBG(1, "%s", data.c_str());
    return r;
}

}  // namespace

extern "C" int xmldbc_get_wb(const char *sock, int flags, const char *path, char *buf, size_t size)
{
    (void)flags;
    if (!buf || size == 0)
        return -1;
    buf[0] = '\0';
    if (!path || path[0] != '/')
        return -1;
    std::string data;
    if (do_call(sock, xmldb::Op::Get, path, nullptr, data) != xmldb::CallResult::Ok)
        return -1;
    size_t n = data.size() < size - 1 ? data.size() : size - 1;
    std::memcpy(buf, data.data(), n);
    buf[n] = '\0';
    return static_cast<int>(data.size() + 1);
}

extern "C" int xmldbc_set(const char *sock, int flags, const char *path, const char *value)
{
    (void)flags;
    if (!path || path[0] != '/' || !value)
        return -1;
    std::string data;
    return do_call(sock, xmldb::Op::Set, path, value, data) == xmldb::CallResult::Ok ? 0 : -1;
}

extern "C" int xmldbc_del(const char *sock, int flags, const char *path)
{
    (void)flags;
    if (!path || path[0] != '/')
        return -1;
    std::string data;
    return do_call(sock, xmldb::Op::Del, path, nullptr, data) == xmldb::CallResult::Ok ? 0 : -1;
}

extern "C" int xml_write_file(const char *file_path)
{
    if (!file_path || file_path[0] != '/')
        return -1;
    std::string file = sysroot_path(file_path);
    std::string data;
    if (do_call(XMLDB_SOCK_ISCSI, xmldb::Op::Save, file.c_str(), nullptr, data) != xmldb::CallResult::Ok) {
        DBG(0, "saving %s failed: %s", file.c_str(), data.c_str());
        return -1;
    }
    return 0;
}
