// A private system root for the kernel-driver and utility tests.
//
// The root is read once per process, so one temporary directory serves the
// whole test program; each test starts from an emptied root. The stand-in
// insmod/rmmod/mount scripts come first on PATH.
#pragma once

#include <string>

#include <gtest/gtest.h>

namespace korv_test {

class KernelRoot : public ::testing::Test {
protected:
    void SetUp() override;
    void TearDown() override;

    // The root directory, and root + abs.
    static const std::string &root();
    static std::string at(const std::string &abs) { return root() + abs; }

    // File helpers working on real paths (already under the root).
    static void write_file(const std::string &path, const std::string &text);
    static std::string read_file(const std::string &path);
    static bool exists(const std::string &path);
    static void mkdirs(const std::string &path);
    // Lines the stand-in commands recorded in <root>/calls.log.
    static std::string calls();
};

}  // namespace korv_test
