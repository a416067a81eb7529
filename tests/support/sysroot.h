// SPDX-License-Identifier: Apache-2.0
// The one temporary system root of a test process.
//
// The library reads NESRAD_SYSROOT once per process, so one mkdtemp
// directory serves the whole test program; it is created and exported on
// first use (before any code maps a system path: use SysRoot::path() or a
// SysRootTest first) and removed at exit. SysRoot's functions take fixed
// system paths ("/proc/modules"); SysRootTest's take real paths, as the
// library's path helpers do (at() maps one).
#pragma once

#include <string>

#include <gtest/gtest.h>

namespace korv_test {

class SysRoot {
public:
    // The root directory. Fails the process loudly if the library had
    // already read another root.
    static const std::string &path();
    // root + abs (abs starts with '/').
    static std::string file(const std::string &abs);
    // Writes content to root + abs, creating parent directories.
    static void write(const std::string &abs, const std::string &content);
    // Contents of root + abs ("" when unreadable).
    static std::string read(const std::string &abs);
    // Creates root + abs and its parents as directories.
    static void mkdirs(const std::string &abs);
    // Removes root + abs recursively (nothing when absent).
    static void remove(const std::string &abs);
};

// A test whose every case starts from an emptied root and debug level 0.
class SysRootTest : public ::testing::Test {
protected:
    void SetUp() override;

    static const std::string &root() { return SysRoot::path(); }
    static std::string at(const std::string &abs) { return SysRoot::file(abs); }

public:
    // On real paths (any, also outside the root): directories with their
    // parents; a file with its parents; a file's contents ("" when
    // unreadable); existence (links count, dangling or not).
    static void mkdirs(const std::string &path);
    static void write_file(const std::string &path, const std::string &text);
    static std::string read_file(const std::string &path);
    static bool exists(const std::string &path);
};

}  // namespace korv_test
