// SPDX-License-Identifier: Apache-2.0
// Builds a sample configfs tree (tests/kernel/data/*.tree) under the kernel
// tests' system root, with a target record naming its portal group. The one
// fixture of the LIO back end's host tests.
#pragma once

#include <unistd.h>

#include <cstdio>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>

#include "kernel/korvadm_mod.h"
#include "tests/support/sysroot.h"

namespace korv_test {

class SampleTree : public SysRootTest {
protected:
    void SetUp() override
    {
        SysRootTest::SetUp();
        target = {};
        set(target.iqn, IQN);
        set(target.alias, "t1");
        target.tpgt = 1;
    }
    void TearDown() override
    {
        iscsi_ip_free_list(&target.ip_list);
        SysRootTest::TearDown();
    }
    // Lines "d PATH" (a directory), "f PATH TEXT" (a file, "\n" for a line
    // end) and "l PATH TARGET" (a symbolic link to TARGET in the root), with
    // parents made as needed; '#' comments.
    static void load_tree(const std::string &name)
    {
        std::ifstream in(std::string(KORV_TEST_DATA) + "/" + name);
        ASSERT_TRUE(in) << name;
        std::string line;
        while (std::getline(in, line)) {
            std::istringstream words(line);
            std::string kind, path, text;
            words >> kind >> path;
            std::getline(words >> std::ws, text);
            if (kind == "d")
                mkdirs(at(path));
            else if (kind == "f")
                write_file(at(path), unescape(text));
            else if (kind == "l") {
                mkdirs(std::filesystem::path(at(path)).parent_path());
                ASSERT_EQ(symlink(at(text).c_str(), at(path).c_str()), 0) << line;
            }
        }
    }
    static std::string unescape(std::string text)
    {
        for (size_t nl; (nl = text.find("\\n")) != std::string::npos;)
            text.replace(nl, 2, "\n");
        return text;
    }
    template <size_t N>
    static void set(char (&field)[N], const std::string &text)
    {
        std::snprintf(field, N, "%s", text.c_str());
    }

    static constexpr const char *IQN = "iqn.2026-01.test:t1";
    static constexpr const char *TPG = "/sys/kernel/config/target/iscsi/iqn.2026-01.test:t1/tpgt_1";
    iscsi_target_t target;
};

}  // namespace korv_test
