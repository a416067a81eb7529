// SPDX-License-Identifier: Apache-2.0
// Mapping LUNs into targets: both sides of a mapping, free LUN numbers, and
// what a failed mapping leaves.
#include <csignal>
#include <cstdio>
#include <string>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "common/korvadm_err.h"
#include "common/korvadm_log.h"
#include "config/korvadm_xmldb_conf.h"
#include "tests/config/store_fixture.h"

using namespace korv_test;

namespace {

sockaddr_un unix_address(const std::string &path)
{
    sockaddr_un sa{};
    sa.sun_family = AF_UNIX;
    std::snprintf(sa.sun_path, sizeof sa.sun_path, "%s", path.c_str());
    return sa;
}

// Stands on the store's socket before a real service on another socket and
// answers failure to the refuse-th set request: a refusal on demand, which
// the real service never gives.
class RefusingProxy {
public:
    RefusingProxy(const std::string &upstream, int refuse)
    {
        const sockaddr_un sa = unix_address(SysRoot::file(XMLDB_SOCK_ISCSI));
        const int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
        ::unlink(sa.sun_path);
        EXPECT_EQ(::bind(fd, reinterpret_cast<const sockaddr *>(&sa), sizeof sa), 0);
        EXPECT_EQ(::listen(fd, 4), 0);
        if ((pid_ = ::fork()) == 0) {
            serve(fd, unix_address(upstream), refuse);
            ::_exit(0);
        }
        ::close(fd);
    }
    ~RefusingProxy()
    {
        ::kill(pid_, SIGKILL);
        ::waitpid(pid_, nullptr, 0);
    }

private:
    // One frame (length header and payload) from fd into out.
    static bool frame(int fd, std::string &out)
    {
        unsigned char h[4];
        if (::recv(fd, h, 4, MSG_WAITALL) != 4)
            return false;
        const size_t len = size_t{h[0]} << 24 | size_t{h[1]} << 16 | size_t{h[2]} << 8 | h[3];
        out.assign(reinterpret_cast<char *>(h), 4);
        out.resize(4 + len);
        return ::recv(fd, out.data() + 4, len, MSG_WAITALL) == static_cast<ssize_t>(len);
    }
    static void serve(int listener, const sockaddr_un &upstream, int refuse)
    {
        int sets = 0;
        for (int c; (c = ::accept(listener, nullptr, nullptr)) >= 0; ::close(c)) {
            const int up = ::socket(AF_UNIX, SOCK_STREAM, 0);
            if (::connect(up, reinterpret_cast<const sockaddr *>(&upstream), sizeof upstream) != 0)
                ::_exit(1);
            for (std::string req, ans; frame(c, req);) {
                if (req[4] == 's' && ++sets == refuse)
                    ans.assign("\0\0\0\x08\x01refused", 12);
                else if (::send(up, req.data(), req.size(), MSG_NOSIGNAL) < 0 || !frame(up, ans))
                    break;
                ::send(c, ans.data(), ans.size(), MSG_NOSIGNAL);
            }
            ::close(up);
        }
    }
    pid_t pid_ = -1;
};

class Mapping : public StoreTest {
protected:
    void SetUp() override
    {
        put_target(1, "t1");
        put_target(2, "t2");
        for (int n = 1; n <= 4; n++)
            put(lpath(n, "name"), "l" + std::to_string(n));
    }
    // The target's map as "lun_name:lun_num ..." read raw, with its count.
    static std::string map_of(int t)
    {
        std::string out;
        for (int m = 1; !raw(epath(tpath(t, "map_lun"), m, "lun_name")).empty(); m++)
            out += raw(epath(tpath(t, "map_lun"), m, "lun_name")) + ":" + raw(epath(tpath(t, "map_lun"), m, "lun_num")) + " ";
        return out + "#" + raw(tpath(t, "map_lun/count"));
    }
    // The LUN's own record of its mapping.
    static std::string lun_side(int l) { return raw(lpath(l, "target_name")) + ":" + raw(lpath(l, "lun_num")); }
};

}  // namespace

TEST_F(Mapping, BothSidesAgreeThroughMapAndUnmap)
{
    EXPECT_EQ(iscsi_conf_ops.xmldb_add_target_lun_map("t1", "l1", 0), KORV_OK);
    EXPECT_EQ(xmldb_add_target_lun_map("t1", "l2", 1), KORV_OK);
    EXPECT_EQ(xmldb_add_target_lun_map("t1", "l3", 5), KORV_OK);
    EXPECT_EQ(map_of(1), "l1:0 l2:1 l3:5 #3");
    EXPECT_EQ(lun_side(1) + " " + lun_side(3), "t1:0 t1:5");

    int num = -1;
    EXPECT_EQ(xmldb_get_free_lun_num(&num, "t1"), KORV_OK);
    EXPECT_EQ(num, 2);
    EXPECT_EQ(xmldb_get_free_lun_num(&num, "t2"), KORV_OK);
    EXPECT_EQ(num, 0);
    char target[CONF_NAME_LEN];
    EXPECT_EQ(xmldb_get_mapping_target(target, sizeof target, &num, "l3"), KORV_OK);
    EXPECT_EQ(std::string(target) + ":" + std::to_string(num), "t1:5");
    EXPECT_EQ(records<target_map_lun_conf_t>([](list_t *l) { return xmldb_get_target_map_lun_conf("t1", l); },
                                             target_map_lun_conf_free_list),
              "t1/l1/0 t1/l2/1 t1/l3/5");

    // Unmapping the first keeps the later ones visible to every map reader.
    EXPECT_EQ(xmldb_del_target_lun_map("t1", "l1"), KORV_OK);
    EXPECT_EQ(map_of(1) + " " + lun_side(1), "l3:5 l2:1 #2 :0");
    EXPECT_EQ(xmldb_get_free_lun_num(&num, "t1"), KORV_OK);
    EXPECT_EQ(num, 0);
    EXPECT_EQ(quiet([] { return xmldb_del_target_lun_map("t1", "l1"); }), ERR_NOT_FOUND);
}

TEST_F(Mapping, RefusesUnknownOrEmptyNamesAndAFullMap)
{
    const struct {
        int rc;
        const char *target, *lun, *message;
    } cases[] = {
        {ERR_PARAM, "", "l1", "target_name error"},
        {ERR_PARAM, "t1", "", "lun_name error"},
        {ERR_NOT_FOUND, "t9", "l1", "can not find t9 in xmldb target entry"},
        {ERR_NOT_FOUND, "t1", "l9", "can not find l9 in xmldb lun entry"},
    };
    g_korv_debug_level = 2;
    for (const auto &c : cases)
        EXPECT_EQ(logged([&] { return xmldb_add_target_lun_map(c.target, c.lun, 0); }, c.message), c.rc);
    g_korv_debug_level = 0;
    EXPECT_EQ(map_of(1) + lun_side(1), "#:");

    for (int m = 1; m <= 128; m++)
        put(epath(tpath(2, "map_lun"), m, "lun_name"), "x");
    EXPECT_EQ(logged([] { return xmldb_add_target_lun_map("t2", "l1", 0); },
                     "the Maximum number of target lun has reached"),
              ERR_NO_ROOM);
    EXPECT_EQ(lun_side(1), ":");
}

TEST_F(Mapping, AFailedWriteTakesBackTheNewMapEntryAndTheLunsTargetName)
{
    // The store reaches the real service through a proxy that refuses one
    // set request: 1 and 2 the map entry, 3 and 4 the LUN's side, 5 the count.
    db().stop();
    const char *real_sock = "/var/run/xmldb_real";
    XmldbProcess real(SysRoot::file(real_sock));
    real.start();
    auto at = [&](const std::string &path) {
        char buf[256] = "";
        EXPECT_GE(xmldbc_get_wb(real_sock, 0, path.c_str(), buf, sizeof buf), 0) << path;
        return std::string(buf);
    };
    const struct {
        int refuse;
        const char *message;
        const char *lun_num_left;
    } rows[] = {
        {1, "set /iscsi/target/id:1/map_lun/id:2/lun_name = l1 failed", ""},
        {2, "set /iscsi/target/id:1/map_lun/id:2/lun_num = 7 failed", ""},
        {3, "set /iscsi/lun/id:1/target_name = t1 failed", ""},
        {4, "set /iscsi/lun/id:1/lun_num = 7 failed", ""},
        {5, "set LUN count = 2 failed", "7"},
    };
    for (const auto &r : rows) {
        // t1 already maps l2 as number 0; l1 goes to map entry 2.
        xmldbc_del(real_sock, 0, "/iscsi");
        for (auto [path, value] : {std::pair{"/iscsi/target/id:1/name", "t1"}, {"/iscsi/lun/id:1/name", "l1"},
                                   {"/iscsi/lun/id:2/name", "l2"}, {"/iscsi/lun/id:2/target_name", "t1"},
                                   {"/iscsi/target/id:1/map_lun/id:1/lun_name", "l2"},
                                   {"/iscsi/target/id:1/map_lun/id:1/lun_num", "0"},
                                   {"/iscsi/target/id:1/map_lun/count", "1"}})
            ASSERT_EQ(xmldbc_set(real_sock, 0, path, value), 0) << path;
        {
            RefusingProxy proxy(SysRoot::file(real_sock), r.refuse);
            EXPECT_EQ(logged([] { return xmldb_add_target_lun_map("t1", "l1", 7); }, r.message), ERR_DB_WRITE);
        }
        // Entry 1 and the LUN it maps stay; entry 2 and l1's target name go.
        const std::string map = "/iscsi/target/id:1/map_lun/";
        EXPECT_EQ(at(map + "id:1/lun_name") + ":" + at(map + "id:1/lun_num") + " " + at(map + "id:2/lun_name") +
                      at(map + "id:2/lun_num") + " #" + at(map + "count") + " " + at(lpath(1, "target_name")) + "/" +
                      at(lpath(1, "lun_num")),
                  std::string("l2:0  #1 /") + r.lun_num_left)
            << r.refuse;
        EXPECT_EQ(at("/iscsi/lun/id:2/target_name"), "t1");
    }
}
