// SPDX-License-Identifier: Apache-2.0
// Mapping LUNs into targets: both sides of a mapping, free LUN numbers, and
// what a failed mapping leaves.
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <tuple>

#include "tests/config/store_fixture.h"

using namespace korv_test;

namespace {

// Stands on the store's socket before a real service on another socket and
// answers failure to the refuse-th set request: a refusal on demand, which
// the real service never gives.
class RefusingProxy {
public:
    RefusingProxy(const std::string &upstream, int refuse)
    {
        const int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
        const sockaddr_un at = address(SysRoot::file(XMLDB_SOCK_ISCSI));
        ::unlink(at.sun_path);
        EXPECT_EQ(::bind(fd, reinterpret_cast<const sockaddr *>(&at), sizeof at), 0);
        EXPECT_EQ(::listen(fd, 4), 0);
        proc_.start([=] {
            const sockaddr_un to = address(upstream);
            for (int c, sets = 0; (c = ::accept(fd, nullptr, nullptr)) >= 0; ::close(c)) {
                const int up = ::socket(AF_UNIX, SOCK_STREAM, 0);
                ::connect(up, reinterpret_cast<const sockaddr *>(&to), sizeof to);
                for (std::string req, ans; frame(c, req); ::send(c, ans.data(), ans.size(), MSG_NOSIGNAL)) {
                    if (req[4] == 's' && ++sets == refuse)
                        ans.assign("\0\0\0\x08\x01refused", 12);  // status 1: failure
                    else if (::send(up, req.data(), req.size(), MSG_NOSIGNAL) < 0 || !frame(up, ans))
                        break;
                }
                ::close(up);
            }
            return 0;
        });
        ::close(fd);
    }

private:
    static sockaddr_un address(const std::string &path)
    {
        sockaddr_un sa{AF_UNIX, {}};
        path.copy(sa.sun_path, sizeof sa.sun_path - 1);
        return sa;
    }
    // One frame (4-byte big-endian length, payload) from fd.
    static bool frame(int fd, std::string &out)
    {
        unsigned char h[4];
        if (::recv(fd, h, 4, MSG_WAITALL) != 4)
            return false;
        const size_t len = size_t{h[0]} << 24 | size_t{h[1]} << 16 | size_t{h[2]} << 8 | h[3];
        out.assign(reinterpret_cast<char *>(h), 4).resize(4 + len);
        return ::recv(fd, out.data() + 4, len, MSG_WAITALL) == static_cast<ssize_t>(len);
    }
    child_process proc_;  // stopped with the proxy
};

using Mapping = SampleStore;

}  // namespace

TEST_F(Mapping, BothSidesAgreeThroughMapAndUnmap)
{
    EXPECT_EQ(iscsi_conf_ops.xmldb_add_target_lun_map("t1", "l1", 0), KORV_OK);
    EXPECT_EQ(xmldb_add_target_lun_map("t1", "l2", 1), KORV_OK);
    EXPECT_EQ(xmldb_add_target_lun_map("t1", "l3", 5), KORV_OK);
    EXPECT_EQ(dump("/iscsi"), data("map_three.txt"));
    EXPECT_EQ(records<target_map_lun_conf_t>([](list_t *l) { return xmldb_get_target_map_lun_conf("t1", l); },
                                             target_map_lun_conf_free_list),
              "t1/l1/0 t1/l2/1 t1/l3/5");
    int num = -1, num_t2 = -1;
    EXPECT_EQ(slash(xmldb_get_free_lun_num(&num, "t1"), num, xmldb_get_free_lun_num(&num_t2, "t2"), num_t2), "0/2/0/0");
    char target[CONF_NAME_LEN];
    EXPECT_EQ(slash(xmldb_get_mapping_target(target, sizeof target, &num, "l3"), target, num), "0/t1/5");

    // Unmapping the first keeps the later ones visible to every map reader.
    EXPECT_EQ(xmldb_del_target_lun_map("t1", "l1"), KORV_OK);
    EXPECT_EQ(dump("/iscsi"), data("map_first_unmapped.txt"));
    EXPECT_EQ(slash(xmldb_get_free_lun_num(&num, "t1"), num), "0/0");
    EXPECT_EQ(quiet([] { return xmldb_del_target_lun_map("t1", "l1"); }), ERR_NOT_FOUND);
}

TEST_F(Mapping, RefusesUnknownOrEmptyNamesAndAFullMap)
{
    const std::string before = dump("/iscsi");
    g_korv_debug_level = 2;
    EXPECT_EQ(logged([] { return xmldb_add_target_lun_map("", "l1", 0); }, "target_name error"), ERR_PARAM);
    EXPECT_EQ(logged([] { return xmldb_add_target_lun_map("t1", "", 0); }, "lun_name error"), ERR_PARAM);
    EXPECT_EQ(logged([] { return xmldb_add_target_lun_map("t9", "l1", 0); }, "can not find t9 in xmldb target entry"),
              ERR_NOT_FOUND);
    EXPECT_EQ(logged([] { return xmldb_add_target_lun_map("t1", "l9", 0); }, "can not find l9 in xmldb lun entry"),
              ERR_NOT_FOUND);
    g_korv_debug_level = 0;
    EXPECT_EQ(dump("/iscsi"), before);

    for (int m = 1; m <= 128; m++)
        put(epath(tpath(2, "map_lun"), m, "lun_name"), "x");
    EXPECT_EQ(logged([] { return xmldb_add_target_lun_map("t2", "l1", 0); },
                     "the Maximum number of target lun has reached"),
              ERR_NO_ROOM);
    EXPECT_EQ(raw(lpath(1, "target_name")) + raw(lpath(1, "lun_num")), "");
}

TEST_F(Mapping, AFailedWriteTakesBackTheNewMapEntryAndTheLunsTargetName)
{
    // The store reaches the real service through a proxy that refuses one
    // set request: 1 and 2 the map entry, 3 and 4 the LUN's side, 5 the count.
    db().stop();
    const char *real_sock = "/var/run/xmldb_real";
    XmldbProcess real(SysRoot::file(real_sock), {"--load", data_file("mapped_one.xml")});
    // The set request refused, its message, what the real service holds afterwards.
    const std::tuple<int, const char *, const char *> rows[] = {
        {1, "set /iscsi/target/id:1/map_lun/id:2/lun_name = l1 failed", "map_rolled_back.txt"},
        {2, "set /iscsi/target/id:1/map_lun/id:2/lun_num = 7 failed", "map_rolled_back.txt"},
        {3, "set /iscsi/lun/id:1/target_name = t1 failed", "map_rolled_back.txt"},
        {4, "set /iscsi/lun/id:1/lun_num = 7 failed", "map_rolled_back.txt"},
        {5, "set LUN count = 2 failed", "map_rolled_back_count.txt"},
    };
    for (const auto &[refuse, message, left] : rows) {
        real.stop();
        real.start();  // t1 maps l2 as number 0: l1 goes to map entry 2
        {
            RefusingProxy proxy(SysRoot::file(real_sock), refuse);
            EXPECT_EQ(logged([] { return xmldb_add_target_lun_map("t1", "l1", 7); }, message), ERR_DB_WRITE);
        }
        // Entry 1 and the LUN it maps stay; entry 2 and l1's target name go.
        EXPECT_EQ(dump("/iscsi", real_sock), data(left)) << refuse;
    }
}
