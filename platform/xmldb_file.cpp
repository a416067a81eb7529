// Whole-file reads and atomic whole-file writes.
#include "platform/xmldb_file.h"

#include <cerrno>
#include <cstring>
#include <fcntl.h>
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

}  // namespace

bool read_file(const std::string &path, std::string &out, std::string &err)
{
    Fd f(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
    if (f.fd < 0) {
        err = errno_text("cannot open", path);
        return false;
    }
    out.clear();
    char buf[65536];
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
    }
}

bool write_file_atomic(const std::string &path, std::string_view content, std::string &err)
{
    size_t slash = path.rfind('/');
    std::string dir = slash == std::string::npos ? "." : (slash == 0 ? "/" : path.substr(0, slash));
    // The pid keeps two writers of the same file from sharing a temporary.
    std::string tmp = path + ".tmp." + std::to_string(::getpid());
    {
        Fd f(::open(tmp.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644));
        if (f.fd < 0) {
            err = errno_text("cannot create", tmp);
            return false;
        }
        const char *p = content.data();
        size_t left = content.size();
        while (left > 0) {
            ssize_t n = ::write(f.fd, p, left);
            if (n < 0 && errno == EINTR)
                continue;
            if (n <= 0) {
                err = errno_text("cannot write", tmp);
                ::unlink(tmp.c_str());
                return false;
            }
            p += n;
            left -= static_cast<size_t>(n);
        }
        if (::fsync(f.fd) != 0) {
            err = errno_text("cannot sync", tmp);
            ::unlink(tmp.c_str());
            return false;
        }
    }
    if (::rename(tmp.c_str(), path.c_str()) != 0) {
        err = errno_text("cannot rename onto", path);
        ::unlink(tmp.c_str());
        return false;
    }
    // Make the rename itself durable.
    Fd d(::open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (d.fd >= 0)
        ::fsync(d.fd);
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
