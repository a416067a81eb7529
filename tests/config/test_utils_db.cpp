// SPDX-License-Identifier: Apache-2.0
// Typed database access and the number converters.
#include <climits>
#include <cstdlib>
#include <cstring>
#include <cerrno>
#include <tuple>

#include "config/korvadm_utils_db.h"
#include "tests/config/store_fixture.h"

using namespace korv_test;

constexpr char kTyped[] = "typed.xml";
using TypedAccess = LoadedStore<kTyped>;

TEST_F(TypedAccess, IntegerReadsFollowAtoiButRefuseEmptyOrAbsent)
{
    const std::tuple<const char *, int, int32_t> cases[] = {
        {"/t/empty", ERR_INT_VALUE, 0}, {"/t/absent", ERR_INT_VALUE, 0}, {"/t/mixed", KORV_OK, 12},
        {"/t/word", KORV_OK, 0},        {"/t/neg", KORV_OK, -42}};
    int32_t v = 77;
    for (const auto &[path, rc, value] : cases)
        EXPECT_EQ(slash(xmldb_get_int32_t(&v, path), v), slash(rc, value)) << path;
    // The reader's own buffer is 128 bytes: a long number (data/typed.xml) is cut, not overrun.
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
    EXPECT_EQ(slash(xmldb_get_uint64_t(&u, "/t/u"), u), "0/18446744073709551615");
    // A value the converter refuses is no number at all, not a zero.
    capture_stderr([&] { EXPECT_EQ(slash(xmldb_get_uint64_t(&u, "/t/word"), u), slash(ERR_INT_VALUE, 0)); });

    EXPECT_EQ(xmldb_set_cstring("", "/t/i"), KORV_OK);
    int32_t v = 3;
    EXPECT_EQ(xmldb_get_int32_t(&v, "/t/i"), ERR_INT_VALUE);
    char buf[8] = "junk", big[8];
    EXPECT_EQ(slash(xmldb_get_cstring(buf, sizeof buf, "/t/i"), buf, xmldb_get_cstring(big, sizeof big, "/t/big"), big),
              "0//0/xxxxxxx");
    EXPECT_EQ(xmldb_set_cstring(nullptr, "/t/s"), ERR_PARAM);
    EXPECT_EQ(xmldb_get_cstring(buf, 0, "/t/s"), ERR_PARAM);

    // Deleting a subtree is checked by every delete of the store's lists.
    EXPECT_EQ(xmldb_delete_node(nullptr), ERR_DB_WRITE);
}

TEST_F(TypedAccess, ADeadServiceIsAClientFailure)
{
    put("/t/i", "5");
    db().kill();
    int32_t v = 9;
    EXPECT_EQ(slash(xmldb_get_int32_t(&v, "/t/i"), v), slash(ERR_DB_CLIENT, 0));
    char buf[8];
    EXPECT_EQ(logged([&] { return xmldb_get_cstring(buf, sizeof buf, "/t/i"); }, "xmldbc_get path = /t/i failed"),
              ERR_DB_CLIENT);
    EXPECT_EQ(quiet([&] { return xmldb_set_cstring("x", "/t/i"); }), ERR_DB_CLIENT);
    EXPECT_EQ(quiet([&] { return xmldb_delete_node("/t/i"); }), ERR_DB_WRITE);
}

TEST(StrNdup, CopiesAtMostMaxLenAndTerminates)
{
    for (auto [in, max, want] : {std::tuple{"abcdef", 3, "abc"}, {"ab", 10, "ab"}, {"ab", 0, ""}}) {
        korv::c_buffer s(str_ndup(in, max));
        EXPECT_STREQ(s.get(), want);
    }
    EXPECT_EQ(str_ndup(nullptr, 4), nullptr);
}

TEST(Converters, AcceptTrailingTextAndReportFailuresOnStandardError)
{
    // Each call as "result/value[/text left]", and what it printed on
    // standard error: nothing, the no-digits line, or perror's line.
    static char *end;
    static long l;
    static uint64_t u;
    const std::string none = "No digits were found\n", range = "strtoll: " + std::string(std::strerror(ERANGE)) + "\n";
    const std::tuple<std::string (*)(), const char *, std::string> cases[] = {
        {[] { return slash(convert_dec_str_to_l("0x10", &end, &l), l, end); }, "0/0/x10", {}},
        {[] { return slash(convert_hex_str_to_l("ff", nullptr, &l), l); }, "0/255", {}},
        {[] { return slash(convert_dec_str_to_uint64_t("  123kb", &end, &u), u, end); }, "0/123/kb", {}},
        {[] { return slash(convert_str_to_uint64_t("42 ", &u), u); }, "0/42", {}},
        // Parsed signed: LLONG_MAX is the largest accepted even for the unsigned type.
        {[] { return slash(convert_dec_str_to_uint64_t("9223372036854775807", &end, &u), u); },
         "0/9223372036854775807", {}},
        {[] { return slash(convert_hex_str_to_l("zz", &end, &l)); }, "-1", none},
        {[] { return slash(convert_str_to_uint64_t("", &u)); }, "1", none},
        {[] { return slash(convert_dec_str_to_uint64_t("-", &end, &u)); }, "-1", none},
        {[] { return slash(convert_dec_str_to_uint64_t("9223372036854775808", &end, &u)); }, "-1", range},
        {[] { return slash(convert_dec_str_to_l("-99999999999999999999", &end, &l)); }, "-1", range},
        {[] { return slash(convert_hex_str_to_l("fffffffffffffffff", &end, &l)); }, "-1", range},
        {[] {
             u = 5;  // a failed unsigned conversion clears its result
             return slash(convert_str_to_uint64_t("18446744073709551616", &u), u);
         },
         "1/0", range},
    };
    for (const auto &[call, want, err] : cases) {
        std::string got;
        auto run = call;  // clang 14 cannot capture a structured binding
        EXPECT_EQ(capture_stderr([&] { got = run(); }), err) << want;
        EXPECT_EQ(got, want);
    }
    EXPECT_EQ(logged([] { return convert_dec_str_to_l(nullptr, &end, &l); }, "ERR_PARAM_ERROR"), ERR_PARAM);
    EXPECT_EQ(quiet([] { return convert_hex_str_to_l("1", &end, nullptr); }), ERR_PARAM);
    EXPECT_EQ(quiet([] { return convert_dec_str_to_uint64_t(nullptr, &end, &u); }), ERR_PARAM);
    EXPECT_EQ(quiet([] { return convert_str_to_uint64_t(nullptr, &u); }), ERR_PARAM);
}
