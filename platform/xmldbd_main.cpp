// xmldbd: the configuration database service. One tree, one Unix socket, one
// thread; requests from every client are served one at a time in arrival order.
#include "common/korvadm_sysroot.h"
#include "platform/xmldb_file.h"
#include "platform/xmldb_proto.h"
#include "platform/xmldb_tree.h"
#include "platform/xmldbc.h"

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstdarg>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <dirent.h>
#include <fcntl.h>
#include <getopt.h>
#include <memory>
#include <poll.h>
#include <string>
#include <sys/file.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>
#include <utility>
#include <vector>

namespace {

constexpr size_t kMaxClients = 256;
constexpr size_t kOutHigh = 256 * 1024;  // answers queued per client before its requests wait
constexpr size_t kPendingMax = 64u << 20;  // answers held for all clients together
constexpr size_t kKeepCapacity = 64 * 1024;  // a client's answer buffer kept after it drains
constexpr const char *kDefaultAllowDir = "/etc/NAS_CFG";
constexpr const char *kDefaultLoad = "/etc/NAS_CFG/config.xml";

volatile sig_atomic_t g_stop = 0;

void on_stop(int) { g_stop = 1; }

void say(const char *fmt, ...) __attribute__((format(printf, 1, 2)));
void say(const char *fmt, ...)
{
    va_list ap;
    va_start(ap, fmt);
    std::fputs("xmldbd: ", stderr);
    std::vfprintf(stderr, fmt, ap);
    std::fputc('\n', stderr);
    va_end(ap);
}

struct Options {
    std::string socket;
    std::string load;
    bool empty = false;
    std::vector<std::string> allow_dirs;
    int ready_fd = -1;
};

void usage(FILE *to)
{
    std::fprintf(to,
        "usage: xmldbd [--socket PATH] [--load FILE | --empty] [--allow-dir DIR]... [--ready-fd N]\n"
        "Serves one configuration database tree on a Unix socket.\n"
        "  --socket PATH     socket to serve (default %s under the system root)\n"
        "  --load FILE       the saved tree to load at start (default %s under the\n"
        "                    system root); a missing file starts empty, a file that\n"
        "                    does not load stops the service\n"
        "  --empty           start with an empty tree, loading nothing\n"
        "  --allow-dir DIR   a directory clients may save into (repeatable;\n"
        "                    default %s under the system root)\n"
        "  --ready-fd N      write one byte to descriptor N and close it once serving\n"
        "Paths given here are used as they are. SIGTERM/SIGINT: finish the request\n"
        "in hand, remove the socket, exit 0.\n",
        XMLDB_SOCK_ISCSI, kDefaultLoad, kDefaultAllowDir);
}

// 0 parsed, 1 exit successfully (help), 2 usage error.
int parse_args(int argc, char **argv, Options &o)
{
    static const option longs[] = {
        {"socket", required_argument, nullptr, 's'},
        {"load", required_argument, nullptr, 'l'},
        {"empty", no_argument, nullptr, 'e'},
        {"allow-dir", required_argument, nullptr, 'a'},
        {"ready-fd", required_argument, nullptr, 'r'},
        {"help", no_argument, nullptr, 'h'},
        {nullptr, 0, nullptr, 0},
    };
    int c;
    while ((c = getopt_long(argc, argv, "s:l:ea:r:h", longs, nullptr)) != -1) {
        switch (c) {
        case 's': o.socket = optarg; break;
        case 'l': o.load = optarg; break;
        case 'e': o.empty = true; break;
        case 'a': o.allow_dirs.emplace_back(optarg); break;
        case 'r': {
            char *end = nullptr;
            long v = std::strtol(optarg, &end, 10);
            if (*optarg == '\0' || *end != '\0' || v < 0 || v > INT_MAX) {
                say("bad --ready-fd \"%s\"", optarg);
                return 2;
            }
            o.ready_fd = static_cast<int>(v);
            break;
        }
        case 'h': usage(stdout); return 1;
        default: usage(stderr); return 2;
        }
    }
    if (optind != argc) {
        say("unexpected argument \"%s\"", argv[optind]);
        usage(stderr);
        return 2;
    }
    if (o.empty && !o.load.empty()) {
        say("--load and --empty exclude each other");
        return 2;
    }
    if (o.socket.empty())
        o.socket = sysroot_path(XMLDB_SOCK_ISCSI);
    if (!o.empty && o.load.empty())
        o.load = sysroot_path(kDefaultLoad);
    if (o.allow_dirs.empty())
        o.allow_dirs.push_back(sysroot_path(kDefaultAllowDir));
    return 0;
}

std::string parent_of(const std::string &p)
{
    size_t s = p.rfind('/');
    if (s == std::string::npos)
        return ".";
    return s == 0 ? "/" : p.substr(0, s);
}

// Removes temporaries that saves of `file` left behind when their writer died.
void remove_stale_temporaries(const std::string &file)
{
    std::string dir = parent_of(file);
    std::string base = file.substr(file.rfind('/') + 1);
    DIR *d = ::opendir(dir.c_str());
    if (!d)
        return;
    while (dirent *e = ::readdir(d)) {
        long writer = 0;
        if (xmldb::is_temporary_of(base, e->d_name, &writer) && ::kill(static_cast<pid_t>(writer), 0) != 0 &&
            errno == ESRCH)
            ::unlinkat(::dirfd(d), e->d_name, 0);
    }
    ::closedir(d);
}

class Service {
public:
    explicit Service(Options o) : opt_(std::move(o)) {}
    int run();

private:
    struct Conn {
        int fd;
        std::string in;
        std::string out;
        size_t out_off = 0;
        bool closing = false;  // flush out, then close
        bool drop = false;     // over the answer budget: close at once
        uint64_t last_active = 0;
    };

    bool take_lock();
    bool load_at_start();
    bool listen_socket();
    void accept_all();
    void close_conn(Conn &c);
    bool read_conn(Conn &c);
    bool write_conn(Conn &c);
    void handle_frames(Conn &c);
    void handle(const xmldb::Request &r, Conn &c);
    void dump(std::string_view path, Conn &c);
    bool save_target(const std::string &file, std::string &resolved, std::string &err) const;

    Options opt_;
    xmldb::Tree tree_;
    int lock_fd_ = -1;  // held for the service's life, never closed
    int lfd_ = -1;
    ino_t sock_ino_ = 0;
    std::vector<std::unique_ptr<Conn>> conns_;
    size_t pending_ = 0;         // bytes of answers held for all clients
    bool accept_paused_ = false;  // out of descriptors: wait for a client to leave
    uint64_t tick_ = 0;
};

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

bool Service::load_at_start()
{
    if (opt_.empty)
        return true;
    std::string text, err;
    struct stat st{};
    if (::stat(opt_.load.c_str(), &st) != 0 && errno == ENOENT) {
        say("%s does not exist yet; starting with an empty tree", opt_.load.c_str());
    } else if (!xmldb::read_file(opt_.load, text, err) || !tree_.from_xml(text, err)) {
        // Starting empty would let the next save overwrite the operator's file.
        say("cannot load %s: %s", opt_.load.c_str(), err.c_str());
        return false;
    }
    remove_stale_temporaries(opt_.load);
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
        if (conns_.size() >= kMaxClients) {
            // Make room by hanging up on the longest idle client: a library
            // client reconnects on its next call, a hoarder loses its slot.
            auto lru = std::min_element(conns_.begin(), conns_.end(), [](const auto &a, const auto &b) {
                return a->last_active < b->last_active;
            });
            close_conn(**lru);
            conns_.erase(lru);
        }
        auto c = std::make_unique<Conn>();
        c->fd = fd;
        c->last_active = ++tick_;
        conns_.push_back(std::move(c));
    }
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

// Sized before it is built: neither an answer over the protocol's limit nor
// one over the budget for unread answers is ever made.
void Service::dump(std::string_view path, Conn &c)
{
    const size_t size = tree_.dump_size(path);
    if (size > xmldb::kAnswerMax) {
        xmldb::encode_answer(c.out, xmldb::kFail,
                             "the dump would exceed " + std::to_string(xmldb::kAnswerMax >> 20) + " MiB");
        return;
    }
    if (pending_ + xmldb::kHeaderSize + 1 + size > kPendingMax) {
        say("dropping a client: its answer would pass the %zu MiB held for unread answers", kPendingMax >> 20);
        c.drop = true;
        return;
    }
    c.out.reserve(c.out.size() + xmldb::kHeaderSize + 1 + size);
    xmldb::begin_answer(c.out, xmldb::kOk, size);
    tree_.dump(path, c.out);
}

// The file to write, its directory resolved: ".." and links cannot lead out
// of the allowed directories.
bool Service::save_target(const std::string &file, std::string &resolved, std::string &err) const
{
    if (file.empty() || file[0] != '/') {
        err = "file path must be absolute";
        return false;
    }
    std::string base = file.substr(file.rfind('/') + 1);
    if (base.empty() || base == "." || base == "..") {
        err = "file path names no file";
        return false;
    }
    char dir[PATH_MAX];
    if (!::realpath(parent_of(file).c_str(), dir)) {
        err = "cannot resolve " + parent_of(file) + ": " + std::strerror(errno);
        return false;
    }
    std::string d = dir;
    for (const auto &a : opt_.allow_dirs) {
        char ad[PATH_MAX];
        if (!::realpath(a.c_str(), ad))
            continue;
        std::string allowed = ad;
        if (d == allowed || allowed == "/" ||
            (d.size() > allowed.size() && d.compare(0, allowed.size(), allowed) == 0 && d[allowed.size()] == '/')) {
            resolved = (d == "/" ? "" : d) + "/" + base;
            return true;
        }
    }
    err = "saving outside the allowed directories is refused: " + file;
    return false;
}

void Service::handle(const xmldb::Request &r, Conn &c)
{
    using xmldb::Op;
    std::string err, &out = c.out;
    switch (r.op) {
    case Op::Get:
        xmldb::encode_answer(out, xmldb::kOk, tree_.get(r.path));
        return;
    case Op::Set:
        if (!tree_.set(r.path, r.value)) {
            xmldb::encode_answer(out, xmldb::kFail, "path names no node or is too deep");
            return;
        }
        xmldb::encode_answer(out, xmldb::kOk, {});
        return;
    case Op::Del:
        tree_.del(r.path);
        xmldb::encode_answer(out, xmldb::kOk, {});
        return;
    case Op::Dump:
        dump(r.path, c);
        return;
    case Op::Ping:
        xmldb::encode_answer(out, xmldb::kOk, "xmldbd");
        return;
    case Op::Save: {
        std::string file;
        if (!save_target(std::string(r.path), file, err) || !xmldb::write_file_atomic(file, tree_.to_xml(), err)) {
            say("save: %s", err.c_str());
            xmldb::encode_answer(out, xmldb::kFail, err);
            return;
        }
        xmldb::encode_answer(out, xmldb::kOk, {});
        return;
    }
    case Op::Load: {
        std::string text;
        if (!xmldb::read_file(std::string(r.path), text, err) || !tree_.from_xml(text, err)) {
            xmldb::encode_answer(out, xmldb::kFail, err);
            return;
        }
        xmldb::encode_answer(out, xmldb::kOk, {});
        return;
    }
    }
    xmldb::encode_answer(out, xmldb::kFail, "unknown operation");
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

}  // namespace

int main(int argc, char **argv)
{
    Options o;
    int rc = parse_args(argc, argv, o);
    if (rc != 0)
        return rc == 1 ? 0 : 2;

    struct sigaction sa{};
    sa.sa_handler = on_stop;
    sigemptyset(&sa.sa_mask);
    sigaction(SIGTERM, &sa, nullptr);
    sigaction(SIGINT, &sa, nullptr);
    signal(SIGPIPE, SIG_IGN);
    sigset_t block;
    sigemptyset(&block);
    sigaddset(&block, SIGTERM);
    sigaddset(&block, SIGINT);
    sigprocmask(SIG_BLOCK, &block, nullptr);  // delivered only inside ppoll

    return Service(std::move(o)).run();
}
