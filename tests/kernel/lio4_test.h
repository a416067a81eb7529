// SPDX-License-Identifier: Apache-2.0
// The one fixture of the kernel driver's host tests: an emptied system root
// that sample configfs trees (tests/kernel/data/*.tree) are loaded into, and
// the records the operations take: target iqn.2026-01.test:t1 portal group 1,
// LUN disk1 on a file, its mapping as LUN 3 and initiator i1's right to it;
// and the caller of a session listing. Each test file includes this alone.
#pragma once

#include <unistd.h>

#include <cstdio>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <memory>
#include <set>
#include <sstream>
#include <string>

#include "common/korvadm_err.h"
#include "kernel/korvadm_mod_lio4_internal.h"
#include "kernel/korvadm_sess.h"
#include "tests/support/process.h"
#include "tests/support/sysroot.h"

namespace korv_test {

// A checked-in sample under tests/kernel/data.
inline std::string data_file(const std::string &name)
{
    std::ostringstream text;
    text << std::ifstream(std::string(KORV_TEST_DATA) + "/" + name, std::ios::binary).rdbuf();
    return text.str();
}

// A session listing's caller: target iqn.2026-01.test:t1 portal group 1,
// the session and initiator lists, all released at the end.
struct Listing {
    korv::list_owner sessions_{iscsi_sess_free_list}, initiators_{iscsi_initiator_free_list};
    list_t &sessions = *sessions_.get(), &initiators = *initiators_.get();
    std::unique_ptr<iscsi_target_t, decltype(&iscsi_target_free)> target_{iscsi_target_new(), iscsi_target_free};
    iscsi_target_t *target = target_.get();
    Listing()
    {
        std::strcpy(target->iqn, "iqn.2026-01.test:t1");
        target->tpgt = 1;
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
            char isid[3 * ISCSI_ISID_LEN];
            std::snprintf(isid, sizeof isid, "%02x %02x %02x %02x %02x %02x", s->isid[0], s->isid[1], s->isid[2],
                          s->isid[3], s->isid[4], s->isid[5]);
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

class Lio4Test : public SysRootTest {
protected:
    void SetUp() override
    {
        SysRootTest::SetUp();
        iscsi_ip_free_list(&target.ip_list);
        target = {};
        set(target.iqn, IQN);
        set(target.alias, "t1");
        target.tpgt = 1;
        lun = {};
        lun.lun_num = -1;
        set(lun.name, "disk1");
        set(lun.path, at("/data/disk1.img"));
        lun.size = 1048576;
        map = {3, &target, &lun, {}};
        init = {};
        set(init.name, I1);
        acl = {&map, &init, 1, {}};
    }
    void TearDown() override { iscsi_ip_free_list(&target.ip_list); }

    // Lines "d PATH" (a directory), "f PATH TEXT" (a file, "\n" for a line
    // end) and "l PATH TARGET" (a symbolic link to TARGET in the root), with
    // parents made as needed; '#' comments.
    static void load_tree(const std::string &name)
    {
        std::istringstream in(data_file(name));
        std::string line;
        while (std::getline(in, line)) {
            std::istringstream words(line);
            std::string kind, path, text;
            words >> kind >> path;
            std::getline(words >> std::ws, text);
            for (size_t nl; (nl = text.find("\\n")) != std::string::npos;)
                text.replace(nl, 2, "\n");
            if (kind == "d")
                mkdirs(at(path));
            else if (kind == "f")
                write_file(at(path), text);
            else if (kind == "l") {
                mkdirs(std::filesystem::path(at(path)).parent_path());
                ASSERT_EQ(symlink(at(text).c_str(), at(path).c_str()), 0) << line;
            }
        }
    }
    // Every path under the root with its kind, a file's text and a link's
    // target: what an operation that must touch nothing leaves equal.
    static std::set<std::string> snapshot()
    {
        std::set<std::string> all;
        for (const auto &e : std::filesystem::recursive_directory_iterator(root())) {
            std::string what = e.is_symlink() ? " -> " + std::filesystem::read_symlink(e).string()
                               : e.is_directory() ? "/" : " = " + read_file(e.path());
            all.insert(e.path().string() + what);
        }
        return all;
    }
    template <size_t N>
    static void set(char (&field)[N], const std::string &text)
    {
        std::snprintf(field, N, "%s", text.c_str());
    }
    static std::string tpg() { return at(TPG); }

    static constexpr const char *IQN = "iqn.2026-01.test:t1";
    static constexpr const char *I1 = "iqn.2026-01.test:i1";
    static inline const std::string TPG = "/sys/kernel/config/target/iscsi/iqn.2026-01.test:t1/tpgt_1";
    static inline const std::string CORE = "/sys/kernel/config/target/core";
    iscsi_target_t target{};
    iscsi_lun_t lun{};
    iscsi_map_lun_t map{};
    iscsi_initiator_t init{};
    iscsi_lun_acl_t acl{};
};

}  // namespace korv_test
