#include "tests/kernel/kernel_root.h"

#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <sstream>

#include "common/korvadm_log.h"
#include "common/korvadm_sysroot.h"

namespace fs = std::filesystem;

namespace korv_test {

namespace {
// Set up before any test runs, before anything reads the root.
struct root_env {
    std::string dir;
    root_env()
    {
        char tmpl[] = "/tmp/korv-kernel-XXXXXX";
        const char *d = mkdtemp(tmpl);
        dir = d ? d : "/tmp/korv-kernel-failed";
        setenv("NESRAD_SYSROOT", dir.c_str(), 1);
        std::string path = std::string(KORV_KERNEL_STANDINS) + ":" + (std::getenv("PATH") ? std::getenv("PATH") : "");
        setenv("PATH", path.c_str(), 1);
    }
    ~root_env()
    {
        std::error_code ec;
        fs::remove_all(dir, ec);
    }
};
root_env &env()
{
    static root_env e;
    return e;
}
// Created at start-up so that the root is in place before anything maps a path.
const root_env &g_env = env();
}  // namespace

const std::string &KernelRoot::root()
{
    return env().dir;
}

void KernelRoot::SetUp()
{
    ASSERT_EQ(std::string(sysroot_prefix()), root());
    std::error_code ec;
    for (const auto &entry : fs::directory_iterator(root(), ec))
        fs::remove_all(entry.path(), ec);
    mkdirs(at("/proc/self"));
    g_korv_debug_level = 0;
}

void KernelRoot::TearDown()
{
    g_korv_debug_level = 0;
}

void KernelRoot::write_file(const std::string &path, const std::string &text)
{
    mkdirs(fs::path(path).parent_path());
    std::ofstream(path, std::ios::binary) << text;
}

std::string KernelRoot::read_file(const std::string &path)
{
    std::ifstream in(path, std::ios::binary);
    std::stringstream ss;
    ss << in.rdbuf();
    return ss.str();
}

bool KernelRoot::exists(const std::string &path)
{
    struct stat st;
    return lstat(path.c_str(), &st) == 0;
}

void KernelRoot::mkdirs(const std::string &path)
{
    std::error_code ec;
    fs::create_directories(path, ec);
}

std::string KernelRoot::calls()
{
    return read_file(at("/calls.log"));
}

}  // namespace korv_test
