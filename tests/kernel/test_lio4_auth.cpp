// SPDX-License-Identifier: Apache-2.0
// CHAP settings: password lengths, names, and mutual CHAP only with one-way.
#include <sstream>

#include "tests/kernel/lio4_test.h"
#include "tests/support/data_cases.h"

namespace {

using Lio4Test = korv_test::Lio4Test;

TEST_F(Lio4Test, ChapPasswordLengthAndMutualOnlyWithOneWay)
{
    std::string log, each;
    for (const auto &[row, valid] : data_cases("chap_settings.txt")) {
        std::istringstream in(row);
        std::string text[4];
        in >> target.chap >> target.mutual_chap >> text[0] >> text[1] >> text[2] >> text[3];
        for (std::string &t : text)
            t = t == "-" ? "" : t;
        set(target.chap_user, text[0]);
        set(target.chap_pass, text[1]);
        set(target.mutual_user, text[2]);
        set(target.mutual_pass, text[3]);
        EXPECT_EQ(korv_test::quiet([&] { return _lio3_validate_target_chap_settings(&target); }, &each),
                  std::stoi(valid))
            << row;
        log += each;
    }
    EXPECT_NE(log.find("(korvadm_mod_lio4:_lio3_validate_target_chap_settings:"), std::string::npos) << log;
    EXPECT_NE(log.find("CHAP enabled, but CHAP password length = 17 is not between 12 to 16"), std::string::npos);
}

}  // namespace
