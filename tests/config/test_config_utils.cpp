// Typed database access and the number converters.
#include <unistd.h>

#include <climits>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <functional>
#include <string>

#include <gtest/gtest.h>

#include "common/korvadm_err.h"
#include "config/korvadm_utils.h"
#include "tests/config/store_fixture.h"
#include "tests/support/capture.h"

using korv_test::StoreTest;

namespace {

std::string capture_stderr(const std::function<void()> &fn)
{
    std::fflush(stderr);
    std::FILE *tmp = std::tmpfile();
    int saved = dup(STDERR_FILENO);
    dup2(fileno(tmp), STDERR_FILENO);
    fn();
    std::fflush(stderr);
    dup2(saved, STDERR_FILENO);
    close(saved);
    std::string out;
    std::rewind(tmp);
    char buf[512];
    size_t n;
    while ((n = std::fread(buf, 1, sizeof buf, tmp)) > 0)
        out.append(buf, n);
    std::fclose(tmp);
    return out;
}

}  // namespace

using TypedAccess = StoreTest;

TEST_F(TypedAccess, IntegerReadsFollowAtoiButRefuseEmpty)
{
    int32_t v = 77;
    put("/t/empty", "");
    EXPECT_EQ(xmldb_get_int32_t(&v, "/t/empty"), ERR_INT_VALUE);
    EXPECT_EQ(v, 0);

    v = 77;
    EXPECT_EQ(xmldb_get_int32_t(&v, "/t/absent"), ERR_INT_VALUE);
    EXPECT_EQ(v, 0);

    put("/t/mixed", "12abc");
    EXPECT_EQ(xmldb_get_int32_t(&v, "/t/mixed"), KORV_OK);
    EXPECT_EQ(v, 12);

    put("/t/word", "abc");
    v = 77;
    EXPECT_EQ(xmldb_get_int32_t(&v, "/t/word"), KORV_OK);
    EXPECT_EQ(v, 0);

    put("/t/neg", "-42");
    EXPECT_EQ(xmldb_get_int32_t(&v, "/t/neg"), KORV_OK);
    EXPECT_EQ(v, -42);

    EXPECT_EQ(xmldb_get_int32_t(&v, ""), ERR_PARAM);
    EXPECT_EQ(xmldb_get_int32_t(&v, nullptr), ERR_PARAM);
    EXPECT_EQ(xmldb_set_int32_t(1, ""), ERR_PARAM);
}

TEST_F(TypedAccess, IntegersRoundTripInDecimal)
{
    EXPECT_EQ(xmldb_set_int32_t(INT32_MIN, "/t/i"), KORV_OK);
    EXPECT_EQ(raw("/t/i"), "-2147483648");
    EXPECT_EQ(xmldb_set_uint64_t(UINT64_MAX, "/t/u"), KORV_OK);
    EXPECT_EQ(raw("/t/u"), "18446744073709551615");
    uint64_t u = 0;
    EXPECT_EQ(xmldb_get_uint64_t(&u, "/t/u"), KORV_OK);
    EXPECT_EQ(u, UINT64_MAX);

    put("/t/huge", "18446744073709551616");
    u = 5;
    capture_stderr([&] { EXPECT_EQ(xmldb_get_uint64_t(&u, "/t/huge"), ERR_INT_VALUE); });
    EXPECT_EQ(u, 0u);
    u = 5;
    EXPECT_EQ(xmldb_get_uint64_t(&u, "/t/absent"), ERR_INT_VALUE);
    EXPECT_EQ(u, 0u);
}

TEST_F(TypedAccess, EmptyStringClearsASetting)
{
    put("/t/s", "value");
    EXPECT_EQ(xmldb_set_cstring("", "/t/s"), KORV_OK);
    char buf[16] = "junk";
    EXPECT_EQ(xmldb_get_cstring(buf, sizeof buf, "/t/s"), KORV_OK);
    EXPECT_STREQ(buf, "");
    int32_t v = 3;
    EXPECT_EQ(xmldb_get_int32_t(&v, "/t/s"), ERR_INT_VALUE);

    EXPECT_EQ(xmldb_set_cstring(nullptr, "/t/s"), ERR_PARAM);
    EXPECT_EQ(xmldb_get_cstring(buf, 0, "/t/s"), ERR_PARAM);
}

TEST_F(TypedAccess, LongValuesAreCutToTheBuffer)
{
    std::string big(300, 'x');
    put("/t/big", big);
    char buf[8];
    std::memset(buf, 'Z', sizeof buf);
    EXPECT_EQ(xmldb_get_cstring(buf, sizeof buf, "/t/big"), KORV_OK);
    EXPECT_STREQ(buf, "xxxxxxx");
    // The integer reader's own buffer is 128 bytes: a long number is cut, not overrun.
    put("/t/longnum", "7" + std::string(400, '0'));
    int32_t v = 0;
    EXPECT_EQ(xmldb_get_int32_t(&v, "/t/longnum"), KORV_OK);
}

TEST_F(TypedAccess, DeleteRemovesTheSubtree)
{
    put("/t/a/b/c", "1");
    put("/t/a/d", "2");
    EXPECT_EQ(xmldb_delete_node("/t/a"), KORV_OK);
    EXPECT_EQ(raw("/t/a/b/c"), "");
    EXPECT_EQ(raw("/t/a/d"), "");
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
    EXPECT_EQ(korv_test::quiet([&] { return xmldb_get_cstring(buf, sizeof buf, "/t/i"); }, &out), ERR_DB_CLIENT);
    EXPECT_NE(out.find("xmldbc_get path = /t/i failed"), std::string::npos) << out;
    EXPECT_EQ(xmldb_set_int32_t(1, "/t/i"), ERR_DB_CLIENT);
    EXPECT_EQ(xmldb_set_cstring("x", "/t/i"), ERR_DB_CLIENT);
    EXPECT_EQ(xmldb_delete_node("/t/i"), ERR_DB_WRITE);
}

TEST(StrNdup, CopiesAtMostMaxLenAndTerminates)
{
    char *a = str_ndup("abcdef", 3);
    ASSERT_NE(a, nullptr);
    EXPECT_STREQ(a, "abc");
    std::free(a);
    char *b = str_ndup("ab", 10);
    EXPECT_STREQ(b, "ab");
    std::free(b);
    char *c = str_ndup("ab", 0);
    EXPECT_STREQ(c, "");
    std::free(c);
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

    EXPECT_EQ(convert_hex_str_to_l("ff", &end, &l), 0);
    EXPECT_EQ(l, 255);

    uint64_t u = 0;
    EXPECT_EQ(convert_dec_str_to_uint64_t("  123kb", &end, &u), 0);
    EXPECT_EQ(u, 123u);
    EXPECT_STREQ(end, "kb");

    EXPECT_EQ(convert_str_to_uint64_t("42 ", &u), 0);
    EXPECT_EQ(u, 42u);
}

TEST(Converters, ReportMissingDigitsOnStandardError)
{
    char *end = nullptr;
    long l = 0;
    std::string err = capture_stderr([&] { EXPECT_EQ(convert_hex_str_to_l("zz", &end, &l), -1); });
    EXPECT_EQ(err, "No digits were found\n");

    uint64_t u = 7;
    err = capture_stderr([&] { EXPECT_EQ(convert_str_to_uint64_t("", &u), 1); });
    EXPECT_EQ(err, "No digits were found\n");
    err = capture_stderr([&] { EXPECT_EQ(convert_dec_str_to_uint64_t("-", &end, &u), -1); });
    EXPECT_EQ(err, "No digits were found\n");
}

TEST(Converters, ReportOverflowThroughPerror)
{
    char *end = nullptr;
    uint64_t u = 0;
    // Parsed signed: one past LLONG_MAX overflows although the type is unsigned.
    std::string err = capture_stderr([&] { EXPECT_EQ(convert_dec_str_to_uint64_t("9223372036854775808", &end, &u), -1); });
    EXPECT_EQ(err.rfind("strtoll: ", 0), 0u) << err;
    EXPECT_EQ(convert_dec_str_to_uint64_t("9223372036854775807", &end, &u), 0);
    EXPECT_EQ(u, static_cast<uint64_t>(LLONG_MAX));

    long l = 0;
    err = capture_stderr([&] { EXPECT_EQ(convert_dec_str_to_l("-99999999999999999999", &end, &l), -1); });
    EXPECT_EQ(err.rfind("strtoll: ", 0), 0u) << err;
    err = capture_stderr([&] { EXPECT_EQ(convert_hex_str_to_l("fffffffffffffffff", &end, &l), -1); });
    EXPECT_EQ(err.rfind("strtoll: ", 0), 0u) << err;

    u = 5;
    err = capture_stderr([&] { EXPECT_EQ(convert_str_to_uint64_t("18446744073709551616", &u), 1); });
    EXPECT_EQ(err.rfind("strtoll: ", 0), 0u) << err;
    EXPECT_EQ(u, 0u);
}

TEST(Converters, RefuseNullArguments)
{
    char *end = nullptr;
    long l = 0;
    uint64_t u = 0;
    std::string out;
    EXPECT_EQ(korv_test::quiet([&] { return convert_dec_str_to_l(nullptr, &end, &l); }, &out), ERR_PARAM);
    EXPECT_NE(out.find("ERR_PARAM_ERROR"), std::string::npos);
    EXPECT_EQ(korv_test::quiet([&] { return convert_hex_str_to_l("1", &end, nullptr); }), ERR_PARAM);
    EXPECT_EQ(korv_test::quiet([&] { return convert_dec_str_to_uint64_t(nullptr, &end, &u); }), ERR_PARAM);
    EXPECT_EQ(korv_test::quiet([&] { return convert_str_to_uint64_t(nullptr, &u); }), ERR_PARAM);
    // A caller that does not want the end pointer may pass none.
    EXPECT_EQ(convert_dec_str_to_l("12", nullptr, &l), 0);
    EXPECT_EQ(l, 12);
}
