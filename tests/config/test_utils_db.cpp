// SPDX-License-Identifier: Apache-2.0
// Typed database access and the number converters.
#include <climits>
#include <cstdlib>
#include <cstring>
#include <cerrno>
#include <functional>
#include <map>
#include <tuple>

#include "config/korvadm_utils_db.h"
#include "tests/config/store_fixture.h"
#include "tests/support/data_cases.h"

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
    char *end = nullptr;
    long l;
    uint64_t u;
    const std::map<std::string, std::function<std::string(const char *)>> convert = {
        {"u64", [&](const char *s) { return slash(convert_str_to_uint64_t(s, &u), u); }},
        {"dec_u64", [&](const char *s) { return slash(convert_dec_str_to_uint64_t(s, &end, &u), u, end); }},
        {"dec_l", [&](const char *s) { return slash(convert_dec_str_to_l(s, &end, &l), l, end); }},
        {"hex_l", [&](const char *s) { return slash(convert_hex_str_to_l(s, nullptr, &l), l); }}};
    const std::map<std::string, std::string> printed = {
        {"nothing", ""},
        {"no-digits", "No digits were found\n"},
        {"range", "strtoll: " + std::string(std::strerror(ERANGE)) + "\n"}};
    for (const auto &[call, want] : data_cases("converters.txt")) {
        const std::string fn = call.substr(0, call.find(' '));
        const std::string arg = call.substr(fn.size() + 2, call.size() - fn.size() - 3);  // inside the quotes
        std::string got;
        l = 5;
        u = 5;
        EXPECT_EQ(capture_stderr([&] { got = convert.at(fn)(arg.c_str()); }), printed.at(want.substr(want.rfind(' ') + 1)))
            << call;
        EXPECT_EQ(got, want.substr(0, want.rfind(' '))) << call;
    }
    EXPECT_EQ(logged([&] { return convert_dec_str_to_l(nullptr, &end, &l); }, "ERR_PARAM_ERROR"), ERR_PARAM);
    EXPECT_EQ(quiet([&] { return convert_hex_str_to_l("1", &end, nullptr); }), ERR_PARAM);
    EXPECT_EQ(quiet([&] { return convert_dec_str_to_uint64_t(nullptr, &end, &u); }), ERR_PARAM);
    EXPECT_EQ(quiet([&] { return convert_str_to_uint64_t(nullptr, &u); }), ERR_PARAM);
}
