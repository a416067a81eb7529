// SPDX-License-Identifier: Apache-2.0
// xmldbd's service loop: the lock and the socket, clients, their buffers and
// the budget for answers they have not read.
#include "platform/xmldb_file.h"
#include "platform/xmldbd_internal.h"

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <cstring>
#include <fcntl.h>
#include <poll.h>
#include <sys/file.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>
#include <utility>

namespace xmldbd {

namespace {

constexpr size_t kMaxClients = 256;
constexpr size_t kOutHigh = 256 * 1024;  // answers queued per client before its requests wait
constexpr size_t kKeepCapacity = 64 * 1024;  // a client's answer buffer kept after it drains

}  // namespace

// Two services starting at once on one socket both see it stale and both
// bind; the lock beside it decides which one serves. It is never removed:
// a removed lock file would let a third service lock a new one while the
// first still serves.
bool Service::take_lock()
{
    const std::string lock = opt_.socket + ".lock";
    xmldb::make_dirs(parent_of(opt_.socket));
    lock_fd_ = ::open(lock.c_str(), O_RDWR | O_CREAT | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC, 0600);
    struct stat st{};
    if (lock_fd_ < 0 || ::fstat(lock_fd_, &st) != 0 || !S_ISREG(st.st_mode)) {
        say("cannot use %s as the lock file: %s", lock.c_str(), lock_fd_ < 0 ? std::strerror(errno) : "not a regular file");
        return false;
    }
    if (::flock(lock_fd_, LOCK_EX | LOCK_NB) != 0) {
        if (errno == EWOULDBLOCK)
            say("another service already serves %s (it holds %s)", opt_.socket.c_str(), lock.c_str());
        else
            say("cannot lock %s: %s", lock.c_str(), std::strerror(errno));
        return false;
    }
    return true;
}

bool Service::listen_socket()
{
    sockaddr_un sa{};
    sa.sun_family = AF_UNIX;
    std::memcpy(sa.sun_path, opt_.socket.c_str(), opt_.socket.size() + 1);

    struct stat st{};
    if (::lstat(opt_.socket.c_str(), &st) == 0) {
        if (!S_ISSOCK(st.st_mode)) {
            say("%s exists and is not a socket", opt_.socket.c_str());
            return false;
        }
        ::unlink(opt_.socket.c_str());  // we hold the lock: left by a service that died
    }

    lfd_ = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
    if (lfd_ < 0) {
        say("socket: %s", std::strerror(errno));
        return false;
    }
    mode_t old = ::umask(077);  // never visible with wider permissions
    int rc = ::bind(lfd_, reinterpret_cast<sockaddr *>(&sa), sizeof sa);
    ::umask(old);
    if (rc != 0 || ::chmod(opt_.socket.c_str(), 0600) != 0 || ::listen(lfd_, 128) != 0) {
        say("cannot serve %s: %s", opt_.socket.c_str(), std::strerror(errno));
        return false;
    }
    if (::stat(opt_.socket.c_str(), &st) == 0)
        sock_ino_ = st.st_ino;
    return true;
}

void Service::accept_all()
{
    for (;;) {
        int fd = ::accept4(lfd_, nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK);
        if (fd < 0) {
            if (errno == EMFILE || errno == ENFILE || errno == ENOBUFS || errno == ENOMEM) {
                // The connection stays queued and the socket readable: polling
                // it again now would spin. Wait for a client to leave.
                static bool told = false;
                if (!std::exchange(told, true))
                    say("out of descriptors (%s); accepting again when a client leaves", std::strerror(errno));
                accept_paused_ = true;
            }
            return;
        }
        if (conns_.size() >= kMaxClients)
            evict_idlest();
        auto c = std::make_unique<Conn>();
        c->fd = fd;
        c->last_active = ++tick_;
        conns_.push_back(std::move(c));
    }
}

// Makes room by hanging up on the longest idle client: a library client
// reconnects on its next call, a hoarder loses its slot.
void Service::evict_idlest()
{
    auto lru = std::min_element(conns_.begin(), conns_.end(),
                                [](const auto &a, const auto &b) { return a->last_active < b->last_active; });
    close_conn(**lru);
    conns_.erase(lru);
}

void Service::close_conn(Conn &c)
{
    ::close(c.fd);
    c.fd = -1;
    pending_ -= c.out.size();
    std::string().swap(c.out);
    accept_paused_ = false;
}

// False when the connection is finished.
bool Service::read_conn(Conn &c)
{
    char buf[65536];
    ssize_t n = ::recv(c.fd, buf, sizeof buf, 0);
    if (n == 0)
        return false;
    if (n < 0)
        return errno == EAGAIN || errno == EWOULDBLOCK || errno == EINTR;
    c.in.append(buf, static_cast<size_t>(n));
    c.last_active = ++tick_;
    handle_frames(c);
    return true;
}

bool Service::write_conn(Conn &c)
{
    while (c.out_off < c.out.size()) {
        ssize_t n = ::send(c.fd, c.out.data() + c.out_off, c.out.size() - c.out_off, MSG_NOSIGNAL);
        if (n < 0)
            return errno == EAGAIN || errno == EWOULDBLOCK || errno == EINTR;
        c.out_off += static_cast<size_t>(n);
    }
    pending_ -= c.out.size();
    if (c.out.capacity() > kKeepCapacity)
        std::string().swap(c.out);  // a drained dump must not stay allocated
    c.out.clear();
    c.out_off = 0;
    return !c.closing;
}

void Service::handle_frames(Conn &c)
{
    size_t off = 0;
    // Answers queue up to a bound: a client that pipelines big requests
    // without reading gets no more work done until it drains its answers.
    while (!c.closing && !c.drop && c.out.size() < kOutHigh && c.in.size() - off >= xmldb::kHeaderSize) {
        const size_t held = c.out.size();
        uint32_t len = xmldb::load_be32(reinterpret_cast<const unsigned char *>(c.in.data() + off));
        if (len == 0 || len > xmldb::kRequestMax) {
            // The stream cannot be resynchronised: answer once, then hang up.
            xmldb::encode_answer(c.out, xmldb::kFail, "request length out of bounds");
            c.closing = true;
        } else if (c.in.size() - off - xmldb::kHeaderSize < len) {
            break;
        } else {
            std::string_view payload(c.in.data() + off + xmldb::kHeaderSize, len);
            xmldb::Request r{};
            if (xmldb::decode_request(payload, r))
                handle(r, c);
            else
                xmldb::encode_answer(c.out, xmldb::kFail, "malformed request");
            off += xmldb::kHeaderSize + len;
        }
        pending_ += c.out.size() - held;
        c.drop = c.drop || pending_ > kPendingMax;
    }
    c.in.erase(0, off);
}

int Service::run()
{
    if (opt_.socket.size() >= sizeof(sockaddr_un::sun_path)) {
        say("socket path too long for a Unix socket: %s", opt_.socket.c_str());
        return 1;
    }
    if (!take_lock() || !load_at_start())
        return 1;
    for (const auto &d : opt_.allow_dirs)
        xmldb::make_dirs(d);
    if (!listen_socket())
        return 1;
    if (opt_.ready_fd >= 0) {
        (void)!::write(opt_.ready_fd, "1", 1);
        ::close(opt_.ready_fd);
    }

    sigset_t unblocked;
    sigprocmask(SIG_SETMASK, nullptr, &unblocked);
    sigdelset(&unblocked, SIGTERM);
    sigdelset(&unblocked, SIGINT);

    std::vector<pollfd> pfds;
    while (!g_stop) {
        pfds.clear();
        pfds.push_back({lfd_, static_cast<short>(accept_paused_ ? 0 : POLLIN), 0});
        for (const auto &c : conns_) {
            // Read no more from a client until it has taken its answers.
            short ev = c->out.empty() ? POLLIN : POLLOUT;
            pfds.push_back({c->fd, ev, 0});
        }
        // Out of descriptors, a retry a second later also covers a limit
        // that lifts without any client of ours leaving.
        const timespec retry{1, 0};
        int n = ::ppoll(pfds.data(), pfds.size(), accept_paused_ ? &retry : nullptr, &unblocked);
        if (n < 0) {
            if (errno == EINTR)
                continue;
            // More clients than a since lowered descriptor limit: poll takes
            // none of them. Shed the idlest until the rest fit.
            rlimit rl{};
            if (errno == EINVAL && !conns_.empty() && ::getrlimit(RLIMIT_NOFILE, &rl) == 0 &&
                pfds.size() > rl.rlim_cur) {
                while (!conns_.empty() && conns_.size() + 1 > rl.rlim_cur)
                    evict_idlest();
                continue;
            }
            say("poll: %s", std::strerror(errno));
            break;
        }
        if (n == 0)
            accept_paused_ = false;
        for (size_t i = 1; i < pfds.size(); ++i) {
            Conn &c = *conns_[i - 1];
            bool keep = !c.drop;
            if (keep && pfds[i].revents & (POLLIN | POLLHUP | POLLERR)) {
                if (pfds[i].events & POLLIN)
                    keep = read_conn(c) && !c.drop;
                else if (pfds[i].revents & (POLLHUP | POLLERR))
                    keep = false;
            }
            if (keep && !c.out.empty())
                keep = write_conn(c);  // most answers go out at once
            if (keep && c.out.empty() && !c.in.empty()) {
                handle_frames(c);  // requests held back while answers were pending
                if (!c.drop && !c.out.empty())
                    keep = write_conn(c);
            }
            if (!keep || c.drop)
                close_conn(c);
        }
        std::erase_if(conns_, [](const auto &c) { return c->fd < 0; });
        if (pfds[0].revents & POLLIN)
            accept_all();
    }

    for (const auto &c : conns_)
        ::close(c->fd);
    struct stat st{};
    // Remove the socket only if it is still ours, not a successor's.
    if (::stat(opt_.socket.c_str(), &st) == 0 && st.st_ino == sock_ino_)
        ::unlink(opt_.socket.c_str());
    ::close(lfd_);
    return 0;
}

}  // namespace xmldbd
