// SPDX-License-Identifier: Apache-2.0
// Sample cases kept as data: lines "<input> => <expected>" of a file in the
// suite's data directory (KORV_TEST_DATA), "#" lines and empty ones skipped.
#pragma once

#include <fstream>
#include <string>
#include <utility>
#include <vector>

#include <gtest/gtest.h>

inline std::vector<std::pair<std::string, std::string>> data_cases(const std::string &name)
{
    std::ifstream in(std::string(KORV_TEST_DATA) + "/" + name);
    std::vector<std::pair<std::string, std::string>> out;
    for (std::string l; std::getline(in, l);)
        if (size_t at = l.find(" => "); !l.empty() && l[0] != '#')
            out.emplace_back(l.substr(0, at), at == std::string::npos ? "" : l.substr(at + 4));
    EXPECT_FALSE(out.empty()) << name;
    return out;
}
