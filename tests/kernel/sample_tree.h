// Builds a sample configfs tree (tests/kernel/data/*.tree) under the kernel
// tests' system root, with a target record naming its portal group.
#pragma once

#include <cstdio>
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
        set(target.iqn, "iqn.2026-01.test:t1");
        set(target.alias, "t1");
        target.tpgt = 1;
    }
    // Lines "d PATH" (a directory) and "f PATH TEXT" (a file); '#' comments.
    static void load_tree(const std::string &name)
    {
        std::ifstream in(std::string(KORV_KERNEL_DATA) + "/" + name);
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
                write_file(at(path), text);
        }
    }
    template <size_t N>
    static void set(char (&field)[N], const std::string &text)
    {
        std::snprintf(field, N, "%s", text.c_str());
    }

    static constexpr const char *TPG = "/sys/kernel/config/target/iscsi/iqn.2026-01.test:t1/tpgt_1";
    iscsi_target_t target;
};

}  // namespace korv_test
