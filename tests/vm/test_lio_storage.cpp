// SPDX-License-Identifier: Apache-2.0
// The driver's backstores, LUN mapping and ACLs against the real kernel
// target, inside the test VM (tests/vm/lio_storage.sh), judged by a real
// initiator: libiscsi logging in over the VM's loopback as each initiator.
#include <gtest/gtest.h>
#include <iscsi/iscsi.h>
#include <iscsi/scsi-lowlevel.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cstring>
#include <fstream>
#include <iterator>
#include <memory>
#include <string>
#include <vector>

#include "common/korvadm_err.h"
#include "kernel/korvadm_mod.h"
#include "kernel/korvadm_mod_lio4.h"
#include "tests/vm/vm_targets.h"

namespace {

const std::string kCore = "/sys/kernel/config/target/core";
const std::string kIscsi = "/sys/kernel/config/target/iscsi";
const char *const kOwnDir = "/mnt/.systemfile/iscsi_target/fileio";
constexpr uint64_t kMiB = 1024 * 1024;

bool exists(const std::string &path)
{
    struct stat st;
    return ::lstat(path.c_str(), &st) == 0;
}

std::string slurp(const std::string &path)
{
    std::ifstream in(path);
    return std::string(std::istreambuf_iterator<char>(in), {});
}

bool target_modules_loaded()
{
    std::string m = slurp("/proc/modules");
    for (const char *name : {"target_core_mod ", "target_core_file ", "iscsi_target_mod "})
        if (m.find(name) != std::string::npos)
            return true;
    return false;
}

// ---- the driver's records ----

struct LunFree {
    void operator()(iscsi_lun_t *l) const { iscsi_lun_free(l); }
};
using Lun = std::unique_ptr<iscsi_lun_t, LunFree>;

Lun make_lun(const std::string &name, const std::string &path, uint64_t size, int hba, const std::string &serial)
{
    Lun l(iscsi_lun_new());
    std::snprintf(l->name, sizeof l->name, "%s", name.c_str());
    std::snprintf(l->path, sizeof l->path, "%s", path.c_str());
    std::snprintf(l->serial, sizeof l->serial, "%s", serial.c_str());
    l->size = size;
    l->hba_id = hba;
    return l;
}

// One initiator's right to one mapped LUN, applied through the table.
int grant(iscsi_target_t *t, int lun_num, const std::string &initiator, int right)
{
    iscsi_map_lun_t *map = iscsi_map_lun_new();
    iscsi_initiator_t *init = iscsi_initiator_new();
    iscsi_lun_acl_t *acl = iscsi_lun_acl_new();
    map->target = t;
    map->lun_num = lun_num;
    std::snprintf(init->name, sizeof init->name, "%s", initiator.c_str());
    acl->map_lun = map;
    acl->initiator = init;
    acl->access_right = right;
    int rc = right == 0 ? iscsi_mod_del_lun_acl(acl) : iscsi_mod_add_lun_acl(acl);
    iscsi_lun_acl_free(acl);
    iscsi_initiator_free(init);
    iscsi_map_lun_free(map);
    return rc;
}

// ---- the initiator ----

struct Task {
    scsi_task *task = nullptr;
    explicit Task(scsi_task *t) : task(t) {}
    ~Task()
    {
        if (task)
            scsi_free_scsi_task(task);
    }
    bool good() const { return task && task->status == SCSI_STATUS_GOOD; }
};

// A session as `initiator` with the target at 127.0.0.1:3260.
class Session {
public:
    Session(const std::string &initiator, const std::string &iqn, const char *user = nullptr,
            const char *secret = nullptr)
        : ctx_(iscsi_create_context(initiator.c_str()))
    {
        iscsi_set_targetname(ctx_, iqn.c_str());
        if (user)
            iscsi_set_initiator_username_pwd(ctx_, user, secret);
        iscsi_set_session_type(ctx_, ISCSI_SESSION_NORMAL);
        iscsi_set_noautoreconnect(ctx_, 1);
        iscsi_set_timeout(ctx_, 10);
        up_ = iscsi_connect_sync(ctx_, "127.0.0.1:3260") == 0 && iscsi_login_sync(ctx_) == 0;
    }
    ~Session() { iscsi_destroy_context(ctx_); }
    bool up() const { return up_; }

    // Bytes of the LUN by READ CAPACITY(16); 0 when refused.
    uint64_t capacity(int lun)
    {
        Task t(retry_attention([&] { return iscsi_readcapacity16_sync(ctx_, lun); }));
        auto *rc16 = t.good() ? static_cast<scsi_readcapacity16 *>(scsi_datain_unmarshall(t.task)) : nullptr;
        return rc16 ? (rc16->returned_lba + 1) * rc16->block_length : 0;
    }
    std::vector<int> report_luns()
    {
        Task t(iscsi_reportluns_sync(ctx_, 0, 4096));
        auto *list = t.good() ? static_cast<scsi_reportluns_list *>(scsi_datain_unmarshall(t.task)) : nullptr;
        std::vector<int> luns;
        for (uint32_t i = 0; list && i < list->num; i++)
            luns.push_back(list->luns[i] & 0x3fff);
        std::sort(luns.begin(), luns.end());
        return luns;
    }
    // The SCSI status of a one-block write, and its sense key.
    int write_block(int lun, uint64_t lba, const std::string &block, int *sense_key)
    {
        std::string data = block;
        Task t(retry_attention([&] {
            return iscsi_write16_sync(ctx_, lun, lba, reinterpret_cast<unsigned char *>(data.data()), 512, 512, 0,
                                      0, 0, 0, 0);
        }));
        *sense_key = t.task ? t.task->sense.key : -1;
        return t.task ? t.task->status : -1;
    }
    std::string read_block(int lun, uint64_t lba)
    {
        Task t(retry_attention([&] { return iscsi_read16_sync(ctx_, lun, lba, 512, 512, 0, 0, 0, 0, 0); }));
        return t.good() ? std::string(reinterpret_cast<char *>(t.task->datain.data), t.task->datain.size) : "";
    }

private:
    // The first command on a LUN after login reports a unit attention.
    template <class F>
    scsi_task *retry_attention(F command)
    {
        scsi_task *t = command();
        if (t && t->status == SCSI_STATUS_CHECK_CONDITION && t->sense.key == SCSI_SENSE_UNIT_ATTENTION) {
            scsi_free_scsi_task(t);
            t = command();
        }
        return t;
    }

    iscsi_context *ctx_;
    bool up_ = false;
};

class LioStorage : public ::testing::Test {
protected:
    void SetUp() override
    {
        ASSERT_EQ(iscsi_mod_select(ISCSI_MOD_TYPE_LIO), 0);
        ASSERT_EQ(iscsi_mod_start(), 0);
        ASSERT_EQ(::system((std::string("mkdir -p ") + kOwnDir).c_str()), 0);
    }
    void TearDown() override
    {
        EXPECT_EQ(iscsi_mod_stop(), 0);
        EXPECT_FALSE(target_modules_loaded());
    }
};

const std::string kRw = "iqn.2026-01.vm:rw", kRo = "iqn.2026-01.vm:ro", kDeny = "iqn.2026-01.vm:deny";

TEST_F(LioStorage, AnInitiatorGetsExactlyTheRightsTheDriverSets)
{
    vm::Target t = vm::make_target("iqn.2026-01.vm:storage", 1);
    t->dataout_timeout = 5;
    ASSERT_EQ(iscsi_mod_add_target(t.get()), 0);
    ASSERT_TRUE(vm::want_portal(t.get(), "127.0.0.1", "", 3260));
    ASSERT_EQ(iscsi_mod_set_target_ip(t.get()), 0);
    ASSERT_EQ(iscsi_mod_set_target_chap(t.get()), 0);  // CHAP off: the kernel's default is on
    const std::string tpg = kIscsi + "/" + t->iqn + "/tpgt_1";

    // A backstore on a file the driver creates, and one in the appliance's
    // own directory, whose file goes with it.
    Lun a = make_lun("disk0", "/tmp/disk0.img", 4 * kMiB, 1, "sn-disk0");
    Lun b = make_lun("disk255", std::string(kOwnDir) + "/disk255.img", 1 * kMiB, 1, "");
    ASSERT_EQ(iscsi_mod_add_backstore(a.get()), 0);
    ASSERT_EQ(iscsi_mod_add_backstore(b.get()), 0);
    EXPECT_TRUE(exists("/tmp/disk0.img") && exists(b->path));
    EXPECT_NE(slurp(kCore + "/fileio_1/disk0/wwn/vpd_unit_serial").find("sn-disk0"), std::string::npos);
    EXPECT_TRUE(exists("/var/target/alua/tpgs_sn-disk0"));
    // Adding it again leaves the kernel's device as it was.
    a->size = 2 * kMiB;
    EXPECT_EQ(iscsi_mod_add_backstore(a.get()), 0);
    EXPECT_NE(slurp(kCore + "/fileio_1/disk0/info").find("Size: 4194304"), std::string::npos)
        << slurp(kCore + "/fileio_1/disk0/info");

    ASSERT_EQ(iscsi_mod_add_lun_mapping(a.get(), t.get(), 0), 0);
    ASSERT_EQ(iscsi_mod_add_lun_mapping(b.get(), t.get(), 255), 0);
    EXPECT_EQ(iscsi_mod_add_lun_mapping(a.get(), t.get(), 0), ERR_LUN_ALREADY_MAPPED);
    Lun c = make_lun("disk0", "/tmp/disk0.img", 4 * kMiB, 1, "");
    EXPECT_EQ(iscsi_mod_add_lun_mapping(c.get(), t.get(), 256), ERR_PARAM);
    EXPECT_FALSE(exists(tpg + "/lun/lun_256"));
    // A linked backstore stays, and so does its file.
    EXPECT_EQ(iscsi_mod_del_backstore(b.get()), ERR_PARAM);
    EXPECT_TRUE(exists(b->path));

    for (const std::string &i : {kRw, kRo, kDeny, std::string("default_policy")})
        ASSERT_EQ(iscsi_mod_add_acl_initiator(i.c_str(), t.get()), 0) << i;
    EXPECT_FALSE(exists(tpg + "/acls/default_policy"));
    EXPECT_EQ(slurp(tpg + "/acls/" + kRw + "/attrib/dataout_timeout"), "5\n");
    ASSERT_EQ(grant(t.get(), 0, kRw, 2), 0);
    ASSERT_EQ(grant(t.get(), 255, kRw, 2), 0);
    ASSERT_EQ(grant(t.get(), 0, kRo, 1), 0);
    ASSERT_EQ(grant(t.get(), 255, kDeny, 1), 0);
    EXPECT_EQ(slurp(tpg + "/acls/" + kRo + "/lun_0/write_protect"), "1\n");
    ASSERT_EQ(iscsi_mod_enable_target(t.get()), 0);

    // Read-write: a pattern written lands in the backing file.
    Session rw(kRw, t->iqn);
    ASSERT_TRUE(rw.up());
    EXPECT_EQ(rw.report_luns(), (std::vector<int>{0, 255}));
    EXPECT_EQ(rw.capacity(0), 4 * kMiB);
    EXPECT_EQ(rw.capacity(255), 1 * kMiB);
    std::string pattern(512, '\0');
    for (size_t i = 0; i < pattern.size(); i++)
        pattern[i] = static_cast<char>("korv-lio"[i % 8] ^ (i / 8));
    int sense = 0;
    EXPECT_EQ(rw.write_block(0, 8, pattern, &sense), SCSI_STATUS_GOOD);
    EXPECT_EQ(rw.read_block(0, 8), pattern);
    std::string file = slurp("/tmp/disk0.img");
    EXPECT_EQ(file.substr(8 * 512, 512), pattern) << "file holds " << file.size() << " bytes";

    // Read-only: reads, but the target refuses its write.
    Session ro(kRo, t->iqn);
    ASSERT_TRUE(ro.up());
    EXPECT_EQ(ro.read_block(0, 8), pattern);
    EXPECT_EQ(ro.write_block(0, 9, pattern, &sense), SCSI_STATUS_CHECK_CONDITION);
    EXPECT_EQ(sense, SCSI_SENSE_DATA_PROTECTION);
    EXPECT_NE(rw.read_block(0, 9), pattern);

    // Read-only on a live target leaves the switch and the sessions alone;
    // deny switches the target off (dropping its sessions) and on again.
    ASSERT_EQ(grant(t.get(), 0, kDeny, 1), 0);
    EXPECT_EQ(rw.capacity(0), 4 * kMiB) << "read-only disturbed a session";
    ASSERT_EQ(grant(t.get(), 255, kDeny, 0), 0);
    ASSERT_EQ(grant(t.get(), 0, kDeny, 0), 0);
    EXPECT_EQ(rw.capacity(0), 0u) << "the session outlived deny: the target was not switched off";
    EXPECT_EQ(slurp(tpg + "/enable"), "1\n");
    EXPECT_FALSE(exists(tpg + "/acls/" + kDeny + "/lun_255"));
    {
        Session denied(kDeny, t->iqn);
        ASSERT_TRUE(denied.up()) << "its ACL admits it";
        std::vector<int> seen = denied.report_luns();
        EXPECT_EQ(std::count(seen.begin(), seen.end(), 255), 0);
        EXPECT_EQ(denied.capacity(255), 0u);
        EXPECT_EQ(denied.read_block(255, 0), "");
    }
    // Without an ACL, the portal group's default policy (generate_node_acls,
    // which the driver turns on) admits an initiator to every LUN, read-only;
    // with CHAP on it has no credentials and cannot log in at all.
    const std::string stranger = "iqn.2026-01.vm:no-acl";
    {
        Session s(stranger, t->iqn);
        ASSERT_TRUE(s.up());
        EXPECT_EQ(s.report_luns(), (std::vector<int>{0, 255}));
        EXPECT_EQ(s.write_block(0, 9, pattern, &sense), SCSI_STATUS_CHECK_CONDITION);
        EXPECT_EQ(sense, SCSI_SENSE_DATA_PROTECTION);
    }
    t->chap = 1;
    std::strcpy(t->chap_user, "vmuser");
    std::strcpy(t->chap_pass, "vm-secret-123");
    ASSERT_EQ(iscsi_mod_set_target_chap(t.get()), 0);
    EXPECT_FALSE(Session(stranger, t->iqn, "vmuser", "vm-secret-123").up());
    EXPECT_TRUE(Session(kRw, t->iqn, "vmuser", "vm-secret-123").up());
    t->chap = 0;
    ASSERT_EQ(iscsi_mod_set_target_chap(t.get()), 0);

    // A resize shows in the capacity the initiator reads.
    a->size = 8 * kMiB;
    ASSERT_EQ(iscsi_mod_change_backstore_size(a.get()), 0);
    Session rw2(kRw, t->iqn);
    ASSERT_TRUE(rw2.up());
    EXPECT_EQ(rw2.capacity(0), 8 * kMiB);

    // Taken apart in the kernel's order: rights, ACLs, mappings, backstores.
    for (const std::string &i : {kRw, kRo})
        EXPECT_EQ(grant(t.get(), 0, i, 0), 0) << i;
    EXPECT_EQ(grant(t.get(), 255, kRw, 0), 0);
    for (const std::string &i : {kRw, kRo, kDeny, std::string("default_policy")})
        EXPECT_EQ(iscsi_mod_del_acl_initiator(i.c_str(), t.get()), 0) << i;
    EXPECT_EQ(iscsi_mod_del_lun_mapping(a.get(), t.get()), 0);
    EXPECT_EQ(iscsi_mod_del_lun_mapping(b.get(), t.get()), 0);
    EXPECT_EQ(iscsi_mod_del_backstore(a.get()), 0);
    EXPECT_EQ(iscsi_mod_del_backstore(b.get()), 0);
    EXPECT_FALSE(exists(kCore + "/fileio_1/disk0"));
    EXPECT_TRUE(exists("/tmp/disk0.img")) << "a file outside the appliance's directory was deleted";
    EXPECT_FALSE(exists(b->path));
    EXPECT_EQ(iscsi_mod_del_target(t.get()), 0);
    EXPECT_FALSE(exists(kIscsi + "/" + t->iqn));
}

TEST_F(LioStorage, StopClearsAFullyPopulatedKernel)
{
    std::vector<vm::Target> targets;
    std::vector<Lun> luns;
    for (int i = 0; i < 3; i++) {
        targets.push_back(vm::make_target("iqn.2026-01.vm:full" + std::to_string(i), 1 + i));
        iscsi_target_t *t = targets.back().get();
        t->dataout_timeout = 5;
        ASSERT_EQ(iscsi_mod_add_target(t), 0);
        for (int n = 0; n < 2; n++) {
            std::string name = "full" + std::to_string(i) + "-" + std::to_string(n);
            luns.push_back(make_lun(name, std::string(kOwnDir) + "/" + name, kMiB, i, ""));
            ASSERT_EQ(iscsi_mod_add_backstore(luns.back().get()), 0);
            ASSERT_EQ(iscsi_mod_add_lun_mapping(luns.back().get(), t, n * 7), 0);
        }
        for (const std::string &init : {kRw, kRo}) {
            ASSERT_EQ(iscsi_mod_add_acl_initiator(init.c_str(), t), 0);
            ASSERT_EQ(grant(t, 7, init, init == kRw ? 2 : 1), 0);
        }
        ASSERT_EQ(iscsi_mod_enable_target(t), 0);
    }
    ASSERT_NE(::system("rmmod target_core_file 2>/dev/null"), 0);
    EXPECT_EQ(iscsi_mod_stop(), 0);
    EXPECT_FALSE(target_modules_loaded());
    EXPECT_FALSE(exists(kCore));
}

}  // namespace
