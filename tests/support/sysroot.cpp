// SPDX-License-Identifier: Apache-2.0
// The temporary system root shared by every test of a process.
#include "tests/support/sysroot.h"

#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <sstream>

#include "common/korvadm_log.h"
#include "common/korvadm_sysroot.h"

namespace korv_test {

namespace fs = std::filesystem;

namespace {
pid_t g_root_owner = 0;
std::error_code ec_ignored;  // a test's files may already be gone

void remove_root_at_exit()
{
    // Forked children exit through here too: only the creator cleans up.
    if (::getpid() == g_root_owner)
        fs::remove_all(SysRoot::path(), ec_ignored);
}
}  // namespace

const std::string &SysRoot::path()
{
    // Leaked on purpose: the exit handler below needs it after static destructors.
    static const std::string &root = *new std::string([] {
        char tmpl[] = "/tmp/korv-root-XXXXXX";
        if (!::mkdtemp(tmpl)) {
            std::perror("mkdtemp");
            std::abort();
        }
        std::string r = tmpl;
        ::setenv(KORV_SYSROOT_ENV, r.c_str(), 1);
        if (r != sysroot_prefix()) {
            std::fprintf(stderr, "SysRoot: the system root was read before the test set it (\"%s\")\n",
                         sysroot_prefix());
            std::abort();
        }
        g_root_owner = ::getpid();
        std::atexit(remove_root_at_exit);
        return r;
    }());
    return root;
}

std::string SysRoot::file(const std::string &abs) { return path() + abs; }
void SysRoot::write(const std::string &abs, const std::string &content) { SysRootTest::write_file(file(abs), content); }
std::string SysRoot::read(const std::string &abs) { return SysRootTest::read_file(file(abs)); }
void SysRoot::mkdirs(const std::string &abs) { SysRootTest::mkdirs(file(abs)); }
void SysRoot::remove(const std::string &abs) { fs::remove_all(file(abs), ec_ignored); }

void SysRootTest::SetUp()
{
    for (const auto &entry : fs::directory_iterator(SysRoot::path(), ec_ignored))
        fs::remove_all(entry.path(), ec_ignored);
    g_korv_debug_level = 0;
}

void SysRootTest::mkdirs(const std::string &path) { fs::create_directories(path, ec_ignored); }

void SysRootTest::write_file(const std::string &path, const std::string &text)
{
    mkdirs(fs::path(path).parent_path());
    std::ofstream(path, std::ios::binary | std::ios::trunc) << text;
}

std::string SysRootTest::read_file(const std::string &path)
{
    // A /proc file whose process is reaped mid-read fails the read itself;
    // streaming the buffer turns that into failbit instead of a throw.
    std::ifstream in(path, std::ios::binary);
    std::ostringstream text;
    return in && text << in.rdbuf() ? text.str() : "";
}

bool SysRootTest::exists(const std::string &path) { return fs::exists(fs::symlink_status(path, ec_ignored)); }

}  // namespace korv_test
