// SPDX-License-Identifier: Apache-2.0
// The session listing: the kernel's texts under tests/kernel/data/sessions
// parsed into records (each NAME.txt beside the NAME.want it must give),
// hostile buffers, and where the text is read from (the portal group's
// "sessions" file, else every ACL's "info" file) in a private system root.
#include <cstring>
#include <filesystem>
#include <fstream>
#include <memory>
#include <sstream>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "common/korvadm_err.h"
#include "kernel/korvadm_mod_lio4_internal.h"
#include "kernel/korvadm_sess.h"
#include "tests/kernel/lio4_test.h"

namespace {

using namespace std::string_literals;

using korv_test::data_file;

// The parse's caller: a target, the two lists, and their release.
struct Listing {
    iscsi_target_t *target = iscsi_target_new();
    list_t sessions, initiators;
    Listing(const char *iqn = "iqn.2026-01.test:t1", int tpgt = 1)
    {
        list_init(&sessions);
        list_init(&initiators);
        std::strcpy(target->iqn, iqn);
        target->tpgt = tpgt;
    }
    ~Listing()
    {
        iscsi_sess_free_list(&sessions);
        iscsi_initiator_free_list(&initiators);
        iscsi_target_free(target);
    }

    // The text in a heap block of exactly its size, so that any read past
    // it is caught under the sanitizers.
    int parse(const std::string &text)
    {
        std::unique_ptr<char[]> buf(new char[text.size() + 1]);
        std::memcpy(buf.get(), text.data(), text.size());
        return _lio3_parse_sessions(&sessions, &initiators, target, buf.get(), text.size());
    }

    // Sessions in list order with their connections, then the initiators.
    std::string render() const
    {
        std::ostringstream out;
        for (iscsi_sess_t *s : korv::list_records<iscsi_sess_t>(&sessions)) {
            char isid[3 * ISCSI_ISID_LEN + 1];
            for (int i = 0; i < ISCSI_ISID_LEN; ++i)
                std::snprintf(isid + 3 * i, 4, "%02x ", s->isid[i]);
            isid[3 * ISCSI_ISID_LEN - 1] = '\0';  // no blank after the last
            bool to_target = s->target_node.list == &target->sess_list;
            bool to_initiator = s->initiator && s->initiator_node.list == &s->initiator->sess_list;
            out << "sess sid=" << s->sid << " tsih=" << s->tsih << " isid=" << isid
                << " initiator=" << (s->initiator ? s->initiator->name : "-")
                << (to_target && to_initiator ? " linked" : !s->target_node.list && !s->initiator_node.list ? " unlinked" : " half")
                << "\n";
            for (iscsi_conn_t *c : korv::list_records<iscsi_conn_t>(&s->conn_list))
                out << "  conn cid=" << c->cid << " address=" << (c->address ? c->address : "-")
                    << " name=" << (c->initiator_name ? c->initiator_name : "-")
                    << (c->local_address ? " local!" : "") << "\n";
        }
        out << "initiators:";
        for (iscsi_initiator_t *i : korv::list_records<iscsi_initiator_t>(&initiators))
            out << " " << i->name;
        return out.str() + "\n";
    }
};

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
    EXPECT_GE(texts, 11);
}

TEST(LioSessionsParse, HostileBuffersEndQuietlyInsideTheirBounds)
{
    const std::string block = data_file("sessions/two-initiators.txt");
    std::string tail_cut = block.substr(0, block.size() - 20);
    struct {
        std::string text;
        size_t sessions;
    } cases[] = {
        {std::string(32768, '\0'), 0},
        {std::string(32768, '\n'), 0},
        {std::string(32768, 'A'), 0},
        {std::string(32768, ' ') + "InitiatorName: x", 0},
        {"\0InitiatorName: x\nLIO Session ID: 1\n"s, 0},  // a NUL hides the rest of its line
        {"InitiatorName: a\nLIO Session ID: 1\0\0\nCID: 0\n   Address 1.2.3.4\n"s, 1},
        {tail_cut, 2},  // the last address line is cut before its newline
    };
    for (auto &c : cases) {
        Listing l;
        EXPECT_EQ(l.parse(c.text), 0);
        EXPECT_EQ(static_cast<size_t>(l.sessions.count), c.sessions) << l.render();
    }
}

TEST(LioSessionsParse, ArgumentsAndLines)
{
    Listing l;
    const char text[] = "ab\ncd";
    EXPECT_EQ(_lio3_parse_sessions(nullptr, &l.initiators, l.target, text, 5), ERR_PARAM);
    EXPECT_EQ(_lio3_parse_sessions(&l.sessions, nullptr, l.target, text, 5), ERR_PARAM);
    EXPECT_EQ(_lio3_parse_sessions(&l.sessions, &l.initiators, nullptr, text, 5), ERR_PARAM);
    EXPECT_EQ(_lio3_parse_sessions(&l.sessions, &l.initiators, l.target, nullptr, 5), ERR_PARAM);
    EXPECT_EQ(_lio3_parse_sessions(&l.sessions, &l.initiators, l.target, text, 0), 0);

    char line[4];
    const char *next = text;
    EXPECT_EQ(_lio3_get_session_line(line, 3, text, text + 5, &next), 2u);
    EXPECT_STREQ(line, "ab");
    EXPECT_EQ(next, text + 3);
    EXPECT_EQ(_lio3_get_session_line(line, 3, next, text + 5, &next), 0u) << "no newline left";
    EXPECT_EQ(next, nullptr);
    const char longer[] = "abcdef\n";
    EXPECT_EQ(_lio3_get_session_line(line, 3, longer, longer + 7, &next), 3u);
    EXPECT_STREQ(line, "abc");
    EXPECT_EQ(next, longer + 7);

    uint64_t sid = 7;
    int32_t tsih = 0;
    uint8_t isid[6] = {};
    int cid = 5;
    char addr[32];
    EXPECT_EQ(_parse_LIO3_SID_line("LIO Session ID: -3", &sid, &tsih, isid), -1);
    EXPECT_EQ(_parse_LIO3_SID_line("LIO Session ID: 18446744073709551615 TSIH: 2147483648", &sid, &tsih, isid), 0);
    EXPECT_EQ(sid, UINT64_MAX);
    EXPECT_EQ(tsih, -1) << "a TSIH beyond 32 bits is no TSIH";
    EXPECT_EQ(_parse_LIO3_sess_CID_line("CID: 99999999999", &cid), -1);
    EXPECT_EQ(cid, -1);
    EXPECT_EQ(_parse_LIO3_sess_ADDR_line("no address here", addr), -1);
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
    EXPECT_EQ(l.initiators.count, 2);
}

}  // namespace
