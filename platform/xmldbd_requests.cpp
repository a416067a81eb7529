// SPDX-License-Identifier: Apache-2.0
// What xmldbd's requests do to the tree and to its file: loading at start,
// saving into the allowed directories, dumps sized before they are built.
#include "platform/xmldb_file.h"
#include "platform/xmldbd_internal.h"

#include <cerrno>
#include <climits>
#include <csignal>
#include <cstdlib>
#include <cstring>
#include <dirent.h>
#include <sys/stat.h>
#include <unistd.h>

namespace xmldbd {

namespace {

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

}  // namespace

std::string parent_of(const std::string &p)
{
    size_t s = p.rfind('/');
    if (s == std::string::npos)
        return ".";
    return s == 0 ? "/" : p.substr(0, s);
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

}  // namespace xmldbd
