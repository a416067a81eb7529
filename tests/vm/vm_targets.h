// SPDX-License-Identifier: Apache-2.0
// Shared by the real-kernel suites: the driver's records (a target with its
// wanted portals, a fileio LUN, one initiator's right to a LUN), the kernel
// as read by hand, independent of the driver, and a driver started for one
// test. Header-only.
#pragma once

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <algorithm>
#include <cstdio>
#include <filesystem>
#include <memory>
#include <string>
#include <vector>

#include "kernel/korvadm_mod.h"
#include "tests/support/process.h"
#include "tests/support/sysroot.h"

namespace vm {

const std::string kIscsi = "/sys/kernel/config/target/iscsi";
const std::string kCore = "/sys/kernel/config/target/core";
using Target = std::unique_ptr<iscsi_target_t, decltype([](iscsi_target_t *t) { iscsi_target_free(t); })>;

// A target record with IQN, alias and tag.
inline Target make_target(const std::string &iqn, int tpgt, const std::string &alias = "vm alias")
{
    Target t(iscsi_target_new());
    std::snprintf(t->iqn, sizeof t->iqn, "%s", iqn.c_str());
    std::snprintf(t->alias, sizeof t->alias, "%s", alias.c_str());
    t->tpgt = tpgt;
    return t;
}

inline std::string tpg_dir(const iscsi_target_t *t)
{
    return kIscsi + "/" + t->iqn + "/tpgt_" + std::to_string(t->tpgt);
}

// Appends one wanted portal to the target's list.
inline void want_portal(iscsi_target_t *t, const std::string &ipv4, const std::string &ipv6, int port,
                        const std::string &dev = "")
{
    iscsi_ip_t *ip = iscsi_ip_new();
    std::snprintf(ip->ipv4, sizeof ip->ipv4, "%s", ipv4.c_str());
    std::snprintf(ip->ipv6, sizeof ip->ipv6, "%s", ipv6.c_str());
    std::snprintf(ip->dev_name, sizeof ip->dev_name, "%s", dev.c_str());
    ip->port = port;
    list_append(&ip->node, &t->ip_list);
}

// A fileio LUN record, not yet mapped.
inline iscsi_lun_t make_lun(const std::string &name, const std::string &path, uint64_t size, int hba,
                            const std::string &serial = "")
{
    iscsi_lun_t l{};
    std::snprintf(l.name, sizeof l.name, "%s", name.c_str());
    std::snprintf(l.path, sizeof l.path, "%s", path.c_str());
    std::snprintf(l.serial, sizeof l.serial, "%s", serial.c_str());
    l.size = size;
    l.hba_id = hba;
    l.lun_num = -1;
    return l;
}

// One initiator's right (0 deny, 1 read-only, 2 read-write) to LUN n,
// through the operations table.
inline int grant(iscsi_target_t *t, int n, const std::string &initiator, int right)
{
    iscsi_map_lun_t map{};
    iscsi_initiator_t init{};
    map.target = t;
    map.lun_num = n;
    std::snprintf(init.name, sizeof init.name, "%s", initiator.c_str());
    iscsi_lun_acl_t acl{&map, &init, right, {}};
    return right == 0 ? iscsi_mod_del_lun_acl(&acl) : iscsi_mod_add_lun_acl(&acl);
}

// A target in the kernel (tag 1) with a portal on ipv4 and/or ipv6 port 3260,
// CHAP off (the kernel's default is on).
inline Target serve(const std::string &iqn, const std::string &ipv4, const std::string &ipv6 = "")
{
    Target t = make_target(iqn, 1);
    EXPECT_EQ(iscsi_mod_add_target(t.get()), 0);
    want_portal(t.get(), ipv4, ipv6, 3260);
    EXPECT_EQ(iscsi_mod_set_target_ip(t.get()), 0);
    EXPECT_EQ(iscsi_mod_set_target_chap(t.get()), 0);
    return t;
}

// A 1 MiB fileio LUN on /tmp/NAME.img mapped as LUN 0, read-write for
// `initiator`, whose ACL it adds.
inline void map_lun_for(iscsi_target_t *t, const std::string &name, const std::string &initiator)
{
    iscsi_lun_t lun = make_lun(name, "/tmp/" + name + ".img", 1 << 20, 0);
    ASSERT_EQ(iscsi_mod_add_backstore(&lun), 0);
    ASSERT_EQ(iscsi_mod_add_lun_mapping(&lun, t, 0), 0);
    ASSERT_EQ(iscsi_mod_add_acl_initiator(initiator.c_str(), t), 0);
    ASSERT_EQ(grant(t, 0, initiator, 2), 0);
}

// ---- the kernel as read by hand ----

inline ino_t inode_of(const std::string &path)
{
    struct stat st;
    return ::lstat(path.c_str(), &st) == 0 ? st.st_ino : 0;
}

inline bool exists(const std::string &path) { return inode_of(path) != 0; }

// The file's text as the kernel gives it (line end included).
inline constexpr auto read_file = &korv_test::SysRootTest::read_file;

inline std::vector<std::string> subdirs(const std::string &dir)
{
    std::vector<std::string> names;
    std::error_code ec;
    for (const auto &e : std::filesystem::directory_iterator(dir, ec))
        if (!e.is_symlink(ec) && e.is_directory(ec))
            names.push_back(e.path().filename());
    std::sort(names.begin(), names.end());
    return names;
}

// The automatic fe80:: address of an interface; "" when it has none.
inline std::string link_local_of(const std::string &ifname)
{
    const std::string out = korv_test::run_shell("ip -6 addr show dev " + ifname +
                                                 " scope link | sed -n 's|.*inet6 \\(fe80[^/]*\\)/.*|\\1|p'");
    return out.substr(0, out.find('\n'));
}

// The driver's stop leaves no target module and configfs mounted, whatever
// a test left behind.
inline void expect_stopped()
{
    EXPECT_EQ(iscsi_mod_stop(), 0);
    EXPECT_NE(::system("grep -qE '^(target_core_mod|target_core_file|iscsi_target_mod) ' /proc/modules"), 0)
        << "a target module stayed loaded";
    EXPECT_EQ(::system("grep -q ' /sys/kernel/config configfs ' /proc/mounts"), 0) << "configfs unmounted";
}

// A test with the LIO driver started; stopped again afterwards.
class Driver : public ::testing::Test {
protected:
    void SetUp() override
    {
        ASSERT_EQ(iscsi_mod_select(ISCSI_MOD_TYPE_LIO), 0);
        ASSERT_EQ(iscsi_mod_start(), 0);
    }
    void TearDown() override { expect_stopped(); }
};

}  // namespace vm
