// SPDX-License-Identifier: Apache-2.0
// Typed database access and the number converters.
#include <climits>
#include <cstdlib>
#include <cstring>
#include <functional>
#include <string>

#include <gtest/gtest.h>

#include "common/korvadm_err.h"
#include "config/korvadm_utils_db.h"
#include "tests/config/store_fixture.h"
#include "tests/support/capture.h"

using korv_test::capture_stderr;
using korv_test::quiet;
using korv_test::StoreTest;

using TypedAccess = StoreTest;

TEST_F(TypedAccess, IntegerReadsFollowAtoiButRefuseEmptyOrAbsent)
{
    put("/t/empty", "");
    put("/t/mixed", "12abc");
    put("/t/word", "abc");
    put("/t/neg", "-42");
    const struct {
        const char *path;
        int rc;
        int32_t value;
    } cases[] = {{"/t/empty", ERR_INT_VALUE, 0}, {"/t/absent", ERR_INT_VALUE, 0}, {"/t/mixed", KORV_OK, 12},
                 {"/t/word", KORV_OK, 0}, {"/t/neg", KORV_OK, -42}};
    for (const auto &c : cases) {
        int32_t v = 77;
        EXPECT_EQ(xmldb_get_int32_t(&v, c.path), c.rc) << c.path;
        EXPECT_EQ(v, c.value) << c.path;
    }
    // The reader's own buffer is 128 bytes: a long number is cut, not overrun.
    put("/t/long", "7" + std::string(400, '0'));
    int32_t v = 0;
    EXPECT_EQ(xmldb_get_int32_t(&v, "/t/long"), KORV_OK);
    EXPECT_EQ(xmldb_get_int32_t(&v, ""), ERR_PARAM);
    EXPECT_EQ(xmldb_get_int32_t(&v, nullptr), ERR_PARAM);
    EXPECT_EQ(xmldb_set_int32_t(1, ""), ERR_PARAM);
}

TEST_F(TypedAccess, WritesRoundTripAndAnEmptyStringClears)
{
    EXPECT_EQ(xmldb_set_int32_t(INT32_MIN, "/t/i"), KORV_OK);
    EXPECT_EQ(xmldb_set_uint64_t(UINT64_MAX, "/t/u"), KORV_OK);
    EXPECT_EQ(raw("/t/i") + " " + raw("/t/u"), "-2147483648 18446744073709551615");
    uint64_t u = 0;
    EXPECT_EQ(xmldb_get_uint64_t(&u, "/t/u"), KORV_OK);
    EXPECT_EQ(u, UINT64_MAX);
    put("/t/huge", "18446744073709551616");
    u = 5;
    capture_stderr([&] { EXPECT_EQ(xmldb_get_uint64_t(&u, "/t/huge"), ERR_INT_VALUE); });
    EXPECT_EQ(u, 0u);

    EXPECT_EQ(xmldb_set_cstring("", "/t/i"), KORV_OK);
    int32_t v = 3;
    EXPECT_EQ(xmldb_get_int32_t(&v, "/t/i"), ERR_INT_VALUE);
    char buf[8] = "junk";
    EXPECT_EQ(xmldb_get_cstring(buf, sizeof buf, "/t/i"), KORV_OK);
    EXPECT_STREQ(buf, "");
    put("/t/big", std::string(300, 'x'));
    EXPECT_EQ(xmldb_get_cstring(buf, sizeof buf, "/t/big"), KORV_OK);
    EXPECT_STREQ(buf, "xxxxxxx");
    EXPECT_EQ(xmldb_set_cstring(nullptr, "/t/s"), ERR_PARAM);
    EXPECT_EQ(xmldb_get_cstring(buf, 0, "/t/s"), ERR_PARAM);

    put("/t/a/b/c", "1");
    EXPECT_EQ(xmldb_delete_node("/t/a"), KORV_OK);
    EXPECT_EQ(raw("/t/a/b/c"), "");
    EXPECT_EQ(xmldb_delete_node(nullptr), ERR_DB_WRITE);
}

TEST_F(TypedAccess, ADeadServiceIsAClientFailure)
{
    put("/t/i", "5");
    db().kill();
    int32_t v = 9;
    EXPECT_EQ(xmldb_get_int32_t(&v, "/t/i"), ERR_DB_CLIENT);
    EXPECT_EQ(v, 0);
    char buf[8];
    std::string out;
    EXPECT_EQ(quiet([&] { return xmldb_get_cstring(buf, sizeof buf, "/t/i"); }, &out), ERR_DB_CLIENT);
    EXPECT_NE(out.find("xmldbc_get path = /t/i failed"), std::string::npos) << out;
    EXPECT_EQ(quiet([&] { return xmldb_set_cstring("x", "/t/i"); }), ERR_DB_CLIENT);
    EXPECT_EQ(quiet([&] { return xmldb_delete_node("/t/i"); }), ERR_DB_WRITE);
}

TEST(StrNdup, CopiesAtMostMaxLenAndTerminates)
{
    for (auto [in, max, want] : {std::tuple{"abcdef", 3, "abc"}, {"ab", 10, "ab"}, {"ab", 0, ""}}) {
        char *s = str_ndup(in, max);
        ASSERT_NE(s, nullptr);
        EXPECT_STREQ(s, want);
        std::free(s);
    }
    EXPECT_EQ(str_ndup(nullptr, 4), nullptr);
}

TEST(Converters, AcceptTrailingTextAndReportWhereParsingStopped)
{
    const char *s = "0x10";
    char *end = nullptr;
    long l = 99;
    EXPECT_EQ(convert_dec_str_to_l(s, &end, &l), 0);
    EXPECT_EQ(l, 0);
    EXPECT_EQ(end, s + 1);
    EXPECT_EQ(convert_hex_str_to_l("ff", nullptr, &l), 0);
    EXPECT_EQ(l, 255);
    uint64_t u = 0;
    EXPECT_EQ(convert_dec_str_to_uint64_t("  123kb", &end, &u), 0);
    EXPECT_EQ(u, 123u);
    EXPECT_STREQ(end, "kb");
    EXPECT_EQ(convert_str_to_uint64_t("42 ", &u), 0);
    EXPECT_EQ(u, 42u);
    // Parsed signed: LLONG_MAX is the largest accepted even for the unsigned type.
    EXPECT_EQ(convert_dec_str_to_uint64_t("9223372036854775807", &end, &u), 0);
    EXPECT_EQ(u, static_cast<uint64_t>(LLONG_MAX));
}

TEST(Converters, MissingDigitsAndOverflowAreReportedOnStandardError)
{
    char *end = nullptr;
    long l = 0;
    uint64_t u = 5;
    const std::string none = "No digits were found\n";
    EXPECT_EQ(capture_stderr([&] { EXPECT_EQ(convert_hex_str_to_l("zz", &end, &l), -1); }), none);
    EXPECT_EQ(capture_stderr([&] { EXPECT_EQ(convert_str_to_uint64_t("", &u), 1); }), none);
    EXPECT_EQ(capture_stderr([&] { EXPECT_EQ(convert_dec_str_to_uint64_t("-", &end, &u), -1); }), none);

    // rc, and a "strtoll: ..." line from perror as the only output.
    auto perror_rc = [](const std::function<int()> &fn) {
        int rc = 0;
        std::string err = capture_stderr([&] { rc = fn(); });
        EXPECT_TRUE(err.rfind("strtoll: ", 0) == 0 && err.find('\n') == err.size() - 1) << err;
        return rc;
    };
    EXPECT_EQ(perror_rc([&] { return convert_dec_str_to_uint64_t("9223372036854775808", &end, &u); }), -1);
    EXPECT_EQ(perror_rc([&] { return convert_dec_str_to_l("-99999999999999999999", &end, &l); }), -1);
    EXPECT_EQ(perror_rc([&] { return convert_hex_str_to_l("fffffffffffffffff", &end, &l); }), -1);
    u = 5;
    EXPECT_EQ(perror_rc([&] { return convert_str_to_uint64_t("18446744073709551616", &u); }), 1);
    EXPECT_EQ(u, 0u);  // a failed unsigned conversion clears its result

    std::string out;
    EXPECT_EQ(quiet([&] { return convert_dec_str_to_l(nullptr, &end, &l); }, &out), ERR_PARAM);
    EXPECT_NE(out.find("ERR_PARAM_ERROR"), std::string::npos);
    EXPECT_EQ(quiet([&] { return convert_hex_str_to_l("1", &end, nullptr); }), ERR_PARAM);
    EXPECT_EQ(quiet([&] { return convert_dec_str_to_uint64_t(nullptr, &end, &u); }), ERR_PARAM);
    EXPECT_EQ(quiet([&] { return convert_str_to_uint64_t(nullptr, &u); }), ERR_PARAM);
}
