// SPDX-License-Identifier: Apache-2.0
// Whole-file reads and atomic whole-file writes.
#include "platform/xmldb_file.h"

#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <sys/random.h>
#include <sys/stat.h>
#include <unistd.h>

namespace xmldb {

namespace {

// Closes a descriptor on every path.
struct Fd {
    int fd = -1;
    explicit Fd(int f) : fd(f) {}
    ~Fd() { if (fd >= 0) ::close(fd); }
    Fd(const Fd &) = delete;
    Fd &operator=(const Fd &) = delete;
};

std::string errno_text(const std::string &what, const std::string &path)
{
    return what + " " + path + ": " + std::strerror(errno);
}

std::string too_big(const std::string &path)
{
    return path + " is over the " + std::to_string(kFileMax >> 20) + " MiB a configuration file may hold";
}

// A temporary name nobody can guess in advance, so nothing can be planted there.
bool temporary_name(const std::string &base, std::string &name)
{
    unsigned char r[8];
    if (::getrandom(r, sizeof r, 0) != static_cast<ssize_t>(sizeof r))
        return false;
    static const char hex[] = "0123456789abcdef";
    name = base + ".tmp." + std::to_string(::getpid()) + ".";
    for (unsigned char c : r) {
        name += hex[c >> 4];
        name += hex[c & 15];
    }
    return true;
}

bool write_all(int fd, std::string_view content)
{
    for (size_t done = 0; done < content.size();) {
        ssize_t n = ::write(fd, content.data() + done, content.size() - done);
        if (n < 0 && errno == EINTR)
            continue;
        if (n <= 0)
            return false;
        done += static_cast<size_t>(n);
    }
    return true;
}

}  // namespace

bool read_file(const std::string &path, std::string &out, std::string &err)
{
    // Checked before opening too: opening a device can have effects of its own.
    struct stat st{};
    if (::stat(path.c_str(), &st) == 0 && !S_ISREG(st.st_mode)) {
        err = path + " is not a regular file";
        return false;
    }
    Fd f(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY));
    if (f.fd < 0) {
        err = errno_text("cannot open", path);
        return false;
    }
    if (::fstat(f.fd, &st) != 0 || !S_ISREG(st.st_mode)) {
        err = path + " is not a regular file";
        return false;
    }
    if (static_cast<unsigned long long>(st.st_size) > kFileMax) {
        err = too_big(path);
        return false;
    }
    out.clear();
    out.reserve(static_cast<size_t>(st.st_size));
    // A page: the daemon reads its small files through here, and its stack
    // keeps every page it ever touched for as long as it runs.
    char buf[4096];
    for (;;) {
        ssize_t n = ::read(f.fd, buf, sizeof buf);
        if (n == 0)
            return true;
        if (n < 0) {
            if (errno == EINTR)
                continue;
            err = errno_text("cannot read", path);
            return false;
        }
        out.append(buf, static_cast<size_t>(n));
        if (out.size() > kFileMax) {  // grew while being read
            err = too_big(path);
            return false;
        }
    }
}

bool write_file_atomic(const std::string &path, std::string_view content, std::string &err)
{
    if (content.size() > kFileMax) {
        err = too_big(path);
        return false;
    }
    size_t slash = path.rfind('/');
    std::string dir = slash == std::string::npos ? "." : (slash == 0 ? "/" : path.substr(0, slash));
    std::string base = slash == std::string::npos ? path : path.substr(slash + 1);
    // Everything below is relative to this one directory, so the temporary
    // and the rename cannot end up anywhere else.
    Fd d(::open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (d.fd < 0) {
        err = errno_text("cannot open directory", dir);
        return false;
    }
    struct stat st{};
    if (::fstatat(d.fd, base.c_str(), &st, AT_SYMLINK_NOFOLLOW) == 0 && !S_ISREG(st.st_mode) &&
        !S_ISLNK(st.st_mode)) {
        err = path + " is not a regular file";
        return false;
    }
    std::string tmp;
    int fd = -1;
    for (int attempt = 0; fd < 0 && attempt < 8; ++attempt) {
        if (!temporary_name(base, tmp)) {
            err = "no random bytes for a temporary name: " + std::string(std::strerror(errno));
            return false;
        }
        fd = ::openat(d.fd, tmp.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0600);
        if (fd < 0 && errno != EEXIST)
            break;
    }
    if (fd < 0) {
        err = errno_text("cannot create", dir + "/" + tmp);
        return false;
    }
    {
        Fd f(fd);
        const char *failed = !write_all(fd, content) ? "cannot write" : ::fsync(fd) != 0 ? "cannot sync" : nullptr;
        if (failed) {
            err = errno_text(failed, dir + "/" + tmp);
            ::unlinkat(d.fd, tmp.c_str(), 0);
            return false;
        }
    }
    if (::renameat(d.fd, tmp.c_str(), d.fd, base.c_str()) != 0) {
        err = errno_text("cannot rename onto", path);
        ::unlinkat(d.fd, tmp.c_str(), 0);
        return false;
    }
    ::fsync(d.fd);  // makes the rename itself durable
    return true;
}

bool is_temporary_of(std::string_view base, std::string_view name, long *writer)
{
    constexpr std::string_view kTmp = ".tmp.";
    if (name.size() <= base.size() + kTmp.size() || name.substr(0, base.size()) != base ||
        name.substr(base.size(), kTmp.size()) != kTmp)
        return false;
    std::string_view rest = name.substr(base.size() + kTmp.size());
    size_t dot = rest.find('.');
    std::string_view pid = rest.substr(0, dot), random = dot == std::string_view::npos ? "" : rest.substr(dot + 1);
    if (pid.empty() || pid.size() > 9 || pid.find_first_not_of("0123456789") != std::string_view::npos ||
        random.size() != 16 || random.find_first_not_of("0123456789abcdef") != std::string_view::npos)
        return false;
    *writer = std::stol(std::string(pid));
    return true;
}

bool make_dirs(const std::string &dir)
{
    for (size_t i = 1; i <= dir.size(); ++i)
        if (i == dir.size() || dir[i] == '/')
            ::mkdir(dir.substr(0, i).c_str(), 0755);
    struct stat st{};
    return ::stat(dir.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}

}  // namespace xmldb
