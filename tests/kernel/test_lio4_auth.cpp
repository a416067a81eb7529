// SPDX-License-Identifier: Apache-2.0
// CHAP settings: password lengths, names, and mutual CHAP only with one-way.
#include "tests/kernel/lio4_test.h"

namespace {

using Lio4Test = korv_test::Lio4Test;

TEST_F(Lio4Test, ChapPasswordLengthAndMutualOnlyWithOneWay)
{
    struct {
        int chap, mutual;
        const char *user, *pass, *muser, *mpass;
        int valid;
    } cases[] = {
        {1, 0, "user", "elevenchars", "", "", 0},
        {1, 0, "user", "twelve-chars", "", "", 1},
        {1, 0, "user", "sixteen-chars-xx", "", "", 1},
        {1, 0, "user", "seventeen-chars-x", "", "", 0},
        {1, 0, "", "twelve-chars", "", "", 0},
        {1, 1, "user", "twelve-chars", "muser", "short", 0},
        {1, 1, "user", "twelve-chars", "muser", "sixteen-chars-xx", 1},
        {1, 1, "user", "twelve-chars", "", "sixteen-chars-xx", 0},
        {0, 1, "", "", "", "short", 1},  // one-way off: mutual is not looked at
    };
    std::string log, each;
    for (auto &c : cases) {
        target.chap = c.chap;
        target.mutual_chap = c.mutual;
        set(target.chap_user, c.user);
        set(target.chap_pass, c.pass);
        set(target.mutual_user, c.muser);
        set(target.mutual_pass, c.mpass);
        EXPECT_EQ(korv_test::quiet([&] { return _lio3_validate_target_chap_settings(&target); }, &each), c.valid)
            << c.pass << " / " << c.mpass;
        log += each;
    }
    EXPECT_NE(log.find("(korvadm_mod_lio4:_lio3_validate_target_chap_settings:"), std::string::npos) << log;
    EXPECT_NE(log.find("CHAP enabled, but CHAP password length = 17 is not between 12 to 16"), std::string::npos);
}

}  // namespace
