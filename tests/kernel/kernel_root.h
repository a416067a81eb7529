// A private system root for the kernel-driver and utility tests.
//
// The root is read once per process, so one temporary directory serves the
// whole test program; each test starts from an emptied root. The stand-in
// insmod/rmmod/mount scripts come first on PATH and log to <root>/calls.log.
#pragma once

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>

#include <gtest/gtest.h>

#include "common/korvadm_log.h"
#include "common/korvadm_sysroot.h"

namespace korv_test {

namespace kernel_root_detail {
struct root_env {
    std::string dir;
    root_env()
    {
        char tmpl[] = "/tmp/korv-kernel-XXXXXX";
        const char *d = mkdtemp(tmpl);
        dir = d ? d : "/tmp/korv-kernel-failed";
        setenv("NESRAD_SYSROOT", dir.c_str(), 1);
        const char *path = std::getenv("PATH");
        setenv("PATH", (std::string(KORV_KERNEL_STANDINS) + ":" + (path ? path : "")).c_str(), 1);
    }
    ~root_env()
    {
        std::error_code ec;
        std::filesystem::remove_all(dir, ec);
    }
};
// Built at start-up, before any test maps a path through the root.
inline root_env g_env;
}  // namespace kernel_root_detail

class KernelRoot : public ::testing::Test {
protected:
    void SetUp() override
    {
        ASSERT_EQ(std::string(sysroot_prefix()), root());
        std::error_code ec;
        for (const auto &entry : std::filesystem::directory_iterator(root(), ec))
            std::filesystem::remove_all(entry.path(), ec);
        mkdirs(at("/proc/self"));
        g_korv_debug_level = 0;
    }

    static const std::string &root() { return kernel_root_detail::g_env.dir; }
    static std::string at(const std::string &abs) { return root() + abs; }

    // Helpers on real paths (already under the root).
    static void mkdirs(const std::string &path)
    {
        std::error_code ec;
        std::filesystem::create_directories(path, ec);
    }
    static void write_file(const std::string &path, const std::string &text)  // parents too
    {
        mkdirs(std::filesystem::path(path).parent_path());
        std::ofstream(path, std::ios::binary) << text;
    }
    static std::string read_file(const std::string &path)
    {
        std::stringstream ss;
        ss << std::ifstream(path, std::ios::binary).rdbuf();
        return ss.str();
    }
    static bool exists(const std::string &path)  // links count, dangling or not
    {
        std::error_code ec;
        return std::filesystem::exists(std::filesystem::symlink_status(path, ec));
    }
};

}  // namespace korv_test
