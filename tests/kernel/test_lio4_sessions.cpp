// SPDX-License-Identifier: Apache-2.0
// The session listing: the kernel's texts under tests/kernel/data/sessions
// parsed into records (each NAME.txt beside the NAME.want it must give),
// hostile buffers, and where the text is read from (the portal group's
// "sessions" file, else every ACL's "info" file) in a private system root.
#include "tests/kernel/lio4_test.h"

namespace {

using namespace std::string_literals;

using korv_test::data_file;
using korv_test::Listing;

TEST(LioSessionsParse, EachKernelTextGivesItsRecordedListing)
{
    int texts = 0;
    for (const auto &e : std::filesystem::directory_iterator(KORV_TEST_DATA "/sessions")) {
        if (e.path().extension() != ".txt")
            continue;
        std::string name = "sessions/" + e.path().stem().string();
        SCOPED_TRACE(name);
        Listing l;
        ASSERT_EQ(l.parse(data_file(name + ".txt")), 0);
        EXPECT_EQ(l.render(), data_file(name + ".want"));
        ++texts;
    }
    EXPECT_GE(texts, 13);
}

TEST(LioSessionsParse, HostileBuffersEndQuietlyInsideTheirBounds)
{
    struct {
        std::string text;
        size_t sessions;
    } cases[] = {
        {std::string(32768, '\0'), 0},
        {std::string(32768, '\n'), 0},
        {std::string(32768, 'A'), 0},
        {"\0InitiatorName: x\nLIO Session ID: 1\n"s, 0},  // a NUL hides the rest of its line
        {"InitiatorName: a\nLIO Session ID: 1\0\0\nCID: 0\n   Address 1.2.3.4\n"s, 1},
    };
    for (auto &c : cases) {
        Listing l;
        EXPECT_EQ(l.parse(c.text), 0);
        EXPECT_EQ(static_cast<size_t>(l.sessions.count), c.sessions) << l.render();
    }
}

TEST(LioSessionsParse, ArgumentsAndLinesCutToTheirBuffer)
{
    Listing l;
    const char text[] = "ab\ncd";
    EXPECT_EQ(_lio3_parse_sessions(nullptr, &l.initiators, l.target, text, 5), ERR_PARAM);
    EXPECT_EQ(_lio3_parse_sessions(&l.sessions, nullptr, l.target, text, 5), ERR_PARAM);
    EXPECT_EQ(_lio3_parse_sessions(&l.sessions, &l.initiators, nullptr, text, 5), ERR_PARAM);
    EXPECT_EQ(_lio3_parse_sessions(&l.sessions, &l.initiators, l.target, nullptr, 5), ERR_PARAM);
    EXPECT_EQ(_lio3_parse_sessions(&l.sessions, &l.initiators, l.target, text, 0), 0);

    char line[4];
    const char longer[] = "abcdef\n", *next = nullptr;
    EXPECT_EQ(_lio3_get_session_line(line, 3, longer, longer + 7, &next), 3u);
    EXPECT_STREQ(line, "abc");
}

/* ------------------------------------------------ reading from configfs */

using LioSessionsRead = korv_test::Lio4Test;

TEST_F(LioSessionsRead, SessionsFileFirstThenEveryAclInfoThenNothing)
{
    {
        Listing l;
        EXPECT_EQ(lio3_get_target_session(&l.sessions, &l.initiators, l.target), 0) << "no portal group";
        EXPECT_EQ(l.sessions.count, 0);
    }
    load_tree("acl_infos.tree");
    {
        Listing l;
        ASSERT_EQ(lio3_get_target_session(&l.sessions, &l.initiators, l.target), 0);
        EXPECT_EQ(l.render(), data_file("acl_infos.want"));
    }
    write_file(tpg() + "/sessions", data_file("sessions/real-ipv4.txt"));
    Listing l;
    ASSERT_EQ(lio3_get_target_session(&l.sessions, &l.initiators, l.target), 0);
    EXPECT_EQ(l.render(), data_file("sessions/real-ipv4.want"));
}

TEST_F(LioSessionsRead, AclTextsStopWhenTheBufferIsFull)
{
    // Three texts of 20000 bytes: the second is cut at 12768, the third not read.
    for (const char *i : {"a", "c", "e"}) {
        std::string text = "InitiatorName: iqn.2026-01.test:"s + i +
                           "\nLIO Session ID: 1   ISID: 0x80 28 09 49 00 00  TSIH: 1\nCID: 0\n   Address ::1 TCP\n";
        write_file(tpg() + "/acls/iqn.2026-01.test:" + i + "/info", text + std::string(20000 - text.size() - 1, '-') + "\n");
    }
    Listing l;
    ASSERT_EQ(lio3_get_target_session(&l.sessions, &l.initiators, l.target), 0);
    EXPECT_EQ(l.sessions.count, 2);
}

}  // namespace
